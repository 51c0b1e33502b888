#include "hardware/sysaction.h"

#include <atomic>

#include "actions/uxaction.h"
#include "obx/obxapi.h"

uint32_t MoxActionCapabilityWord = 0x7FF;

namespace {

std::atomic<MoxShutDownFunction> shutDownFunction{nullptr};

int shutDownOs(void)
{
    MoxShutDownFunction function = shutDownFunction.load();
    return function != nullptr ? function() : MoxShutDownOs();
}

// Capability bits.
constexpr uint32_t capPowerOff = 0x01;
constexpr uint32_t capHardReset = 0x02;
constexpr uint32_t capShutDownReset = 0x10;
constexpr uint32_t capShutDownDelayedReset = 0x20;
constexpr uint32_t capShutDownPowerOff = 0x40;
constexpr uint32_t capShutDownDelayedPowerOff = 0x80;

// One step of the watchdog's countdown, in milliseconds.
constexpr int32_t watchdogStepMs = 100;

// Watchdog timer actions of Set Watchdog Timer.
constexpr uint8_t timerNoAction = 0x00;
constexpr uint8_t timerHardReset = 0x01;
constexpr uint8_t timerPowerDown = 0x02;

// After-shutdown codes of the driver.
constexpr uint32_t afterShutDownReset = 1;
constexpr uint32_t afterShutDownPowerOff = 2;

// Sends one request to the controller (address 0x20, LUN 0, bus 0, time-out
// 300); 0 only when the driver carried it and the completion code is 0.
int sendToController(uint8_t netFunction, uint8_t command, const uint8_t* data, int32_t length)
{
    const ObxpRequest request = {command, 0x20, 0, netFunction, 0, data, length};
    uint8_t response[obxTimedBufferSize];
    uint32_t responseLength = 0;
    uint8_t completionCode = 0;
    int result = SendTimedObxpRequest(&request, 300, response, &responseLength, &completionCode);
    return result == ObxResultOk && completionCode == 0 ? ObxResultOk : ObxResultError;
}

// Set Watchdog Timer: timer use 0x04 (OS use; this command stops the timer;
// expiry logged), the timer action, no pre-timeout, no flags to clear, then
// the countdown in 100 ms steps, low byte first.
int setWatchdog(uint8_t timerAction, int32_t steps)
{
    const uint8_t data[6] = {0x04,
                             timerAction,
                             0x00,
                             0x00,
                             static_cast<uint8_t>(steps & 0xFF),
                             static_cast<uint8_t>((steps >> 8) & 0xFF)};
    return sendToController(0x06, 0x24, data, sizeof data);
}

int resetWatchdog(void)
{
    return sendToController(0x06, 0x22, nullptr, 0);
}

} // namespace

void moxSetShutDownFunction(MoxShutDownFunction function)
{
    shutDownFunction.store(function);
}

int _MoxGetSystemControlInfo(SystemControlInfo* info)
{
    if (info == nullptr)
        return ObxResultError;
    info->capabilities = MoxActionCapabilityWord;
    info->minimumDelay = 100;
    info->maximumDelay = 6553600;
    return ObxResultOk;
}

int _MoxSetWatchDogTimeoutValue(uint32_t timeoutAction, int32_t timeoutMs)
{
    uint8_t timerAction;
    if (timeoutAction == 1)
        timerAction = timerHardReset;
    else if (timeoutAction == 2)
        timerAction = timerPowerDown;
    else
        return ObxResultError;
    return setWatchdog(timerAction, timeoutMs / watchdogStepMs);
}

int _MoxResetWatchDogTimer(uint32_t mode)
{
    if (mode != 1 && mode != 2)
        return ObxResultUnsupported;
    // Mode 1 first replaces the armed action by none, so the timer runs out
    // harmlessly once restarted.
    if (mode == 1 && setWatchdog(timerNoAction, 1) != ObxResultOk)
        return ObxResultError;
    return resetWatchdog();
}

int MoxGenerateNmi(void)
{
    // Chassis Control: pulse diagnostic interrupt. The completion code is not examined.
    const uint8_t data[1] = {0x04};
    const ObxpRequest request = {0x02, 0x20, 0, 0x00, 0, data, 1};
    uint8_t response[obxTimedBufferSize];
    uint32_t responseLength = 0;
    uint8_t completionCode = 0;
    return SendTimedObxpRequest(&request, 300, response, &responseLength, &completionCode);
}

int MoxDelayAfterShutDown(uint32_t delayTenths, uint32_t code)
{
    return SetShutDownCode(delayTenths, code);
}

int _MoxInitiateSystemControlAction(uint32_t action, int32_t delayMs)
{
    if (action > MoxActionNmi || action == MoxActionNone)
        return ObxResultUnsupported;
    static const uint32_t requiredCapability[9] = {
        0, capHardReset, capPowerOff, 0, capShutDownReset, capShutDownPowerOff, capShutDownDelayedReset,
        capShutDownDelayedPowerOff, 0,
    };
    const uint32_t required = requiredCapability[action];
    if (required != 0 && (MoxActionCapabilityWord & required) == 0)
        return ObxResultUnsupported;

    switch (action) {
    case MoxActionHardReset:
    case MoxActionPowerOff:
        // Arm a one-step countdown, give the caller's other work three seconds,
        // then start it: the controller acts about 100 ms later.
        if (_MoxSetWatchDogTimeoutValue(action == MoxActionHardReset ? 1 : 2, watchdogStepMs) != ObxResultOk)
            return ObxResultError;
        MoxDelay(3000);
        return _MoxResetWatchDogTimer(2) == ObxResultOk ? ObxResultOk : ObxResultError;
    case MoxActionShutDownOs:
        shutDownOs();
        return ObxResultOk;
    case MoxActionShutDownReset:
        MoxDelayAfterShutDown(1, afterShutDownReset);
        shutDownOs();
        return ObxResultOk;
    case MoxActionShutDownPowerOff:
        MoxDelayAfterShutDown(1, afterShutDownPowerOff);
        shutDownOs();
        return ObxResultOk;
    case MoxActionShutDownDelayedReset:
    case MoxActionShutDownDelayedPowerOff:
        // The shutdown goes ahead even when the driver refuses the code.
        MoxDelayAfterShutDown(static_cast<uint32_t>(delayMs / 100),
                              action == MoxActionShutDownDelayedReset ? afterShutDownReset : afterShutDownPowerOff);
        shutDownOs();
        return ObxResultOk;
    default: // MoxActionNmi
        MoxGenerateNmi();
        return ObxResultOk;
    }
}

int MoxGetSystemControlInfo(SystemControlInfo* info)
{
    MoxSemaphoreWait();
    int result = _MoxGetSystemControlInfo(info);
    MoxSemaphoreRelease();
    return result;
}

int MoxInitiateSystemControlAction(uint32_t action, int32_t delayMs)
{
    MoxSemaphoreWait();
    int result = _MoxInitiateSystemControlAction(action, delayMs);
    MoxSemaphoreRelease();
    return result;
}

int MoxSetWatchDogTimeoutValue(uint32_t timeoutAction, int32_t timeoutMs)
{
    MoxSemaphoreWait();
    int result = _MoxSetWatchDogTimeoutValue(timeoutAction, timeoutMs);
    MoxSemaphoreRelease();
    return result;
}

int MoxResetWatchDogTimer(uint32_t mode)
{
    MoxSemaphoreWait();
    int result = _MoxResetWatchDogTimer(mode);
    MoxSemaphoreRelease();
    return result;
}
