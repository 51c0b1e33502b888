#include "actions/actionlog.h"

#include <cstdio>
#include <cstring>
#include <initializer_list>
#include <syslog.h>

#include "actions/actions.h"
#include "actions/uxaction.h"
#include "base/log.h"
#include "mif/format.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"

uint32_t bActionLog = 0;

namespace {

constexpr uint32_t emailGroup = 1012;
constexpr uint32_t emailSwitch = 20;
constexpr uint32_t enableFlag = 30;
constexpr uint32_t logSwitch = 9;

} // namespace

const char* systemControlName(uint32_t code)
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

namespace {

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

void surveyRow(const ActionRow& row, ActionsTableSurvey* survey)
{
    bool enabled = true;
    uint32_t controls[6];
    unsigned control = 0;
    bool email = false, alarm = false;
    for (int i = 0; i < row.count; ++i) {
        uint32_t id = row.pairs[i].attributeId;
        bool on = row.pairs[i].value != 0;
        if (id == enableFlag)
            enabled = on;
        email |= id == emailSwitch && on;
        alarm |= id == logSwitch && on;
        if (on && isSystemControlAction(id) && control < 6)
            controls[control++] = id;
    }
    if (!enabled)
        return;
    ++survey->enabled;
    survey->email += email ? 1 : 0;
    survey->alarm += alarm ? 1 : 0;
    survey->control += control != 0 ? 1 : 0;
    if (control < 2)
        return;
    // Each of them ends the machine's or the daemon's run: only the first in
    // run order can happen.
    if (survey->conflicting++ != 0)
        return;
    explainKeys(row.keyList, survey->conflict, sizeof survey->conflict);
    for (unsigned c = 0; c < control; ++c) {
        size_t used = strlen(survey->conflict);
        snprintf(survey->conflict + used, sizeof survey->conflict - used, "%s%s", c == 0 ? ": " : ", ",
                 actionName(controls[c]));
    }
}

} // namespace

bool surveyActionsTable(SLHandle* h, int group, ActionsTableSurvey* survey)
{
    *survey = ActionsTableSurvey{};
    uint32_t own = MyComponentId();
    if (own == 0 || SLListGroup(h, own, static_cast<uint32_t>(group)) != 0)
        return false;
    int savedGroup = moxActionTableGroup;
    moxActionTableGroup = group;
    ActionRow* first = GetNewActionRow();
    if (first != nullptr)
        ReadMOXActionsTable(h, first);
    moxActionTableGroup = savedGroup;
    // A first row that cannot be read leaves the first record without keys.
    for (ActionRow* row = first; row != nullptr && row->keyList != nullptr; row = row->next) {
        ++survey->rows;
        surveyRow(*row, survey);
    }
    DeleteActionTable(first);
    return true;
}

bool emailServerSet(SLHandle* h, char* server, size_t size)
{
    return getStringValue(h, BaseboardComponentId(), emailGroup, 1, nullptr, server, static_cast<int>(size)) != 0 &&
           server[0] != '\0';
}

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
        moxLog(LOG_NOTICE, "mox action: %s skipped for %s: notifications only\n", systemControlName(controlCode), event);
    else
        moxLog(LOG_NOTICE, "mox action: %s ordered for %s\n", systemControlName(controlCode), event);
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
    unsigned rows = 0;
    if (!emailServerSet(h, server, sizeof server)) {
        ActionsTableSurvey survey;
        for (int group : {10, 4})
            rows += surveyActionsTable(h, group, &survey) ? survey.email : 0;
    }
    SLDestroyHandle(h);
    if (rows != 0)
        moxLog(LOG_NOTICE,
               "mox action: warning: %u actions-table rows ask for e-mail but no SMTP server is set "
               "(baseboard group 1012, attribute 1)\n",
               rows);
}
