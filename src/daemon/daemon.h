// Process services: signal handling, detaching, descriptor limit, log stubs.
#pragma once

#include <csignal>

// Blocks `wait` (default: every signal but SIGALRM, SIGIO, SIGUSR1, SIGUSR2) in
// the calling thread and starts the signal thread, which ends on a signal of
// `term` (default: SIGTERM, SIGINT, SIGQUIT, SIGPWR) and consumes the others.
// 0 when the thread runs (its id stored through `thread`), -1 otherwise.
int daemon_startSignalHandling(const sigset_t* wait, const sigset_t* term, pthread_t* thread);
// The signal thread's routine; `param` is the block of the two sets.
void* signalHandlerThread(void* param);
// The default wait set; -1 (after perror) when it cannot be built.
int daemon_defaultWaitSet(sigset_t* set);
// The block daemon_startSignalHandling passed to the signal thread.
void* daemon_signalParam();

int daemon_init(void);
int maxOpenFileHandles(void);
int daemon_close(void);
void daemon_openLog(void);
void daemon_log(int priority, const char* text);
void daemon_closeLog(void);

extern int g_isLogOpen;

// maxOpenFileHandles with the limit asked of `limit` instead of sysconf.
int maxOpenFileHandlesFrom(long (*limit)(int));
void resetOpenFileHandlesCache();
