// The baseboard's system-control and paging groups.
#pragma once

// 0 when the system-control group is known, -1 otherwise.
int SysCtrlInitialize(void);
void SysCtrlPage(void);
void SysCtrlIdLedOff(void);
void SysCtrlIdLedBlink(void);
