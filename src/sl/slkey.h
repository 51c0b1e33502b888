// SL key lists: free-standing copies of the keys that name one table row.
#pragma once

#include "sl/sltypes.h"

extern "C" {
int SLKeyCount(SLHandle* h);
int SLKeyListOffset(SLHandle* h);
// A new key list with copies of the keys of the handle's group entry 0 or
// row; null when there are no keys, more than 10, or memory runs out. The
// caller deletes it with SLDeleteKeyList.
SLKeyList* SLCreateKeyList(SLHandle* h);
// Deletes the chain behind `k`, the value copies and `k`; null does nothing.
void SLDeleteKeyList(SLKeyList* k);
// 1 when equal, else 0.
int SLCompareKeyLists(SLKeyList* a, SLKeyList* b);
void SLIndicateDown(void);
}
