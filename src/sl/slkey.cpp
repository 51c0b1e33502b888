#include "sl/slkey.h"

#include <cstring>

#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slstring.h"

namespace {

// Words 1 (count) and 2 (list offset) of the record that holds a handle's
// keys: group entry 0 after a group listing, the row after a row command or
// in an event indication. 0 when the handle has no keys or the record lies
// outside the buffer.
uint32_t keyRecordWord(SLHandle* h, uint32_t field)
{
    if (h == nullptr)
        return 0;
    switch (loadWordAt(h->command, 1)) {
    case 516:
    case 518: {
        // Group entry: id, name, class name, key count, key list offset.
        const uint8_t* entry = slConfirmBytes(h, 0, 20);
        return entry != nullptr ? loadWordAt(entry, field + 2) : 0;
    }
    case 1:
    case 772:
    case 773:
    case 774: {
        const uint8_t* row = pGetRow(h);
        return row != nullptr ? loadWordAt(row, field) : 0;
    }
    default:
        return 0;
    }
}

// The copy of one key's value at `offset`, or null when the value does not
// lie inside the buffer; `failed` is set then and when memory runs out.
void* copyKeyValue(SLHandle* h, uint32_t type, uint32_t offset, bool& failed)
{
    uint64_t size;
    if (type == DMI_OCTETSTRING || type == DMI_DISPLAYSTRING) {
        const uint8_t* count = slConfirmBytes(h, offset, 4);
        if (count == nullptr) {
            failed = true;
            return nullptr;
        }
        size = 4ull + loadWord(count);
    } else {
        size = SLAttributeSize(static_cast<int>(type), nullptr);
    }
    const uint8_t* value = slConfirmBytes(h, offset, size);
    void* copy = value != nullptr ? SLCreateString(static_cast<unsigned>(size)) : nullptr;
    if (copy == nullptr) {
        failed = true;
        return nullptr;
    }
    std::memcpy(copy, value, size);
    return copy;
}

} // namespace

extern "C" {

int SLKeyCount(SLHandle* h)
{
    return static_cast<int>(keyRecordWord(h, 1));
}

int SLKeyListOffset(SLHandle* h)
{
    return static_cast<int>(keyRecordWord(h, 2));
}

SLKeyList* SLCreateKeyList(SLHandle* h)
{
    uint32_t n = keyRecordWord(h, 1);
    // A row with more keys than a list holds cannot be named by one.
    if (n == 0 || n > SL_MAX_KEYS)
        return nullptr;
    uint32_t list = keyRecordWord(h, 2);
    const uint8_t* entries = slConfirmBytes(h, list, 12ull * n);
    if (entries == nullptr)
        return nullptr;

    auto* keys = static_cast<SLKeyList*>(SLCreateString(sizeof(SLKeyList)));
    if (keys == nullptr)
        return nullptr;
    for (SLKeyEntry& key : keys->keys) {
        key.attributeId = 0;
        key.type = 0;
        key.value = nullptr;
    }
    keys->count = n;
    keys->next = nullptr;

    for (uint32_t i = 0; i < n; ++i) {
        const uint8_t* entry = entries + 12 * i;
        SLKeyEntry& key = keys->keys[i];
        key.attributeId = loadWordAt(entry, 0);
        key.type = loadWordAt(entry, 1);
        uint32_t valueOffset = loadWordAt(entry, 2);
        if (valueOffset == 0)
            continue;
        bool failed = false;
        key.value = copyKeyValue(h, key.type, valueOffset, failed);
        if (failed) {
            SLDeleteKeyList(keys);
            return nullptr;
        }
    }
    return keys;
}

void SLDeleteKeyList(SLKeyList* k)
{
    // Iteratively along the chain; each record's values, then the record.
    while (k != nullptr) {
        SLKeyList* next = k->next;
        uint32_t count = k->count < SL_MAX_KEYS ? k->count : SL_MAX_KEYS;
        for (uint32_t i = 0; i < count; ++i)
            SLDeleteString(k->keys[i].value);
        SLDeleteString(k);
        k = next;
    }
}

// Keys of types 1, 3, 5, 7 and 8 compare by value. A key without a value
// equals only a key of the same id and type that has no value either; a list
// claiming more keys than a list holds equals nothing.
int SLCompareKeyLists(SLKeyList* a, SLKeyList* b)
{
    if (a == nullptr || b == nullptr)
        return a == b ? 1 : 0;
    if (a->count != b->count || a->count > SL_MAX_KEYS)
        return 0;
    for (uint32_t i = 0; i < a->count; ++i) {
        const SLKeyEntry& x = a->keys[i];
        const SLKeyEntry& y = b->keys[i];
        if (x.attributeId != y.attributeId || x.type != y.type)
            return 0;
        switch (x.type) {
        case DMI_COUNTER:
        case DMI_GAUGE:
        case DMI_INTEGER:
        case DMI_OCTETSTRING:
        case DMI_DISPLAYSTRING:
            if (x.value == nullptr || y.value == nullptr) {
                if (x.value != y.value)
                    return 0;
                continue;
            }
            break;
        default:
            continue; // 64-bit counters and integers, dates: not compared
        }
        uint32_t first = loadWord(x.value);
        if (first != loadWord(y.value))
            return 0; // the value, or for strings the byte count
        if (x.type == DMI_OCTETSTRING || x.type == DMI_DISPLAYSTRING) {
            auto* textX = static_cast<const char*>(x.value) + 4;
            auto* textY = static_cast<const char*>(y.value) + 4;
            if (std::strncmp(textX, textY, first) != 0)
                return 0;
        }
    }
    return 1;
}

void SLIndicateDown(void)
{
    SLLibDownFlag = 1;
}

} // extern "C"
