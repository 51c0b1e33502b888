#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <mutex>
#include <pthread.h>
#include <thread>
#include <vector>

#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

// Records what the completion callback and the handler saw.
struct Observed {
    std::atomic<int> completions{0};
    std::atomic<int> handled{0};
    std::atomic<int> entered{0};
    std::atomic<int> handledAfterRemoval{0};
    std::atomic<bool> removed{false};
    std::atomic<pthread_t> completionThread{};
    std::atomic<size_t> handlerStack{0};
    std::mutex lock;
    std::vector<uint8_t> seenCommand;
    std::vector<uint8_t> seenConfirm;
    uint32_t seenConfirmSize = 0;
    // While set, handlers wait: keeps event threads alive.
    std::atomic<bool> hold{false};
};

Observed* observed = nullptr;

void complete(void*)
{
    observed->completionThread = pthread_self();
    ++observed->completions;
}

int recordingHandler(SLHandle* h)
{
    if (observed->removed)
        ++observed->handledAfterRemoval;
    {
        std::lock_guard<std::mutex> guard(observed->lock);
        observed->seenCommand.assign(h->command, h->command + 64);
        observed->seenConfirm.assign(h->confirm, h->confirm + h->confirmSize);
        observed->seenConfirmSize = h->confirmSize;
    }
    pthread_attr_t attributes;
    if (pthread_getattr_np(pthread_self(), &attributes) == 0) {
        size_t size = 0;
        pthread_attr_getstacksize(&attributes, &size);
        observed->handlerStack = size;
        pthread_attr_destroy(&attributes);
    }
    ++observed->entered;
    while (observed->hold)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    ++observed->handled;
    return 0;
}

// An indication of `length` bytes with a patterned body.
std::vector<uint8_t> indication(uint32_t length, uint32_t stated, bool withCompletion = true)
{
    std::vector<uint8_t> ind(length);
    for (uint32_t i = 0; i < length; ++i)
        ind[i] = static_cast<uint8_t>(i * 7 + 1);
    storeWordAt(ind.data(), 0, SL_LEVEL_CHECK);
    storeWordAt(ind.data(), 1, 1);
    storeWordAt(ind.data(), 2, stated);
    storeWordAt(ind.data(), 11, withCompletion ? pointerWord(reinterpret_cast<void*>(&complete)) : 0);
    storeWordAt(ind.data(), 12, 52);
    return ind;
}

// Waits until `counter` reaches `value` (at most a few seconds).
void awaitCount(const std::atomic<int>& counter, int value)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (counter.load() < value && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

class SLEvent : public ::testing::Test {
protected:
    void SetUp() override
    {
        observed = &seen;
        SLEventInitialize();
        live = slLiveStringCount();
    }
    void TearDown() override
    {
        seen.hold = false;
        SLEventSetHandler(nullptr);
        EXPECT_EQ(slLiveStringCount(), live) << "every indication handle is freed";
        observed = nullptr;
    }
    Observed seen;
    unsigned live = 0;
};

TEST_F(SLEvent, WithoutHandlerCompletedAtOnceOnTheCallingThread)
{
    auto ind = indication(300, 300);
    SLIndicationFunc(ind.data());
    EXPECT_EQ(seen.completions.load(), 1);
    EXPECT_TRUE(pthread_equal(seen.completionThread.load(), pthread_self()));
    EXPECT_EQ(slLiveStringCount(), live);
}

TEST_F(SLEvent, HandlerGetsACopyThenTheIndicationIsCompleted)
{
    SLEventSetHandler(recordingHandler);
    auto ind = indication(300, 300);
    SLIndicationFunc(ind.data());
    awaitCount(seen.completions, 1);
    SLEventSetHandler(nullptr);
    ASSERT_EQ(seen.handled.load(), 1);
    EXPECT_EQ(seen.completions.load(), 1);
    EXPECT_FALSE(pthread_equal(seen.completionThread.load(), pthread_self()));
    EXPECT_EQ(seen.seenConfirmSize, 8192u);
    EXPECT_EQ(std::memcmp(seen.seenConfirm.data(), ind.data(), 300), 0);
    EXPECT_EQ(std::memcmp(seen.seenCommand.data(), ind.data(), 52), 0) << "the 13 header words";
    EXPECT_EQ(loadWordAt(seen.seenCommand.data(), 15), pointerWord(ind.data()));
    EXPECT_GT(seen.handlerStack.load(), 0u);
    EXPECT_LE(seen.handlerStack.load(), 64u * 1024) << "event threads run on a small stack";
}

TEST_F(SLEvent, LargeIndicationKeepsItsLength)
{
    SLEventSetHandler(recordingHandler);
    auto ind = indication(20000, 20000, false);
    SLIndicationFunc(ind.data());
    awaitCount(seen.handled, 1);
    SLEventSetHandler(nullptr);
    ASSERT_EQ(seen.handled.load(), 1);
    EXPECT_EQ(seen.completions.load(), 0) << "no completion callback";
    EXPECT_EQ(seen.seenConfirmSize, 20000u);
    EXPECT_EQ(std::memcmp(seen.seenConfirm.data(), ind.data(), 20000), 0);
}

TEST_F(SLEvent, ImplausibleLengthsAreCompletedAndDropped)
{
    SLEventSetHandler(recordingHandler);
    for (uint32_t stated : {0u, 4u, 51u, (1u << 20) + 1, 0xFFFFFFFFu}) {
        auto ind = indication(64, stated);
        int before = seen.completions;
        SLIndicationFunc(ind.data());
        EXPECT_EQ(seen.completions.load(), before + 1) << stated;
    }
    SLEventSetHandler(nullptr);
    EXPECT_EQ(seen.handled.load(), 0);
    // The limits themselves are accepted.
    SLEventSetHandler(recordingHandler);
    auto smallest = indication(52, 52);
    SLIndicationFunc(smallest.data());
    awaitCount(seen.handled, 1);
    SLEventSetHandler(nullptr);
    EXPECT_EQ(seen.handled.load(), 1);
}

TEST_F(SLEvent, RemovingTheHandlerWaitsForStartedThreads)
{
    constexpr int count = 40;
    std::vector<std::vector<uint8_t>> inds;
    for (int i = 0; i < count; ++i)
        inds.push_back(indication(100, 100));
    SLEventSetHandler(recordingHandler);
    for (auto& ind : inds)
        SLIndicationFunc(ind.data());
    // Many of the threads are still in their first yield: they must call no
    // handler now, but still complete and free their indication.
    seen.removed = true;
    SLEventSetHandler(nullptr);
    EXPECT_EQ(seen.handledAfterRemoval.load(), 0);
    EXPECT_EQ(seen.completions.load(), count) << "every thread finished before the removal returned";
    EXPECT_EQ(slLiveStringCount(), live);
}

TEST_F(SLEvent, ABurstOfBlockedHandlersIsNotDropped)
{
    // Hundreds of event threads alive at once must fit the 32-bit address
    // space.
    constexpr int count = 300;
    std::vector<std::vector<uint8_t>> inds;
    for (int i = 0; i < count; ++i)
        inds.push_back(indication(100, 100));
    seen.hold = true;
    SLEventSetHandler(recordingHandler);
    for (auto& ind : inds)
        SLIndicationFunc(ind.data());
    EXPECT_EQ(seen.completions.load(), 0) << "no indication was dropped";
    awaitCount(seen.entered, count);
    EXPECT_EQ(seen.entered.load(), count) << "all handlers run at the same time";
    seen.hold = false;
    SLEventSetHandler(nullptr);
    EXPECT_EQ(seen.handled.load(), count);
    EXPECT_EQ(seen.completions.load(), count);
}

TEST_F(SLEvent, CleanupRemovesTheHandlerWithoutWaiting)
{
    seen.hold = true;
    SLEventSetHandler(recordingHandler);
    auto ind = indication(100, 100);
    SLIndicationFunc(ind.data());
    auto start = std::chrono::steady_clock::now();
    SLEventCleanup();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(100));
    // A new indication now finds no handler.
    auto later = indication(100, 100);
    SLIndicationFunc(later.data());
    EXPECT_GE(seen.completions.load(), 1);
    seen.hold = false;
    SLEventSetHandler(nullptr);
    EXPECT_EQ(seen.completions.load(), 2);
}

TEST_F(SLEvent, NullIndicationIsIgnored)
{
    SLIndicationFunc(nullptr);
    EXPECT_EQ(seen.completions.load(), 0);
}

} // namespace
