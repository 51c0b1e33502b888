// The e-mail action: an alert composed from the event and the baseboard's
// e-mail settings, handed to the SMTP client.
#pragma once

#include "events/eventrecord.h"
#include "sl/sltypes.h"
#include "smtp/smtp.h"

// The record of the alert being composed and sent; null at all other times.
extern EmailConfig* pEmailConfig;

// The handler of the e-mail action. Reads group 1012 of the baseboard afresh
// for every alert: attribute 1 the server (no server, no e-mail), 2 the
// sender, 3 the recipients (both default to "admin@" and the host name).
int MoxSendEmail(SLHandle* indication, EventRecord* record);
