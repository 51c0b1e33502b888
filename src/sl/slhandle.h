// SL handles and handle lists.
#pragma once

#include "sl/sltypes.h"

extern "C" {
// A new handle with a confirm buffer of max(confirmSize, 8192) bytes, on the
// handle module's list; null when memory is exhausted. The command block,
// pending word and confirm buffer are not initialised.
SLHandle* SLCreateHandle(unsigned confirmSize);
// A copy of `h` (command block and confirm buffer) on the handle module's
// list; null for a null `h` or when memory is exhausted.
SLHandle* SLDupHandle(SLHandle* h);
// Unlinks `h` from its list and frees it; null does nothing.
void SLDestroyHandle(SLHandle* h);
int SLUnlinkHandle(SLHandle* h);
// Appends `h`, which must be on no list, at the tail of the list `head`.
int SLEnqueueHandle(SLHandle* head, SLHandle* h);
// The first handle of the list without removing it; null when empty.
SLHandle* SLHeadHandle(SLHandle* head);
int SLDestroyAllHandles(SLHandle* head);
int SLHandleInitialize(void);
int SLHandleCleanup(void);
void* SLCommandBuffer(SLHandle* h);
void* SLConfirmBuffer(SLHandle* h);
}

// Makes `head` an empty list. `head` is a complete handle record whose links
// alone are used.
void slInitHandleList(SLHandle* head);
// Number of handles on the list `head`; for leak checks and tests.
unsigned slHandleListLength(SLHandle* head);

// Storage for a list head: a complete handle record with the minimum confirm
// buffer, of which only the links are used. Starts as an empty list.
class SLHandleListHead {
public:
    SLHandleListHead();
    SLHandle* get() { return head_; }

private:
    alignas(SLHandle) unsigned char storage_[sizeof(SLHandle) + SL_MIN_CONFIRM_SIZE];
    SLHandle* head_;
};
