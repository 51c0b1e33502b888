// Confirm buffers from a hostile provider: the first 68 bytes are the command
// header words 0 to 16, the rest the confirm buffer. Every accessor is called
// with small and huge indices; every address it returns must lie inside the
// confirm buffer (a DMI string with its characters), which is then read in
// full so that AddressSanitizer sees any overrun of the handle.
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slstring.h"

namespace {

constexpr size_t headerBytes = 68;

volatile uint32_t sink;

void readAll(const void* p, size_t n)
{
    const auto* bytes = static_cast<const unsigned char*>(p);
    uint32_t sum = 0;
    for (size_t i = 0; i < n; ++i)
        sum += bytes[i];
    sink = sum;
}

void inside(SLHandle* h, const void* p, size_t n)
{
    if (p == nullptr)
        return;
    auto* begin = reinterpret_cast<const unsigned char*>(h->confirm);
    auto* at = static_cast<const unsigned char*>(p);
    if (at < begin || n > h->confirmSize || at - begin > static_cast<ptrdiff_t>(h->confirmSize - n))
        abort(); // an address outside the confirm buffer
    readAll(p, n);
}

void string(SLHandle* h, const DmiString* s)
{
    if (s == nullptr)
        return;
    inside(h, s, 4);
    inside(h, s, 4 + static_cast<size_t>(dmiStringLength(s)));
    char* copy = NewCString(s);
    if (copy != nullptr && strlen(copy) > dmiStringLength(s))
        abort();
    SLDeleteString(copy);
}

void value(SLHandle* h, const void* p)
{
    inside(h, p, 4);
}

void walk(SLHandle* h)
{
    const uint32_t indices[] = {0, 1, 2, 7, 255, 0x10000, 0x7FFFFFFF, 0xFFFFFFFF};
    sink = SLCnfCount(h) + SLCnfStatus(h) + SLIndicationType(h) + SLIndicationComponentId(h);
    sink = SLInstallComponentId(h) + SLRegisterHandle(h) + SLComponentId(h) + SLComponentMatchType(h);
    sink = SLComponentGroupCount(h) + SLComponentFileCount(h) + SLUnsignedValue(h) + SLIntegerValue(h);
    string(h, SLDmiSpecificationLevel(h));
    string(h, SLImplementationDescription(h));
    string(h, SLComponentName(h));
    string(h, SLDescription(h));
    string(h, SLStringPtr(h));
    value(h, SLAttributePtr(h));
    sink = SLEventClassCount(h);
    for (uint32_t i : indices) {
        sink = SLComponentGroupId(h, i) + SLComponentFileType(h, i) + SLGroupId(h, i) + SLAttributeId(h, i);
        sink = SLAttributeAccess(h, i) + SLAttributeType(h, i) + SLAttributeMaxSize(h, i) +
               SLEnumerationListCount(h, i) + SLEventComponentId(h, i) + SLEventRowCount(h, i);
        string(h, SLComponentGroupName(h, i));
        inside(h, SLComponentFileData(h, i), 1); // data of unknown length: its first byte
        string(h, SLGroupName(h, i));
        string(h, SLGroupClassName(h, i));
        string(h, SLAttributeName(h, i));
        string(h, SLEventClassString(h, i));
        for (uint32_t j : {0u, 1u, 0xFFFFFFFFu}) {
            sink = static_cast<uint32_t>(SLEnumerationValue(h, i, j));
            string(h, SLEnumerationName(h, i, j));
        }
    }
    // Rows: of the confirm itself, or of each selected event class and row.
    for (uint32_t c : {0u, 1u, 3u}) {
        for (uint32_t r : {0u, 1u, 2u, 0xFFFFFFFFu}) {
            if (SLIndicationType(h) == 1)
                SLEventSelectRowCnf(h, c, r);
            sink = SLRowGroupId(h) + SLRowAttributeCount(h);
            for (uint32_t i : indices) {
                sink = SLRowAttributeId(h, i) + SLRowAttributeType(h, i) + SLRowUnsignedValue(h, i);
                sink = static_cast<uint32_t>(SLRowIntegerValue(h, i));
                value(h, SLRowAttributePtr(h, i));
                string(h, SLRowStringPtr(h, i));
            }
            SLKeyList* keys = SLCreateKeyList(h);
            SLDeleteKeyList(keys);
            if (SLIndicationType(h) != 1)
                return;
        }
    }
}

int initialise()
{
    SLInitialize();
    return 0;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    if (size < headerBytes)
        return 0;
    // The confirm buffer is exactly as long as the data (at least the minimum).
    SLHandle* h = SLCreateHandle(static_cast<unsigned>(size - headerBytes));
    if (h == nullptr)
        return 0;
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memcpy(h->command, data, headerBytes);
    std::memset(h->confirm, 0, h->confirmSize);
    std::memcpy(h->confirm, data + headerBytes, size - headerBytes);
    walk(h);
    SLDestroyHandle(h);
    return 0;
}
