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

// "event <group> of <component>", control bytes as blanks, cut to fit out.
void actionLogEventName(const EventRecord* record, char* out, size_t size);
