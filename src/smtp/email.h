// The e-mail action: an alert composed from the event and the baseboard's
// e-mail settings, handed to the SMTP client.
#pragma once

#include "actions/actions.h"
#include "events/eventrecord.h"
#include "sl/sltypes.h"
#include "smtp/smtp.h"

// The record of the alert being composed and sent; null at all other times.
extern EmailConfig* pEmailConfig;

// The handler of the e-mail action. Reads group 1012 of the baseboard afresh
// for every alert: attribute 1 the server (no server, no e-mail), 2 the
// sender, 3 the recipients (both default to "admin@" and the host name).
int MoxSendEmail(SLHandle* indication, EventRecord* record);
// Tells what MoxSendEmail would send for the event; sends nothing.
void describeMoxSendEmail(SLHandle* indication, EventRecord* record, const Explanation* explain);
// Composes the alert for `record` into the zero-filled slots of `config`: the
// settings, the subject and the body. 0 when no server is set, else 1.
int emailCompose(SLHandle* handle, const char* hostName, EventRecord* record, EmailConfig* config);

// Reads the server, sender and recipients of the baseboard's e-mail settings
// into the zero-filled slots of `config`, with "admin@" and `hostName` for an
// absent sender or recipient list. 0 when no server is set, else 1.
int emailReadSettings(SLHandle* handle, const char* hostName, EmailConfig* config);
