#include "mif/mif.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <syslog.h>

#include "base/files.h"
#include "base/log.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

ComponentInfo* componentList = nullptr;
SLHandle* myHandle = nullptr;
int registered = 0;
int moxNewKeyFormat = 0;
int moxActionTableGroup = 0;

namespace {

const char moxComponentName[] = "Zorek Tessarin Server Manager - Mox";
const char moxMifFile[] = "mox.mif";
const char unknownComponent[] = "Unknown Component";
const char unknownGroup[] = "Unknown Group";
const char unknownAttribute[] = "Unknown Attribute";
// Confirm status with which a component listing still names a component.
constexpr uint32_t listedWithWarning = 512;
constexpr uint32_t supportedComponentsGroup = 2;

template <typename T> T* newRecord()
{
    void* block = SLCreateString(sizeof(T));
    if (block != nullptr)
        memset(block, 0, sizeof(T));
    return static_cast<T*>(block);
}

// ---------------------------------------------------------------------------
// Catalogue records.

void deleteEnumList(EnumList* e)
{
    while (e != nullptr) {
        EnumList* next = e->next;
        SLDeleteString(e->name);
        SLDeleteString(e);
        e = next;
    }
}

void deleteAttributeList(AttributeInfo* a)
{
    while (a != nullptr) {
        AttributeInfo* next = a->next;
        deleteEnumList(a->enums);
        SLDeleteString(a->description);
        SLDeleteString(a->name);
        SLDeleteString(a);
        a = next;
    }
}

void deleteGroupList(GroupInfo* g)
{
    while (g != nullptr) {
        GroupInfo* next = g->next;
        deleteAttributeList(g->attributes);
        SLDeleteKeyList(g->keyLists);
        SLDeleteString(g->name);
        SLDeleteString(g);
        g = next;
    }
}

// The key lists of the group's rows in row order, chained through `next`;
// null for a scalar group, an empty table or a first row that cannot be read.
// The handle's confirm must still hold the group listing.
SLKeyList* newKeyList(SLHandle* h, uint32_t componentId, uint32_t groupId)
{
    SLKeyList* probe = SLCreateKeyList(h);
    if (probe == nullptr)
        return nullptr;
    SLDeleteKeyList(probe);
    if (SLGetFirstRow(h, componentId, groupId, 0, nullptr) != 0)
        return nullptr;
    SLKeyList* first = SLCreateKeyList(h);
    SLKeyList* last = first;
    // findNextKey: each next-row command starts from the previous row's keys.
    while (last != nullptr && SLGetNextRow(h, componentId, groupId, 0, last) == 0) {
        SLKeyList* row = SLCreateKeyList(h);
        if (row == nullptr)
            break;
        // A provider answering the same row again would never reach the end.
        if (SLCompareKeyLists(row, last) == 1) {
            SLDeleteKeyList(row);
            break;
        }
        last->next = row;
        last = row;
    }
    return first;
}

GroupInfo* newGroupInfo(SLHandle* h, uint32_t componentId, uint32_t groupId)
{
    if (h == nullptr || SLListGroup(h, componentId, groupId) != 0)
        return nullptr;
    GroupInfo* g = newRecord<GroupInfo>();
    if (g == nullptr)
        return nullptr;
    g->groupId = groupId;
    g->name = NewCString(SLGroupName(h, 0));
    g->keyLists = newKeyList(h, componentId, groupId);
    return g;
}

AttributeInfo* newAttributeInfo(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId)
{
    if (h == nullptr || SLListAttribute(h, componentId, groupId, attributeId) != 0)
        return nullptr;
    AttributeInfo* a = newRecord<AttributeInfo>();
    if (a == nullptr)
        return nullptr;
    a->attributeId = attributeId;
    a->name = NewCString(SLAttributeName(h, 0));
    a->enumCount = SLEnumerationListCount(h, 0);
    a->type = SLAttributeType(h, 0);
    // Pushed at the front: the entry listed last answers first. The accessors
    // read entries outside the confirm as absent, so a wild count ends there.
    for (uint32_t i = 0; i < a->enumCount; ++i) {
        DmiString* text = SLEnumerationName(h, 0, i);
        if (text == nullptr)
            break;
        EnumList* e = newRecord<EnumList>();
        if (e == nullptr)
            continue;
        e->value = SLEnumerationValue(h, 0, i);
        e->name = NewCString(text);
        e->next = a->enums;
        a->enums = e;
    }
    return a;
}

ComponentInfo* lastEntry(ComponentInfo* entry)
{
    while (entry != nullptr && entry->next != nullptr)
        entry = entry->next;
    return entry;
}

// ---------------------------------------------------------------------------
// Registration helpers.

// Whether the file SLInstallMIF would give the provider can be read.
bool mifReadable(const char* file)
{
    char path[SL_COMMAND_SIZE];
    FILE* f = slMifPath(file, path, sizeof path) ? moxOpenRegular(path) : nullptr;
    if (f == nullptr)
        return false;
    fclose(f);
    return true;
}

template <typename Visit> void walkComponents(SLHandle* h, const char* filter, Visit visit);

// The ids of the installed own components in list order; at most `max`.
int ownComponents(SLHandle* h, uint32_t* ids, int max)
{
    int n = 0;
    walkComponents(h, nullptr, [&](uint32_t id) {
        if (n < max && IsExactMatch(SLComponentName(h), moxComponentName) == 1)
            ids[n++] = id;
    });
    return n;
}

// After a set that failed: whether the new table has the value's row and
// attribute without holding the value (the write failed), rather than not
// having them at all (the new MIF dropped them, and the value goes with them).
bool valueMissing(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys,
                  int32_t value)
{
    return SLGetAttribute(h, component, group, attribute, keys) == 0 && SLIntegerValue(h) != value;
}

// Writes the saved rows into table `moxActionTableGroup` of `component`.
// 0 when every value the new table has a place for holds its saved value.
int writeActionsTable(SLHandle* h, uint32_t component, ActionRow* first)
{
    uint32_t group = static_cast<uint32_t>(moxActionTableGroup);
    for (ActionRow* row = first; row != nullptr; row = row->next) {
        // A set without keys would address the table's first row.
        if (row->keyList == nullptr)
            continue;
        uint32_t errorState = 0;
        if (group != 10 && ModifyKeyList(row->keyList, &errorState) != 0)
            continue;
        bool written = true;
        for (int i = 0; written && i < row->count; ++i) {
            uint32_t attribute = row->pairs[i].attributeId;
            if (attribute <= 6) {
                // In group 3 attribute 6 is the enable flag, attribute 30 now.
                if (moxNewKeyFormat != 0 || attribute != 6)
                    continue;
                attribute = 30;
            }
            int32_t value = row->pairs[i].value;
            written = SLSetAttribute(h, component, group, attribute, row->keyList, sizeof value, &value) == 0 ||
                      !valueMissing(h, component, group, attribute, row->keyList, value);
        }
        if (group != 10)
            UnModifyKeyList(row->keyList);
        if (!written)
            return 1;
    }
    return 0;
}

// Replaces the installed own MIF `old`, of an older version, with the new one,
// carrying the old actions table's integer settings over.
//
// The old MIF is removed last, once the new one holds every carried value, so
// a crash or a failed write at any step leaves the old MIF first in list
// order with all the administrator's settings; the next start then finds it
// older again, removes the current copies behind it (a carry-over that did
// not finish) and carries over once more. Until then the daemon runs on the
// old MIF. Nothing here is kept between starts.
void carryOver(SLHandle* h, uint32_t old, float installedVersion)
{
    CarryOverBand band;
    if (!moxCarryOverBand(installedVersion, &band))
        return;
    // Without the new file the reinstall would fail: keep the old one as it is.
    if (!mifReadable(moxMifFile))
        return;
    const int max = 16;
    uint32_t before[max];
    int count = ownComponents(h, before, max);
    bool ok = count > 0 && before[0] == old;
    for (int i = 1; ok && i < count; ++i) {
        float version = 0;
        CarryOverBand older;
        if (slInstalledMifVersionOf(h, before[i], &version) == 0 && !moxCarryOverBand(version, &older))
            ok = SLCiUninstallData(h, before[i]) == 0;
    }
    if (!ok) {
        moxLog(LOG_ERR, "%s\n", "MOX - could not remove an unfinished copy of mox.mif; the installed one is kept");
        return;
    }
    ActionRow* saved = GetNewActionRow();
    if (saved == nullptr)
        return; // out of memory: the next start tries again
    moxNewKeyFormat = band.keyFormat;
    moxActionTableGroup = band.groupRead;
    ReadMOXActionsTable(h, saved);
    moxActionTableGroup = band.groupWritten;
    uint32_t added = 0;
    if (SLInstallMIF(h, moxMifFile) == 0) {
        uint32_t after[max];
        int n = ownComponents(h, after, max);
        // The new component is the last listed: ids grow.
        if (n > 0 && after[n - 1] != old)
            added = after[n - 1];
    }
    ok = added != 0 && writeActionsTable(h, added, saved) == 0 && SLCiUninstallData(h, old) == 0;
    DeleteActionTable(saved);
    if (ok)
        return;
    if (added != 0)
        SLCiUninstallData(h, added);
    moxLog(LOG_ERR, "%s\n",
           "MOX - could not carry the actions table over to the new mox.mif; the installed one is kept "
           "and the carry-over is tried again at the next start");
}

// Walks the components the provider lists for `filter`, calling `visit` for
// each. A listing with status 512 still names a component; a walk whose id
// does not move forward (a stale confirm) ends.
template <typename Visit> void walkComponents(SLHandle* h, const char* filter, Visit visit)
{
    uint32_t last = 0;
    for (;;) {
        if (SLListNextComponent(h, filter, last) != 0 && SLCnfStatus(h) != listedWithWarning)
            break;
        uint32_t id = SLComponentId(h);
        if (id <= last)
            break;
        visit(id);
        last = id;
    }
}

} // namespace

// ---------------------------------------------------------------------------
// Catalogue lookups.

ComponentInfo* pComponentInfo(uint32_t componentId)
{
    for (ComponentInfo* c = componentList; c != nullptr; c = c->next) {
        if (c->componentId == componentId)
            return c;
    }
    return nullptr;
}

GroupInfo* pGroupInfo(SLHandle* h, uint32_t componentId, uint32_t groupId)
{
    ComponentInfo* c = pComponentInfo(componentId);
    if (c == nullptr)
        return nullptr;
    for (GroupInfo* g = c->groups; g != nullptr; g = g->next) {
        if (g->groupId == groupId)
            return g;
    }
    GroupInfo* g = newGroupInfo(h, componentId, groupId);
    if (g != nullptr) {
        g->next = c->groups;
        c->groups = g;
    }
    return g;
}

AttributeInfo* pAttributeInfo(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId)
{
    GroupInfo* g = pGroupInfo(h, componentId, groupId);
    if (g == nullptr)
        return nullptr;
    for (AttributeInfo* a = g->attributes; a != nullptr; a = a->next) {
        if (a->attributeId == attributeId)
            return a;
    }
    AttributeInfo* a = newAttributeInfo(h, componentId, groupId, attributeId);
    if (a != nullptr) {
        a->next = g->attributes;
        g->attributes = a;
    }
    return a;
}

const char* ComponentName(uint32_t componentId)
{
    ComponentInfo* c = pComponentInfo(componentId);
    return c != nullptr ? c->name : unknownComponent;
}

const char* GroupName(SLHandle* h, uint32_t componentId, uint32_t groupId)
{
    GroupInfo* g = pGroupInfo(h, componentId, groupId);
    return g != nullptr ? g->name : unknownGroup;
}

SLKeyList* GroupKeyList(SLHandle* h, uint32_t componentId, uint32_t groupId)
{
    GroupInfo* g = pGroupInfo(h, componentId, groupId);
    return g != nullptr ? g->keyLists : nullptr;
}

const char* AttributeName(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId)
{
    AttributeInfo* a = pAttributeInfo(h, componentId, groupId, attributeId);
    return a != nullptr ? a->name : unknownAttribute;
}

uint32_t AttributeType(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId)
{
    AttributeInfo* a = pAttributeInfo(h, componentId, groupId, attributeId);
    return a != nullptr ? a->type : 0;
}

const char* AttributeDescription(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId)
{
    AttributeInfo* a = pAttributeInfo(h, componentId, groupId, attributeId);
    if (a == nullptr)
        return nullptr;
    // newAttributeDescription: a failed fetch is tried again next time.
    if (a->description == nullptr && SLListAttributeDesc(h, componentId, groupId, attributeId) == 0)
        a->description = NewCString(SLDescription(h));
    return a->description;
}

const char* AttributeEnumerationString(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId,
                                       int32_t value)
{
    for (EnumList* e = AttributeEnumList(h, componentId, groupId, attributeId); e != nullptr; e = e->next) {
        if (e->value == value)
            return e->name;
    }
    return nullptr;
}

EnumList* AttributeEnumList(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId)
{
    AttributeInfo* a = pAttributeInfo(h, componentId, groupId, attributeId);
    return a != nullptr ? a->enums : nullptr;
}

uint32_t GetMifId(uint32_t componentId)
{
    ComponentInfo* c = pComponentInfo(componentId);
    return c != nullptr ? c->mifId : 0;
}

int standardEventSupported(uint32_t componentId)
{
    for (ComponentInfo* c = componentList; c != nullptr; c = c->next) {
        if (c->componentId == componentId)
            c->standardEvents = 1;
    }
    return 0;
}

uint32_t IsStandardEventSupported(uint32_t componentId)
{
    ComponentInfo* c = pComponentInfo(componentId);
    return c != nullptr ? c->standardEvents : 0;
}

uint32_t GetComponentId(uint32_t mifId)
{
    for (ComponentInfo* c = componentList; c != nullptr; c = c->next) {
        if (c->mifId == mifId)
            return c->componentId;
    }
    return 0;
}

uint32_t MyComponentId(void)
{
    return GetComponentId(0);
}

uint32_t BaseboardComponentId(void)
{
    return GetComponentId(1);
}

ComponentInfo* newComponentInfo(uint32_t componentId)
{
    ComponentInfo* c = newRecord<ComponentInfo>();
    if (c == nullptr)
        return nullptr;
    c->componentId = componentId;
    c->name = SLMapComponentIdToName(componentId);
    return c;
}

void deleteComponentList(ComponentInfo* first)
{
    while (first != nullptr) {
        ComponentInfo* next = first->next;
        deleteGroupList(first->groups);
        SLDeleteString(first->name);
        SLDeleteString(first);
        first = next;
    }
}

// ---------------------------------------------------------------------------
// Registration.

bool moxCarryOverBand(float installedVersion, CarryOverBand* band)
{
    // The limits are compared as 32-bit floats, as the version itself is
    // held: "2.51" read into a float lies just below the double 2.51 and
    // would otherwise be taken for a group-3 version.
    static const struct {
        float low, high;
        CarryOverBand band;
    } bands[] = {
        {-__builtin_inff(), 2.51f, {0, 3, 4}},
        {2.51f, 2.91f, {1, 4, 4}},
        {2.91f, 2.93f, {2, 10, 10}},
    };
    for (const auto& b : bands) {
        // Written so that a version that is not a number matches no band.
        if (installedVersion >= b.low && installedVersion < b.high) {
            *band = b.band;
            return true;
        }
    }
    return false;
}

int findMOXmif(SLHandle* h)
{
    uint32_t own = SLMapComponentNameToId(moxComponentName);
    if (own == 0) {
        if (SLInstallMIF(h, moxMifFile) != 0)
            return -1;
        moxLog(LOG_INFO, "%s\n", "MOX - installed mox.mif");
    } else {
        float version = 0;
        if (SLGetInstalledMIFVersion(h, moxComponentName, &version) == 0)
            carryOver(h, own, version);
    }
    own = SLMapComponentNameToId(moxComponentName);
    if (own == 0)
        return -1;
    ComponentInfo* entry = newComponentInfo(own);
    if (entry == nullptr)
        return -1;
    deleteComponentList(componentList);
    componentList = entry;
    return 0;
}

void findSupportedMifs(SLHandle* h)
{
    if (h == nullptr)
        return;
    walkComponents(h, nullptr, [h](uint32_t id) { AddComponentToList(SLComponentName(h), id); });
    walkComponents(h, "EventGeneration|", [](uint32_t id) { standardEventSupported(id); });
}

void AddComponentToList(const DmiString* name, uint32_t componentId)
{
    uint32_t own = MyComponentId();
    if (name == nullptr || own == 0)
        return;
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr)
        return;
    uint32_t nameLength = dmiStringLength(name);
    SLKeyList* previous = nullptr;
    while (SLGetNextRow(h, own, supportedComponentsGroup, 0, previous) == 0) {
        DmiString* listed = SLRowStringPtr(h, 1);
        if (listed == nullptr)
            break;
        if (dmiStringLength(listed) == nameLength &&
            memcmp(dmiStringText(listed), dmiStringText(name), nameLength) == 0) {
            appendToList(componentList, componentId, static_cast<uint32_t>(SLRowIntegerValue(h, 0)));
            break;
        }
        SLKeyList* keys = SLCreateKeyList(h);
        if (keys == nullptr)
            break;
        SLDeleteKeyList(previous);
        previous = keys;
    }
    SLDeleteKeyList(previous);
    SLDestroyHandle(h);
}

ComponentInfo* appendToList(ComponentInfo* entry, uint32_t componentId, uint32_t mifId)
{
    ComponentInfo* last = lastEntry(entry);
    if (last == nullptr)
        return nullptr;
    ComponentInfo* added = newComponentInfo(componentId);
    if (added == nullptr)
        return nullptr;
    added->mifId = mifId;
    last->next = added;
    return added;
}

namespace {
RegistrationCalls registrationCalls{nullptr, nullptr};
} // namespace

void RegisterWithSLCalls(const RegistrationCalls& calls)
{
    registrationCalls = calls;
}

int RegisterWithSL(void)
{
    // A registration without an indication handler would take every event
    // and drop it without a word: it is refused before anything is sent.
    if (registrationCalls.indicationHandler == nullptr)
        return 2;
    myHandle = SLCreateHandle(0);
    if (myHandle == nullptr)
        return 1;
    if (SLDmiRegisterMgmt(myHandle, registrationCalls.indicationHandler) != 0)
        return 2;
    if (findMOXmif(myHandle) != 0)
        return 3;
    findSupportedMifs(myHandle);
    if (registrationCalls.findBaseboardGroups != nullptr)
        registrationCalls.findBaseboardGroups();
    registered = 1;
    return 0;
}

int catalogueInstalledMifs(SLHandle* h)
{
    uint32_t own = SLMapComponentNameToId(moxComponentName);
    ComponentInfo* entry = own != 0 ? newComponentInfo(own) : nullptr;
    if (entry == nullptr)
        return -1;
    deleteComponentList(componentList);
    componentList = entry;
    findSupportedMifs(h);
    return 0;
}

const char* MoxComponentName(void)
{
    return moxComponentName;
}

void UnregisterWithSL(void)
{
    deleteComponentList(componentList);
    componentList = nullptr;
    if (registered) {
        SLDmiUnregisterMgmt(myHandle);
        registered = 0;
    }
    if (myHandle != nullptr) {
        SLDestroyHandle(myHandle);
        myHandle = nullptr;
    }
}

// ---------------------------------------------------------------------------
// Actions table copy.

ActionRow* GetNewActionRow(void)
{
    return static_cast<ActionRow*>(calloc(1, sizeof(ActionRow)));
}

int FillActionTable(SLHandle* h, ActionRow* row)
{
    if (h == nullptr || row == nullptr)
        return 1;
    uint32_t n = SLRowAttributeCount(h);
    // Each attribute of a row record takes at least 16 bytes of the confirm;
    // a larger count cannot be genuine and would overflow the allocation.
    if (n > h->confirmSize / 16)
        n = h->confirmSize / 16;
    auto* pairs = static_cast<ActionPair*>(malloc((n != 0 ? n : 1) * sizeof(ActionPair)));
    if (pairs == nullptr)
        return 1;
    int count = 0;
    for (uint32_t i = 0; i < n; ++i) {
        if (SLRowAttributeType(h, i) == DMI_INTEGER)
            pairs[count++] = ActionPair{SLRowAttributeId(h, i), SLRowIntegerValue(h, i)};
    }
    free(row->pairs);
    row->pairs = pairs;
    row->count = count;
    return 0;
}

int ReadMOXActionsTable(SLHandle* h, ActionRow* first)
{
    if (h == nullptr || first == nullptr)
        return 1;
    uint32_t own = SLMapComponentNameToId(moxComponentName);
    ActionRow* last = nullptr;
    while (SLGetNextRow(h, own, moxActionTableGroup, 0, last != nullptr ? last->keyList : nullptr) == 0) {
        ActionRow* row = first;
        if (last != nullptr) {
            row = GetNewActionRow();
            if (row == nullptr)
                break;
            last->next = row;
        }
        FillActionTable(h, row);
        row->keyList = SLCreateKeyList(h);
        last = row;
        // Without keys the next command would fetch the first row again.
        if (row->keyList == nullptr)
            break;
    }
    return 0;
}

int WriteMOXActionsTable(SLHandle* h, ActionRow* first)
{
    if (first == nullptr || h == nullptr)
        return 1;
    // The newest own component: the one a carry-over installed last.
    uint32_t ids[16];
    int n = ownComponents(h, ids, 16);
    if (n == 0)
        return 1;
    return writeActionsTable(h, ids[n - 1], first);
}

int DeleteActionTable(ActionRow* first)
{
    if (first == nullptr)
        return 1;
    while (first != nullptr) {
        ActionRow* next = first->next;
        SLDeleteKeyList(first->keyList);
        free(first->pairs);
        free(first);
        first = next;
    }
    return 0;
}

int ModifyKeyList(SLKeyList* keys, uint32_t* value)
{
    if (moxNewKeyFormat != 0)
        return 0;
    if (keys == nullptr)
        return -1;
    // Only a group-3 row's five keys are widened; any other count would lose
    // or overwrite a key of its own.
    if (keys->count != 5)
        return -1;
    keys->firstWord = 4;
    keys->count = 6;
    keys->keys[5] = SLKeyEntry{6, DMI_INTEGER, value};
    return 0;
}

int UnModifyKeyList(SLKeyList* keys)
{
    if (moxNewKeyFormat != 0)
        return 0;
    if (keys == nullptr)
        return -1;
    keys->count = 5;
    keys->keys[5].value = nullptr;
    return 0;
}
