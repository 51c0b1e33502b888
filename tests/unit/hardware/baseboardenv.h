// A fresh substitute-provider database per test, the SL library set up once,
// an empty catalogue and the baseboard groups not yet found.
#pragma once

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <initializer_list>
#include <string>

#include "dmisp/dmisp.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slhandle.h"

class BaseboardTest : public ::testing::Test {
protected:
    std::string dir;
    int databases = 0;

    void SetUp() override
    {
        static bool slReady = (SLInitialize(), true);
        (void)slReady;
        char pattern[] = "/tmp/moxlcdXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
        freshDatabase();
    }

    void TearDown() override
    {
        SLDmiInvoke = DmiInvoke;
        dmisp::clearFaults();
        forget();
        dmisp::shutdown();
        std::filesystem::remove_all(dir);
    }

    // An empty database, an empty catalogue and no group known.
    void freshDatabase()
    {
        forget();
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db" + std::to_string(databases++), false, &error), 0) << error;
        // The provider confirms commands to a registered management application.
        SLHandle* h = SLCreateHandle(0);
        ASSERT_NE(h, nullptr);
        ASSERT_EQ(SLDmiRegisterMgmt(h, [](SLHandle*) { return 0; }), 0);
        SLDestroyHandle(h);
    }

    void forget()
    {
        deleteComponentList(componentList);
        componentList = nullptr;
        LcdGroupId = LcdContentsAttrId = 0;
        sysCtrlGroup = sysCtrlComponent = PagingGroupId = 0;
    }

    uint32_t installText(const std::string& text)
    {
        std::string error;
        uint32_t id = dmisp::installText(text, "test.mif", &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }

    uint32_t installBaseboardMif()
    {
        std::string error;
        uint32_t id = dmisp::install(MOX_SOURCE_DIR "/mifs/baseboard.mif", &error);
        EXPECT_NE(id, 0u) << error;
        return id;
    }

    // Puts `component` into the catalogue with MIF id `mifId` (1: the baseboard).
    void catalogue(uint32_t component, uint32_t mifId)
    {
        ComponentInfo* entry = componentList == nullptr ? (componentList = newComponentInfo(component))
                                                        : appendToList(componentList, component, mifId);
        ASSERT_NE(entry, nullptr);
        entry->mifId = mifId;
    }

    static std::string value(uint32_t component, uint32_t group, uint32_t attribute)
    {
        std::string text;
        EXPECT_EQ(dmisp::getValue(component, group, attribute, {}, &text), 0u)
            << "component " << component << " group " << group << " attribute " << attribute;
        return text;
    }
};

// ---- Test MIF texts ---------------------------------------------------------

inline std::string mifComponent(const std::string& name, std::initializer_list<std::string> groups)
{
    std::string text = "start component\n    name = \"" + name + "\"\n";
    for (const auto& g : groups)
        text += g;
    return text + "end component\n";
}

inline std::string mifGroupStart(const std::string& name, const std::string& cls, uint32_t id)
{
    return "    start group\n        name = \"" + name + "\"\n        class = \"" + cls + "\"\n        id = " +
           std::to_string(id) + "\n";
}

inline std::string mifStringAttribute(uint32_t id, int size = 32)
{
    return "        start attribute\n            name = \"Text " + std::to_string(id) + "\"\n            id = " +
           std::to_string(id) + "\n            type = displaystring(" + std::to_string(size) +
           ")\n            access = read-write\n            value = \"\"\n        end attribute\n";
}

// An enumerated attribute whose entry 0 is "No Action", the current value,
// followed by `texts` as 1, 2, ...
inline std::string mifEnumAttribute(uint32_t id, std::initializer_list<const char*> texts)
{
    std::string text = "        start attribute\n            name = \"Request " + std::to_string(id) +
                       "\"\n            id = " + std::to_string(id) +
                       "\n            type = start enum\n                0 = \"No Action\"\n";
    int value = 1;
    for (const char* t : texts)
        text += "                " + std::to_string(value++) + " = \"" + t + "\"\n";
    return text + "            end enum\n            access = read-write\n            value = \"No Action\"\n"
                  "        end attribute\n";
}

inline const char* mifGroupEnd()
{
    return "    end group\n";
}

// A status-display group with both contents attributes (7 and 8), so that a
// write to the wrong one shows.
inline std::string displayGroup(uint32_t id, const std::string& cls)
{
    return mifGroupStart("Status Display", cls, id) + mifStringAttribute(7) + mifStringAttribute(8) + mifGroupEnd();
}

inline std::string systemControlGroup(uint32_t id, const std::string& cls)
{
    return mifGroupStart("System Control", cls, id) + mifEnumAttribute(25, {"LED Off", "LED Blink"}) +
           mifGroupEnd();
}

inline std::string pagingGroup(uint32_t id, const std::string& cls)
{
    return mifGroupStart("Paging Config", cls, id) + mifEnumAttribute(6, {"Page"}) + mifGroupEnd();
}
