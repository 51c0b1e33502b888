#include "events/dmi2kob.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <syslog.h>
#include <sys/stat.h>
#include <unistd.h>

#include "base/files.h"
#include "base/log.h"

namespace {

// The lock file's first word, when it is a decimal process id.
bool readPid(const char* lockFile, char (&pid)[20], bool& present)
{
    // Only a regular lock file is read; anything else in its place (a FIFO
    // would block the worker) is left alone, like a lock that cannot be opened.
    FILE* lock = moxOpenRegular(lockFile);
    present = lock != nullptr;
    if (lock == nullptr)
        return false;
    int got = fscanf(lock, "%19s", pid);
    fclose(lock);
    if (got != 1 || pid[0] == '\0')
        return false;
    for (const char* c = pid; *c != '\0'; ++c) {
        if (*c < '0' || *c > '9')
            return false;
    }
    return true;
}

// Opens the FIFO for writing once its reader has it open, waiting at most
// `waitMs`: a peer that holds the lock but never reads must not stall the
// event worker. The descriptor stays non-blocking, so that a full pipe fails
// the write instead of holding the worker. Anything but a FIFO (an ordinary
// file behind a link, a device) is closed unwritten. -1 (errno set) when no
// reader came or the path is no FIFO.
int openFifo(const char* fifo, unsigned waitMs)
{
    // Not even opened when it is no FIFO now (opening some devices acts);
    // checked again on the descriptor, in case the path changed in between.
    struct stat before;
    if (stat(fifo, &before) == 0 && !S_ISFIFO(before.st_mode)) {
        errno = EINVAL;
        return -1;
    }
    const unsigned stepMs = 20;
    for (unsigned waited = 0;; waited += stepMs) {
        int fd = open(fifo, O_WRONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
        if (fd >= 0) {
            struct stat status;
            if (fstat(fd, &status) != 0 || !S_ISFIFO(status.st_mode)) {
                close(fd);
                errno = EINVAL;
                return -1;
            }
            return fd;
        }
        if (errno != ENXIO || waited >= waitMs)
            return -1;
        timespec step{0, static_cast<long>(stepMs) * 1000000L};
        nanosleep(&step, nullptr);
    }
}

} // namespace

KobPaths defaultKobPaths()
{
    return KobPaths{"/var/run/kobLock", "/dev/kob", "/proc/%s/cmdline", 2000};
}

uint32_t getRowName(EventRecord* record)
{
    if (record->groupId == 0 || record->keyList == nullptr || record->keyList->count == 0 ||
        record->keyList->keys[0].value == nullptr)
        return 0;
    return loadWord(record->keyList->keys[0].value);
}

AlarmRecord makeAlarmRecord(EventRecord* record)
{
    AlarmRecord alarm;
    std::memset(&alarm, 0, sizeof alarm);
    alarm.recordType = 1;
    alarm.componentId = record->componentId;
    alarm.groupId = record->groupId;
    alarm.eventGroupId = record->eventGroupId;
    alarm.severity = record->severity;
    alarm.instance = getRowName(record);
    const char* group = record->groupName;
    alarm.powerFlag = group != nullptr && (strstr(group, "Voltage") != nullptr || strstr(group, "Power") != nullptr);
    return alarm;
}

KobPeer kobPeerAt(const KobPaths& paths, char (&pid)[20])
{
    bool present = false;
    if (!readPid(paths.lockFile, pid, present))
        return present ? KobPeer::Stale : KobPeer::None; // a lock naming no process id is stale
    char cmdlinePath[64];
    snprintf(cmdlinePath, sizeof cmdlinePath, paths.cmdline, pid);
    FILE* cmdline = fopen(cmdlinePath, "r");
    if (cmdline == nullptr)
        return KobPeer::Gone;
    // The arguments are separated by NULs, so the comparison ends with the
    // program name as it was started.
    char name[32] = {};
    if (fscanf(cmdline, "%31s", name) != 1)
        name[0] = '\0';
    fclose(cmdline);
    return strcmp(name, "kobd") == 0 ? KobPeer::Running : KobPeer::Stale;
}

int kobProcessAlarmAt(const KobPaths& paths, EventRecord* record)
{
    char pid[20] = {};
    KobPeer peer = kobPeerAt(paths, pid);
    if (peer == KobPeer::Stale) {
        unlink(paths.lockFile);
        unlink(paths.fifo);
    }
    if (peer != KobPeer::Running)
        return 0;

    AlarmRecord alarm = makeAlarmRecord(record);
    int fd = openFifo(paths.fifo, paths.openWaitMs);
    if (fd < 0) {
        perror("Error opening /dev/kob");
        return 0;
    }
    // The record is below PIPE_BUF: it goes in whole or, with the pipe full,
    // not at all (EAGAIN).
    ssize_t written = write(fd, &alarm, sizeof alarm);
    if (written != static_cast<ssize_t>(sizeof alarm)) {
        moxLog(LOG_INFO, "Error writing to pipe at file descriptor %i\n", fd);
        close(fd);
        return 0;
    }
    close(fd);
    return static_cast<int>(written);
}

int KOBProcessAlarm(EventRecord* record)
{
    return kobProcessAlarmAt(defaultKobPaths(), record);
}
