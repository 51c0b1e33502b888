#include "events/oldevent.h"

#include <cstring>

#include "events/stdevent.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"

namespace {

constexpr uint32_t vendorActionsGroup = 4;
constexpr uint32_t firstActionAttribute = 6;
constexpr uint32_t anyValue = 0x80000000u;

} // namespace

void fillKey(SLKeyList* keys, uint32_t* mifId, uint32_t* group, uint32_t* instance, uint32_t* attribute,
             uint32_t* value, uint32_t* state)
{
    std::memset(keys, 0, sizeof *keys);
    keys->firstWord = 4;
    keys->count = 6;
    uint32_t* values[] = {mifId, group, instance, attribute, value, state};
    for (uint32_t i = 0; i < 6; ++i) {
        keys->keys[i].attributeId = i + 1;
        keys->keys[i].type = DMI_INTEGER;
        keys->keys[i].value = values[i];
    }
}

void matchZorekEvents(SLHandle* indication, EventRecord* record, const Explanation* explain)
{
    uint32_t mifId = GetMifId(record->componentId);
    if (mifId == 0) {
        explainLine(explain, "component %u is not a supported component: nothing runs", record->componentId);
        return;
    }
    uint32_t group = record->groupId;
    uint32_t attribute = record->attributeId;
    uint32_t value = record->attributeValue;
    uint32_t state = record->errorState;
    if (mifId == 1) {
        // The baseboard's rows are looked up without its value and state.
        value = 0;
        state = 0;
    }
    uint32_t eventInstance = firstKeyValue(record->keyList);

    SLHandle* handle = SLCreateHandle(0);
    if (handle == nullptr)
        return;
    // The key list lives here and points at these locals; it is never
    // handed to SLDeleteKeyList.
    SLKeyList keys;
    uint32_t instance = 0;
    uint32_t lookupValue = 0;
    fillKey(&keys, &mifId, &group, &instance, &attribute, &lookupValue, &state);
    const struct {
        uint32_t instance, value;
    } tries[] = {{eventInstance, value}, {eventInstance, anyValue}, {0, value}, {0, anyValue}};
    uint32_t own = MyComponentId();
    explainLine(explain, "actions table: group %u of component %u", vendorActionsGroup, own);
    bool found = false;
    int attempt = 0;
    for (const auto& t : tries) {
        instance = t.instance;
        lookupValue = t.value;
        found = SLGetRow(handle, own, vendorActionsGroup, firstActionAttribute, &keys) == 0;
        explainTry(explain, ++attempt, &keys, found);
        if (found) {
            runRowActions(handle, indication, record, explain);
            break;
        }
    }
    if (!found)
        explainLine(explain, "no row matched: nothing runs");
    SLDestroyHandle(handle);
}

void ZorekEventActions(SLHandle* indication)
{
    zorekEventActions(indication, nullptr);
}

void zorekEventActions(SLHandle* indication, const Explanation* explain)
{
    EventRecord record{};
    record.eventKind = EVENT_VENDOR;
    SLHandle* lookup = SLCreateHandle(0);
    if (lookup == nullptr)
        return;
    bool match = false;
    if (SLEventClassCount(indication) != 0) {
        record.componentId = SLEventComponentId(indication, 0);
        record.componentName = ComponentName(record.componentId);
        if (SLEventRowCount(indication, 0) != 0) {
            SLEventSelectRowCnf(indication, 0, 0);
            match = SLRowAttributeCount(indication) != 0;
        }
    }
    if (match) {
        record.errorState = SLRowUnsignedValue(indication, 0);
        if (SLEventClassCount(indication) >= 2) {
            if (SLEventRowCount(indication, 1) == 0) {
                match = false;
            } else {
                SLEventSelectRowCnf(indication, 1, 0);
                record.groupId = SLRowGroupId(indication);
                record.groupName = GroupName(lookup, record.componentId, record.groupId);
                if (SLKeyCount(indication) > 0) {
                    record.keyList = SLCreateKeyList(indication);
                    match = record.keyList != nullptr;
                }
                if (match && SLRowAttributeCount(indication) > 0) {
                    record.attributeId = SLRowAttributeId(indication, 0);
                    record.attributeName = AttributeName(lookup, record.componentId, record.groupId,
                                                         record.attributeId);
                    record.attributeValue = SLRowUnsignedValue(indication, 0);
                }
            }
        }
    }
    if (match) {
        explainRecord(explain, &record);
        matchZorekEvents(indication, &record, explain);
    } else {
        explainLine(explain, "the event's rows cannot be read: nothing runs");
    }
    SLDeleteKeyList(record.keyList);
    SLDestroyHandle(lookup);
}
