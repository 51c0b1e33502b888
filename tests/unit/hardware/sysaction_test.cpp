#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "base/sleep.h"
#include "hardware/sysaction.h"
#include "simdriver.h"

namespace {

std::vector<unsigned> sleeps;
int shutDowns = 0;

class SystemControl : public SimDriverTest {
protected:
    void SetUp() override
    {
        SimDriverTest::SetUp();
        sleeps.clear();
        shutDowns = 0;
        moxSetSleepHook([](unsigned ms) { sleeps.push_back(ms); });
        moxSetShutDownFunction([] { return ++shutDowns, -1; }); // as a failed exec
        MoxActionCapabilityWord = 0x7FF;
    }
    void TearDown() override
    {
        moxSetSleepHook(nullptr);
        moxSetShutDownFunction(nullptr);
        MoxActionCapabilityWord = 0x7FF;
        SimDriverTest::TearDown();
    }
};

const std::string resetArmed = "watchdog set: use 0x04 action hard reset countdown 1; watchdog started: countdown 1; ";
const std::string powerArmed = "watchdog set: use 0x04 action power down countdown 1; watchdog started: countdown 1; ";

TEST_F(SystemControl, ActionCodes)
{
    struct Row {
        uint32_t action;
        int32_t delay;
        uint32_t capabilities;
        int result;
        std::string effect; // what the controller saw
        int shutDowns;
        std::vector<unsigned> sleeps;
    } rows[] = {
        {0, 200, 0x7FF, ObxResultUnsupported, "", 0, {}},
        {1, 200, 0x7FF, ObxResultOk, resetArmed, 0, {3000}},
        {2, 200, 0x7FF, ObxResultOk, powerArmed, 0, {3000}},
        {3, 200, 0, ObxResultOk, "", 1, {}},
        {4, 40000, 0x7FF, ObxResultOk, "shutdown code 1 delay 1; ", 1, {}},
        {5, 40000, 0x7FF, ObxResultOk, "shutdown code 2 delay 1; ", 1, {}},
        {6, 40000, 0x7FF, ObxResultOk, "shutdown code 1 delay 400; ", 1, {}},
        {7, 250, 0x7FF, ObxResultOk, "shutdown code 2 delay 2; ", 1, {}},
        {6, 99, 0x7FF, ObxResultOk, "shutdown code 1 delay 0; ", 1, {}},
        {8, 200, 0, ObxResultOk, "chassis control: nmi; ", 0, {}},
        {9, 200, 0x7FF, ObxResultUnsupported, "", 0, {}},
        {0xFFFFFFFF, 200, 0x7FF, ObxResultUnsupported, "", 0, {}},
        // Each capability bit missing.
        {1, 200, 0x7FF & ~0x02u, ObxResultUnsupported, "", 0, {}},
        {2, 200, 0x7FF & ~0x01u, ObxResultUnsupported, "", 0, {}},
        {4, 200, 0x7FF & ~0x10u, ObxResultUnsupported, "", 0, {}},
        {5, 200, 0x7FF & ~0x40u, ObxResultUnsupported, "", 0, {}},
        {6, 200, 0x7FF & ~0x20u, ObxResultUnsupported, "", 0, {}},
        {7, 200, 0x7FF & ~0x80u, ObxResultUnsupported, "", 0, {}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE("action " + std::to_string(row.action) + " delay " + std::to_string(row.delay));
        SetUp();
        MoxActionCapabilityWord = row.capabilities;
        EXPECT_EQ(MoxInitiateSystemControlAction(row.action, row.delay), row.result);
        EXPECT_EQ(actions(), row.effect);
        EXPECT_EQ(shutDowns, row.shutDowns);
        EXPECT_EQ(sleeps, row.sleeps);
        TearDown();
    }
    // The reset is the controller's: it comes about 100 ms after the start.
    SetUp();
    ASSERT_EQ(MoxInitiateSystemControlAction(1, 200), ObxResultOk);
    EXPECT_TRUE(obxsimWaitForLog("watchdog expired: hard reset", 2000));
    // The NMI is Chassis Control with the single byte 0x04.
    ASSERT_EQ(MoxInitiateSystemControlAction(8, 200), ObxResultOk);
    ASSERT_EQ(requestsFor(0x00, 0x02).size(), 1u);
    EXPECT_EQ(requestsFor(0x00, 0x02)[0].data, std::vector<uint8_t>{0x04});
}

TEST_F(SystemControl, FailuresOnTheWay)
{
    // A refused arming: no sleep, no start.
    obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x24, ObxSimCompletionCode, 0xC0);
    EXPECT_EQ(MoxInitiateSystemControlAction(1, 200), ObxResultError);
    EXPECT_TRUE(sleeps.empty());
    EXPECT_TRUE(requestsFor(0x06, 0x22).empty());
    // A refused after-shutdown code does not stop the shutdown.
    SetUp();
    obxsimInjectFault(ObxIoctlSetShutdownCode, -1, -1, ObxSimFail);
    EXPECT_EQ(MoxInitiateSystemControlAction(6, 40000), ObxResultOk);
    EXPECT_EQ(shutDowns, 1);
}

TEST_F(SystemControl, WatchdogCountdownAndRestartModes)
{
    struct Row {
        uint32_t timeoutAction;
        int32_t ms;
        int result;
        std::vector<uint8_t> data; // of Set Watchdog Timer, empty when none is sent
    } rows[] = {
        {1, 250, ObxResultOk, {0x04, 0x01, 0x00, 0x00, 0x02, 0x00}},
        {2, 0x123 * 100, ObxResultOk, {0x04, 0x02, 0x00, 0x00, 0x23, 0x01}},
        {1, 6553500, ObxResultOk, {0x04, 0x01, 0x00, 0x00, 0xFF, 0xFF}},
        {2, 99, ObxResultOk, {0x04, 0x02, 0x00, 0x00, 0x00, 0x00}},
        {3, 1000, ObxResultError, {}},
    };
    for (const Row& row : rows) {
        SetUp();
        EXPECT_EQ(MoxSetWatchDogTimeoutValue(row.timeoutAction, row.ms), row.result) << row.ms;
        std::vector<ObxSimRequest> sets = requestsFor(0x06, 0x24);
        EXPECT_EQ(sets.empty() ? std::vector<uint8_t>{} : sets[0].data, row.data) << row.ms;
        EXPECT_EQ(sets.empty() ? 300000u : sets[0].timeout, 300000u);
    }
    struct Mode {
        uint32_t mode;
        int result;
        std::string effect;
    } modes[] = {
        {1, ObxResultOk, "watchdog set: use 0x04 action no action countdown 1; watchdog started: countdown 1; "},
        {2, ObxResultOk, "watchdog started: countdown 600; "},
        {3, ObxResultUnsupported, ""},
    };
    for (const Mode& m : modes) {
        SetUp();
        ASSERT_EQ(MoxSetWatchDogTimeoutValue(1, 60000), ObxResultOk);
        const std::string armed = actions();
        EXPECT_EQ(MoxResetWatchDogTimer(m.mode), m.result);
        EXPECT_EQ(actions(), armed + m.effect) << m.mode;
    }
}

} // namespace
