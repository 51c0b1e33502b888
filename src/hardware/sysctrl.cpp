#include "hardware/sysctrl.h"

#include <algorithm>
#include <cstring>

#include "base/strcase.h"
#include "mif/format.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"

uint32_t sysCtrlGroup = 0;
uint32_t sysCtrlComponent = 0;
uint32_t PagingGroupId = 0;

const char sysCtrlClassString[] = "Zorek|System Control|";
const int sysCtrlClassLength = 21;
const char PagingClassString[] = "Zorek|Paging Config|001";
const int PagingClassLength = 23;
static_assert(sizeof sysCtrlClassString - 1 == 21 && sizeof PagingClassString - 1 == 23);

namespace {

// Confirm status with which a component listing may still name a component.
constexpr uint32_t listedWithWarning = 512;
// Confirm buffer asked for by the searches.
constexpr unsigned searchConfirmSize = 4096;
// Attribute of the paging group that sends a page.
constexpr uint32_t pageControlAttribute = 6;

// The group-list entries a component record in `h` can really hold: a count
// beyond what fits in the confirm buffer is not walked to its end.
uint32_t listedGroupCount(SLHandle* h)
{
    return std::min(SLComponentGroupCount(h), h->confirmSize / 8);
}

// A listing that failed with status 512 still counts when the confirm really
// carries a component record: the provider reported at least one entry and it
// names a component. Without that, the confirm buffer holds whatever an
// earlier command left there.
bool holdsComponentRecord(SLHandle* h)
{
    return SLCnfCount(h) >= 1 && SLComponentId(h) != 0;
}

// Writes `value` to `attribute` of `group` in `component`, addressing the
// group's first row. Results are not examined: a request that cannot be
// written is dropped quietly.
void writeRequest(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, const char* value)
{
    SLKeyList* keys = GroupKeyList(h, component, group);
    SetPureValue(h, component, group, attribute, keys, value);
}

// The write of a request to the system-control group; false while the group
// is not known.
bool sysCtrlTarget(uint32_t attribute, const char* value, SysCtrlTarget* target)
{
    if (sysCtrlGroup == 0)
        return false;
    *target = SysCtrlTarget{sysCtrlComponent, sysCtrlGroup, attribute, value};
    return true;
}

void sysCtrlWrite(uint32_t attribute, const char* value)
{
    SysCtrlTarget target;
    if (!sysCtrlTarget(attribute, value, &target))
        return;
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr)
        return;
    writeRequest(h, target.component, target.group, target.attribute, target.value);
    SLDestroyHandle(h);
}

// The index of the first group listed in the component record in `h` whose
// class matches, or -1.
long findListedGroup(SLHandle* h, const char* text, int length)
{
    uint32_t count = listedGroupCount(h);
    for (uint32_t i = 0; i < count; ++i) {
        if (groupClassMatches(SLComponentGroupName(h, i), text, length))
            return i;
    }
    return -1;
}

constexpr uint32_t idLedAttribute = 25;

const char* idLedText(bool blink)
{
    return blink ? "LED Blink" : "LED Off";
}

// The page's write: "Page" to the paging group, searched for in the baseboard
// component while it is not known; false when there is none.
bool pageTarget(SLHandle* h, SysCtrlTarget* target)
{
    uint32_t baseboard = BaseboardComponentId();
    if (PagingGroupId == 0 && SLListComponent(h, nullptr, baseboard) == 0) {
        long found = findListedGroup(h, PagingClassString, PagingClassLength);
        if (found >= 0)
            PagingGroupId = SLComponentGroupId(h, static_cast<uint32_t>(found));
    }
    if (PagingGroupId == 0)
        return false;
    *target = SysCtrlTarget{baseboard, PagingGroupId, pageControlAttribute, "Page"};
    return true;
}

} // namespace

int groupClassMatches(const DmiString* classString, const char* text, int length)
{
    if (classString == nullptr)
        return 0;
    // The class string has no terminator; compare a bounded, terminated copy
    // so that a short class string ends the comparison instead of the
    // comparison running on past its count.
    char copy[64];
    size_t n = std::min<size_t>(dmiStringLength(classString), sizeof copy - 1);
    memcpy(copy, dmiStringText(classString), n);
    copy[n] = '\0';
    return strnicmp(copy, text, length) == 0 ? 1 : 0;
}

uint32_t SysCtrlFindGroupId(SLHandle* h, uint32_t component)
{
    if (h == nullptr)
        return 0;
    if (component != 0) {
        if (SLListComponent(h, nullptr, component) != 0)
            return 0;
    } else if (SLListNextComponent(h, sysCtrlClassString, 0) != 0) {
        if (SLCnfStatus(h) != listedWithWarning || !holdsComponentRecord(h))
            return 0;
    }
    long found = findListedGroup(h, sysCtrlClassString, sysCtrlClassLength);
    if (found < 0)
        return 0;
    sysCtrlComponent = SLComponentId(h);
    return SLComponentGroupId(h, static_cast<uint32_t>(found));
}

int SysCtrlInitialize(void)
{
    if (sysCtrlGroup != 0)
        return 0;
    SLHandle* h = SLCreateHandle(searchConfirmSize);
    if (h == nullptr)
        return -1;
    sysCtrlGroup = SysCtrlFindGroupId(h, BaseboardComponentId());
    if (sysCtrlGroup == 0)
        sysCtrlGroup = SysCtrlFindGroupId(h, 0);
    SLDestroyHandle(h);
    return sysCtrlGroup != 0 ? 0 : -1;
}

void SysCtrlReset(void) { sysCtrlWrite(2, "Initiate Reset"); }
void SysCtrlPowerOff(void) { sysCtrlWrite(7, "Off"); }
void SysCtrlShutDown(void) { sysCtrlWrite(17, "Shutdown OS"); }
void SysCtrlShutAndPowerOff(void) { sysCtrlWrite(18, "Shutdown and Power Off"); }
void SysCtrlShutAndReset(void) { sysCtrlWrite(19, "Shutdown and Hardware Reset"); }
void SysCtrlNMI(void) { sysCtrlWrite(20, "Issue an NMI"); }
void SysCtrlIdLedBlink(void) { sysCtrlWrite(idLedAttribute, idLedText(true)); }
void SysCtrlIdLedOff(void) { sysCtrlWrite(idLedAttribute, idLedText(false)); }

bool SysCtrlIdLedTarget(bool blink, SysCtrlTarget* target)
{
    return sysCtrlTarget(idLedAttribute, idLedText(blink), target);
}

// The paging group is searched for in the baseboard component, and the page
// is written there too: its id names a baseboard group, whatever component
// the system-control group was found in. Addressing sysCtrlComponent instead
// would, when the system-control group lives in another component, write to
// whatever group carries the same id there, and with no system-control group
// at all (component 0) could not page. When both groups are in the baseboard
// the two are the same component.
void SysCtrlPage(void)
{
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr)
        return;
    SysCtrlTarget target;
    if (pageTarget(h, &target))
        writeRequest(h, target.component, target.group, target.attribute, target.value);
    SLDestroyHandle(h);
}

bool SysCtrlPageTarget(SysCtrlTarget* target)
{
    SLHandle* h = SLCreateHandle(0);
    bool found = h != nullptr && pageTarget(h, target);
    SLDestroyHandle(h);
    return found;
}
