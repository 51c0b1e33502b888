#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstring>
#include <fstream>
#include <sys/stat.h>
#include <syslog.h>
#include <thread>
#include <unistd.h>

#include "base/log.h"
#include "daemon/daemon.h"
#include "daemon/events.h"
#include "daemon/startup.h"
#include "sl/sl.h"
#include "sl/slhandle.h"

namespace {

// An indication as the SL event thread hands it over: header words in the
// command block, the indication in the confirm buffer, with one class string
// (none when empty) at offset 1024. Every byte not written is 0x5A, so nothing
// past the string's end reads as a terminator.
SLHandle* indication(uint32_t type, const std::string& cls)
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0x5A, h->confirmSize);
    const uint32_t header[13] = {SL_LEVEL_CHECK, type, 4096, 0, 0, 0, 0, 0, 0, 0, 0, 0, 64};
    for (uint32_t i = 0; i < 13; ++i)
        storeWordAt(h->command, i, header[i]);
    const uint32_t classes[4] = {cls.empty() ? 0u : 1u, 5, 1024, 0}; // count; component, string, rows
    for (uint32_t i = 0; i < 4; ++i)
        storeWordAt(h->confirm + 64, i, classes[i]);
    storeWord(h->confirm + 1024, static_cast<uint32_t>(cls.size()));
    std::memcpy(h->confirm + 1028, cls.data(), cls.size());
    return h;
}

std::string seen;
std::string tagOf(SLHandle* h) { return std::to_string(loadWordAt(h->command, 3)) + " "; }

class Events : public ::testing::Test {
protected:
    void SetUp() override
    {
        SLInitialize();
        saved_ = eventsSetCallees({[](SLHandle* h) { seen += "standard" + tagOf(h); },
                                   [](SLHandle* h) { seen += "vendor" + tagOf(h); }, [](SLHandle*) { seen += "unknown "; },
                                   [](SLHandle*) { seen += "installed "; }});
    }
    void TearDown() override { eventsSetCallees(saved_), SLCleanup(); }
    EventCallees saved_{};
};

TEST_F(Events, ClassStringChoosesTheMatcher)
{
    // cut: non-zero when the indication ends this many characters into the string.
    struct Row { uint32_t type; std::string cls; uint32_t cut; const char* expected; } rows[] = {
        {1, "zorek|error|Baseboard|001", 0, "vendor0 "}, {1, "Zorek|Error", 0, "vendor0 "},
        {1, "Zorek|ErroX|Baseboard", 0, "unknown "}, // all 11 characters count
        {1, "EVENTGENERATION|Temperature|001", 0, "standard0 "}, {1, "EventGeneration|", 0, "standard0 "},
        {1, "EventGenerationX|Temperature", 0, "unknown "}, // the bar counts
        {1, "Zorek|Error|x", 3, "unknown "}, {1, "EventGeneration|x", 9, "unknown "}, // nothing read past the end
        {1, "", 0, ""}, {2, "", 0, "installed "}, {3, "", 0, ""}, {7, "", 0, ""},
    };
    for (const Row& row : rows) {
        seen.clear();
        SLHandle* h = indication(row.type, row.cls);
        if (row.cut != 0) { // the string's length word agrees; its bytes go on
            storeWordAt(h->command, 2, 1028 + row.cut);
            storeWord(h->confirm + 1024, row.cut);
        }
        processEvent(h);
        SLDestroyHandle(h);
        EXPECT_EQ(seen, row.expected) << row.type << " " << row.cls << " " << row.cut;
    }
}

TEST_F(Events, QueueCountsKeepsOrderAndStops)
{
    unsigned before = EventsHandled();
    SLHandle* h = indication(1, "EventGeneration|");
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
    for (int i = 0; i < 2000 && EventsHandled() < before + 6; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(EventsHandled(), before + 6) << "every type is counted";
    EXPECT_EQ(seen, "standard0 vendor1 standard2 vendor3 installed ");
    EXPECT_EQ(eventsWorkersRunning(), 1) << "the stopped worker must not have joined the new one";
    KillEventThread();
    EventHandler(h);
    EXPECT_EQ(eventsQueued(), 0u);
    DestroyEventHandler();
    EXPECT_EQ(EventsHandled(), before + 6);
    SLDestroyHandle(h);
}

std::string commands, logText;
bool inDrive;

TEST(Startup, MarkerCheckOrderAndTexts)
{
    const std::string checking = "Checking for mox configurations ..\n", go = "Proceeding with loading mox ..\n";
    struct Row { std::vector<std::string> files; int result; std::string out, ran; } rows[] = { // "f/": floppy
        {{"mox.not", "-"}, 4, "", ""}, {{"vornmox.not", "f/mox.not"}, 4, "", ""}, // "-": no floppy in the drive
        {{"-"}, 0, checking + "There is no floppy found in floppy drive\n" + go, "mount "},
        {{"f/mox.not", "f/vornmox.not"}, 4, checking + "file mox.not  found in floppy\n", "mount umount "},
        {{"f/vornmox.not"}, 4, checking + "file vornmox.not found in floppy\n", "mount umount "},
        {{}, 0, checking + "Couldn't find any mox configuration files in floppy drive\n" + go, "mount umount "},
    };
    moxSetLogHook([](int priority, const char* text) { logText += (priority == LOG_ERR ? "" : "!") + std::string(text); });
    for (const Row& row : rows) {
        char pattern[] = "/tmp/moxmarkXXXXXX";
        const std::string dir = std::string(mkdtemp(pattern)) + "/";
        mkdir((dir + "f").c_str(), 0755);
        inDrive = true;
        for (const auto& f : row.files)
            f == "-" ? void(inDrive = false) : void(std::ofstream(dir + f) << "");
        const std::string paths[4] = {dir + "vornmox.not", dir + "mox.not", dir + "f/mox.not", dir + "f/vornmox.not"};
        char* buffer = nullptr;
        size_t size = 0;
        MarkerCheck check{paths[0].c_str(), paths[1].c_str(), paths[2].c_str(), paths[3].c_str(), "mount", "umount",
                          [](const char* command) { return commands += command + std::string(" "),
                                                           std::string(command) == "mount" && !inDrive ? 32 : 0; },
                          open_memstream(&buffer, &size)};
        commands.clear(), logText.clear();
        EXPECT_EQ(checkForMoxNot(check), row.result) << row.out;
        fclose(check.out);
        EXPECT_EQ(std::string(buffer, size), row.out);
        EXPECT_EQ(commands, row.ran) << row.out;
        // Every line also at LOG_ERR, the first with a leading line feed.
        EXPECT_EQ(logText, row.out.empty() ? "" : "\n" + row.out);
        free(buffer);
    }
    moxSetLogHook(nullptr);
}

TEST(Startup, DefaultSignalSets)
{
    // Run last: from here on this thread blocks the wait set, and the signal
    // thread takes what reaches the process.
    pthread_t thread;
    ASSERT_EQ(daemon_startSignalHandling(nullptr, nullptr, &thread), 0);
    auto* sets = static_cast<const sigset_t*>(daemon_signalParam()); // wait, then stop
    std::string text;
    for (int s : {SIGTERM, SIGINT, SIGQUIT, SIGPWR, SIGHUP, SIGCHLD, SIGPIPE, SIGALRM, SIGIO, SIGUSR1, SIGUSR2})
        text += std::to_string(sigismember(&sets[0], s)) + std::to_string(sigismember(&sets[1], s)) + " ";
    // Waited for: all but ALRM, IO, USR1, USR2. Stopping: TERM, INT, QUIT, PWR.
    EXPECT_EQ(text, "11 11 11 11 10 10 10 00 00 00 00 ");
}

} // namespace
