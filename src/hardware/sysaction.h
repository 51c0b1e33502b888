// System control through the management controller: reset, power off, the
// operating-system shutdown and its after-shutdown variants, NMI, and the
// controller's watchdog.
//
// The four public operations take the system-control lock for their whole
// duration and call their unlocked workers (leading underscore); the workers
// call one another, never the public operations.
#pragma once

#include <cstdint>

// Capabilities of this platform; 0x7FF, never changed.
extern uint32_t MoxActionCapabilityWord;

struct SystemControlInfo {
    uint32_t capabilities;
    uint32_t minimumDelay; // milliseconds
    uint32_t maximumDelay; // milliseconds
};

// Action codes of MoxInitiateSystemControlAction.
enum : uint32_t {
    MoxActionNone = 0,
    MoxActionHardReset = 1,
    MoxActionPowerOff = 2,
    MoxActionShutDownOs = 3,
    MoxActionShutDownReset = 4,
    MoxActionShutDownPowerOff = 5,
    MoxActionShutDownDelayedReset = 6,
    MoxActionShutDownDelayedPowerOff = 7,
    MoxActionNmi = 8,
};

int MoxGetSystemControlInfo(SystemControlInfo* info);
int MoxInitiateSystemControlAction(uint32_t action, int32_t delayMs);
int MoxSetWatchDogTimeoutValue(uint32_t timeoutAction, int32_t timeoutMs);
int MoxResetWatchDogTimer(uint32_t mode);

int _MoxGetSystemControlInfo(SystemControlInfo* info);
int _MoxInitiateSystemControlAction(uint32_t action, int32_t delayMs);
int _MoxSetWatchDogTimeoutValue(uint32_t timeoutAction, int32_t timeoutMs);
int _MoxResetWatchDogTimer(uint32_t mode);

int MoxGenerateNmi(void);
int MoxDelayAfterShutDown(uint32_t delayTenths, uint32_t code);

// The operating-system shutdown used by the actions; null restores
// MoxShutDownOs. Tests install a stub so that nothing is executed.
using MoxShutDownFunction = int (*)(void);
void moxSetShutDownFunction(MoxShutDownFunction function);
