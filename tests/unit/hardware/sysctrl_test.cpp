#include <cstring>
#include <map>
#include <string>

#include "base/bytes.h"
#include "baseboardenv.h"
#include "sl/slaccess.h"

namespace {

// Attributes of the shipped baseboard's system-control group (31).
const uint32_t requestAttributes[] = {2, 7, 17, 18, 19, 20, 25};

class SysCtrl : public BaseboardTest {
protected:
    uint32_t baseboard = 0;

    void withBaseboardMif()
    {
        baseboard = installBaseboardMif();
        catalogue(baseboard, 1);
        ASSERT_EQ(SysCtrlInitialize(), 0);
        ASSERT_EQ(sysCtrlGroup, 31u);
        ASSERT_EQ(sysCtrlComponent, baseboard);
    }

    std::map<uint32_t, std::string> requests()
    {
        std::map<uint32_t, std::string> values;
        for (uint32_t a : requestAttributes)
            values[a] = value(baseboard, 31, a);
        return values;
    }
};

TEST_F(SysCtrl, EachWriterSetsItsOwnAttribute)
{
    withBaseboardMif();
    struct Case {
        const char* what;
        void (*write)(void);
        uint32_t attribute;
        const char* value; // enumeration value of the request text in the baseboard MIF
    } cases[] = {
        {"reset", SysCtrlReset, 2, "1"},
        {"power off", SysCtrlPowerOff, 7, "1"},
        {"shutdown", SysCtrlShutDown, 17, "1"},
        {"shutdown and power off", SysCtrlShutAndPowerOff, 18, "1"},
        {"shutdown and reset", SysCtrlShutAndReset, 19, "1"},
        {"NMI", SysCtrlNMI, 20, "1"},
        {"ID LED blink", SysCtrlIdLedBlink, 25, "2"},
        {"ID LED off", SysCtrlIdLedOff, 25, "1"},
        {"ID LED blink again", SysCtrlIdLedBlink, 25, "2"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        std::map<uint32_t, std::string> expected = requests();
        expected[c.attribute] = c.value;
        c.write();
        EXPECT_EQ(requests(), expected);
    }
}

TEST_F(SysCtrl, ValueTextOutsideTheEnumerationWritesNothing)
{
    // The LED attribute knows "LED Off" but not "LED Blink" (only in other case).
    baseboard = installText(mifComponent(
        "Test Baseboard", {mifGroupStart("System Control", "Zorek|System Control|001", 4) +
                           mifEnumAttribute(25, {"LED Off", "led blink"}) + mifGroupEnd()}));
    catalogue(baseboard, 1);
    ASSERT_EQ(SysCtrlInitialize(), 0);
    uint64_t sets = dmisp::commandsReceived(769);
    SysCtrlIdLedBlink();
    EXPECT_EQ(dmisp::commandsReceived(769), sets);
    EXPECT_EQ(value(baseboard, 4, 25), "0");
    SysCtrlIdLedOff();
    EXPECT_EQ(value(baseboard, 4, 25), "1");
}

TEST_F(SysCtrl, ClassMatchesAnyVersionAfterTheFinalBar)
{
    struct Case {
        const char* cls;
        bool found;
    } cases[] = {
        {"Zorek|System Control|001", true},
        {"Zorek|System Control|", true},
        {"Zorek|System Control|7.5 beta", true},
        {"zorek|SYSTEM CONTROL|002", true},
        {"Zorek|System Control", false},
        {"Zorek|System Control-001", false},
        {"Zorek|System", false},
        {"Other|System Control|001", false},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.cls);
        freshDatabase();
        baseboard = installText(mifComponent("Test Baseboard", {systemControlGroup(6, c.cls)}));
        catalogue(baseboard, 1);
        EXPECT_EQ(SysCtrlInitialize(), c.found ? 0 : -1);
        EXPECT_EQ(sysCtrlGroup, c.found ? 6u : 0u);
        EXPECT_EQ(sysCtrlComponent, c.found ? baseboard : 0u);
    }
}

TEST_F(SysCtrl, FirstMatchingGroupAndRepeatedInitialise)
{
    baseboard = installText(mifComponent(
        "Test Baseboard", {pagingGroup(3, "Zorek|Paging Config|001"), systemControlGroup(5, "Zorek|System Control|002"),
                           systemControlGroup(8, "Zorek|System Control|001")}));
    catalogue(baseboard, 1);
    EXPECT_EQ(SysCtrlInitialize(), 0);
    EXPECT_EQ(sysCtrlGroup, 5u);
    uint64_t before = dmisp::commandsReceived();
    EXPECT_EQ(SysCtrlInitialize(), 0);
    EXPECT_EQ(SysCtrlInitialize(), 0);
    EXPECT_EQ(dmisp::commandsReceived(), before);
}

TEST_F(SysCtrl, GroupOutsideTheBaseboardIsFoundByClass)
{
    baseboard = installText(mifComponent("Test Baseboard", {pagingGroup(3, "Zorek|Paging Config|001")}));
    uint32_t other = installText(mifComponent("Controller", {systemControlGroup(7, "Zorek|System Control|003")}));
    catalogue(baseboard, 1);
    catalogue(other, 2);
    EXPECT_EQ(SysCtrlInitialize(), 0);
    EXPECT_EQ(sysCtrlGroup, 7u);
    EXPECT_EQ(sysCtrlComponent, other);
    SysCtrlIdLedBlink();
    EXPECT_EQ(value(other, 7, 25), "2");
}

TEST_F(SysCtrl, WithoutGroupNothingIsSent)
{
    baseboard = installText(mifComponent("Test Baseboard", {displayGroup(3, "Zorek|Status Display|002")}));
    catalogue(baseboard, 1);
    EXPECT_EQ(SysCtrlInitialize(), -1);
    EXPECT_EQ(sysCtrlComponent, 0u);
    uint64_t before = dmisp::commandsReceived();
    for (auto write : {SysCtrlReset, SysCtrlPowerOff, SysCtrlShutDown, SysCtrlShutAndPowerOff, SysCtrlShutAndReset,
                       SysCtrlNMI, SysCtrlIdLedBlink, SysCtrlIdLedOff})
        write();
    EXPECT_EQ(dmisp::commandsReceived(), before);
}

// The page goes to the baseboard, where the paging group was found, also
// when the system-control group lives in another component or nowhere.
TEST_F(SysCtrl, PageIsWrittenToTheBaseboard)
{
    struct Case {
        const char* what;
        bool controllerHasSystemControl;
    } cases[] = {{"system control in another component", true}, {"no system-control group", false}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        freshDatabase();
        baseboard = installText(mifComponent("Test Baseboard", {pagingGroup(32, "Zorek|Paging Config|001")}));
        // The controller has a group with the paging group's id and an
        // attribute 6 that takes "Page" too: a write addressed there would show.
        uint32_t controller =
            installText(c.controllerHasSystemControl
                            ? mifComponent("Controller", {systemControlGroup(31, "Zorek|System Control|001"),
                                                          pagingGroup(32, "Other|Pager|001")})
                            : mifComponent("Controller", {pagingGroup(32, "Other|Pager|001")}));
        catalogue(baseboard, 1);
        catalogue(controller, 2);
        SysCtrlInitialize();
        EXPECT_EQ(sysCtrlComponent, c.controllerHasSystemControl ? controller : 0u);
        SysCtrlPage();
        EXPECT_EQ(PagingGroupId, 32u);
        EXPECT_EQ(value(baseboard, 32, 6), "1");
        EXPECT_EQ(value(controller, 32, 6), "0");
    }
}

TEST_F(SysCtrl, PagingSearchRepeatsUntilFound)
{
    withBaseboardMif();
    ASSERT_EQ(dmisp::setValue(baseboard, 32, 6, {}, "0"), 0u);
    SysCtrlPage();
    EXPECT_EQ(PagingGroupId, 32u);
    EXPECT_EQ(value(baseboard, 32, 6), "1");
    // Once found, a page lists nothing more.
    uint64_t listings = dmisp::commandsReceived(512);
    SysCtrlPage();
    EXPECT_EQ(dmisp::commandsReceived(512), listings);

    freshDatabase();
    baseboard = installText(mifComponent("Test Baseboard", {systemControlGroup(2, "Zorek|System Control|001")}));
    catalogue(baseboard, 1);
    listings = dmisp::commandsReceived(512);
    SysCtrlPage();
    SysCtrlPage();
    EXPECT_EQ(PagingGroupId, 0u);
    EXPECT_EQ(dmisp::commandsReceived(512), listings + 2);
    EXPECT_EQ(dmisp::commandsReceived(769), 0u);
}

TEST_F(SysCtrl, Status512CountsOnlyWithAComponentRecord)
{
    baseboard = installBaseboardMif();
    catalogue(baseboard, 1);
    SLHandle* h = SLCreateHandle(4096);
    ASSERT_NE(h, nullptr);

    // The provider lists the baseboard with status 512: a usable listing.
    dmisp::injectListingStatus512(1);
    EXPECT_EQ(SysCtrlFindGroupId(h, 0), 31u);
    EXPECT_EQ(SLCnfStatus(h), 512u);
    EXPECT_EQ(sysCtrlComponent, baseboard);

    // Status 512 with no entry: the confirm buffer still holds the previous
    // listing of the baseboard, which must not be taken for an answer.
    sysCtrlComponent = 0;
    SLDmiInvoke = [](void* block) -> uint32_t {
        storeWordAt(block, 11, 512);
        storeWordAt(block, 10, 0);
        dmiConfirmFunc(block);
        return 0;
    };
    EXPECT_EQ(SysCtrlFindGroupId(h, 0), 0u);
    EXPECT_EQ(SLCnfStatus(h), 512u);
    EXPECT_EQ(sysCtrlComponent, 0u);
    SLDmiInvoke = DmiInvoke;
    SLDestroyHandle(h);
}

} // namespace
