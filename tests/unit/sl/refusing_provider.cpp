// The provider entry point for test builds without the provider library: it
// refuses every command. Tests install their own scripted entry point.
#include "sl/sl.h"

extern "C" uint32_t DmiInvoke(void*)
{
    return 3;
}
