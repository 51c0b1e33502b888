// Confirm accessors over each confirm and indication layout, key lists, and
// name walks.
#include <gtest/gtest.h>

#include <utility>

#include "scripted_provider.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

using Words = std::vector<std::pair<uint32_t, uint32_t>>;

// A handle as command or indication `type` left it: `words` (by index) and
// strings (by byte offset) over non-zero filler; an indication states
// `length` bytes and has its data at 64.
SLHandle* confirmOf(uint32_t type, const Words& words, const std::vector<std::pair<uint32_t, std::string>>& strings = {},
                    uint32_t length = 0, uint32_t level = SL_LEVEL_CHECK)
{
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->confirm, 0xAB, h->confirmSize);
    for (uint32_t i = 0; i < 16; ++i) // the indication header: level, type, length ... data offset
        storeWordAt(h->command, i, i == 0 ? level : i == 1 ? type : i == 2 ? length : i == 12 ? 64 : 0);
    for (auto [index, value] : words)
        storeWordAt(h->confirm, index, value);
    for (const auto& [offset, text] : strings)
        putString(h->confirm, offset, text);
    return h;
}

std::string show(SLHandle*, uint32_t v) { return std::to_string(v); }
std::string show(SLHandle*, int v) { return std::to_string(v); }
std::string show(SLHandle*, DmiString* s) { return s ? std::string(dmiStringText(s), dmiStringLength(s)) : "null"; }
std::string show(SLHandle* h, void* p) { return p ? "@" + std::to_string(static_cast<uint8_t*>(p) - h->confirm) : "null"; }
#define ROW(h, expr, want) {#expr, [&] { return show(h, expr); }, want}

TEST(SLAccess, EveryLayout)
{
    ScriptedProvider p;
    SLHandle* reg = confirmOf(256, {{0, 100}, {1, 120}, {2, 77}}, {{100, "1.1"}, {120, "Sub"}});
    SLHandle* comp = confirmOf(512, {{0, 7}, {1, 1}, {2, 100}, {3, 2}, {4, 120}, {5, 1}, {6, 140}, {30, 1}, {31, 160},
                                     {32, 2}, {33, 170}, {35, 3}, {36, 180}, {2045, 9}},
                               {{100, "Board"}, {160, "G1"}, {170, "G2"}});
    SLHandle* desc = confirmOf(515, {}, {{0, "About"}});
    SLHandle* group = confirmOf(516, {{0, 30}, {1, 200}, {2, 240}, {3, 1}, {4, 300}, {5, 31}, {6, 220}, {7, 260}},
                                {{200, "A"}, {220, "B"}, {240, "C1"}, {260, "C2"}});
    SLHandle* attr = confirmOf(520, {{0, 2}, {2, 2}, {5, 2}, {6, 320}, {7, 3}, {8, 310}, {10, 8}, {11, 64}, {13, 0},
                                     {80, 1}, {81, 340}, {82, 0xFFFFFFFE}, {83, 360}},
                               {{310, "Label"}, {340, "Warning"}, {360, "Failure"}});
    SLHandle* get = confirmOf(768, {{2, 8}, {3, 100}}, {{100, "2.90"}});
    SLHandle* row = confirmOf(772, {{0, 30}, {1, 1}, {2, 100}, {3, 2}, {5, 1}, {6, 5}, {7, 200}, {9, 2}, {10, 8},
                                    {11, 210}, {50, 0xFFFFFFFD}},
                              {{210, "CPU"}});
    // Indications: the stated length bounds every read, whatever lies behind it.
    SLHandle* removed = confirmOf(3, {{16, 9}, {18, 140}}, {{140, "Out"}}, 120);
    // An event of one class with two rows of one attribute: rows back to back
    // from 240, or an array of their offsets at 400.
    Words event{{16, 1}, {17, 7}, {18, 500}, {19, 2}, {20, 240}, {60, 20}, {63, 1}, {65, 1}, {66, 5}, {67, 340},
                {68, 30}, {69, 1}, {70, 320}, {71, 1}, {73, 7}, {74, 5}, {75, 344}, {80, 7}, {81, 5}, {82, 344},
                {85, 11}, {86, 22}, {100, 240}, {101, 272}};
    SLHandle* rows1 = confirmOf(1, event, {{500, "EventGeneration|x"}}, 510);
    event[4].second = 400;
    SLHandle* rows2 = confirmOf(1, event, {{500, "EventGeneration|x"}}, 560, 0x444D4932);
    SLEventSelectRowCnf(rows1, 0, 1);
    SLEventSelectRowCnf(rows2, 0, 1);
    struct Row {
        const char* name;
        std::function<std::string()> read;
        std::string want;
    } rows[] = {
        ROW(reg, SLDmiSpecificationLevel(reg), "1.1"), ROW(reg, SLImplementationDescription(reg), "Sub"),
        ROW(reg, SLRegisterHandle(reg), "77"), ROW(comp, SLComponentId(comp), "7"),
        ROW(comp, SLComponentMatchType(comp), "1"), ROW(comp, SLComponentName(comp), "Board"),
        ROW(comp, SLComponentGroupCount(comp), "2"), ROW(comp, SLComponentGroupId(comp, 1), "2"),
        ROW(comp, SLComponentGroupName(comp, 1), "G2"), ROW(comp, SLComponentFileCount(comp), "1"),
        ROW(comp, SLComponentFileType(comp, 0), "3"), ROW(comp, SLComponentFileData(comp, 0), "@180"),
        ROW(comp, SLComponentGroupId(comp, 2000), "0"), ROW(comp, SLComponentGroupId(comp, 0x7FFFFFFF), "0"),
        ROW(desc, SLDescription(desc), "About"), ROW(group, SLGroupId(group, 1), "31"),
        ROW(group, SLGroupName(group, 1), "B"), ROW(group, SLGroupClassName(group, 0), "C1"),
        ROW(group, SLGroupClassName(group, 1), "C2"), ROW(group, SLKeyCount(group), "1"),
        ROW(group, SLKeyListOffset(group), "300"), ROW(attr, SLAttributeId(attr, 1), "3"),
        ROW(attr, SLAttributeName(attr, 1), "Label"), ROW(attr, SLAttributeAccess(attr, 0), "2"),
        ROW(attr, SLAttributeType(attr, 1), "8"), ROW(attr, SLAttributeMaxSize(attr, 1), "64"),
        ROW(attr, SLEnumerationListCount(attr, 0), "2"), ROW(attr, SLEnumerationValue(attr, 0, 1), "-2"),
        ROW(attr, SLEnumerationName(attr, 0, 1), "Failure"), ROW(attr, SLEnumerationName(attr, 1, 0), "null"),
        ROW(get, SLAttributeType(get, 5), "8"), ROW(get, SLAttributePtr(get), "@100"),
        ROW(get, SLStringPtr(get), "2.90"), ROW(get, SLUnsignedValue(get), "4"),
        ROW(row, SLRowGroupId(row), "30"), ROW(row, SLRowAttributeCount(row), "2"),
        ROW(row, SLRowAttributeId(row, 1), "2"), ROW(row, SLRowAttributeType(row, 1), "8"),
        ROW(row, SLRowStringPtr(row, 1), "CPU"), ROW(row, SLRowIntegerValue(row, 0), "-3"),
        ROW(row, SLRowAttributePtr(row, 0), "@200"), ROW(row, SLRowAttributeId(row, 600), "0"),
        ROW(row, SLKeyCount(row), "1"), ROW(removed, SLComponentId(removed), "9"),
        ROW(removed, SLComponentName(removed), "null"), ROW(rows1, SLEventClassCount(rows1), "1"),
        ROW(rows1, SLEventComponentId(rows1, 0), "7"), ROW(rows1, SLEventRowCount(rows1, 0), "2"),
        ROW(rows1, SLEventClassString(rows1, 0), "null"), ROW(rows2, SLEventClassString(rows2, 0), "EventGeneration|x"),
        ROW(rows1, SLRowGroupId(rows1), "30"), ROW(rows2, SLRowGroupId(rows2), "30"),
        ROW(rows1, SLRowAttributeId(rows1, 0), "7"), ROW(rows2, SLRowUnsignedValue(rows2, 0), "22"),
        ROW(rows1, SLKeyListOffset(rows1), "320"),
    };
    for (const Row& r : rows)
        EXPECT_EQ(r.read(), r.want) << r.name;
    storeWordAt(comp->confirm, 2, 8180); // a name whose count runs past the buffer's end
    EXPECT_EQ(show(comp, SLComponentName(comp)), "null");
    storeWordAt(row->confirm, 3, 0x7FFFFFFF); // a hostile count: only the entries that fit
    EXPECT_EQ(slRowAttributesPresent(row), (8192u - 16) / 16);
}

SLKeyList keyList(std::vector<SLKeyEntry> entries)
{
    SLKeyList k{};
    k.count = static_cast<uint32_t>(entries.size());
    for (size_t i = 0; i < entries.size() && i < SL_MAX_KEYS; ++i)
        k.keys[i] = entries[i];
    return k;
}

TEST(SLKey, CopyAndCompare)
{
    ScriptedProvider p;
    Words words{{0, 30}, {3, 10}, {4, 100}}; // group entry 0: 10 integer keys listed at 100, values from 300
    for (uint32_t i = 0; i < 11; ++i)
        words.insert(words.end(), {{25 + 3 * i, i + 1}, {26 + 3 * i, DMI_INTEGER}, {27 + 3 * i, 300 + 4 * i}, {75 + i, 40 + i}});
    SLHandle* h = confirmOf(516, words);
    SLKeyList* ten = SLCreateKeyList(h);
    ASSERT_NE(ten, nullptr) << "a row of exactly 10 keys";
    EXPECT_EQ(ten->count, 10u);
    EXPECT_EQ(loadWord(ten->keys[9].value), 49u);
    SLDeleteKeyList(ten);
    storeWordAt(h->confirm, 3, 11);
    EXPECT_EQ(SLCreateKeyList(h), nullptr) << "11 keys";
    storeWordAt(h->confirm, 3, 1);
    storeWordAt(h->confirm, 27, 8190);
    EXPECT_EQ(SLCreateKeyList(h), nullptr) << "a value outside the buffer";

    uint32_t one = 1, two = 2;
    uint64_t big1 = 1, big2 = 2;
    uint8_t abc[7] = {3, 0, 0, 0, 'a', 'b', 'c'}, abd[7] = {3, 0, 0, 0, 'a', 'b', 'd'};
    struct Row {
        const char* name;
        SLKeyList a, b;
        int equal;
    } rows[] = {
        {"same integer", keyList({{1, DMI_INTEGER, &one}}), keyList({{1, DMI_INTEGER, &one}}), 1},
        {"other integer", keyList({{1, DMI_INTEGER, &one}}), keyList({{1, DMI_INTEGER, &two}}), 0},
        {"other counter", keyList({{1, DMI_COUNTER, &one}}), keyList({{1, DMI_COUNTER, &two}}), 0},
        {"other id", keyList({{1, DMI_INTEGER, &one}}), keyList({{2, DMI_INTEGER, &one}}), 0},
        {"one without value", keyList({{1, DMI_INTEGER, nullptr}}), keyList({{1, DMI_INTEGER, &one}}), 0},
        {"both without value", keyList({{1, DMI_INTEGER, nullptr}}), keyList({{1, DMI_INTEGER, nullptr}}), 1},
        {"same string", keyList({{1, DMI_DISPLAYSTRING, abc}}), keyList({{1, DMI_DISPLAYSTRING, abc}}), 1},
        {"other string", keyList({{1, DMI_OCTETSTRING, abc}}), keyList({{1, DMI_OCTETSTRING, abd}}), 0},
        {"64-bit not compared", keyList({{1, DMI_INTEGER64, &big1}}), keyList({{1, DMI_INTEGER64, &big2}}), 1},
        {"other count", keyList({{1, DMI_INTEGER, &one}}), keyList({}), 0},
        {"eleven keys", keyList(std::vector<SLKeyEntry>(11)), keyList(std::vector<SLKeyEntry>(11)), 0},
    };
    for (Row& r : rows)
        EXPECT_EQ(SLCompareKeyLists(&r.a, &r.b), r.equal) << r.name;
}

TEST(SLMap, NameWalks)
{
    ScriptedProvider p;
    std::vector<std::pair<uint32_t, std::string>> list = {{5, "Other"}, {9, std::string("Board\0junk", 10)}, {12, "Board"}};
    bool repeat = false; // a provider answering with the id it was asked after
    p.responder = [&](const uint8_t* block) {
        size_t i = 0;
        while (!repeat && loadWordAt(block, 16) != 0 && i < list.size())
            if (list[i++].first == loadWordAt(block, 16))
                break;
        if (i == list.size())
            return Reply{0, 3};
        auto entry = list[i];
        return Reply{0, 0, true, [entry](uint8_t* c) {
                         storeWordAt(c, 0, entry.first);
                         storeWordAt(c, 2, 100);
                         putString(c, 100, entry.second);
                     }};
    };
    EXPECT_EQ(SLMapComponentNameToId("Board"), 12u) << "the exact name, not one with more bytes";
    EXPECT_EQ(SLMapComponentNameToId("board"), 0u);
    EXPECT_EQ(p.word(0, 1), 514u);
    repeat = true;
    size_t sent = p.blocks.size();
    EXPECT_EQ(SLMapComponentNameToId("Absent"), 0u);
    EXPECT_EQ(p.blocks.size(), sent + 2) << "the walk ends where the provider repeats itself";
    storeWord(SLCreateString(0), 1); // the smallest string holds a word
}

} // namespace
