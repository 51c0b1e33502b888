#include "events/stdevent.h"

#include <initializer_list>

#include "actions/actions.h"
#include "events/alert.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

constexpr uint32_t standardActionsGroup = 10;
constexpr uint32_t firstActionAttribute = 6; // rows are read from the attribute after it

// Walks the event-generation row (class 0, row 0, selected) into the record;
// returns the instance-data flag.
uint32_t readEventRow(SLHandle* indication, SLHandle* lookup, EventRecord* record)
{
    uint32_t component = record->componentId;
    uint32_t group = record->eventGroupId;
    uint32_t instanceData = 0;
    uint32_t count = slRowAttributesPresent(indication);
    for (uint32_t i = 0; i < count; ++i) {
        uint32_t id = SLRowAttributeId(indication, i);
        uint32_t value = SLRowUnsignedValue(indication, i);
        switch (id) {
        case 1:
            record->eventType = value;
            record->eventTypeText = AttributeEnumerationString(lookup, component, group, 1, value);
            break;
        case 2:
            record->severity = value;
            record->severityText = AttributeEnumerationString(lookup, component, group, 2, value);
            break;
        case 5: {
            char* className = NewCString(SLRowStringPtr(indication, i));
            if (className != nullptr) {
                record->groupId = SLMapClassNameToId(component, className);
                record->groupName = GroupName(lookup, component, record->groupId);
                SLDeleteString(className);
            }
            break;
        }
        case 6:
            record->eventSystem = value;
            record->systemText = AttributeEnumerationString(lookup, component, group, 6, value);
            break;
        case 7:
            record->eventSubsystem = value;
            record->subsystemText = AttributeEnumerationString(lookup, component, group, 7, value);
            break;
        case 8:
            record->attribute8Text = AttributeEnumerationString(lookup, component, group, 8, value);
            break;
        case 9:
            instanceData = value;
            break;
        default:
            break;
        }
    }
    return instanceData;
}

} // namespace

void explainTry(const Explanation* explain, int attempt, const SLKeyList* keys, bool found)
{
    if (explain == nullptr)
        return;
    char text[400];
    explainKeys(keys, text, sizeof text);
    explainLine(explain, "try %d: keys %s: %s", attempt, text, found ? "row found" : "no row");
}

uint32_t firstKeyValue(const SLKeyList* keys)
{
    if (keys == nullptr || keys->count == 0 || keys->keys[0].value == nullptr)
        return 0;
    return loadWord(keys->keys[0].value);
}

int modifyKey(SLKeyList* keys, uint32_t mifId, uint32_t eventGroupId, uint32_t eventType, uint32_t instance,
              uint32_t severity, uint32_t eventSystem, uint32_t eventSubsystem)
{
    for (uint32_t i = 0; i < keys->count && i < SL_MAX_KEYS; ++i) {
        uint32_t value;
        switch (keys->keys[i].attributeId) {
        case 1: value = mifId; break;
        case 2: value = eventGroupId; break;
        case 3: value = eventType; break;
        case 4: value = instance; break;
        case 5: value = 0; break;
        case 6: value = severity; break;
        case 31: value = eventSystem; break;
        case 32: value = eventSubsystem; break;
        default: continue; // keeps the first row's value
        }
        if (keys->keys[i].value == nullptr)
            return -1;
        storeWord(keys->keys[i].value, value);
    }
    return 0;
}

void runRowActions(SLHandle* row, SLHandle* indication, EventRecord* record, const Explanation* explain)
{
    uint32_t count = slRowAttributesPresent(row);
    char* alert = nullptr;
    for (uint32_t i = 0; i < count; ++i) {
        uint32_t id = SLRowAttributeId(row, i);
        if (id == 17 && SLRowAttributeType(row, i) == DMI_DISPLAYSTRING && alert == nullptr) {
            alert = NewCString(SLRowStringPtr(row, i));
        } else if (id == 30 && SLRowUnsignedValue(row, i) == 0) {
            explainLine(explain, "row disabled (attribute 30 is 0), alert name \"%s\": nothing runs",
                        alert != nullptr ? alert : "");
            SLDeleteString(alert); // the row is disabled
            return;
        }
    }
    explainLine(explain, "row enabled, alert name \"%s\"", alert != nullptr ? alert : "");
    if (alert != nullptr) {
        if (explain == nullptr)
            IssueOrRegisterAlert(alert, record, 0);
        SLDeleteString(alert);
    }
    bool any = false;
    for (uint32_t i = 0; ActionID[i].code != 0 && i < count; ++i) {
        uint32_t position = ActionID[i].position;
        uint32_t value = position < count ? SLRowUnsignedValue(row, position) : 0;
        any |= value != 0;
        dispatchAction(ActionID[i].code, value, indication, record, explain);
    }
    if (!any)
        explainLine(explain, "no action is switched on in the row");
}

void matchStdEvents(SLHandle* indication, EventRecord* record, const Explanation* explain)
{
    uint32_t mifId = GetMifId(record->componentId);
    if (mifId == 0) {
        explainLine(explain, "component %u is not a supported component: nothing runs", record->componentId);
        return;
    }
    // The baseboard's rows carry severity 0 and serve every severity.
    uint32_t severity = mifId == 1 ? 0 : record->severity;
    uint32_t instance = firstKeyValue(record->keyList);

    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return;
    uint32_t own = MyComponentId();
    explainLine(explain, "actions table: group %u of component %u", standardActionsGroup, own);
    SLKeyList* keys = nullptr;
    if (SLGetFirstRow(handle, own, standardActionsGroup, 0, nullptr) == 0)
        keys = SLCreateKeyList(handle);
    bool found = false;
    if (keys != nullptr) {
        // The exact instance first, then the row that serves every instance.
        int attempt = 0;
        for (uint32_t tryInstance : {instance, 0u}) {
            if (modifyKey(keys, mifId, record->eventGroupId, record->eventType, tryInstance, severity,
                          record->eventSystem, record->eventSubsystem) != 0)
                break;
            found = SLGetRow(handle, own, standardActionsGroup, firstActionAttribute, keys) == 0;
            explainTry(explain, ++attempt, keys, found);
            if (found)
                break;
        }
        SLDeleteKeyList(keys);
    }
    if (found)
        runRowActions(handle, indication, record, explain);
    else
        explainLine(explain, "no row matched: nothing runs");
    SLDestroyHandle(handle);
}

void StdEventActions(SLHandle* indication)
{
    stdEventActions(indication, nullptr);
}

void stdEventActions(SLHandle* indication, const Explanation* explain)
{
    EventRecord record{};
    record.eventKind = EVENT_STANDARD;
    SLHandle* lookup = SLCreateHandle(0);
    if (lookup == nullptr)
        return;
    if (SLEventClassCount(indication) == 0) {
        SLDestroyHandle(lookup);
        return;
    }
    record.componentId = SLEventComponentId(indication, 0);
    record.componentName = ComponentName(record.componentId);
    if (GetMifId(record.componentId) == 0 || SLEventRowCount(indication, 0) == 0) {
        explainLine(explain, "component %u is not a supported component: nothing runs", record.componentId);
        SLDestroyHandle(lookup);
        return;
    }
    SLEventSelectRowCnf(indication, 0, 0);
    record.eventGroupId = SLRowGroupId(indication);
    if (SLRowAttributeCount(indication) <= 6) {
        explainLine(explain, "the event-generation row has 6 attributes or fewer: nothing runs");
        SLDestroyHandle(lookup);
        return;
    }
    uint32_t instanceData = readEventRow(indication, lookup, &record);
    if (instanceData != 0 && SLEventClassCount(indication) >= 2) {
        bool readable = SLEventRowCount(indication, 1) != 0;
        if (readable) {
            SLEventSelectRowCnf(indication, 1, 0);
            record.groupId = SLRowGroupId(indication);
            if (SLKeyCount(indication) > 0) {
                record.keyList = SLCreateKeyList(indication);
                readable = record.keyList != nullptr;
            }
        }
        if (!readable) {
            explainLine(explain, "the instance row cannot be read: nothing runs");
            SLDestroyHandle(lookup);
            return;
        }
    }
    explainRecord(explain, &record);
    matchStdEvents(indication, &record, explain);
    SLDeleteKeyList(record.keyList);
    SLDestroyHandle(lookup);
}
