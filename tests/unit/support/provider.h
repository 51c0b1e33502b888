// The one fixture for tests against the substitute DMI provider: a fresh
// database per test, the SL library set up once, the log lines captured, and
// the catalogue and the baseboard group ids forgotten between tests.
#pragma once

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

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
    static Lines lines()
    {
        std::lock_guard<std::mutex> guard(lock());
        return std::exchange(logged(), {});
    }

protected:
    std::string dir;
    SLHandle* h = nullptr;
    bool managing = false;

    void SetUp() override
    {
        static bool slReady = (SLInitialize(), true);
        (void)slReady;
        char pattern[] = "/tmp/moxunitXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db", false, &error), 0) << error;
        setenv("UXDMIPATH", (dir + "/mifs").c_str(), 1);
        lines();
        moxSetLogHook([](int priority, const char* text) {
            std::lock_guard<std::mutex> guard(lock());
            logged().emplace_back(priority, text);
        });
        moxNewKeyFormat = moxActionTableGroup = -1;
        RegisterWithSLCalls(RegistrationCalls{EventHandler, [] { SysCtrlInitialize(); LcdInitialize(); }});
        h = SLCreateHandle(0);
        ASSERT_NE(h, nullptr);
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
    void manage()
    {
        ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return 0; }), 0);
        managing = true;
    }

    // A new empty database (and catalogue) within the test.
    void freshDatabase(const std::string& name)
    {
        UnregisterWithSL();
        forget();
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/" + name, false, &error), 0) << error;
        if (managing) {
            ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return 0; }), 0);
        }
    }

    static void forget()
    {
        deleteComponentList(componentList);
        componentList = nullptr;
        LcdGroupId = LcdContentsAttrId = 0;
        sysCtrlGroup = sysCtrlComponent = PagingGroupId = 0;
    }

    static uint32_t install(const std::string& text, const std::string& name = "test.mif")
    {
        std::string error;
        uint32_t id = dmisp::installText(text, name, &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }

    static uint32_t installShipped(const std::string& file)
    {
        std::string error;
        uint32_t id = dmisp::install(MOX_SOURCE_DIR "/mifs/" + file, &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }

    // Writes mox.mif with `text` into the MIF directory registration reads.
    void ownMifFile(const std::string& text)
    {
        std::filesystem::create_directories(dir + "/mifs");
        FILE* f = fopen((dir + "/mifs/mox.mif").c_str(), "w");
        fputs(text.c_str(), f);
        fclose(f);
    }

    // Puts `component` into the catalogue with MIF id `mifId` (1: the baseboard).
    static void catalogue(uint32_t component, uint32_t mifId)
    {
        ComponentInfo* entry = componentList == nullptr ? (componentList = newComponentInfo(component))
                                                        : appendToList(componentList, component, mifId);
        ASSERT_NE(entry, nullptr);
        entry->mifId = mifId;
    }

    // A value as the provider holds it, or "status N".
    static std::string value(uint32_t component, uint32_t group, uint32_t attribute,
                             const std::vector<std::string>& keys = {})
    {
        std::string v;
        uint32_t status = dmisp::getValue(component, group, attribute, keys, &v);
        return status == 0 ? v : "status " + std::to_string(status);
    }
};
