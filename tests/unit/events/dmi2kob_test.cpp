#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

#include "events/dmi2kob.h"

namespace {

using namespace std::chrono_literals;

std::string hex(const void* data, size_t size)
{
    std::string out;
    char two[3];
    for (size_t i = 0; i < size; ++i) {
        snprintf(two, sizeof two, "%02x", static_cast<const unsigned char*>(data)[i]);
        out += two;
    }
    return out;
}

struct KeyValue {
    SLKeyList list{};
    uint32_t value;
    explicit KeyValue(uint32_t v) : value(v)
    {
        list.count = 1;
        list.keys[0] = {1, 5, &value};
    }
};

TEST(AlarmRecord, Fields)
{
    KeyValue key(3);
    struct Case {
        const char* what;
        EventRecord record;
        const char* bytes;
    } cases[] = {
        {"standard event on a voltage row",
         {1, 7, 12, 0, 0, 0, &key.list, 9, 0, 16, 0, 0, nullptr, "Voltage Probe", nullptr, nullptr, nullptr,
          nullptr, nullptr, nullptr},
         "01000000070000000c00000009000000100000000300000001000000"},
        {"power supply",
         {1, 7, 12, 0, 0, 0, nullptr, 9, 0, 8, 0, 0, nullptr, "Power Supply", nullptr, nullptr, nullptr, nullptr,
          nullptr, nullptr},
         "01000000070000000c00000009000000080000000000000001000000"},
        {"power only in lower case",
         {1, 7, 12, 0, 0, 0, &key.list, 9, 0, 4, 0, 0, nullptr, "power supply", nullptr, nullptr, nullptr,
          nullptr, nullptr, nullptr},
         "01000000070000000c00000009000000040000000300000000000000"},
        {"vendor event without class 1: no group, no instance",
         {2, 7, 0, 0, 0, 2, &key.list, 0, 0, 0, 0, 0, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
          nullptr, nullptr},
         "01000000070000000000000000000000000000000000000000000000"},
        {"unknown event",
         {3, 5, 0, 0, 0, 0, nullptr, 0, 0, 0, 0, 0, "Baseboard", nullptr, nullptr, nullptr, nullptr, nullptr,
          nullptr, nullptr},
         "01000000050000000000000000000000000000000000000000000000"},
    };
    for (auto& c : cases) {
        AlarmRecord alarm = makeAlarmRecord(&c.record);
        EXPECT_EQ(hex(&alarm, sizeof alarm), c.bytes) << c.what;
    }
    SLKeyList noValue{};
    noValue.count = 1;
    EventRecord record{};
    record.groupId = 4;
    record.keyList = &noValue;
    EXPECT_EQ(getRowName(&record), 0u) << "a key without a value";
}

class Hand : public ::testing::Test {
protected:
    void SetUp() override
    {
        signal(SIGPIPE, SIG_IGN);
        char pattern[] = "/tmp/moxkobXXXXXX";
        dir_ = mkdtemp(pattern);
        lock_ = dir_ + "/kobLock";
        fifo_ = dir_ + "/kob";
        paths_ = KobPaths{lock_.c_str(), fifo_.c_str(), "/proc/%s/cmdline", 300};
    }
    void writeLock(const std::string& content) { std::ofstream(lock_) << content; }
    bool exists(const std::string& path) const
    {
        struct stat st;
        return stat(path.c_str(), &st) == 0;
    }
    // A child whose command line starts with `name` and that never reads.
    pid_t sleeper(const char* name)
    {
        pid_t pid = fork();
        if (pid == 0) {
            execl("/bin/sleep", name, "20", static_cast<char*>(nullptr));
            _exit(1);
        }
        std::this_thread::sleep_for(50ms);
        return pid;
    }
    static void finish(pid_t pid)
    {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }

    std::string dir_, lock_, fifo_;
    KobPaths paths_{};
    EventRecord record_{1, 7, 12, 0, 0, 0, nullptr, 9, 0, 16, 0, 0, nullptr, "Voltage Probe", nullptr,
                        nullptr, nullptr, nullptr, nullptr, nullptr};
};

TEST_F(Hand, StaleAndForeignLocks)
{
    struct Case {
        const char* lock; // null: no lock file
        bool removed;
    } cases[] = {
        {nullptr, false},
        {"", true},
        {"self\n", true},
        {"/etc/passwd\n", true},
        {"12x\n", true},
        {"999999999\n", false}, // no such process: the lock stays
    };
    for (const Case& c : cases) {
        unlink(lock_.c_str());
        mkfifo(fifo_.c_str(), 0600);
        if (c.lock != nullptr)
            writeLock(c.lock);
        EXPECT_EQ(kobProcessAlarmAt(paths_, &record_), 0) << (c.lock ? c.lock : "none");
        EXPECT_EQ(exists(lock_), c.lock != nullptr && !c.removed) << (c.lock ? c.lock : "none");
        EXPECT_EQ(exists(fifo_), !c.removed) << (c.lock ? c.lock : "none");
    }
}

TEST_F(Hand, ProgramNameMustBeExactlyKobd)
{
    for (const char* name : {"kobdx", "/usr/sbin/kobd", "sleep"}) {
        pid_t pid = sleeper(name);
        mkfifo(fifo_.c_str(), 0600);
        writeLock(std::to_string(pid) + "\n");
        EXPECT_EQ(kobProcessAlarmAt(paths_, &record_), 0) << name;
        EXPECT_FALSE(exists(lock_)) << name;
        EXPECT_FALSE(exists(fifo_)) << name;
        finish(pid);
    }
}

TEST_F(Hand, PeerThatNeverReadsDoesNotStallTheWorker)
{
    pid_t pid = sleeper("kobd");
    mkfifo(fifo_.c_str(), 0600);
    writeLock(std::to_string(pid) + "\n");
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(kobProcessAlarmAt(paths_, &record_), 0);
    auto waited = std::chrono::steady_clock::now() - start;
    EXPECT_GE(waited, 280ms);
    EXPECT_LT(waited, 1500ms);
    EXPECT_TRUE(exists(lock_)) << "a live peer keeps its lock";
    finish(pid);
    EXPECT_EQ(defaultKobPaths().openWaitMs, 2000u);
}

TEST_F(Hand, RecordsReachTheAlarmDaemonByteForByte)
{
    std::string out = dir_ + "/kobd.out";
    pid_t pid = fork();
    if (pid == 0) {
        freopen(out.c_str(), "w", stdout);
        execl(KOBD_BINARY, "kobd", "-l", lock_.c_str(), "-f", fifo_.c_str(), "-n", "2",
              static_cast<char*>(nullptr));
        _exit(1);
    }
    for (int i = 0; i < 100 && !exists(lock_); ++i)
        std::this_thread::sleep_for(20ms);
    KeyValue key(3);
    record_.keyList = &key.list;
    paths_.openWaitMs = 2000;
    EXPECT_EQ(kobProcessAlarmAt(paths_, &record_), 28);
    EventRecord unknown{};
    unknown.eventKind = 3;
    unknown.componentId = 5;
    EXPECT_EQ(kobProcessAlarmAt(paths_, &unknown), 28);
    int status = 0;
    waitpid(pid, &status, 0);
    std::ifstream in(out);
    std::string banner, first, second;
    std::getline(in, banner);
    std::getline(in, first);
    std::getline(in, second);
    EXPECT_EQ(first.substr(0, 62), "alarm 01000000070000000c00000009000000100000000300000001000000");
    EXPECT_EQ(second.substr(0, 62), "alarm 01000000050000000000000000000000000000000000000000000000");
}

} // namespace
