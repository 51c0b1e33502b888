// A scripted DMI provider for the SL tests: it records every command block it
// receives and answers each one as the script says, completing it from a
// thread of its own as a real provider does.
#pragma once

#include <cstdint>
#include <cstring>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "sl/sltypes.h"

namespace sltest {

// The answer to one command.
struct Reply {
    uint32_t invokeResult = 0; // what DmiInvoke returns: 0 accepted, 529 busy, else refused
    uint32_t status = 0;       // confirm status (word 11)
    uint32_t count = 1;        // confirm entry count (word 10)
    bool confirm = true;       // call the confirm callback (commands other than 1024 to 1027)
    // Writes the confirm buffer; gets its address and size from words 8 and 7.
    std::function<void(uint8_t* confirm, uint32_t size)> fill;
};

// Writes records into a confirm buffer.
struct ConfirmWriter {
    uint8_t* base;
    uint32_t size;
    void word(uint32_t offset, uint32_t value) const { storeWord(base + offset, value); }
    uint32_t string(uint32_t offset, const std::string& text) const
    {
        word(offset, static_cast<uint32_t>(text.size()));
        std::memcpy(base + offset + 4, text.data(), text.size());
        return offset + 4 + static_cast<uint32_t>(text.size());
    }
};

class ScriptedProvider {
public:
    // Initialises the SL library and installs the provider as its entry point.
    ScriptedProvider();
    // Waits for outstanding completions and cleans the library up.
    ~ScriptedProvider();

    // Replies are used in order; when none is queued, `responder` answers
    // (default: accept with status 0 and an empty confirm).
    void push(Reply reply) { queue_.push_back(std::move(reply)); }
    std::function<Reply(const uint8_t* block)> responder;

    // Copies of the command blocks as they were handed over, in order.
    std::vector<std::vector<uint8_t>> blocks;
    uint32_t word(size_t command, uint32_t index) const { return loadWordAt(blocks.at(command).data(), index); }
    uint32_t code(size_t command) const { return word(command, 1); }

    // Cleans the library up now (the destructor then does not).
    void cleanupNow();
    // Joins the thread of the last completion.
    void joinCompletions();

    static uint32_t invoke(void* block);

private:
    uint32_t answer(uint8_t* block);

    std::vector<Reply> queue_;
    size_t next_ = 0;
    std::vector<std::thread> completions_;
    void* (*confirmCallback_)(void*) = nullptr;
    bool cleaned_ = false;
};

// The sleep requests the library made through the sleep hook since the
// provider was created.
std::vector<unsigned> sleepRequests();

} // namespace sltest
