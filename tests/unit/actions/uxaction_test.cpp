#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "actions/uxaction.h"
#include "base/log.h"
#include "base/sleep.h"

namespace {

std::string tempDir()
{
    char pattern[] = "/tmp/moxtestXXXXXX";
    return mkdtemp(pattern);
}

void writeFile(const std::string& path, const std::string& content)
{
    std::ofstream(path, std::ios::binary) << content;
}

TEST(Config, NotificationOnlyOption)
{
    struct Case {
        const char* content;
        uint32_t initial;
        uint32_t expected;
    } cases[] = {
        {"NotificationOnly = TRUE\n", 0, 1},
        {"notificationonly=false\n", 1, 0},
        {"notificationonly yes\n", 1, 0},
        {"# notificationonly = true\n", 0, 0},
        {"#notificationonly = true\n", 1, 1},
        {"   # notificationonly = true\n", 0, 1}, // not a comment: '#' is not in the first column
        {"notificationonly = untrue\n", 0, 1},   // a plain substring test
        {"notificationonly = true\nnotificationonly = false\n", 0, 0},
        {"notificationonly = true", 0, 1}, // no final line feed
        {"other = true\n", 0, 0},
        {"\x01\xff\x7f notificationonly \x80 true\n", 0, 1},
        {"", 1, 1},
    };
    std::string dir = tempDir();
    for (const Case& c : cases) {
        std::string path = dir + "/mox.cfg";
        writeFile(path, c.content);
        bNotificationOnly = c.initial;
        EXPECT_EQ(processCfgFile(path.c_str()), 1);
        EXPECT_EQ(bNotificationOnly, c.expected) << c.content;
    }
    bNotificationOnly = 0;
    EXPECT_EQ(processCfgFile((dir + "/missing.cfg").c_str()), 0);
    EXPECT_EQ(bNotificationOnly, 0u);
}

TEST(Config, LongLinesArriveInPieces)
{
    std::string dir = tempDir();
    std::string path = dir + "/mox.cfg";
    // The option name straddles the 499-character pieces, so neither piece holds it.
    std::string line(490, 'x');
    line += "notificationonly = true\n";
    writeFile(path, line);
    bNotificationOnly = 0;
    EXPECT_EQ(processCfgFile(path.c_str()), 1);
    EXPECT_EQ(bNotificationOnly, 0u);

    // A second piece that holds the whole option still counts.
    std::string longer(600, 'y');
    longer += " notificationonly true\n";
    writeFile(path, longer);
    EXPECT_EQ(processCfgFile(path.c_str()), 1);
    EXPECT_EQ(bNotificationOnly, 1u);
    bNotificationOnly = 0;
}

std::vector<unsigned> sleeps;

TEST(OsServices, DelaySleepsWholeSeconds)
{
    moxSetSleepHook([](unsigned ms) { sleeps.push_back(ms); });
    struct Case {
        int32_t ms;
        unsigned slept;
    } cases[] = {{3000, 3000}, {2999, 2000}, {2000, 2000}, {1500, 1000}, {999, 1000},
                 {100, 1000},  {0, 1000},    {-5, 1000},   {40000, 40000}};
    for (const Case& c : cases) {
        sleeps.clear();
        MoxDelay(c.ms);
        ASSERT_EQ(sleeps.size(), 1u);
        EXPECT_EQ(sleeps[0], c.slept) << c.ms;
    }
    moxSetSleepHook(nullptr);
}

TEST(OsServices, DelayReallySleeps)
{
    auto start = std::chrono::steady_clock::now();
    MoxDelay(999);
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(990));
}

TEST(OsServices, LockAndType)
{
    EXPECT_EQ(MoxOsSpecificInit(), 0);
    EXPECT_EQ(MoxSemaphoreWait(), 0);
    EXPECT_EQ(MoxSemaphoreRelease(), 0);
    EXPECT_EQ(GetOSType(), 6);
}

std::vector<std::pair<int, std::string>> logged;

TEST(OsServices, FailedShutdownIsLoggedAndReturned)
{
    logged.clear();
    moxSetLogHook([](int priority, const char* text) { logged.emplace_back(priority, text); });
    EXPECT_NE(shutDownOsWith("/nonexistent/init"), 0);
    moxSetLogHook(nullptr);
    ASSERT_EQ(logged.size(), 1u);
    EXPECT_EQ(logged[0].first, LOG_ERR);
    EXPECT_NE(logged[0].second.find("/nonexistent/init"), std::string::npos);
}

TEST(OsServices, ShutdownExecutesInitZeroWithNoBlockedSignals)
{
    // /bin/sh started as "init" "0" runs the script named "0" in its working
    // directory; the script records its blocked signals (with builtins only,
    // before the shell starts any child: while it waits for one it blocks
    // signals itself) and its command line.
    std::string dir = tempDir();
    std::string record = dir + "/record";
    writeFile(dir + "/0", "while read key value; do case $key in SigBlk:) blocked=$value;; esac; done < /proc/$$/status\n"
                          "tr '\\000' ' ' < /proc/$$/cmdline > " + record + "\necho >> " + record +
                              "\necho \"SigBlk: $blocked\" >> " + record + "\n");
    pid_t child = fork();
    if (child == 0) {
        if (chdir(dir.c_str()) != 0)
            _exit(98);
        sigset_t all;
        sigfillset(&all);
        pthread_sigmask(SIG_SETMASK, &all, nullptr);
        shutDownOsWith("/bin/sh");
        _exit(99);
    }
    int status = 0;
    waitpid(child, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    std::ifstream in(record);
    std::string args, blocked;
    std::getline(in, args);
    std::getline(in, blocked);
    EXPECT_EQ(args, "init 0 ");
    EXPECT_EQ(blocked, "SigBlk: 0000000000000000");
}

} // namespace
