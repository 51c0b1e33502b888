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

volatile uint32_t sink;

void inside(SLHandle* h, const void* p, size_t n)
{
    if (p == nullptr)
        return;
    auto* begin = reinterpret_cast<const unsigned char*>(h->confirm);
    auto* at = static_cast<const unsigned char*>(p);
    if (at < begin || n > h->confirmSize || at - begin > static_cast<ptrdiff_t>(h->confirmSize - n))
        abort(); // an address outside the confirm buffer
    for (size_t i = 0; i < n; ++i)
        sink = sink + at[i];
}

void string(SLHandle* h, const DmiString* s)
{
    if (s != nullptr) {
        inside(h, s, 4);
        inside(h, s, 4 + static_cast<size_t>(dmiStringLength(s)));
    }
}

void walk(SLHandle* h)
{
    const uint32_t indices[] = {0, 1, 2, 7, 255, 0x10000, 0x7FFFFFFF, 0xFFFFFFFF};
    sink = SLCnfCount(h) + SLCnfStatus(h) + SLIndicationType(h) + SLIndicationComponentId(h) +
           SLInstallComponentId(h) + SLRegisterHandle(h) + SLComponentId(h) + SLComponentMatchType(h) +
           SLComponentGroupCount(h) + SLComponentFileCount(h) + SLUnsignedValue(h) + SLIntegerValue(h) +
           SLEventClassCount(h);
    for (const DmiString* s : {SLDmiSpecificationLevel(h), SLImplementationDescription(h), SLComponentName(h),
                               SLDescription(h), SLStringPtr(h)})
        string(h, s);
    inside(h, SLAttributePtr(h), 4);
    for (uint32_t i : indices) {
        sink = SLComponentGroupId(h, i) + SLComponentFileType(h, i) + SLGroupId(h, i) + SLAttributeId(h, i) +
               SLAttributeAccess(h, i) + SLAttributeType(h, i) + SLAttributeMaxSize(h, i) +
               SLEnumerationListCount(h, i) + SLEventComponentId(h, i) + SLEventRowCount(h, i);
        for (const DmiString* s : {SLComponentGroupName(h, i), SLGroupName(h, i), SLGroupClassName(h, i),
                                   SLAttributeName(h, i), SLEventClassString(h, i), SLEnumerationName(h, i, 0),
                                   SLEnumerationName(h, i, 1), SLEnumerationName(h, i, 0xFFFFFFFF)})
            string(h, s);
        inside(h, SLComponentFileData(h, i), 1); // data of unknown length: its first byte
        sink = static_cast<uint32_t>(SLEnumerationValue(h, i, 0)) +
               static_cast<uint32_t>(SLEnumerationValue(h, i, 0xFFFFFFFF));
    }
    // Rows: of the confirm itself, or of each selected event class and row.
    for (uint32_t c : {0u, 1u, 3u}) {
        for (uint32_t r : {0u, 1u, 2u, 0xFFFFFFFFu}) {
            if (SLIndicationType(h) == 1)
                SLEventSelectRowCnf(h, c, r);
            sink = SLRowGroupId(h) + SLRowAttributeCount(h);
            for (uint32_t i : indices) {
                sink = SLRowAttributeId(h, i) + SLRowAttributeType(h, i) + SLRowUnsignedValue(h, i) +
                       static_cast<uint32_t>(SLRowIntegerValue(h, i));
                inside(h, SLRowAttributePtr(h, i), 4);
                string(h, SLRowStringPtr(h, i));
            }
            SLDeleteKeyList(SLCreateKeyList(h));
            if (SLIndicationType(h) != 1)
                return;
        }
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = (SLInitialize(), 0);
    (void)once;
    constexpr size_t headerBytes = 68;
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
