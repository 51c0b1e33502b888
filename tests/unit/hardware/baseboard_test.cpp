// The baseboard's display, system-control and paging groups, against the
// substitute provider.
#include <cstring>
#include <map>

#include "base/bytes.h"
#include "provider.h"
#include "sl/slaccess.h"

namespace {

const char* display1 = "Zorek|Status Display|basebrd001";
const char* display2 = "Zorek|Status Display|002";

std::string displayGroup(unsigned id, const std::string& cls)
{
    return mifGroup("Status Display", cls, id, {7, 8});
}
std::string systemControlGroup(unsigned id, const std::string& cls)
{
    return mifGroup("System Control", cls, id, {}, 25, {"LED Off", "LED Blink"});
}
std::string pagingGroup(unsigned id, const std::string& cls)
{
    return mifGroup("Paging Config", cls, id, {}, 6, {"Page"});
}

class Baseboard : public Provider {
protected:
    uint32_t board = 0;
    int databases = 0;
    void SetUp() override
    {
        Provider::SetUp();
        manage();
    }
    // A fresh database with a baseboard of `groups` in the catalogue.
    void withBaseboard(std::initializer_list<std::string> groups)
    {
        freshDatabase("db" + std::to_string(databases++));
        board = install(mifComponent("Test Baseboard", groups));
        catalogue(board, 1);
    }
};

TEST_F(Baseboard, DisplayLineOfThirtyTwoCharactersInTheFirstListedForm)
{
    board = installShipped("baseboard.mif");
    catalogue(board, 1);
    ASSERT_EQ(LcdInitialize(), 0);
    const std::string forty = "0123456789012345678901234567890123456789";
    for (const char* text : {"Fan failed", forty.c_str(), "", static_cast<const char*>(nullptr)}) {
        std::string expected = std::string(text ? text : "").substr(0, 32);
        WriteLCD(text);
        EXPECT_EQ(value(board, 30, 8), expected + std::string(32 - expected.size(), ' '));
        char line[40];
        memset(line, 'X', sizeof line);
        ReadLCD(line);
        EXPECT_EQ(std::string(line, 34), expected + std::string(32 - expected.size(), ' ') + '\0' + 'X');
    }
    struct Row {
        std::string first, second;
        uint32_t group, attribute; // 0: no display found
    } rows[] = {
        {displayGroup(11, display1), displayGroup(12, display2), 11, 7},
        {displayGroup(11, display2), displayGroup(12, display1), 11, 8},
        {pagingGroup(11, "Zorek|Paging Config|001"), displayGroup(12, "zOREK|status DISPLAY|0027"), 12, 8},
        {displayGroup(11, "Zorek|Status Display|00"), displayGroup(12, "Zorek|Status Display|basebrd002"), 0, 0},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(r.first + r.second);
        withBaseboard({r.first, r.second});
        EXPECT_EQ(LcdInitialize(), r.group != 0 ? 0 : -1);
        uint64_t sets = dmisp::commandsReceived(769);
        WriteLCD("hello");
        if (r.group == 0) {
            EXPECT_EQ(dmisp::commandsReceived(769), sets);
            continue;
        }
        EXPECT_EQ(value(board, r.group, r.attribute), "hello" + std::string(27, ' '));
        EXPECT_EQ(value(board, r.group, 15 - r.attribute), "");
    }
}

TEST_F(Baseboard, EachRequestSetsItsOwnAttribute)
{
    board = installShipped("baseboard.mif");
    catalogue(board, 1);
    ASSERT_EQ(SysCtrlInitialize(), 0);
    const uint32_t attributes[] = {2, 7, 17, 18, 19, 20, 25};
    struct Row {
        void (*write)(void);
        uint32_t attribute;
        const char* value;
    } rows[] = {{SysCtrlReset, 2, "1"},        {SysCtrlPowerOff, 7, "1"},     {SysCtrlShutDown, 17, "1"},
                {SysCtrlShutAndPowerOff, 18, "1"}, {SysCtrlShutAndReset, 19, "1"}, {SysCtrlNMI, 20, "1"},
                {SysCtrlIdLedBlink, 25, "2"},  {SysCtrlIdLedOff, 25, "1"}};
    for (const auto& r : rows) {
        SCOPED_TRACE(r.attribute);
        std::map<uint32_t, std::string> expected;
        for (uint32_t a : attributes)
            expected[a] = a == r.attribute ? r.value : value(board, 31, a);
        r.write();
        for (uint32_t a : attributes)
            EXPECT_EQ(value(board, 31, a), expected[a]) << "attribute " << a;
    }
    ASSERT_EQ(dmisp::setValue(board, 32, 6, {}, "0"), 0u);
    SysCtrlPage();
    EXPECT_EQ(value(board, 32, 6), "1");
}

TEST_F(Baseboard, SystemControlClassAnyVersionAfterTheFinalBar)
{
    struct Row {
        const char* cls;
        bool found;
    } rows[] = {{"Zorek|System Control|001", true}, {"zorek|SYSTEM CONTROL|", true},
                {"Zorek|System Control|7.5 beta", true}, {"Zorek|System Control", false},
                {"Zorek|System Control-001", false}, {"Other|System Control|001", false}};
    for (const auto& r : rows) {
        SCOPED_TRACE(r.cls);
        withBaseboard({pagingGroup(3, "Zorek|Paging Config|001"), systemControlGroup(6, r.cls)});
        EXPECT_EQ(SysCtrlInitialize(), r.found ? 0 : -1);
        uint64_t sets = dmisp::commandsReceived(769);
        SysCtrlIdLedBlink();
        EXPECT_EQ(value(board, 6, 25), r.found ? "2" : "0");
        EXPECT_EQ(dmisp::commandsReceived(769), sets + r.found);
        SysCtrlPage();
        EXPECT_EQ(value(board, 3, 6), "1") << "the page goes to the baseboard";
    }
}

// A listing with status 512 counts only when it holds a component record:
// the confirm still holds the previous listing otherwise.
TEST_F(Baseboard, Status512CountsOnlyWithAComponentRecord)
{
    board = installShipped("baseboard.mif");
    catalogue(board, 1);
    dmisp::injectListingStatus512(1);
    EXPECT_EQ(SysCtrlFindGroupId(h, 0), 31u);
    EXPECT_EQ(sysCtrlComponent, board);
    sysCtrlComponent = 0;
    SLDmiInvoke = [](void* block) -> uint32_t {
        storeWordAt(block, 11, 512);
        storeWordAt(block, 10, 0);
        dmiConfirmFunc(block);
        return 0;
    };
    EXPECT_EQ(SysCtrlFindGroupId(h, 0), 0u);
    EXPECT_EQ(sysCtrlComponent, 0u);
}

} // namespace
