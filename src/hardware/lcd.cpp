#include "hardware/lcd.h"

int LcdInitialize(void)
{
    return -1;
}

void WriteLCD(const char*)
{
}
