#include "actions/uxaction.h"

#include <cctype>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <pthread.h>
#include <syslog.h>
#include <unistd.h>

#include "actions/actionlog.h"
#include "base/files.h"
#include "base/log.h"
#include "base/sleep.h"

uint32_t bNotificationOnly = 0;
const char* const MoxConfigFile = "/usr/local/ubo/bin/mox.cfg";

namespace {
pthread_mutex_t MoxSyncMutex = PTHREAD_MUTEX_INITIALIZER;
const char* const initProgram = "/sbin/init";
} // namespace

int MoxOsSpecificInit(void)
{
    return pthread_mutex_init(&MoxSyncMutex, nullptr);
}

int MoxSemaphoreWait(void)
{
    return pthread_mutex_lock(&MoxSyncMutex);
}

int MoxSemaphoreRelease(void)
{
    return pthread_mutex_unlock(&MoxSyncMutex);
}

void MoxDelay(int32_t milliseconds)
{
    int32_t seconds = milliseconds / 1000;
    moxSleepMs(seconds > 0 ? static_cast<unsigned>(seconds) * 1000u : 1000u);
}

int shutDownOsWith(const char* program)
{
    // The program must not inherit the blocked signals of the daemon's threads.
    sigset_t none;
    sigemptyset(&none);
    pthread_sigmask(SIG_SETMASK, &none, nullptr);
    execl(program, "init", "0", static_cast<char*>(nullptr));
    int error = errno;
    moxLog(LOG_ERR, "MOX - cannot execute %s for the OS shutdown: %s\n", program, strerror(error));
    return -1;
}

int MoxShutDownOs(void)
{
    return shutDownOsWith(initProgram);
}

int GetOSType(void)
{
    return 6;
}

int processCfgFile(const char* path)
{
    // A FIFO or device in the file's place would block or never end: only a
    // regular file is read, anything else counts as a file that cannot be opened.
    FILE* file = moxOpenRegular(path);
    if (file == nullptr)
        return 0;
    // A line longer than the buffer arrives in pieces, each taken as a line.
    char line[500];
    while (fgets(line, sizeof line, file) != nullptr) {
        if (line[0] == '#')
            continue;
        for (char* c = line; *c != '\0'; ++c)
            *c = static_cast<char>(tolower(static_cast<unsigned char>(*c)));
        if (strstr(line, "notificationonly") != nullptr)
            bNotificationOnly = strstr(line, "true") != nullptr ? 1 : 0;
        if (strstr(line, "actionlog") != nullptr)
            bActionLog = strstr(line, "true") != nullptr ? 1 : 0;
    }
    fclose(file);
    return 1;
}

int ProcessCfgOption(void)
{
    return processCfgFile(MoxConfigFile);
}
