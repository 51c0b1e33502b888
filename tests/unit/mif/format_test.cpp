#include <cstring>
#include <string>

#include "mif/basebrd.h"
#include "mif/format.h"
#include "providerenv.h"
#include "sl/slkey.h"
#include "testmif.h"

namespace {

class Formatting : public ProviderTest {
protected:
    uint32_t component = 0;

    void SetUp() override
    {
        ProviderTest::SetUp();
        component = install(testComponentMif());
        registerManagement();
        componentList = newComponentInfo(component);
        ASSERT_NE(componentList, nullptr);
    }

    void set(uint32_t attribute, const std::string& value)
    {
        ASSERT_EQ(dmisp::setValue(component, 1, attribute, {}, value), 0u) << value;
    }

    std::string get(uint32_t attribute)
    {
        std::string value;
        EXPECT_EQ(dmisp::getValue(component, 1, attribute, {}, &value), 0u);
        return value;
    }

    // GetPureValue into a buffer of `len` bytes; checks that nothing past
    // the buffer was touched.
    std::string read(uint32_t attribute, int len, int* result)
    {
        char buffer[96];
        memset(buffer, 'X', sizeof buffer);
        *result = GetPureValue(h, component, 1, attribute, nullptr, buffer, len);
        for (size_t i = static_cast<size_t>(len); i < sizeof buffer; ++i)
            EXPECT_EQ(buffer[i], 'X') << "byte " << i << " written past len " << len;
        EXPECT_LT(strlen(buffer), static_cast<size_t>(len));
        return buffer;
    }
};

TEST_F(Formatting, ValuesAsTextCutToTheBuffer)
{
    struct Case {
        const char* what;
        uint32_t attribute;
        const char* value; // set first when not null
        int len;
        const char* text;
        int result;
    } cases[] = {
        {"plain integer", 1, nullptr, 64, "42", 2},
        {"plain integer len 5", 1, "-12345", 5, "-123", 4},
        {"plain integer len 1", 1, nullptr, 1, "", 0},
        {"negative integer", 1, "-5", 64, "-5", 2},
        {"unsupported", 1, "-2147483648", 64, "Unsupported", 0},
        {"unsupported len 5", 1, "-2147483648", 5, "Unsu", 0},
        {"unsupported len 1", 1, "-2147483648", 1, "", 0},
        {"enumeration", 2, nullptr, 64, "Off", 3},
        {"enumeration other entry", 2, "1", 64, "On", 2},
        {"enumeration len 5", 2, "2", 5, "Fail", 4},
        {"counter", 5, nullptr, 64, "7", 1},
        {"gauge", 6, nullptr, 64, "99", 2},
        {"string", 3, nullptr, 64, "plain text", 10},
        {"string len 5", 3, nullptr, 5, "plai", 4},
        {"string len 1", 3, nullptr, 1, "", 0},
        {"string above 7-bit", 3, "caf\xe9 \x80\xff!", 64, "caf    !", 8},
        {"date", 4, nullptr, 64, "2026-12-06 at 11:30:05 (+060)", 29},
        {"date len 5", 4, nullptr, 5, "2026", 4},
        {"date len 1", 4, nullptr, 1, "", 0},
        {"date cut short", 4, "2026120611", 64, "2026-12-06 at 11:", 17},
        {"negative offset", 4, "19991231235959.000000-300", 64, "1999-12-31 at 23:59:59 (-300)", 29},
        {"no such attribute", 77, nullptr, 64, "        ", 0},
        {"no such attribute len 5", 77, nullptr, 5, "    ", 0},
        {"no such attribute len 1", 77, nullptr, 1, "", 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        if (c.value != nullptr)
            set(c.attribute, c.value);
        int result = -1;
        EXPECT_EQ(read(c.attribute, c.len, &result), c.text);
        EXPECT_EQ(result, c.result);
    }
}

TEST_F(Formatting, FailedReadWritesTheNoValueText)
{
    // The catalogue knows the attribute, the read itself fails.
    ASSERT_EQ(AttributeType(h, component, 1, 1), 5u);
    dmisp::injectRefuse(1);
    int result = -1;
    EXPECT_EQ(read(1, 64, &result), "        ");
    EXPECT_EQ(result, 0);
}

TEST_F(Formatting, TypesWithoutConversionReadAsNoValue)
{
    for (uint32_t type : {4u, 9u, 10u}) {
        SCOPED_TRACE(type);
        uint32_t attribute = 90 + type;
        scriptedAttribute() = ScriptedAttribute{attribute, type, {}};
        SLDmiInvoke = answerScriptedAttribute;
        EXPECT_EQ(AttributeType(h, component, 1, attribute), type);
        SLDmiInvoke = DmiInvoke;
        uint64_t before = dmisp::commandsReceived();
        char buffer[16];
        EXPECT_EQ(GetPureValue(h, component, 1, attribute, nullptr, buffer, sizeof buffer), 0);
        EXPECT_STREQ(buffer, "        ");
        EXPECT_EQ(SetPureValue(h, component, 1, attribute, nullptr, "1"), 0);
        EXPECT_EQ(dmisp::commandsReceived(), before) << "nothing is read or written";
    }
}

TEST_F(Formatting, SetsByType)
{
    struct Case {
        const char* what;
        uint32_t attribute;
        std::string value;
        int result;
        std::string stored; // as the provider gives it back
    } cases[] = {
        {"enumeration text", 2, "Failed", 1, "2"},
        {"enumeration other entry", 2, "On", 1, "1"},
        {"enumeration in other case", 2, "failed", 0, "1"},
        {"text outside the enumeration", 2, "Broken", 0, "1"},
        {"plain integer", 1, "123", 1, "123"},
        {"plain integer from text", 1, "-77abc", 1, "-77"},
        {"string", 3, "new label", 1, "new label"},
        {"empty string", 3, "", 1, ""},
        {"date", 4, std::string("20270101000000.000000+000\0\0\0", 28), 1, "20270101000000.000000+000"},
        {"no such attribute", 77, "1", 0, ""},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        EXPECT_EQ(SetPureValue(h, component, 1, c.attribute, nullptr, c.value.c_str()), c.result);
        if (c.attribute != 77) {
            std::string stored = get(c.attribute);
            stored.erase(stored.find_last_not_of('\0') + 1);
            EXPECT_EQ(stored, c.stored);
        }
    }
}

TEST_F(Formatting, FormatDmiDateAndSmallHelpers)
{
    char out[30];
    EXPECT_STREQ(formatDmiDate("20010203040506.000000+120", out), "2001-02-03 at 04:05:06 (+120)");
    char shortDate[28] = "200102";
    EXPECT_STREQ(formatDmiDate(shortDate, out), "2001-02-");
    char empty[28] = {};
    EXPECT_STREQ(formatDmiDate(empty, out), "");
    char buffer[4] = {'a', 'b', 'c', 'd'};
    EXPECT_EQ(noValue(buffer, 1), 0);
    EXPECT_EQ(buffer[0], '\0');
    EXPECT_EQ(buffer[1], 'b');
    EXPECT_EQ(unsupported(buffer, 4), 0);
    EXPECT_STREQ(buffer, "Uns");
    EXPECT_EQ(min(-3, 2), -3);
    EXPECT_EQ(min(INT32_MAX, INT32_MIN), INT32_MIN);
}

TEST_F(Formatting, RowNamesByShortNameDescriptionOrNeither)
{
    struct Case {
        uint32_t group;
        size_t row;
        const char* text;
        int result;
    } cases[] = {
        {2, 1, "CPU 2", 5},
        {3, 0, "Fan in front", 12},
        {4, 0, "        ", 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.group);
        SLKeyList* k = GroupKeyList(h, component, c.group);
        for (size_t i = 0; i < c.row && k != nullptr; ++i)
            k = k->next;
        ASSERT_NE(k, nullptr);
        char buffer[64];
        EXPECT_EQ(BaseboardRowName(h, component, c.group, k, buffer), c.result);
        EXPECT_STREQ(buffer, c.text);
    }
}

} // namespace
