// The action log: with "actionlog = true" in the configuration file, one
// system-log line at LOG_NOTICE for every system-control action an event
// ordered or that notifications-only skipped, for every e-mail outcome, and
// once at start-up a warning when actions rows ask for e-mail but no SMTP
// server is set. Off by default: then none of these lines is written.
#pragma once

#include <cstddef>
#include <cstdint>

#include "events/eventrecord.h"
#include "smtp/smtp.h"

// 1: the action log is on. Set from the configuration file at start-up.
extern uint32_t bActionLog;

// A system-control action (the management controller's action code) that an
// event ordered, or that notifications-only skipped.
void actionLogSystemControl(uint32_t controlCode, const EventRecord* record, bool skipped);
// Sends an alert composed for `record` and logs its outcome. The same as
// _MoxSendEmail when the action log is off.
int actionLogSendEmail(EmailConfig* config, const EventRecord* record);
// An alert not sent because no SMTP server is set.
void actionLogNoServer(const EventRecord* record);
// At start-up, after registration: warns when enabled rows of the actions
// tables ask for e-mail but the baseboard has no SMTP server.
void actionLogStartupCheck(void);

// What the enabled rows of one actions table ask for.
struct ActionsTableSurvey {
    unsigned rows;        // rows read
    unsigned enabled;     // of them enabled
    unsigned email;       // enabled rows asking for e-mail
    unsigned alarm;       // enabled rows asking for the log line and alarm record
    unsigned control;     // enabled rows asking for system control
    unsigned conflicting; // enabled rows asking for more than one system-control action
    char conflict[200];   // the first of them: its keys and those actions
};
// Reads actions table `group` of the own component as the carry-over copies
// it; false when the group cannot be listed.
bool surveyActionsTable(SLHandle* h, int group, ActionsTableSurvey* survey);
// Whether the baseboard's e-mail settings name an SMTP server (copied to
// `server`).
bool emailServerSet(SLHandle* h, char* server, size_t size);
// The name of a system-control action code.
const char* systemControlName(uint32_t code);

// "event <group> of <component>", control bytes as blanks, cut to fit out.
void actionLogEventName(const EventRecord* record, char* out, size_t size);
