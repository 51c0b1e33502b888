// Command blocks as the provider receives them, the status rules, and what
// cleanup does to commands still under way.
#include <gtest/gtest.h>

#include <thread>
#include <utility>

#include "scripted_provider.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slmap.h"

namespace {

using Words = std::vector<std::pair<uint32_t, uint32_t>>;

SLKeyList integerKeys(uint32_t n, uint32_t* values)
{
    SLKeyList keys{};
    keys.count = n;
    for (uint32_t i = 0; i < n && i < SL_MAX_KEYS; ++i)
        keys.keys[i] = {i + 1, DMI_INTEGER, &values[i]};
    return keys;
}

// Code 0: refused before anything is sent.
TEST(SLCommand, BlocksOfEveryCommand)
{
    ScriptedProvider p;
    SLHandle* h = SLCreateHandle(0);
    p.responder = [](const uint8_t*) { return Reply{0, 0, true, [](uint8_t* c) { storeWordAt(c, 2, 77); }}; };
    ASSERT_EQ(SLDmiRegisterMgmt(h, nullptr), 0);
    EXPECT_EQ(p.word(0, 1), 256u);
    EXPECT_EQ(p.word(0, 16), pointerWord(reinterpret_cast<void*>(&dmiConfirmFunc)));
    EXPECT_EQ(p.word(0, 17), pointerWord(reinterpret_cast<void*>(&SLIndicationFunc)));
    uint32_t kv[11] = {4, 9, 12, 13, 14, 15, 16, 17, 18, 19, 20}, v = 0x11223344, pairs[2 * 503] = {5, 6, 7, 8};
    SLKeyList k = integerKeys(2, kv), ten = integerKeys(10, kv), eleven = integerKeys(11, kv), mixed = k;
    uint8_t abc[7] = {3, 0, 0, 0, 'a', 'b', 'c'}; // a string key: the values behind it off the word grid
    mixed.keys[0] = {1, DMI_DISPLAYSTRING, abc};
    std::string tooLong(SL_COMMAND_SIZE, 'x');
    std::vector<uint8_t> fits(SL_COMMAND_SIZE - 88 - 24 - 7 - 4); // behind two keys and their values
    struct Row {
        const char* name;
        std::function<int()> call;
        uint32_t code;
        Words words = {};
        std::pair<uint32_t, std::string> bytes = {};
    } rows[] = {
        {"unregister", [&] { return SLDmiUnregisterMgmt(h); }, 257, {}},
        {"cancel", [&] { return SLCancel(h); }, 258, {}},
        {"list component", [&] { return SLListComponent(h, nullptr, 7); }, 512, {{16, 7}, {17, 0}, {18, 0}}},
        {"list filtered", [&] { return SLListComponent(h, "Zo", 7); }, 512, {{17, 80}, {20, 2}}, {84, "Zo"}},
        {"filter too long", [&] { return SLListComponent(h, tooLong.c_str(), 7); }, 0, {}},
        {"first component", [&] { return SLListFirstComponent(h, nullptr); }, 513, {{16, 0}, {17, 0}}},
        {"next component", [&] { return SLListNextComponent(h, nullptr, 7); }, 514, {{16, 7}}},
        {"component desc", [&] { return SLListComponentDesc(h, 7); }, 515, {{16, 7}, {19, 0}}},
        {"list group", [&] { return SLListGroup(h, 7, 3); }, 516, {{16, 7}, {17, 3}}},
        {"first group", [&] { return SLListFirstGroup(h, 7); }, 517, {{16, 7}}},
        {"next group", [&] { return SLListNextGroup(h, 7, 3); }, 518, {{16, 7}, {17, 3}}},
        {"group desc", [&] { return SLListGroupDesc(h, 7, 3); }, 519, {{16, 7}, {17, 3}, {19, 0}}},
        {"list attribute", [&] { return SLListAttribute(h, 7, 3, 2); }, 520, {{16, 7}, {17, 3}, {18, 2}}},
        {"first attribute", [&] { return SLListFirstAttribute(h, 7, 3); }, 521, {{16, 7}, {17, 3}}},
        {"next attribute", [&] { return SLListNextAttribute(h, 7, 3, 2); }, 522, {{16, 7}, {17, 3}, {18, 2}}},
        {"attribute desc", [&] { return SLListAttributeDesc(h, 7, 3, 2); }, 523, {{18, 2}, {19, 0}}},
        {"get", [&] { return SLGetAttribute(h, 7, 3, 2, nullptr); }, 768, {{16, 7}, {17, 3}, {18, 0}, {19, 0}, {20, 2}}},
        {"get keyed", [&] { return SLGetAttribute(h, 7, 3, 2, &k); }, 768,
         {{18, 2}, {19, 84}, {21, 1}, {22, 5}, {23, 108}, {24, 2}, {25, 5}, {26, 112}, {27, 4}, {28, 9}}},
        {"set", [&] { return SLSetAttribute(h, 7, 3, 2, nullptr, 4, &v); }, 769, {{18, 0}, {19, 0}, {21, 88}, {22, v}}},
        {"set keyed", [&] { return SLSetAttribute(h, 7, 3, 2, &k, 4, &v); }, 769,
         {{16, 7}, {17, 3}, {18, 2}, {19, 88}, {20, 2}, {21, 120}, {22, 1}, {24, 112}, {28, 4}, {29, 9}, {30, v}}},
        {"set value that just fits", [&] { return SLSetAttribute(h, 7, 3, 2, &mixed, fits.size(), fits.data()); }, 769,
         {{21, 123}}},
        {"set value one byte over", [&] { return SLSetAttribute(h, 7, 3, 2, &mixed, fits.size() + 1, fits.data()); }, 0},
        {"reserve", [&] { return SLReserveAttribute(h, 7, 3, 2, &k); }, 770, {{19, 88}, {21, 120}}},
        {"release", [&] { return SLReleaseAttribute(h, 7, 3, 2, nullptr); }, 771, {{19, 0}, {21, 88}}},
        {"row", [&] { return SLGetRow(h, 7, 3, 0, &k); }, 772, {{16, 7}, {17, 3}, {18, 2}, {19, 84}, {20, 0}}},
        {"row of exactly ten keys", [&] { return SLGetRow(h, 7, 3, 0, &ten); }, 772,
         {{18, 10}, {48, 10}, {49, 5}, {50, 240}, {60, 19}}},
        {"row of eleven keys", [&] { return SLGetRow(h, 7, 3, 0, &eleven); }, 0},
        {"set with eleven keys", [&] { return SLSetAttribute(h, 7, 3, 2, &eleven, 0, nullptr); }, 0},
        {"row by a string key", [&] { return SLGetRow(h, 7, 3, 0, &mixed); }, 772, {{24, 2}, {26, 115}},
         {108, std::string("\3\0\0\0abc\x09\0\0\0", 11)}},
        {"first row", [&] { return SLGetFirstRow(h, 7, 3, 0, nullptr); }, 773, {{18, 0}, {19, 0}}},
        {"next row", [&] { return SLGetNextRow(h, 7, 3, 0, &k); }, 774, {{18, 2}, {19, 84}}},
        {"next row, no keys", [&] { return SLGetNextRow(h, 7, 3, 0, nullptr); }, 773, {{19, 0}}},
        {"register ci", [&] { return SLRegisterCi(h, 1, 2, 3, 2, pairs); }, 1024,
         {{16, 1}, {17, 2}, {18, 3}, {19, 2}, {20, 5}, {21, 6}, {22, 7}, {23, 8}}},
        {"register ci, 502 pairs", [&] { return SLRegisterCi(h, 1, 2, 3, 502, pairs); }, 1024, {{19, 502}}},
        {"register ci, 503 pairs", [&] { return SLRegisterCi(h, 1, 2, 3, 503, pairs); }, 0},
        {"unregister ci", [&] { return SLUnregisterCi(h, 9); }, 1025, {{16, 9}}},
        {"install", [&] { return SLCiInstallData(h, 7, "/m"); }, 1026, {{16, 7}, {17, 1}, {18, 2}, {19, 80}, {20, 2}},
         {84, std::string("/m\0", 3)}},
        {"MIF from UXDMIPATH", [&] { return setenv("UXDMIPATH", "/d", 1) + SLInstallMIF(h, "a.mif"); }, 1026,
         {{16, 0}}, {84, std::string("/d/a.mif\0", 9)}},
        {"MIF path too long", [&] { return setenv("UXDMIPATH", tooLong.c_str(), 1) + SLInstallMIF(h, "a.mif"); }, 0},
        {"MIF from the default directory", [&] { return unsetenv("UXDMIPATH") + SLInstallMIF(h, "a.mif"); }, 1026,
         {}, {84, std::string("/var/dmi/mifs/backup/a.mif\0", 27)}},
        {"uninstall", [&] { return SLCiUninstallData(h, 7); }, 1027, {{16, 7}}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        size_t n = p.blocks.size();
        std::memset(h->command, 0xEE, SL_COMMAND_SIZE); // stale words must be overwritten,
        storeWordAt(h->command, 4, p.word(n - 1, 4));     // but the handle keeps its command number
        ASSERT_EQ(row.call(), row.code == 0 ? 1 : 0);
        ASSERT_EQ(p.blocks.size(), n + (row.code == 0 ? 0 : 1));
        if (row.code == 0)
            continue;
        EXPECT_EQ(p.word(n, 0), SL_LEVEL_CHECK);
        EXPECT_EQ(p.word(n, 1), row.code);
        EXPECT_EQ(p.word(n, 2), SL_COMMAND_SIZE);
        EXPECT_EQ(p.word(n, 3), row.code == 1026 || row.code == 1027 ? 0u : 77u) << "management handle";
        // A cancel names the command last issued; every other command takes the next number.
        EXPECT_EQ(p.word(n, 4), p.word(n - 1, 4) + (row.code == 258 ? 0 : 1));
        EXPECT_EQ(p.word(n, 7), 8192u) << "the smallest confirm buffer";
        EXPECT_EQ(p.word(n, 8), pointerWord(h->confirm));
        EXPECT_EQ(p.word(n, 9), 1u);
        for (auto [index, value] : row.words)
            EXPECT_EQ(p.word(n, index), value) << "word " << index;
        const auto& [offset, bytes] = row.bytes;
        EXPECT_EQ(std::string(reinterpret_cast<const char*>(p.blocks[n].data()) + offset, bytes.size()), bytes);
    }
}

TEST(SLCommand, StatusAndBusyRules)
{
    struct Row {
        const char* name;
        std::vector<Reply> replies;
        int rc;
        size_t sends;
        std::vector<unsigned> sleeps;
    } rows[] = {
        {"status 0", {{0, 0}}, 0, 1, {}},
        {"status 1 counts as success", {{0, 1}}, 0, 1, {}},
        {"status 2 fails", {{0, 2}}, 1, 1, {}},
        {"refused", {{1, 0}}, 1, 1, {}},
        {"528 is not busy", {{528, 0}, {0, 0}}, 1, 1, {}},
        {"busy once", {{529, 0}, {0, 0}}, 0, 2, {5000}},
        {"busy twice: no third try", {{529, 0}, {529, 0}, {0, 0}}, 1, 2, {5000, 5000}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        ScriptedProvider p;
        p.responder = [&](const uint8_t*) { return row.replies.at(p.blocks.size() - 1); };
        EXPECT_EQ(SLListFirstComponent(SLCreateHandle(0), nullptr), row.rc);
        EXPECT_EQ(p.blocks.size(), row.sends);
        EXPECT_EQ(p.sleeps, row.sleeps);
    }
}

// A command waiting for a confirm that never comes ends when cleanup starts
// and leaves before cleanup frees its handle; one queued behind it is not sent.
TEST(SLCommand, CleanupLetsWaitingCommandsLeave)
{
    ScriptedProvider p;
    p.responder = [](const uint8_t*) { return Reply{0, 0, false}; };
    std::atomic<int> left{0}, failed{0};
    auto command = [&](SLHandle* h) {
        failed += SLListFirstComponent(h, nullptr);
        ++left;
    };
    SLHandle* h1 = SLCreateHandle(0);
    SLHandle* h2 = SLCreateHandle(0);
    std::thread first(command, h1);
    while (p.received.load() == 0)
        std::this_thread::yield();
    std::thread second(command, h2);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    p.cleanup();
    EXPECT_EQ(left.load(), 2) << "cleanup returned before the commands left";
    first.join();
    second.join();
    EXPECT_EQ(failed.load(), 2);
    EXPECT_EQ(p.received.load(), 1);
}

} // namespace
