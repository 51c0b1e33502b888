// Indications that no honest provider sends: the worker must finish them
// promptly, reading nothing outside the indication.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <future>
#include <thread>
#include <vector>

#include "base/bytes.h"
#include "base/log.h"
#include "daemon/events.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"

namespace {

uint32_t refuse(void*)
{
    return 1;
}

// An event indication of component 1 with one class whose one row (back to
// back layout) claims `claimed` attributes and holds `present` entries.
std::vector<uint8_t> eventIndication(const char* className, uint32_t claimed, uint32_t present)
{
    std::vector<uint32_t> w(13, 0);
    w[0] = SL_LEVEL_CHECK;
    w[1] = 1;
    w[3] = 1;
    w[12] = 52;
    // Event data at 52: class count, then (component, class offset, rows, rows offset).
    uint32_t classOffset = 52 + 4 + 16;
    uint32_t classLength = static_cast<uint32_t>(std::strlen(className));
    uint32_t rowsOffset = classOffset + 4 + ((classLength + 3) & ~3u);
    uint32_t valueOffset = rowsOffset + 16 + 16 * present;
    w.insert(w.end(), {1, 1, classOffset, 1, rowsOffset});
    w.push_back(classLength);
    std::vector<uint32_t> text((classLength + 3) / 4, 0);
    std::memcpy(text.data(), className, classLength);
    w.insert(w.end(), text.begin(), text.end());
    w.insert(w.end(), {20, 0, 0, claimed});
    for (uint32_t i = 0; i < present; ++i)
        w.insert(w.end(), {0, i + 1, DMI_INTEGER, valueOffset});
    w.push_back(4);
    w[2] = static_cast<uint32_t>(4 * w.size());
    std::vector<uint8_t> bytes(4 * w.size());
    std::memcpy(bytes.data(), w.data(), bytes.size());
    return bytes;
}

// The handle SLIndicationFunc makes of an indication.
SLHandle* indicationHandle(const std::vector<uint8_t>& indication)
{
    SLHandle* h = SLCreateHandle(static_cast<unsigned>(indication.size()));
    std::memcpy(h->command, indication.data(), 52);
    storeWordAt(h->command, 13, 0);
    storeWordAt(h->command, 14, 0);
    std::memcpy(h->confirm, indication.data(), indication.size());
    return h;
}

class Hostile : public ::testing::Test {
protected:
    void SetUp() override
    {
        SLInitialize();
        SLDmiInvoke = refuse; // every catalogue and table lookup fails
        moxSetLogHook([](int, const char*) {});
        deleteComponentList(componentList);
        componentList = newComponentInfo(100);
        appendToList(componentList, 1, 1); // component 1 is the baseboard
    }
    void TearDown() override
    {
        deleteComponentList(componentList);
        componentList = nullptr;
        moxSetLogHook(nullptr);
        SLCleanup();
    }
};

// A row that claims four billion attributes made the standard matcher walk
// every one of them (hours on the worker); only the entries inside the
// indication are walked now.
TEST_F(Hostile, RowClaimingBillionsOfAttributesEndsPromptly)
{
    struct Case {
        const char* className;
        uint32_t claimed, present, walked;
    } cases[] = {
        {"EventGeneration|Voltage", 0xFFFFFFF0u, 3, 3},
        {"EventGeneration|Voltage", 0x7FFFFFFFu, 0, 0},
        {"EventGeneration|Voltage", 2, 3, 2}, // an honest count below the entries
        {"Zorek|Error|Voltage", 0xFFFFFFFFu, 2, 2},
    };
    for (const Case& c : cases) {
        SLHandle* h = indicationHandle(eventIndication(c.className, c.claimed, c.present));
        SLEventSelectRowCnf(h, 0, 0);
        EXPECT_EQ(SLRowAttributeCount(h), c.claimed) << "the accessor still reports the word";
        EXPECT_EQ(slRowAttributesPresent(h), c.walked);
        auto done = std::async(std::launch::async, [h] { processEvent(h); });
        if (done.wait_for(std::chrono::seconds(10)) != std::future_status::ready) {
            ADD_FAILURE() << c.className << " claiming " << c.claimed << " still running after 10 s";
            std::_Exit(1); // the worker's loop cannot be interrupted
        }
        SLDestroyHandle(h);
    }
}

} // namespace
