#include "mif/format.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slstring.h"

const char moxNoValueText[] = "        ";

namespace {

const char unsupportedText[] = "Unsupported";
constexpr int32_t unsupportedValue = INT32_MIN;
constexpr size_t dmiDateSize = 28;

const char dateTemplate[] = "1995-01-01 at 12:00:00 (+000)";

// Where each field of a DMI date goes in the readable text.
const struct {
    int source, target, length;
} dateConversion[] = {
    {0, 0, 4},   // year
    {4, 5, 2},   // month
    {6, 8, 2},   // day
    {8, 14, 2},  // hour
    {10, 17, 2}, // minute
    {12, 20, 2}, // second
    {21, 24, 4}, // UTC offset: sign and three digits
    {0, 0, 0},
};

// Copies at most len - 1 characters of `text` and terminates; the count.
int copyCut(char* buffer, int len, const char* text, size_t length)
{
    if (buffer == nullptr || len < 1)
        return 0;
    size_t n = length < static_cast<size_t>(len - 1) ? length : static_cast<size_t>(len - 1);
    memcpy(buffer, text, n);
    buffer[n] = '\0';
    return static_cast<int>(n);
}

bool isIntegerType(uint32_t type)
{
    return type == DMI_COUNTER || type == DMI_COUNTER64 || type == DMI_GAUGE || type == DMI_INTEGER ||
           type == DMI_INTEGER64;
}

bool isStringType(uint32_t type)
{
    return type == DMI_OCTETSTRING || type == DMI_DISPLAYSTRING;
}

} // namespace

int32_t min(int32_t a, int32_t b)
{
    return a < b ? a : b;
}

int noValue(char* buffer, int len)
{
    copyCut(buffer, len, moxNoValueText, sizeof moxNoValueText - 1);
    return 0;
}

int unsupported(char* buffer, int len)
{
    copyCut(buffer, len, unsupportedText, sizeof unsupportedText - 1);
    return 0;
}

char* formatDmiDate(const char* date, char* output)
{
    memcpy(output, dateTemplate, sizeof dateTemplate);
    for (int row = 0; dateConversion[row].length != 0; ++row) {
        // Like strncpy: a NUL in the date ends the field and pads it with NULs.
        const char* from = date + dateConversion[row].source;
        char* to = output + dateConversion[row].target;
        int i = 0;
        for (; i < dateConversion[row].length && from[i] != '\0'; ++i)
            to[i] = from[i];
        for (; i < dateConversion[row].length; ++i)
            to[i] = '\0';
    }
    return output;
}

int getIntegerValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                    char* buffer, int len)
{
    if (h == nullptr || SLGetAttribute(h, componentId, groupId, attributeId, keys) != 0)
        return noValue(buffer, len);
    int32_t value = SLIntegerValue(h);
    if (value == unsupportedValue)
        return unsupported(buffer, len);
    const char* text = AttributeEnumerationString(h, componentId, groupId, attributeId, value);
    if (text != nullptr)
        return copyCut(buffer, len, text, strlen(text));
    char number[16];
    int length = snprintf(number, sizeof number, "%d", value);
    return copyCut(buffer, len, number, static_cast<size_t>(length));
}

int getStringValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                   char* buffer, int len)
{
    if (h == nullptr || SLGetAttribute(h, componentId, groupId, attributeId, keys) != 0)
        return noValue(buffer, len);
    DmiString* s = SLStringPtr(h);
    if (s == nullptr)
        return noValue(buffer, len);
    int n = copyCut(buffer, len, dmiStringText(s), dmiStringLength(s));
    for (int i = 0; i < n; ++i) {
        if (static_cast<unsigned char>(buffer[i]) >= 0x80)
            buffer[i] = ' ';
    }
    return n;
}

int getDateValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 char* buffer, int len)
{
    if (h == nullptr || SLGetAttribute(h, componentId, groupId, attributeId, keys) != 0)
        return noValue(buffer, len);
    const auto* value = static_cast<const uint8_t*>(SLAttributePtr(h));
    if (value == nullptr)
        return noValue(buffer, len);
    // The confirm may give the value a smaller type than a date: read no
    // further than the confirm buffer; missing bytes count as NULs.
    char date[dmiDateSize] = {};
    size_t available = static_cast<size_t>(h->confirm + h->confirmSize - value);
    memcpy(date, value, available < dmiDateSize ? available : dmiDateSize);
    char text[sizeof dateTemplate];
    formatDmiDate(date, text);
    return copyCut(buffer, len, text, strlen(text));
}

int GetPureValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 char* buffer, int len)
{
    uint32_t type = AttributeType(h, componentId, groupId, attributeId);
    if (isIntegerType(type))
        return getIntegerValue(h, componentId, groupId, attributeId, keys, buffer, len);
    if (isStringType(type))
        return getStringValue(h, componentId, groupId, attributeId, keys, buffer, len);
    if (type == DMI_DATE)
        return getDateValue(h, componentId, groupId, attributeId, keys, buffer, len);
    return noValue(buffer, len);
}

int setIntegerValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                    const char* value)
{
    if (h == nullptr || value == nullptr)
        return 0;
    int32_t number;
    EnumList* e = AttributeEnumList(h, componentId, groupId, attributeId);
    if (e != nullptr) {
        while (e != nullptr && (e->name == nullptr || strcmp(e->name, value) != 0))
            e = e->next;
        if (e == nullptr)
            return 0;
        number = e->value;
    } else {
        number = atoi(value);
    }
    return SLSetAttribute(h, componentId, groupId, attributeId, keys, sizeof number, &number) == 0 ? 1 : 0;
}

int setStringValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                   const char* value)
{
    if (h == nullptr)
        return 0;
    DmiString* s = NewDmiString(value);
    if (s == nullptr)
        return 0;
    int rc = SLSetAttribute(h, componentId, groupId, attributeId, keys, dmiStringLength(s) + 4, s);
    SLDeleteString(s);
    return rc == 0 ? 1 : 0;
}

int setDateValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 const char* value)
{
    if (h == nullptr || value == nullptr)
        return 0;
    return SLSetAttribute(h, componentId, groupId, attributeId, keys, dmiDateSize, value) == 0 ? 1 : 0;
}

int SetPureValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 const char* value)
{
    uint32_t type = AttributeType(h, componentId, groupId, attributeId);
    if (isIntegerType(type))
        return setIntegerValue(h, componentId, groupId, attributeId, keys, value);
    if (isStringType(type))
        return setStringValue(h, componentId, groupId, attributeId, keys, value);
    if (type == DMI_DATE)
        return setDateValue(h, componentId, groupId, attributeId, keys, value);
    return 0;
}
