#include <cstring>
#include <string>

#include "baseboardenv.h"

namespace {

const std::string blanks32(32, ' ');

class Lcd : public BaseboardTest {
protected:
    uint32_t baseboard = 0;

    // The shipped baseboard MIF in the catalogue, its display found.
    void withBaseboardMif()
    {
        baseboard = installBaseboardMif();
        catalogue(baseboard, 1);
        ASSERT_EQ(LcdInitialize(), 0);
        ASSERT_EQ(LcdGroupId, 30u);
        ASSERT_EQ(LcdContentsAttrId, 8u);
    }

    // A baseboard of the given groups, catalogued, and a fresh search.
    void withBaseboard(std::initializer_list<std::string> groups)
    {
        freshDatabase();
        baseboard = installText(mifComponent("Test Baseboard", groups));
        catalogue(baseboard, 1);
    }
};

TEST_F(Lcd, DisplayLineIsAlwaysThirtyTwoCharacters)
{
    withBaseboardMif();
    const std::string forty = "0123456789012345678901234567890123456789";
    struct Case {
        const char* what;
        const char* text;
        std::string stored;
    } cases[] = {
        {"10 characters", "Fan failed", "Fan failed" + std::string(22, ' ')},
        {"40 characters", forty.c_str(), forty.substr(0, 32)},
        {"empty", "", blanks32},
        {"exactly 32", "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdef", "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdef"},
        {"31 characters", "ABCDEFGHIJKLMNOPQRSTUVWXYZabcde", "ABCDEFGHIJKLMNOPQRSTUVWXYZabcde "},
        {"null text", nullptr, blanks32},
    };
    for (const auto& c : cases) {
        // Something else first, so that each case really writes.
        ASSERT_EQ(dmisp::setValue(baseboard, 30, 8, {}, "previous"), 0u);
        WriteLCD(c.text);
        EXPECT_EQ(value(baseboard, 30, 8), c.stored) << c.what;
    }
    WriteLCD("Fan failed");
    ClearLCD();
    EXPECT_EQ(value(baseboard, 30, 8), blanks32);
}

TEST_F(Lcd, ReadGivesTheWholeLine)
{
    withBaseboardMif();
    const char* line = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdef";
    WriteLCD(line);
    char buffer[40];
    memset(buffer, 'X', sizeof buffer);
    ReadLCD(buffer);
    EXPECT_STREQ(buffer, line);
    for (size_t i = 33; i < sizeof buffer; ++i)
        EXPECT_EQ(buffer[i], 'X') << "byte " << i;

    WriteLCD("short");
    ReadLCD(buffer);
    EXPECT_EQ(std::string(buffer), "short" + std::string(27, ' '));
}

TEST_F(Lcd, FirstListedDisplayFormWins)
{
    const char* form1 = "Zorek|Status Display|basebrd001";
    const char* form2 = "Zorek|Status Display|002";
    struct Case {
        const char* what;
        std::string first;
        std::string second;
        uint32_t group;     // 0: no display found
        uint32_t attribute; // contents attribute written
    } cases[] = {
        {"first form listed first", displayGroup(11, form1), displayGroup(12, form2), 11, 7},
        {"second form listed first", displayGroup(11, form2), displayGroup(12, form1), 11, 8},
        {"other group, then second form", pagingGroup(11, "Zorek|Paging Config|001"), displayGroup(12, form2), 12, 8},
        {"second form in other case", displayGroup(11, "zOREK|status DISPLAY|002"), pagingGroup(12, "Other|X|1"), 11,
         8},
        {"first form in other case", displayGroup(11, "ZOREK|STATUS DISPLAY|BASEBRD001"), pagingGroup(12, "Other|X|1"),
         11, 7},
        {"text after the compared length", displayGroup(11, "Zorek|Status Display|0027"), pagingGroup(12, "Other|X|1"),
         11, 8},
        {"class shorter than the form", displayGroup(11, "Zorek|Status Display|00"), displayGroup(12, "Zorek|Status"),
         0, 0},
        {"other version", displayGroup(11, "Zorek|Status Display|003"),
         displayGroup(12, "Zorek|Status Display|basebrd002"), 0, 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        withBaseboard({c.first, c.second});
        EXPECT_EQ(LcdInitialize(), c.group != 0 ? 0 : -1);
        EXPECT_EQ(LcdGroupId, c.group);
        EXPECT_EQ(LcdContentsAttrId, c.attribute);
        uint64_t sets = dmisp::commandsReceived(769);
        WriteLCD("hello");
        if (c.group == 0) {
            EXPECT_EQ(dmisp::commandsReceived(769), sets);
            continue;
        }
        EXPECT_EQ(value(baseboard, c.group, c.attribute), "hello" + std::string(27, ' '));
        EXPECT_EQ(value(baseboard, c.group, c.attribute == 7 ? 8 : 7), "");
        uint32_t other = c.group == 11 ? 12 : 11;
        std::string untouched;
        if (dmisp::getValue(baseboard, other, 7, {}, &untouched) == 0) {
            EXPECT_EQ(untouched, "");
        }
    }
}

TEST_F(Lcd, SearchRunsOnceAndOnlyUntilFound)
{
    withBaseboardMif();
    uint64_t before = dmisp::commandsReceived();
    EXPECT_EQ(LcdInitialize(), 0);
    EXPECT_EQ(LcdInitialize(), 0);
    EXPECT_EQ(dmisp::commandsReceived(), before);

    // A failed search changes nothing and can succeed later.
    withBaseboard({pagingGroup(5, "Zorek|Paging Config|001")});
    EXPECT_EQ(LcdInitialize(), -1);
    EXPECT_EQ(LcdGroupId, 0u);
    ASSERT_TRUE(dmisp::uninstall(baseboard));
    forget();
    baseboard = installText(mifComponent("Test Baseboard", {displayGroup(9, "Zorek|Status Display|002")}));
    catalogue(baseboard, 1);
    EXPECT_EQ(LcdInitialize(), 0);
    EXPECT_EQ(LcdGroupId, 9u);
}

TEST_F(Lcd, WithoutDisplayNothingIsSentOrRead)
{
    struct Case {
        const char* what;
        bool catalogued;
    } cases[] = {{"no display group", true}, {"baseboard not catalogued", false}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        freshDatabase();
        baseboard = installText(
            mifComponent("Test Baseboard", {displayGroup(3, "Zorek|Other Display|002")}));
        if (c.catalogued)
            catalogue(baseboard, 1);
        EXPECT_EQ(LcdInitialize(), -1);
        uint64_t before = dmisp::commandsReceived();
        WriteLCD("hello");
        ClearLCD();
        char buffer[40];
        memset(buffer, 'X', sizeof buffer);
        ReadLCD(buffer);
        EXPECT_EQ(dmisp::commandsReceived(), before);
        EXPECT_EQ(std::string(buffer, sizeof buffer), std::string(40, 'X'));
    }
}

} // namespace
