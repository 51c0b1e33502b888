#include "sl/slaccess.h"

#include <cstring>

namespace {

// Bytes of the confirm buffer that records may be read from: the whole buffer
// for a command's confirm; for an indication (type below 256) no more than the
// indication's stated length.
uint32_t confirmLimit(SLHandle* h)
{
    uint32_t limit = h->confirmSize;
    if (loadWordAt(h->command, 1) < 256) {
        uint32_t stated = loadWordAt(h->command, 2);
        if (stated < limit)
            limit = stated;
    }
    return limit;
}

// Address of `length` bytes at `offset`, or null when they do not fit.
const uint8_t* inConfirm(SLHandle* h, uint64_t offset, uint64_t length)
{
    if (offset + length > confirmLimit(h))
        return nullptr;
    return h->confirm + offset;
}

// Word `index` of the record at `record` (an offset), 0 when outside.
uint32_t recordWord(SLHandle* h, uint64_t record, uint64_t index)
{
    const uint8_t* at = inConfirm(h, record + 4 * index, 4);
    return at != nullptr ? loadWord(at) : 0;
}

// Offset-0-means-absent address of a value of `size` bytes.
void* offsetAddress(SLHandle* h, uint32_t offset, uint64_t size)
{
    if (offset == 0)
        return nullptr;
    return const_cast<uint8_t*>(inConfirm(h, offset, size));
}

// A DMI string at `offset` whose count and characters lie in the buffer.
DmiString* stringAt(SLHandle* h, uint32_t offset)
{
    const uint8_t* at = offset != 0 ? inConfirm(h, offset, 4) : nullptr;
    if (at == nullptr || inConfirm(h, offset, 4ull + loadWord(at)) == nullptr)
        return nullptr;
    return reinterpret_cast<DmiString*>(const_cast<uint8_t*>(at));
}

// A value of DMI type `type` at `offset`, checked by the size its type gives.
void* valueAt(SLHandle* h, uint32_t offset, uint32_t type)
{
    if (type == DMI_OCTETSTRING || type == DMI_DISPLAYSTRING)
        return stringAt(h, offset);
    uint64_t size = type == DMI_DATE ? 28 : (type == DMI_COUNTER64 || type == DMI_INTEGER64) ? 8 : 4;
    return offsetAddress(h, offset, size);
}

uint32_t header(SLHandle* h, uint32_t word)
{
    return loadWordAt(h->command, word);
}

// Offset of the component record: the confirm's start, or the indication's
// data for component installed (2) and uninstalled (3).
uint64_t componentRecord(SLHandle* h)
{
    uint32_t type = header(h, 1);
    return (type == 2 || type == 3) ? header(h, 12) : 0;
}

uint32_t componentWord(SLHandle* h, uint32_t index)
{
    return recordWord(h, componentRecord(h), index);
}

constexpr uint64_t groupEntryWords = 5;
constexpr uint64_t attributeEntryWords = 7;

uint32_t groupWord(SLHandle* h, uint32_t i, uint32_t field)
{
    return recordWord(h, 0, groupEntryWords * i + field);
}

uint32_t attributeWord(SLHandle* h, uint32_t i, uint32_t field)
{
    return recordWord(h, 0, attributeEntryWords * i + field);
}

// Offset of the event data of an indication.
uint64_t eventData(SLHandle* h)
{
    return header(h, 12);
}

uint32_t classWord(SLHandle* h, uint32_t c, uint32_t field)
{
    return recordWord(h, eventData(h) + 4 + 16ull * c, field);
}

// Offset of the row the row accessors read, or -1 when it lies outside.
int64_t rowOffset(SLHandle* h)
{
    if (header(h, 1) != 1)
        return inConfirm(h, 0, 16) != nullptr ? 0 : -1;
    uint32_t c = header(h, 13);
    uint32_t r = header(h, 14);
    if (inConfirm(h, eventData(h) + 4 + 16ull * c, 16) == nullptr)
        return -1;
    uint64_t rows = classWord(h, c, 3);
    uint64_t position;
    if (header(h, 0) == SL_LEVEL_CHECK) {
        // Rows back to back, each 16 bytes and 16 per attribute.
        position = rows;
        for (uint32_t i = 0; i < r; ++i) {
            const uint8_t* row = inConfirm(h, position, 16);
            if (row == nullptr)
                return -1;
            position += 16 + 16ull * loadWordAt(row, 3);
        }
    } else {
        // An array of row offsets.
        const uint8_t* element = inConfirm(h, rows + 4ull * r, 4);
        if (element == nullptr)
            return -1;
        position = loadWord(element);
    }
    if (inConfirm(h, position, 16) == nullptr)
        return -1;
    return static_cast<int64_t>(position);
}

uint32_t rowWord(SLHandle* h, uint64_t index)
{
    int64_t row = rowOffset(h);
    return row < 0 ? 0 : recordWord(h, static_cast<uint64_t>(row), index);
}

// Field of row entry i (1 id, 2 type, 3 value offset).
uint32_t rowEntryWord(SLHandle* h, uint32_t i, uint32_t field)
{
    return rowWord(h, 4 + 4ull * i + field);
}

} // namespace

uint32_t slRowAttributesPresent(SLHandle* h)
{
    int64_t row = rowOffset(h);
    if (row < 0)
        return 0;
    uint64_t fit = (confirmLimit(h) - static_cast<uint64_t>(row) - 16) / 16;
    uint32_t count = recordWord(h, static_cast<uint64_t>(row), 3);
    return count < fit ? count : static_cast<uint32_t>(fit);
}

const uint8_t* slConfirmBytes(SLHandle* h, uint64_t offset, uint64_t length)
{
    return inConfirm(h, offset, length);
}

const uint8_t* pGetRow(SLHandle* h)
{
    int64_t row = rowOffset(h);
    return row < 0 ? nullptr : h->confirm + row;
}

extern "C" {

uint32_t SLCnfCount(SLHandle* h) { return header(h, 10); }
uint32_t SLCnfStatus(SLHandle* h) { return header(h, 11); }
uint32_t SLIndicationType(SLHandle* h) { return header(h, 1); }
uint32_t SLIndicationComponentId(SLHandle* h) { return header(h, 3); }
void* SLIndicationTimeStamp(SLHandle* h) { return h->command + 16; }
uint32_t SLInstallComponentId(SLHandle* h) { return header(h, 16); }
DmiString* SLDmiSpecificationLevel(SLHandle* h) { return stringAt(h, recordWord(h, 0, 0)); }
DmiString* SLImplementationDescription(SLHandle* h) { return stringAt(h, recordWord(h, 0, 1)); }
uint32_t SLRegisterHandle(SLHandle* h) { return recordWord(h, 0, 2); }

uint32_t SLComponentId(SLHandle* h) { return componentWord(h, 0); }
uint32_t SLComponentMatchType(SLHandle* h) { return componentWord(h, 1); }
DmiString* SLComponentName(SLHandle* h) { return stringAt(h, componentWord(h, 2)); }
uint32_t SLComponentGroupCount(SLHandle* h) { return componentWord(h, 3); }

uint32_t SLComponentGroupId(SLHandle* h, uint32_t i)
{
    return recordWord(h, componentWord(h, 4), 2ull * i);
}

DmiString* SLComponentGroupName(SLHandle* h, uint32_t i)
{
    return stringAt(h, recordWord(h, componentWord(h, 4), 2ull * i + 1));
}

uint32_t SLComponentFileCount(SLHandle* h) { return componentWord(h, 5); }

uint32_t SLComponentFileType(SLHandle* h, uint32_t i)
{
    uint32_t list = componentWord(h, 6);
    return list == 0 ? 0 : recordWord(h, list, 2ull * i);
}

void* SLComponentFileData(SLHandle* h, uint32_t i)
{
    uint32_t list = componentWord(h, 6);
    if (list == 0)
        return nullptr;
    return offsetAddress(h, recordWord(h, list, 2ull * i + 1), 1);
}

uint32_t SLGroupId(SLHandle* h, uint32_t i) { return groupWord(h, i, 0); }
DmiString* SLGroupName(SLHandle* h, uint32_t i) { return stringAt(h, groupWord(h, i, 1)); }
DmiString* SLGroupClassName(SLHandle* h, uint32_t i) { return stringAt(h, groupWord(h, i, 2)); }

uint32_t SLAttributeId(SLHandle* h, uint32_t i) { return attributeWord(h, i, 0); }
DmiString* SLAttributeName(SLHandle* h, uint32_t i) { return stringAt(h, attributeWord(h, i, 1)); }
uint32_t SLAttributeAccess(SLHandle* h, uint32_t i) { return attributeWord(h, i, 2); }

uint32_t SLAttributeType(SLHandle* h, uint32_t i)
{
    if (header(h, 1) == 768)
        return recordWord(h, 0, 2);
    return attributeWord(h, i, 3);
}

uint32_t SLAttributeMaxSize(SLHandle* h, uint32_t i) { return attributeWord(h, i, 4); }
uint32_t SLEnumerationListCount(SLHandle* h, uint32_t i) { return attributeWord(h, i, 5); }

int32_t SLEnumerationValue(SLHandle* h, uint32_t i, uint32_t j)
{
    return static_cast<int32_t>(recordWord(h, attributeWord(h, i, 6), 2ull * j));
}

DmiString* SLEnumerationName(SLHandle* h, uint32_t i, uint32_t j)
{
    uint32_t list = attributeWord(h, i, 6);
    if (list == 0)
        return nullptr;
    return stringAt(h, recordWord(h, list, 2ull * j + 1));
}

DmiString* SLDescription(SLHandle* h)
{
    const uint8_t* at = inConfirm(h, 0, 4);
    if (at == nullptr || inConfirm(h, 0, 4ull + loadWord(at)) == nullptr)
        return nullptr;
    return reinterpret_cast<DmiString*>(h->confirm);
}

void* SLAttributePtr(SLHandle* h)
{
    return valueAt(h, recordWord(h, 0, 3), recordWord(h, 0, 2));
}

uint32_t SLUnsignedValue(SLHandle* h)
{
    const void* value = offsetAddress(h, recordWord(h, 0, 3), 4);
    return value != nullptr ? loadWord(value) : 0;
}

int32_t SLIntegerValue(SLHandle* h)
{
    return static_cast<int32_t>(SLUnsignedValue(h));
}

DmiString* SLStringPtr(SLHandle* h)
{
    return stringAt(h, recordWord(h, 0, 3));
}

uint32_t SLRowGroupId(SLHandle* h) { return rowWord(h, 0); }
uint32_t SLRowAttributeCount(SLHandle* h) { return rowWord(h, 3); }
uint32_t SLRowAttributeId(SLHandle* h, uint32_t i) { return rowEntryWord(h, i, 1); }
uint32_t SLRowAttributeType(SLHandle* h, uint32_t i) { return rowEntryWord(h, i, 2); }

void* SLRowAttributePtr(SLHandle* h, uint32_t i)
{
    return valueAt(h, rowEntryWord(h, i, 3), rowEntryWord(h, i, 2));
}

uint32_t SLRowUnsignedValue(SLHandle* h, uint32_t i)
{
    const void* value = offsetAddress(h, rowEntryWord(h, i, 3), 4);
    return value != nullptr ? loadWord(value) : 0;
}

int32_t SLRowIntegerValue(SLHandle* h, uint32_t i)
{
    return static_cast<int32_t>(SLRowUnsignedValue(h, i));
}

DmiString* SLRowStringPtr(SLHandle* h, uint32_t i)
{
    return stringAt(h, rowEntryWord(h, i, 3));
}

uint32_t SLEventClassCount(SLHandle* h) { return recordWord(h, eventData(h), 0); }
uint32_t SLEventComponentId(SLHandle* h, uint32_t c) { return classWord(h, c, 0); }
DmiString* SLEventClassString(SLHandle* h, uint32_t c) { return stringAt(h, classWord(h, c, 1)); }

DmiString* SLEventClassStringUnchecked(SLHandle* h, uint32_t c)
{
    uint32_t offset = classWord(h, c, 1);
    const uint8_t* at = offset != 0 ? inConfirm(h, offset, 4) : nullptr;
    return reinterpret_cast<DmiString*>(const_cast<uint8_t*>(at));
}
uint32_t SLEventRowCount(SLHandle* h, uint32_t c) { return classWord(h, c, 2); }

void SLEventSelectRowCnf(SLHandle* h, uint32_t c, uint32_t r)
{
    storeWordAt(h->command, 13, c);
    storeWordAt(h->command, 14, r);
}

} // extern "C"
