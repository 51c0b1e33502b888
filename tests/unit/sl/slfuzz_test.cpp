// Arbitrary indication bytes through the indication callback, the event and
// row accessors and the key-list copy. Run under AddressSanitizer, any read
// outside the indication's copy fails the test.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <cstdio>
#include <cstring>
#include <random>
#include <vector>

#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slstring.h"

namespace {

std::atomic<int> handled{0};
std::atomic<uint64_t> checksum{0};
std::atomic<unsigned> seed{0};
// How deep the random records led: rows with a readable value, key lists made.
std::atomic<int> valuesRead{0};
std::atomic<int> keyListsMade{0};

uint64_t mix(uint64_t sum, uint64_t value)
{
    return sum * 1099511628211ull ^ value;
}

uint64_t stringSum(const DmiString* s)
{
    if (s == nullptr)
        return 1;
    uint64_t sum = dmiStringLength(s);
    const char* text = dmiStringText(s);
    for (uint32_t i = 0; i < dmiStringLength(s); ++i)
        sum = mix(sum, static_cast<uint8_t>(text[i]));
    return sum;
}

// Reads everything an event handler could read, with indices drawn from the
// data itself and from a random generator.
int sweepingHandler(SLHandle* h)
{
    std::minstd_rand random(seed.fetch_add(1));
    uint64_t sum = 0;
    sum = mix(sum, SLIndicationType(h));
    sum = mix(sum, SLIndicationComponentId(h));
    uint32_t classes = SLEventClassCount(h);
    sum = mix(sum, classes);
    for (int round = 0; round < 24; ++round) {
        uint32_t c = round < 4 ? static_cast<uint32_t>(round) : static_cast<uint32_t>(random());
        if (round % 5 == 4)
            c = classes - 1;
        sum = mix(sum, SLEventComponentId(h, c));
        sum = mix(sum, stringSum(SLEventClassString(h, c)));
        uint32_t rows = SLEventRowCount(h, c);
        uint32_t r = round < 8 ? static_cast<uint32_t>(round % 3) : static_cast<uint32_t>(random() % (rows + 1));
        SLEventSelectRowCnf(h, c, r);
        sum = mix(sum, SLRowGroupId(h));
        uint32_t attributes = SLRowAttributeCount(h);
        for (uint32_t i = 0; i < 4; ++i) {
            uint32_t a = i < 3 ? i : attributes - 1;
            sum = mix(sum, SLRowAttributeId(h, a));
            sum = mix(sum, SLRowAttributeType(h, a));
            sum = mix(sum, SLRowUnsignedValue(h, a));
            sum = mix(sum, stringSum(SLRowStringPtr(h, a)));
            if (SLRowAttributePtr(h, a) != nullptr) {
                sum = mix(sum, 1);
                ++valuesRead;
            }
        }
        sum = mix(sum, static_cast<uint32_t>(SLKeyCount(h)));
        sum = mix(sum, static_cast<uint32_t>(SLKeyListOffset(h)));
        if (SLKeyList* keys = SLCreateKeyList(h)) {
            ++keyListsMade;
            for (uint32_t k = 0; k < keys->count; ++k)
                if (keys->keys[k].value != nullptr)
                    sum = mix(sum, keys->keys[k].type);
            sum = mix(sum, SLCompareKeyLists(keys, keys));
            SLDeleteKeyList(keys);
        }
    }
    // The component record of an install indication.
    sum = mix(sum, SLComponentId(h));
    sum = mix(sum, stringSum(SLComponentName(h)));
    uint32_t groups = SLComponentGroupCount(h);
    for (uint32_t g : {0u, 1u, groups - 1, groups})
        sum = mix(sum, stringSum(SLComponentGroupName(h, g)));
    for (uint32_t f : {0u, 1u, SLComponentFileCount(h)}) {
        sum = mix(sum, SLComponentFileType(h, f));
        sum = mix(sum, SLComponentFileData(h, f) != nullptr);
    }
    checksum.fetch_add(sum);
    ++handled;
    return 0;
}

// A well-formed event: one class whose rows (back to back) each carry keys
// of assorted types and attribute values, all inside `length` bytes.
void wellFormedEvent(std::vector<uint8_t>& ind, std::mt19937& random)
{
    uint32_t length = static_cast<uint32_t>(ind.size());
    uint8_t* b = ind.data();
    const uint32_t types[] = {1, 2, 3, 5, 6, 7, 8, 11};
    uint32_t at = 52;
    storeWord(b + at, 1); // class count
    uint32_t rowsWord = at + 4 + 12;
    at += 20;
    storeWord(b + rowsWord, at);
    uint32_t values = length / 2; // values in the upper half
    for (uint32_t row = 0; row < 3 && at + 80 < values; ++row) {
        uint32_t attributes = 1 + random() % 3;
        uint32_t keys = 1 + random() % 3;
        uint32_t keyList = at + 16 + 16 * attributes;
        storeWord(b + at, 10 + row);
        storeWord(b + at + 4, keys);
        storeWord(b + at + 8, keyList);
        storeWord(b + at + 12, attributes);
        auto value = [&](uint32_t type) -> uint32_t {
            uint32_t size = type == 7 || type == 8 ? 4 + random() % 12 : SLAttributeSize(static_cast<int>(type), nullptr);
            if (values + size > length)
                return 0;
            uint32_t offset = values;
            if (type == 7 || type == 8)
                storeWord(b + offset, size - 4);
            values += size;
            return offset;
        };
        for (uint32_t a = 0; a < attributes; ++a) {
            uint32_t type = types[random() % 8];
            storeWord(b + at + 16 + 16 * a + 4, a + 1);
            storeWord(b + at + 16 + 16 * a + 8, type);
            storeWord(b + at + 16 + 16 * a + 12, value(type));
        }
        for (uint32_t k = 0; k < keys; ++k) {
            uint32_t type = types[random() % 8];
            storeWord(b + keyList + 12 * k, k + 1);
            storeWord(b + keyList + 12 * k + 4, type);
            storeWord(b + keyList + 12 * k + 8, random() % 4 ? value(type) : 0);
        }
        at = keyList + 12 * keys;
    }
    storeWord(b + rowsWord - 4, 3); // row count
}

// An indication of random bytes with a plausible header: most are well-formed
// events with a few bytes or words spoiled, so that the walks go deep and then
// meet damage; the rest are random throughout.
std::vector<uint8_t> randomIndication(std::mt19937& random)
{
    uint32_t length = 200 + random() % 1400;
    std::vector<uint8_t> ind(length);
    for (auto& b : ind)
        b = static_cast<uint8_t>(random());
    bool structured = random() % 4 != 0;
    if (structured) {
        wellFormedEvent(ind, random);
        for (uint32_t spoil = random() % 4; spoil > 0; --spoil) {
            uint32_t at = 52 + random() % (length - 56);
            if (random() % 2)
                ind[at] = static_cast<uint8_t>(random());
            else
                storeWord(ind.data() + at, random() % 3 ? random() % (length + 64) : static_cast<uint32_t>(random()));
        }
    }
    storeWordAt(ind.data(), 0, random() % 4 ? SL_LEVEL_CHECK : static_cast<uint32_t>(random()));
    storeWordAt(ind.data(), 1, structured ? 1 : 1 + random() % 3);
    storeWordAt(ind.data(), 2, length - (random() % 3 ? 0 : random() % (length - 51)));
    storeWordAt(ind.data(), 11, 0);
    storeWordAt(ind.data(), 12, structured ? 52 : 52 + random() % (length - 51));
    return ind;
}

// Lets the event threads catch up, so that few run at a time.
void awaitHandled(int value)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (handled.load() < value && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::microseconds(200));
}

TEST(SLFuzz, ArbitraryIndicationBytes)
{
    std::mt19937 random(20261206);
    handled = 0;
    valuesRead = 0;
    keyListsMade = 0;
    unsigned live = slLiveStringCount();
    SLEventInitialize();
    SLEventSetHandler(sweepingHandler);
    constexpr int rounds = 3000;
    for (int i = 0; i < rounds; ++i) {
        auto ind = randomIndication(random);
        // The event thread reads only its copy: the indication may go now.
        SLIndicationFunc(ind.data());
        if (i % 64 == 63 || i == rounds - 1)
            awaitHandled(i + 1);
    }
    SLEventSetHandler(nullptr);
    EXPECT_EQ(handled.load(), rounds);
    EXPECT_EQ(slLiveStringCount(), live);
    // The generator must reach rows and keys, or the test proves little.
    EXPECT_GT(valuesRead.load(), 1000);
    EXPECT_GT(keyListsMade.load(), 100);
    std::printf("rows with values read: %d, key lists made: %d\n", valuesRead.load(), keyListsMade.load());
}

TEST(SLFuzz, ArbitraryConfirmBytesThroughTheKeyCopy)
{
    std::mt19937 random(7);
    int made = 0;
    for (int i = 0; i < 20000; ++i) {
        SLHandle* h = SLCreateHandle(0);
        std::memset(h->command, 0, SL_COMMAND_SIZE);
        for (uint32_t at = 0; at < 1024; at += 4)
        {
            // Small counts and types, offsets inside the written part, and
            // arbitrary words, in equal shares.
            uint32_t pick = random() % 3;
            uint32_t w = static_cast<uint32_t>(random());
            storeWord(h->confirm + at, pick == 0 ? w % 12 : pick == 1 ? w % 1100 : w);
        }
        // Leave the end of the buffer random too: a walk may reach it.
        for (uint32_t at = SL_MIN_CONFIRM_SIZE - 256; at < SL_MIN_CONFIRM_SIZE; at += 4)
            storeWord(h->confirm + at, static_cast<uint32_t>(random()));
        const uint32_t codes[] = {516, 518, 772, 773, 774};
        storeWordAt(h->command, 1, codes[random() % 5]);
        if (SLKeyList* keys = SLCreateKeyList(h)) {
            EXPECT_LE(keys->count, SL_MAX_KEYS);
            ++made;
            SLDeleteKeyList(keys);
        }
        SLRowAttributePtr(h, random() % 8);
        SLRowStringPtr(h, random() % 8);
        SLDestroyHandle(h);
    }
    std::printf("key lists made from random confirms: %d\n", made);
    EXPECT_GT(made, 100);
}

} // namespace
