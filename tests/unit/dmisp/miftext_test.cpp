#include <gtest/gtest.h>

#include <fstream>
#include <random>
#include <sstream>
#include <string>

#include "dmisp/miftext.h"

using namespace dmisp;

namespace {

const char* const goodMif = R"MIF(// a sample
LANGUAGE = "English (US)"
Start Component
    Name = "Sample " "Board"    // adjacent strings join
    description = "tab\there \"quoted\" back\\slash\x41\n"
    start enum
        name = "OnOff"
        type = integer
        0 = "Off"
        1 = "On"
    end enum
    start group
        name = "ComponentID"
        class = "DMTF|ComponentID|001"
        id = 1
        start attribute
            name = "Version"
            id = 3
            type = displaystring(16)
            value = "2.93"
        end attribute
        start attribute
            name = "Manufacturer"
            id = 1
            type = string(32)
            access = read-only
            storage = common
            value = "Zorek"
        end attribute
        start attribute
            name = "Switch"
            id = 2
            access = READ-WRITE
            type = "OnOff"
            value = "on"
        end attribute
    end group
    start group
        name = "Template"
        class = "Zorek|Things|001"
        key = 1, 2
        start attribute
            name = "Index"  id = 1  type = integer
        end attribute
        start attribute
            name = "Label"  id = 2  type = displaystring(8)
        end attribute
        start attribute
            name = "Level"  id = 3  type = start enum 010 = "eight" 0x10 = "sixteen" end enum
            value = 8
        end attribute
        start attribute
            name = "Big"    id = 4  type = counter64  value = 0x123456789  access = write-only
        end attribute
        start attribute
            name = "When"   id = 5  type = date  value = unknown
        end attribute
        start attribute
            name = "Wild"   id = 6  type = int  value = 0x80000000
        end attribute
    end group
    start table
        name = "Things"
        class = "Zorek|Things|001"
        id = 7
        {1, "a"}
        {2, "b", "sixteen", 5, "19950101120000.000000+000", -1}
        {3, "c", , , , unsupported}
    end table
end component
)MIF";

TEST(DmispMifText, ParsesEveryConstructOfTheGrammar)
{
    Component c;
    std::string error;
    ASSERT_TRUE(parseMif(goodMif, "good.mif", &c, &error)) << error;
    EXPECT_EQ(c.language, "English (US)");
    EXPECT_EQ(c.name, "Sample Board");
    EXPECT_EQ(c.description, "tab\there \"quoted\" back\\slashA\n");
    ASSERT_EQ(c.groups.size(), 2u); // the template is not installed by itself
    const Group& id = c.groups[0];
    EXPECT_EQ(id.id, 1u);
    ASSERT_EQ(id.attributes.size(), 3u);
    EXPECT_EQ(id.attributes[0].id, 1u); // sorted by id
    EXPECT_EQ(id.attributes[2].type, TypeDisplayString);
    EXPECT_EQ(id.attributes[2].maxSize, 16u);
    EXPECT_EQ(id.attributes[1].access, 2u);
    EXPECT_EQ(id.attributes[1].enumeration.size(), 2u);
    ASSERT_EQ(id.rows.size(), 1u);
    EXPECT_EQ(id.rows[0][1], Value::integer(1)); // enum text, any case
    EXPECT_EQ(id.rows[0][2], Value::string("2.93"));

    const Group& t = c.groups[1];
    EXPECT_EQ(t.id, 7u);
    EXPECT_EQ(t.name, "Things");
    EXPECT_EQ(t.keys, (std::vector<uint32_t>{1, 2}));
    ASSERT_EQ(t.rows.size(), 3u);
    // Omitted values take the template's.
    EXPECT_EQ(t.rows[0][2], Value::integer(8)); // octal 010
    EXPECT_EQ(t.rows[0][3], Value::integer(0x123456789ll));
    EXPECT_EQ(t.rows[0][4].state, Value::Unknown);
    EXPECT_EQ(t.rows[0][5], Value::integer(INT32_MIN)); // 0x80000000 wraps
    EXPECT_EQ(t.rows[1][2], Value::integer(16));
    EXPECT_EQ(t.rows[1][4].text.size(), DateSize);
    EXPECT_EQ(t.rows[1][5], Value::integer(-1));
    EXPECT_EQ(t.rows[2][3], Value::integer(0x123456789ll));
    EXPECT_EQ(t.rows[2][5].state, Value::Unsupported);
    EXPECT_EQ(t.attributes[3].access, 3u);
    EXPECT_EQ(t.findRow({Value::integer(2), Value::string("b")}), 1);
    EXPECT_EQ(t.findRow({Value::integer(2), Value::string("c")}), -1);
}

// Replaces the first occurrence of `from` in the good text.
std::string variant(const std::string& from, const std::string& to)
{
    std::string s = goodMif;
    size_t at = s.find(from);
    EXPECT_NE(at, std::string::npos) << from;
    return s.replace(at, from.size(), to);
}

TEST(DmispMifText, RefusesBadFilesWithLineAndReason)
{
    const struct {
        std::string text;
        std::string error;
    } cases[] = {
        {"", "bad.mif:1: expected 'start', found end of file"},
        {"start component\n  name = \"x\"\n", "bad.mif:3: missing 'end component'"},
        {"start component\nend component\n", "bad.mif:1: component without a name"},
        {"start component name = \"x\" end component junk", "bad.mif:1: text after end component"},
        {"start component\n name = \"x\n\"\nend component", "bad.mif:2: unterminated string"},
        {"start component\n name = \"a\\qb\"\nend component", "bad.mif:2: bad escape \\q"},
        {"start component\n name = \"x\"\n colour = \"red\"\nend component",
         "bad.mif:3: unknown keyword 'colour' in component"},
        {variant("id = 3", "id = 09"), "bad.mif:18: bad integer literal"},
        {variant("id = 3", "id = 1"), "bad.mif:22: attribute id 1 used twice in group"},
        {variant("value = \"2.93\"", "value = 293"), "bad.mif:20: integer value for attribute 3 \"Version\" of string type"},
        {variant("value = \"2.93\"", "value = \"12345678901234567\""),
         "bad.mif:20: string longer than its size 16 for attribute 3 \"Version\""},
        {variant("value = \"on\"", "value = \"maybe\""),
         "bad.mif:35: \"maybe\" is not in the enumeration for attribute 2 \"Switch\""},
        {variant("type = \"OnOff\"", "type = \"Dimmer\""), "bad.mif:34: unknown type or enumeration \"Dimmer\""},
        {variant("key = 1, 2", "key = 1, 9"), "bad.mif:41: key attribute 9 is not an attribute of the group"},
        {variant("{3, \"c\"", "{2, \"b\""), "bad.mif:68: row has the same key values as an earlier row"},
        {variant("{1, \"a\"}", "{1, \"a\", 8, 1, unknown, 1, 7}"), "bad.mif:66: row has 7 values, the group has 6 attributes"},
        {variant("{1, \"a\"}", "{1, \"a\", 9}"), "bad.mif:66: value not in the enumeration for attribute 3 \"Level\""},
        {variant("{1, \"a\"}", "{1 \"a\"}"), "bad.mif:66: expected ',' or '}' in row, found string \"a\""},
        {variant("class = \"Zorek|Things|001\"\n        id = 7", "class = \"Zorek|Other\"\n        id = 7"),
         "bad.mif:62: table of class \"Zorek|Other\" has no template group"},
        {variant("id = 7", "id = 1"), "bad.mif:65: group id 1 used twice"},
        {variant("value = 0x80000000", "value = 0x100000000"), "bad.mif:59: integer out of range for attribute 6 \"Wild\""},
        {variant("value = 0x80000000", "value = 99999999999999999999"), "bad.mif:59: integer out of range"},
        {variant("type = date", "type = float"), "bad.mif:56: unknown type or enumeration \"float\""},
        {variant("type = string(32)", "type = string"), "bad.mif:25: string type without a size"},
        {variant("access = read-only", "access = sometimes"), "bad.mif:26: unknown access 'sometimes'"},
        {variant("end group\n    start table", "end grup\n    start table"),
         "bad.mif:61: expected 'end group', found 'end' 'grup'"},
        {variant("        name = \"Index\"", "       "), "bad.mif:42: attribute without a name"},
        {variant("    end group\n    start group", "    start group"), "bad.mif:37: unknown block 'group' in group"},
        {variant("1 = \"On\"", "0 = \"On\""), "bad.mif:10: enumeration value 0 given twice"},
        {"start component name = \"x\" \x01 end component", "bad.mif:1: unexpected character '\\x01'"},
        // Found by fuzzing: an enumeration followed by a second type was kept,
        // and the writer then emitted a value the enumeration refuses.
        {"start component name = \"x\"\n start group name = \"g\" class = \"c\" id = 2\n"
         " start attribute name = \"a\" id = 1 type = start enum 1 = \"One\" end enum\n"
         " type = displaystring(8) value = \"\" end attribute end group end component",
         "bad.mif:4: attribute type given twice"},
    };
    for (const auto& tc : cases) {
        Component c;
        c.name = "untouched";
        std::string error;
        EXPECT_FALSE(parseMif(tc.text, "bad.mif", &c, &error)) << tc.error;
        EXPECT_EQ(error, tc.error);
        EXPECT_EQ(c.name, "untouched");
    }
}

TEST(DmispMifText, WriterOutputReadsBackToTheSameContent)
{
    Component c;
    std::string error;
    ASSERT_TRUE(parseMif(goodMif, "good.mif", &c, &error)) << error;
    // Current values that differ from the defaults, including bytes that
    // need escapes.
    c.groups[0].rows[0][2] = Value::string("x\"\\\n\t\x01\xe9");
    c.groups[0].attributes[2].value = c.groups[0].rows[0][2];
    c.groups[1].rows[2][1] = Value::string("");
    c.groups[1].rows[1][3] = Value::integer(-5);
    c.groups[1].rows[0][5] = Value::integer(INT32_MAX);
    for (int round = 0; round < 2; ++round) {
        std::string text = writeMif(c);
        Component back;
        ASSERT_TRUE(parseMif(text, "written.mif", &back, &error)) << error << "\n" << text;
        EXPECT_EQ(back, c) << text;
        EXPECT_EQ(back.groups[1].findRow({Value::integer(3), Value::string("")}), 2);
        c = back;
    }
}

TEST(DmispMifText, TwoTablesFromOneTemplateKeepTheirOwnRows)
{
    std::string text = R"(start component name = "t"
        start group name = "T" class = "C|T|1" key = 1
          start attribute name = "k" id = 1 type = integer end attribute
          start attribute name = "v" id = 2 type = integer value = 4 end attribute
        end group
        start table name = "A" class = "C|T|1" id = 5 {1} {2, 3} end table
        start table name = "B" class = "C|T|1" id = 6 end table
        end component)";
    Component c;
    std::string error;
    ASSERT_TRUE(parseMif(text, "t.mif", &c, &error)) << error;
    ASSERT_EQ(c.groups.size(), 2u);
    EXPECT_EQ(c.groups[0].rows.size(), 2u);
    EXPECT_EQ(c.groups[0].rows[0][1], Value::integer(4));
    EXPECT_EQ(c.groups[1].rows.size(), 0u);
    Component back;
    ASSERT_TRUE(parseMif(writeMif(c), "w.mif", &back, &error)) << error;
    EXPECT_EQ(back, c);
}

// Damaged variants of a good file never crash the parser or read outside
// the text (checked under AddressSanitizer).
TEST(DmispMifText, DamagedTextIsRefusedOrParsedButNeverCrashes)
{
    std::mt19937 random(12345);
    const std::string good = goodMif;
    int refused = 0;
    for (int i = 0; i < 3000; ++i) {
        std::string s = good;
        switch (i % 3) {
        case 0:
            s.resize(random() % s.size());
            break;
        case 1:
            for (int k = 0; k < 4; ++k)
                s[random() % s.size()] = static_cast<char>(random() % 256);
            break;
        default:
            s.erase(random() % s.size(), 1 + random() % 20);
            break;
        }
        Component c;
        std::string error;
        if (!parseMif(s, "d.mif", &c, &error)) {
            ++refused;
            EXPECT_EQ(error.rfind("d.mif:", 0), 0u) << error;
        }
    }
    EXPECT_GT(refused, 1000);
}

TEST(DmispMifText, ShippedMifsReadBackToTheSameContent)
{
    const std::string dir = MOX_SOURCE_DIR "/mifs/";
    int found = 0;
    for (const char* file : {"mox.mif", "baseboard.mif", "enclosure.mif", "old/mox-2.40.mif", "old/mox-2.60.mif",
                             "old/mox-2.92.mif"}) {
        std::ifstream in(dir + file);
        if (!in.good())
            continue;
        ++found;
        std::stringstream text;
        text << in.rdbuf();
        Component c, back;
        std::string error;
        ASSERT_TRUE(parseMif(text.str(), file, &c, &error)) << error;
        ASSERT_TRUE(parseMif(writeMif(c), file, &back, &error)) << error;
        EXPECT_EQ(back, c) << file;
    }
    if (found == 0)
        GTEST_SKIP() << "no shipped MIFs in " << dir;
}

} // namespace
