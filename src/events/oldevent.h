// Vendor ("Zorek|Error") event matching.
#pragma once

#include <cstdint>

#include "actions/actions.h"
#include "events/eventrecord.h"
#include "sl/sltypes.h"

void ZorekEventActions(SLHandle* indication);
// The same; with an explanation it tells what it reads and finds and what
// each action would do, and does nothing.
void zorekEventActions(SLHandle* indication, const Explanation* explain);
void matchZorekEvents(SLHandle* indication, EventRecord* record, const Explanation* explain = nullptr);
// Points a six-key list at the caller's values, in key order: MIF id, group,
// instance, attribute, attribute value, error state. The list does not own
// the values.
void fillKey(SLKeyList* keys, uint32_t* mifId, uint32_t* group, uint32_t* instance, uint32_t* attribute,
             uint32_t* value, uint32_t* state);
