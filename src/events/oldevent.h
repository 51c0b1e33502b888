// Vendor ("Zorek|Error") event matching.
#pragma once

#include <cstdint>

#include "events/eventrecord.h"
#include "sl/sltypes.h"

void ZorekEventActions(SLHandle* indication);
void matchZorekEvents(SLHandle* indication, EventRecord* record);
// Points a six-key list at the caller's values, in key order: MIF id, group,
// instance, attribute, attribute value, error state. The list does not own
// the values.
void fillKey(SLKeyList* keys, uint32_t* mifId, uint32_t* group, uint32_t* instance, uint32_t* attribute,
             uint32_t* value, uint32_t* state);
