// A minimal management application for the provider's tests: builds
// command blocks in SL handles as the daemon lays them out, sends them
// through DmiInvoke and waits for the confirm.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "dmisp/dmisp.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace dmisptest {

// Confirm callback: clears the pending word of the handle whose block it gets.
inline void* confirmCallback(void* block)
{
    __atomic_store_n(&static_cast<SLHandle*>(block)->pending, 0u, __ATOMIC_SEQ_CST);
    return block;
}

// Indications received by indicationCallback, as copies; the provider's
// copy is given back through its completion callback at once.
struct Received {
    std::mutex mu;
    std::vector<std::vector<uint8_t>> indications;
    std::atomic<bool> complete{true};
    std::vector<void*> kept; // indications not yet completed
};
inline Received& received()
{
    static Received r;
    return r;
}

inline void complete(void* indication);

inline void indicationCallback(void* indication)
{
    uint32_t length = loadWordAt(indication, 2);
    std::vector<uint8_t> copy(static_cast<uint8_t*>(indication), static_cast<uint8_t*>(indication) + length);
    {
        std::lock_guard<std::mutex> lock(received().mu);
        received().indications.push_back(copy);
    }
    if (!received().complete) {
        std::lock_guard<std::mutex> lock(received().mu);
        received().kept.push_back(indication);
        return;
    }
    complete(indication);
}

inline void complete(void* indication)
{
    uint32_t completion = loadWordAt(indication, 11);
    if (completion != 0)
        reinterpret_cast<void (*)(void*)>(static_cast<uintptr_t>(completion))(indication);
}

// An SL handle made from an indication copy, as the SL library makes it.
struct IndicationHandle {
    SLHandle* h;
    explicit IndicationHandle(const std::vector<uint8_t>& ind) : h(SLCreateHandle(static_cast<unsigned>(ind.size())))
    {
        std::memset(h->command, 0, SL_COMMAND_SIZE);
        std::memcpy(h->command, ind.data(), 52);
        std::memcpy(h->confirm, ind.data(), ind.size());
    }
    ~IndicationHandle() { SLDestroyHandle(h); }
};

class Client {
public:
    explicit Client(unsigned confirmSize = 8192) : h_(SLCreateHandle(confirmSize)) {}
    ~Client() { SLDestroyHandle(h_); }
    SLHandle* h() { return h_; }
    uint8_t* block() { return h_->command; }
    uint32_t word(uint32_t i) { return loadWordAt(h_->command, i); }
    void set(uint32_t i, uint32_t v) { storeWordAt(h_->command, i, v); }
    uint32_t confirmWord(uint32_t offset) { return loadWord(h_->confirm + offset); }
    std::string confirmString(uint32_t offset)
    {
        return std::string(reinterpret_cast<char*>(h_->confirm + offset + 4), confirmWord(offset));
    }

    // A fresh command block with the header words the SL library writes.
    void begin(uint32_t code)
    {
        std::memset(h_->command, 0, SL_COMMAND_SIZE);
        std::memset(h_->confirm, 0xEE, h_->confirmSize);
        set(0, SL_LEVEL_CHECK);
        set(1, code);
        set(2, SL_COMMAND_SIZE);
        set(3, handle_);
        set(4, next_++);
        set(7, h_->confirmSize);
        set(8, pointerWord(h_->confirm));
        set(9, 1);
    }
    // Sends the block; the DmiInvoke result.
    uint32_t send()
    {
        __atomic_store_n(&h_->pending, 1u, __ATOMIC_SEQ_CST);
        return DmiInvoke(h_->command);
    }
    // Waits for the confirm; false after the timeout.
    bool wait(unsigned ms = 5000)
    {
        auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
        while (__atomic_load_n(&h_->pending, __ATOMIC_SEQ_CST) != 0) {
            if (std::chrono::steady_clock::now() > end)
                return false;
            std::this_thread::yield();
        }
        return true;
    }
    // Sends and waits; the confirm status (word 11), or 0xFFFFFFFF when the
    // command was not accepted or never confirmed.
    uint32_t run()
    {
        uint32_t code = word(1);
        if (send() != 0)
            return 0xFFFFFFFF;
        if (code >= 1024 && code <= 1027)
            return word(11);
        return wait() ? word(11) : 0xFFFFFFFF;
    }
    uint32_t registerApp(bool withIndications = true)
    {
        begin(256);
        set(16, static_cast<uint32_t>(reinterpret_cast<uintptr_t>(&confirmCallback)));
        set(17, withIndications ? static_cast<uint32_t>(reinterpret_cast<uintptr_t>(&indicationCallback)) : 0);
        uint32_t status = run();
        if (status == 0)
            handle_ = confirmWord(8);
        return status;
    }
    // Key entries at `at` (three words each) with integer values behind them.
    uint32_t intKeys(uint32_t at, const std::vector<std::pair<uint32_t, int32_t>>& keys)
    {
        set(18, static_cast<uint32_t>(keys.size()));
        set(19, at);
        uint32_t value = at + 12 * static_cast<uint32_t>(keys.size());
        for (size_t i = 0; i < keys.size(); ++i) {
            uint32_t entry = at + 12 * static_cast<uint32_t>(i);
            storeWord(h_->command + entry, keys[i].first);
            storeWord(h_->command + entry + 4, 5);
            storeWord(h_->command + entry + 8, value);
            storeWord(h_->command + value, static_cast<uint32_t>(keys[i].second));
            value += 4;
        }
        return value;
    }
    uint32_t mgmtHandle() const { return handle_; }

private:
    SLHandle* h_;
    uint32_t handle_ = 0;
    uint32_t next_ = 0;
};

inline std::string text(const DmiString* s)
{
    return s == nullptr ? "<null>" : std::string(dmiStringText(s), dmiStringLength(s));
}

// A component with an event-generation group, an instance table, a vendor
// error group and a ComponentID group.
inline const char* sampleMif()
{
    return R"(start component
  name = "Test Board"
  description = "a board for tests"
  start group
    name = "ComponentID"  class = "DMTF|ComponentID|001"  id = 1
    start attribute name = "Manufacturer" id = 1 type = string(32) value = "Zorek" end attribute
    start attribute name = "Version" id = 3 type = displaystring(8) access = read-write value = "1.0" end attribute
  end group
  start group
    name = "Voltage Events"  class = "EventGeneration|Voltage Probe|001"  id = 20
    description = "voltage events"
    start attribute name = "Event Type" id = 1 type = start enum 1 = "Warning" 2 = "Failure" end enum value = 2 end attribute
    start attribute name = "Severity" id = 2 type = start enum 8 = "Critical" 16 = "Major" end enum value = 16 end attribute
    start attribute name = "Is State" id = 3 type = integer value = 0 end attribute
    start attribute name = "State Key" id = 4 type = integer value = 0 end attribute
    start attribute name = "Associated Group" id = 5 type = string(64) value = "DMTF|Voltage Probe|001" end attribute
    start attribute name = "System" id = 6 type = integer value = 3 end attribute
    start attribute name = "Subsystem" id = 7 type = integer value = 4 end attribute
    start attribute name = "Solution" id = 8 type = integer value = 0 end attribute
    start attribute name = "Instance Data" id = 9 type = integer access = read-write value = 1 end attribute
  end group
  start group
    name = "Voltage Probe"  class = "DMTF|Voltage Probe|001"  key = 1
    start attribute name = "Index" id = 1 type = integer end attribute
    start attribute name = "Label" id = 2 type = displaystring(16) access = read-write value = "probe" end attribute
    start attribute name = "Reading" id = 3 type = integer access = read-write value = 0 end attribute
    start attribute name = "Total" id = 4 type = integer64 access = read-write value = 0 end attribute
    start attribute name = "Stamp" id = 5 type = date access = read-write value = "19950101120000.000000+000" end attribute
    start attribute name = "State" id = 6 type = start enum 0 = "OK" 1 = "Bad" end enum access = read-write value = 0 end attribute
    start attribute name = "Errors" id = 7 type = counter value = 9 end attribute
    start attribute name = "Secret" id = 8 type = integer access = write-only value = 5 end attribute
  end group
  start table
    name = "Voltage Probe"  class = "DMTF|Voltage Probe|001"  id = 30
    {1, "CPU"}  {2, "Memory", 1200}  {3, "Fan"}
  end table
  start group
    name = "Errors"  class = "Zorek|Error|001"  id = 40
    start attribute name = "Error State" id = 1 type = start enum 0 = "None" 2 = "Overheat" end enum value = 2 end attribute
    start attribute name = "Code" id = 2 type = integer value = 77 end attribute
  end group
end component
)";
}

// A fresh database directory for each test, removed afterwards.
class ProviderTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        static bool slReady = false;
        if (!slReady) {
            SLInitialize();
            slReady = true;
        }
        char tmpl[] = "/tmp/dmisp-test-XXXXXX";
        ASSERT_NE(mkdtemp(tmpl), nullptr);
        dir_ = tmpl;
        std::string error;
        ASSERT_EQ(dmisp::reset(dir_, serveControl(), &error), 0) << error;
        std::lock_guard<std::mutex> lock(received().mu);
        received().indications.clear();
        received().complete = true;
    }
    void TearDown() override
    {
        dmisp::shutdown();
        std::string cmd = "rm -rf '" + dir_ + "'";
        if (std::system(cmd.c_str()) != 0)
            ADD_FAILURE() << "cannot remove " << dir_;
    }
    virtual bool serveControl() { return false; }
    uint32_t installSample()
    {
        std::string error;
        uint32_t id = dmisp::installText(sampleMif(), "sample.mif", &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }
    std::vector<std::vector<uint8_t>> takeIndications()
    {
        EXPECT_TRUE(dmisp::waitIndicationsDelivered());
        std::lock_guard<std::mutex> lock(received().mu);
        auto out = std::move(received().indications);
        received().indications.clear();
        return out;
    }
    std::string dir_;
};

} // namespace dmisptest
