#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "daemon/events.h"
#include "sl/sl.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

// An indication handle as the SL event thread hands it over: header words in
// the command block, the indication itself in the confirm buffer.
SLHandle* indication(uint32_t type, std::vector<std::string> classes, uint32_t tag = 0)
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0, h->confirmSize);
    storeWordAt(h->command, 0, SL_LEVEL_CHECK);
    storeWordAt(h->command, 1, type);
    storeWordAt(h->command, 2, 4096);
    storeWordAt(h->command, 3, tag);
    storeWordAt(h->command, 12, 64);
    uint8_t* data = h->confirm + 64;
    storeWord(data, static_cast<uint32_t>(classes.size()));
    uint32_t text = 1024;
    for (size_t c = 0; c < classes.size(); ++c) {
        storeWordAt(data + 4 + 16 * c, 0, 5);
        storeWordAt(data + 4 + 16 * c, 1, text);
        storeWord(h->confirm + text, static_cast<uint32_t>(classes[c].size()));
        std::memcpy(h->confirm + text + 4, classes[c].data(), classes[c].size());
        text += 4 + static_cast<uint32_t>(classes[c].size());
    }
    return h;
}

std::mutex seenLock;
std::vector<std::string> seen;
std::multiset<uint32_t> tags;

void record(const char* what, SLHandle* h)
{
    std::lock_guard<std::mutex> guard(seenLock);
    seen.emplace_back(what);
    tags.insert(loadWordAt(h->command, 3));
}

class EventQueue : public ::testing::Test {
protected:
    void SetUp() override
    {
        SLInitialize();
        seen.clear();
        tags.clear();
        saved_ = eventsSetCallees({[](SLHandle* h) { record("standard", h); },
                                   [](SLHandle* h) { record("vendor", h); },
                                   [](SLHandle* h) { record("unknown", h); },
                                   [](SLHandle* h) { record("installed", h); }});
    }
    void TearDown() override
    {
        eventsSetCallees(saved_);
        SLCleanup();
    }
    static bool waitForEvents(unsigned count)
    {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
        while (EventsHandled() < count && std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        return EventsHandled() >= count;
    }

private:
    EventCallees saved_{};
};

TEST_F(EventQueue, ClassStringChoosesTheMatcher)
{
    struct Case {
        uint32_t type;
        std::vector<std::string> classes;
        const char* expected; // nullptr: dropped silently
    } cases[] = {
        {1, {"zorek|error|Baseboard|001"}, "vendor"},
        {1, {"Zorek|Error"}, "vendor"},
        {1, {"EVENTGENERATION|Temperature|001"}, "standard"},
        {1, {"EventGeneration|"}, "standard"},
        {1, {"EventGeneration"}, "unknown"},
        {1, {"DMTF|Something|001", "EventGeneration|x"}, "unknown"},
        {1, {"Zorek|Err"}, "unknown"},
        {1, {}, nullptr},
        {2, {}, "installed"},
        {3, {}, nullptr},
        {7, {}, nullptr},
    };
    for (const Case& c : cases) {
        seen.clear();
        SLHandle* h = indication(c.type, c.classes);
        processEvent(h);
        SLDestroyHandle(h);
        if (c.expected == nullptr)
            EXPECT_TRUE(seen.empty()) << c.type;
        else
            EXPECT_EQ(seen, std::vector<std::string>{c.expected}) << (c.classes.empty() ? "" : c.classes[0]);
    }
}

TEST_F(EventQueue, PrefixReadStopsAtTheIndicationsEnd)
{
    // A three-character class string in the last bytes of the indication.
    SLHandle* h = indication(1, {"Zor"});
    storeWordAt(h->command, 2, 1024 + 7);
    processEvent(h);
    SLDestroyHandle(h);
    EXPECT_EQ(seen, std::vector<std::string>{"unknown"});
}

TEST_F(EventQueue, DropsBeforeCreateAndAfterKill)
{
    unsigned before = EventsHandled();
    SLHandle* h = indication(1, {"EventGeneration|"});
    EventHandler(h);
    EXPECT_EQ(eventsQueued(), 0u);
    ASSERT_EQ(CreateEventHandler(), 0);
    EventHandler(h);
    storeWordAt(h->command, 1, 2);
    EventHandler(h);
    storeWordAt(h->command, 1, 7);
    EventHandler(h);
    ASSERT_TRUE(waitForEvents(before + 3));
    EXPECT_EQ(EventsHandled(), before + 3) << "types 1, 2 and 7 are all counted";
    EXPECT_EQ(seen, (std::vector<std::string>{"standard", "installed"}));
    KillEventThread();
    EventHandler(h);
    EXPECT_EQ(eventsQueued(), 0u);
    SLDestroyHandle(h);
    DestroyEventHandler();
    EXPECT_EQ(EventsHandled(), before + 3);
}

TEST_F(EventQueue, DestroyFreesWhatIsStillQueued)
{
    ASSERT_EQ(CreateEventHandler(), 0);
    KillEventThread();
    // A stopped worker leaves the queue alone; indications are dropped.
    SLHandle* h = indication(1, {"EventGeneration|"});
    EventHandler(h);
    SLDestroyHandle(h);
    unsigned live = slLiveStringCount();
    DestroyEventHandler();
    EXPECT_EQ(eventsQueued(), 0u);
    EXPECT_EQ(slLiveStringCount(), live);
}

TEST_F(EventQueue, StopBeforeTheWorkerStartedStillWaitsForIt)
{
    // A worker stopped before its first step, and a new one started at once:
    // the queue must never have two consumers.
    for (int round = 0; round < 2; ++round) {
        ASSERT_EQ(CreateEventHandler(), 0);
        KillEventThread();
        EXPECT_EQ(eventsWorkersRunning(), 0) << "KillEventThread returned while a worker could still run";
    }
    ASSERT_EQ(CreateEventHandler(), 0);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_EQ(eventsWorkersRunning(), 1);
    DestroyEventHandler();
    EXPECT_EQ(eventsWorkersRunning(), 0);
}

TEST_F(EventQueue, ConcurrentProducersEveryHandleOnce)
{
    constexpr uint32_t producers = 8, perProducer = 1250; // 10,000 in all
    unsigned before = EventsHandled();
    unsigned liveBefore = slLiveStringCount();
    ASSERT_EQ(CreateEventHandler(), 0);
    std::vector<std::thread> threads;
    for (uint32_t p = 0; p < producers; ++p)
        threads.emplace_back([p] {
            for (uint32_t i = 0; i < perProducer; ++i) {
                SLHandle* h = indication(1, {"EventGeneration|"}, p * perProducer + i);
                EventHandler(h);
                SLDestroyHandle(h);
            }
        });
    for (auto& t : threads)
        t.join();
    ASSERT_TRUE(waitForEvents(before + producers * perProducer));
    DestroyEventHandler();
    EXPECT_EQ(EventsHandled(), before + producers * perProducer);
    std::lock_guard<std::mutex> guard(seenLock);
    EXPECT_EQ(tags.size(), producers * perProducer);
    EXPECT_EQ(std::set<uint32_t>(tags.begin(), tags.end()).size(), producers * perProducer) << "each once";
    EXPECT_EQ(slLiveStringCount(), liveBefore) << "no handle leaked";
}

TEST_F(EventQueue, OneProducerKeepsItsOrder)
{
    ASSERT_EQ(CreateEventHandler(), 0);
    unsigned before = EventsHandled();
    for (uint32_t i = 0; i < 50; ++i) {
        SLHandle* h = indication(1, {i % 2 ? "Zorek|Error" : "EventGeneration|"}, i);
        EventHandler(h);
        SLDestroyHandle(h);
    }
    ASSERT_TRUE(waitForEvents(before + 50));
    DestroyEventHandler();
    ASSERT_EQ(seen.size(), 50u);
    for (size_t i = 0; i < seen.size(); ++i)
        EXPECT_EQ(seen[i], i % 2 ? "vendor" : "standard");
}

} // namespace
