#include "sl/slstring.h"

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <pthread.h>

namespace {

// Header of a tracked block; the caller's data follows `self`, so the block is
// found again from a data pointer.
struct Block {
    Block* next;
    Block* prev;
    Block* self;
};
static_assert(sizeof(Block) == 12);

// Head of the circular list of every live block. Its data area is never used.
struct {
    Block block;
    unsigned char data[4];
} stringListHead = {{&stringListHead.block, &stringListHead.block, &stringListHead.block}, {}};
Block* const stringList = &stringListHead.block;

pthread_mutex_t protectHandle_mutex = PTHREAD_MUTEX_INITIALIZER; // link lock
pthread_mutex_t protectList_mutex = PTHREAD_MUTEX_INITIALIZER;   // held by SLStringCleanup

constexpr unsigned maxStringSize = 0x7FFFFFFFu;

void* dataOf(Block* block)
{
    return reinterpret_cast<unsigned char*>(block) + sizeof(Block);
}

Block* blockOf(void* data)
{
    Block* self;
    std::memcpy(&self, static_cast<unsigned char*>(data) - sizeof(Block*), sizeof self);
    return self;
}

void append(Block* node)
{
    pthread_mutex_lock(&protectHandle_mutex);
    Block* tail = stringList->prev;
    node->prev = tail;
    node->next = tail->next;
    stringList->prev = node;
    std::atomic_ref<Block*>(tail->next).store(node, std::memory_order_release);
    pthread_mutex_unlock(&protectHandle_mutex);
}

void unlink(Block* node)
{
    pthread_mutex_lock(&protectHandle_mutex);
    if (node->next != node) {
        node->prev->next = node->next;
        node->next->prev = node->prev;
        node->next = node;
        node->prev = node;
    }
    pthread_mutex_unlock(&protectHandle_mutex);
}

} // namespace

extern "C" void* SLCreateString(unsigned size)
{
    if (size < 4)
        size = 4;
    if (size > maxStringSize)
        return nullptr;
    auto* block = static_cast<Block*>(std::malloc(size + sizeof(Block)));
    if (block == nullptr)
        return nullptr;
    block->next = block;
    block->prev = block;
    block->self = block;
    append(block);
    return dataOf(block);
}

extern "C" void SLDeleteString(void* data)
{
    if (data == nullptr)
        return;
    Block* block = blockOf(data);
    unlink(block);
    std::free(block);
}

extern "C" int SLStringInitialize(void)
{
    stringList->next = stringList;
    stringList->prev = stringList;
    pthread_mutex_init(&protectHandle_mutex, nullptr);
    return pthread_mutex_init(&protectList_mutex, nullptr);
}

extern "C" int SLStringCleanup(void)
{
    pthread_mutex_lock(&protectList_mutex);
    while (stringList->next != stringList)
        SLDeleteString(dataOf(stringList->next));
    pthread_mutex_unlock(&protectList_mutex);
    pthread_mutex_destroy(&protectHandle_mutex);
    return pthread_mutex_destroy(&protectList_mutex);
}

extern "C" char* NewCString(const DmiString* s)
{
    if (s == nullptr)
        return nullptr;
    uint32_t length = dmiStringLength(s);
    if (length >= maxStringSize)
        return nullptr;
    auto* text = static_cast<char*>(SLCreateString(length + 1));
    if (text == nullptr)
        return nullptr;
    std::memcpy(text, dmiStringText(s), length);
    text[length] = '\0';
    return text;
}

extern "C" DmiString* NewDmiString(const char* s)
{
    if (s == nullptr)
        return nullptr;
    size_t length = std::strlen(s);
    if (length > maxStringSize - 5)
        return nullptr;
    auto* block = static_cast<unsigned char*>(SLCreateString(static_cast<unsigned>(length + 5)));
    if (block == nullptr)
        return nullptr;
    storeWord(block, static_cast<uint32_t>(length));
    std::memcpy(block + 4, s, length);
    block[4 + length] = 0;
    return reinterpret_cast<DmiString*>(block);
}

unsigned slLiveStringCount()
{
    unsigned count = 0;
    pthread_mutex_lock(&protectHandle_mutex);
    for (Block* b = stringList->next; b != stringList; b = b->next)
        ++count;
    pthread_mutex_unlock(&protectHandle_mutex);
    return count;
}
