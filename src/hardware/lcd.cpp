#include "hardware/lcd.h"

int LcdInitialize(void)
{
    return -1;
}
