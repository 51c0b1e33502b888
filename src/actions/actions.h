// Action dispatch and the local notifications.
#pragma once

#include "events/eventrecord.h"
#include "sl/sltypes.h"

// Hands the event to the alarm daemon and writes its system-log line.
void LogEvent(SLHandle* indication, EventRecord* record);
