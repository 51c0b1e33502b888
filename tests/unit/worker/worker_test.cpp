// The event worker against hostile or unlucky surroundings: peers that stop
// reading, files of the wrong type, control bytes from the provider, teardown
// while work is under way. (An SMTP server that never accepts and closed
// standard descriptors are proved end to end, in the hostile scenario.)
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

#include "actions/uxaction.h"
#include "base/log.h"
#include "base/text.h"
#include "daemon/events.h"
#include "daemon/startup.h"
#include "events/dmi2kob.h"
#include "sl/sl.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"

namespace {

using namespace std::chrono_literals;

std::string lines; // every line logged, one after the other

// A private directory; a blocking open, read or connect ends the run, not the suite.
struct Worker : ::testing::Test {
    void SetUp() override { signal(SIGPIPE, SIG_IGN), alarm(120), lines.clear(), moxSetLogHook(keep); }
    static void keep(int, const char* text) { lines += text; }
    void TearDown() override { alarm(0), moxSetLogHook(nullptr); EXPECT_EQ(system(("rm -rf " + dir).c_str()), 0); }
    std::string path(const char* name) const { return dir + "/" + name; }
    char pattern[21] = "/tmp/moxworkerXXXXXX";
    std::string dir = mkdtemp(pattern);
};

TEST_F(Worker, AlarmHandOffNeverBlocksAndWritesOnlyAFifo)
{
    pid_t peer = fork(); // a process named kobd that never reads
    if (peer == 0)
        _exit(execl("/bin/sleep", "kobd", "30", static_cast<char*>(nullptr)));
    std::this_thread::sleep_for(100ms);
    EventRecord record{};
    record.componentId = 7;
    enum Kind { FullPipe, Room, LinkToFile, LockIsFifo };
    struct Case { Kind kind; int result; bool errorLine; } cases[] = {
        {FullPipe, 0, true}, {Room, 28, false}, {LinkToFile, 0, false}, {LockIsFifo, 0, false}};
    std::string lock = path("kobLock"), fifo = path("kob"), file = path("precious");
    for (const Case& c : cases) {
        unlink(lock.c_str()), unlink(fifo.c_str()), lines.clear();
        std::ofstream(file) << "precious";
        c.kind == LockIsFifo ? mkfifo(lock.c_str(), 0600) : (std::ofstream(lock) << peer << "\n", 0);
        c.kind == LinkToFile ? symlink(file.c_str(), fifo.c_str()) : mkfifo(fifo.c_str(), 0600);
        int reader = open(fifo.c_str(), O_RDONLY | O_NONBLOCK);
        int filler = c.kind == FullPipe ? open(fifo.c_str(), O_WRONLY | O_NONBLOCK) : -1;
        while (filler >= 0 && write(filler, "x", 1) == 1) {}
        close(filler);
        EXPECT_EQ(kobProcessAlarmAt(KobPaths{lock.c_str(), fifo.c_str(), "/proc/%s/cmdline", 300}, &record),
                  c.result) << c.kind; // a blocking write would hang here for good
        EXPECT_EQ(lines.find("Error writing to pipe at file descriptor ") == 0, c.errorLine) << c.kind << lines;
        AlarmRecord got{};
        EXPECT_EQ(c.kind == Room && read(reader, &got, sizeof got) == 28 && got.componentId == 7, c.kind == Room);
        std::ifstream in(file);
        EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "precious") << c.kind;
        close(reader);
    }
    kill(peer, SIGKILL);
    waitpid(peer, nullptr, 0);
}

TEST_F(Worker, MarkersAndConfigurationNeverBlock)
{
    // Markers: one that exists and can be opened disables, even a FIFO. The
    // last row has no marker.
    struct Marker { const char* name; bool fifo, medium; int result; } markers[] = {
        {"vornmox.not", 1, 0, 4}, {"mox.not", 1, 0, 4}, {"fmox.not", 1, 1, 4}, {"", 0, 1, 0}};
    std::string a = path("vornmox.not"), b = path("mox.not"), f1 = path("fmox.not"), f2 = path("fvornmox.not");
    for (const Marker& m : markers) {
        unlink(a.c_str()), unlink(b.c_str()), unlink(f1.c_str());
        m.fifo ? mkfifo(path(m.name).c_str(), 0600) : (std::ofstream(path(m.name)) << "", 0);
        auto run = m.medium ? [](const char*) { return 0; } : [](const char*) { return 32; };
        MarkerCheck check{a.c_str(), b.c_str(), f1.c_str(), f2.c_str(), "mount", "umount", run, stdout};
        EXPECT_EQ(checkForMoxNot(check), m.result) << m.name;
    }

    // The configuration: only an ordinary file is read.
    std::string cfg = path("mox.cfg");
    for (int kind : {0, 1, 2}) {
        unlink(cfg.c_str());
        kind == 0   ? mkfifo(cfg.c_str(), 0600)
        : kind == 1 ? symlink("/dev/zero", cfg.c_str())
                    : (std::ofstream(cfg) << "NotificationOnly = TRUE\n", 0);
        bNotificationOnly = 0;
        EXPECT_EQ(processCfgFile(cfg.c_str()), kind / 2) << kind; // FIFO: hangs; /dev/zero: spins
        EXPECT_EQ(bNotificationOnly, kind / 2u) << kind;
    }
    bNotificationOnly = 0;
}

TEST(WorkerText, ControlBytesBecomeBlanks)
{
    std::string text = "Row\r\nmox: fake\x1b[2J\a\t\x7f\x1f ~ h\xc3\xa9 \x80\xff"; // bytes above 0x7F stay
    moxBlankControls(text.data());
    EXPECT_EQ(text, "Row  mox: fake [2J     ~ h\xc3\xa9 \x80\xff");
    moxBlankControls(nullptr);
}

// A standard event indication as the worker receives it.
SLHandle* indication()
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0, h->confirmSize);
    storeWordAt(h->command, 1, 1);
    storeWordAt(h->command, 2, 2048);
    storeWordAt(h->command, 12, 64);
    storeWordAt(h->confirm, 16, 1);        // one class
    storeWordAt(h->confirm + 68, 1, 1024); // its string at 1024
    storeWord(h->confirm + 1024, 16);
    std::memcpy(h->confirm + 1028, "EventGeneration|", 16);
    return h;
}

std::atomic<int> state{0};

TEST(WorkerTeardown, CleanupWaitsAndUnloadReturns)
{
    SLInitialize();
    SLEventSetHandler([](SLHandle*) {
        state = 1;
        std::this_thread::sleep_for(300ms);
        state = 2;
        return 0;
    });
    uint32_t raw[32] = {};
    raw[2] = sizeof raw; // the stated length; no completion routine
    SLIndicationFunc(raw);
    while (state == 0)
        std::this_thread::sleep_for(1ms);
    SLCleanup();
    EXPECT_EQ(state.load(), 2) << "cleanup returned while an event thread still ran";

    // unload while the worker waits for a confirm that never comes
    if (fork() == 0) {
        alarm(60); // a hang, not a slow machine (sanitizers under an emulator)
        state = 0;
        SLInitialize();
        SLDmiInvoke = [](void*) -> uint32_t { return 0; }; // accepted, never confirmed
        auto command = [](SLHandle*) {
            SLHandle* h = SLCreateHandle(0);
            state = 1;
            SLListComponent(h, nullptr, 1);
            SLDestroyHandle(h);
        };
        eventsSetCallees({command, command, command, command});
        CreateEventHandler();
        SLHandle* h = indication();
        EventHandler(h);
        SLDestroyHandle(h);
        while (state == 0)
            std::this_thread::sleep_for(1ms);
        std::this_thread::sleep_for(50ms);
        unload();
        _exit(eventsWorkersRunning() == 0 ? 0 : 3);
    }
    int status = -1;
    wait(&status);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "unload: status " << status;
}

} // namespace
