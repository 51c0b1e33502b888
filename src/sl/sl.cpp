#include "sl/sl.h"

#include <atomic>
#include <cstdint>
#include <cstring>
#include <initializer_list>
#include <pthread.h>
#include <sched.h>

#include "base/sleep.h"
#include "base/threadcheck.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

SLInvokeFunction SLDmiInvoke = nullptr;
std::atomic<int> SLLibDownFlag{0};

namespace {

pthread_mutex_t Dmi_Mutex1 = PTHREAD_MUTEX_INITIALIZER; // held for the whole of every command
std::atomic<uint32_t> iMgmtHandle{0};
std::atomic<uint32_t> iCmdHandle{0};
std::atomic<int> cleanup{0};
// Commands inside SLSynchronousExecute, running or waiting for Dmi_Mutex1.
std::atomic<int> commandsInside{0};

// Command codes.
enum : uint32_t {
    cmdRegisterMgmt = 256,
    cmdUnregisterMgmt = 257,
    cmdCancel = 258,
    cmdListComponent = 512,
    cmdListFirstComponent = 513,
    cmdListNextComponent = 514,
    cmdListComponentDesc = 515,
    cmdListGroup = 516,
    cmdListFirstGroup = 517,
    cmdListNextGroup = 518,
    cmdListGroupDesc = 519,
    cmdListAttribute = 520,
    cmdListFirstAttribute = 521,
    cmdListNextAttribute = 522,
    cmdListAttributeDesc = 523,
    cmdGetAttribute = 768,
    cmdSetAttribute = 769,
    cmdReserveAttribute = 770,
    cmdReleaseAttribute = 771,
    cmdGetRow = 772,
    cmdGetFirstRow = 773,
    cmdGetNextRow = 774,
    cmdRegisterCi = 1024,
    cmdUnregisterCi = 1025,
    cmdCiInstallData = 1026,
    cmdCiUninstallData = 1027,
};

constexpr uint32_t statusBusy = 529;
constexpr uint32_t statusAbandoned = 522;
constexpr unsigned busySleepMs = 5000;

// Where the parameters of the commands that carry text, keys or values start.
constexpr uint32_t stringOffset = 80;  // a DMI string: its count in word 20
constexpr uint32_t textOffset = 84;    // its characters
constexpr uint32_t getKeysOffset = 84; // keys of get-attribute and the row commands
constexpr uint32_t setKeysOffset = 88; // keys of set, reserve and release

void word(SLHandle* h, uint32_t index, uint32_t value)
{
    storeWordAt(h->command, index, value);
}

uint32_t readWord(SLHandle* h, uint32_t index)
{
    return loadWordAt(h->command, index);
}

std::atomic_ref<uint32_t> pendingWord(SLHandle* h)
{
    return std::atomic_ref<uint32_t>(h->pending);
}

// The component-interface commands complete when DmiInvoke returns.
bool completesAtOnce(uint32_t code)
{
    return code >= cmdRegisterCi && code <= cmdCiUninstallData;
}

// Encodes the first list of `keys` at offset `start` of the command block:
// one entry (id, type, value offset) per key, then the values back to back.
// Returns the offset after the last value, or 0 when the list has more keys
// than a list can hold or the encoding would not fit the command block; then
// nothing has been written.
uint32_t buildDmiKeyList(SLHandle* h, const SLKeyList* keys, uint32_t start)
{
    uint32_t n = keys->count;
    if (n > SL_MAX_KEYS)
        return 0;
    uint64_t end = start + 12ull * n;
    for (uint32_t i = 0; i < n; ++i)
        end += SLAttributeSize(static_cast<int>(keys->keys[i].type), keys->keys[i].value);
    if (end > SL_COMMAND_SIZE)
        return 0;

    uint32_t running = start + 12 * n;
    for (uint32_t i = 0; i < n; ++i) {
        const SLKeyEntry& key = keys->keys[i];
        uint32_t entry = start + 12 * i;
        storeWord(h->command + entry, key.attributeId);
        storeWord(h->command + entry + 4, key.type);
        storeWord(h->command + entry + 8, running);
        unsigned size = SLAttributeSize(static_cast<int>(key.type), key.value);
        // Values behind a string key are unaligned: copied byte-wise.
        if (key.value != nullptr)
            std::memcpy(h->command + running, key.value, size);
        running += size;
    }
    return running;
}

// Copies `text` as a DMI string at offset 80 (count in word 20, characters
// from 84). False, with nothing written, when it does not fit; `terminator`
// also copies the zero byte.
bool putText(SLHandle* h, const char* text, bool terminator)
{
    size_t length = std::strlen(text);
    if (length + (terminator ? 1 : 0) > SL_COMMAND_SIZE - textOffset)
        return false;
    word(h, 20, static_cast<uint32_t>(length));
    std::memcpy(h->command + textOffset, text, length + (terminator ? 1 : 0));
    return true;
}

int listComponentFunc(SLHandle* h, uint32_t code, const char* filter, uint32_t component)
{
    if (h == nullptr)
        return 1;
    if (filter != nullptr && !putText(h, filter, false))
        return 1;
    word(h, 1, code);
    word(h, 16, component);
    word(h, 17, filter != nullptr ? stringOffset : 0);
    word(h, 18, 0);
    return SLSynchronousExecute(h);
}

// Commands whose parameters are words 16, 17, ... only.
int wordsCommand(SLHandle* h, uint32_t code, std::initializer_list<uint32_t> parameters)
{
    if (h == nullptr)
        return 1;
    word(h, 1, code);
    uint32_t index = 16;
    for (uint32_t value : parameters)
        word(h, index++, value);
    return SLSynchronousExecute(h);
}

// Get-attribute and the row commands: keys at 84.
int getFunc(SLHandle* h, uint32_t code, uint32_t component, uint32_t group, uint32_t attribute,
            const SLKeyList* keys)
{
    if (h == nullptr)
        return 1;
    if (keys != nullptr) {
        if (buildDmiKeyList(h, keys, getKeysOffset) == 0)
            return 1;
        word(h, 18, keys->count);
        word(h, 19, getKeysOffset);
    } else {
        word(h, 18, 0);
        word(h, 19, 0);
    }
    word(h, 1, code);
    word(h, 16, component);
    word(h, 17, group);
    word(h, 20, attribute);
    return SLSynchronousExecute(h);
}

// Set, reserve and release: keys at 88, the value behind them, its offset in
// word 21.
int setAttributeFunc(SLHandle* h, uint32_t code, uint32_t component, uint32_t group, uint32_t attribute,
                     const SLKeyList* keys, unsigned size, const void* value)
{
    if (h == nullptr || (size != 0 && value == nullptr))
        return 1;
    uint32_t valueOffset = setKeysOffset;
    if (keys != nullptr) {
        valueOffset = buildDmiKeyList(h, keys, setKeysOffset);
        if (valueOffset == 0)
            return 1;
    }
    if (static_cast<uint64_t>(valueOffset) + size > SL_COMMAND_SIZE)
        return 1;
    word(h, 1, code);
    word(h, 16, component);
    word(h, 17, group);
    word(h, 18, keys != nullptr ? keys->count : 0);
    word(h, 19, keys != nullptr ? setKeysOffset : 0);
    word(h, 20, attribute);
    word(h, 21, valueOffset);
    if (size != 0)
        std::memcpy(h->command + valueOffset, value, size);
    return SLSynchronousExecute(h);
}

} // namespace

extern "C" {

int SLInitialize(void)
{
    SLStringInitialize();
    SLHandleInitialize();
    SLEventInitialize();
    iMgmtHandle = 0;
    iCmdHandle = 0;
    cleanup = 0;
    int rc = pthread_mutex_init(&Dmi_Mutex1, nullptr);
    SLDmiInvoke = DmiInvoke;
    return rc;
}

void SLAbandonCommands(void)
{
    cleanup = 1;
}

int SLCleanup(void)
{
    // An indication the provider is still delivering finishes first.
    slEventQuiesce();
    cleanup = 1;
    // A command still in progress ends its wait on the flag; let it, and every
    // command queued behind it on the mutex, leave before their handles are
    // freed and the mutex is destroyed.
    while (commandsInside.load() != 0)
        sched_yield();
    pthread_mutex_lock(&Dmi_Mutex1);
    pthread_mutex_unlock(&Dmi_Mutex1);
    SLHandleCleanup();
    SLStringCleanup();
    SLEventCleanup();
    return pthread_mutex_destroy(&Dmi_Mutex1);
}

namespace {

int synchronousExecute(SLHandle* h)
{
    SLInvokeFunction invoke = SLDmiInvoke;
    if (invoke == nullptr || h == nullptr)
        return 1;
    pendingWord(h).store(1);

    uint32_t code = readWord(h, 1);
    word(h, 0, SL_LEVEL_CHECK);
    word(h, 2, SL_COMMAND_SIZE);
    word(h, 3, (code == cmdCiInstallData || code == cmdCiUninstallData) ? 0 : iMgmtHandle.load());
    word(h, 5, 0);
    word(h, 6, 0);
    word(h, 7, h->confirmSize);
    word(h, 8, pointerWord(h->confirm));
    word(h, 9, 1);
    word(h, 10, 0);
    word(h, 11, 0);
    // A cancel names the command last issued from this handle.
    if (code != cmdCancel)
        word(h, 4, iCmdHandle.fetch_add(1));

    pthread_mutex_lock(&Dmi_Mutex1);
    if (cleanup.load() != 0) {
        // Cleanup has begun: a command that waited for the lock is not sent,
        // since its confirm could arrive after its handle was freed.
        word(h, 11, statusAbandoned);
        pthread_mutex_unlock(&Dmi_Mutex1);
        return 1;
    }
    uint32_t result = invoke(h->command);
    if (result == statusBusy) {
        moxSleepMs(busySleepMs);
        result = invoke(h->command);
        if (result == statusBusy)
            moxSleepMs(busySleepMs);
    }
    if (result != 0) {
        pthread_mutex_unlock(&Dmi_Mutex1);
        return 1;
    }
    if (!completesAtOnce(code)) {
        while (pendingWord(h).load() == 1 && cleanup.load() == 0)
            sched_yield();
        MOX_RECEIVE(h); // the provider's confirm precedes the pending word
        if (pendingWord(h).load() == 1)
            word(h, 11, statusAbandoned);
    }
    uint32_t status = readWord(h, 11);
    pthread_mutex_unlock(&Dmi_Mutex1);
    return (status == 0 || status == 1) ? 0 : 1;
}

} // namespace

int SLSynchronousExecute(SLHandle* h)
{
    ++commandsInside;
    int rc = synchronousExecute(h);
    --commandsInside;
    return rc;
}

void* dmiConfirmFunc(void* commandBlock)
{
    // The command block is the start of its handle.
    if (commandBlock != nullptr) {
        MOX_PUBLISH(commandBlock);
        pendingWord(static_cast<SLHandle*>(commandBlock)).store(0);
    }
    return commandBlock;
}

int SLDmiRegisterMgmt(SLHandle* h, SLIndicationHandler handler)
{
    if (h == nullptr)
        return 1;
    word(h, 1, cmdRegisterMgmt);
    word(h, 16, pointerWord(reinterpret_cast<void*>(&dmiConfirmFunc)));
    // A process without a handler asks for no indications: it names no
    // indication callback, so the provider knows it serves no events.
    word(h, 17, handler != nullptr ? pointerWord(reinterpret_cast<void*>(&SLIndicationFunc)) : 0);
    // In place before the provider can deliver the first indication.
    SLEventSetHandler(handler);
    if (SLSynchronousExecute(h) != 0) {
        SLEventSetHandler(nullptr);
        return 1;
    }
    iMgmtHandle = loadWordAt(h->confirm, 2);
    return 0;
}

int SLDmiUnregisterMgmt(SLHandle* h)
{
    SLEventSetHandler(nullptr);
    return wordsCommand(h, cmdUnregisterMgmt, {});
}

int SLCancel(SLHandle* h)
{
    return wordsCommand(h, cmdCancel, {});
}

int SLListComponent(SLHandle* h, const char* filter, uint32_t component)
{
    return listComponentFunc(h, cmdListComponent, filter, component);
}

int SLListFirstComponent(SLHandle* h, const char* filter)
{
    return listComponentFunc(h, cmdListFirstComponent, filter, 0);
}

int SLListNextComponent(SLHandle* h, const char* filter, uint32_t component)
{
    return listComponentFunc(h, cmdListNextComponent, filter, component);
}

int SLListComponentDesc(SLHandle* h, uint32_t component)
{
    if (h != nullptr)
        word(h, 19, 0);
    return wordsCommand(h, cmdListComponentDesc, {component});
}

int SLListGroup(SLHandle* h, uint32_t component, uint32_t group)
{
    return wordsCommand(h, cmdListGroup, {component, group});
}

int SLListFirstGroup(SLHandle* h, uint32_t component)
{
    return wordsCommand(h, cmdListFirstGroup, {component});
}

int SLListNextGroup(SLHandle* h, uint32_t component, uint32_t group)
{
    return wordsCommand(h, cmdListNextGroup, {component, group});
}

int SLListGroupDesc(SLHandle* h, uint32_t component, uint32_t group)
{
    if (h != nullptr)
        word(h, 19, 0);
    return wordsCommand(h, cmdListGroupDesc, {component, group});
}

int SLListAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute)
{
    return wordsCommand(h, cmdListAttribute, {component, group, attribute});
}

int SLListFirstAttribute(SLHandle* h, uint32_t component, uint32_t group)
{
    return wordsCommand(h, cmdListFirstAttribute, {component, group});
}

int SLListNextAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute)
{
    return wordsCommand(h, cmdListNextAttribute, {component, group, attribute});
}

int SLListAttributeDesc(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute)
{
    return wordsCommand(h, cmdListAttributeDesc, {component, group, attribute, 0});
}

int SLGetAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys)
{
    return getFunc(h, cmdGetAttribute, component, group, attribute, keys);
}

int SLSetAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys,
                   unsigned size, const void* value)
{
    return setAttributeFunc(h, cmdSetAttribute, component, group, attribute, keys, size, value);
}

int SLReserveAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys)
{
    return setAttributeFunc(h, cmdReserveAttribute, component, group, attribute, keys, 0, nullptr);
}

int SLReleaseAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys)
{
    return setAttributeFunc(h, cmdReleaseAttribute, component, group, attribute, keys, 0, nullptr);
}

int SLGetRow(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys)
{
    return getFunc(h, cmdGetRow, component, group, attribute, keys);
}

int SLGetFirstRow(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys)
{
    return getFunc(h, cmdGetFirstRow, component, group, attribute, keys);
}

int SLGetNextRow(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys)
{
    return getFunc(h, keys != nullptr ? cmdGetNextRow : cmdGetFirstRow, component, group, attribute, keys);
}

int SLRegisterCi(SLHandle* h, uint32_t a, uint32_t b, uint32_t c, uint32_t n, const uint32_t* pairs)
{
    // The pairs fill words 20 onward: at most (4096 - 80) / 8 of them.
    if (h == nullptr || n > (SL_COMMAND_SIZE - stringOffset) / 8 || (n != 0 && pairs == nullptr))
        return 1;
    for (uint32_t i = 0; i < 2 * n; ++i)
        word(h, 20 + i, pairs[i]);
    return wordsCommand(h, cmdRegisterCi, {a, b, c, n});
}

int SLUnregisterCi(SLHandle* h, uint32_t x)
{
    return wordsCommand(h, cmdUnregisterCi, {x});
}

int SLCiInstallData(SLHandle* h, uint32_t component, const char* path)
{
    if (h == nullptr || path == nullptr || !putText(h, path, true))
        return 1;
    return wordsCommand(h, cmdCiInstallData, {component, 1, 2, stringOffset});
}

int SLCiUninstallData(SLHandle* h, uint32_t component)
{
    return wordsCommand(h, cmdCiUninstallData, {component});
}

unsigned SLAttributeSize(int type, const void* value)
{
    switch (type) {
    case DMI_COUNTER:
    case DMI_GAUGE:
    case DMI_INTEGER:
        return 4;
    case DMI_COUNTER64:
    case DMI_INTEGER64:
        return 8;
    case DMI_OCTETSTRING:
    case DMI_DISPLAYSTRING: {
        if (value == nullptr)
            return 0;
        uint32_t count = loadWord(value);
        // A count that would wrap the size saturates, so that every bounds
        // check against it fails.
        return count > UINT32_MAX - 4 ? UINT32_MAX : 4 + count;
    }
    case DMI_DATE:
        return 28;
    default:
        return 0;
    }
}

} // extern "C"
