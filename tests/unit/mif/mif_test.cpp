// Catalogue, value formatting, registration and the carry-over of the actions
// tables, against the substitute provider.
#include <cstring>
#include <syslog.h>

#include "base/bytes.h"
#include "mif/basebrd.h"
#include "mif/format.h"
#include "provider.h"
#include "sl/slaccess.h"
#include "sl/slstring.h"

namespace {

using Texts = std::vector<std::string>;

std::string attr(int id, const char* name, const char* type, const char* value) { return attribute(id, type, value, name); }

// Scalars of every converted type (group 1), a table named by its description (2).
const std::string scalarsMif = mifComponent(
    "Catalogue Test",
    {"start group\n name = \"Scalars\"\n class = \"T|S|1\"\n id = 1\n" + attr(1, "Count", "integer", "42") +
         attr(2, "State", "start enum\n 0 = \"Off\"\n 1 = \"On\"\n 2 = \"Failed\"\n end enum", "0") +
         attr(3, "Label", "displaystring(64)", "\"plain text\"") + attr(4, "When", "date", "\"20261206113005.123456+060\"") +
         attr(5, "Events", "counter", "7") + attr(6, "Level", "gauge", "99") + "end group\n",
     "start group\n name = \"Described\"\n class = \"T|D|1\"\n id = 2\n key = 1\n" + attr(1, "Index", "integer", "0") +
         attr(2, "Description", "displaystring(64)", "\"\"") +
         "end group\nstart table\n name = \"Described\"\n class = \"T|D|1\"\n id = 2\n { 1, \"Fan in front\" }\n"
         " { 2, \"Fan at the back\" }\nend table\n"});

unsigned commandsSent = 0;

TEST_F(Provider, CatalogueValuesRowNamesAndActionRows)
{
    uint32_t component = install(scalarsMif), board = install(boardMif("Test Board"));
    manage();
    catalogue(component, 0);
    catalogue(board, 1);
    struct Row { uint32_t attribute; const char* set; int len; const char* text; int result; } rows[] = {
        {1, nullptr, 64, "42", 2}, {1, "-12345", 5, "-123", 4}, {1, nullptr, 1, "", 0},
        {1, "-2147483648", 64, "Unsupported", 0}, {1, nullptr, 5, "Unsu", 0}, {1, "-2147483647", 64, "-2147483647", 11},
        {2, "2", 64, "Failed", 6}, {2, "1", 2, "O", 1}, {5, nullptr, 64, "7", 1}, {6, nullptr, 64, "99", 2},
        {3, nullptr, 5, "plai", 4}, {3, "caf\xe9 \x80\x7f\xff!", 64, "caf   \x7f !", 9},
        {4, nullptr, 64, "2026-12-06 at 11:30:05 (+060)", 29}, {4, nullptr, 1, "", 0},
        {4, "2026120611", 64, "2026-12-06 at 11:", 17}, {77, nullptr, 64, "        ", 0}, {77, nullptr, 5, "    ", 0}};
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
    // Enumeration texts are matched exactly when set.
    for (auto [text, result, stored] : {std::tuple{"failed", 0, "1"}, {"Failed", 1, "2"}}) {
        EXPECT_EQ(SetPureValue(h, component, 1, 2, nullptr, text), result);
        EXPECT_EQ(value(component, 1, 2), stored);
    }
    // A provider listing one value twice (attribute 99: "First", then "Second" for 1): the text
    // listed later wins. Asked again, or about a component not catalogued, nothing is sent.
    SLDmiInvoke = [](void* block) -> uint32_t {
        if (++commandsSent, loadWordAt(block, 1) != 520 || loadWordAt(block, 18) != 99)
            return DmiInvoke(block);
        const uint32_t words[] = {99, 44, 1, 5, 4, 2, 28, 1, 53, 1, 62}; // attribute 99, two entries at 28
        auto* confirm = static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8)));
        memcpy(confirm, words, sizeof words);
        memcpy(confirm + 44, "\5\0\0\0Twice\5\0\0\0First\6\0\0\0Second", 28); // name and texts
        storeWordAt(block, 10, 1), storeWordAt(block, 11, 0);
        return dmiConfirmFunc(block), 0;
    };
    EXPECT_STREQ(AttributeEnumerationString(h, component, 1, 99, 1), "Second");
    commandsSent = 0;
    EXPECT_STREQ(AttributeEnumerationString(h, component, 1, 99, 1), "Second");
    EXPECT_STREQ(AttributeName(h, 999, 1, 1), "Unknown Attribute");
    EXPECT_EQ(commandsSent, 0u);
    SLDmiInvoke = DmiInvoke;
    // Rows by Short Name, by Description, or neither (second rows of 3 and 2).
    for (auto [c, group, text] : {std::tuple{board, 3u, "3.3V"}, {component, 2u, "Fan at the back"}, {board, 5u, "        "}}) {
        SLKeyList* k = GroupKeyList(h, c, group);
        char buffer[64];
        EXPECT_EQ(BaseboardRowName(h, c, group, k->next != nullptr ? k->next : k, buffer), text[0] == ' ' ? 0 : int(strlen(text)));
        EXPECT_STREQ(buffer, text);
    }
    // A row claiming more attributes than its confirm can hold.
    ASSERT_EQ(SLGetNextRow(h, board, 3, 0, nullptr), 0);
    storeWordAt(const_cast<uint8_t*>(pGetRow(h)), 3, 0xFFFFFFFFu);
    ActionRow* row = GetNewActionRow();
    EXPECT_EQ(FillActionTable(h, row), 0);
    EXPECT_EQ(row->count, 2) << "the two integers of the row";
    DeleteActionTable(row);

}

uint32_t own() { return dmisp::componentId("Zorek Tessarin Server Manager - Mox"); }

// The first listing after the own entry (stale: after `staleAfter`) answers
// with status 512; a stale answer leaves the previous component in the confirm.
uint32_t staleAfter = 0;
bool stale = false, warned = false, ownNamed = false;
uint32_t listingWith512(void* block)
{
    ownNamed = ownNamed || loadWordAt(block, 1) == 512;
    if (loadWordAt(block, 1) != 514 || warned || !ownNamed || (stale && loadWordAt(block, 16) != staleAfter))
        return DmiInvoke(block);
    warned = true;
    if (!stale)
        return dmisp::injectListingStatus512(1), DmiInvoke(block);
    storeWordAt(block, 11, 512);
    return dmiConfirmFunc(block), 0;
}

TEST_F(Provider, RegistrationInstallsOnceListingsWithStatus512AndFailures)
{
    ownMifFile(ownMif({}));
    uint32_t board = install(boardMif("Test Board"));
    install(boardMif("test board"));
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(lines(), (Lines{{LOG_INFO, "MOX - installed mox.mif\n"}}));
    staleAfter = std::max(board, own());
    for (bool s : {false, true}) {
        UnregisterWithSL();
        stale = s;
        warned = ownNamed = false;
        SLDmiInvoke = listingWith512;
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_TRUE(warned);
        ASSERT_EQ(BaseboardComponentId(), board) << s;
        EXPECT_EQ(componentList->next->next, nullptr) << "one entry each; names match exactly " << s;
    }
    SLDmiInvoke = DmiInvoke;
    UnregisterWithSL();
    dmisp::injectRefuse(1);
    EXPECT_EQ(RegisterWithSL(), 2);
    freshDatabase();
    setenv("UXDMIPATH", (dir + "/nothing").c_str(), 1);
    EXPECT_EQ(RegisterWithSL(), 3);
    RegisterWithSLCalls({}); // no indication handler: refused before the provider hears of it
    const uint64_t sent = dmisp::commandsReceived();
    EXPECT_EQ(RegisterWithSL(), 2);
    EXPECT_EQ(dmisp::commandsReceived(), sent);
}

// Old own MIFs whose three tables hold distinct settings (7, 8, enable):
// group 3 (1, 0, 0), group 4 (0, 1, 0), group 10 (1, 1, 0); the new one
// holds (0, 0, 1) and the alert "new".
const std::string vendorKeys = "1, 33, 3, 0, -2147483648", standardKeys = "1, 50, 1, 0, 0, 4";
std::string ownMifWith(const std::string& version, const char* alert, std::initializer_list<int> group4,
                       std::initializer_list<int> group10, std::vector<std::string> group3 = {})
{
    const char* enable = group3.empty() && version == "2.93" ? "1" : "0";
    return ownMif({version, {"1, \"Test Board\""}, group3,
                   {actionRow(vendorKeys + ", 0", group4, std::string(", ") + enable, 16, alert)},
                   {actionRow(standardKeys, group10, std::string(", ") + enable + ", 7, 8", 16, alert)}});
}
std::string oldOwnMif(const std::string& version)
{
    return ownMifWith(version, "old", {8}, {7, 8}, {actionRow(vendorKeys + ", 0", {7}, ""), actionRow("2, 2, 2, 2, 2, 1", {7}, "")});
}

TEST_F(Provider, CarryOverBandsFailuresAndKeylessRows)
{
    ownMifFile(ownMifWith("2.93", "new", {}, {}));
    const Texts fresh{"0", "0", "1", "new"};
    struct Row { const char* version; Texts vendor, standard; } rows[] = {
        {"2.50", {"1", "0", "0", "new"}, fresh}, {"2.51", {"0", "1", "0", "new"}, fresh},
        {"2.91", fresh, {"1", "1", "0", "new"}},
        {"2.92", fresh, {"1", "1", "0", "new"}}, {"none", {"1", "0", "0", "new"}, fresh}}; // no digits: read as 0
    for (const auto& r : rows) {
        SCOPED_TRACE(r.version);
        freshDatabase();
        install(oldOwnMif(r.version));
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_EQ(value(own(), 1, 3), "2.93");
        // Attributes 7, 8, 30 and 17 of each row.
        for (uint32_t i = 0; i < 4; ++i) {
            uint32_t a = std::vector<uint32_t>{7, 8, 30, 17}[i];
            EXPECT_EQ(value(own(), 4, a, {"1", "33", "3", "0", "-2147483648", "0"}), r.vendor[i]) << a;
            EXPECT_EQ(value(own(), 10, a, {"1", "50", "1", "0", "0", "4", "7", "8"}), r.standard[i]) << a;
        }
    }
    // The current version, a version that is not a number, or no new file to read: nothing is uninstalled.
    for (const char* v : {"2.93", "nan", "2.60"}) {
        freshDatabase();
        if (v[2] == '6')
            setenv("UXDMIPATH", (dir + "/nothing").c_str(), 1);
        uint32_t before = install(oldOwnMif(v));
        uint64_t removals = dmisp::commandsReceived(1027);
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_EQ(dmisp::commandsReceived(1027), removals) << v;
        EXPECT_EQ(own(), before) << v;
    }
    // The ComponentID group has no keys: the row after "no keys" would be the first again.
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
    EXPECT_EQ(ModifyKeyList(&k, &zero), -1) << "six keys are not widened again";
}

} // namespace
