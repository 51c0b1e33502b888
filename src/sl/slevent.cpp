#include "sl/slevent.h"

#include <atomic>
#include <cstring>
#include <ctime>
#include <pthread.h>
#include <sched.h>

#include "base/threadcheck.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"

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

// Holds an indication of `length` bytes in `h` as the accessors read it: all
// of it in the confirm buffer, its header also in the command block, no row
// selected, and `origin` as the indication to complete.
void holdIndication(SLHandle* h, const void* indication, uint32_t length, const void* origin)
{
    std::memcpy(h->command, indication, headerBytes);
    storeWordAt(h->command, 13, 0);
    storeWordAt(h->command, 14, 0);
    storeWordAt(h->command, 15, pointerWord(origin));
    if (indication != h->confirm)
        std::memcpy(h->confirm, indication, length);
    // Whatever reads past the indication's end finds zeros, not old heap.
    std::memset(h->confirm + length, 0, h->confirmSize - length);
}

// Lays out an event indication in `out`, or with a null `out` only counts
// it; the bytes it takes. Rows back to back, as under SL_LEVEL_CHECK, their
// keys and values behind all of them; values 4-byte aligned.
uint32_t layEventIndication(uint8_t* out, uint32_t component, const DmiString* const* classes,
                            SLHandle* const* rows, uint32_t count)
{
    uint32_t used = 0;
    auto word = [out](uint32_t at, uint32_t value) {
        if (out != nullptr)
            storeWord(out + at, value);
    };
    // The offset of a copy of `size` bytes at `from`; 0 (absent) for none.
    auto copy = [out, &used](const void* from, uint64_t size) -> uint32_t {
        if (from == nullptr || size == 0)
            return 0;
        uint32_t at = used;
        used += static_cast<uint32_t>((size + 3) & ~3ull);
        if (out != nullptr)
            std::memcpy(out + at, from, size);
        return at;
    };
    used = headerBytes;
    word(0, SL_LEVEL_CHECK);
    word(4, 1);
    word(12, component);
    word(48, headerBytes);
    uint32_t data = used;
    used += 4 + 16 * count;
    word(data, count);
    uint32_t rowAt = used;
    for (uint32_t i = 0; i < count; ++i)
        used += 16 + 16 * slRowAttributesPresent(rows[i]);
    for (uint32_t i = 0; i < count; ++i) {
        SLHandle* r = rows[i];
        uint32_t entries = slRowAttributesPresent(r);
        uint32_t entry = data + 4 + 16 * i;
        word(entry, component);
        word(entry + 4, copy(classes[i], 4ull + dmiStringLength(classes[i])));
        word(entry + 8, 1);
        word(entry + 12, rowAt);
        word(rowAt, SLRowGroupId(r));
        uint32_t keyCount = static_cast<uint32_t>(SLKeyCount(r));
        const uint8_t* keys = slConfirmBytes(r, static_cast<uint32_t>(SLKeyListOffset(r)), 12ull * keyCount);
        uint32_t keyList = keys != nullptr ? copy(keys, 12ull * keyCount) : 0;
        word(rowAt + 4, keyList != 0 ? keyCount : 0);
        word(rowAt + 8, keyList);
        for (uint32_t k = 0; keyList != 0 && k < keyCount; ++k) {
            uint32_t type = loadWordAt(keys + 12 * k, 1);
            uint32_t offset = loadWordAt(keys + 12 * k, 2);
            const uint8_t* length = slConfirmBytes(r, offset, 4);
            uint64_t size = type == DMI_OCTETSTRING || type == DMI_DISPLAYSTRING
                                ? (length != nullptr ? 4ull + loadWord(length) : 0)
                                : SLAttributeSize(static_cast<int>(type), nullptr);
            word(keyList + 12 * k + 8, copy(slConfirmBytes(r, offset, size), size));
        }
        word(rowAt + 12, entries);
        for (uint32_t a = 0; a < entries; ++a) {
            uint32_t at = rowAt + 16 + 16 * a;
            uint32_t type = SLRowAttributeType(r, a);
            const void* value = SLRowAttributePtr(r, a);
            word(at + 4, SLRowAttributeId(r, a));
            word(at + 8, type);
            word(at + 12, copy(value, value != nullptr ? SLAttributeSize(static_cast<int>(type), value) : 0));
        }
        rowAt += 16 + 16 * entries;
    }
    word(8, used);
    return used;
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
        holdIndication(h, indication, length, indication);
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

SLHandle* slMakeEventIndication(uint32_t component, const DmiString* const* classes, SLHandle* const* rows,
                                uint32_t count)
{
    uint32_t length = layEventIndication(nullptr, component, classes, rows, count);
    SLHandle* h = SLCreateHandle(length);
    if (h == nullptr)
        return nullptr;
    std::memset(h->confirm, 0, h->confirmSize);
    layEventIndication(h->confirm, component, classes, rows, count);
    holdIndication(h, h->confirm, length, nullptr);
    return h;
}
