// The daemon's one road to the system log.
//
// Every module logs through moxLog, which hands the format and arguments to
// vsyslog unchanged. A test can install a hook that receives the priority and
// the formatted text instead, so that lines and priorities are checked without
// a system logger.
#pragma once

#include <cstdarg>

void moxLog(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

// Receives each line in place of syslog; null restores syslog.
using MoxLogHook = void (*)(int priority, const char* text);
void moxSetLogHook(MoxLogHook hook);
