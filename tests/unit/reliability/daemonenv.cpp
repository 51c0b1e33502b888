#include "daemonenv.h"

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <thread>

#include "base/log.h"
#include "base/sleep.h"
#include "daemon/events.h"
#include "mif/mif.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "sl/sl.h"
#include "testmifs.h"

std::atomic<unsigned> RegisteredDaemon::logLines{0};
std::atomic<unsigned> RegisteredDaemon::otherLines{0};

namespace {

// Keys 1-6 (MIF id, group, type, instance, 0, severity), actions 7 to 22
// (17 the alert name), enabled, system, subsystem: the log action (9) only.
std::string logOnlyRow()
{
    std::string row = "{ 1, 20, 4, 0, 0, 0";
    for (int id = 7; id <= 22; ++id)
        row += id == 17 ? ", \"\"" : id == 9 ? ", 1" : ", 0";
    return row + ", 1, 1, 2 }\n";
}

void countLine(int, const char* text)
{
    if (std::strncmp(text, "TYPE:", 5) == 0)
        ++RegisteredDaemon::logLines;
    else
        ++RegisteredDaemon::otherLines;
}

} // namespace

bool RegisteredDaemon::start(std::string* error, bool withWorker)
{
    running = true;
    char pattern[] = "/tmp/moxreliabilityXXXXXX";
    if (mkdtemp(pattern) == nullptr) {
        *error = "mkdtemp";
        return false;
    }
    dir = pattern;
    if (dmisp::reset(dir + "/db", false, error) != 0)
        return false;
    if (dmisp::installText(ownMif(logOnlyRow(), ""), "own.mif", error) == 0)
        return false;
    board = dmisp::installText(boardMif("Test Board"), "board.mif", error);
    if (board == 0)
        return false;
    setenv("UXDMIPATH", dir.c_str(), 1);
    moxSetLogHook(countLine);
    SLInitialize();
    RegisterWithSLCalls(RegistrationCalls{EventHandler, [] { SysCtrlInitialize(); LcdInitialize(); }});
    if (int rc = RegisterWithSL(); rc != 0) {
        *error = "RegisterWithSL " + std::to_string(rc);
        return false;
    }
    if (withWorker && CreateEventHandler() != 0) {
        *error = "CreateEventHandler";
        return false;
    }
    // The installs above announce themselves too.
    if (!dmisp::waitIndicationsCompleted(20000)) {
        *error = "install indications not completed";
        return false;
    }
    logLines = 0;
    otherLines = 0;
    return true;
}

void RegisteredDaemon::stop()
{
    if (!running)
        return;
    DestroyEventHandler();
    UnregisterWithSL();
    abandon();
}

void RegisteredDaemon::abandon()
{
    running = false;
    SLCleanup();
    // SLCleanup freed the catalogue and the registration handle with every
    // other SL block; forget them so that nothing frees them again.
    componentList = nullptr;
    myHandle = nullptr;
    registered = 0;
    dmisp::shutdown();
    moxSetLogHook(nullptr);
    moxSetSleepHook(nullptr);
    if (!dir.empty())
        std::system(("rm -rf '" + dir + "'").c_str());
}

uint32_t RegisteredDaemon::raiseVoltage()
{
    return dmisp::raiseEvent(board, {20, {"8"}});
}

bool RegisteredDaemon::drain(unsigned handled, unsigned timeoutMs)
{
    auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    if (!dmisp::waitIndicationsCompleted(timeoutMs))
        return false;
    while (EventsHandled() < handled || eventsQueued() != 0) {
        if (std::chrono::steady_clock::now() > until)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}
