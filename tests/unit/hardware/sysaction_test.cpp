#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <pthread.h>
#include <unistd.h>

#include "actions/uxaction.h"
#include "base/sleep.h"
#include "hardware/sysaction.h"
#include "simdriver.h"

namespace {

std::vector<unsigned> sleeps;
int shutDowns = 0;

void recordSleep(unsigned milliseconds)
{
    sleeps.push_back(milliseconds);
}

int stubShutDown(void)
{
    ++shutDowns;
    return -1; // as a failed exec would
}

class SystemControl : public SimDriverTest {
protected:
    void SetUp() override
    {
        SimDriverTest::SetUp();
        sleeps.clear();
        shutDowns = 0;
        moxSetSleepHook(recordSleep);
        moxSetShutDownFunction(stubShutDown);
        MoxActionCapabilityWord = 0x7FF;
    }
    void TearDown() override
    {
        moxSetSleepHook(nullptr);
        moxSetShutDownFunction(nullptr);
        MoxActionCapabilityWord = 0x7FF;
        SimDriverTest::TearDown();
    }
    static std::vector<ObxSimRequest> watchdogSets() { return requestsFor(0x06, 0x24); }
    static std::vector<ObxSimRequest> watchdogStarts() { return requestsFor(0x06, 0x22); }
};

TEST_F(SystemControl, CapabilityReportNeverTouchesTheController)
{
    SystemControlInfo info{};
    EXPECT_EQ(MoxGetSystemControlInfo(&info), ObxResultOk);
    EXPECT_EQ(info.capabilities, 0x7FFu);
    EXPECT_EQ(info.minimumDelay, 100u);
    EXPECT_EQ(info.maximumDelay, 6553600u);
    EXPECT_EQ(obxsimOpenCount(), 0);
    EXPECT_EQ(MoxGetSystemControlInfo(nullptr), ObxResultError);
}

TEST_F(SystemControl, ResetAndPowerOffArmSleepAndStart)
{
    struct Case {
        uint32_t action;
        uint8_t timerAction;
        const char* expiry;
    } cases[] = {{1, 0x01, "watchdog expired: hard reset"}, {2, 0x02, "watchdog expired: power down"}};
    for (const Case& c : cases) {
        SetUp();
        EXPECT_EQ(MoxInitiateSystemControlAction(c.action, 200), ObxResultOk);
        std::vector<ObxSimRequest> sets = watchdogSets();
        ASSERT_EQ(sets.size(), 1u);
        // The delay argument is ignored: always one step of 100 ms.
        EXPECT_EQ(sets[0].data, (std::vector<uint8_t>{0x04, c.timerAction, 0x00, 0x00, 0x01, 0x00}));
        EXPECT_EQ(sets[0].timeout, 300000u);
        EXPECT_EQ(sleeps, std::vector<unsigned>{3000});
        ASSERT_EQ(watchdogStarts().size(), 1u);
        EXPECT_TRUE(watchdogStarts()[0].data.empty());
        // The simulated controller acts about 100 ms after the start.
        EXPECT_TRUE(obxsimWaitForLog(c.expiry, 2000)) << c.expiry;
        EXPECT_EQ(shutDowns, 0);
        TearDown();
    }
}

TEST_F(SystemControl, ArmingFailureSkipsSleepAndStart)
{
    struct Case {
        ObxSimFault fault;
        uint8_t value;
    } cases[] = {{ObxSimCompletionCode, 0xC0}, {ObxSimFail, 0}, {ObxSimPositive, 0}, {ObxSimEmpty, 0}};
    for (const Case& c : cases) {
        SetUp();
        obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x24, c.fault, c.value);
        EXPECT_EQ(MoxInitiateSystemControlAction(1, 200), ObxResultError) << c.fault;
        EXPECT_TRUE(sleeps.empty());
        EXPECT_TRUE(watchdogStarts().empty());
        TearDown();
    }
    // A failed start is reported after the sleep; the watchdog stays armed but stopped.
    SetUp();
    obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x22, ObxSimCompletionCode, 0xD5);
    EXPECT_EQ(MoxInitiateSystemControlAction(2, 200), ObxResultError);
    EXPECT_EQ(sleeps, std::vector<unsigned>{3000});
    EXPECT_FALSE(obxsimWaitForLog("watchdog expired: power down", 300));
}

TEST_F(SystemControl, ShutdownVariantsRegisterCodeAndDelay)
{
    struct Case {
        uint32_t action;
        int32_t delay;
        const char* line;
    } cases[] = {
        {4, 40000, "shutdown code 1 delay 1"},   {5, 40000, "shutdown code 2 delay 1"},
        {6, 40000, "shutdown code 1 delay 400"}, {7, 40000, "shutdown code 2 delay 400"},
        {6, 150, "shutdown code 1 delay 1"},     {6, 99, "shutdown code 1 delay 0"},
        {7, 250, "shutdown code 2 delay 2"},
    };
    for (const Case& c : cases) {
        SetUp();
        EXPECT_EQ(MoxInitiateSystemControlAction(c.action, c.delay), ObxResultOk);
        EXPECT_EQ(countLog(c.line), 1u) << c.action << " " << c.delay;
        EXPECT_EQ(shutDowns, 1);
        EXPECT_TRUE(watchdogSets().empty());
        TearDown();
    }
    // A refused code does not stop the shutdown.
    SetUp();
    obxsimInjectFault(ObxIoctlSetShutdownCode, -1, -1, ObxSimFail);
    EXPECT_EQ(MoxInitiateSystemControlAction(6, 40000), ObxResultOk);
    EXPECT_EQ(shutDowns, 1);
    // Code 3 is the shutdown alone and needs no driver.
    SetUp();
    EXPECT_EQ(MoxInitiateSystemControlAction(3, 200), ObxResultOk);
    EXPECT_EQ(shutDowns, 1);
    EXPECT_EQ(obxsimOpenCount(), 0);
}

TEST_F(SystemControl, NmiIsAChassisControlRequest)
{
    EXPECT_EQ(MoxInitiateSystemControlAction(8, 200), ObxResultOk);
    std::vector<ObxSimRequest> sent = requestsFor(0x00, 0x02);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].data, std::vector<uint8_t>{0x04});
    EXPECT_EQ(countLog("chassis control: nmi"), 1u);
    // A failed NMI is not reported by the action; MoxGenerateNmi gives the send's result.
    obxsimInjectFault(ObxIoctlSendMessage, 0x00, 0x02, ObxSimFail);
    EXPECT_EQ(MoxInitiateSystemControlAction(8, 200), ObxResultOk);
    EXPECT_EQ(MoxGenerateNmi(), ObxResultError);
}

TEST_F(SystemControl, UnsupportedCodesAndClearCapabilitiesSendNothing)
{
    for (uint32_t action : {0u, 9u, 10u, 0xFFFFFFFFu})
        EXPECT_EQ(MoxInitiateSystemControlAction(action, 200), ObxResultUnsupported) << action;
    struct Case {
        uint32_t action;
        uint32_t bit;
    } cases[] = {{1, 0x02}, {2, 0x01}, {4, 0x10}, {5, 0x40}, {6, 0x20}, {7, 0x80}};
    for (const Case& c : cases) {
        MoxActionCapabilityWord = 0x7FF & ~c.bit;
        EXPECT_EQ(MoxInitiateSystemControlAction(c.action, 40000), ObxResultUnsupported) << c.action;
    }
    // Codes 3 and 8 need no bit.
    MoxActionCapabilityWord = 0;
    EXPECT_EQ(MoxInitiateSystemControlAction(8, 200), ObxResultOk);
    EXPECT_EQ(MoxInitiateSystemControlAction(3, 200), ObxResultOk);
    EXPECT_EQ(shutDowns, 1);
    EXPECT_EQ(obxsimRequests().size(), 2u); // the identity query and the NMI
    EXPECT_TRUE(sleeps.empty());
}

TEST_F(SystemControl, WatchdogCountdownBytes)
{
    struct Case {
        uint32_t timeoutAction;
        int32_t milliseconds;
        std::vector<uint8_t> data;
    } cases[] = {
        {1, 250, {0x04, 0x01, 0x00, 0x00, 0x02, 0x00}},
        {2, 0x123 * 100, {0x04, 0x02, 0x00, 0x00, 0x23, 0x01}},
        {1, 6553500, {0x04, 0x01, 0x00, 0x00, 0xFF, 0xFF}},
        {2, 99, {0x04, 0x02, 0x00, 0x00, 0x00, 0x00}},
    };
    for (const Case& c : cases) {
        SetUp();
        EXPECT_EQ(MoxSetWatchDogTimeoutValue(c.timeoutAction, c.milliseconds), ObxResultOk);
        ASSERT_EQ(watchdogSets().size(), 1u);
        EXPECT_EQ(watchdogSets()[0].data, c.data) << c.milliseconds;
        TearDown();
    }
    SetUp();
    EXPECT_EQ(MoxSetWatchDogTimeoutValue(3, 1000), ObxResultError);
    EXPECT_EQ(obxsimOpenCount(), 0);
    obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x24, ObxSimCompletionCode, 0xCC);
    EXPECT_EQ(MoxSetWatchDogTimeoutValue(1, 1000), ObxResultError);
}

TEST_F(SystemControl, WatchdogRestartModes)
{
    // Mode 1 neutralises the action first, so the running timer expires harmlessly.
    ASSERT_EQ(MoxSetWatchDogTimeoutValue(1, 60000), ObxResultOk);
    EXPECT_EQ(MoxResetWatchDogTimer(1), ObxResultOk);
    std::vector<ObxSimRequest> sets = watchdogSets();
    ASSERT_EQ(sets.size(), 2u);
    EXPECT_EQ(sets[1].data, (std::vector<uint8_t>{0x04, 0x00, 0x00, 0x00, 0x01, 0x00}));
    EXPECT_EQ(watchdogStarts().size(), 1u);
    EXPECT_TRUE(obxsimWaitForLog("watchdog expired: no action", 2000));

    EXPECT_EQ(MoxResetWatchDogTimer(3), ObxResultUnsupported);
    EXPECT_EQ(watchdogSets().size(), 2u);

    // The first request failing keeps the second from being sent.
    obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x24, ObxSimFail, 0, 1);
    EXPECT_EQ(MoxResetWatchDogTimer(1), ObxResultError);
    EXPECT_EQ(watchdogStarts().size(), 1u);
    // Mode 2 only restarts.
    EXPECT_EQ(MoxResetWatchDogTimer(2), ObxResultOk);
    EXPECT_EQ(watchdogStarts().size(), 2u);
    EXPECT_EQ(watchdogSets().size(), 2u);
}

TEST_F(SystemControl, SimulatedWatchdogCountsDownInTenthsOfASecond)
{
    ASSERT_EQ(MoxSetWatchDogTimeoutValue(2, 500), ObxResultOk);
    auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(MoxResetWatchDogTimer(2), ObxResultOk);
    ASSERT_TRUE(obxsimWaitForLog("watchdog expired: power down", 3000));
    auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start);
    EXPECT_GE(elapsed.count(), 490);
    EXPECT_LT(elapsed.count(), 1500);
    // Re-arming stops the timer (timer use 0x04): nothing expires.
    ASSERT_EQ(MoxSetWatchDogTimeoutValue(1, 100), ObxResultOk);
    ASSERT_EQ(MoxResetWatchDogTimer(2), ObxResultOk);
    ASSERT_EQ(MoxSetWatchDogTimeoutValue(1, 100), ObxResultOk);
    EXPECT_FALSE(obxsimWaitForLog("watchdog expired: hard reset", 400));
}

TEST_F(SystemControl, ResetWaitsThreeRealSeconds)
{
    moxSetSleepHook(nullptr);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(MoxInitiateSystemControlAction(1, 200), ObxResultOk);
    auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start);
    EXPECT_GE(elapsed.count(), 3000);
    EXPECT_LT(elapsed.count(), 4000);
    EXPECT_EQ(watchdogStarts().size(), 1u);
}

TEST_F(SystemControl, PublicOperationsTakeTheSystemControlLock)
{
    ASSERT_EQ(MoxSemaphoreWait(), 0);
    std::atomic<bool> done{false};
    auto work = [](void* argument) -> void* {
        SystemControlInfo info{};
        MoxGetSystemControlInfo(&info);
        MoxInitiateSystemControlAction(8, 200);
        static_cast<std::atomic<bool>*>(argument)->store(true);
        return nullptr;
    };
    pthread_t thread;
    ASSERT_EQ(pthread_create(&thread, nullptr, work, &done), 0);
    usleep(100000);
    EXPECT_FALSE(done.load());
    EXPECT_EQ(obxsimOpenCount(), 0);
    ASSERT_EQ(MoxSemaphoreRelease(), 0);
    pthread_join(thread, nullptr);
    EXPECT_TRUE(done.load());
    EXPECT_EQ(countLog("chassis control: nmi"), 1u);
}

} // namespace
