// The baseboard's display, system-control and paging groups, against the
// substitute provider.
#include <cstring>

#include "base/bytes.h"
#include "daemon/events.h"
#include "provider.h"

namespace {

std::string displayGroup(unsigned id, const std::string& cls)
{
    return mifGroup("Status Display", cls, id, {7, 8});
}

class Baseboard : public Provider {
protected:
    uint32_t board = 0;
    // A fresh database whose baseboard holds `groups` (none: the shipped baseboard).
    void withBaseboard(std::initializer_list<std::string> groups)
    {
        managing = true; // freshDatabase registers as the management application
        freshDatabase();
        board = groups.size() == 0 ? install("baseboard.mif", true) : install(mifComponent("Board", groups));
        catalogue(board, 1);
    }
};

TEST_F(Baseboard, DisplayLineOfThirtyTwoCharactersInTheFirstListedForm)
{
    withBaseboard({});
    // A component-install indication makes the worker look for the groups again.
    SLHandle* installed = SLCreateHandle(0);
    memset(installed->command, 0, SL_COMMAND_SIZE), memset(installed->confirm, 0, 64);
    storeWordAt(installed->command, 1, 2), processEvent(installed), SLDestroyHandle(installed);
    EXPECT_NE(LcdGroupId, 0u);
    ASSERT_EQ(LcdInitialize(), 0);
    for (std::string text : {"Fan failed", "0123456789012345678901234567890123456789", ""}) {
        std::string line = (text + std::string(32, ' ')).substr(0, 32);
        WriteLCD(text.c_str());
        EXPECT_EQ(value(board, 30, 8), line);
        char read[40];
        memset(read, 'X', sizeof read);
        ReadLCD(read);
        EXPECT_EQ(std::string(read, 34), line + '\0' + 'X');
    }
    WriteLCD(nullptr);
    EXPECT_EQ(value(board, 30, 8), std::string(32, ' '));
    struct Row { std::string first, second; uint32_t group, attribute; } rows[] = { // group 0: none found
        {displayGroup(11, "Zorek|Status Display|basebrd001"), displayGroup(12, "Zorek|Status Display|002"), 11, 7},
        {displayGroup(11, "Zorek|Status Display|002"), displayGroup(12, "Zorek|Status Display|basebrd001"), 11, 8},
        {mifGroup("Other", "Zorek|Paging Config|001", 11, {7}), displayGroup(12, "zOREK|status DISPLAY|0027"), 12, 8},
        {displayGroup(11, "Zorek|Status Display|00"), displayGroup(12, "Zorek|Status Display|basebrd002"), 0, 0}};
    for (const auto& r : rows) {
        SCOPED_TRACE(r.first + r.second);
        withBaseboard({r.first, r.second});
        EXPECT_EQ(LcdInitialize(), r.group != 0 ? 0 : -1);
        uint64_t sets = dmisp::commandsReceived(769);
        WriteLCD("hello");
        EXPECT_EQ(dmisp::commandsReceived(769), sets + 1 - (r.group == 0));
        if (r.group != 0) {
            EXPECT_EQ(value(board, r.group, r.attribute), "hello" + std::string(27, ' '));
            EXPECT_EQ(value(board, r.group, 15 - r.attribute), "");
        }
    }
}

TEST_F(Baseboard, EachRequestSetsItsOwnAttributeTheClassTakesAnyVersionAndStatus512)
{
    withBaseboard({});
    ASSERT_EQ(SysCtrlInitialize(), 0);
    struct Row { void (*write)(void); uint32_t attribute; const char* value; } rows[] = {
        {SysCtrlReset, 2, "1"},           {SysCtrlPowerOff, 7, "1"},    {SysCtrlShutDown, 17, "1"},
        {SysCtrlShutAndPowerOff, 18, "1"}, {SysCtrlShutAndReset, 19, "1"}, {SysCtrlNMI, 20, "1"},
        {SysCtrlIdLedBlink, 25, "2"},     {SysCtrlIdLedOff, 25, "1"},   {SysCtrlPage, 0, ""}};
    for (const auto& r : rows) {
        SCOPED_TRACE(r.attribute);
        std::string before[26];
        for (uint32_t a : {2, 7, 17, 18, 19, 20, 25})
            before[a] = value(board, 31, a);
        before[r.attribute] = r.value;
        dmisp::setValue(board, 32, 6, {}, "0");
        r.write();
        for (uint32_t a : {2, 7, 17, 18, 19, 20, 25})
            EXPECT_EQ(value(board, 31, a), before[a]) << "attribute " << a;
        EXPECT_EQ(value(board, 32, 6), r.attribute == 0 ? "1" : "0") << "the page";
    }
    for (auto [cls, found] : {std::pair{"Zorek|System Control|001", true}, {"zorek|SYSTEM CONTROL|", true},
                              {"Zorek|System Control|7.5 beta", true}, {"Zorek|System Control", false},
                              {"Zorek|System Control-001", false}, {"Other|System Control|001", false}}) {
        SCOPED_TRACE(cls);
        withBaseboard({mifGroup("Paging", "Zorek|Paging Config|001", 3, {}, 6, {"Page"}),
                       mifGroup("System Control", cls, 6, {}, 25, {"LED Off", "LED Blink"})});
        EXPECT_EQ(SysCtrlInitialize(), found ? 0 : -1);
        SysCtrlIdLedBlink();
        SysCtrlPage();
        EXPECT_EQ(value(board, 6, 25), found ? "2" : "0");
        EXPECT_EQ(value(board, 3, 6), "1") << "the page goes to the baseboard";
    }
    // A listing with status 512 counts only when it holds a component record:
    // the confirm still holds the previous listing otherwise.
    withBaseboard({});
    dmisp::injectListingStatus512(1);
    EXPECT_EQ(SysCtrlFindGroupId(h, 0), 31u);
    EXPECT_EQ(sysCtrlComponent, board);
    sysCtrlComponent = 0;
    SLDmiInvoke = [](void* block) -> uint32_t {
        storeWordAt(block, 11, 512);
        storeWordAt(block, 10, 0);
        return dmiConfirmFunc(block), 0;
    };
    EXPECT_EQ(SysCtrlFindGroupId(h, 0), 0u);
    EXPECT_EQ(sysCtrlComponent, 0u);
}

} // namespace
