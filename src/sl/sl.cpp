#include "sl/sl.h"

#include "sl/slhandle.h"
#include "sl/slstring.h"

SLInvokeFunction SLDmiInvoke = nullptr;

extern "C" int SLInitialize(void)
{
    SLStringInitialize();
    return SLHandleInitialize();
}

extern "C" int SLCleanup(void)
{
    SLHandleCleanup();
    return SLStringCleanup();
}
