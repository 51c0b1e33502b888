#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstring>
#include <fstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "base/log.h"
#include "daemon/daemon.h"
#include "daemon/events.h"
#include "daemon/startup.h"
#include "sl/sl.h"
#include "sl/slhandle.h"

namespace {

// An indication as the SL event thread hands it over: header words in the
// command block, the indication in the confirm buffer. Every byte not written
// is 0x5A, so nothing past a string's end reads as a terminator.
SLHandle* indication(uint32_t type, const std::vector<std::string>& classes, uint32_t tag = 0)
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0x5A, h->confirmSize);
    storeWordAt(h->command, 0, SL_LEVEL_CHECK);
    storeWordAt(h->command, 1, type);
    storeWordAt(h->command, 2, 4096); // the indication's length
    storeWordAt(h->command, 3, tag);
    storeWordAt(h->command, 12, 64);
    uint8_t* data = h->confirm + 64;
    storeWord(data, static_cast<uint32_t>(classes.size()));
    uint32_t text = 1024;
    for (size_t c = 0; c < classes.size(); ++c) {
        storeWordAt(data + 4 + 16 * c, 0, 5);
        storeWordAt(data + 4 + 16 * c, 1, text);
        storeWordAt(data + 4 + 16 * c, 2, 0);
        storeWord(h->confirm + text, static_cast<uint32_t>(classes[c].size()));
        std::memcpy(h->confirm + text + 4, classes[c].data(), classes[c].size());
        text += 4 + static_cast<uint32_t>(classes[c].size());
    }
    return h;
}

std::string seen;

class Events : public ::testing::Test {
protected:
    void SetUp() override
    {
        SLInitialize();
        seen.clear();
        saved_ = eventsSetCallees({[](SLHandle* h) { seen += "standard" + std::to_string(tagOf(h)) + " "; },
                                   [](SLHandle* h) { seen += "vendor" + std::to_string(tagOf(h)) + " "; },
                                   [](SLHandle*) { seen += "unknown "; }, [](SLHandle*) { seen += "installed "; }});
    }
    void TearDown() override
    {
        eventsSetCallees(saved_);
        SLCleanup();
    }
    static uint32_t tagOf(SLHandle* h) { return loadWordAt(h->command, 3); }
    EventCallees saved_{};
};

TEST_F(Events, ClassStringChoosesTheMatcher)
{
    struct Row {
        uint32_t type;
        std::vector<std::string> classes;
        uint32_t length; // the indication's stated length
        const char* expected;
    } rows[] = {
        {1, {"zorek|error|Baseboard|001"}, 4096, "vendor0 "},
        {1, {"Zorek|Error"}, 4096, "vendor0 "},
        {1, {"Zorek|ErroX|Baseboard"}, 4096, "unknown "}, // all 11 characters count
        {1, {"EVENTGENERATION|Temperature|001"}, 4096, "standard0 "},
        {1, {"EventGeneration|"}, 4096, "standard0 "},
        {1, {"EventGenerationX|Temperature"}, 4096, "unknown "}, // the bar counts
        {1, {"DMTF|Something|001", "EventGeneration|x"}, 4096, "unknown "},
        {1, {}, 4096, ""},
        {2, {}, 4096, "installed "},
        {3, {}, 4096, ""},
        {7, {}, 4096, ""},
        // A class string cut by the indication's end: what lies beyond is not read.
        {1, {"Zorek|Error|x"}, 1024 + 4 + 3, "unknown "},
        {1, {"EventGeneration|x"}, 1024 + 4 + 9, "unknown "},
    };
    for (const Row& row : rows) {
        seen.clear();
        SLHandle* h = indication(row.type, row.classes);
        storeWordAt(h->command, 2, row.length);
        if (row.length < 4096) // the string's length word stays inside, its bytes go on
            storeWord(h->confirm + 1024, row.length - 1024 - 4);
        processEvent(h);
        SLDestroyHandle(h);
        EXPECT_EQ(seen, row.expected) << row.type << " " << (row.classes.empty() ? "" : row.classes[0]);
    }
}

bool waitForEvents(unsigned count)
{
    for (int i = 0; i < 2000 && EventsHandled() < count; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    return EventsHandled() == count;
}

TEST_F(Events, QueueCountsKeepsOrderAndStops)
{
    unsigned before = EventsHandled();
    SLHandle* h = indication(1, {"EventGeneration|"});
    EventHandler(h); // no worker yet: dropped
    EXPECT_EQ(eventsQueued(), 0u);
    // A worker stopped before its first step is still waited for.
    ASSERT_EQ(CreateEventHandler(), 0);
    KillEventThread();
    EXPECT_EQ(eventsWorkersRunning(), 0);
    ASSERT_EQ(CreateEventHandler(), 0);
    for (uint32_t i = 0; i < 6; ++i) {
        storeWordAt(h->command, 1, i < 4 ? 1 : i == 4 ? 2 : 7);
        storeWordAt(h->command, 3, i);
        std::memcpy(h->confirm + 1028, i % 2 ? "Zorek|Error|abcd" : "EventGeneration|", 16);
        EventHandler(h);
    }
    ASSERT_TRUE(waitForEvents(before + 6)) << "every type is counted";
    EXPECT_EQ(seen, "standard0 vendor1 standard2 vendor3 installed ");
    KillEventThread();
    EventHandler(h);
    EXPECT_EQ(eventsQueued(), 0u);
    DestroyEventHandler();
    EXPECT_EQ(EventsHandled(), before + 6);
    SLDestroyHandle(h);
}

std::vector<std::string> commands;
std::string logText;

TEST(Startup, MarkerCheckOrderAndTexts)
{
    const std::string mount = "mount", umount = "umount";
    const std::string checking = "Checking for mox configurations ..\n", go = "Proceeding with loading mox ..\n";
    struct Row {
        const char* name;
        std::vector<std::string> local, floppy; // marker files; floppy "-": none in the drive
        int result;
        std::string out;
        std::vector<std::string> ran;
    } rows[] = {
        {"local mox.not", {"mox.not"}, {"-"}, 4, "", {}},
        {"local vornmox.not", {"vornmox.not"}, {"mox.not"}, 4, "", {}},
        {"no floppy", {}, {"-"}, 0, checking + "There is no floppy found in floppy drive\n" + go, {mount}},
        {"floppy with both", {}, {"mox.not", "vornmox.not"}, 4, checking + "file mox.not  found in floppy\n",
         {mount, umount}},
        {"floppy with vornmox.not", {}, {"vornmox.not"}, 4, checking + "file vornmox.not found in floppy\n",
         {mount, umount}},
        {"empty floppy", {}, {}, 0,
         checking + "Couldn't find any mox configuration files in floppy drive\n" + go, {mount, umount}},
    };
    moxSetLogHook([](int priority, const char* text) { logText += (priority == LOG_ERR ? "" : "!") + std::string(text); });
    for (const Row& row : rows) {
        char pattern[] = "/tmp/moxmarkXXXXXX";
        std::string dir = mkdtemp(pattern);
        mkdir((dir + "/floppy").c_str(), 0755);
        for (const auto& f : row.local)
            std::ofstream(dir + "/" + f) << "";
        for (const auto& f : row.floppy)
            std::ofstream(dir + "/floppy/" + f) << "";
        std::string vorn = dir + "/vornmox.not", mox = dir + "/mox.not";
        std::string fmox = dir + "/floppy/mox.not", fvorn = dir + "/floppy/vornmox.not";
        char* buffer = nullptr;
        size_t size = 0;
        FILE* out = open_memstream(&buffer, &size);
        static bool inDrive;
        inDrive = row.floppy.empty() || row.floppy[0] != "-";
        MarkerCheck check{vorn.c_str(), mox.c_str(), fmox.c_str(), fvorn.c_str(), mount.c_str(), umount.c_str(),
                          [](const char* command) {
                              commands.emplace_back(command);
                              return std::string(command) == "mount" && !inDrive ? 32 : 0;
                          },
                          out};
        commands.clear();
        logText.clear();
        EXPECT_EQ(checkForMoxNot(check), row.result) << row.name;
        fclose(out);
        EXPECT_EQ(std::string(buffer, size), row.out) << row.name;
        EXPECT_EQ(commands, row.ran) << row.name;
        // Every line also at LOG_ERR, the first with a leading line feed.
        EXPECT_EQ(logText, row.out.empty() ? "" : "\n" + row.out) << row.name;
        free(buffer);
    }
    moxSetLogHook(nullptr);
}

TEST(Startup, DefaultSignalSets)
{
    // In a child: the signal thread's default sets, as membership strings.
    const int signals[] = {SIGTERM, SIGINT, SIGQUIT, SIGPWR, SIGHUP, SIGCHLD, SIGPIPE, SIGALRM, SIGIO, SIGUSR1, SIGUSR2};
    int ends[2];
    ASSERT_EQ(pipe(ends), 0);
    pid_t child = fork();
    if (child == 0) {
        pthread_t thread;
        if (daemon_startSignalHandling(nullptr, nullptr, &thread) != 0)
            _exit(1);
        auto* sets = static_cast<const sigset_t*>(daemon_signalParam()); // wait, then term
        std::string text;
        for (int s : signals)
            text += std::to_string(sigismember(&sets[0], s)) + std::to_string(sigismember(&sets[1], s)) + " ";
        _exit(write(ends[1], text.data(), text.size()) == static_cast<ssize_t>(text.size()) ? 0 : 1);
    }
    close(ends[1]);
    char text[128] = {};
    EXPECT_GT(read(ends[0], text, sizeof text - 1), 0);
    close(ends[0]);
    int status = 0;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0);
    // Wait set: all but ALRM, IO, USR1, USR2. Stop set: TERM, INT, QUIT, PWR.
    EXPECT_STREQ(text, "11 11 11 11 10 10 10 00 00 00 00 ");
}

} // namespace
