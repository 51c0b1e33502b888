// What the SL tests share: the library's headers, DMI string helpers, and an
// in-process DMI provider that keeps a copy of every command block it is
// handed and answers as `responder` says, confirming before DmiInvoke returns.
#pragma once

#include <cstring>
#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "base/sleep.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

struct Reply {
    uint32_t invoke = 0;  // DmiInvoke's result: 0 accepted, 529 busy, else refused
    uint32_t status = 0;  // confirm status (word 11)
    bool confirm = true;  // false: accepted and never confirmed
    std::function<void(uint8_t* confirm)> fill = nullptr;
};

inline std::string text(const DmiString* s) { return s ? std::string(dmiStringText(s), dmiStringLength(s)) : "null"; }

// Writes a DMI string at `offset` of `base`.
inline void putString(uint8_t* base, uint32_t offset, const std::string& text)
{
    storeWord(base + offset, static_cast<uint32_t>(text.size()));
    std::memcpy(base + offset + 4, text.data(), text.size());
}

struct ScriptedProvider {
    static inline ScriptedProvider* provider = nullptr; // the one in use
    std::function<Reply(const uint8_t* block)> responder = [](const uint8_t*) { return Reply{}; };
    std::vector<std::vector<uint8_t>> blocks;
    std::vector<unsigned> sleeps; // requested through the sleep hook
    bool cleaned = false;

    ScriptedProvider()
    {
        provider = this;
        moxSetSleepHook([](unsigned ms) { provider->sleeps.push_back(ms); });
        SLInitialize();
        SLDmiInvoke = [](void* command) {
            auto* block = static_cast<uint8_t*>(command);
            provider->blocks.emplace_back(block, block + SL_COMMAND_SIZE);
            Reply reply = provider->responder(block);
            if (reply.invoke == 0 && reply.confirm && reply.fill)
                reply.fill(static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8))));
            storeWordAt(block, 11, reply.status);
            if (reply.invoke == 0 && reply.confirm && loadWordAt(block, 1) < 1024) // 1024-1027 are final at once
                dmiConfirmFunc(block);
            return reply.invoke;
        };
    }
    ~ScriptedProvider() { cleanup(), moxSetSleepHook(nullptr); }
    void cleanup() { cleaned = cleaned || (SLCleanup(), true); }
    uint32_t word(size_t block, uint32_t index) const { return loadWordAt(blocks.at(block).data(), index); }
};
