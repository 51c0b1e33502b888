#include "hardware/sysctrl.h"

int SysCtrlInitialize(void)
{
    return -1;
}

void SysCtrlPage(void)
{
}

void SysCtrlIdLedOff(void)
{
}

void SysCtrlIdLedBlink(void)
{
}
