#include "base/sleep.h"

#include <atomic>
#include <cerrno>
#include <ctime>

namespace {
std::atomic<MoxSleepHook> sleepHook{nullptr};
}

void moxSleepMs(unsigned milliseconds)
{
    MoxSleepHook hook = sleepHook.load();
    if (hook != nullptr) {
        hook(milliseconds);
        return;
    }
    timespec left{static_cast<time_t>(milliseconds / 1000), static_cast<long>(milliseconds % 1000) * 1000000L};
    while (nanosleep(&left, &left) != 0 && errno == EINTR) {
    }
}

void moxSetSleepHook(MoxSleepHook hook)
{
    sleepHook.store(hook);
}
