#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

// Writes records into a handle's confirm buffer as a provider would.
class Confirm {
public:
    explicit Confirm(uint32_t command, unsigned size = 0) : h_(SLCreateHandle(size))
    {
        std::memset(h_->command, 0, SL_COMMAND_SIZE);
        std::memset(h_->confirm, 0, h_->confirmSize);
        storeWordAt(h_->command, 1, command);
        storeWordAt(h_->command, 2, SL_COMMAND_SIZE);
    }
    ~Confirm() { SLDestroyHandle(h_); }
    SLHandle* get() { return h_; }
    void word(uint32_t offset, uint32_t value) { storeWord(h_->confirm + offset, value); }
    void header(uint32_t index, uint32_t value) { storeWordAt(h_->command, index, value); }
    // A DMI string at `offset`; returns the offset after it.
    uint32_t string(uint32_t offset, const std::string& text)
    {
        word(offset, static_cast<uint32_t>(text.size()));
        std::memcpy(h_->confirm + offset + 4, text.data(), text.size());
        return offset + 4 + static_cast<uint32_t>(text.size());
    }
    // A row record with `n` attributes of type 5 whose values follow at `values`.
    uint32_t row(uint32_t offset, uint32_t group, uint32_t n, uint32_t values, uint32_t first)
    {
        word(offset, group);
        word(offset + 12, n);
        for (uint32_t i = 0; i < n; ++i) {
            uint32_t entry = offset + 16 + 16 * i;
            word(entry + 4, i + 1);
            word(entry + 8, DMI_INTEGER);
            word(entry + 12, values + 4 * i);
            word(values + 4 * i, first + i);
        }
        return offset + 16 + 16 * n;
    }

private:
    SLHandle* h_;
};

std::string text(const DmiString* s)
{
    return s == nullptr ? "<null>" : std::string(dmiStringText(s), dmiStringLength(s));
}

TEST(SLAccess, ComponentRecordInConfirmAndInInstallIndication)
{
    Confirm c(512);
    c.word(0, 7);     // id
    c.word(8, 100);   // name
    c.word(12, 2);    // group count
    c.word(16, 200);  // group list
    c.string(100, "Baseboard");
    c.word(200, 3);
    c.word(204, 300);
    c.word(208, 4);
    c.word(212, 0);
    c.string(300, "Zorek|System Control|001");
    EXPECT_EQ(SLComponentId(c.get()), 7u);
    EXPECT_EQ(text(SLComponentName(c.get())), "Baseboard");
    EXPECT_EQ(SLComponentGroupCount(c.get()), 2u);
    EXPECT_EQ(SLComponentGroupId(c.get(), 1), 4u);
    EXPECT_EQ(text(SLComponentGroupName(c.get(), 0)), "Zorek|System Control|001");
    EXPECT_EQ(SLComponentGroupName(c.get(), 1), nullptr);
    EXPECT_EQ(SLComponentFileType(c.get(), 0), 0u) << "no file list";
    EXPECT_EQ(SLComponentFileData(c.get(), 0), nullptr);

    Confirm ind(2);
    ind.header(2, 1000);
    ind.header(12, 40);
    ind.word(0, 99); // would be the id if read at the start
    ind.word(40, 12);
    ind.word(48, 500);
    ind.string(500, "Installed");
    EXPECT_EQ(SLComponentId(ind.get()), 12u);
    EXPECT_EQ(text(SLComponentName(ind.get())), "Installed");
}

TEST(SLAccess, OffsetsOutsideTheBufferReadAsAbsent)
{
    Confirm c(516);
    uint32_t end = c.get()->confirmSize;
    struct Case {
        const char* what;
        uint32_t nameOffset;
        uint32_t count;
    } cases[] = {
        {"offset zero", 0, 0},
        {"offset past the end", end + 8, 0},
        {"count past the end", end - 8, 5},
        {"huge count", 100, 0xFFFFFFF0u},
    };
    for (const Case& k : cases) {
        c.word(4, k.nameOffset);
        if (k.nameOffset != 0 && k.nameOffset + 4 <= end)
            c.word(k.nameOffset, k.count);
        EXPECT_EQ(SLGroupName(c.get(), 0), nullptr) << k.what;
    }
    c.word(8, end - 4);
    c.word(end - 4, 0);
    EXPECT_NE(SLGroupClassName(c.get(), 0), nullptr) << "an empty string at the very end fits";
    EXPECT_EQ(SLGroupId(c.get(), 0x10000000u), 0u) << "an index far outside reads as 0";
    EXPECT_EQ(SLAttributeName(c.get(), 0x7FFFFFFFu), nullptr);
}

TEST(SLAccess, IndicationLengthBoundsTheRecords)
{
    Confirm ind(1);
    ind.header(2, 64); // the indication is 64 bytes long
    ind.header(12, 0);
    ind.word(0, 1);
    ind.word(8, 100); // class string beyond the stated length
    ind.string(100, "EventGeneration|x");
    EXPECT_EQ(SLEventClassCount(ind.get()), 1u);
    EXPECT_EQ(SLEventClassString(ind.get(), 0), nullptr);
    ind.header(2, 200);
    EXPECT_EQ(text(SLEventClassString(ind.get(), 0)), "EventGeneration|x");
}

TEST(SLAccess, AttributeValueConfirm)
{
    Confirm get(768);
    get.word(8, DMI_INTEGER); // type
    get.word(12, 0);          // no value
    EXPECT_EQ(SLAttributeType(get.get(), 5), static_cast<uint32_t>(DMI_INTEGER)) << "index ignored";
    EXPECT_EQ(SLUnsignedValue(get.get()), 0u);
    EXPECT_EQ(SLAttributePtr(get.get()), nullptr);
    get.word(12, 64);
    get.word(64, 0x80000000u);
    EXPECT_EQ(SLIntegerValue(get.get()), INT32_MIN);
    get.word(8, DMI_DISPLAYSTRING);
    get.string(64, "mail.example");
    EXPECT_EQ(text(SLStringPtr(get.get())), "mail.example");
    EXPECT_EQ(SLAttributePtr(get.get()), static_cast<void*>(get.get()->confirm + 64));

    Confirm list(520);
    list.word(12, DMI_INTEGER);
    EXPECT_EQ(SLAttributeType(list.get(), 0), static_cast<uint32_t>(DMI_INTEGER));
    list.word(20, 2);
    list.word(24, 100);
    list.word(100, 1);
    list.word(104, 200);
    list.word(108, 1);
    list.word(112, 220);
    list.string(200, "Warning");
    list.string(220, "Critical");
    EXPECT_EQ(SLEnumerationListCount(list.get(), 0), 2u);
    EXPECT_EQ(SLEnumerationValue(list.get(), 0, 1), 1);
    EXPECT_EQ(text(SLEnumerationName(list.get(), 0, 1)), "Critical");
}

TEST(SLAccess, RowsOfBothIndicationLayouts)
{
    for (bool backToBack : {true, false}) {
        Confirm ind(1, 16384);
        ind.header(0, backToBack ? SL_LEVEL_CHECK : 0x12345678u);
        ind.header(2, 16384);
        ind.header(12, 0);
        ind.word(0, 1);     // one class
        ind.word(4, 3);     // component
        ind.word(12, 3);    // rows
        uint32_t rows = 1000;
        uint32_t r0 = backToBack ? rows : 2000;
        uint32_t r1 = ind.row(r0, 10, 3, 5000, 10) + (backToBack ? 0 : 100);
        uint32_t r2 = ind.row(r1, 11, 1, 5100, 20) + (backToBack ? 0 : 100);
        ind.row(r2, 12, 2, 5200, 30);
        if (!backToBack) {
            ind.word(rows, r0);
            ind.word(rows + 4, r1);
            ind.word(rows + 8, r2);
        }
        ind.word(16, rows);
        EXPECT_EQ(r1 - r0, backToBack ? 64u : 164u) << "a row of 3 attributes is 64 bytes";
        SLEventSelectRowCnf(ind.get(), 0, 2);
        EXPECT_EQ(SLRowGroupId(ind.get()), 12u) << backToBack;
        EXPECT_EQ(SLRowAttributeCount(ind.get()), 2u);
        EXPECT_EQ(SLRowAttributeId(ind.get(), 1), 2u);
        EXPECT_EQ(SLRowUnsignedValue(ind.get(), 1), 31u);
        SLEventSelectRowCnf(ind.get(), 0, 1);
        EXPECT_EQ(SLRowIntegerValue(ind.get(), 0), 20);
        EXPECT_EQ(SLRowUnsignedValue(ind.get(), 5), 0u) << "an entry past the row's values";
    }
}

TEST(SLAccess, RowSkipThatWouldRunOffTheBufferIsAbsent)
{
    Confirm ind(1);
    ind.header(0, SL_LEVEL_CHECK);
    ind.header(2, 8192);
    ind.word(0, 1);
    ind.word(16, 1000);
    ind.word(1000 + 12, 0x0FFFFFFFu); // absurd attribute count
    SLEventSelectRowCnf(ind.get(), 0, 1);
    EXPECT_EQ(pGetRow(ind.get()), nullptr);
    EXPECT_EQ(SLRowGroupId(ind.get()), 0u);
    SLEventSelectRowCnf(ind.get(), 0x01000000u, 0);
    EXPECT_EQ(SLRowAttributeCount(ind.get()), 0u);
}

} // namespace
