#include <gtest/gtest.h>

#include "base/sleep.h"
#include "hardware/sysaction.h"
#include "simdriver.h"

namespace {

using SystemControl = SimDriverTest;
std::vector<unsigned> sleeps;
int shutDowns = 0;

TEST_F(SystemControl, ActionCodes)
{
    // The capability report, before anything changes the word, asks the controller nothing.
    SystemControlInfo info{};
    EXPECT_EQ(MoxGetSystemControlInfo(&info), 0);
    EXPECT_EQ((std::vector<uint32_t>{info.capabilities, info.minimumDelay, info.maximumDelay}),
              (std::vector<uint32_t>{0x7FF, 100, 6553600}));
    EXPECT_TRUE(obxsimLog().empty());
    const std::string armed = "watchdog set: use 0x04 action ", started = " countdown 1; watchdog started: countdown 1; ";
    enum { none, armingRefused, codeRefused };
    // bit: the capability it needs (without it, unsupported and nothing done); effect: what the controller saw.
    struct Row { uint32_t action; int32_t delay; uint32_t bit; int fault, result; std::string effect; int shutDowns;
        std::vector<unsigned> sleeps; } rows[] = {
        {0, 200, 0, none, ObxResultUnsupported, "", 0, {}}, {1, 200, 0x02, none, ObxResultOk, armed + "hard reset" + started, 0, {3000}},
        {2, 200, 0x01, none, ObxResultOk, armed + "power down" + started, 0, {3000}},
        {1, 200, 0x02, armingRefused, ObxResultError,
         "refused: netfn 0x06 cmd 0x24 completion code 0xc0; fault: ioctl 0x1082 answered with 1 bytes; ", 0, {}},
        {3, 200, 0, none, ObxResultOk, "", 1, {}}, {4, 40000, 0x10, none, ObxResultOk, "shutdown code 1 delay 1; ", 1, {}},
        {5, 40000, 0x40, none, ObxResultOk, "shutdown code 2 delay 1; ", 1, {}},
        {6, 40000, 0x20, none, ObxResultOk, "shutdown code 1 delay 400; ", 1, {}},
        {6, 40000, 0x20, codeRefused, ObxResultOk, "fault: ioctl 0x1092 failed; ", 1, {}}, // the shutdown goes ahead
        {7, 250, 0x80, none, ObxResultOk, "shutdown code 2 delay 2; ", 1, {}},
        {8, 200, 0, none, ObxResultOk, "chassis control: nmi; ", 0, {}}, {9, 200, 0, none, ObxResultUnsupported, "", 0, {}}};
    // The shutdown function fails as a failed exec would.
    moxSetSleepHook([](unsigned ms) { sleeps.push_back(ms); }), moxSetShutDownFunction([] { return ++shutDowns, -1; });
    for (const Row& row : rows) {
        for (uint32_t capabilities : {row.bit == 0 ? 0u : row.bit, 0x7FF & ~row.bit}) {
            SCOPED_TRACE("action " + std::to_string(row.action) + " capabilities " + std::to_string(capabilities));
            const bool allowed = (capabilities & row.bit) != 0 || row.bit == 0;
            SetUp();
            sleeps.clear(), shutDowns = 0, MoxActionCapabilityWord = capabilities;
            if (row.fault != none)
                obxsimInjectFault(row.fault == armingRefused ? ObxIoctlSendMessage : ObxIoctlSetShutdownCode,
                                  row.fault == armingRefused ? 0x06 : -1, row.fault == armingRefused ? 0x24 : -1,
                                  row.fault == armingRefused ? ObxSimCompletionCode : ObxSimFail, 0xC0);
            EXPECT_EQ(MoxInitiateSystemControlAction(row.action, row.delay), allowed ? row.result : ObxResultUnsupported);
            EXPECT_EQ(actions(), allowed ? row.effect : "");
            EXPECT_EQ(std::make_pair(shutDowns, sleeps),
                      allowed ? std::make_pair(row.shutDowns, row.sleeps) : std::make_pair(0, std::vector<unsigned>{}));
        }
    }
    // The reset is the controller's, about 100 ms after the start; the NMI is
    // Chassis Control with the one byte 0x04.
    SetUp(), MoxActionCapabilityWord = 0x7FF;
    ASSERT_EQ(MoxInitiateSystemControlAction(1, 200), ObxResultOk);
    EXPECT_TRUE(obxsimWaitForLog("watchdog expired: hard reset", 2000));
    ASSERT_EQ(MoxInitiateSystemControlAction(8, 200), ObxResultOk);
    EXPECT_EQ(requestsFor(0x00, 0x02).at(0).data, std::vector<uint8_t>{0x04});
    moxSetSleepHook(nullptr), moxSetShutDownFunction(nullptr);
}

TEST_F(SystemControl, WatchdogCountdown)
{
    struct Row { uint32_t timeoutAction; int32_t ms; std::vector<uint8_t> data; } rows[] = { // Set Watchdog Timer
        {1, 250, {0x04, 0x01, 0x00, 0x00, 0x02, 0x00}}, {2, 0x123 * 100, {0x04, 0x02, 0x00, 0x00, 0x23, 0x01}},
        {1, 6553500, {0x04, 0x01, 0x00, 0x00, 0xFF, 0xFF}}, {2, 99, {0x04, 0x02, 0x00, 0x00, 0x00, 0x00}}, {3, 1000, {}}};
    for (const Row& row : rows) {
        SetUp();
        EXPECT_EQ(MoxSetWatchDogTimeoutValue(row.timeoutAction, row.ms), row.data.empty() ? ObxResultError : ObxResultOk);
        std::vector<ObxSimRequest> sets = requestsFor(0x06, 0x24);
        EXPECT_EQ(sets.empty() ? std::vector<uint8_t>{} : sets[0].data, row.data) << row.ms;
    }
    // Mode 1 first arms no action with one step, then restarts; a refused first request ends it.
    for (bool refused : {false, true}) {
        SetUp();
        if (refused)
            obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x24, ObxSimCompletionCode, 0xC0);
        EXPECT_EQ(MoxResetWatchDogTimer(1), refused ? ObxResultError : ObxResultOk);
        EXPECT_EQ(requestsFor(0x06, 0x24).at(0).data, (std::vector<uint8_t>{0x04, 0x00, 0x00, 0x00, 0x01, 0x00}));
        EXPECT_EQ(requestsFor(0x06, 0x22).size(), refused ? 0u : 1u);
    }
}

} // namespace
