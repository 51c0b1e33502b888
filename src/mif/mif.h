// The component catalogue, registration with the provider and the actions
// table.
#pragma once

#include <cstdint>

#include "sl/sltypes.h"

// 0 on success; 1 no SL handle, 2 registration refused, 3 own MIF unavailable.
int RegisterWithSL(void);
// `name` is a DMI string as the SL accessors return it.
void AddComponentToList(const DmiString* name, uint32_t componentId);
// The catalogue's name of the component; "Unknown Component" without an entry.
const char* ComponentName(uint32_t componentId);
