// Confirm and indication records: what the provider writes for each
// command and event, laid out as the management interface reads them.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "dmisp/database.h"

namespace dmisp {

// Size of a command block; parameters and values must lie inside it.
constexpr uint32_t CommandSize = 4096;

// The answer to one command: status (word 11), entry count (word 10) and
// the confirm bytes to copy to the caller's confirm buffer.
struct Outcome {
    uint32_t status = 0;
    uint32_t count = 0;
    std::vector<uint8_t> confirm;
};

// Executes the listing, attribute and row commands (512 to 523, 768 to 774)
// and the trivial ones (258, 1024, 1025) on a copy of the command block.
// Sets persist to the component to write back after a successful set.
Outcome executeCommand(Database& db, const uint8_t* block, uint32_t* persistComponent);

// Path of an install command (1026), or false when it lies outside the block.
bool installPath(const uint8_t* block, std::string* path);

// One row of an event: the group and row position in a component.
struct EventClassRow {
    const Group* group;
    size_t row;
};

// An event indication (type 1) with one class per row given; the class
// string of each is its group's class. `levelCheck` selects the row layout.
std::vector<uint8_t> eventIndication(const Component& c, const std::vector<EventClassRow>& classes,
                                     uint32_t levelCheck, uint32_t completion);
// A component installed (2) or uninstalled (3) indication.
std::vector<uint8_t> componentIndication(const Component& c, uint32_t type, uint32_t levelCheck, uint32_t completion);

// Reads key entries of a command (count word 18, offset word 19) as values
// in the group's key order. A Status.
uint32_t readKeys(const Group& g, const uint8_t* block, std::vector<Value>* keyValues);

} // namespace dmisp
