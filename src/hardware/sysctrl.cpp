#include "hardware/sysctrl.h"

int SysCtrlInitialize(void)
{
    return -1;
}
