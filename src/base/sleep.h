// The daemon's one road to a timed sleep.
//
// Long waits that the daemon's logic asks for (the provider's busy retry, the
// delay before a watchdog is started, MoxDelay) go through moxSleepMs, so a test
// can install a hook that records the request and returns at once. Zero-length
// yields are not sleeps and do not come here.
#pragma once

void moxSleepMs(unsigned milliseconds);

// Receives each request in place of sleeping; null restores real sleeps.
using MoxSleepHook = void (*)(unsigned milliseconds);
void moxSetSleepHook(MoxSleepHook hook);
