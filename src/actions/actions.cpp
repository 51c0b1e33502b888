#include "actions/actions.h"

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
// notifications-only setting, and takes the lock once for each call.
int systemControl(uint32_t capability, uint32_t code, int32_t delay, const EventRecord* record)
{
    SystemControlInfo info;
    int rc = MoxGetSystemControlInfo(&info);
    if (rc != 0)
        return rc;
    if ((info.capabilities & capability) == 0)
        return 0;
    actionLogSystemControl(code, record, bNotificationOnly != 0);
    if (bNotificationOnly != 0)
        return 0;
    return MoxInitiateSystemControlAction(code, delay);
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

void logStandardEvent(SLHandle*, EventRecord* record)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return;
    char label[64];
    rowLabel(handle, record, label, sizeof label);
    SLDestroyHandle(handle);
    char line[200];
    snprintf(line, sizeof line, "TYPE:%s COMPONENT:%s GROUP:%s SEVERITY:%s ROW:%s SYSTEM:%s SUBSYSTEM:%s",
             text(record->eventTypeText), text(record->componentName), text(record->groupName),
             text(record->severityText), label, text(record->systemText), text(record->subsystemText));
    // Every text in the line comes from the provider; the line end is ours.
    moxBlankControls(line);
    moxLog(severityPriority(record->severity), "%s\n", line);
}

void logBaseboardEvent(SLHandle* indication, EventRecord* record)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return;
    if (SLEventRowCount(indication, 0) == 0) {
        SLDestroyHandle(handle);
        return;
    }
    SLEventSelectRowCnf(indication, 0, 0);
    if (SLRowAttributeCount(indication) == 0) {
        SLDestroyHandle(handle);
        return;
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
    int priority = errorValue == 0 ? LOG_INFO : errorValue == 1 ? LOG_WARNING : LOG_ERR;

    char line[200];
    snprintf(line, sizeof line, "NAME:%s COMPONENT:%s GROUP:%s ROW:%s ATTRIBUTE:%s %s", name, text(componentName),
             text(GroupName(handle, component, record->groupId)), label,
             text(AttributeName(handle, component, record->groupId, record->attributeId)), value);
    moxBlankControls(line);
    moxLog(priority, "%s\n", line);
    SLDeleteString(componentName);
    SLDestroyHandle(handle);
}

void logUnknownEvent(SLHandle*, EventRecord* record)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return;
    char* name = listedComponentName(handle, record->componentId);
    char line[124];
    snprintf(line, sizeof line, "DMI Unknown Indication %s", text(name));
    moxBlankControls(line);
    moxLog(LOG_NOTICE, "%s\n", line);
    SLDeleteString(name);
    SLDestroyHandle(handle);
}

} // namespace

const ActionEntry lscActions[] = {
    {7, BeepSpeaker},
    {8, ConsoleMessage},
    {9, LogEvent},
    {10, writeToLCD},
    {11, shutdownOS},
    {12, shutdownAndPowerOff},
    {13, shutdownAndresetsystem},
    {14, powerOff},
    {15, resetSystem},
    {16, BroadcastMessage},
    {18, issueNMI},
    {19, issuePage},
    {20, MoxSendEmail},
    {21, MoxIdLedOff},
    {22, MoxIdLedBlink},
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
    if (value == 0)
        return;
    for (const ActionEntry* entry = handlers; entry->code != 0; ++entry) {
        if (entry->code == code) {
            entry->handler(indication, record);
            return;
        }
    }
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
    char* message = createEventMessage(record);
    if (message != nullptr) {
        moxBlankControls(message);
        fprintf(stderr, "MOX: %s\n", message);
        SLDeleteString(message);
    }
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
    switch (record->eventKind) {
    case EVENT_STANDARD:
        logStandardEvent(indication, record);
        break;
    case EVENT_VENDOR:
        logBaseboardEvent(indication, record);
        break;
    default:
        logUnknownEvent(indication, record);
        break;
    }
    return 0;
}

int BroadcastMessage(SLHandle*, EventRecord* record)
{
    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return 0;
    char* name = nullptr;
    if (SLListGroup(handle, record->componentId, record->groupId) == 0)
        name = NewCString(SLGroupName(handle, 0));
    if (name != nullptr) {
        // The name is cleaned, not the message: its line end is the daemon's.
        moxBlankControls(name);
        char message[1024];
        snprintf(message, sizeof message, "Please check group %s on this machine\n", name);
        moxLog(LOG_EMERG, "%s\n", message);
        SLDeleteString(name);
    }
    SLDestroyHandle(handle);
    return 0;
}

int writeToLCD(SLHandle*, EventRecord* record)
{
    char message[1024];
    snprintf(message, sizeof message, "Check: %s", text(record->groupName));
    moxBlankControls(message);
    WriteLCD(message);
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
    return systemControl(0x08, 3, 200, record);
}

int shutdownAndPowerOff(SLHandle*, EventRecord* record)
{
    return systemControl(0x40, 7, 40000, record);
}

int shutdownAndresetsystem(SLHandle*, EventRecord* record)
{
    return systemControl(0x10, 6, 40000, record);
}

int powerOff(SLHandle*, EventRecord* record)
{
    return systemControl(0x01, 2, 200, record);
}

int resetSystem(SLHandle*, EventRecord* record)
{
    return systemControl(0x02, 1, 200, record);
}

int issueNMI(SLHandle*, EventRecord* record)
{
    return systemControl(0x04, 8, 200, record);
}
