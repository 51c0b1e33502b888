// An in-process DMI provider for the SL tests: it keeps a copy of every
// command block it is handed and answers as `responder` says, confirming
// before DmiInvoke returns.
#pragma once

#include <atomic>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "base/sleep.h"
#include "sl/sl.h"

struct Reply {
    uint32_t invoke = 0;  // DmiInvoke's result: 0 accepted, 529 busy, else refused
    uint32_t status = 0;  // confirm status (word 11)
    bool confirm = true;  // false: accepted and never confirmed
    std::function<void(uint8_t* confirm)> fill = nullptr;
};

// Writes a DMI string at `offset` of `base`.
inline void putString(uint8_t* base, uint32_t offset, const std::string& text)
{
    storeWord(base + offset, static_cast<uint32_t>(text.size()));
    std::memcpy(base + offset + 4, text.data(), text.size());
}

struct ScriptedProvider {
    std::function<Reply(const uint8_t* block)> responder = [](const uint8_t*) { return Reply{}; };
    std::vector<std::vector<uint8_t>> blocks;
    std::atomic<int> received{0};
    std::vector<unsigned> sleeps; // requested through the sleep hook
    bool cleaned = false;

    static ScriptedProvider*& current()
    {
        static ScriptedProvider* provider = nullptr;
        return provider;
    }
    ScriptedProvider()
    {
        current() = this;
        moxSetSleepHook([](unsigned ms) { current()->sleeps.push_back(ms); });
        SLInitialize();
        SLDmiInvoke = [](void* command) {
            ScriptedProvider& p = *current();
            auto* block = static_cast<uint8_t*>(command);
            p.blocks.emplace_back(block, block + SL_COMMAND_SIZE);
            ++p.received;
            Reply reply = p.responder(block);
            if (reply.invoke != 0 || !reply.confirm)
                return reply.invoke;
            if (reply.fill)
                reply.fill(static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8))));
            storeWordAt(block, 11, reply.status);
            if (loadWordAt(block, 1) < 1024) // the component-interface commands are final at once
                dmiConfirmFunc(block);
            return 0u;
        };
    }
    ~ScriptedProvider()
    {
        cleanup();
        SLInitialize(); // leave the library usable, with no provider
        SLDmiInvoke = nullptr;
        moxSetSleepHook(nullptr);
    }
    void cleanup()
    {
        if (!cleaned)
            SLCleanup();
        cleaned = true;
    }
    uint32_t word(size_t block, uint32_t index) const { return loadWordAt(blocks.at(block).data(), index); }
};
