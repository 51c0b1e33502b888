// Records shared by the whole service-layer (SL) library.
#pragma once

#include <cstddef>
#include <cstdint>

#include "base/bytes.h"

// A DMI string: a 32-bit byte count followed by that many characters, no
// terminator. Only ever handled through pointers into SL memory or confirms.
struct DmiString;

inline uint32_t dmiStringLength(const DmiString* s)
{
    return loadWord(s);
}

inline const char* dmiStringText(const DmiString* s)
{
    return reinterpret_cast<const char*>(s) + 4;
}

// Size of the command block at the start of every handle.
constexpr uint32_t SL_COMMAND_SIZE = 4096;
// Smallest confirm buffer a handle gets.
constexpr uint32_t SL_MIN_CONFIRM_SIZE = 8192;
// Level check of the DMI 1.x command and indication layouts.
constexpr uint32_t SL_LEVEL_CHECK = 0x444D4931;

// An SL handle: the data of one tracked block. The confirm buffer follows the
// header fields; offsets in confirms and indications count from its first byte.
struct SLHandle {
    uint8_t command[SL_COMMAND_SIZE]; // the DMI command block, or an indication header
    SLHandle* next;                   // handle list links; the handle itself when on no list
    SLHandle* prev;
    uint32_t pending;     // 1 while a command waits for its confirm; accessed atomically
    uint32_t confirmSize; // bytes in confirm[], never below SL_MIN_CONFIRM_SIZE
    uint8_t confirm[];    // confirmSize bytes
};
static_assert(offsetof(SLHandle, next) == 4096);
static_assert(offsetof(SLHandle, pending) == 4104);
static_assert(offsetof(SLHandle, confirmSize) == 4108);
static_assert(offsetof(SLHandle, confirm) == 4112);

// One key of a key list: the value is an SL string holding a copy of the
// key's DMI value, or null.
struct SLKeyEntry {
    uint32_t attributeId;
    uint32_t type;
    void* value;
};

constexpr uint32_t SL_MAX_KEYS = 10;

// A key list names one table row. It is an SL string of 132 bytes.
struct SLKeyList {
    uint32_t firstWord; // not used by the library
    uint32_t count;     // keys in use
    SLKeyEntry keys[SL_MAX_KEYS];
    SLKeyList* next; // a further list chained behind this one, or null
};
static_assert(sizeof(SLKeyList) == 132);

// DMI data types.
enum : uint32_t {
    DMI_COUNTER = 1,
    DMI_COUNTER64 = 2,
    DMI_GAUGE = 3,
    DMI_INTEGER = 5,
    DMI_INTEGER64 = 6,
    DMI_OCTETSTRING = 7,
    DMI_DISPLAYSTRING = 8,
    DMI_DATE = 11,
};

// The application's indication handler; its result is not used.
typedef int (*SLIndicationHandler)(SLHandle* handle);
