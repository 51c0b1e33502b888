// The one fixture for tests against the substitute DMI provider: a fresh
// database per test, the SL library set up once, the log lines captured, and
// the catalogue and the baseboard group ids forgotten between tests.
#pragma once

#include <gtest/gtest.h>

#include <fstream>
#include <filesystem>
#include <mutex>

#include "base/log.h"
#include "daemon/events.h"
#include "dmisp/dmisp.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slhandle.h"
#include "testmifs.h"

using Lines = std::vector<std::pair<int, std::string>>;

class Provider : public ::testing::Test {
public:
    static std::mutex& lock() { static std::mutex m; return m; }
    static Lines& logged() { static Lines l; return l; }
    // The lines logged since the last call.
    static Lines lines() { std::lock_guard<std::mutex> guard(lock()); return std::exchange(logged(), {}); }
    // A value as the provider holds it, or "status N".
    static std::string value(uint32_t component, uint32_t group, uint32_t attribute,
                             const std::vector<std::string>& keys = {})
    {
        std::string v;
        uint32_t status = dmisp::getValue(component, group, attribute, keys, &v);
        return status == 0 ? v : "status " + std::to_string(status);
    }

protected:
    std::string dir;
    SLHandle* h = nullptr;
    bool managing = false;
    int databases = 0;

    void SetUp() override
    {
        [[maybe_unused]] static bool slReady = (SLInitialize(), true);
        char pattern[] = "/tmp/moxunitXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
        freshDatabase();
        setenv("UXDMIPATH", (dir + "/mifs").c_str(), 1);
        lines();
        moxSetLogHook([](int priority, const char* text) {
            std::lock_guard<std::mutex> guard(lock());
            logged().emplace_back(priority, text);
        });
        moxNewKeyFormat = moxActionTableGroup = -1;
        RegisterWithSLCalls(RegistrationCalls{EventHandler, [] { SysCtrlInitialize(); LcdInitialize(); }});
        ASSERT_NE(h = SLCreateHandle(0), nullptr);
    }

    void TearDown() override
    {
        SLDmiInvoke = DmiInvoke;
        dmisp::clearFaults();
        UnregisterWithSL();
        if (managing)
            SLDmiUnregisterMgmt(h);
        SLDestroyHandle(h);
        forget();
        moxSetLogHook(nullptr);
        dmisp::shutdown();
        std::filesystem::remove_all(dir);
    }

    // Without RegisterWithSL, the provider confirms only to a management application.
    void manage() { ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return 0; }), 0); managing = true; }

    // A new empty database and catalogue; registration ended.
    void freshDatabase()
    {
        UnregisterWithSL();
        forget();
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db" + std::to_string(databases++), false, &error), 0) << error;
        if (managing)
            manage();
    }

    static void forget()
    {
        deleteComponentList(componentList);
        componentList = nullptr;
        LcdGroupId = LcdContentsAttrId = sysCtrlGroup = sysCtrlComponent = PagingGroupId = 0;
    }

    // Installs MIF text, or with `shipped` the file of that name in mifs/.
    static uint32_t install(const std::string& text, bool shipped = false)
    {
        std::string error;
        uint32_t id = shipped ? dmisp::install(MOX_SOURCE_DIR "/mifs/" + text, &error)
                              : dmisp::installText(text, "test.mif", &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }

    // Writes mox.mif with `text` into the MIF directory registration reads.
    void ownMifFile(const std::string& text)
    {
        std::filesystem::create_directories(dir + "/mifs");
        std::ofstream(dir + "/mifs/mox.mif") << text;
    }

    // Puts `component` into the catalogue with MIF id `mifId` (1: the baseboard).
    static void catalogue(uint32_t component, uint32_t mifId)
    {
        ComponentInfo* entry = componentList == nullptr ? (componentList = newComponentInfo(component))
                                                        : appendToList(componentList, component, mifId);
        ASSERT_NE(entry, nullptr);
        entry->mifId = mifId;
    }

};
