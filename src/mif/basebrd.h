// Naming a table row of a baseboard group for people.
#pragma once

#include <cstdint>

#include "sl/sltypes.h"

// The row's "Short Name", else its "Description", into a 64-byte buffer;
// the no-value text when the group has neither. Result as GetPureValue.
int BaseboardRowName(SLHandle* h, uint32_t componentId, uint32_t groupId, SLKeyList* keys, char* buffer);
