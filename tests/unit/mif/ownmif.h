// Own-MIF texts written by the tests: the daemon's component with a chosen
// version, a supported-components table and small actions tables in groups 3,
// 4 and 10, so that the carry-over's source and target rows are known.
#pragma once

#include <string>
#include <vector>

namespace ownmif {

inline std::string attribute(int id, const std::string& name, const std::string& type, const std::string& access,
                             const std::string& value)
{
    return "        start attribute\n            name = \"" + name + "\"\n            id = " + std::to_string(id) +
           "\n            type = " + type + "\n            access = " + access + "\n            value = " + value +
           "\n        end attribute\n";
}

inline std::string integer(int id, bool key = false)
{
    return attribute(id, "A" + std::to_string(id), "integer", key ? "read-only" : "read-write", "0");
}

inline std::string table(int id, const std::string& keys, const std::string& attributes,
                         const std::vector<std::string>& rows)
{
    std::string cls = "Test|Table " + std::to_string(id) + "|001";
    std::string text = "    start group\n        name = \"Table " + std::to_string(id) + "\"\n        class = \"" +
                       cls + "\"\n        id = " + std::to_string(id) + "\n        key = " + keys + "\n" +
                       attributes + "    end group\n";
    text += "    start table\n        name = \"Table " + std::to_string(id) + "\"\n        class = \"" + cls +
            "\"\n        id = " + std::to_string(id) + "\n";
    for (const auto& row : rows)
        text += "        { " + row + " }\n";
    return text + "    end table\n";
}

struct Rows {
    std::vector<std::string> supported{"1, \"Zorek Tessarin Baseboard\""};
    std::vector<std::string> group3, group4, group10;
    bool withGroup3 = true;
};

// Slots: group 3 is 1-5 keys, 6 enable, 7, 8, 17; group 4 is 1-6 keys, 7, 8,
// 17, 30; group 10 is 1-6 keys, 7, 8, 17, 30, 31 and 32 keys.
inline std::string text(const std::string& version, const Rows& rows)
{
    std::string t = "start component\n    name = \"Zorek Tessarin Server Manager - Mox\"\n"
                    "    description = \"test MIF\"\n"
                    "    start group\n        name = \"ComponentID\"\n        class = \"DMTF|ComponentID|001\"\n"
                    "        id = 1\n";
    t += attribute(1, "Manufacturer", "displaystring(64)", "read-only", "\"Zorek\"");
    t += attribute(3, "Version", "displaystring(16)", "read-only", "\"" + version + "\"");
    t += "    end group\n";
    t += table(2, "1,2",
               attribute(1, "MIF Id", "integer", "read-only", "0") +
                   attribute(2, "Component Name", "displaystring(64)", "read-only", "\"\""),
               rows.supported);
    std::string keys5, keys6;
    for (int i = 1; i <= 5; ++i)
        keys5 += integer(i, true);
    keys6 = keys5 + integer(6, true);
    std::string alert = attribute(17, "Alert Name", "displaystring(64)", "read-write", "\"\"");
    if (rows.withGroup3)
        t += table(3, "1,2,3,4,5", keys5 + integer(6) + integer(7) + integer(8) + alert, rows.group3);
    t += table(4, "1,2,3,4,5,6", keys6 + integer(7) + integer(8) + alert + integer(30), rows.group4);
    t += table(10, "1,2,3,4,5,6,31,32",
               keys6 + integer(7) + integer(8) + alert + integer(30) + integer(31, true) + integer(32, true),
               rows.group10);
    return t + "end component\n";
}

// Row keys shared by the old and new test MIFs.
constexpr const char* vendorKeys = "1, 33, 3, 0, -2147483648";
constexpr const char* standardKeys = "1, 50, 1, 0, 0, 4";

// An older own MIF whose three tables carry distinct settings:
// group 3 (7, 8, enable) = (1, 0, 0), group 4 (7, 8, 30) = (0, 1, 0),
// group 10 (7, 8, 30) = (1, 1, 0).
inline std::string old(const std::string& version)
{
    Rows r;
    r.group3 = {std::string(vendorKeys) + ", 0, 1, 0, \"old alert\"", "2, 2, 2, 2, 2, 1, 1, 1, \"x\""};
    r.group4 = {std::string(vendorKeys) + ", 0, 0, 1, \"old alert\", 0"};
    r.group10 = {std::string(standardKeys) + ", 1, 1, \"old alert\", 0, 7, 8"};
    return text(version, r);
}

// The new own MIF: defaults (7, 8, 30) = (0, 0, 1) and alert "new alert".
inline std::string current()
{
    Rows r;
    r.withGroup3 = false;
    r.group4 = {std::string(vendorKeys) + ", 0, 0, 0, \"new alert\", 1"};
    r.group10 = {std::string(standardKeys) + ", 0, 0, \"new alert\", 1, 7, 8"};
    return text("2.93", r);
}

} // namespace ownmif
