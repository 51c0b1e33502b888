// The baseboard's system-control and paging groups: requests written as
// attribute values that the baseboard's instrumentation carries out.
#pragma once

#include <cstdint>

#include "sl/sltypes.h"

// Group id of the system-control group and the component it was found in;
// 0 until found, then kept for the life of the process.
extern uint32_t sysCtrlGroup;
extern uint32_t sysCtrlComponent;
// Group id of the baseboard's paging-configuration group; 0 until found.
extern uint32_t PagingGroupId;

// Class texts; a group matches when its class string begins with the text,
// compared without regard to case over the given number of characters.
extern const char sysCtrlClassString[];
extern const int sysCtrlClassLength; // its own length: any version matches
extern const char PagingClassString[];
extern const int PagingClassLength;

// 1 when the DMI string `classString` begins with the first `length`
// characters of `text`, ignoring case; 0 otherwise and for a null string.
// Never reads past the string's count.
int groupClassMatches(const DmiString* classString, const char* text, int length);

// 0 when the system-control group is known (found now or earlier), -1 otherwise.
int SysCtrlInitialize(void);
// The id of the first system-control group listed for `component` (0: the
// first component after 0 that carries the class), storing the listed
// component's id in sysCtrlComponent; 0 when there is none.
uint32_t SysCtrlFindGroupId(SLHandle* h, uint32_t component);

// System-control requests; each does nothing while sysCtrlGroup is 0.
void SysCtrlReset(void);
void SysCtrlPowerOff(void);
void SysCtrlShutDown(void);
void SysCtrlShutAndPowerOff(void);
void SysCtrlShutAndReset(void);
void SysCtrlNMI(void);
void SysCtrlIdLedBlink(void);
void SysCtrlIdLedOff(void);
// Pages through the baseboard's paging-configuration group, searching for
// it first while it is not known.
void SysCtrlPage(void);

// The write a request makes: component, group, attribute and value text.
struct SysCtrlTarget {
    uint32_t component;
    uint32_t group;
    uint32_t attribute;
    const char* value;
};
// The write SysCtrlIdLedBlink (blink) or SysCtrlIdLedOff makes; false when it
// makes none.
bool SysCtrlIdLedTarget(bool blink, SysCtrlTarget* target);
// The write SysCtrlPage makes, searching for the paging group as it does;
// false when it makes none.
bool SysCtrlPageTarget(SysCtrlTarget* target);
