// Standard DMI event matching.
#pragma once

#include <cstdint>

#include "actions/actions.h"
#include "events/eventrecord.h"
#include "sl/sltypes.h"

// Builds the record of a standard event indication, finds its row in the
// standard actions table and runs the row's actions.
void StdEventActions(SLHandle* indication);
// The same; with an explanation it tells what it reads and finds and what
// each action would do, and does nothing.
void stdEventActions(SLHandle* indication, const Explanation* explain);
void matchStdEvents(SLHandle* indication, EventRecord* record, const Explanation* explain = nullptr);
// Writes the event's values into the keys of a key list taken from the
// table. -1 (nothing usable) when a key to be written carries no value.
int modifyKey(SLKeyList* keys, uint32_t mifId, uint32_t eventGroupId, uint32_t eventType, uint32_t instance,
              uint32_t severity, uint32_t eventSystem, uint32_t eventSubsystem);

// The actions of the actions-table row in `row`'s confirm, for both matchers:
// the alert name, the enable flag, then every action in run order.
void runRowActions(SLHandle* row, SLHandle* indication, EventRecord* record, const Explanation* explain = nullptr);
// One lookup of a matcher, for an explanation: the keys tried and whether a
// row was found.
void explainTry(const Explanation* explain, int attempt, const SLKeyList* keys, bool found);
// The value of the first key of `keys`, 0 when there is none.
uint32_t firstKeyValue(const SLKeyList* keys);
