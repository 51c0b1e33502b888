#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <thread>

#include "daemon/events.h"
#include "sl/sl.h"
#include "sl/slhandle.h"

namespace {

// An indication as the SL event thread hands it over: header words in the
// command block, the indication in the confirm buffer, with one class string
// (none when empty) at offset 1024, and a second class at 1536 when `second` is
// not empty. Every byte not written is 0x5A, so nothing past the string's end
// reads as a terminator.
SLHandle* indication(uint32_t type, const std::string& cls, const std::string& second = "")
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0x5A, h->confirmSize);
    storeWordAt(h->command, 0, SL_LEVEL_CHECK), storeWordAt(h->command, 1, type), storeWordAt(h->command, 2, 4096);
    storeWordAt(h->command, 12, 64); // where the data starts: class count; component, string, rows
    storeWordAt(h->confirm + 64, 0, cls.empty() ? 0u : second.empty() ? 1u : 2u), storeWordAt(h->confirm + 64, 1, 5);
    storeWordAt(h->confirm + 64, 2, 1024), storeWordAt(h->confirm + 64, 3, 0), storeWordAt(h->confirm + 64, 6, 1536);
    for (auto [at, text] : {std::pair{1024, cls}, {1536, second}}) {
        storeWord(h->confirm + at, static_cast<uint32_t>(text.size()));
        std::memcpy(h->confirm + at + 4, text.data(), text.size());
    }
    return h;
}

std::string seen;
std::string tagOf(SLHandle* h) { return std::to_string(loadWordAt(h->command, 3)) + " "; }

class Events : public ::testing::Test {
protected:
    void SetUp() override
    {
        SLInitialize();
        saved_ = eventsSetCallees({[](SLHandle* h) { seen += "standard" + tagOf(h); },
                                   [](SLHandle* h) { seen += "vendor" + tagOf(h); }, [](SLHandle*) { seen += "unknown "; },
                                   [](SLHandle*) { seen += "installed "; }});
    }
    void TearDown() override { eventsSetCallees(saved_), SLCleanup(); }
    EventCallees saved_{};
};

TEST_F(Events, ClassStringChoosesTheMatcher)
{
    // cut: non-zero when the indication ends this many characters into the string; count: the
    // string's own count word when it does not agree (it is not consulted). Only class 0 counts.
    struct Row { uint32_t type; std::string cls; uint32_t cut; const char* expected; uint32_t count = 0;
        std::string second = ""; } rows[] = {
        {1, "zorek|error|Baseboard|001", 0, "vendor0 "}, {1, "Zorek|Error", 0, "vendor0 "},
        {1, "Zorek|ErroX|Baseboard", 0, "unknown "}, // all 11 characters count
        {1, "EVENTGENERATION|Temperature|001", 0, "standard0 "}, {1, "EventGeneration|", 0, "standard0 "},
        {1, "EventGenerationX|Temperature", 0, "unknown "}, // the bar counts
        {1, "Zorek|Error|x", 3, "unknown "}, {1, "EventGeneration|x", 9, "unknown "}, // nothing read past the end
        {1, "Zorek|Error|x", 0, "vendor0 ", 100000}, {1, "EventGeneration|T", 0, "standard0 ", 0xFFFFFFFF},
        {1, "Other|Class|", 0, "unknown ", 0, "EventGeneration|"},
        {1, "", 0, ""}, {2, "", 0, "installed "}, {3, "", 0, ""}, {7, "", 0, ""}};
    for (const Row& row : rows) {
        SLHandle* h = indication(row.type, row.cls, row.second);
        seen.clear();
        if (row.count != 0)
            storeWord(h->confirm + 1024, row.count);
        if (row.cut != 0) { // the string's length word agrees; its bytes go on
            storeWordAt(h->command, 2, 1028 + row.cut);
            storeWord(h->confirm + 1024, row.cut);
        }
        processEvent(h);
        SLDestroyHandle(h);
        EXPECT_EQ(seen, row.expected) << row.type << " " << row.cls << " " << row.cut;
    }
}

TEST_F(Events, QueueCountsKeepsOrderAndStops)
{
    unsigned before = EventsHandled();
    SLHandle* h = indication(1, "EventGeneration|");
    EventHandler(h); // no worker yet: dropped
    EXPECT_EQ(eventsQueued(), 0u);
    // A worker stopped before its first step is still waited for.
    ASSERT_EQ(CreateEventHandler(), 0);
    KillEventThread();
    EXPECT_EQ(eventsWorkersRunning(), 0);
    ASSERT_EQ(CreateEventHandler(), 0);
    for (uint32_t i = 0; i < 6; ++i) {
        storeWordAt(h->command, 1, i < 4 ? 1 : i == 4 ? 2 : 7), storeWordAt(h->command, 3, i);
        std::memcpy(h->confirm + 1028, i % 2 ? "Zorek|Error|abcd" : "EventGeneration|", 16);
        EventHandler(h);
    }
    for (int i = 0; i < 2000 && EventsHandled() < before + 6; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(EventsHandled(), before + 6) << "every type is counted";
    EXPECT_EQ(seen, "standard0 vendor1 standard2 vendor3 installed ");
    EXPECT_EQ(eventsWorkersRunning(), 1) << "the stopped worker must not have joined the new one";
    KillEventThread();
    EventHandler(h);
    EXPECT_EQ(eventsQueued(), 0u);
    DestroyEventHandler();
    EXPECT_EQ(EventsHandled(), before + 6);
    SLDestroyHandle(h);
}

} // namespace
