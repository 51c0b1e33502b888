// The alert service. It issues no alerts on this platform: every entry point
// accepts its arguments and does nothing.
#pragma once

#include "events/eventrecord.h"

int IssueOrRegisterAlert(const char* alert, EventRecord* record, int flag);
int RegisterAllAlerts(void);
int AlertServiceInitialize(void);
int AlertServiceCleanup(void);
