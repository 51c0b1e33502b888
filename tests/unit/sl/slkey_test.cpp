#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <string>
#include <vector>

#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slstring.h"

namespace {

// A handle holding a confirm (or an indication) written by the test.
class Record {
public:
    explicit Record(uint32_t code, uint32_t stated = SL_MIN_CONFIRM_SIZE) : h_(SLCreateHandle(0))
    {
        std::memset(h_->command, 0, SL_COMMAND_SIZE);
        std::memset(h_->confirm, 0, h_->confirmSize);
        header(0, SL_LEVEL_CHECK);
        header(1, code);
        header(2, stated);
    }
    ~Record() { SLDestroyHandle(h_); }
    SLHandle* get() { return h_; }
    void header(uint32_t index, uint32_t value) { storeWordAt(h_->command, index, value); }
    void word(uint32_t offset, uint32_t value) { storeWord(h_->confirm + offset, value); }
    // Key entries at `at`: (id, type, value offset) each.
    void keys(uint32_t at, const std::vector<std::array<uint32_t, 3>>& entries)
    {
        for (size_t i = 0; i < entries.size(); ++i)
            for (uint32_t f = 0; f < 3; ++f)
                word(at + 12 * static_cast<uint32_t>(i) + 4 * f, entries[i][f]);
    }
    void text(uint32_t at, const std::string& s)
    {
        word(at, static_cast<uint32_t>(s.size()));
        std::memcpy(h_->confirm + at + 4, s.data(), s.size());
    }

private:
    SLHandle* h_;
};

std::string valueText(const SLKeyEntry& key)
{
    auto* v = static_cast<const DmiString*>(key.value);
    return v == nullptr ? "<null>" : std::string(dmiStringText(v), dmiStringLength(v));
}

TEST(SLKey, CountAndOffsetByCommand)
{
    struct Case {
        uint32_t code;
        int count;
        int offset;
    } cases[] = {
        {516, 2, 400}, {518, 2, 400}, {517, 0, 0}, {772, 3, 500}, {773, 3, 500}, {774, 3, 500},
        {768, 0, 0},   {2, 0, 0},     {256, 0, 0},
    };
    for (const Case& c : cases) {
        Record r(c.code);
        // Group entry 0: key count in word 3, list offset in word 4. A row
        // record: key count in word 1, list offset in word 2. Both overlap
        // here, so each command must pick its own.
        r.word(4, 3);
        r.word(8, 500);
        r.word(12, 2);
        r.word(16, 400);
        EXPECT_EQ(SLKeyCount(r.get()), c.count) << c.code;
        EXPECT_EQ(SLKeyListOffset(r.get()), c.offset) << c.code;
    }
}

TEST(SLKey, CreateFromGroupEntryCopiesValues)
{
    Record r(518);
    r.word(12, 3);
    r.word(16, 200);
    r.keys(200, {{{7, DMI_DISPLAYSTRING, 300}}, {{8, DMI_INTEGER, 309}}, {{9, DMI_INTEGER, 0}}});
    r.text(300, "hello"); // 9 bytes; the integer after it is unaligned
    r.word(309, 0xBEEF);
    unsigned live = slLiveStringCount();
    SLKeyList* k = SLCreateKeyList(r.get());
    ASSERT_NE(k, nullptr);
    EXPECT_EQ(k->count, 3u);
    EXPECT_EQ(k->next, nullptr);
    EXPECT_EQ(k->keys[0].attributeId, 7u);
    EXPECT_EQ(k->keys[0].type, DMI_DISPLAYSTRING);
    EXPECT_EQ(valueText(k->keys[0]), "hello");
    EXPECT_EQ(std::memcmp(k->keys[0].value, r.get()->confirm + 300, 9), 0);
    EXPECT_EQ(loadWord(k->keys[1].value), 0xBEEFu);
    EXPECT_EQ(k->keys[2].value, nullptr) << "value offset 0";
    for (uint32_t i = 3; i < SL_MAX_KEYS; ++i)
        EXPECT_EQ(k->keys[i].value, nullptr);
    EXPECT_EQ(slLiveStringCount(), live + 3) << "the list and two values";
    SLDeleteKeyList(k);
    EXPECT_EQ(slLiveStringCount(), live);
}

TEST(SLKey, CreateFromRowAndFromSelectedEventRow)
{
    Record row(772);
    row.word(4, 1);
    row.word(8, 100);
    row.keys(100, {{{3, DMI_INTEGER, 120}}});
    row.word(120, 42);
    SLKeyList* k = SLCreateKeyList(row.get());
    ASSERT_NE(k, nullptr);
    EXPECT_EQ(k->count, 1u);
    EXPECT_EQ(loadWord(k->keys[0].value), 42u);
    SLDeleteKeyList(k);

    // Event: data at 64 with one class whose rows (back to back) start at
    // 200; row 0 has one attribute (32 bytes), row 1 follows at 232.
    Record ev(1, 1000);
    ev.header(12, 64);
    ev.word(64, 1);
    ev.word(64 + 4 + 12, 200);
    ev.word(200 + 12, 1);
    ev.word(232 + 4, 1);
    ev.word(232 + 8, 600);
    ev.keys(600, {{{5, DMI_INTEGER, 640}}});
    ev.word(640, 99);
    SLEventSelectRowCnf(ev.get(), 0, 1);
    k = SLCreateKeyList(ev.get());
    ASSERT_NE(k, nullptr);
    EXPECT_EQ(k->keys[0].attributeId, 5u);
    EXPECT_EQ(loadWord(k->keys[0].value), 99u);
    SLDeleteKeyList(k);
    SLEventSelectRowCnf(ev.get(), 0, 0);
    EXPECT_EQ(SLCreateKeyList(ev.get()), nullptr) << "row 0 has no keys";

    // The other layout: the rows offset names an array of row offsets.
    Record array(1, 1000);
    array.header(0, 0x12345678);
    array.header(12, 64);
    array.word(64, 1);
    array.word(64 + 4 + 12, 300);
    array.word(300, 0);   // row 0: none of interest
    array.word(304, 500); // row 1 at 500
    array.word(500 + 4, 2);
    array.word(500 + 8, 700);
    array.keys(700, {{{1, DMI_INTEGER, 740}}, {{2, DMI_OCTETSTRING, 744}}});
    array.word(740, 17);
    array.text(744, "ab");
    SLEventSelectRowCnf(array.get(), 0, 1);
    k = SLCreateKeyList(array.get());
    ASSERT_NE(k, nullptr);
    EXPECT_EQ(k->count, 2u);
    EXPECT_EQ(loadWord(k->keys[0].value), 17u);
    EXPECT_EQ(valueText(k->keys[1]), "ab");
    SLDeleteKeyList(k);
}

TEST(SLKey, RowsThatCannotBeCopiedGiveNoList)
{
    struct Case {
        const char* name;
        uint32_t count;
        uint32_t listOffset;
        uint32_t valueOffset;
        uint32_t type;
        uint32_t stringCount;
    } cases[] = {
        {"no keys", 0, 100, 0, DMI_INTEGER, 0},
        {"eleven keys", 11, 100, 0, DMI_INTEGER, 0},
        {"huge key count", 0xFFFFFFFF, 100, 0, DMI_INTEGER, 0},
        {"key entries past the indication", 2, 990, 0, DMI_INTEGER, 0},
        {"key list offset far outside", 1, 0xFFFFFFF0, 0, DMI_INTEGER, 0},
        {"value past the end", 1, 100, 998, DMI_INTEGER, 0},
        {"64-bit value past the end", 1, 100, 994, DMI_COUNTER64, 0},
        {"string count past the end", 1, 100, 900, DMI_OCTETSTRING, 200},
        {"string count wrapping", 1, 100, 900, DMI_DISPLAYSTRING, 0xFFFFFFFE},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        // An indication of 1000 bytes: nothing beyond it may be read.
        Record ev(1, 1000);
        ev.header(12, 64);
        ev.word(64, 1);
        ev.word(64 + 4 + 12, 200);
        ev.word(200 + 4, c.count);
        ev.word(200 + 8, c.listOffset);
        if (c.listOffset == 100)
            ev.keys(100, {{{1, c.type, c.valueOffset}}});
        ev.word(900, c.stringCount);
        SLEventSelectRowCnf(ev.get(), 0, 0);
        unsigned live = slLiveStringCount();
        EXPECT_EQ(SLCreateKeyList(ev.get()), nullptr);
        EXPECT_EQ(slLiveStringCount(), live) << "a partial list is not left behind";
    }
}

// Builds a one-key list with a value of `bytes` (or none).
SLKeyList* oneKey(uint32_t id, uint32_t type, const std::vector<uint8_t>* bytes)
{
    auto* k = static_cast<SLKeyList*>(SLCreateString(sizeof(SLKeyList)));
    std::memset(k, 0, sizeof *k);
    k->count = 1;
    k->keys[0].attributeId = id;
    k->keys[0].type = type;
    if (bytes != nullptr) {
        k->keys[0].value = SLCreateString(static_cast<unsigned>(bytes->size()));
        std::memcpy(k->keys[0].value, bytes->data(), bytes->size());
    }
    return k;
}

std::vector<uint8_t> word(uint32_t w)
{
    std::vector<uint8_t> b(4);
    storeWord(b.data(), w);
    return b;
}

std::vector<uint8_t> wide(uint32_t low, uint32_t high, size_t size = 8)
{
    std::vector<uint8_t> b(size, 0);
    storeWord(b.data(), low);
    storeWord(b.data() + 4, high);
    return b;
}

std::vector<uint8_t> str(const std::string& s, uint32_t count)
{
    std::vector<uint8_t> b(4 + s.size());
    storeWord(b.data(), count);
    std::copy(s.begin(), s.end(), b.begin() + 4);
    return b;
}

TEST(SLKey, Compare)
{
    auto v5 = word(5), v6 = word(6);
    auto w1 = wide(1, 1), w2 = wide(1, 2);
    auto d1 = wide(1, 0, 28), d2 = wide(2, 0, 28);
    auto hello = str("hello", 5), help = str("help!", 5), hell = str("hell", 4);
    auto nul1 = str(std::string("ab\0x", 4), 4), nul2 = str(std::string("ab\0y", 4), 4);
    struct Case {
        const char* name;
        uint32_t idA, typeA;
        const std::vector<uint8_t>* a;
        uint32_t idB, typeB;
        const std::vector<uint8_t>* b;
        int equal;
    } cases[] = {
        {"same integer", 1, 5, &v5, 1, 5, &v5, 1},
        {"integer differs", 1, 5, &v5, 1, 5, &v6, 0},
        {"counter differs", 1, 1, &v5, 1, 1, &v6, 0},
        {"gauge differs", 1, 3, &v5, 1, 3, &v6, 0},
        {"ids differ", 1, 5, &v5, 2, 5, &v5, 0},
        {"types differ", 1, 5, &v5, 1, 3, &v5, 0},
        {"64-bit counter not compared", 1, 2, &w1, 1, 2, &w2, 1},
        {"64-bit integer not compared", 1, 6, &w1, 1, 6, &w2, 1},
        {"date not compared", 1, 11, &d1, 1, 11, &d2, 1},
        {"same text", 1, 8, &hello, 1, 8, &hello, 1},
        {"text differs", 1, 8, &hello, 1, 8, &help, 0},
        {"octet string differs", 1, 7, &hello, 1, 7, &help, 0},
        {"text lengths differ", 1, 8, &hello, 1, 8, &hell, 0},
        {"text compare stops at a zero byte", 1, 8, &nul1, 1, 8, &nul2, 1},
        {"both without value", 1, 5, nullptr, 1, 5, nullptr, 1},
        {"one without value", 1, 5, &v5, 1, 5, nullptr, 0},
        {"other without value", 1, 8, nullptr, 1, 8, &hello, 0},
        {"text both without value", 1, 7, nullptr, 1, 7, nullptr, 1},
    };
    for (const Case& c : cases) {
        SLKeyList* a = oneKey(c.idA, c.typeA, c.a);
        SLKeyList* b = oneKey(c.idB, c.typeB, c.b);
        EXPECT_EQ(SLCompareKeyLists(a, b), c.equal) << c.name;
        EXPECT_EQ(SLCompareKeyLists(b, a), c.equal) << c.name << " (swapped)";
        SLDeleteKeyList(a);
        SLDeleteKeyList(b);
    }
}

TEST(SLKey, CompareCountsNullsAndChains)
{
    auto v5 = word(5);
    SLKeyList* a = oneKey(1, 5, &v5);
    SLKeyList* b = oneKey(1, 5, &v5);
    auto* empty = static_cast<SLKeyList*>(SLCreateString(sizeof(SLKeyList)));
    std::memset(empty, 0, sizeof *empty);
    EXPECT_EQ(SLCompareKeyLists(nullptr, nullptr), 1);
    EXPECT_EQ(SLCompareKeyLists(nullptr, empty), 0);
    EXPECT_EQ(SLCompareKeyLists(empty, nullptr), 0);
    EXPECT_EQ(SLCompareKeyLists(a, empty), 0) << "counts differ";
    // Chains are not compared.
    b->next = oneKey(2, 5, &v5);
    EXPECT_EQ(SLCompareKeyLists(a, b), 1);
    // A count beyond what a list holds equals nothing, itself included.
    a->count = 11;
    EXPECT_EQ(SLCompareKeyLists(a, a), 0);
    a->count = 1;

    unsigned live = slLiveStringCount();
    SLDeleteKeyList(b); // with the list chained behind it: 2 records, 2 values
    EXPECT_EQ(slLiveStringCount(), live - 4);
    SLDeleteKeyList(a);
    SLDeleteKeyList(empty);
    SLDeleteKeyList(nullptr);
}

TEST(SLKey, IndicateDownSetsTheFlag)
{
    SLLibDownFlag = 0;
    SLIndicateDown();
    EXPECT_EQ(SLLibDownFlag.load(), 1);
    SLLibDownFlag = 0;
}

} // namespace
