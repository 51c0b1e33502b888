// Reading and writing the 32-bit little-endian words of DMI records.
//
// Records exchanged with the provider and the driver are packed and often
// unaligned (a key value behind a string key, data at odd offsets), so their
// fields are copied with memcpy rather than read through a cast pointer.
#pragma once

#include <cstdint>
#include <cstring>

static_assert(sizeof(void*) == 4, "the daemon's records carry 4-byte pointers: build for i386");

inline uint32_t loadWord(const void* at)
{
    uint32_t value;
    std::memcpy(&value, at, sizeof value);
    return value;
}

inline void storeWord(void* at, uint32_t value)
{
    std::memcpy(at, &value, sizeof value);
}

// Word number `index` of a record that starts at `base`.
inline uint32_t loadWordAt(const void* base, uint32_t index)
{
    return loadWord(static_cast<const uint8_t*>(base) + 4 * index);
}

inline void storeWordAt(void* base, uint32_t index, uint32_t value)
{
    storeWord(static_cast<uint8_t*>(base) + 4 * index, value);
}

// Pointers travel in 32-bit words of the records.
inline uint32_t pointerWord(const void* pointer)
{
    return static_cast<uint32_t>(reinterpret_cast<uintptr_t>(pointer));
}

inline void* wordPointer(uint32_t word)
{
    return reinterpret_cast<void*>(static_cast<uintptr_t>(word));
}
