#include <gtest/gtest.h>

#include "base/strcase.h"

namespace {

TEST(StrCase, Comparisons)
{
    struct Case {
        const char* a;
        const char* b;
        int n; // -1: stricmp
        int expected;
    } cases[] = {
        {"EventGeneration|Temp", "eventgeneration|", 16, 0},
        {"ZOREK|error", "Zorek|Error", 11, 0},
        {"EventGeneration", "EventGeneration|", 16, -1},
        {"abc", "abd", 2, 0},
        {"abc", "abd", 3, -1},
        {"abd", "ABC", 3, 1},
        {"abc", "abcdef", -1, -1},
        {"abcdef", "ABC", -1, 1},
        {"Same", "sAME", -1, 0},
        {nullptr, "", -1, -1},
        {"", nullptr, -1, 1},
        {nullptr, nullptr, -1, 0},
        {nullptr, "x", 0, -1},
        {"x", "y", 0, 0},
        {"x", "y", -5, 0},
        {"\xe9", "a", 1, -1}, // bytes from 0x80 up sort below ASCII
        {"a", "\xe9", 1, 1},
        {"zz", "a", 1, 1},
    };
    for (const Case& c : cases) {
        int got = c.n < 0 && c.n != -5 ? stricmp(c.a, c.b) : strnicmp(c.a, c.b, c.n);
        EXPECT_EQ(got, c.expected) << (c.a ? c.a : "null") << " / " << (c.b ? c.b : "null") << " n=" << c.n;
    }
}

TEST(StrCase, ResultIsOnlySignNeverDifference)
{
    EXPECT_EQ(strnicmp("a", "z", 1), -1);
    EXPECT_EQ(strnicmp("z", "a", 1), 1);
}

} // namespace
