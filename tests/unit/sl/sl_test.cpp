// The SL library against the scripted provider: command blocks byte for byte,
// the status rules, every confirm and indication layout through the
// accessors, key lists, name walks, indication delivery and cleanup.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <thread>

#include "base/sleep.h"
#include "dmisp/dmisp.h"
#include "actions/actions.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

// An in-process DMI provider that keeps a copy of every command block it is
// handed and answers as `responder` says, confirming before DmiInvoke returns.
// A reply: DmiInvoke's result (0 accepted, 529 busy, else refused), the confirm status (word 11), whether a
// confirm comes at all, and what to write into the confirm.
struct Reply { uint32_t invoke = 0, status = 0; bool confirm = true; std::function<void(uint8_t*)> fill = nullptr; };

std::string text(const DmiString* s) { return s ? std::string(dmiStringText(s), dmiStringLength(s)) : "null"; }

// Writes a DMI string at `offset` of `base`.
void putString(uint8_t* base, uint32_t offset, const std::string& s)
{
    storeWord(base + offset, static_cast<uint32_t>(s.size())), std::memcpy(base + offset + 4, s.data(), s.size());
}

struct ScriptedProvider {
    static inline ScriptedProvider* provider = nullptr; // the one in use
    std::function<Reply(const uint8_t* block)> responder = [](const uint8_t*) { return Reply{}; };
    std::vector<std::vector<uint8_t>> blocks;
    std::vector<unsigned> sleeps; // requested through the sleep hook
    bool cleaned = false;

    ScriptedProvider()
    {
        provider = this;
        moxSetSleepHook([](unsigned ms) { provider->sleeps.push_back(ms); }), SLInitialize();
        SLDmiInvoke = [](void* command) {
            auto* block = static_cast<uint8_t*>(command);
            provider->blocks.emplace_back(block, block + SL_COMMAND_SIZE);
            Reply reply = provider->responder(block);
            if (reply.invoke == 0 && reply.confirm && reply.fill)
                reply.fill(static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8))));
            storeWordAt(block, 11, reply.status);
            if (reply.invoke == 0 && reply.confirm && loadWordAt(block, 1) < 1024) // 1024-1027 are final at once
                dmiConfirmFunc(block);
            return reply.invoke;
        };
    }
    ~ScriptedProvider() { cleanup(), moxSetSleepHook(nullptr); }
    void cleanup() { cleaned = cleaned || (SLCleanup(), true); }
    uint32_t word(size_t block, uint32_t index) const { return loadWordAt(blocks.at(block).data(), index); }
};

using Words = std::vector<uint32_t>; // word index, value, index, value ...

SLKeyList keyList(std::vector<SLKeyEntry> entries)
{
    SLKeyList k{0, static_cast<uint32_t>(entries.size()), {}, nullptr};
    std::copy_n(entries.begin(), std::min<size_t>(entries.size(), SL_MAX_KEYS), k.keys);
    return k;
}

// A row: the call (also its name), the code sent (0: refused, nothing sent),
// the block's words from 16 on and bytes at an offset.
#define CMD(call, code, ...) {#call, [&] { return call; }, code, __VA_ARGS__}

TEST(SLCommand, BlocksOfEveryCommand)
{
    ScriptedProvider p;
    SLHandle* h = SLCreateHandle(0);
    p.responder = [](const uint8_t*) { return Reply{0, 0, true, [](uint8_t* c) { storeWordAt(c, 2, 77); }}; };
    ASSERT_EQ(SLDmiRegisterMgmt(h, nullptr), 0); // the handle the rest carry
    uint32_t kv[11] = {4, 9, 12, 13, 14, 15, 16, 17, 18, 19, 20}, v = 0x11223344, pairs[2 * 503] = {5, 6, 7, 8};
    std::vector<SLKeyEntry> entries;
    for (uint32_t i = 0; i < 11; ++i)
        entries.push_back({i + 1, DMI_INTEGER, &kv[i]});
    uint8_t abc[7] = {3, 0, 0, 0, 'a', 'b', 'c'}; // a string key puts the values behind it off the word grid
    SLKeyList k = keyList({entries[0], entries[1]}), mixed = keyList({{1, DMI_DISPLAYSTRING, abc}, entries[1]});
    SLKeyList ten = keyList({entries.begin(), entries.end() - 1}), eleven = keyList(entries);
    std::string tooLong(SL_COMMAND_SIZE, 'x');
    std::vector<uint8_t> fits(SL_COMMAND_SIZE - 88 - 24 - 7 - 4); // behind the two keys and their values
    struct Row { const char* name; std::function<int()> call; uint32_t code; Words words = {};
        std::pair<uint32_t, std::string> bytes = {}; } rows[] = {CMD(SLDmiUnregisterMgmt(h), 257), CMD(SLCancel(h), 258),
        CMD(SLListComponent(h, nullptr, 7), 512, {16, 7, 17, 0, 18, 0}), CMD(SLListComponent(h, tooLong.data(), 1), 0),
        CMD(SLListComponent(h, "Zo", 7), 512, {17, 80, 20, 2}, {84, "Zo"}),
        CMD(SLListFirstComponent(h, nullptr), 513, {16, 0, 17, 0}), CMD(SLListNextComponent(h, 0, 7), 514, {16, 7}),
        CMD(SLListComponentDesc(h, 7), 515, {16, 7, 19, 0}), CMD(SLListNextGroup(h, 7, 3), 518, {16, 7, 17, 3}),
        CMD(SLListAttributeDesc(h, 7, 3, 2), 523, {16, 7, 17, 3, 18, 2, 19, 0}),
        CMD(SLGetAttribute(h, 7, 3, 2, nullptr), 768, {16, 7, 17, 3, 18, 0, 19, 0, 20, 2}),
        CMD(SLGetAttribute(h, 7, 3, 2, &k), 768,
            {18, 2, 19, 84, 21, 1, 22, 5, 23, 108, 24, 2, 25, 5, 26, 112, 27, 4, 28, 9}),
        CMD(SLSetAttribute(h, 7, 3, 2, nullptr, 4, &v), 769, {18, 0, 19, 0, 21, 88, 22, v}),
        CMD(SLSetAttribute(h, 7, 3, 2, &k, 4, &v), 769,
            {16, 7, 17, 3, 18, 2, 19, 88, 20, 2, 21, 120, 22, 1, 24, 112, 28, 4, 29, 9, 30, v}),
        CMD(SLSetAttribute(h, 7, 3, 2, &mixed, fits.size(), fits.data()), 769, {21, 123}),
        CMD(SLSetAttribute(h, 7, 3, 2, &mixed, fits.size() + 1, fits.data()), 0),
        CMD(SLReserveAttribute(h, 7, 3, 2, &k), 770, {19, 88, 21, 120}),
        CMD(SLReleaseAttribute(h, 7, 3, 2, nullptr), 771, {19, 0, 21, 88}),
        CMD(SLGetRow(h, 7, 3, 0, &k), 772, {16, 7, 17, 3, 18, 2, 19, 84, 20, 0}),
        CMD(SLGetRow(h, 7, 3, 0, &ten), 772, {18, 10, 48, 10, 49, 5, 50, 240, 60, 19}),
        CMD(SLGetRow(h, 7, 3, 0, &eleven), 0), CMD(SLSetAttribute(h, 7, 3, 2, &eleven, 0, nullptr), 0),
        CMD(SLGetRow(h, 7, 3, 0, &mixed), 772, {24, 2, 26, 115}, {108, std::string("\3\0\0\0abc\x09\0\0\0", 11)}),
        CMD(SLGetFirstRow(h, 7, 3, 0, nullptr), 773, {18, 0, 19, 0}), CMD(SLGetNextRow(h, 7, 3, 0, &k), 774, {19, 84}),
        CMD(SLGetNextRow(h, 7, 3, 0, nullptr), 773, {19, 0}),
        CMD(SLRegisterCi(h, 1, 2, 3, 2, pairs), 1024, {16, 1, 17, 2, 18, 3, 19, 2, 20, 5, 23, 8}),
        CMD(SLRegisterCi(h, 1, 2, 3, 502, pairs), 1024, {19, 502}), CMD(SLRegisterCi(h, 1, 2, 3, 503, pairs), 0),
        CMD(SLUnregisterCi(h, 9), 1025, {16, 9}),
        CMD(SLCiInstallData(h, 7, "/m"), 1026, {16, 7, 17, 1, 18, 2, 19, 80, 20, 2}, {84, {"/m\0", 3}}),
        CMD(setenv("UXDMIPATH", "/d", 1) + SLInstallMIF(h, "a.mif"), 1026, {16, 0}, {84, {"/d/a.mif\0", 9}}),
        CMD(setenv("UXDMIPATH", tooLong.c_str(), 1) + SLInstallMIF(h, "a.mif"), 0),
        CMD(unsetenv("UXDMIPATH") + SLInstallMIF(h, "a.mif"), 1026, {}, {84, {"/var/dmi/mifs/backup/a.mif\0", 27}}),
        CMD(SLCiUninstallData(h, 7), 1027, {16, 7})};
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        size_t n = p.blocks.size();
        std::memset(h->command, 0xEE, SL_COMMAND_SIZE); // stale words must be overwritten,
        storeWordAt(h->command, 4, p.word(n - 1, 4));     // but the handle keeps its command number
        ASSERT_EQ(row.call(), row.code == 0 ? 1 : 0);
        ASSERT_EQ(p.blocks.size(), n + (row.code == 0 ? 0 : 1));
        if (row.code == 0)
            continue;
        // Level check, code, block size, management handle (none for installs), command number (a cancel
        // names the last command), confirm size and address, one confirm.
        Words words{0, SL_LEVEL_CHECK, 1, row.code, 2, 4096, 3, row.code == 1026 || row.code == 1027 ? 0u : 77u, 4,
            p.word(n - 1, 4) + (row.code != 258), 7, 8192, 8, pointerWord(h->confirm), 9, 1};
        words.insert(words.end(), row.words.begin(), row.words.end());
        for (size_t i = 0; i + 1 < words.size(); i += 2)
            EXPECT_EQ(p.word(n, words[i]), words[i + 1]) << "word " << words[i];
        const auto& [offset, bytes] = row.bytes;
        EXPECT_EQ(std::string(reinterpret_cast<const char*>(p.blocks[n].data()) + offset, bytes.size()), bytes);
    }
}

TEST(SLCommand, StatusAndBusyRules)
{
    std::tuple<const char*, std::vector<Reply>, int, size_t, std::vector<unsigned>> rows[] = {
        {"status 1 counts as success", {{0, 1}}, 0, 1, {}}, {"status 2 fails", {{0, 2}}, 1, 1, {}},
        {"528 is refusal, not busy", {{528, 0}, {0, 0}}, 1, 1, {}}, {"busy once", {{529, 0}, {0, 0}}, 0, 2, {5000}},
        {"busy twice: no third try", {{529, 0}, {529, 0}, {0, 0}}, 1, 2, {5000, 5000}}};
    for (const auto& [name, replies, rc, sends, sleeps] : rows) {
        ScriptedProvider p;
        p.responder = [&](const uint8_t*) { return replies.at(p.blocks.size() - 1); };
        EXPECT_EQ(SLListFirstComponent(SLCreateHandle(0), nullptr), rc) << name;
        EXPECT_EQ(p.blocks.size(), sends) << name;
        EXPECT_EQ(p.sleeps, sleeps) << name;
    }
}

// A handle as command or indication `type` left it: `words` (by index) and
// strings (by byte offset) over non-zero filler; an indication states
// `length` bytes and has its data at 64.
using Strings = std::vector<std::pair<uint32_t, std::string>>;
SLHandle* confirmOf(uint32_t type, const Words& words, const Strings& strings = {}, uint32_t length = 0,
    uint32_t level = SL_LEVEL_CHECK)
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->confirm, 0xAB, h->confirmSize);
    for (uint32_t i = 0; i < 16; ++i) // the indication header: level, type, length ... data offset
        storeWordAt(h->command, i, i == 0 ? level : i == 1 ? type : i == 2 ? length : i == 12 ? 64 : 0);
    for (size_t i = 0; i + 1 < words.size(); i += 2)
        storeWordAt(h->confirm, words[i], words[i + 1]);
    for (const auto& [offset, text] : strings)
        putString(h->confirm, offset, text);
    return h;
}

template <typename Number> std::string show(SLHandle*, Number n) { return std::to_string(n); }
std::string show(SLHandle*, DmiString* s) { return text(s); }
std::string show(SLHandle*, SLKeyList* k) { return k ? std::to_string(loadWord(k->keys[9].value)) : "null"; }
// A row: the accessor, its handle and arguments, and the value it must read.
#define A(h, f, w, ...) {#f "(" #h ", " #__VA_ARGS__ ")", [&] { return show(h, f(h __VA_OPT__(, ) __VA_ARGS__)); }, w}

TEST(SLAccess, EveryLayout)
{
    ScriptedProvider p;
    SLHandle* comp = confirmOf(512, {0, 7, 2, 100, 3, 2, 4, 120, 30, 1, 31, 160, 32, 2, 33, 170, 2045, 9},
        {{100, "Board"}, {160, "G1"}, {170, "G2"}});
    SLHandle* group = confirmOf(516, {0, 30, 1, 200, 2, 240, 3, 1, 4, 300, 5, 31, 6, 220, 7, 260},
        {{200, "A"}, {220, "B"}, {240, "C1"}, {260, "C2"}});
    SLHandle* attr = confirmOf(520, {0, 2, 2, 2, 5, 2, 6, 320, 7, 3, 8, 310, 10, 8, 11, 64, 13, 0, 80, 1, 81, 340, 82,
        0xFFFFFFFE, 83, 360}, {{310, "Label"}, {340, "Warning"}, {360, "Failure"}});
    // Group entry 0 naming 10 (or 11) integer keys listed at 100, values from 300; or one outside the buffer.
    Words keys{0, 30, 3, 10, 4, 100};
    for (uint32_t i = 0; i < 11; ++i)
        keys.insert(keys.end(), {25 + 3 * i, i + 1, 26 + 3 * i, DMI_INTEGER, 27 + 3 * i, 300 + 4 * i, 75 + i, 40 + i});
    SLHandle* ten = confirmOf(516, keys);
    keys[3] = 11;
    SLHandle* eleven = confirmOf(516, keys);
    keys[3] = 10, keys[11] = 8190; // the first value
    SLHandle* outside = confirmOf(516, keys);
    SLHandle* row = confirmOf(
        772, {0, 30, 1, 1, 2, 100, 3, 2, 5, 1, 6, 5, 7, 200, 9, 2, 10, 8, 11, 210, 50, 0xFFFFFFFD}, {{210, "CPU"}});
    // Indications: the stated length bounds every read, whatever lies behind it.
    SLHandle* removed = confirmOf(3, {16, 9, 18, 140}, {{140, "Out"}}, 120);
    // An event of one class with two rows of one attribute: rows back to back
    // from 240, or an array of their offsets at 400.
    Words event{16, 1, 17, 7, 18, 500, 19, 2, 20, 240, 60, 20, 63, 1, 65, 1, 66, 5, 67, 340, 68, 30, 69, 1, 70, 320,
        71, 1, 73, 7, 74, 5, 75, 344, 80, 7, 81, 5, 82, 344, 85, 11, 86, 22, 100, 240, 101, 272};
    SLHandle* rows1 = confirmOf(1, event, {{500, "EventGeneration|x"}}, 510);
    event[9] = 400;
    SLHandle* rows2 = confirmOf(1, event, {{500, "EventGeneration|x"}}, 560, 0x444D4932);
    SLEventSelectRowCnf(rows1, 0, 1), SLEventSelectRowCnf(rows2, 0, 1);
    std::tuple<const char*, std::function<std::string()>, std::string> rows[] = {A(comp, SLComponentId, "7"),
        A(comp, SLComponentName, "Board"), A(comp, SLComponentGroupCount, "2"), A(comp, SLComponentGroupId, "2", 1),
        A(comp, SLComponentGroupName, "G2", 1), A(comp, SLComponentGroupId, "0", 0x7FFFFFFF),
        A(group, SLGroupId, "31", 1), A(group, SLGroupName, "B", 1), A(group, SLGroupClassName, "C1", 0),
        A(group, SLGroupClassName, "C2", 1), A(group, SLKeyCount, "1"), A(ten, SLCreateKeyList, "49"),
        A(eleven, SLCreateKeyList, "null"), A(outside, SLCreateKeyList, "null"), A(attr, SLAttributeId, "3", 1),
        A(attr, SLAttributeName, "Label", 1), A(attr, SLAttributeType, "8", 1), A(attr, SLEnumerationListCount, "2", 0),
        A(attr, SLEnumerationValue, "-2", 0, 1), A(attr, SLEnumerationName, "Failure", 0, 1),
        A(attr, SLEnumerationName, "null", 1, 0), A(row, SLRowGroupId, "30"), A(row, SLRowAttributeCount, "2"),
        A(row, SLRowAttributeId, "2", 1), A(row, SLRowAttributeType, "8", 1), A(row, SLRowStringPtr, "CPU", 1),
        A(row, SLRowIntegerValue, "-3", 0), A(row, SLRowAttributeId, "0", 600), A(row, SLKeyCount, "1"),
        A(removed, SLComponentId, "9"), A(removed, SLComponentName, "null"), A(rows1, SLEventClassCount, "1"),
        A(rows1, SLEventComponentId, "7", 0), A(rows1, SLEventRowCount, "2", 0),
        A(rows1, SLEventClassString, "null", 0), A(rows2, SLEventClassString, "EventGeneration|x", 0),
        A(rows1, SLRowGroupId, "30"), A(rows2, SLRowGroupId, "30"), A(rows1, SLRowAttributeId, "7", 0),
        A(rows2, SLRowUnsignedValue, "22", 0)};
    for (const auto& [name, read, want] : rows)
        EXPECT_EQ(read(), want) << name;
    storeWordAt(comp->confirm, 2, 8180); // a name whose count runs past the buffer's end
    EXPECT_EQ(show(comp, SLComponentName(comp)), "null");
    storeWordAt(row->confirm, 3, 0x7FFFFFFF); // a hostile count: only the entries that fit
    EXPECT_EQ(slRowAttributesPresent(row), (8192u - 16) / 16);
}

TEST(SLKey, Compare)
{
    uint32_t one = 1, two = 2, big1[2] = {1, 0}, big2[2] = {2, 0};
    uint8_t abc[7] = {3, 0, 0, 0, 'a', 'b', 'c'}, abd[7] = {3, 0, 0, 0, 'a', 'b', 'd'};
    // Types: 1 counter, 5 integer, 6 64-bit integer, 7 octet string, 8 display string.
    auto key = [](uint32_t type, void* value, uint32_t id = 1) { return keyList({{id, type, value}}); };
    std::tuple<const char*, SLKeyList, SLKeyList, int> rows[] = {{"same integer", key(5, &one), key(5, &one), 1},
        {"other integer", key(5, &one), key(5, &two), 0}, {"other counter", key(1, &one), key(1, &two), 0},
        {"other id", key(5, &one), key(5, &one, 2), 0}, {"one without value", key(5, nullptr), key(5, &one), 0},
        {"both without value", key(5, nullptr), key(5, nullptr), 1}, {"same string", key(8, abc), key(8, abc), 1},
        {"other string", key(7, abc), key(7, abd), 0}, {"64-bit not compared", key(6, big1), key(6, big2), 1},
        {"other count", key(5, &one), keyList({}), 0}, {"eleven keys", keyList(std::vector<SLKeyEntry>(11)),
        keyList(std::vector<SLKeyEntry>(11)), 0}};
    for (auto& [name, a, b, equal] : rows)
        EXPECT_EQ(SLCompareKeyLists(&a, &b), equal) << name;
}

TEST(SLMap, NameWalks)
{
    ScriptedProvider p;
    std::map<uint32_t, std::pair<uint32_t, std::string>> next = {
        {0, {5, "Other"}}, {5, {9, std::string("Board\0junk", 10)}}, {9, {12, "Board"}}};
    bool repeat = false; // a provider answering with the id it was asked after
    p.responder = [&](const uint8_t* block) {
        auto it = next.find(repeat ? 0 : loadWordAt(block, 16));
        if (it == next.end())
            return Reply{0, 3};
        return Reply{0, 0, true, [entry = it->second](uint8_t* c) {
                         storeWordAt(c, 0, entry.first), storeWordAt(c, 2, 100), putString(c, 100, entry.second);
                     }};
    };
    EXPECT_EQ(SLMapComponentNameToId("Board"), 12u) << "the exact name, not one with more bytes";
    repeat = true;
    EXPECT_EQ(SLMapComponentNameToId("Absent"), 0u);
    EXPECT_EQ(p.blocks.size(), 3u + 2) << "the walk ends where the provider repeats itself";
}

// A command waiting for a confirm that never comes ends when cleanup starts
// and leaves before cleanup frees its handle; one queued behind it is not sent.
TEST(SLCleanup, LetsWaitingCommandsLeave)
{
    ScriptedProvider p;
    p.responder = [](const uint8_t*) { return Reply{0, 0, false}; };
    std::atomic<int> left{0}, failed{0};
    auto command = [&](SLHandle* h) { failed += SLListFirstComponent(h, nullptr), ++left; };
    SLHandle* h = SLCreateHandle(0); // made before cleanup begins
    std::thread first(command, SLCreateHandle(0));
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    std::thread second(command, h);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    p.cleanup();
    EXPECT_EQ(left.load(), 2) << "cleanup returned before the commands left";
    first.join(), second.join();
    EXPECT_EQ(failed.load(), 2);
    EXPECT_EQ(p.blocks.size(), 1u);
}

std::atomic<bool> hold{false};
std::atomic<int> handled{0}, completions{0};

// An event indication stating `length` bytes, whose completion counts itself and waits while held.
std::vector<uint32_t> event(uint32_t length)
{
    std::vector<uint32_t> w(20, 0xABABABAB);
    void (*completion)(void*) = [](void*) { for (++completions; hold;) std::this_thread::yield(); };
    w[1] = 1, w[2] = length, w[11] = pointerWord(reinterpret_cast<void*>(completion));
    return w;
}

// Indications stating an absurd length are completed at once and dropped. While the handler (or, with
// no handler, the completion inside the indication callback) is held,
// removing the handler and cleanup must wait.
TEST(SLEvent, Delivery)
{
    ScriptedProvider p;
    SLEventSetHandler([](SLHandle*) { for (++handled; hold;) std::this_thread::yield(); return 0; });
    for (uint32_t length : {51u, (1u << 20) + 1}) { // shorter than the header, above 1 MiB
        int before = completions;
        SLIndicationFunc(event(length).data()); // a handled one would be completed later, by its event thread
        EXPECT_EQ(completions.load(), before + 1) << length;
    }
    auto expectWaits = [](std::atomic<int>& entered, const std::function<void()>& act) {
        hold = true;
        int before = entered;
        std::vector<uint32_t> indication = event(52); // no more than its header
        std::thread provider([&] { SLIndicationFunc(indication.data()); });
        for (int i = 0; i < 5000 && entered.load() == before; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        std::atomic<bool> over{false};
        std::thread([&] { act(), over = true; }).detach();
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        EXPECT_FALSE(over.load());
        hold = false;
        provider.join();
        for (int i = 0; i < 5000 && !over; ++i) // a bounded wait: a broken count would keep it waiting forever
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        if (!over.load()) { // the program would wait too, at exit: it ends here instead
            std::fprintf(stderr, "still waiting after 5 s: the count of event threads is wrong\n");
            std::_Exit(1);
        }
    };
    expectWaits(handled, [] { SLEventSetHandler(nullptr); });
    const unsigned strings = slLiveStringCount(); // without a handler, no handle is made
    expectWaits(completions, [&] {
        EXPECT_EQ(slLiveStringCount(), strings);
        p.cleanup();
    });
}

// An explanation makes the indication of an event from rows it reads: it must
// read through the accessors exactly like the one the provider delivers.
const char board[] = R"(start component name = "Test Board"
  start group name = "Voltage Events" class = "EventGeneration|Voltage Probe|001" id = 20
    start attribute name = "Event Type" id = 1 type = integer value = 2 end attribute
  end group
  start group name = "Slot" class = "DMTF|Slot|001" key = 1
    start attribute name = "Name" id = 1 type = displaystring(8) end attribute
    start attribute name = "Width" id = 2 type = integer end attribute
  end group
  start table name = "Slot" class = "DMTF|Slot|001" id = 31 {"A1", 16} end table
end component)";

std::string str(uint32_t n) { return std::to_string(static_cast<int32_t>(n)) + " "; }
std::string delivered;

// Everything the accessors read of an event indication: classes, rows, keys, values.
std::string readEvent(SLHandle* e)
{
    std::string out = str(SLIndicationType(e)) + str(SLIndicationComponentId(e));
    for (uint32_t c = 0; c < SLEventClassCount(e); ++c) {
        SLEventSelectRowCnf(e, c, 0);
        SLKeyList* keys = SLCreateKeyList(e);
        char keyText[200];
        explainKeys(keys, keyText, sizeof keyText), SLDeleteKeyList(keys);
        out += "| " + text(SLEventClassString(e, c)) + " " + str(SLEventComponentId(e, c)) +
               str(SLEventRowCount(e, c)) + str(SLRowGroupId(e)) + keyText;
        for (uint32_t a = 0; a < SLRowAttributeCount(e); ++a) {
            auto* v = static_cast<const char*>(SLRowAttributePtr(e, a));
            unsigned size = SLAttributeSize(static_cast<int>(SLRowAttributeType(e, a)), v);
            out += " " + str(SLRowAttributeId(e, a)) + str(SLRowAttributeType(e, a)) + std::string(v, v ? size : 0);
        }
    }
    return out;
}

TEST(ExplainedEvent, IndicationMadeOfRowsReadsLikeTheDeliveredOne)
{
    char dir[] = "/tmp/sl-contract-XXXXXX";
    ASSERT_TRUE(mkdtemp(dir) && dmisp::reset(dir, false) == 0);
    SLInitialize();
    SLHandle* h = SLCreateHandle(0);
    ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle* e) {
        if (SLIndicationType(e) == 1)
            delivered = readEvent(e);
        return 0; }), 0);
    uint32_t c = dmisp::installText(board, "board.mif");
    ASSERT_TRUE(dmisp::raiseEvent(c, {20, {}}, {31, {"A1"}}) == 0 && dmisp::waitIndicationsCompleted());
    SLHandle* read[] = {SLCreateHandle(0), SLCreateHandle(0)};
    ASSERT_EQ(SLGetRow(read[0], c, 20, 0, nullptr) + SLGetFirstRow(read[1], c, 31, 0, nullptr), 0);
    const DmiString* classes[] = {NewDmiString("EventGeneration|Voltage Probe|001"), NewDmiString("DMTF|Slot|001")};
    SLHandle* made = slMakeEventIndication(c, classes, read, 2);
    EXPECT_EQ(readEvent(made), delivered);
    EXPECT_NE(delivered.find("1=\"A1\""), std::string::npos) << delivered;
    SLDmiUnregisterMgmt(h), dmisp::shutdown(), SLCleanup();
    EXPECT_EQ(std::system(("rm -rf " + std::string(dir)).c_str()), 0);
}

} // namespace
