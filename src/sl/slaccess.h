// Accessors over confirm and indication records held in an SL handle.
//
// Offsets count from the handle's confirm buffer; an offset of 0 means absent.
// An offset or index that points outside the confirm buffer (or, in an
// indication handle, outside the indication's stated length) also reads as
// absent: null for addresses, 0 for words. A DMI string is returned only when
// its count and characters lie inside, so callers may read them in full.
#pragma once

#include "sl/sltypes.h"

extern "C" {
uint32_t SLCnfCount(SLHandle* h);
uint32_t SLCnfStatus(SLHandle* h);
uint32_t SLIndicationType(SLHandle* h);
uint32_t SLIndicationComponentId(SLHandle* h);
void* SLIndicationTimeStamp(SLHandle* h);
uint32_t SLInstallComponentId(SLHandle* h);
DmiString* SLDmiSpecificationLevel(SLHandle* h);
DmiString* SLImplementationDescription(SLHandle* h);
uint32_t SLRegisterHandle(SLHandle* h);

uint32_t SLComponentId(SLHandle* h);
uint32_t SLComponentMatchType(SLHandle* h);
DmiString* SLComponentName(SLHandle* h);
uint32_t SLComponentGroupCount(SLHandle* h);
uint32_t SLComponentGroupId(SLHandle* h, uint32_t i);
DmiString* SLComponentGroupName(SLHandle* h, uint32_t i);
uint32_t SLComponentFileCount(SLHandle* h);
uint32_t SLComponentFileType(SLHandle* h, uint32_t i);
void* SLComponentFileData(SLHandle* h, uint32_t i);

uint32_t SLGroupId(SLHandle* h, uint32_t i);
DmiString* SLGroupName(SLHandle* h, uint32_t i);
DmiString* SLGroupClassName(SLHandle* h, uint32_t i);

uint32_t SLAttributeId(SLHandle* h, uint32_t i);
DmiString* SLAttributeName(SLHandle* h, uint32_t i);
uint32_t SLAttributeAccess(SLHandle* h, uint32_t i);
uint32_t SLAttributeType(SLHandle* h, uint32_t i);
uint32_t SLAttributeMaxSize(SLHandle* h, uint32_t i);
uint32_t SLEnumerationListCount(SLHandle* h, uint32_t i);
int32_t SLEnumerationValue(SLHandle* h, uint32_t i, uint32_t j);
DmiString* SLEnumerationName(SLHandle* h, uint32_t i, uint32_t j);

DmiString* SLDescription(SLHandle* h);
void* SLAttributePtr(SLHandle* h);
uint32_t SLUnsignedValue(SLHandle* h);
int32_t SLIntegerValue(SLHandle* h);
DmiString* SLStringPtr(SLHandle* h);

uint32_t SLRowGroupId(SLHandle* h);
uint32_t SLRowAttributeCount(SLHandle* h);
uint32_t SLRowAttributeId(SLHandle* h, uint32_t i);
uint32_t SLRowAttributeType(SLHandle* h, uint32_t i);
void* SLRowAttributePtr(SLHandle* h, uint32_t i);
uint32_t SLRowUnsignedValue(SLHandle* h, uint32_t i);
int32_t SLRowIntegerValue(SLHandle* h, uint32_t i);
DmiString* SLRowStringPtr(SLHandle* h, uint32_t i);

uint32_t SLEventClassCount(SLHandle* h);
uint32_t SLEventComponentId(SLHandle* h, uint32_t c);
DmiString* SLEventClassString(SLHandle* h, uint32_t c);
// Class c's string when its count word lies inside the indication, whatever
// the count says (the class test reads only a prefix); null otherwise.
DmiString* SLEventClassStringUnchecked(SLHandle* h, uint32_t c);
uint32_t SLEventRowCount(SLHandle* h, uint32_t c);
void SLEventSelectRowCnf(SLHandle* h, uint32_t c, uint32_t r);
}

// The row record the row accessors read (the confirm's row, or the selected
// row of an event indication); null when it lies outside the buffer.
const uint8_t* pGetRow(SLHandle* h);
// The row's attribute count cut to the entries that lie inside the buffer:
// what a loop over the row's entries may run to (a hostile count would
// otherwise keep it going for billions of absent entries).
uint32_t slRowAttributesPresent(SLHandle* h);
// Address of `length` bytes at `offset` of the confirm buffer, or null when
// they do not lie inside it (for an indication: inside its stated length).
const uint8_t* slConfirmBytes(SLHandle* h, uint64_t offset, uint64_t length);
