// The event worker against hostile or unlucky surroundings: peers that stop
// reading, files of the wrong type, control bytes from the provider, SMTP
// servers that never accept, teardown while work is under way, and closed
// standard descriptors.
#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <mutex>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "actions/uxaction.h"
#include "base/log.h"
#include "base/text.h"
#include "daemon/events.h"
#include "daemon/startup.h"
#include "events/dmi2kob.h"
#include "sl/sl.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "smtp/smtp.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

std::mutex linesLock;
std::string lines; // every line logged, one after the other
void keepLine(int, const char* text)
{
    std::lock_guard<std::mutex> guard(linesLock);
    lines += text;
}

class Worker : public ::testing::Test {
protected:
    void SetUp() override
    {
        signal(SIGPIPE, SIG_IGN);
        alarm(120); // a blocking open, read or connect ends the run, not the suite
        char pattern[] = "/tmp/moxworkerXXXXXX";
        dir_ = mkdtemp(pattern);
        lines.clear();
        moxSetLogHook(keepLine);
    }
    void TearDown() override
    {
        alarm(0);
        moxSetLogHook(nullptr);
        EXPECT_EQ(system(("rm -rf " + dir_).c_str()), 0);
    }
    std::string path(const char* name) const { return dir_ + "/" + name; }
    std::string dir_;
};

TEST_F(Worker, AlarmHandOffNeverBlocksAndWritesOnlyAFifo)
{
    pid_t peer = fork(); // a process named kobd that never reads
    if (peer == 0) {
        execl("/bin/sleep", "kobd", "30", static_cast<char*>(nullptr));
        _exit(1);
    }
    std::this_thread::sleep_for(100ms);
    EventRecord record{};
    record.componentId = 7;
    enum Kind { FullPipe, Room, LinkToFile, PlainFile, LockIsFifo };
    const char* const kept = "precious bytes that must stay";
    struct Case { const char* what; Kind kind; int result; bool errorLine; } cases[] = {
        {"pipe full", FullPipe, 0, true}, {"pipe with room", Room, 28, false},
        {"symlink to an ordinary file", LinkToFile, 0, false}, {"ordinary file", PlainFile, 0, false},
        {"lock file is a FIFO", LockIsFifo, 0, false}};
    for (const Case& c : cases) {
        std::string lock = path("kobLock"), fifo = path("kob"), file = path("precious");
        unlink(lock.c_str());
        unlink(fifo.c_str());
        lines.clear();
        std::ofstream(c.kind == PlainFile ? fifo : file) << kept;
        if (c.kind != LockIsFifo)
            std::ofstream(lock) << peer << "\n";
        if (c.kind == LockIsFifo)
            mkfifo(lock.c_str(), 0600);
        else if (c.kind == LinkToFile)
            ASSERT_EQ(symlink(file.c_str(), fifo.c_str()), 0);
        else if (c.kind != PlainFile)
            mkfifo(fifo.c_str(), 0600);
        int reader = open(fifo.c_str(), O_RDONLY | O_NONBLOCK);
        int filler = c.kind == FullPipe ? open(fifo.c_str(), O_WRONLY | O_NONBLOCK) : -1;
        while (filler >= 0 && write(filler, "x", 1) == 1) {
        }
        close(filler);
        auto start = Clock::now();
        EXPECT_EQ(kobProcessAlarmAt(KobPaths{lock.c_str(), fifo.c_str(), "/proc/%s/cmdline", 300}, &record),
                  c.result) << c.what;
        EXPECT_LT(Clock::now() - start, 2s) << c.what;
        EXPECT_EQ(lines.find("Error writing to pipe at file descriptor ") == 0, c.errorLine) << c.what << lines;
        AlarmRecord got{};
        EXPECT_EQ(c.kind == Room && read(reader, &got, sizeof got) == 28 && got.componentId == 7, c.kind == Room);
        std::ifstream in(c.kind == PlainFile ? fifo : file);
        EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), kept) << c.what;
        struct stat st;
        EXPECT_EQ(stat(lock.c_str(), &st), 0) << c.what << ": the lock is left alone";
        close(reader);
    }
    kill(peer, SIGKILL);
    waitpid(peer, nullptr, 0);
}

int mountOk(const char*) { return 0; }
int noMedium(const char*) { return 32; }

TEST_F(Worker, MarkersAndConfigurationNeverBlock)
{
    // Markers: one that exists and can be opened disables, whatever it is.
    struct Marker { const char* what; const char* name; bool fifo; int (*run)(const char*); int result; } markers[] = {
        {"local vornmox.not a FIFO", "vornmox.not", true, noMedium, 4},
        {"local mox.not a FIFO", "mox.not", true, noMedium, 4},
        {"local mox.not a file", "mox.not", false, noMedium, 4},
        {"floppy mox.not a FIFO", "fmox.not", true, mountOk, 4},
        {"floppy vornmox.not a FIFO", "fvornmox.not", true, mountOk, 4},
        {"no marker, no medium", nullptr, false, noMedium, 0},
        {"no marker on the medium", nullptr, false, mountOk, 0}};
    FILE* out = fopen("/dev/null", "w");
    std::string a = path("vornmox.not"), b = path("mox.not"), f1 = path("fmox.not"), f2 = path("fvornmox.not");
    for (const Marker& m : markers) {
        for (const std::string& p : {a, b, f1, f2})
            unlink(p.c_str());
        if (m.name != nullptr && m.fifo)
            mkfifo(path(m.name).c_str(), 0600);
        else if (m.name != nullptr)
            std::ofstream(path(m.name)) << "";
        MarkerCheck check{a.c_str(), b.c_str(), f1.c_str(), f2.c_str(), "mount", "umount", m.run, out};
        EXPECT_EQ(checkForMoxNot(check), m.result) << m.what;
    }
    fclose(out);

    // The configuration: only an ordinary file is read.
    struct Config { const char* what; int kind; int result; } configs[] = {
        {"FIFO", 0, 0}, {"link to /dev/zero", 1, 0}, {"directory", 2, 0}, {"ordinary file", 3, 1}};
    std::string cfg = path("mox.cfg");
    for (const Config& c : configs) {
        ASSERT_EQ(system(("rm -rf " + cfg).c_str()), 0);
        if (c.kind == 0)
            mkfifo(cfg.c_str(), 0600);
        else if (c.kind == 1)
            ASSERT_EQ(symlink("/dev/zero", cfg.c_str()), 0);
        else if (c.kind == 2)
            mkdir(cfg.c_str(), 0700);
        else
            std::ofstream(cfg) << "# comment\nNotificationOnly = TRUE\n";
        bNotificationOnly = 0;
        auto start = Clock::now();
        EXPECT_EQ(processCfgFile(cfg.c_str()), c.result) << c.what;
        EXPECT_LT(Clock::now() - start, 2s) << c.what;
        EXPECT_EQ(bNotificationOnly, static_cast<uint32_t>(c.result)) << c.what;
    }
    bNotificationOnly = 0;
}

TEST(WorkerText, ControlBytesBecomeBlanks)
{
    struct Case { const char* in; const char* out; } cases[] = {
        {"Row 1\r\nmox: fake line", "Row 1  mox: fake line"}, {"\x1b[2J\a\tbell", " [2J  bell"},
        {"del\x7f end", "del  end"}, {"\x1f\x20\x7e", "  ~"},
        {"h\xc3\xa9llo \x80\xff", "h\xc3\xa9llo \x80\xff"}, // bytes above 0x7F stay
        {"", ""}};
    for (const Case& c : cases) {
        std::string text = c.in;
        moxBlankControls(text.data());
        EXPECT_EQ(text, c.out);
    }
    moxBlankControls(nullptr);
}

TEST_F(Worker, SmtpConnectIsBounded)
{
    // A loopback listener with a backlog of 0, its accept queue filled: the
    // kernel drops further handshakes, so a connect would wait for minutes.
    // Beside it a port nobody listens on: refused at once, with its own error.
    int listener = socket(AF_INET, SOCK_STREAM, 0), closed = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in full{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}}, refused = full;
    socklen_t length = sizeof full;
    ASSERT_TRUE(bind(listener, reinterpret_cast<sockaddr*>(&full), length) == 0 && listen(listener, 0) == 0 &&
                bind(closed, reinterpret_cast<sockaddr*>(&refused), length) == 0);
    getsockname(listener, reinterpret_cast<sockaddr*>(&full), &length);
    getsockname(closed, reinterpret_cast<sockaddr*>(&refused), &length);
    std::vector<int> fillers{listener, closed};
    for (int i = 0; i < 4; ++i)
        fillers.push_back(socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK, 0)),
            connect(fillers.back(), reinterpret_cast<sockaddr*>(&full), sizeof full);
    std::this_thread::sleep_for(200ms);
    struct Case { const char* what; uint16_t port; const char* line; } cases[] = {
        {"accept queue full", ntohs(full.sin_port),
         "Error Value=110,Reason:Mox email alert was not sent Unable to connect to SMTP server[127.0.0.1] The last "
         "command returned the following values:3, 110"},
        {"nobody listens", ntohs(refused.sin_port), "Error Value=111,"}};
    smtpSetLimitMs(600);
    for (const Case& c : cases) {
        lines.clear();
        smtpSetPort(c.port);
        char server[] = "127.0.0.1", sender[] = "a@b", to[] = "c@d", subject[] = "s", body[] = "b\n";
        EmailConfig config{server, sender, to, subject, body};
        auto start = Clock::now();
        EXPECT_EQ(_MoxSendEmail(&config), 0) << c.what;
        EXPECT_LT(Clock::now() - start, 3s) << c.what;
        EXPECT_NE(lines.find(c.line), std::string::npos) << c.what << ": " << lines;
    }
    smtpSetLimitMs(8000);
    smtpSetPort(25);
    for (int fd : fillers)
        close(fd);
}

TEST(WorkerStart, ClosedStandardDescriptorsGetDevNull)
{
    struct stat null;
    ASSERT_EQ(stat("/dev/null", &null), 0);
    for (const std::vector<int>& closedFds : std::vector<std::vector<int>>{{}, {0}, {1, 2}, {0, 1, 2}, {2}}) {
        pid_t child = fork();
        if (child == 0) {
            for (int fd : closedFds)
                close(fd);
            int bad = openStandardDescriptors() == static_cast<int>(closedFds.size()) ? 0 : 1;
            struct stat st;
            for (int fd : closedFds)
                bad |= fstat(fd, &st) != 0 || st.st_rdev != null.st_rdev || !S_ISCHR(st.st_mode) ? 2 : 0;
            _exit(bad);
        }
        int status = -1;
        waitpid(child, &status, 0);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << closedFds.size() << " closed: " << status;
    }
}

// An indication handle as the worker receives it, with one class string whose
// count word says `count` however many characters follow.
SLHandle* indication(const std::string& text, uint32_t count)
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0, h->confirmSize);
    storeWordAt(h->command, 1, 1);
    storeWordAt(h->command, 2, 2048);
    storeWordAt(h->command, 12, 64);
    storeWordAt(h->confirm, 16, 1);        // one class
    storeWordAt(h->confirm + 68, 1, 1024); // its string at 1024
    storeWord(h->confirm + 1024, count);
    std::memcpy(h->confirm + 1028, text.data(), text.size());
    return h;
}

std::string chosen;

TEST(WorkerClass, ClassTestIgnoresTheStringsCountWord)
{
    SLInitialize();
    EventCallees saved = eventsSetCallees({[](SLHandle*) { chosen = "standard"; },
                                           [](SLHandle*) { chosen = "vendor"; },
                                           [](SLHandle*) { chosen = "unknown"; }, [](SLHandle*) {}});
    struct Case { const char* text; uint32_t count; const char* expected; } cases[] = {
        {"Zorek|Error|x", 100000, "vendor"}, {"Zorek|Error|x", 0xFFFFFFFFu, "vendor"},
        {"EventGeneration|Temp", 100000, "standard"}, {"Zorek|Error|x", 13, "vendor"},
        {"Zorek|Err", 3, "unknown"}};
    for (const Case& c : cases) {
        chosen = "dropped";
        SLHandle* h = indication(c.text, c.count);
        processEvent(h);
        SLDestroyHandle(h);
        EXPECT_EQ(chosen, c.expected) << c.text << " count " << c.count;
    }
    eventsSetCallees(saved);
    SLCleanup();
}

std::atomic<int> state{0};

TEST(WorkerTeardown, CleanupWaitsForEventThreads)
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
}

TEST(WorkerTeardown, UnloadReturnsWhileTheWorkerWaitsForAConfirm)
{
    pid_t child = fork();
    if (child == 0) {
        alarm(15);
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
        SLHandle* h = indication("EventGeneration|", 16);
        EventHandler(h);
        SLDestroyHandle(h);
        while (state == 0)
            std::this_thread::sleep_for(1ms);
        std::this_thread::sleep_for(50ms);
        unload();
        _exit(eventsWorkersRunning() == 0 ? 0 : 3);
    }
    int status = -1;
    waitpid(child, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
}

} // namespace
