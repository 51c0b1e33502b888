#include "daemon/startup.h"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <pthread.h>
#include <syslog.h>
#include <unistd.h>

#include "actions/actionlog.h"
#include "actions/uxaction.h"
#include "base/files.h"
#include "base/log.h"
#include "daemon/daemon.h"
#include "daemon/events.h"
#include "daemon/notify.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "mif/mif.h"
#include "sl/sl.h"

namespace {

// Each marker-check message goes to standard output, then to the system log.
void tell(const MarkerCheck& check, const char* text, const char* logText = nullptr)
{
    fputs(text, check.out);
    fflush(check.out);
    moxLog(LOG_ERR, "%s", logText != nullptr ? logText : text);
}

} // namespace

MarkerCheck defaultMarkerCheck()
{
    return MarkerCheck{"./vornmox.not",
                       "./mox.not",
                       "/mnt/floppy/mox.not",
                       "/mnt/floppy/vornmox.not",
                       "mount -t msdos /dev/fd0 /mnt/floppy 2>/dev/null",
                       "umount /mnt/floppy 2>/dev/null",
                       system,
                       stdout};
}

const char* localMarker(const MarkerCheck& check)
{
    // In the working directory vornmox.not comes first; on the floppy mox.not.
    for (const char* marker : {check.localVornmox, check.localMox}) {
        if (moxCanOpen(marker))
            return marker;
    }
    return nullptr;
}

int checkForMoxNot(const MarkerCheck& check)
{
    if (localMarker(check) != nullptr)
        return 4;
    tell(check, "Checking for mox configurations ..\n", "\nChecking for mox configurations ..\n");
    if (check.run(check.mountCommand) != 0) {
        tell(check, "There is no floppy found in floppy drive\n");
        tell(check, "Proceeding with loading mox ..\n");
        return 0;
    }
    if (moxCanOpen(check.floppyMox)) {
        check.run(check.umountCommand);
        tell(check, "file mox.not  found in floppy\n");
        return 4;
    }
    if (moxCanOpen(check.floppyVornmox)) {
        check.run(check.umountCommand);
        tell(check, "file vornmox.not found in floppy\n");
        return 4;
    }
    tell(check, "Couldn't find any mox configuration files in floppy drive\n");
    tell(check, "Proceeding with loading mox ..\n");
    check.run(check.umountCommand);
    return 0;
}

int check_for_moxnot(void)
{
    moxNotify("STATUS=Checking marker files");
    return checkForMoxNot(defaultMarkerCheck());
}

void findBaseboardGroups()
{
    SysCtrlInitialize();
    LcdInitialize();
}

RegistrationCalls daemonRegistrationCalls()
{
    return RegistrationCalls{EventHandler, findBaseboardGroups};
}

int init_routine(void)
{
    MoxOsSpecificInit();
    ProcessCfgOption();
    SLInitialize();
    RegisterWithSLCalls(daemonRegistrationCalls());
    moxNotify("STATUS=Registering with the DMI service provider");
    int rc = RegisterWithSL();
    if (rc == 0) {
        actionLogStartupCheck();
        if (CreateEventHandler() == 0) {
            moxNotify("STATUS=Handling events");
            moxNotify("READY=1");
        }
    }
    return rc;
}

int unload(void)
{
    // The worker may be waiting for a confirm that will not come; it must
    // leave that wait before it can be told to stop.
    SLAbandonCommands();
    DestroyEventHandler();
    return SLCleanup();
}

void* mainThread(void*)
{
    char message[124];
    memset(message, 0, sizeof message);
    pthread_t signalThread;
    bool signalThreadRuns = daemon_startSignalHandling(nullptr, nullptr, &signalThread) == 0;
    if (!signalThreadRuns)
        moxLog(LOG_INFO, "MOX Could  not install signalhandler \n");

    int rc = init_routine();
    if (rc != 0) {
        snprintf(message, sizeof message, "mox: initialization failed, return code = 0x%x", rc);
        moxLog(LOG_ERR, "%s\n", message);
        printf("MOX ERROR, %s\n", message);
        fflush(stdout);
        exit(1);
    }
    if (signalThreadRuns) {
        pthread_join(signalThread, nullptr);
    } else {
        // No signal thread: wait for the termination signals on this thread.
        sigset_t wait;
        if (daemon_defaultWaitSet(&wait) == 0)
            pthread_sigmask(SIG_SETMASK, &wait, nullptr);
        signalHandlerThread(daemon_signalParam());
    }
    return nullptr;
}

int openStandardDescriptors()
{
    int opened = 0;
    for (int fd = 0; fd <= 2; ++fd) {
        if (fcntl(fd, F_GETFD) != -1 || errno != EBADF)
            continue;
        int null = open("/dev/null", O_RDWR);
        if (null < 0)
            return -1;
        // The lower descriptors are open, so the new one is normally fd.
        if (null != fd) {
            dup2(null, fd);
            close(null);
        }
        ++opened;
    }
    return opened;
}

void moxMain()
{
    // Before anything can open a descriptor: a closed standard descriptor
    // would otherwise be taken by the log socket or a file, and start-up text
    // and the bell would go there.
    openStandardDescriptors();
    // Lines reach a supervisor that captures standard output as they are written.
    setvbuf(stdout, nullptr, _IOLBF, 0);
    // Signals sent to the process must reach only the signal thread's sigwait:
    // block them here too, or the kernel delivers them to this thread. Blocked
    // before the marker check, so that a stop requested while the floppy is
    // probed waits for the signal thread instead of killing the process (the
    // floppy commands inherit the blocked set, as system() passes it on).
    sigset_t wait;
    if (daemon_defaultWaitSet(&wait) == 0)
        pthread_sigmask(SIG_SETMASK, &wait, nullptr);
    if (check_for_moxnot() == 4) {
        printf("Mox has been disabled.\n");
        moxLog(LOG_ERR, "%s", "Mox has been disabled.\n");
        exit(0);
    }

    pthread_t thread;
    int error = pthread_create(&thread, nullptr, mainThread, nullptr);
    if (error != 0) {
        moxLog(LOG_ERR, "mox: cannot start the main thread: %s\n", strerror(error));
        exit(1);
    }
    sleep(10);
    pthread_join(thread, nullptr);
    exit(0);
}
