#include "mif/mif.h"

int RegisterWithSL(void)
{
    return 0;
}

void AddComponentToList(const DmiString*, uint32_t)
{
}

const char* ComponentName(uint32_t)
{
    return "Unknown Component";
}
