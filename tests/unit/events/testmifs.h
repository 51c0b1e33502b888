// Small MIFs for the event tests: the daemon's own component with its
// supported-components and actions tables, and a board with event groups.
#pragma once

#include <string>

// Own MIF whose actions rows hold `actionAttributes` (7 .. 6 + n, plus 30)
// after the keys. Rows are given as MIF table rows.
std::string ownMif(const std::string& standardRows, const std::string& vendorRows, int actionAttributes = 16);
// The test board ("Test Board", supported with MIF id 1) and a second kind
// ("Other Board", MIF id 2).
std::string boardMif(const std::string& name);
