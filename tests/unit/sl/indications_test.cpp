// Indication delivery: copied for the handler and completed once, dropped
// when its stated length is absurd, and who waits for whom.
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "scripted_provider.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"

namespace {

std::atomic<bool> holdHandler{false}, holdCompletion{false};
std::atomic<int> handled{0}, completions{0};
std::string seen;

int handler(SLHandle* h)
{
    seen = std::to_string(SLIndicationComponentId(h)) + " " + std::to_string(SLEventClassCount(h));
    ++handled;
    while (holdHandler)
        std::this_thread::yield();
    return 0;
}

void completion(void*)
{
    ++completions;
    while (holdCompletion)
        std::this_thread::yield();
}

// An event of component 7 stating `length` bytes: one class counted at 64.
std::vector<uint32_t> event(uint32_t length)
{
    std::vector<uint32_t> w(20, 0xABABABAB);
    w[0] = SL_LEVEL_CHECK, w[1] = 1, w[2] = length, w[3] = 7, w[12] = 64, w[16] = 1;
    w[11] = pointerWord(reinterpret_cast<void*>(&completion));
    return w;
}

TEST(SLEvent, DeliveredOrDroppedAndCompletedOnce)
{
    ScriptedProvider p;
    SLEventSetHandler(handler);
    struct Row {
        const char* name;
        uint32_t length;
        std::string seen; // "" when the handler must not run
    } rows[] = {
        {"an event", 80, "7 1"}, {"exactly its header", 52, "7 0"},
        {"shorter than its header", 51, ""}, {"above 1 MiB", (1u << 20) + 1, ""},
    };
    for (const Row& row : rows) {
        seen.clear();
        int before = completions, handledBefore = handled;
        std::vector<uint32_t> indication = event(row.length);
        SLIndicationFunc(indication.data());
        for (int i = 0; i < 5000 && completions.load() == before; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        EXPECT_EQ(completions.load(), before + 1) << row.name;
        EXPECT_EQ(handled.load(), handledBefore + (row.seen.empty() ? 0 : 1)) << row.name;
        EXPECT_EQ(seen, row.seen) << row.name;
    }
    SLEventSetHandler(nullptr);
}

void* deliver(void* indication)
{
    SLIndicationFunc(indication);
    return nullptr;
}

// `hold` keeps the handler or the completion busy while `act` runs on a
// thread of its own; `act` must not be over before it is released.
void expectWaits(std::atomic<bool>& hold, std::atomic<int>& entered, const std::function<void()>& act)
{
    hold = true;
    int before = entered;
    std::vector<uint32_t> indication = event(80);
    pthread_t provider;
    ASSERT_EQ(pthread_create(&provider, nullptr, deliver, indication.data()), 0);
    while (entered.load() == before)
        std::this_thread::yield();
    std::atomic<bool> over{false};
    std::thread actor([&] {
        act();
        over = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_FALSE(over.load());
    hold = false;
    pthread_join(provider, nullptr);
    actor.join();
}

TEST(SLEvent, RemovingTheHandlerWaitsForEventThreads)
{
    ScriptedProvider p;
    SLEventSetHandler(handler);
    expectWaits(holdHandler, handled, [] { SLEventSetHandler(nullptr); });
}

// Without a handler the indication is completed inside the callback.
TEST(SLEvent, CleanupWaitsForAnIndicationBeingDelivered)
{
    ScriptedProvider p;
    expectWaits(holdCompletion, completions, [&] { p.cleanup(); });
}

} // namespace
