// An in-process DMI provider for the SL tests: it keeps a copy of every
// command block it is handed and answers as the script says, confirming
// before DmiInvoke returns (the library must cope with either order).
#pragma once

#include <atomic>
#include <cstring>
#include <deque>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "base/sleep.h"
#include "sl/sl.h"

struct Reply {
    Reply(uint32_t i = 0, uint32_t s = 0, bool c = true, std::function<void(uint8_t*)> f = nullptr)
        : invoke(i), status(s), confirm(c), fill(std::move(f)) {}
    uint32_t invoke;  // what DmiInvoke returns: 0 accepted, 529 busy, else refused
    uint32_t status;  // confirm status (word 11)
    bool confirm;     // false: accepted and never confirmed
    std::function<void(uint8_t* confirm)> fill;
};

// Writes a DMI string at `offset`; returns the offset behind it.
inline uint32_t putString(uint8_t* base, uint32_t offset, const std::string& text)
{
    storeWord(base + offset, static_cast<uint32_t>(text.size()));
    std::memcpy(base + offset + 4, text.data(), text.size());
    return offset + 4 + static_cast<uint32_t>(text.size());
}

struct ScriptedProvider {
    std::deque<Reply> queue;                          // used first, in order
    std::function<Reply(const uint8_t*)> responder;   // then this; else accept
    std::vector<std::vector<uint8_t>> blocks;
    std::atomic<int> received{0};
    std::vector<unsigned> sleeps;
    bool cleaned = false;

    ScriptedProvider()
    {
        current() = this;
        moxSetSleepHook([](unsigned ms) { current()->sleeps.push_back(ms); });
        SLInitialize();
        SLDmiInvoke = &invoke;
    }
    ~ScriptedProvider()
    {
        cleanup();
        SLInitialize(); // leave the library usable, with no provider
        SLDmiInvoke = nullptr;
        moxSetSleepHook(nullptr);
        current() = nullptr;
    }
    void cleanup()
    {
        if (!cleaned)
            SLCleanup();
        cleaned = true;
    }
    uint32_t word(size_t block, uint32_t index) const { return loadWordAt(blocks.at(block).data(), index); }
    static ScriptedProvider*& current()
    {
        static ScriptedProvider* provider = nullptr;
        return provider;
    }
    static uint32_t invoke(void* commandBlock)
    {
        ScriptedProvider& p = *current();
        auto* block = static_cast<uint8_t*>(commandBlock);
        p.blocks.emplace_back(block, block + SL_COMMAND_SIZE);
        ++p.received;
        Reply reply;
        if (!p.queue.empty()) {
            reply = p.queue.front();
            p.queue.pop_front();
        } else if (p.responder) {
            reply = p.responder(block);
        }
        if (reply.invoke != 0 || !reply.confirm)
            return reply.invoke;
        if (reply.fill)
            reply.fill(static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8))));
        storeWordAt(block, 11, reply.status);
        if (loadWordAt(block, 1) < 1024)
            dmiConfirmFunc(block);
        return 0;
    }
};
