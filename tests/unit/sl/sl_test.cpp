#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <climits>
#include <cstring>
#include <functional>
#include <map>
#include <new>
#include <string>
#include <thread>

#include "base/sleep.h"
#include "scripted_provider.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

using sltest::Reply;
using sltest::ScriptedProvider;

constexpr uint32_t filler = 0xA5A5A5A5;

// A handle whose command block is filled with a pattern, so that words a
// command leaves alone can be told from words it writes.
SLHandle* patternHandle()
{
    SLHandle* h = SLCreateHandle(0);
    for (uint32_t i = 0; i < SL_COMMAND_SIZE / 4; ++i)
        storeWordAt(h->command, i, filler);
    return h;
}

// A key list record built by hand, as the catalogue builds them.
struct Keys {
    SLKeyList list{};
    std::vector<std::vector<uint8_t>> values;
    Keys& add(uint32_t id, uint32_t type, std::vector<uint8_t> value)
    {
        values.push_back(std::move(value));
        list.keys[list.count] = {id, type, values.back().empty() ? nullptr : values.back().data()};
        ++list.count;
        return *this;
    }
    Keys& integer(uint32_t id, uint32_t value)
    {
        std::vector<uint8_t> bytes(4);
        storeWord(bytes.data(), value);
        return add(id, DMI_INTEGER, bytes);
    }
    Keys& text(uint32_t id, const std::string& s)
    {
        std::vector<uint8_t> bytes(4 + s.size());
        storeWord(bytes.data(), static_cast<uint32_t>(s.size()));
        std::copy(s.begin(), s.end(), bytes.begin() + 4);
        return add(id, DMI_DISPLAYSTRING, bytes);
    }
    Keys() { values.reserve(SL_MAX_KEYS + 1); }
};

// One command family: the call, its code, and the parameter words it sets
// (index to value); every other word from 16 to 23 must keep the pattern.
struct Placement {
    const char* name;
    std::function<int(SLHandle*)> call;
    uint32_t code;
    std::map<uint32_t, uint32_t> words;
    std::string text; // expected at offset 84, when not empty
};

TEST(SLCommand, WordPlacementOfEachCommandFamily)
{
    const uint32_t pairs[] = {11, 12, 13, 14};
    std::vector<Placement> table = {
        {"list component with filter", [](SLHandle* h) { return SLListComponent(h, "Base", 7); }, 512,
         {{16, 7}, {17, 80}, {18, 0}, {20, 4}}, "Base"},
        {"list component without filter", [](SLHandle* h) { return SLListComponent(h, nullptr, 7); }, 512,
         {{16, 7}, {17, 0}, {18, 0}}, ""},
        {"list first component", [](SLHandle* h) { return SLListFirstComponent(h, "X"); }, 513,
         {{16, 0}, {17, 80}, {18, 0}, {20, 1}}, "X"},
        {"list next component", [](SLHandle* h) { return SLListNextComponent(h, nullptr, 3); }, 514,
         {{16, 3}, {17, 0}, {18, 0}}, ""},
        {"component description", [](SLHandle* h) { return SLListComponentDesc(h, 3); }, 515,
         {{16, 3}, {19, 0}}, ""},
        {"list group", [](SLHandle* h) { return SLListGroup(h, 3, 4); }, 516, {{16, 3}, {17, 4}}, ""},
        {"list first group", [](SLHandle* h) { return SLListFirstGroup(h, 3); }, 517, {{16, 3}}, ""},
        {"list next group", [](SLHandle* h) { return SLListNextGroup(h, 3, 4); }, 518, {{16, 3}, {17, 4}}, ""},
        {"group description", [](SLHandle* h) { return SLListGroupDesc(h, 3, 4); }, 519,
         {{16, 3}, {17, 4}, {19, 0}}, ""},
        {"list attribute", [](SLHandle* h) { return SLListAttribute(h, 3, 4, 5); }, 520,
         {{16, 3}, {17, 4}, {18, 5}}, ""},
        {"list first attribute", [](SLHandle* h) { return SLListFirstAttribute(h, 3, 4); }, 521,
         {{16, 3}, {17, 4}}, ""},
        {"list next attribute", [](SLHandle* h) { return SLListNextAttribute(h, 3, 4, 5); }, 522,
         {{16, 3}, {17, 4}, {18, 5}}, ""},
        {"attribute description", [](SLHandle* h) { return SLListAttributeDesc(h, 3, 4, 5); }, 523,
         {{16, 3}, {17, 4}, {18, 5}, {19, 0}}, ""},
        {"get attribute", [](SLHandle* h) { return SLGetAttribute(h, 3, 4, 5, nullptr); }, 768,
         {{16, 3}, {17, 4}, {18, 0}, {19, 0}, {20, 5}}, ""},
        {"reserve attribute", [](SLHandle* h) { return SLReserveAttribute(h, 3, 4, 5, nullptr); }, 770,
         {{16, 3}, {17, 4}, {18, 0}, {19, 0}, {20, 5}, {21, 88}}, ""},
        {"release attribute", [](SLHandle* h) { return SLReleaseAttribute(h, 3, 4, 5, nullptr); }, 771,
         {{16, 3}, {17, 4}, {18, 0}, {19, 0}, {20, 5}, {21, 88}}, ""},
        {"get row", [](SLHandle* h) { return SLGetRow(h, 3, 4, 5, nullptr); }, 772,
         {{16, 3}, {17, 4}, {18, 0}, {19, 0}, {20, 5}}, ""},
        {"get first row", [](SLHandle* h) { return SLGetFirstRow(h, 3, 4, 5, nullptr); }, 773,
         {{16, 3}, {17, 4}, {18, 0}, {19, 0}, {20, 5}}, ""},
        {"get next row without keys is get first row",
         [](SLHandle* h) { return SLGetNextRow(h, 3, 4, 5, nullptr); }, 773,
         {{16, 3}, {17, 4}, {18, 0}, {19, 0}, {20, 5}}, ""},
        {"register component interface", [&](SLHandle* h) { return SLRegisterCi(h, 1, 2, 3, 2, pairs); }, 1024,
         {{16, 1}, {17, 2}, {18, 3}, {19, 2}, {20, 11}, {21, 12}, {22, 13}, {23, 14}}, ""},
        {"unregister component interface", [](SLHandle* h) { return SLUnregisterCi(h, 9); }, 1025, {{16, 9}}, ""},
        {"install data", [](SLHandle* h) { return SLCiInstallData(h, 6, "/m/a.mif"); }, 1026,
         {{16, 6}, {17, 1}, {18, 2}, {19, 80}, {20, 8}}, std::string("/m/a.mif\0", 9)},
        {"uninstall data", [](SLHandle* h) { return SLCiUninstallData(h, 6); }, 1027, {{16, 6}}, ""},
        {"unregister", [](SLHandle* h) { return SLDmiUnregisterMgmt(h); }, 257, {}, ""},
    };
    for (const Placement& p : table) {
        SCOPED_TRACE(p.name);
        ScriptedProvider provider;
        SLHandle* h = patternHandle();
        ASSERT_EQ(p.call(h), 0);
        ASSERT_EQ(provider.blocks.size(), 1u);
        EXPECT_EQ(provider.code(0), p.code);
        // The header as handed over.
        EXPECT_EQ(provider.word(0, 0), SL_LEVEL_CHECK);
        EXPECT_EQ(provider.word(0, 2), 4096u);
        EXPECT_EQ(provider.word(0, 3), 0u);
        EXPECT_EQ(provider.word(0, 4), 0u);
        EXPECT_EQ(provider.word(0, 5), 0u);
        EXPECT_EQ(provider.word(0, 6), 0u);
        EXPECT_EQ(provider.word(0, 7), 8192u);
        EXPECT_EQ(provider.word(0, 8), pointerWord(h->confirm));
        EXPECT_EQ(provider.word(0, 9), 1u);
        EXPECT_EQ(provider.word(0, 10), 0u);
        EXPECT_EQ(provider.word(0, 11), 0u);
        for (uint32_t w = 16; w <= 23; ++w) {
            auto expected = p.words.find(w);
            if (expected != p.words.end()) {
                EXPECT_EQ(provider.word(0, w), expected->second) << "word " << w;
            } else if (p.text.empty() || w < 21) {
                EXPECT_EQ(provider.word(0, w), filler) << "word " << w << " must be left alone";
            }
        }
        if (!p.text.empty()) {
            EXPECT_EQ(std::string(reinterpret_cast<const char*>(provider.blocks[0].data()) + 84, p.text.size()),
                      p.text);
        }
    }
}

TEST(SLCommand, RegisterPlacesTheCallbacksAndKeepsTheManagementHandle)
{
    ScriptedProvider provider;
    Reply registered;
    registered.fill = [](uint8_t* confirm, uint32_t) { storeWordAt(confirm, 2, 0x51); };
    provider.push(registered);
    SLHandle* h = patternHandle();
    ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return 0; }), 0);
    EXPECT_EQ(provider.code(0), 256u);
    EXPECT_EQ(provider.word(0, 16), pointerWord(reinterpret_cast<void*>(&dmiConfirmFunc)));
    EXPECT_EQ(provider.word(0, 17), pointerWord(reinterpret_cast<void*>(&SLIndicationFunc)));
    EXPECT_EQ(provider.word(0, 3), 0u) << "before registration";

    // Later commands carry the management handle, except 1026 and 1027, which
    // complete without a confirm.
    Reply noConfirm;
    noConfirm.confirm = false;
    noConfirm.status = 1;
    provider.push(Reply{});
    provider.push(noConfirm);
    provider.push(noConfirm);
    EXPECT_EQ(SLListFirstGroup(h, 1), 0);
    EXPECT_EQ(SLCiInstallData(h, 0, "x"), 0);
    EXPECT_EQ(SLCiUninstallData(h, 2), 0);
    EXPECT_EQ(provider.word(1, 3), 0x51u);
    EXPECT_EQ(provider.word(2, 3), 0u);
    EXPECT_EQ(provider.word(3, 3), 0u);
    ASSERT_EQ(SLDmiUnregisterMgmt(h), 0);
    EXPECT_EQ(provider.word(4, 3), 0x51u);
}

TEST(SLCommand, HandlerIsInPlaceBeforeTheRegisterCommandCompletes)
{
    ScriptedProvider provider;
    static std::atomic<int> handled{0};
    handled = 0;
    static uint8_t indication[64];
    storeWordAt(indication, 1, 1);
    storeWordAt(indication, 2, sizeof indication);
    // The provider delivers an indication while the register command is
    // still outstanding.
    Reply registered;
    registered.fill = [](uint8_t* confirm, uint32_t) {
        SLIndicationFunc(indication);
        storeWordAt(confirm, 2, 1);
    };
    provider.push(registered);
    SLHandle* h = SLCreateHandle(0);
    ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return ++handled; }), 0);
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (handled == 0 && std::chrono::steady_clock::now() < deadline)
        std::this_thread::yield();
    EXPECT_EQ(handled.load(), 1);
    SLDmiUnregisterMgmt(h);
}

TEST(SLCommand, FailedRegistrationRemovesTheHandler)
{
    ScriptedProvider provider;
    static std::atomic<int> handled{0};
    handled = 0;
    Reply failed;
    failed.status = 2;
    provider.push(failed);
    SLHandle* h = SLCreateHandle(0);
    EXPECT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return ++handled; }), 1);
    // An indication now reaches no handler: it is completed at once.
    static std::atomic<int> completed{0};
    completed = 0;
    uint8_t indication[64] = {};
    storeWordAt(indication, 1, 1);
    storeWordAt(indication, 2, sizeof indication);
    void (*complete)(void*) = [](void*) { ++completed; };
    storeWordAt(indication, 11, pointerWord(reinterpret_cast<void*>(complete)));
    SLIndicationFunc(indication);
    EXPECT_EQ(completed.load(), 1);
    EXPECT_EQ(handled.load(), 0);
}

TEST(SLCommand, KeyEncodingOffsets)
{
    ScriptedProvider provider;
    SLHandle* h = patternHandle();
    uint32_t value = 0x01020304;

    // Without keys the value sits at 88.
    ASSERT_EQ(SLSetAttribute(h, 3, 4, 5, nullptr, 4, &value), 0);
    EXPECT_EQ(provider.code(0), 769u);
    EXPECT_EQ(provider.word(0, 18), 0u);
    EXPECT_EQ(provider.word(0, 19), 0u);
    EXPECT_EQ(provider.word(0, 21), 88u);
    EXPECT_EQ(loadWord(provider.blocks[0].data() + 88), value);

    // One type-5 key: its entry at 88, its value at 100, the value at 104.
    Keys one;
    one.integer(9, 77);
    ASSERT_EQ(SLSetAttribute(h, 3, 4, 5, &one.list, 4, &value), 0);
    const uint8_t* b = provider.blocks[1].data();
    EXPECT_EQ(provider.word(1, 18), 1u);
    EXPECT_EQ(provider.word(1, 19), 88u);
    EXPECT_EQ(loadWord(b + 88), 9u);
    EXPECT_EQ(loadWord(b + 92), 5u);
    EXPECT_EQ(loadWord(b + 96), 100u);
    EXPECT_EQ(loadWord(b + 100), 77u);
    EXPECT_EQ(provider.word(1, 21), 104u);
    EXPECT_EQ(loadWord(b + 104), value);

    // A type-8 key of count 5 takes 9 bytes; the type-5 key after it is
    // unaligned, and so is the attribute value. A key without a value keeps
    // the running offset and still advances by its type's size.
    Keys mixed;
    mixed.text(1, "hello").integer(2, 0xCAFE).add(3, DMI_COUNTER, {});
    ASSERT_EQ(SLSetAttribute(h, 3, 4, 5, &mixed.list, 4, &value), 0);
    b = provider.blocks[2].data();
    const uint32_t values = 88 + 36;
    EXPECT_EQ(provider.word(2, 18), 3u);
    EXPECT_EQ(loadWord(b + 88 + 8), values);
    EXPECT_EQ(loadWord(b + values), 5u);
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(b) + values + 4, 5), "hello");
    EXPECT_EQ(loadWord(b + 88 + 20), values + 9);
    EXPECT_EQ(loadWord(b + values + 9), 0xCAFEu);
    EXPECT_EQ(loadWord(b + 88 + 32), values + 13) << "a key without value keeps the running offset";
    EXPECT_EQ(provider.word(2, 21), values + 17);
    EXPECT_EQ(loadWord(b + values + 17), value);

    // Get-attribute and the row commands put the keys at 84; only the first
    // list of a chain is encoded.
    Keys chained;
    chained.integer(4, 1);
    mixed.list.next = &chained.list;
    ASSERT_EQ(SLGetNextRow(h, 3, 4, 5, &mixed.list), 0);
    EXPECT_EQ(provider.code(3), 774u);
    EXPECT_EQ(provider.word(3, 18), 3u);
    EXPECT_EQ(provider.word(3, 19), 84u);
    b = provider.blocks[3].data();
    EXPECT_EQ(loadWord(b + 84), 1u);
    EXPECT_EQ(loadWord(b + 84 + 8), 84u + 36);
    EXPECT_EQ(loadWord(b + 84 + 24), 3u) << "third key of the first list, not the chained one";
    ASSERT_EQ(SLGetAttribute(h, 3, 4, 5, &one.list), 0);
    EXPECT_EQ(provider.word(4, 19), 84u);
    EXPECT_EQ(loadWord(provider.blocks[4].data() + 84 + 8), 96u);
}

TEST(SLCommand, ParametersThatDoNotFitTheCommandBlockAreRefusedUnsent)
{
    ScriptedProvider provider;
    SLHandle* h = SLCreateHandle(0);
    std::string longest(4096 - 84, 'f');
    std::string path(4096 - 84 - 1, 'p');
    Keys bigKey;
    bigKey.text(1, std::string(4096 - 88 - 12 - 4, 'k'));
    Keys tooBigKey;
    tooBigKey.text(1, std::string(4096 - 88 - 12 - 4 + 1, 'k'));
    Keys eleven;
    for (uint32_t i = 0; i < 10; ++i)
        eleven.integer(i, i);
    std::vector<uint8_t> value(4096 - 88);
    std::vector<uint32_t> pairs(2 * 503);

    struct Case {
        const char* name;
        std::function<int()> call;
        bool fits;
    };
    std::vector<Case> cases = {
        {"filter filling the block", [&] { return SLListComponent(h, longest.c_str(), 0); }, true},
        {"filter one byte over", [&] { return SLListComponent(h, (longest + "f").c_str(), 0); }, false},
        {"path with terminator filling the block", [&] { return SLCiInstallData(h, 0, path.c_str()); }, true},
        {"path one byte over", [&] { return SLCiInstallData(h, 0, (path + "p").c_str()); }, false},
        {"null path", [&] { return SLCiInstallData(h, 0, nullptr); }, false},
        {"key filling the block", [&] { return SLSetAttribute(h, 1, 2, 3, &bigKey.list, 0, nullptr); }, true},
        {"key one byte over", [&] { return SLSetAttribute(h, 1, 2, 3, &tooBigKey.list, 0, nullptr); }, false},
        {"key over at 84", [&] { return SLGetRow(h, 1, 2, 3, &tooBigKey.list); }, true},
        {"value filling the block", [&] { return SLSetAttribute(h, 1, 2, 3, nullptr, 4008, value.data()); }, true},
        {"value one byte over", [&] { return SLSetAttribute(h, 1, 2, 3, nullptr, 4009, value.data()); }, false},
        {"value after keys over", [&] { return SLSetAttribute(h, 1, 2, 3, &bigKey.list, 1, value.data()); }, false},
        {"value without data", [&] { return SLSetAttribute(h, 1, 2, 3, nullptr, 4, nullptr); }, false},
        {"ten keys", [&] { return SLGetRow(h, 1, 2, 3, &eleven.list); }, true},
        {"eleven keys", [&] { eleven.list.count = 11; return SLGetRow(h, 1, 2, 3, &eleven.list); }, false},
        {"502 pairs", [&] { return SLRegisterCi(h, 1, 2, 3, 502, pairs.data()); }, true},
        {"503 pairs", [&] { return SLRegisterCi(h, 1, 2, 3, 503, pairs.data()); }, false},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        size_t before = provider.blocks.size();
        EXPECT_EQ(c.call(), c.fits ? 0 : 1);
        EXPECT_EQ(provider.blocks.size(), before + (c.fits ? 1 : 0));
    }
}

TEST(SLCommand, CommandHandlesCountFromZeroAndCancelNamesTheLastCommand)
{
    ScriptedProvider provider;
    SLHandle* a = SLCreateHandle(0);
    SLHandle* b = SLCreateHandle(0);
    ASSERT_EQ(SLListFirstGroup(a, 1), 0);
    ASSERT_EQ(SLListFirstGroup(b, 1), 0);
    ASSERT_EQ(SLCancel(a), 0);
    ASSERT_EQ(SLListFirstGroup(b, 1), 0);
    ASSERT_EQ(SLCancel(b), 0);
    ASSERT_EQ(provider.blocks.size(), 5u);
    EXPECT_EQ(provider.word(0, 4), 0u);
    EXPECT_EQ(provider.word(1, 4), 1u);
    EXPECT_EQ(provider.code(2), 258u);
    EXPECT_EQ(provider.word(2, 4), 0u) << "cancel names a's command";
    EXPECT_EQ(provider.word(3, 4), 2u) << "a cancel consumes no number";
    EXPECT_EQ(provider.word(4, 4), 2u);
}

TEST(SLCommand, ConcurrentCommandsGetDistinctHandles)
{
    ScriptedProvider provider;
    constexpr int perThread = 50;
    auto issue = [] {
        SLHandle* h = SLCreateHandle(0);
        for (int i = 0; i < perThread; ++i)
            SLListFirstGroup(h, 1);
    };
    std::thread t1(issue), t2(issue);
    t1.join();
    t2.join();
    std::vector<uint32_t> seen;
    for (size_t i = 0; i < provider.blocks.size(); ++i)
        seen.push_back(provider.word(i, 4));
    std::sort(seen.begin(), seen.end());
    ASSERT_EQ(seen.size(), 2u * perThread);
    for (uint32_t i = 0; i < seen.size(); ++i)
        EXPECT_EQ(seen[i], i);
}

TEST(SLCommand, ProviderAnswersAndResults)
{
    struct Case {
        const char* name;
        std::vector<Reply> replies;
        int result;
        size_t invocations;
        std::vector<unsigned> sleeps;
        uint32_t status;
    };
    Reply busy;
    busy.invokeResult = 529;
    Reply refused;
    refused.invokeResult = 3;
    Reply ok;
    Reply okOne;
    okOne.status = 1;
    Reply failed;
    failed.status = 2;
    std::vector<Case> cases = {
        {"accepted, status 0", {ok}, 0, 1, {}, 0},
        {"status 1 counts as success", {okOne}, 0, 1, {}, 1},
        {"status 2 fails, readable", {failed}, 1, 1, {}, 2},
        {"busy once, then accepted", {busy, ok}, 0, 2, {5000}, 0},
        {"busy twice", {busy, busy}, 1, 2, {5000, 5000}, 0},
        {"refused at once", {refused}, 1, 1, {}, 0},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        ScriptedProvider provider;
        for (const Reply& r : c.replies)
            provider.push(r);
        SLHandle* h = SLCreateHandle(0);
        EXPECT_EQ(SLListNextAttribute(h, 1, 2, 3), c.result);
        EXPECT_EQ(provider.blocks.size(), c.invocations);
        EXPECT_EQ(sltest::sleepRequests(), c.sleeps);
        EXPECT_EQ(SLCnfStatus(h), c.status);
    }
}

TEST(SLCommand, BusyOnceSleepsFiveSecondsInEarnest)
{
    ScriptedProvider provider;
    moxSetSleepHook(nullptr);
    Reply busy;
    busy.invokeResult = 529;
    provider.push(busy);
    SLHandle* h = SLCreateHandle(0);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(SLListFirstGroup(h, 1), 0);
    double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    EXPECT_GE(seconds, 5.0);
    EXPECT_LT(seconds, 6.5);
    EXPECT_EQ(provider.blocks.size(), 2u);
}

TEST(SLCommand, UninitialisedLibrarySendsNothing)
{
    ScriptedProvider provider;
    SLDmiInvoke = nullptr;
    SLHandle* h = SLCreateHandle(0);
    EXPECT_EQ(SLListFirstGroup(h, 1), 1);
    EXPECT_EQ(SLCancel(nullptr), 1);
    EXPECT_TRUE(provider.blocks.empty());
}

TEST(SLCommand, InitialiseInstallsTheProviderEntryPoint)
{
    ScriptedProvider provider;
    provider.cleanupNow();
    SLDmiInvoke = nullptr;
    SLInitialize();
    EXPECT_NE(SLDmiInvoke, nullptr);
    EXPECT_EQ(SLDmiInvoke, &DmiInvoke);
    SLCleanup();
}

TEST(SLCommand, CleanupDuringTheWaitEndsItWithStatus522)
{
    ScriptedProvider provider;
    Reply never;
    never.confirm = false;
    provider.push(never);
    // A handle record outside SL memory, so that it outlives the cleanup.
    alignas(SLHandle) static unsigned char storage[sizeof(SLHandle) + SL_MIN_CONFIRM_SIZE];
    auto* h = std::launder(new (storage) SLHandle);
    h->next = h->prev = h;
    h->confirmSize = SL_MIN_CONFIRM_SIZE;

    std::atomic<int> result{-1};
    std::thread waiter([&] { result = SLListFirstGroup(h, 1); });
    while (provider.blocks.empty())
        std::this_thread::yield();
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    EXPECT_EQ(result.load(), -1) << "still waiting for the confirm";
    provider.cleanupNow();
    waiter.join();
    EXPECT_EQ(result.load(), 1);
    EXPECT_EQ(SLCnfStatus(h), 522u);
}

TEST(SLCommand, CleanupLetsTheWaitingCommandLeaveBeforeFreeingItsHandle)
{
    // Under AddressSanitizer: the abandoned command must not touch its handle
    // (an SL handle, freed by the cleanup) after the cleanup has freed it.
    ScriptedProvider provider;
    Reply never;
    never.confirm = false;
    provider.push(never);
    SLHandle* h = SLCreateHandle(0);
    std::atomic<int> result{-1};
    std::thread waiter([&] { result = SLListFirstGroup(h, 1); });
    while (provider.blocks.empty())
        std::this_thread::yield();
    provider.cleanupNow();
    waiter.join();
    EXPECT_EQ(result.load(), 1);
}

TEST(SLCommand, UnregisterWaitsForRunningHandlersBeforeIssuing257)
{
    ScriptedProvider provider;
    static std::atomic<bool> hold{true};
    static std::atomic<int> entered{0};
    hold = true;
    entered = 0;
    SLHandle* h = SLCreateHandle(0);
    ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) {
                  ++entered;
                  while (hold)
                      std::this_thread::sleep_for(std::chrono::milliseconds(1));
                  return 0;
              }),
              0);
    uint8_t indication[64] = {};
    storeWordAt(indication, 1, 1);
    storeWordAt(indication, 2, sizeof indication);
    SLIndicationFunc(indication);
    while (entered == 0)
        std::this_thread::yield();
    std::atomic<int> result{-1};
    std::thread unregister([&] { result = SLDmiUnregisterMgmt(h); });
    std::this_thread::sleep_for(std::chrono::milliseconds(30));
    EXPECT_EQ(provider.blocks.size(), 1u) << "257 waits for the running handler";
    hold = false;
    unregister.join();
    EXPECT_EQ(result.load(), 0);
    ASSERT_EQ(provider.blocks.size(), 2u);
    EXPECT_EQ(provider.code(1), 257u);
}

TEST(SLCommand, ConfirmCallbackClearsPendingAndReturnsItsArgument)
{
    ScriptedProvider provider;
    SLHandle* h = SLCreateHandle(0);
    h->pending = 1;
    EXPECT_EQ(dmiConfirmFunc(h->command), h->command);
    EXPECT_EQ(h->pending, 0u);
}

TEST(SLCommand, AttributeSizes)
{
    uint8_t five[9] = {5, 0, 0, 0, 'a', 'b', 'c', 'd', 'e'};
    uint8_t huge[4] = {0xFF, 0xFF, 0xFF, 0xFF};
    struct Case {
        int type;
        const void* value;
        unsigned size;
    } cases[] = {
        {1, nullptr, 4}, {3, nullptr, 4}, {5, nullptr, 4}, {2, nullptr, 8}, {6, nullptr, 8},
        {7, five, 9}, {8, five, 9}, {7, nullptr, 0}, {8, nullptr, 0}, {11, nullptr, 28},
        {4, five, 0}, {0, nullptr, 0}, {-1, nullptr, 0},
        {8, huge, UINT_MAX}, // a count that would wrap saturates
    };
    for (const Case& c : cases)
        EXPECT_EQ(SLAttributeSize(c.type, c.value), c.size) << "type " << c.type;
}

} // namespace
