#include "actions/actions.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <syslog.h>
#include <unistd.h>

#include "actions/actionlog.h"
#include "actions/uxaction.h"
#include "base/log.h"
#include "base/text.h"
#include "events/dmi2kob.h"
#include "hardware/lcd.h"
#include "hardware/sysaction.h"
#include "hardware/sysctrl.h"
#include "mif/basebrd.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"
#include "smtp/email.h"

const ActionOrder ActionID[] = {
    {8, 1},  {7, 0},  {9, 2},  {10, 3}, {16, 9}, {20, 13}, {19, 12}, {21, 14},
    {22, 15}, {11, 4}, {12, 5}, {13, 6}, {14, 7}, {15, 8},  {18, 11}, {0, 0},
};

namespace {

// What a line shows for a text the record does not have.
const char* const absent = "Unknown";

const char* text(const char* s)
{
    return s != nullptr ? s : absent;
}

const ActionEntry* handlers = lscActions;

// A system-control action: asks for the capability first, honours the
// notifications-only setting, and takes the lock once for each call. With an
// explanation it tells the request it would make, and makes none.
struct Control {
    uint32_t capability;
    uint32_t code; // of MoxInitiateSystemControlAction
    int32_t delay; // milliseconds
};
constexpr Control osShutdown{0x08, 3, 200};
constexpr Control shutdownPowerOff{0x40, 7, 40000};
constexpr Control shutdownReset{0x10, 6, 40000};
constexpr Control hardPowerOff{0x01, 2, 200};
constexpr Control hardReset{0x02, 1, 200};
constexpr Control nmi{0x04, 8, 200};

int systemControl(const Control& control, const EventRecord* record, const Explanation* explain)
{
    SystemControlInfo info;
    int rc = MoxGetSystemControlInfo(&info);
    if (rc != 0)
        return rc;
    if ((info.capabilities & control.capability) == 0) {
        explainLine(explain, "nothing: capability 0x%x is not offered", control.capability);
        return 0;
    }
    if (explain != nullptr) {
        if (bNotificationOnly != 0)
            explainLine(explain, "skipped: notificationonly is set");
        else
            explainLine(explain, "system-control request %u (%s) with delay %d ms", control.code,
                        systemControlName(control.code), control.delay);
        return 0;
    }
    actionLogSystemControl(control.code, record, bNotificationOnly != 0);
    if (bNotificationOnly != 0)
        return 0;
    return MoxInitiateSystemControlAction(control.code, control.delay);
}

template <const Control& control>
void describeControl(SLHandle*, EventRecord* record, const Explanation* explain)
{
    systemControl(control, record, explain);
}

const char* priorityName(int priority)
{
    switch (priority) {
    case LOG_EMERG:
        return "emerg";
    case LOG_ERR:
        return "err";
    case LOG_WARNING:
        return "warning";
    case LOG_NOTICE:
        return "notice";
    default:
        return "info";
    }
}

int severityPriority(uint32_t severity)
{
    switch (severity) {
    case 1:
    case 2:
    case 4:
        return LOG_INFO;
    case 8:
        return LOG_WARNING;
    default:
        return LOG_ERR;
    }
}

// The text of the first enumeration entry with `value`, or `fallback`.
const char* enumText(SLHandle* handle, uint32_t component, uint32_t group, uint32_t attribute, uint32_t value,
                     const char* fallback)
{
    for (EnumList* e = AttributeEnumList(handle, component, group, attribute); e != nullptr; e = e->next) {
        if (static_cast<uint32_t>(e->value) == value)
            return e->name != nullptr ? e->name : fallback;
    }
    return fallback;
}

// The component's name as the provider lists it now (caller deletes it).
char* listedComponentName(SLHandle* handle, uint32_t component)
{
    if (SLListComponent(handle, nullptr, component) != 0)
        return nullptr;
    return NewCString(SLComponentName(handle));
}

// The event's system-log line and its priority, chosen by the record's kind;
// false when no line is logged.
bool standardLogLine(EventRecord* record, char (&line)[200], int* priority)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return false;
    char label[64];
    rowLabel(handle, record, label, sizeof label);
    SLDestroyHandle(handle);
    snprintf(line, sizeof line, "TYPE:%s COMPONENT:%s GROUP:%s SEVERITY:%s ROW:%s SYSTEM:%s SUBSYSTEM:%s",
             text(record->eventTypeText), text(record->componentName), text(record->groupName),
             text(record->severityText), label, text(record->systemText), text(record->subsystemText));
    *priority = severityPriority(record->severity);
    return true;
}

bool baseboardLogLine(SLHandle* indication, EventRecord* record, char (&line)[200], int* priority)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return false;
    if (SLEventRowCount(indication, 0) == 0) {
        SLDestroyHandle(handle);
        return false;
    }
    SLEventSelectRowCnf(indication, 0, 0);
    if (SLRowAttributeCount(indication) == 0) {
        SLDestroyHandle(handle);
        return false;
    }
    uint32_t errorGroup = SLRowGroupId(indication);
    uint32_t errorAttribute = SLRowAttributeId(indication, 0);
    uint32_t errorValue = SLRowUnsignedValue(indication, 0);

    uint32_t component = record->componentId;
    char* componentName = listedComponentName(handle, component);
    const char* name = enumText(handle, component, errorGroup, errorAttribute, errorValue, "Unknown");
    const char* value =
        enumText(handle, component, record->groupId, record->attributeId, record->attributeValue, "N/A");
    char label[64];
    rowLabel(handle, record, label, sizeof label);
    *priority = errorValue == 0 ? LOG_INFO : errorValue == 1 ? LOG_WARNING : LOG_ERR;
    snprintf(line, sizeof line, "NAME:%s COMPONENT:%s GROUP:%s ROW:%s ATTRIBUTE:%s %s", name, text(componentName),
             text(GroupName(handle, component, record->groupId)), label,
             text(AttributeName(handle, component, record->groupId, record->attributeId)), value);
    SLDeleteString(componentName);
    SLDestroyHandle(handle);
    return true;
}

bool unknownLogLine(EventRecord* record, char (&line)[200], int* priority)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return false;
    char* name = listedComponentName(handle, record->componentId);
    // The unknown-event line is built in 124 bytes.
    snprintf(line, 124, "DMI Unknown Indication %s", text(name));
    *priority = LOG_NOTICE;
    SLDeleteString(name);
    SLDestroyHandle(handle);
    return true;
}

bool eventLogLine(SLHandle* indication, EventRecord* record, char (&line)[200], int* priority)
{
    bool built;
    switch (record->eventKind) {
    case EVENT_STANDARD:
        built = standardLogLine(record, line, priority);
        break;
    case EVENT_VENDOR:
        built = baseboardLogLine(indication, record, line, priority);
        break;
    default:
        built = unknownLogLine(record, line, priority);
        break;
    }
    // Every text in the line comes from the provider; the line end is ours.
    if (built)
        moxBlankControls(line);
    return built;
}

// The console line without its line end; false when there is none.
bool consoleLine(EventRecord* record, char* out, size_t size)
{
    char* message = createEventMessage(record);
    if (message == nullptr)
        return false;
    moxBlankControls(message);
    snprintf(out, size, "MOX: %s", message);
    SLDeleteString(message);
    return true;
}

// The broadcast text without its line end; false when the group cannot be listed.
bool broadcastText(EventRecord* record, char* out, size_t size)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return false;
    char* name = nullptr;
    if (SLListGroup(handle, record->componentId, record->groupId) == 0)
        name = NewCString(SLGroupName(handle, 0));
    SLDestroyHandle(handle);
    if (name == nullptr)
        return false;
    // The name is cleaned, not the message: its line ends are the daemon's.
    moxBlankControls(name);
    snprintf(out, size, "Please check group %s on this machine", name);
    SLDeleteString(name);
    return true;
}

void lcdText(EventRecord* record, char (&line)[LcdWidth + 1])
{
    char message[1024];
    snprintf(message, sizeof message, "Check: %s", text(record->groupName));
    moxBlankControls(message);
    LcdLine(message, line);
}

// ---------------------------------------------------------------------------
// What each action would do, for an explanation.

void describeConsoleMessage(SLHandle*, EventRecord* record, const Explanation* explain)
{
    char line[1100];
    if (consoleLine(record, line, sizeof line))
        explainLine(explain, "standard error: %s", line);
    else
        explainLine(explain, "nothing: no message can be made");
}

void describeBeepSpeaker(SLHandle*, EventRecord*, const Explanation* explain)
{
    explainLine(explain, "the bell (byte 0x07) on standard output");
}

void describeAlarm(EventRecord* record, const Explanation* explain)
{
    AlarmRecord alarm = makeAlarmRecord(record);
    char record28[128];
    snprintf(record28, sizeof record28,
             "alarm record component %u group %u event group %u severity %u instance %u power %u",
             alarm.componentId, alarm.groupId, alarm.eventGroupId, alarm.severity, alarm.instance, alarm.powerFlag);
    KobPaths paths = defaultKobPaths();
    char pid[20] = {};
    switch (kobPeerAt(paths, pid)) {
    case KobPeer::Running:
        explainLine(explain, "%s to %s (kobd runs, process %s)", record28, paths.fifo, pid);
        break;
    case KobPeer::Stale:
        explainLine(explain, "%s not sent: %s names no running kobd; it and %s would be removed", record28,
                    paths.lockFile, paths.fifo);
        break;
    case KobPeer::Gone:
        explainLine(explain, "%s not sent: the process %s names (%s) has ended", record28, paths.lockFile, pid);
        break;
    case KobPeer::None:
        explainLine(explain, "%s not sent: no alarm peer (no %s)", record28, paths.lockFile);
        break;
    }
}

void describeLogEvent(SLHandle* indication, EventRecord* record, const Explanation* explain)
{
    describeAlarm(record, explain);
    char line[200];
    int priority;
    if (eventLogLine(indication, record, line, &priority))
        explainLine(explain, "system log at %s: %s", priorityName(priority), line);
    else
        explainLine(explain, "no system-log line: the event's row cannot be read");
}

void describeWriteToLCD(SLHandle*, EventRecord* record, const Explanation* explain)
{
    if (LcdGroupId == 0) {
        explainLine(explain, "nothing: the baseboard has no status display");
        return;
    }
    char line[LcdWidth + 1];
    lcdText(record, line);
    explainLine(explain, "LCD (group %u, attribute %u of component %u): \"%s\"", LcdGroupId, LcdContentsAttrId,
                BaseboardComponentId(), line);
}

void describeBroadcastMessage(SLHandle*, EventRecord* record, const Explanation* explain)
{
    char message[1024];
    if (broadcastText(record, message, sizeof message))
        explainLine(explain, "system log at emerg (every logged-in user): %s", message);
    else
        explainLine(explain, "nothing: group %u of component %u cannot be listed", record->groupId,
                    record->componentId);
}

void describeTarget(bool found, const SysCtrlTarget& target, const char* what, const Explanation* explain)
{
    if (found)
        explainLine(explain, "\"%s\" to attribute %u of group %u of component %u", target.value, target.attribute,
                    target.group, target.component);
    else
        explainLine(explain, "nothing: no %s group", what);
}

void describeIssuePage(SLHandle*, EventRecord*, const Explanation* explain)
{
    SysCtrlTarget target;
    describeTarget(SysCtrlPageTarget(&target), target, "paging", explain);
}

template <bool blink> void describeIdLed(SLHandle*, EventRecord*, const Explanation* explain)
{
    SysCtrlTarget target;
    describeTarget(SysCtrlIdLedTarget(blink, &target), target, "system-control", explain);
}

// Prefixes each line of a describer with the action's code and name.
struct ActionLines {
    const Explanation* outer;
    const ActionEntry* entry;
};

void actionLine(void* context, const char* text)
{
    auto* lines = static_cast<ActionLines*>(context);
    const char* name = lines->entry->name != nullptr ? lines->entry->name : "(unnamed)";
    explainLine(lines->outer, "action %u %s: %s", lines->entry->code, name, text);
}

} // namespace

const ActionEntry lscActions[] = {
    {7, BeepSpeaker, describeBeepSpeaker, "BeepSpeaker"},
    {8, ConsoleMessage, describeConsoleMessage, "ConsoleMessage"},
    {9, LogEvent, describeLogEvent, "LogEvent"},
    {10, writeToLCD, describeWriteToLCD, "writeToLCD"},
    {11, shutdownOS, describeControl<osShutdown>, "shutdownOS"},
    {12, shutdownAndPowerOff, describeControl<shutdownPowerOff>, "shutdownAndPowerOff"},
    {13, shutdownAndresetsystem, describeControl<shutdownReset>, "shutdownAndresetsystem"},
    {14, powerOff, describeControl<hardPowerOff>, "powerOff"},
    {15, resetSystem, describeControl<hardReset>, "resetSystem"},
    {16, BroadcastMessage, describeBroadcastMessage, "BroadcastMessage"},
    {18, issueNMI, describeControl<nmi>, "issueNMI"},
    {19, issuePage, describeIssuePage, "issuePage"},
    {20, MoxSendEmail, describeMoxSendEmail, "MoxSendEmail"},
    {21, MoxIdLedOff, describeIdLed<false>, "MoxIdLedOff"},
    {22, MoxIdLedBlink, describeIdLed<true>, "MoxIdLedBlink"},
    {0, nullptr},
};

const ActionEntry* actionsSetHandlers(const ActionEntry* table)
{
    const ActionEntry* previous = handlers;
    handlers = table != nullptr ? table : lscActions;
    return previous;
}

void DoAction(uint32_t code, uint32_t value, SLHandle* indication, EventRecord* record)
{
    dispatchAction(code, value, indication, record, nullptr);
}

void dispatchAction(uint32_t code, uint32_t value, SLHandle* indication, EventRecord* record,
                    const Explanation* explain)
{
    if (value == 0)
        return;
    for (const ActionEntry* entry = handlers; entry->code != 0; ++entry) {
        if (entry->code != code)
            continue;
        if (explain == nullptr) {
            entry->handler(indication, record);
        } else if (entry->describe != nullptr) {
            ActionLines lines{explain, entry};
            Explanation prefixed{actionLine, &lines};
            entry->describe(indication, record, &prefixed);
        } else {
            explainLine(explain, "action %u: its handler cannot describe itself", code);
        }
        return;
    }
}

const char* actionName(uint32_t code)
{
    for (const ActionEntry* entry = lscActions; entry->code != 0; ++entry) {
        if (entry->code == code)
            return entry->name;
    }
    return nullptr;
}

bool isSystemControlAction(uint32_t code)
{
    return (code >= 11 && code <= 15) || code == 18;
}

void explainLine(const Explanation* explain, const char* format, ...)
{
    if (explain == nullptr)
        return;
    char line[2048];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(line, sizeof line, format, arguments);
    va_end(arguments);
    moxBlankControls(line);
    explain->line(explain->context, line);
}

void explainKeys(const SLKeyList* keys, char* out, unsigned size)
{
    if (size == 0)
        return;
    out[0] = '\0';
    size_t used = 0;
    uint32_t count = keys == nullptr ? 0 : keys->count < SL_MAX_KEYS ? keys->count : SL_MAX_KEYS;
    for (uint32_t i = 0; i < count && used < size; ++i) {
        const SLKeyEntry& key = keys->keys[i];
        const char* separator = i == 0 ? "" : " ";
        int n;
        if (key.value == nullptr)
            n = snprintf(out + used, size - used, "%s%u=(none)", separator, key.attributeId);
        else if (key.type == DMI_OCTETSTRING || key.type == DMI_DISPLAYSTRING)
            n = snprintf(out + used, size - used, "%s%u=\"%.*s\"", separator, key.attributeId,
                         static_cast<int>(dmiStringLength(static_cast<const DmiString*>(key.value))),
                         dmiStringText(static_cast<const DmiString*>(key.value)));
        else
            n = snprintf(out + used, size - used, "%s%u=%d", separator, key.attributeId,
                         static_cast<int32_t>(loadWord(key.value)));
        used += n > 0 ? static_cast<size_t>(n) : 0;
    }
    if (count == 0)
        snprintf(out, size, "(none)");
}

void explainRecord(const Explanation* explain, const EventRecord* record)
{
    if (explain == nullptr)
        return;
    char instance[24] = "none";
    if (record->keyList != nullptr && record->keyList->count != 0 && record->keyList->keys[0].value != nullptr)
        snprintf(instance, sizeof instance, "%d", static_cast<int32_t>(loadWord(record->keyList->keys[0].value)));
    if (record->eventKind == EVENT_STANDARD)
        explainLine(explain,
                    "standard event of component %u (%s): event group %u, type %u (%s), severity %u (%s), "
                    "system %u (%s), subsystem %u (%s), group %u (%s), instance %s",
                    record->componentId, text(record->componentName), record->eventGroupId, record->eventType,
                    text(record->eventTypeText), record->severity, text(record->severityText), record->eventSystem,
                    text(record->systemText), record->eventSubsystem, text(record->subsystemText), record->groupId,
                    text(record->groupName), instance);
    else
        explainLine(explain,
                    "vendor event of component %u (%s): error state %u, group %u (%s), attribute %u (%s), "
                    "value %u, instance %s",
                    record->componentId, text(record->componentName), record->errorState, record->groupId,
                    text(record->groupName), record->attributeId, text(record->attributeName),
                    record->attributeValue, instance);
}

char* createEventMessage(EventRecord* record)
{
    auto* message = static_cast<char*>(SLCreateString(1024));
    if (message == nullptr)
        return nullptr;
    if (record->eventKind == EVENT_STANDARD)
        snprintf(message, 1024, "Event type \"%s\" reported for \"%s\" group.", text(record->eventTypeText),
                 text(record->groupName));
    else
        snprintf(message, 1024, "Event reported for %s attribute in the %s group.", text(record->attributeName),
                 text(record->groupName));
    return message;
}

void rowLabel(SLHandle* handle, EventRecord* record, char* out, unsigned size)
{
    SLKeyList* keys = record->keyList;
    if (keys == nullptr) {
        snprintf(out, size, "Not Applicable");
        return;
    }
    char name[64];
    BaseboardRowName(handle, record->componentId, record->groupId, keys, name);
    if (strcmp(name, "        ") != 0) {
        snprintf(out, size, "%s", name);
        return;
    }
    // No name: the first key's value, when the key carries one.
    if (keys->count == 0 || keys->keys[0].value == nullptr)
        snprintf(out, size, "Not Applicable");
    else
        snprintf(out, size, "%d", static_cast<int32_t>(loadWord(keys->keys[0].value)));
}

int ConsoleMessage(SLHandle*, EventRecord* record)
{
    char line[1100];
    if (consoleLine(record, line, sizeof line))
        fprintf(stderr, "%s\n", line);
    return 0;
}

int BeepSpeaker(SLHandle*, EventRecord*)
{
    const char bell = 0x07;
    if (write(1, &bell, 1) != 1) {
        // A bell that cannot be rung is not worth a message.
    }
    return 0;
}

int LogEvent(SLHandle* indication, EventRecord* record)
{
    KOBProcessAlarm(record);
    char line[200];
    int priority;
    if (eventLogLine(indication, record, line, &priority))
        moxLog(priority, "%s\n", line);
    return 0;
}

int BroadcastMessage(SLHandle*, EventRecord* record)
{
    char message[1024];
    if (broadcastText(record, message, sizeof message))
        moxLog(LOG_EMERG, "%s\n\n", message);
    return 0;
}

int writeToLCD(SLHandle*, EventRecord* record)
{
    char line[LcdWidth + 1];
    lcdText(record, line);
    WriteLCD(line);
    return 0;
}

int issuePage(SLHandle*, EventRecord*)
{
    SysCtrlPage();
    return 0;
}

int MoxIdLedOff(SLHandle*, EventRecord*)
{
    SysCtrlIdLedOff();
    return 0;
}

int MoxIdLedBlink(SLHandle*, EventRecord*)
{
    SysCtrlIdLedBlink();
    return 0;
}

int shutdownOS(SLHandle*, EventRecord* record)
{
    return systemControl(osShutdown, record, nullptr);
}

int shutdownAndPowerOff(SLHandle*, EventRecord* record)
{
    return systemControl(shutdownPowerOff, record, nullptr);
}

int shutdownAndresetsystem(SLHandle*, EventRecord* record)
{
    return systemControl(shutdownReset, record, nullptr);
}

int powerOff(SLHandle*, EventRecord* record)
{
    return systemControl(hardPowerOff, record, nullptr);
}

int resetSystem(SLHandle*, EventRecord* record)
{
    return systemControl(hardReset, record, nullptr);
}

int issueNMI(SLHandle*, EventRecord* record)
{
    return systemControl(nmi, record, nullptr);
}
