// Indications: both row layouts of an event, the indication's stated length
// as the bound of every read, dropped indications, and who waits for whom.
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "scripted_provider.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slkey.h"

namespace {

std::atomic<bool> holdHandler{false}, holdCompletion{false};
std::atomic<int> handled{0}, completions{0};
std::string seen;

std::string text(const DmiString* s)
{
    return s ? std::string(dmiStringText(s), dmiStringLength(s)) : "null";
}

// Reads class 0 and its row 1 as an event handler would.
int handler(SLHandle* h)
{
    SLEventSelectRowCnf(h, 0, 1);
    SLKeyList* k = SLCreateKeyList(h);
    seen = std::to_string(SLEventClassCount(h)) + " " + std::to_string(SLEventComponentId(h, 0)) + " " +
           std::to_string(SLEventRowCount(h, 0)) + " " + text(SLEventClassString(h, 0)) + " " +
           std::to_string(SLRowGroupId(h)) + " " + std::to_string(SLRowAttributeId(h, 0)) + " " +
           std::to_string(SLRowUnsignedValue(h, 0)) + " " + (k ? std::to_string(loadWord(k->keys[0].value)) : "-");
    SLDeleteKeyList(k);
    ++handled;
    while (holdHandler)
        std::this_thread::yield();
    return 0;
}

void completion(void*)
{
    ++completions;
    while (holdCompletion)
        std::this_thread::yield();
}

// An event of one class with two rows of one attribute each; row 1 is group
// 30, attribute 7 = 22, keyed by that attribute. Filler elsewhere is non-zero.
std::vector<uint32_t> event(uint32_t level, uint32_t length)
{
    std::vector<uint32_t> w(160, 0xABABABAB);
    w[0] = level, w[1] = 1, w[2] = length, w[3] = 7;
    w[11] = pointerWord(reinterpret_cast<void*>(&completion));
    w[12] = 64;                                                 // event data
    w[16] = 1;                                                  // classes
    w[17] = 7, w[18] = 500, w[19] = 2;                          // component, class string, rows
    w[20] = level == SL_LEVEL_CHECK ? 240 : 400;                // rows, or the array of their offsets
    w[60] = 20, w[61] = 0, w[62] = 0, w[63] = 1;                // row 0 at 240
    w[65] = 1, w[66] = DMI_INTEGER, w[67] = 340;                //   its attribute
    w[68] = 30, w[69] = 1, w[70] = 320, w[71] = 1;              // row 1 at 272
    w[73] = 7, w[74] = DMI_INTEGER, w[75] = 344;                //   its attribute
    w[80] = 7, w[81] = DMI_INTEGER, w[82] = 344;                //   its key list at 320
    w[85] = 11, w[86] = 22;                                     // values at 340
    w[100] = 240, w[101] = 272;                                 // row offsets at 400
    putString(reinterpret_cast<uint8_t*>(w.data()), 500, "EventGeneration|x");
    return w;
}

void deliver(std::vector<uint32_t>& indication, int completionsBefore)
{
    SLIndicationFunc(indication.data());
    for (int i = 0; i < 5000 && completions.load() == completionsBefore; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

TEST(SLEvent, RowLayoutsAndDroppedIndications)
{
    ScriptedProvider p;
    SLEventSetHandler(handler);
    const std::string full = "1 7 2 EventGeneration|x 30 7 22 22";
    struct Row {
        const char* name;
        uint32_t level, length;
        std::string want; // "" when the handler must not run
    } rows[] = {
        {"rows back to back", SL_LEVEL_CHECK, 560, full},
        {"an array of row offsets", 0x444D4932, 560, full},
        {"class string past the stated length", SL_LEVEL_CHECK, 510, "1 7 2 null 30 7 22 22"},
        {"exactly its header", SL_LEVEL_CHECK, 52, "0 0 0 null 0 0 0 -"},
        {"shorter than its header", SL_LEVEL_CHECK, 51, ""},
        {"above 1 MiB", SL_LEVEL_CHECK, (1u << 20) + 1, ""},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        seen.clear();
        int before = completions, handledBefore = handled;
        std::vector<uint32_t> indication = event(row.level, row.length);
        deliver(indication, before);
        EXPECT_EQ(completions.load(), before + 1) << "completed once";
        EXPECT_EQ(handled.load(), handledBefore + (row.want.empty() ? 0 : 1));
        EXPECT_EQ(seen, row.want);
    }
    SLEventSetHandler(nullptr);
}

// Removing the handler waits for the event threads still running it.
TEST(SLEvent, RemovingTheHandlerWaitsForEventThreads)
{
    ScriptedProvider p;
    SLEventSetHandler(handler);
    holdHandler = true;
    int before = handled;
    std::vector<uint32_t> indication = event(SL_LEVEL_CHECK, 560);
    SLIndicationFunc(indication.data());
    while (handled.load() == before)
        std::this_thread::yield();
    std::atomic<bool> removed{false};
    std::thread remover([&] {
        SLEventSetHandler(nullptr);
        removed = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_FALSE(removed.load());
    holdHandler = false;
    remover.join();
}

// Cleanup waits for the provider still inside the indication callback.
TEST(SLEvent, CleanupWaitsForAnIndicationBeingDelivered)
{
    ScriptedProvider p;
    holdCompletion = true;
    int before = completions;
    std::vector<uint32_t> indication = event(SL_LEVEL_CHECK, 560);
    std::thread provider([&] { SLIndicationFunc(indication.data()); });
    while (completions.load() == before)
        std::this_thread::yield();
    std::atomic<bool> cleaned{false};
    std::thread cleaner([&] {
        p.cleanup();
        cleaned = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_FALSE(cleaned.load());
    holdCompletion = false;
    provider.join();
    cleaner.join();
}

} // namespace
