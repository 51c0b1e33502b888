// Catalogue, value formatting, registration and the carry-over of the actions
// tables, against the substitute provider.
#include <cmath>
#include <cstring>
#include <syslog.h>

#include "base/bytes.h"
#include "mif/basebrd.h"
#include "mif/format.h"
#include "provider.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slkey.h"
#include "sl/slstring.h"
#include <atomic>
#include <thread>

namespace {

std::string attr(int id, const char* name, const char* type, const char* value)
{
    return std::string("start attribute\n name = \"") + name + "\"\n id = " + std::to_string(id) + "\n type = " +
           type + "\n access = read-write\n value = " + value + "\nend attribute\n";
}

// Scalars of every converted type (group 1) and a table named by its
// description only (group 2).
std::string scalarsMif()
{
    return mifComponent("Catalogue Test", {
        "start group\n name = \"Scalars\"\n class = \"Test|Scalars|001\"\n id = 1\n" + attr(1, "Count", "integer", "42") +
        attr(2, "State", "start enum\n 0 = \"Off\"\n 1 = \"On\"\n 2 = \"Failed\"\n end enum", "0") +
        attr(3, "Label", "displaystring(64)", "\"plain text\"") +
        attr(4, "When", "date", "\"20261206113005.123456+060\"") + attr(5, "Events", "counter", "7") +
        attr(6, "Level", "gauge", "99") + "end group\n",
        "start group\n name = \"Described\"\n class = \"Test|Described|001\"\n id = 2\n key = 1\n" +
        attr(1, "Index", "integer", "0") + attr(2, "Description", "displaystring(64)", "\"\"") +
        "end group\nstart table\n name = \"Described\"\n class = \"Test|Described|001\"\n id = 2\n"
        " { 1, \"Fan in front\" }\n { 2, \"Fan at the back\" }\nend table\n"});
}

class Catalogue : public Provider {
protected:
    uint32_t component = 0, board = 0;
    void SetUp() override
    {
        Provider::SetUp();
        component = install(scalarsMif());
        board = install(boardMif("Test Board"));
        manage();
        catalogue(component, 0);
        catalogue(board, 1);
    }
};

TEST_F(Catalogue, NamesTypesAndFallbacksAskTheProviderOnce)
{
    auto ask = [this] {
        return std::vector<std::string>{ComponentName(component), GroupName(h, component, 2),
                                        AttributeName(h, component, 1, 2), std::to_string(AttributeType(h, component, 1, 4)),
                                        AttributeEnumerationString(h, component, 1, 2, 2)};
    };
    EXPECT_EQ(ask(), (std::vector<std::string>{"Catalogue Test", "Described", "State", "11", "Failed"}));
    uint64_t before = dmisp::commandsReceived();
    ask();
    EXPECT_EQ(dmisp::commandsReceived(), before) << "cached";
    EXPECT_EQ((std::vector<std::string>{ComponentName(component + 100), GroupName(h, component + 100, 1),
                                        AttributeName(h, component, 1, 77)}),
              (std::vector<std::string>{"Unknown Component", "Unknown Group", "Unknown Attribute"}));
    std::vector<uint32_t> keys;
    for (SLKeyList* k = GroupKeyList(h, board, 3); k != nullptr; k = k->next)
        keys.push_back(loadWord(k->keys[0].value));
    EXPECT_EQ(keys, (std::vector<uint32_t>{1, 2, 7}));
    EXPECT_EQ(BaseboardComponentId(), board);
}

TEST_F(Catalogue, ValuesAsTextCutToTheBuffer)
{
    struct Row {
        uint32_t attribute;
        const char* set; // written first when not null
        int len;
        const char* text;
        int result;
    } rows[] = {
        {1, nullptr, 64, "42", 2}, {1, "-12345", 5, "-123", 4}, {1, nullptr, 1, "", 0},
        {1, "-2147483648", 64, "Unsupported", 0}, {1, "-2147483648", 5, "Unsu", 0}, {1, "-2147483647", 64, "-2147483647", 11},
        {2, "2", 64, "Failed", 6}, {2, "1", 2, "O", 1}, {5, nullptr, 64, "7", 1}, {6, nullptr, 64, "99", 2},
        {3, nullptr, 5, "plai", 4}, {3, "caf\xe9 \x80\x7f\xff!", 64, "caf   \x7f !", 9},
        {4, nullptr, 64, "2026-12-06 at 11:30:05 (+060)", 29}, {4, nullptr, 1, "", 0},
        {4, "2026120611", 64, "2026-12-06 at 11:", 17}, {77, nullptr, 64, "        ", 0}, {77, nullptr, 5, "    ", 0},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(std::to_string(row.attribute) + " " + row.text);
        if (row.set != nullptr)
            dmisp::setValue(component, 1, row.attribute, {}, row.set);
        char buffer[80];
        memset(buffer, 'X', sizeof buffer);
        EXPECT_EQ(GetPureValue(h, component, 1, row.attribute, nullptr, buffer, row.len), row.result);
        EXPECT_STREQ(buffer, row.text);
        EXPECT_EQ(buffer[row.len], 'X') << "written past the buffer";
    }
    struct Set {
        uint32_t attribute;
        const char* text;
        int result;
        const char* stored;
    } sets[] = {{2, "Failed", 1, "2"}, {2, "failed", 0, "2"}, {1, "-77abc", 1, "-77"}, {3, "new label", 1, "new label"}};
    for (const auto& s : sets) {
        SCOPED_TRACE(s.text);
        EXPECT_EQ(SetPureValue(h, component, 1, s.attribute, nullptr, s.text), s.result);
        EXPECT_EQ(value(component, 1, s.attribute), s.stored);
    }
    struct Named {
        uint32_t component, group;
        int skip;
        const char* text;
    } named[] = {{board, 3, 1, "3.3V"}, {component, 2, 1, "Fan at the back"}, {board, 5, 0, "        "}};
    for (const auto& n : named) {
        SCOPED_TRACE(n.text);
        SLKeyList* k = GroupKeyList(h, n.component, n.group);
        for (int i = 0; i < n.skip; ++i)
            k = k->next;
        char buffer[64];
        EXPECT_EQ(BaseboardRowName(h, n.component, n.group, k, buffer), n.text[0] == ' ' ? 0 : static_cast<int>(strlen(n.text)));
        EXPECT_STREQ(buffer, n.text);
    }
}

// A confirm whose row claims more attributes than the confirm can hold.
TEST_F(Catalogue, ActionRowCopyClampsAHostileCount)
{
    ASSERT_EQ(SLGetNextRow(h, board, 3, 0, nullptr), 0);
    storeWordAt(const_cast<uint8_t*>(pGetRow(h)), 3, 0xFFFFFFFFu);
    ActionRow* row = GetNewActionRow();
    EXPECT_EQ(FillActionTable(h, row), 0);
    EXPECT_EQ(row->count, 2) << "the two integers of the row";
    DeleteActionTable(row);
}

std::atomic<bool> deliveryRelease{false}, deliveryInside{false};
void slowCompletion(void*)
{
    deliveryInside = true;
    while (!deliveryRelease)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

// Cleanup while one command waits for a confirm that never comes, a second
// waits for the command lock, and the provider is inside the indication
// callback: cleanup returns only after all have left, the waiting command is
// not sent, and the callback, finding no handler, makes no handle.
TEST_F(Catalogue, CleanupWaitsForCommandsAndIndicationsUnderWay)
{
    SLHandle* second = SLCreateHandle(0);
    const uint64_t calls = dmisp::commandsReceived();
    const unsigned strings = slLiveStringCount();
    dmisp::injectNoConfirm(1);
    std::atomic<int> first{-1}, later{-1};
    std::thread a([&] { first = SLListComponent(h, nullptr, board); });
    while (dmisp::commandsReceived() == calls)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    std::thread b([&] { later = SLListComponent(second, nullptr, board); });
    uint32_t indication[13] = {SL_LEVEL_CHECK, 1, 52};
    indication[11] = pointerWord(reinterpret_cast<void*>(&slowCompletion));
    SLEventSetHandler(nullptr); // as cleanup leaves it
    std::thread provider([&] { SLIndicationFunc(indication); });
    std::atomic<bool> cleaned{false};
    while (!deliveryInside)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    EXPECT_EQ(slLiveStringCount(), strings) << "no handle made without a handler";
    std::thread cleanup([&] { SLCleanup(); cleaned = true; });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_FALSE(cleaned.load()) << "returned while the provider was inside the callback";
    deliveryRelease = true;
    for (std::thread* t : {&a, &b, &provider, &cleanup})
        t->join();
    EXPECT_EQ((std::vector<int>{first, later}), (std::vector<int>{1, 1}));
    EXPECT_EQ(dmisp::commandsReceived() - calls, 1u) << "the waiting command was not sent";
    componentList = nullptr; // freed with every other SL block
    managing = false;
    SLInitialize();
    h = SLCreateHandle(0);
}

class Registration : public Provider {
protected:
    static uint32_t own() { return dmisp::componentId("Zorek Tessarin Server Manager - Mox"); }
};

TEST_F(Registration, InstallsTheOwnMifOnceAndCataloguesTheSupported)
{
    ownMifFile(ownMif({}));
    uint32_t board = install(boardMif("Test Board")), other = install(boardMif("Other Board"));
    install(boardMif("test board"));
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(MyComponentId(), own());
    EXPECT_EQ(GetComponentId(1), board);
    EXPECT_EQ(GetMifId(other), 2u);
    int entries = 0;
    for (ComponentInfo* c = componentList; c != nullptr; c = c->next)
        ++entries;
    EXPECT_EQ(entries, 3) << "names match exactly";
    EXPECT_EQ(lines(), (Lines{{LOG_INFO, "MOX - installed mox.mif\n"}}));
    UnregisterWithSL();
    uint64_t installs = dmisp::commandsReceived(1026);
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(dmisp::commandsReceived(1026), installs);
    EXPECT_TRUE(lines().empty());
}

// The provider answers the first listing after `stale` (0: the first one
// after the own entry) with status 512; a stale answer leaves the confirm as
// it was, naming the previous component once more.
uint32_t staleAfter = 0;
bool stale = false, warned = false;
uint32_t listingWith512(void* block)
{
    if (loadWordAt(block, 1) != 514 || warned || (stale && loadWordAt(block, 16) != staleAfter))
        return DmiInvoke(block);
    warned = true;
    if (!stale) {
        dmisp::injectListingStatus512(1);
        return DmiInvoke(block);
    }
    storeWordAt(block, 11, 512);
    dmiConfirmFunc(block);
    return 0;
}

TEST_F(Registration, ListingsWithStatus512AndFailures)
{
    ownMifFile(ownMif({}));
    uint32_t board = install(boardMif("Test Board"));
    ASSERT_EQ(RegisterWithSL(), 0);
    staleAfter = std::max(board, own());
    for (bool s : {false, true}) {
        SCOPED_TRACE(s ? "stale" : "status 512 with an entry");
        UnregisterWithSL();
        stale = s;
        warned = false;
        SLDmiInvoke = listingWith512;
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_TRUE(warned);
        EXPECT_EQ(BaseboardComponentId(), board);
        EXPECT_EQ(componentList->next->next, nullptr) << "the walk ends";
    }
    SLDmiInvoke = DmiInvoke;
    UnregisterWithSL();
    dmisp::injectRefuse(1);
    EXPECT_EQ(RegisterWithSL(), 2);
    freshDatabase("empty");
    setenv("UXDMIPATH", (dir + "/nothing").c_str(), 1);
    EXPECT_EQ(RegisterWithSL(), 3);
    EXPECT_EQ(componentList, nullptr);
}

TEST(CarryOverBands, VersionsPickTheirGroups)
{
    struct Row {
        const char* version;
        bool migrates;
        int keyFormat, read, written;
    } rows[] = {{"2.50", true, 0, 3, 4},   {"2.51", true, 1, 4, 4},  {"2.90", true, 1, 4, 4},
                {"2.91", true, 2, 10, 10}, {"2.92", true, 2, 10, 10}, {"2.93", false, 0, 0, 0},
                {"abc", true, 0, 3, 4},    {"nan", false, 0, 0, 0}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.version);
        CarryOverBand band{0, 0, 0};
        ASSERT_EQ(moxCarryOverBand(static_cast<float>(atof(row.version)), &band), row.migrates);
        EXPECT_EQ((std::vector<int>{band.keyFormat, band.groupRead, band.groupWritten}),
                  (std::vector<int>{row.keyFormat, row.read, row.written}));
    }
}

// Old own MIFs whose three tables hold distinct settings (7, 8, enable):
// group 3 (1, 0, 0), group 4 (0, 1, 0), group 10 (1, 1, 0); the new one
// holds (0, 0, 1) and the alert "new".
const std::string vendorKeys = "1, 33, 3, 0, -2147483648", standardKeys = "1, 50, 1, 0, 0, 4";
std::string oldOwnMif(const std::string& version)
{
    OwnMif m;
    m.version = version;
    m.group3 = {actionRow(vendorKeys + ", 0", {7}, ""), actionRow("2, 2, 2, 2, 2, 1", {7, 8}, "")};
    m.vendor = {actionRow(vendorKeys + ", 0", {8}, ", 0", 16, "old")};
    m.standard = {actionRow(standardKeys, {7, 8}, ", 0, 7, 8", 16, "old")};
    return ownMif(m);
}

class CarryOver : public Registration {
protected:
    std::vector<std::string> row(uint32_t group, std::vector<std::string> keys)
    {
        return {value(own(), group, 7, keys), value(own(), group, 8, keys), value(own(), group, 30, keys),
                value(own(), group, 17, keys)};
    }
    std::vector<std::string> vendorRow() { return row(4, {"1", "33", "3", "0", "-2147483648", "0"}); }
    std::vector<std::string> standardRow() { return row(10, {"1", "50", "1", "0", "0", "4", "7", "8"}); }
    void SetUp() override
    {
        Registration::SetUp();
        OwnMif m;
        m.vendor = {actionRow(vendorKeys + ", 0", {}, ", 1", 16, "new")};
        m.standard = {actionRow(standardKeys, {}, ", 1, 7, 8", 16, "new")};
        ownMifFile(ownMif(m));
    }
};

TEST_F(CarryOver, EachBandCarriesItsGroup)
{
    const std::vector<std::string> fresh{"0", "0", "1", "new"};
    struct Row {
        const char* version;
        std::vector<std::string> vendor, standard;
    } rows[] = {
        {"2.50", {"1", "0", "0", "new"}, fresh}, {"2.51", {"0", "1", "0", "new"}, fresh},
        {"2.92", fresh, {"1", "1", "0", "new"}},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(r.version);
        freshDatabase(r.version);
        install(oldOwnMif(r.version));
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_EQ(value(own(), 1, 3), "2.93");
        EXPECT_EQ(vendorRow(), r.vendor);
        EXPECT_EQ(standardRow(), r.standard);
    }
    // The current version, or no new file to read: nothing is uninstalled.
    for (const char* v : {"2.93", "2.60"}) {
        SCOPED_TRACE(v);
        freshDatabase(std::string("kept") + v);
        if (std::string(v) == "2.60")
            setenv("UXDMIPATH", (dir + "/nothing").c_str(), 1);
        uint32_t before = install(oldOwnMif(v));
        uint64_t removals = dmisp::commandsReceived(1027);
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_EQ(dmisp::commandsReceived(1027), removals);
        EXPECT_EQ(own(), before);
        EXPECT_EQ(value(own(), 1, 3), v);
    }
}

bool uninstalled = false;
uint32_t refuseReinstall(void* block)
{
    if (loadWordAt(block, 1) == 1027)
        uninstalled = true;
    else if (loadWordAt(block, 1) == 1026 && uninstalled)
        dmisp::injectRefuse(1);
    return DmiInvoke(block);
}

TEST_F(CarryOver, FailedReinstallIsFailureThreeAndKeylessRowsEndTheCopy)
{
    install(oldOwnMif("2.40"));
    uninstalled = false;
    SLDmiInvoke = refuseReinstall;
    EXPECT_EQ(RegisterWithSL(), 3);
    EXPECT_TRUE(dmisp::components().empty());
    SLDmiInvoke = DmiInvoke;

    freshDatabase("keyless");
    install(oldOwnMif("2.93"));
    ASSERT_EQ(RegisterWithSL(), 0);
    // The ComponentID group has no keys: asking for the row after "no keys"
    // would give the first row again.
    moxActionTableGroup = 1;
    ActionRow* first = GetNewActionRow();
    EXPECT_EQ(ReadMOXActionsTable(h, first), 0);
    EXPECT_EQ(first->next, nullptr);
    EXPECT_EQ(WriteMOXActionsTable(h, first), 0) << "a row without keys is not written";
    DeleteActionTable(first);
    SLKeyList k{};
    k.count = 5;
    uint32_t zero = 0;
    moxNewKeyFormat = 0;
    EXPECT_EQ(ModifyKeyList(&k, &zero), 0);
    EXPECT_EQ(k.count, 6u);
    EXPECT_EQ(ModifyKeyList(&k, &zero), -1) << "six keys are not widened again";
}

} // namespace
