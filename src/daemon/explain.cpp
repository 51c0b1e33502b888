#include "daemon/explain.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "actions/actions.h"
#include "actions/uxaction.h"
#include "daemon/events.h"
#include "daemon/startup.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

const char usage[] = "usage: mox --explain C G [-k KEY]... [--instance G2 [-k KEY]...]\n";

// A group and the texts of its row's keys, as given on the command line.
struct RowArgument {
    const char* group = nullptr;
    const char* keys[SL_MAX_KEYS] = {};
    uint32_t keyCount = 0;
};

// What one explanation holds, released by `release`.
struct Event {
    SLHandle* rows[2] = {};
    DmiString* classes[2] = {};
    SLHandle* indication = nullptr;
};

void release(Event& event)
{
    for (int i = 0; i < 2; ++i) {
        SLDestroyHandle(event.rows[i]);
        SLDeleteString(event.classes[i]);
    }
    SLDestroyHandle(event.indication);
}

// "C G [-k KEY]... [--instance G2 [-k KEY]...]"; false on anything else.
bool parse(int argc, char** argv, const char** component, RowArgument (&rows)[2], uint32_t* rowCount)
{
    int at = 0;
    if (argc < 2)
        return false;
    *component = argv[at++];
    *rowCount = 0;
    while (at < argc && *rowCount < 2) {
        if (*rowCount == 1 && strcmp(argv[at++], "--instance") != 0)
            return false;
        if (at >= argc)
            return false;
        RowArgument& row = rows[(*rowCount)++];
        row.group = argv[at++];
        while (at + 1 < argc && strcmp(argv[at], "-k") == 0) {
            if (row.keyCount == SL_MAX_KEYS)
                return false;
            row.keys[row.keyCount++] = argv[at + 1];
            at += 2;
        }
    }
    return at == argc;
}

bool number(const char* text, long long* value)
{
    char* end = nullptr;
    errno = 0;
    *value = strtoll(text, &end, 0);
    return errno == 0 && end != text && *end == '\0';
}

// A component by id or exact name; 0 when the provider lists none.
uint32_t componentArgument(SLHandle* h, const char* text)
{
    long long id;
    uint32_t component = number(text, &id) ? static_cast<uint32_t>(id) : SLMapComponentNameToId(text);
    return component != 0 && SLListComponent(h, nullptr, component) == 0 ? component : 0;
}

// A group of `component` by id, name or class; 0 when there is none. Leaves
// the group's listing in `h`.
uint32_t groupArgument(SLHandle* h, uint32_t component, const char* text)
{
    long long id;
    uint32_t group = 0;
    if (number(text, &id))
        group = static_cast<uint32_t>(id);
    else if ((group = SLMapGroupNameToId(component, text)) == 0)
        group = SLMapClassNameToId(component, text);
    return group != 0 && SLListGroup(h, component, group) == 0 ? group : 0;
}

// The value of a key of `type` (an SL string), from its text: an integer in
// decimal or hex, or the text of one of the attribute's enumeration entries;
// a string as it stands. Null when the text does not fit the type.
void* keyValue(SLHandle* h, uint32_t component, uint32_t group, const SLKeyEntry& key, const char* text)
{
    if (key.type == DMI_OCTETSTRING || key.type == DMI_DISPLAYSTRING)
        return NewDmiString(text);
    long long value;
    if (!number(text, &value)) {
        EnumList* e = AttributeEnumList(h, component, group, key.attributeId);
        while (e != nullptr && (e->name == nullptr || strcmp(e->name, text) != 0))
            e = e->next;
        if (e == nullptr)
            return nullptr;
        value = e->value;
    }
    unsigned size = SLAttributeSize(static_cast<int>(key.type), nullptr);
    bool fits = size == 8 || (size == 4 && value >= INT32_MIN && value <= static_cast<long long>(UINT32_MAX));
    void* copy = fits ? SLCreateString(size) : nullptr;
    if (copy != nullptr)
        memcpy(copy, &value, size); // little-endian: the low word first
    return copy;
}

// Reads the row a command-line row names into a handle of its own and keeps
// the group's class; false with a message on `err` when there is no such row.
bool readRow(SLHandle* h, uint32_t component, const RowArgument& argument, Event& event, int index, FILE* err)
{
    uint32_t group = groupArgument(h, component, argument.group);
    if (group == 0) {
        fprintf(err, "mox: component %u has no group %s\n", component, argument.group);
        return false;
    }
    char* className = NewCString(SLGroupClassName(h, 0));
    event.classes[index] = NewDmiString(className != nullptr ? className : "");
    SLDeleteString(className);
    SLKeyList* keys = SLCreateKeyList(h); // the group's keys, without values
    uint32_t keyCount = keys != nullptr ? keys->count : 0;
    bool named = keyCount == argument.keyCount;
    if (!named)
        fprintf(err, "mox: group %u of component %u has %u key%s; give each with -k in key order\n", group,
                component, keyCount, keyCount == 1 ? "" : "s");
    for (uint32_t i = 0; named && i < keyCount; ++i) {
        keys->keys[i].value = keyValue(h, component, group, keys->keys[i], argument.keys[i]);
        named = keys->keys[i].value != nullptr;
        if (!named)
            fprintf(err, "mox: %s is no value of key %u of group %u\n", argument.keys[i], keys->keys[i].attributeId,
                    group);
    }
    event.rows[index] = named ? SLCreateHandle(0) : nullptr;
    bool found = event.rows[index] != nullptr && SLGetRow(event.rows[index], component, group, 0, keys) == 0;
    if (named && !found)
        fprintf(err, "mox: group %u of component %u has no row with these keys\n", group, component);
    SLDeleteKeyList(keys);
    return found;
}

void printLine(void* context, const char* text)
{
    fprintf(static_cast<FILE*>(context), "%s\n", text);
}

int explain(SLHandle* h, int argc, char** argv, FILE* out, FILE* err)
{
    const char* componentText = nullptr;
    RowArgument arguments[2];
    uint32_t rowCount = 0;
    if (!parse(argc, argv, &componentText, arguments, &rowCount)) {
        fputs(usage, err);
        return 1;
    }
    if (catalogueInstalledMifs(h) != 0) {
        fprintf(err, "mox: the DMI service provider holds no mox MIF (start the daemon once)\n");
        return 1;
    }
    // What the daemon reads at its start: the configuration, the baseboard's groups.
    ProcessCfgOption();
    findBaseboardGroups();
    uint32_t component = componentArgument(h, componentText);
    if (component == 0) {
        fprintf(err, "mox: no component %s\n", componentText);
        return 1;
    }
    Event event;
    int status = 1;
    bool read = readRow(h, component, arguments[0], event, 0, err) &&
                (rowCount < 2 || readRow(h, component, arguments[1], event, 1, err));
    if (read)
        event.indication = slMakeEventIndication(component, event.classes, event.rows, rowCount);
    uint32_t kind = event.indication != nullptr ? eventClass(event.indication) : 0;
    if (kind == EVENT_STANDARD || kind == EVENT_VENDOR) {
        Explanation explanation{printLine, out};
        explainEventActions(event.indication, &explanation);
        status = 0;
    } else if (read) {
        fprintf(err, "mox: group %s is neither an event-generation group nor the vendor error group\n",
                arguments[0].group);
    }
    release(event);
    return status;
}

} // namespace

int moxExplain(int argc, char** argv, FILE* out)
{
    SLInitialize();
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr) {
        fprintf(stderr, "mox: out of memory\n");
        return 1;
    }
    if (SLDmiRegisterMgmt(h, nullptr) != 0) {
        fprintf(stderr, "mox: the DMI service provider cannot be reached\n");
        return 2;
    }
    int status = explain(h, argc, argv, out, stderr);
    SLDmiUnregisterMgmt(h);
    SLDestroyHandle(h);
    return status;
}
