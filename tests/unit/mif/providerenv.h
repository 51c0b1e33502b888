// A fresh substitute-provider database per test, the SL library set up once,
// and the log lines captured.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <utility>
#include <vector>

#include "base/log.h"
#include "dmisp/dmisp.h"
#include "mif/mif.h"
#include "daemon/events.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "sl/sl.h"
#include "sl/slhandle.h"

inline std::vector<std::pair<int, std::string>>& loggedLines()
{
    static std::vector<std::pair<int, std::string>> lines;
    return lines;
}

// An attribute listing answered by the test itself, for what the provider
// would not hold: an enumeration listing a value twice, a data type it lacks.
struct ScriptedAttribute {
    uint32_t id = 0;
    uint32_t type = 0;
    std::vector<std::pair<int32_t, std::string>> enums;
};

inline ScriptedAttribute& scriptedAttribute()
{
    static ScriptedAttribute a;
    return a;
}

// An SLDmiInvoke that answers the listing (520) of the scripted attribute and
// hands every other command to the provider.
inline uint32_t answerScriptedAttribute(void* block)
{
    const ScriptedAttribute& a = scriptedAttribute();
    if (loadWordAt(block, 1) != 520 || loadWordAt(block, 18) != a.id)
        return DmiInvoke(block);
    auto* confirm = static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8)));
    const auto count = static_cast<uint32_t>(a.enums.size());
    uint32_t offset = 7 * 4 + 8 * count; // the entry, then the enumeration list
    auto putString = [&](const std::string& text) {
        uint32_t at = offset;
        storeWord(confirm + at, static_cast<uint32_t>(text.size()));
        memcpy(confirm + at + 4, text.data(), text.size());
        offset += 4 + static_cast<uint32_t>(text.size());
        return at;
    };
    // Attribute entry: id, name, access, type, maximum size, enumeration count and list.
    const uint32_t words[] = {a.id, putString("Scripted"), 2, a.type, 4, count, 28};
    for (uint32_t i = 0; i < 7; ++i)
        storeWordAt(confirm, i, words[i]);
    for (uint32_t i = 0; i < count; ++i) {
        storeWordAt(confirm + 28, 2 * i, static_cast<uint32_t>(a.enums[i].first));
        storeWordAt(confirm + 28, 2 * i + 1, putString(a.enums[i].second));
    }
    storeWordAt(block, 10, 1);
    storeWordAt(block, 11, 0);
    dmiConfirmFunc(block);
    return 0;
}

class ProviderTest : public ::testing::Test {
protected:
    std::string dir;
    SLHandle* h = nullptr;
    bool managementRegistered = false;

    // Commands are confirmed only to a registered management application.
    void registerManagement()
    {
        ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return 0; }), 0);
        managementRegistered = true;
    }

    void SetUp() override
    {
        static bool slReady = (SLInitialize(), true);
        (void)slReady;
        RegisterWithSLCalls(RegistrationCalls{EventHandler, [] { SysCtrlInitialize(); LcdInitialize(); }});
        char pattern[] = "/tmp/moxmifXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db", false, &error), 0) << error;
        setenv("UXDMIPATH", MOX_SOURCE_DIR "/mifs", 1);
        loggedLines().clear();
        moxSetLogHook([](int priority, const char* text) { loggedLines().emplace_back(priority, text); });
        moxNewKeyFormat = -1;
        moxActionTableGroup = -1;
        h = SLCreateHandle(0);
        ASSERT_NE(h, nullptr);
    }

    void TearDown() override
    {
        SLDmiInvoke = DmiInvoke;
        dmisp::clearFaults();
        UnregisterWithSL();
        if (managementRegistered)
            SLDmiUnregisterMgmt(h);
        SLDestroyHandle(h);
        moxSetLogHook(nullptr);
        dmisp::shutdown();
        std::filesystem::remove_all(dir);
    }

    uint32_t install(const std::string& text, const char* name = "test.mif")
    {
        std::string error;
        uint32_t id = dmisp::installText(text, name, &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }

    // Writes `text` as `name` into a directory of its own and returns it.
    std::string mifDirectoryWith(const std::string& name, const std::string& text)
    {
        std::string d = dir + "/mifs-" + name;
        std::filesystem::create_directories(d);
        FILE* f = fopen((d + "/" + name).c_str(), "w");
        fputs(text.c_str(), f);
        fclose(f);
        return d;
    }
};
