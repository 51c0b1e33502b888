// Faults of the daemon's peers that need no testbed: a busy provider, a
// confirm that never comes, a driver that refuses every request, a missing
// MIF directory and a full disk under the provider's database.
#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <future>
#include <sys/mount.h>
#include <sys/stat.h>
#include <thread>
#include <vector>
#include <unistd.h>

#include "base/bytes.h"
#include "base/sleep.h"
#include "daemon/events.h"
#include "daemonenv.h"
#include "actions/uxaction.h"
#include "hardware/sysaction.h"
#include "mif/mif.h"
#include "obx/obxapi.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"
#include "testmifs.h"

namespace {

std::atomic<unsigned> sleptMs{0};
std::atomic<unsigned> sleeps{0};

void countSleep(unsigned ms)
{
    sleptMs += ms;
    ++sleeps;
}

class Faults : public ::testing::Test {
protected:
    void TearDown() override
    {
        dmisp::clearFaults();
        daemon_.stop();
    }
    RegisteredDaemon daemon_;
};

// While the provider answers busy, each command is tried twice with 5 s
// sleeps after each busy answer and then fails; the daemon keeps serving:
// an event that arrives meanwhile is processed (its table lookup fails, so
// nothing is logged) and the next one after recovery is logged.
TEST_F(Faults, BusyProviderFailsEachCommandAfterTwoAttemptsThenServesAgain)
{
    std::string error;
    ASSERT_TRUE(daemon_.start(&error)) << error;
    moxSetSleepHook(countSleep);
    SLHandle* h = SLCreateHandle(0);
    sleptMs = 0;
    sleeps = 0;
    dmisp::injectBusy(1000000);
    for (int i = 0; i < 3; ++i) {
        uint64_t calls = dmisp::commandsReceived();
        EXPECT_EQ(SLListComponent(h, nullptr, daemon_.board), 1);
        EXPECT_EQ(dmisp::commandsReceived() - calls, 2u) << "two attempts";
    }
    EXPECT_EQ(sleptMs.load(), 3u * 10000u);
    EXPECT_EQ(sleeps.load(), 6u);

    // The worker meets the busy provider too; each of its commands returns.
    unsigned handled = EventsHandled();
    dmisp::clearFaults();
    ASSERT_EQ(daemon_.raiseVoltage(), 0u); // raised while serving
    ASSERT_TRUE(dmisp::waitIndicationsDelivered());
    dmisp::injectBusy(1000000);
    ASSERT_TRUE(daemon_.drain(handled + 1, 30000));
    EXPECT_EQ(RegisteredDaemon::logLines.load(), 0u) << "the table could not be read";

    dmisp::clearFaults();
    EXPECT_EQ(SLListComponent(h, nullptr, daemon_.board), 0);
    ASSERT_EQ(daemon_.raiseVoltage(), 0u);
    ASSERT_TRUE(daemon_.drain(handled + 2, 30000));
    EXPECT_EQ(RegisteredDaemon::logLines.load(), 1u);
    SLDestroyHandle(h);
}

// A command whose confirm never comes holds the command lock: a later
// command from another thread waits behind it without reaching the
// provider. Cleanup ends the wait with status 522, does not send the
// waiting command (its confirm could come after its handle was freed) and
// returns only after both commands have left, so neither touches freed
// memory or a destroyed lock (under AddressSanitizer).
TEST_F(Faults, ConfirmThatNeverComesBlocksLaterCommandsUntilCleanup)
{
    std::string error;
    ASSERT_TRUE(daemon_.start(&error, false)) << error;
    SLHandle* first = SLCreateHandle(0);
    SLHandle* second = SLCreateHandle(0);
    uint64_t calls = dmisp::commandsReceived();
    dmisp::injectNoConfirm(1);
    std::atomic<int> firstResult{-1}, secondResult{-1};
    std::thread a([&] { firstResult = SLListComponent(first, nullptr, daemon_.board); });
    while (dmisp::commandsReceived() == calls)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    std::thread b([&] { secondResult = SLListComponent(second, nullptr, daemon_.board); });
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    EXPECT_EQ(firstResult.load(), -1) << "the first command waits for its confirm";
    EXPECT_EQ(secondResult.load(), -1) << "the second waits for the command lock";
    EXPECT_EQ(dmisp::commandsReceived() - calls, 1u) << "the second never reached the provider";

    // Cleanup (unregistering would queue behind the first command too):
    // both commands leave before SL memory is released.
    daemon_.abandon();
    a.join();
    b.join();
    EXPECT_EQ(firstResult.load(), 1) << "abandoned";
    EXPECT_EQ(secondResult.load(), 1) << "not sent once cleanup has begun";
}

// /dev/obx opens but refuses every ioctl: identification fails, every
// system-control request reports failure, and the control lock is free
// again after each (a second request does not hang).
int refusedOpen(const char*, int)
{
    return open("/dev/null", O_RDWR);
}
int refusedIoctl(int, unsigned long, void*)
{
    errno = EIO;
    return -1;
}
void* refusedMmap(void*, size_t, int, int, int, off_t)
{
    errno = EIO;
    return reinterpret_cast<void*>(-1);
}
int refusedMunmap(void*, size_t)
{
    return 0;
}

TEST(ObxFaults, DriverRefusingEveryIoctlFailsEachRequestAndReleasesTheLock)
{
    static const ObxOs refusing = {refusedOpen, refusedIoctl, refusedMmap, refusedMunmap, close};
    obxSetOs(&refusing);
    moxSetSleepHook(countSleep);
    EXPECT_EQ(open_obx(), 0);
    uint32_t bytes = 0;
    uint8_t out[64];
    EXPECT_EQ(DeviceIoControl(0, 0, out, sizeof out, out, sizeof out, &bytes, nullptr), 0);
    ObxpRequest request{};
    uint8_t response[64], code = 0;
    uint32_t length = 0;
    EXPECT_NE(SendTimedObxpRequest(&request, 1, response, &length, &code), 0);
    // Each locked entry point takes and gives back the control lock; were it
    // left held, the second round would hang.
    MoxOsSpecificInit();
    auto rounds = std::async(std::launch::async, [] {
        SystemControlInfo info{};
        for (int i = 0; i < 2; ++i) {
            MoxGetSystemControlInfo(&info);
            MoxResetWatchDogTimer(0);
            MoxSetWatchDogTimeoutValue(0, 1000);
        }
    });
    if (rounds.wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
        ADD_FAILURE() << "a system-control request hangs on the refusing driver";
        std::_Exit(1);
    }
    obxSetOs(nullptr);
    moxSetSleepHook(nullptr);
}

// Registration without the own MIF installed needs the MIF directory: a
// missing directory, or a file where the directory should be, ends it with
// failure 3 and installs nothing.
TEST(RegistrationFaults, MissingMifDirectoryIsFailureThree)
{
    char pattern[] = "/tmp/moxreliabilityXXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    std::string dir = pattern;
    std::string error;
    ASSERT_EQ(dmisp::reset(dir + "/db", false, &error), 0) << error;
    ASSERT_NE(dmisp::installText(boardMif("Test Board"), "board.mif", &error), 0u) << error;
    std::string plainFile = dir + "/not-a-directory";
    FILE* f = fopen(plainFile.c_str(), "w");
    ASSERT_NE(f, nullptr);
    fclose(f);
    for (const std::string& path : {dir + "/missing", plainFile}) {
        setenv("UXDMIPATH", path.c_str(), 1);
        SLInitialize();
        size_t before = dmisp::components().size();
        EXPECT_EQ(RegisterWithSL(), 3) << path;
        EXPECT_EQ(dmisp::components().size(), before) << path;
        UnregisterWithSL();
        SLCleanup();
    }
    dmisp::shutdown();
    std::system(("rm -rf '" + dir + "'").c_str());
}

// The provider's database on a full file system: a write that cannot be
// stored fails with status 11 and is undone; the value, the component file
// and a reload from disk all still show the old state.
TEST(ProviderFaults, FullDiskLeavesTheDatabaseConsistent)
{
    if (geteuid() != 0)
        GTEST_SKIP() << "mounting a small file system needs root";
    char pattern[] = "/tmp/moxreliabilityXXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    std::string dir = pattern;
    if (mount("moxfull", dir.c_str(), "tmpfs", 0, "size=256k") != 0)
        GTEST_SKIP() << "tmpfs mount refused: " << strerror(errno);
    std::string error;
    ASSERT_EQ(dmisp::reset(dir + "/db", false, &error), 0) << error;
    uint32_t board = dmisp::installText(boardMif("Test Board"), "board.mif", &error);
    ASSERT_NE(board, 0u) << error;
    std::string before;
    ASSERT_EQ(dmisp::getValue(board, 3, 2, {"1"}, &before), 0u);
    std::string mifBefore = dmisp::componentMif(board);
    // Fill the file system.
    std::string filler = dir + "/filler";
    int fd = open(filler.c_str(), O_WRONLY | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    char block[4096] = {};
    while (write(fd, block, sizeof block) > 0) {
    }
    close(fd);

    EXPECT_EQ(dmisp::setValue(board, 3, 2, {"1"}, "changed on a full disk"), uint32_t{dmisp::StatusStorageFailed});
    std::string after;
    EXPECT_EQ(dmisp::getValue(board, 3, 2, {"1"}, &after), 0u);
    EXPECT_EQ(after, before);
    EXPECT_EQ(dmisp::componentMif(board), mifBefore);
    EXPECT_EQ(dmisp::installText(boardMif("Second Board"), "second.mif", &error), 0u) << "no room";

    // Room again: the database reloads as it was, with no load error and no
    // temporary file left, and takes the change now.
    unlink(filler.c_str());
    ASSERT_EQ(dmisp::reset(dir + "/db", false, &error), 0) << error;
    EXPECT_TRUE(dmisp::loadErrors().empty());
    EXPECT_EQ(dmisp::components().size(), 1u);
    EXPECT_EQ(dmisp::getValue(board, 3, 2, {"1"}, &after), 0u);
    EXPECT_EQ(after, before);
    EXPECT_EQ(dmisp::setValue(board, 3, 2, {"1"}, "changed"), 0u);
    dmisp::shutdown();
    umount2(dir.c_str(), MNT_DETACH);
    rmdir(dir.c_str());
}

// The provider delivers an indication while the application cleans up (its
// indication thread calls back after the unregister was confirmed). Cleanup
// waits for the call to leave, and the call, finding no handler, touches no
// SL memory: before, cleanup freed the handle the call had made and the call
// then freed it again.
std::atomic<int> deliveryInside{0};
std::atomic<bool> deliveryRelease{false};

void slowCompletion(void*)
{
    deliveryInside = 1;
    while (!deliveryRelease)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

TEST(SLCleanupFaults, CleanupWaitsForAnIndicationBeingDelivered)
{
    SLInitialize();
    std::vector<uint32_t> indication(13, 0);
    indication[0] = SL_LEVEL_CHECK;
    indication[1] = 1;
    indication[2] = 52;
    indication[11] = pointerWord(reinterpret_cast<void*>(&slowCompletion));
    unsigned strings = slLiveStringCount();
    std::thread provider([&] { SLIndicationFunc(indication.data()); });
    while (deliveryInside == 0)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    EXPECT_EQ(slLiveStringCount(), strings) << "no handle made without a handler";
    std::atomic<bool> cleaned{false};
    std::thread cleanup([&] {
        SLCleanup();
        cleaned = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_FALSE(cleaned.load()) << "cleanup returned while the provider was inside the callback";
    deliveryRelease = true;
    provider.join();
    cleanup.join();
    EXPECT_TRUE(cleaned.load());
}

} // namespace
