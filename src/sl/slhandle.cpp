#include "sl/slhandle.h"

#include <atomic>
#include <cstring>
#include <new>
#include <pthread.h>

#include "base/threadcheck.h"
#include "sl/slstring.h"

namespace {

constexpr uint32_t handleOverhead = offsetof(SLHandle, confirm);
// Largest confirm buffer a handle may have, so that the block size cannot wrap.
constexpr uint32_t maxConfirmSize = 0x7FFFFFFFu - handleOverhead;

SLHandleListHead slHandleList; // every handle, from creation until it is moved or destroyed

pthread_mutex_t protectHandle_mutex = PTHREAD_MUTEX_INITIALIZER; // link lock, all handle lists
pthread_mutex_t protectList_mutex = PTHREAD_MUTEX_INITIALIZER;   // held by SLDestroyAllHandles

// The head's next link is read without a lock by the event worker; the final
// store of an append publishes the new node.
SLHandle* loadNext(SLHandle* node)
{
    return std::atomic_ref<SLHandle*>(node->next).load(std::memory_order_acquire);
}

void appendLocked(SLHandle* head, SLHandle* node)
{
    SLHandle* tail = head->prev;
    node->prev = tail;
    node->next = tail->next;
    head->prev = node;
    // Everything written into the node so far is seen by a lock-free reader
    // that finds it through the head.
    MOX_PUBLISH(head);
    std::atomic_ref<SLHandle*>(tail->next).store(node, std::memory_order_release);
}

} // namespace

SLHandleListHead::SLHandleListHead()
    : head_(std::launder(new (storage_) SLHandle))
{
    head_->next = head_;
    head_->prev = head_;
    MOX_ATOMIC_WORD(&head_->next);
    head_->pending = 0;
    head_->confirmSize = SL_MIN_CONFIRM_SIZE;
}

void slInitHandleList(SLHandle* head)
{
    head->next = head;
    head->prev = head;
    MOX_ATOMIC_WORD(&head->next);
}

unsigned slHandleListLength(SLHandle* head)
{
    unsigned count = 0;
    pthread_mutex_lock(&protectHandle_mutex);
    for (SLHandle* h = head->next; h != head; h = h->next)
        ++count;
    pthread_mutex_unlock(&protectHandle_mutex);
    return count;
}

extern "C" SLHandle* SLCreateHandle(unsigned confirmSize)
{
    if (confirmSize < SL_MIN_CONFIRM_SIZE)
        confirmSize = SL_MIN_CONFIRM_SIZE;
    if (confirmSize > maxConfirmSize)
        return nullptr;
    void* data = SLCreateString(handleOverhead + confirmSize);
    if (data == nullptr)
        return nullptr;
    auto* h = std::launder(new (data) SLHandle);
    h->next = h;
    h->prev = h;
    h->confirmSize = confirmSize;
    pthread_mutex_lock(&protectHandle_mutex);
    appendLocked(slHandleList.get(), h);
    pthread_mutex_unlock(&protectHandle_mutex);
    return h;
}

extern "C" SLHandle* SLDupHandle(SLHandle* h)
{
    if (h == nullptr)
        return nullptr;
    SLHandle* copy = SLCreateHandle(h->confirmSize);
    if (copy == nullptr)
        return nullptr;
    std::memcpy(copy->command, h->command, SL_COMMAND_SIZE);
    std::memcpy(copy->confirm, h->confirm, h->confirmSize);
    return copy;
}

extern "C" void SLDestroyHandle(SLHandle* h)
{
    if (h == nullptr)
        return;
    SLUnlinkHandle(h);
    SLDeleteString(h);
}

extern "C" int SLUnlinkHandle(SLHandle* h)
{
    int rc = pthread_mutex_lock(&protectHandle_mutex);
    if (h->next != h) {
        h->prev->next = h->next;
        h->next->prev = h->prev;
        h->next = h;
        h->prev = h;
    }
    rc = pthread_mutex_unlock(&protectHandle_mutex);
    return rc;
}

extern "C" int SLEnqueueHandle(SLHandle* head, SLHandle* h)
{
    pthread_mutex_lock(&protectHandle_mutex);
    appendLocked(head, h);
    return pthread_mutex_unlock(&protectHandle_mutex);
}

extern "C" SLHandle* SLHeadHandle(SLHandle* head)
{
    SLHandle* first = loadNext(head);
    if (first == head)
        return nullptr;
    MOX_RECEIVE(head);
    return first;
}

extern "C" int SLDestroyAllHandles(SLHandle* head)
{
    pthread_mutex_lock(&protectList_mutex);
    while (SLHandle* h = SLHeadHandle(head))
        SLDestroyHandle(h);
    return pthread_mutex_unlock(&protectList_mutex);
}

extern "C" int SLHandleInitialize(void)
{
    slInitHandleList(slHandleList.get());
    pthread_mutex_init(&protectList_mutex, nullptr);
    return pthread_mutex_init(&protectHandle_mutex, nullptr);
}

extern "C" int SLHandleCleanup(void)
{
    SLDestroyAllHandles(slHandleList.get());
    pthread_mutex_destroy(&protectList_mutex);
    return pthread_mutex_destroy(&protectHandle_mutex);
}

extern "C" void* SLCommandBuffer(SLHandle* h)
{
    return h->command;
}

extern "C" void* SLConfirmBuffer(SLHandle* h)
{
    return h->confirm;
}
