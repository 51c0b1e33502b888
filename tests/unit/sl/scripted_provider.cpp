#include "scripted_provider.h"

#include "base/sleep.h"
#include "sl/sl.h"

namespace sltest {

namespace {

ScriptedProvider* current = nullptr;
std::mutex sleepLock;
std::vector<unsigned> sleeps;

void recordSleep(unsigned milliseconds)
{
    std::lock_guard<std::mutex> lock(sleepLock);
    sleeps.push_back(milliseconds);
}

} // namespace

std::vector<unsigned> sleepRequests()
{
    std::lock_guard<std::mutex> lock(sleepLock);
    return sleeps;
}

ScriptedProvider::ScriptedProvider()
{
    {
        std::lock_guard<std::mutex> lock(sleepLock);
        sleeps.clear();
    }
    moxSetSleepHook(recordSleep);
    SLInitialize();
    SLDmiInvoke = &ScriptedProvider::invoke;
    current = this;
}

ScriptedProvider::~ScriptedProvider()
{
    cleanupNow();
    // Leave the library usable for tests that do not bring a provider.
    SLInitialize();
    SLDmiInvoke = nullptr;
    moxSetSleepHook(nullptr);
    current = nullptr;
}

void ScriptedProvider::joinCompletions()
{
    for (std::thread& t : completions_)
        t.join();
    completions_.clear();
}

void ScriptedProvider::cleanupNow()
{
    if (cleaned_)
        return;
    cleaned_ = true;
    SLCleanup();
    joinCompletions();
}

uint32_t ScriptedProvider::invoke(void* block)
{
    return current->answer(static_cast<uint8_t*>(block));
}

uint32_t ScriptedProvider::answer(uint8_t* block)
{
    joinCompletions();
    blocks.emplace_back(block, block + SL_COMMAND_SIZE);
    uint32_t code = loadWordAt(block, 1);
    if (code == 256)
        confirmCallback_ = reinterpret_cast<void* (*)(void*)>(wordPointer(loadWordAt(block, 16)));

    Reply reply;
    if (next_ < queue_.size())
        reply = queue_[next_++];
    else if (responder)
        reply = responder(block);
    if (reply.invokeResult != 0)
        return reply.invokeResult;

    auto complete = [block, reply]() {
        auto* confirm = static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8)));
        uint32_t size = loadWordAt(block, 7);
        if (reply.fill)
            reply.fill(confirm, size);
        storeWordAt(block, 10, reply.count);
        storeWordAt(block, 11, reply.status);
    };
    if (code >= 1024 && code <= 1027) {
        complete(); // final when DmiInvoke returns
        return 0;
    }
    if (!reply.confirm)
        return 0;
    auto callback = confirmCallback_ != nullptr ? confirmCallback_ : &dmiConfirmFunc;
    completions_.emplace_back([block, complete, callback]() {
        complete();
        callback(block);
    });
    return 0;
}

} // namespace sltest
