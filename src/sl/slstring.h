// SL strings: tracked heap blocks that SLCleanup can release all at once.
#pragma once

#include "sl/sltypes.h"

extern "C" {
// A new tracked block of max(size, 4) uninitialised data bytes; null when
// memory is exhausted. The caller deletes it with SLDeleteString.
void* SLCreateString(unsigned size);
void SLDeleteString(void* data);
int SLStringInitialize(void);
int SLStringCleanup(void);
// The characters of `s` and a terminator in a new SL string; null for a null
// `s` or when memory is exhausted. Caller deletes it with SLDeleteString.
char* NewCString(const DmiString* s);
// A DMI string of `s` in a new SL string of strlen(s) + 5 bytes; null for a
// null `s` or when memory is exhausted. Caller deletes it with SLDeleteString.
DmiString* NewDmiString(const char* s);
}

// Number of tracked blocks alive (handles included); for leak checks.
unsigned slLiveStringCount();
