#include "sl/slmap.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "base/strcase.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

// Every lookup asks for the smallest handle; the confirm buffer is then the
// minimum 8192 bytes.
constexpr unsigned lookupHandleSize = 2048;

const char defaultMifDirectory[] = "/var/dmi/mifs/backup";
const char componentIdClass[] = "DMTF|ComponentID|001";
const char versionAttribute[] = "Version";

// One walk over a provider list: `next` issues the list-next command after
// `id`, `entryId` and `entryName` read entry 0 of its confirm.
struct Walk {
    int (*next)(SLHandle* h, uint32_t id, const uint32_t* scope);
    uint32_t (*entryId)(SLHandle* h, uint32_t i);
    DmiString* (*entryName)(SLHandle* h, uint32_t i);
};

// Walks the list until entry 0 is named `wanted`; its id, or 0. A provider
// that answers with the id it was asked after would repeat itself forever:
// the walk ends there too.
uint32_t walkToId(const Walk& walk, const uint32_t* scope, const char* wanted)
{
    if (wanted == nullptr)
        return 0;
    SLHandle* h = SLCreateHandle(lookupHandleSize);
    if (h == nullptr)
        return 0;
    uint32_t id = 0;
    while (walk.next(h, id, scope) == 0) {
        uint32_t found = walk.entryId(h, 0);
        if (found == id)
            break;
        id = found;
        DmiString* name = walk.entryName(h, 0);
        if (name != nullptr && IsExactMatch(name, wanted) == 1) {
            SLDestroyHandle(h);
            return id;
        }
    }
    SLDestroyHandle(h);
    return 0;
}

int nextComponent(SLHandle* h, uint32_t id, const uint32_t*)
{
    return SLListNextComponent(h, nullptr, id);
}

int nextGroup(SLHandle* h, uint32_t id, const uint32_t* scope)
{
    return SLListNextGroup(h, scope[0], id);
}

int nextAttribute(SLHandle* h, uint32_t id, const uint32_t* scope)
{
    return SLListNextAttribute(h, scope[0], scope[1], id);
}

uint32_t componentEntryId(SLHandle* h, uint32_t)
{
    return SLComponentId(h);
}

DmiString* componentEntryName(SLHandle* h, uint32_t)
{
    return SLComponentName(h);
}

const Walk componentWalk{nextComponent, componentEntryId, componentEntryName};
const Walk groupWalk{nextGroup, SLGroupId, SLGroupName};
const Walk classWalk{nextGroup, SLGroupId, SLGroupClassName};
const Walk attributeWalk{nextAttribute, SLAttributeId, SLAttributeName};

// Runs `list` on a fresh handle and returns entry 0's name as a new C string.
template <typename List, typename Name>
char* nameOf(List list, Name name)
{
    SLHandle* h = SLCreateHandle(lookupHandleSize);
    if (h == nullptr)
        return nullptr;
    char* result = list(h) == 0 ? NewCString(name(h)) : nullptr;
    SLDestroyHandle(h);
    return result;
}

} // namespace

extern "C" {

uint32_t SLMapComponentNameToId(const char* name)
{
    return walkToId(componentWalk, nullptr, name);
}

uint32_t SLMapGroupNameToId(uint32_t component, const char* name)
{
    uint32_t scope[] = {component};
    return walkToId(groupWalk, scope, name);
}

uint32_t SLMapClassNameToId(uint32_t component, const char* className)
{
    uint32_t scope[] = {component};
    return walkToId(classWalk, scope, className);
}

uint32_t SLMapAttributeNameToId(uint32_t component, uint32_t group, const char* name)
{
    uint32_t scope[] = {component, group};
    return walkToId(attributeWalk, scope, name);
}

char* SLMapComponentIdToName(uint32_t component)
{
    return nameOf([&](SLHandle* h) { return SLListComponent(h, nullptr, component); },
                  [](SLHandle* h) { return SLComponentName(h); });
}

char* SLMapGroupIdToName(uint32_t component, uint32_t group)
{
    return nameOf([&](SLHandle* h) { return SLListGroup(h, component, group); },
                  [](SLHandle* h) { return SLGroupName(h, 0); });
}

char* SLMapAttributeIdToName(uint32_t component, uint32_t group, uint32_t attribute)
{
    return nameOf([&](SLHandle* h) { return SLListAttribute(h, component, group, attribute); },
                  [](SLHandle* h) { return SLAttributeName(h, 0); });
}

int IsExactMatch(const DmiString* d, const char* s)
{
    if (d == nullptr || s == nullptr)
        return 0;
    uint32_t count = dmiStringLength(d);
    if (count != std::strlen(s))
        return 0;
    return std::strncmp(dmiStringText(d), s, count) == 0 ? 1 : 0;
}

int PrefixMatches(const DmiString* d, const char* s)
{
    if (d == nullptr || s == nullptr)
        return 0;
    size_t length = std::strlen(s);
    if (dmiStringLength(d) < length)
        return 0;
    return strnicmp(dmiStringText(d), s, static_cast<int>(length)) == 0 ? 1 : 0;
}

int SLInstallMIF(SLHandle* h, const char* file)
{
    if (h == nullptr || file == nullptr)
        return 1;
    // The path travels in the command block after its 84 bytes of header and
    // parameters, with its terminator; a longer one is refused there.
    char path[SL_COMMAND_SIZE - 84];
    if (!slMifPath(file, path, sizeof path))
        return 1;
    return SLCiInstallData(h, 0, path);
}

int SLGetInstalledMIFVersion(SLHandle* h, const char* name, float* version)
{
    if (h == nullptr || name == nullptr)
        return 1;
    return slInstalledMifVersionOf(h, SLMapComponentNameToId(name), version);
}

} // extern "C"

bool slMifPath(const char* file, char* out, size_t size)
{
    const char* directory = std::getenv("UXDMIPATH");
    if (directory == nullptr)
        directory = defaultMifDirectory;
    int length = std::snprintf(out, size, "%s/%s", directory, file);
    return length >= 0 && static_cast<size_t>(length) < size;
}

int slInstalledMifVersionOf(SLHandle* h, uint32_t c, float* version)
{
    uint32_t g = SLMapClassNameToId(c, componentIdClass);
    uint32_t a = SLMapAttributeNameToId(c, g, versionAttribute);
    if (h == nullptr || c == 0 || g == 0 || a == 0)
        return 1;
    if (SLGetAttribute(h, c, g, a, nullptr) != 0)
        return 1;
    // Bounds-checked: the count and characters lie inside the confirm buffer.
    const DmiString* value = SLStringPtr(h);
    if (value == nullptr)
        return 1;
    char* text = NewCString(value);
    if (text == nullptr)
        return 1;
    if (version != nullptr)
        *version = static_cast<float>(std::atof(text));
    SLDeleteString(text);
    return 0;
}
