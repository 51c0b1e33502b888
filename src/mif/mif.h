// The component catalogue, registration with the provider (own MIF and
// supported components) and the in-memory copy of an actions table used when
// an older own MIF is replaced.
#pragma once

#include <cstdint>

#include "sl/sltypes.h"

// ---------------------------------------------------------------------------
// Catalogue. Every record and text is an SL string owned by the catalogue;
// callers never free what the lookups return.

struct EnumList {
    int32_t value;
    char* name;
    EnumList* next;
};

struct AttributeInfo {
    uint32_t attributeId;
    uint32_t enumCount; // entries listed by the provider
    uint32_t type;      // DMI data type code
    char* name;
    char* description; // null until first asked for
    EnumList* enums;   // reverse listing order: the entry listed last comes first
    AttributeInfo* next;
};

struct GroupInfo {
    uint32_t groupId;
    char* name;
    SLKeyList* keyLists; // one per row in row order, chained through `next`; null for no keys
    AttributeInfo* attributes;
    GroupInfo* next;
};

struct ComponentInfo {
    uint32_t componentId;
    uint32_t standardEvents; // 1 once listed for "EventGeneration|"
    char* name;              // null when the component could not be listed
    uint32_t mifId;          // 0 own component, 1 baseboard, else from the supported-components group
    GroupInfo* groups;
    ComponentInfo* next;
};

// Head of the catalogue; the daemon's own component is the first entry.
extern ComponentInfo* componentList;

ComponentInfo* pComponentInfo(uint32_t componentId);
GroupInfo* pGroupInfo(SLHandle* h, uint32_t componentId, uint32_t groupId);
AttributeInfo* pAttributeInfo(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId);
// The catalogue's name of the component; "Unknown Component" without an
// entry, null for an entry whose name could not be listed.
const char* ComponentName(uint32_t componentId);
const char* GroupName(SLHandle* h, uint32_t componentId, uint32_t groupId);
SLKeyList* GroupKeyList(SLHandle* h, uint32_t componentId, uint32_t groupId);
const char* AttributeName(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId);
uint32_t AttributeType(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId);
const char* AttributeDescription(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId);
const char* AttributeEnumerationString(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId,
                                       int32_t value);
EnumList* AttributeEnumList(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId);
uint32_t GetMifId(uint32_t componentId);
int standardEventSupported(uint32_t componentId);
uint32_t IsStandardEventSupported(uint32_t componentId);
uint32_t GetComponentId(uint32_t mifId);
uint32_t MyComponentId(void);
uint32_t BaseboardComponentId(void);
// A new entry named as the provider lists the component; null when out of memory.
ComponentInfo* newComponentInfo(uint32_t componentId);
void deleteComponentList(ComponentInfo* first);

// ---------------------------------------------------------------------------
// Registration.

extern SLHandle* myHandle;
extern int registered;
// Layout of the actions table being carried over: 0 group 3 (five keys,
// enable flag in attribute 6), 1 group 4, 2 group 10.
extern int moxNewKeyFormat;
// The group the carry-over reads from and, once set anew, writes to.
extern int moxActionTableGroup;

// What registration reaches in the layers above it, set by the daemon before
// RegisterWithSL: the indication handler it registers, and the search for the
// baseboard's system-control and display groups that ends a registration.
struct RegistrationCalls {
    SLIndicationHandler indicationHandler;
    void (*findBaseboardGroups)(void);
};
void RegisterWithSLCalls(const RegistrationCalls& calls);
// 0 on success; 1 no SL handle, 2 registration refused (also when no
// indication handler was given), 3 own MIF unavailable.
int RegisterWithSL(void);
void UnregisterWithSL(void);
// Catalogues the installed own MIF and the supported components, installing
// and migrating nothing (for a process that only reads). 0, or -1 when the
// own MIF is not installed.
int catalogueInstalledMifs(SLHandle* h);
// The own component's name, "Zorek Tessarin Server Manager - Mox".
const char* MoxComponentName(void);
// 0 when the own component exists afterwards and is catalogued, else -1.
int findMOXmif(SLHandle* h);
void findSupportedMifs(SLHandle* h);
// `name` is a DMI string as the SL accessors return it; null adds nothing.
void AddComponentToList(const DmiString* name, uint32_t componentId);
// Appends an entry behind the last one of the list at `entry`; the new entry,
// or null when `entry` is null or memory runs out.
ComponentInfo* appendToList(ComponentInfo* entry, uint32_t componentId, uint32_t mifId);

// ---------------------------------------------------------------------------
// In-memory copy of an actions table (only during the carry-over).

struct ActionPair {
    uint32_t attributeId;
    int32_t value;
};

struct ActionRow {
    int count;          // pairs in use
    ActionPair* pairs;  // integer attributes of the row, in the row's order
    SLKeyList* keyList; // the row's keys
    ActionRow* next;
};

ActionRow* GetNewActionRow(void);
int FillActionTable(SLHandle* h, ActionRow* row);
int ReadMOXActionsTable(SLHandle* h, ActionRow* first);
int WriteMOXActionsTable(SLHandle* h, ActionRow* first);
int DeleteActionTable(ActionRow* first);
int ModifyKeyList(SLKeyList* keys, uint32_t* value);
int UnModifyKeyList(SLKeyList* keys);

// The MIF version bands of the carry-over: fills the key format and the groups
// read and written for an installed version; false when nothing is migrated.
struct CarryOverBand {
    int keyFormat;
    int groupRead;
    int groupWritten;
};
bool moxCarryOverBand(float installedVersion, CarryOverBand* band);
