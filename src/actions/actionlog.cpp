#include "actions/actionlog.h"

#include <cstdio>
#include <cstring>
#include <syslog.h>

#include "actions/uxaction.h"
#include "base/log.h"
#include "mif/format.h"
#include "mif/mif.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"

uint32_t bActionLog = 0;

namespace {

constexpr uint32_t emailGroup = 1012;
constexpr uint32_t emailSwitch = 20;
constexpr uint32_t enableFlag = 30;

const char* controlName(uint32_t code)
{
    switch (code) {
    case 1:
        return "reset";
    case 2:
        return "power off";
    case 3:
        return "operating-system shutdown";
    case 6:
        return "shutdown and reset";
    case 7:
        return "shutdown and power off";
    case 8:
        return "NMI";
    default:
        return "system-control action";
    }
}

struct EmailOutcome {
    bool failed = false;
    SmtpStep step{};
    char message[256] = {};
};

void recordFailure(void* context, const SmtpStep& step)
{
    auto* outcome = static_cast<EmailOutcome*>(context);
    if (step.errorClass == 0)
        return;
    outcome->failed = true;
    outcome->step = step;
    smtpCopySanitized(outcome->message, sizeof outcome->message, step.message, sizeof outcome->message - 1);
    outcome->step.message = outcome->message;
}

// Enabled rows of one actions table of the own component that ask for e-mail.
unsigned rowsAskingForEmail(SLHandle* h, int group)
{
    int savedGroup = moxActionTableGroup;
    moxActionTableGroup = group;
    ActionRow* first = GetNewActionRow();
    if (first == nullptr) {
        moxActionTableGroup = savedGroup;
        return 0;
    }
    ReadMOXActionsTable(h, first);
    moxActionTableGroup = savedGroup;
    unsigned count = 0;
    for (ActionRow* row = first; row != nullptr; row = row->next) {
        bool enabled = true;
        bool email = false;
        for (int i = 0; i < row->count; ++i) {
            if (row->pairs[i].attributeId == enableFlag)
                enabled = row->pairs[i].value != 0;
            if (row->pairs[i].attributeId == emailSwitch)
                email = row->pairs[i].value != 0;
        }
        if (enabled && email)
            ++count;
    }
    DeleteActionTable(first);
    return count;
}

} // namespace

void actionLogEventName(const EventRecord* record, char* out, size_t size)
{
    if (out == nullptr || size == 0)
        return;
    const char* group = record != nullptr && record->groupName != nullptr ? record->groupName : "Unknown Group";
    const char* component =
        record != nullptr && record->componentName != nullptr ? record->componentName : "Unknown Component";
    snprintf(out, size, "event %s of %s", group, component);
    smtpSanitize(out);
}

void actionLogSystemControl(uint32_t controlCode, const EventRecord* record, bool skipped)
{
    if (bActionLog == 0)
        return;
    char event[400];
    actionLogEventName(record, event, sizeof event);
    if (skipped)
        moxLog(LOG_NOTICE, "mox action: %s skipped for %s: notifications only\n", controlName(controlCode), event);
    else
        moxLog(LOG_NOTICE, "mox action: %s ordered for %s\n", controlName(controlCode), event);
}

int actionLogSendEmail(EmailConfig* config, const EventRecord* record)
{
    if (bActionLog == 0)
        return _MoxSendEmail(config);
    EmailOutcome outcome;
    int result = smtpSendObserved(config, recordFailure, &outcome);
    char event[400];
    actionLogEventName(record, event, sizeof event);
    char server[EMAIL_SERVER_SIZE];
    smtpCopySanitized(server, sizeof server, config != nullptr ? config->server : nullptr, EMAIL_SERVER_SIZE - 1);
    if (result == 1)
        moxLog(LOG_NOTICE, "mox action: e-mail alert for %s delivered to server[%s]\n", event, server);
    else if (outcome.failed)
        moxLog(LOG_NOTICE, "mox action: e-mail alert for %s failed in step %d (%s): %s\n", event, outcome.step.step,
               outcome.step.name, outcome.message);
    else
        moxLog(LOG_NOTICE, "mox action: e-mail alert for %s failed\n", event);
    return result;
}

void actionLogNoServer(const EventRecord* record)
{
    if (bActionLog == 0)
        return;
    char event[400];
    actionLogEventName(record, event, sizeof event);
    moxLog(LOG_NOTICE, "mox action: e-mail alert for %s not sent: no SMTP server is set\n", event);
}

void actionLogStartupCheck(void)
{
    if (bActionLog == 0)
        return;
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr)
        return;
    char server[EMAIL_SERVER_SIZE] = {};
    bool serverSet = getStringValue(h, BaseboardComponentId(), emailGroup, 1, nullptr, server, sizeof server) != 0 &&
                     server[0] != '\0';
    unsigned rows = serverSet ? 0 : rowsAskingForEmail(h, 10) + rowsAskingForEmail(h, 4);
    SLDestroyHandle(h);
    if (rows != 0)
        moxLog(LOG_NOTICE,
               "mox action: warning: %u actions-table rows ask for e-mail but no SMTP server is set "
               "(baseboard group 1012, attribute 1)\n",
               rows);
}
