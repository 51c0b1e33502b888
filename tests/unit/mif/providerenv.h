// A fresh substitute-provider database per test, the SL library set up once,
// and the log lines captured.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <utility>
#include <vector>

#include "base/log.h"
#include "dmisp/dmisp.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slhandle.h"

inline std::vector<std::pair<int, std::string>>& loggedLines()
{
    static std::vector<std::pair<int, std::string>> lines;
    return lines;
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
