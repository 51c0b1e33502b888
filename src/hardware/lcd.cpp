#include "hardware/lcd.h"

#include <algorithm>
#include <cstring>

#include "hardware/sysctrl.h"
#include "mif/format.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"

uint32_t LcdGroupId = 0;
uint32_t LcdContentsAttrId = 0;

const char Lcd1ClassString[] = "Zorek|Status Display|basebrd001";
const int Lcd1ClassLength = 31;
const char Lcd2ClassString[] = "Zorek|Status Display|002";
const int Lcd2ClassLength = 24;
static_assert(sizeof Lcd1ClassString - 1 == 31 && sizeof Lcd2ClassString - 1 == 24);

namespace {

constexpr unsigned searchConfirmSize = 4096;
// Contents attribute of each display form.
constexpr uint32_t lcd1ContentsAttribute = 7;
constexpr uint32_t lcd2ContentsAttribute = 8;

} // namespace

int LcdInitialize(void)
{
    if (LcdGroupId != 0)
        return 0;
    SLHandle* h = SLCreateHandle(searchConfirmSize);
    if (h == nullptr)
        return -1;
    if (SLListComponent(h, nullptr, BaseboardComponentId()) != 0) {
        SLDestroyHandle(h);
        return -1;
    }
    // The first group of either form wins, whichever form it is.
    uint32_t count = std::min(SLComponentGroupCount(h), h->confirmSize / 8);
    for (uint32_t i = 0; i < count; ++i) {
        const DmiString* cls = SLComponentGroupName(h, i);
        if (cls == nullptr)
            continue;
        if (groupClassMatches(cls, Lcd1ClassString, Lcd1ClassLength)) {
            LcdContentsAttrId = lcd1ContentsAttribute;
            LcdGroupId = SLComponentGroupId(h, i);
            break;
        }
        if (groupClassMatches(cls, Lcd2ClassString, Lcd2ClassLength)) {
            LcdContentsAttrId = lcd2ContentsAttribute;
            LcdGroupId = SLComponentGroupId(h, i);
            break;
        }
    }
    SLDestroyHandle(h);
    return LcdGroupId != 0 ? 0 : -1;
}

void LcdLine(const char* text, char (&line)[LcdWidth + 1])
{
    size_t n = text == nullptr ? 0 : strnlen(text, LcdWidth);
    memcpy(line, text == nullptr ? "" : text, n);
    memset(line + n, ' ', LcdWidth - n);
    line[LcdWidth] = '\0';
}

void WriteLCD(const char* text)
{
    if (LcdGroupId == 0)
        return;
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr)
        return;
    char line[LcdWidth + 1];
    LcdLine(text, line);
    uint32_t baseboard = BaseboardComponentId();
    SLKeyList* keys = GroupKeyList(h, baseboard, LcdGroupId);
    SetPureValue(h, baseboard, LcdGroupId, LcdContentsAttrId, keys, line);
    SLDestroyHandle(h);
}

void ClearLCD(void)
{
    WriteLCD("                                ");
}

void ReadLCD(char* buffer)
{
    if (LcdGroupId == 0 || buffer == nullptr)
        return;
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr)
        return;
    uint32_t baseboard = BaseboardComponentId();
    SLKeyList* keys = GroupKeyList(h, baseboard, LcdGroupId);
    // The caller's buffer holds 33 bytes: room for the whole 32-character
    // line and its terminator.
    GetPureValue(h, baseboard, LcdGroupId, LcdContentsAttrId, keys, buffer, LcdWidth + 1);
    buffer[LcdWidth] = '\0';
    SLDestroyHandle(h);
}
