// DMI attribute values as text for people, and text back into values.
//
// Text results go into the caller's buffer of `len` bytes (terminator
// included): at most len - 1 characters, always followed by a NUL. A len below
// 1 writes nothing.
#pragma once

#include <cstdint>

#include "sl/sltypes.h"

// The value as text; the number of characters written, or 0 when the
// no-value text (eight blanks) or "Unsupported" was written.
int GetPureValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 char* buffer, int len);
// Sets the attribute from `value`: a NUL-terminated text for integers and
// strings, a 28-byte DMI date for dates. 1 on success, 0 on failure.
int SetPureValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 const char* value);

int getIntegerValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                    char* buffer, int len);
int getStringValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                   char* buffer, int len);
int getDateValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 char* buffer, int len);
int setIntegerValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                    const char* value);
int setStringValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                   const char* value);
int setDateValue(SLHandle* h, uint32_t componentId, uint32_t groupId, uint32_t attributeId, SLKeyList* keys,
                 const char* value);

// A DMI date (28 bytes, yyyymmddHHMMSS.uuuuuu+ooo) as
// "YYYY-MM-DD at HH:MM:SS (sOOO)"; `output` needs 30 bytes. A field cut short
// by a NUL in the date ends the text there. Returns `output`.
char* formatDmiDate(const char* date, char* output);
// The no-value text (eight blanks) and "Unsupported", cut to len - 1; 0.
int noValue(char* buffer, int len);
int unsupported(char* buffer, int len);
int32_t min(int32_t a, int32_t b);

// The no-value text, which callers compare a result buffer with.
extern const char moxNoValueText[];
