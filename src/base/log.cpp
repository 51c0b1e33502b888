#include "base/log.h"

#include <atomic>
#include <cstdio>
#include <syslog.h>

namespace {
std::atomic<MoxLogHook> logHook{nullptr};
}

void moxLog(int priority, const char* format, ...)
{
    va_list args;
    va_start(args, format);
    MoxLogHook hook = logHook.load();
    if (hook != nullptr) {
        char text[4096];
        vsnprintf(text, sizeof text, format, args);
        hook(priority, text);
    } else {
        vsyslog(priority, format, args);
    }
    va_end(args);
}

void moxSetLogHook(MoxLogHook hook)
{
    logHook.store(hook);
}
