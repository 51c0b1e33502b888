#include "sl/slevent.h"

#include <atomic>
#include <cstring>
#include <ctime>
#include <pthread.h>
#include <sched.h>

#include "base/threadcheck.h"
#include "sl/slhandle.h"

namespace {

std::atomic<SLIndicationHandler> userHandler{nullptr};
std::atomic<int> slEventThreads{0}; // started and not yet finished
std::atomic<int> callsInside{0};     // calls of SLIndicationFunc under way

// The indication header: 13 words, copied into the command block.
constexpr uint32_t headerWords = 13;
constexpr uint32_t headerBytes = 4 * headerWords;
// An indication is a few kilobytes; one that claims more than this is taken
// for garbage rather than copied.
constexpr uint32_t maxIndicationSize = 1u << 20;
// Event threads run the handler, which copies the handle into the event
// queue: a small stack lets hundreds of them coexist in a 32-bit process.
constexpr size_t eventThreadStack = 64 * 1024;
constexpr long handlerPollNs = 5 * 1000 * 1000;

using Completion = void (*)(void* indication);

Completion completionOf(const void* indication)
{
    return reinterpret_cast<Completion>(wordPointer(loadWordAt(indication, 11)));
}

bool startEventThread(SLHandle* h)
{
    pthread_attr_t attributes;
    if (pthread_attr_init(&attributes) != 0)
        return false;
    pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    pthread_attr_setstacksize(&attributes, eventThreadStack);
    // Counted before the start: a thread that finishes at once must not
    // bring the count below the threads still running.
    slEventThreads.fetch_add(1);
    pthread_t thread;
    int rc = pthread_create(&thread, &attributes, SLEventThread, h);
    pthread_attr_destroy(&attributes);
    if (rc != 0) {
        slEventThreads.fetch_sub(1);
        return false;
    }
    return true;
}

} // namespace

extern "C" {

void SLEventInitialize(void)
{
    userHandler = nullptr;
    slEventThreads = 0;
}

void SLEventCleanup(void)
{
    userHandler = nullptr;
}

void slEventQuiesce(void)
{
    userHandler = nullptr;
    while (callsInside.load() != 0)
        sched_yield();
    MOX_RECEIVE(&callsInside);
    // Event threads already started still use their handles (and the handler
    // they read before the handler was removed): they finish first.
    while (slEventThreads.load() != 0) {
        timespec poll{0, 1000 * 1000};
        nanosleep(&poll, nullptr);
    }
    MOX_RECEIVE(&slEventThreads);
}

void SLEventSetHandler(SLIndicationHandler handler)
{
    userHandler = handler;
    if (handler != nullptr)
        return;
    // No thread of this module calls the old handler once this returns.
    while (slEventThreads.load() != 0) {
        timespec poll{0, handlerPollNs};
        nanosleep(&poll, nullptr);
    }
    MOX_RECEIVE(&slEventThreads); // everything the finished threads did
}

void SLIndicationFunc(void* indication)
{
    if (indication == nullptr)
        return;
    ++callsInside;
    uint32_t length = loadWordAt(indication, 2);
    // A length that cannot hold the header, or is absurd, is not copied: the
    // indication is completed and dropped. Without a handler no handle is
    // made, so that a call racing SLCleanup touches no SL memory.
    bool sane = length >= headerBytes && length <= maxIndicationSize;
    SLHandle* h = sane && userHandler.load() != nullptr ? SLCreateHandle(length) : nullptr;
    if (h != nullptr && userHandler.load() != nullptr) {
        std::memcpy(h->command, indication, headerBytes);
        storeWordAt(h->command, 13, 0);
        storeWordAt(h->command, 14, 0);
        storeWordAt(h->command, 15, pointerWord(indication));
        std::memcpy(h->confirm, indication, length);
        // Whatever reads past the indication's end finds zeros, not old heap.
        std::memset(h->confirm + length, 0, h->confirmSize - length);
        if (startEventThread(h)) {
            --callsInside;
            return; // now in the event thread's care
        }
    }
    if (Completion complete = completionOf(indication))
        complete(indication);
    SLDestroyHandle(h);
    MOX_PUBLISH(&callsInside);
    --callsInside;
}

void* SLEventThread(void* handle)
{
    auto* h = static_cast<SLHandle*>(handle);
    Completion complete = reinterpret_cast<Completion>(wordPointer(loadWordAt(h->command, 11)));
    void* indication = wordPointer(loadWordAt(h->command, 15));
    sched_yield();
    // Read now: a handler removed since the start is not called.
    if (SLIndicationHandler handler = userHandler.load())
        handler(h);
    if (complete != nullptr)
        complete(indication);
    SLDestroyHandle(h);
    MOX_PUBLISH(&slEventThreads);
    slEventThreads.fetch_sub(1);
    return nullptr;
}

} // extern "C"
