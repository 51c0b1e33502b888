// MIF texts for the tests against the substitute provider: the daemon's own
// component with its supported-components and actions tables, a board with
// event groups, and builders for small baseboards.
#pragma once

#include <initializer_list>
#include <string>
#include <vector>

// The own component. Actions tables: group 3 (keys 1-5, enable flag 6, then
// the actions) only when it has rows, group 4 (keys 1-6, actions, enable 30)
// and group 10 (keys 1-6, actions, enable 30, keys 31 and 32).
struct OwnMif {
    std::string version = "2.93";
    std::vector<std::string> supported{"1, \"Test Board\"", "2, \"Other Board\""};
    std::vector<std::string> group3, vendor, standard;
    int actions = 16; // attributes 7 .. 6 + actions; 17 is the alert name
};
std::string ownMif(const OwnMif& m);

// A table row: `keys`, the actions 7 .. 6 + n (those in `on` are 1, 17 the
// alert name), then `tail` (enable flag and, in group 10, keys 31 and 32).
std::string actionRow(const std::string& keys, std::initializer_list<int> on, const std::string& tail, int n = 16,
                      const std::string& alert = "");

// "Test Board": voltage event generation (group 20, 9 attributes), a short
// event generation group (21, 6 attributes), the voltage-probe instance
// table (3), a fan table without names (5), a vendor error group (30).
std::string boardMif(const std::string& name);

// An attribute named `name` (empty: "A<id>").
std::string attribute(int id, const std::string& type, const std::string& value = "0", const std::string& name = "");
std::string mifComponent(const std::string& name, std::initializer_list<std::string> groups);
// A scalar group holding string attributes `strings` (displaystring(32)) and
// an enumeration `enumId` (0 "No Action", then `texts` as 1, 2, ...).
std::string mifGroup(const std::string& name, const std::string& cls, unsigned id,
                     std::initializer_list<unsigned> strings, unsigned enumId = 0,
                     std::initializer_list<const char*> texts = {});
