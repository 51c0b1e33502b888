#include "daemon/daemon.h"

#include <cstdio>
#include <cstdlib>
#include <pthread.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include "base/log.h"

int g_isLogOpen = 0;

namespace {

// The two sets handed to the signal thread, in this order.
struct SignalHandlerParam {
    sigset_t wait;
    sigset_t term;
} signalHandlerParam;

int gs_maxOpenFileHandles = 0;

int defaultTermSet(sigset_t* set)
{
    if (sigemptyset(set) != 0 || sigaddset(set, SIGTERM) != 0 || sigaddset(set, SIGINT) != 0 ||
        sigaddset(set, SIGQUIT) != 0 || sigaddset(set, SIGPWR) != 0) {
        perror("sigemptyset()/sigaddset()");
        return -1;
    }
    return 0;
}

} // namespace

int daemon_defaultWaitSet(sigset_t* set)
{
    if (sigfillset(set) != 0) {
        perror("sigfillset()");
        return -1;
    }
    if (sigdelset(set, SIGALRM) != 0 || sigdelset(set, SIGIO) != 0 || sigdelset(set, SIGUSR1) != 0 ||
        sigdelset(set, SIGUSR2) != 0) {
        perror("sigdelset()");
        return -1;
    }
    return 0;
}

void* daemon_signalParam()
{
    return &signalHandlerParam;
}

int daemon_startSignalHandling(const sigset_t* wait, const sigset_t* term, pthread_t* thread)
{
    if (wait != nullptr)
        signalHandlerParam.wait = *wait;
    else if (daemon_defaultWaitSet(&signalHandlerParam.wait) != 0)
        return -1;
    if (term != nullptr)
        signalHandlerParam.term = *term;
    else if (defaultTermSet(&signalHandlerParam.term) != 0)
        return -1;

    int error = pthread_sigmask(SIG_SETMASK, &signalHandlerParam.wait, nullptr);
    if (error != 0) {
        moxLog(LOG_ERR, "thr_sigsetmask() error: %d\n", error);
        return -1;
    }
    error = pthread_create(thread, nullptr, signalHandlerThread, &signalHandlerParam);
    if (error != 0) {
        moxLog(LOG_ERR, "thr_create( signalHandlerThread ) error: %d\n", error);
        return -1;
    }
    return 0;
}

void* signalHandlerThread(void* param)
{
    auto* sets = static_cast<SignalHandlerParam*>(param);
    for (;;) {
        int signal = 0;
        if (sigwait(&sets->wait, &signal) != 0)
            continue;
        if (sigismember(&sets->term, signal) == 1)
            return nullptr;
    }
}

int daemon_init(void)
{
    pid_t pid = fork();
    if (pid < 0)
        return -1;
    if (pid > 0)
        exit(0);
    setsid();
    if (chdir("/") != 0) {
        // The root directory always exists; nothing sensible to do otherwise.
    }
    // Files the detached process creates are never writable by group or others.
    umask(022);
    for (int fd = 0; fd < maxOpenFileHandles(); ++fd)
        close(fd);
    return 0;
}

int maxOpenFileHandlesFrom(long (*limit)(int))
{
    if (gs_maxOpenFileHandles == 0) {
        long value = limit(_SC_OPEN_MAX);
        gs_maxOpenFileHandles = value < 0 ? 256 : static_cast<int>(value);
    }
    return gs_maxOpenFileHandles;
}

void resetOpenFileHandlesCache()
{
    gs_maxOpenFileHandles = 0;
}

int maxOpenFileHandles(void)
{
    return maxOpenFileHandlesFrom(sysconf);
}

int daemon_close(void)
{
    return 0;
}

void daemon_openLog(void)
{
}

void daemon_log(int priority, const char* text)
{
    // The text is data, never a format.
    if (g_isLogOpen)
        moxLog(priority, "%s", text);
}

void daemon_closeLog(void)
{
    g_isLogOpen = 0;
    closelog();
}
