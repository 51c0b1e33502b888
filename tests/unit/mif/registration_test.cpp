#include <cmath>
#include <cstdlib>
#include <cstring>
#include <map>
#include <syslog.h>

#include "mif/mif.h"
#include "ownmif.h"
#include "providerenv.h"
#include "sl/slkey.h"
#include "sl/slstring.h"

namespace {

const char moxName[] = "Zorek Tessarin Server Manager - Mox";

class Registration : public ProviderTest {
protected:
    uint32_t own() { return dmisp::componentId(moxName); }

    std::string value(uint32_t group, uint32_t attribute, const std::vector<std::string>& keys)
    {
        std::string v;
        uint32_t status = dmisp::getValue(own(), group, attribute, keys, &v);
        return status == 0 ? v : "status " + std::to_string(status);
    }

    std::string version() { return value(1, 3, {}); }

    int installedLines()
    {
        int n = 0;
        for (const auto& [priority, text] : loggedLines())
            n += priority == LOG_INFO && text == "MOX - installed mox.mif\n";
        return n;
    }
};

TEST_F(Registration, InstallsTheOwnMifOnceAndCataloguesIt)
{
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(registered, 1);
    EXPECT_NE(own(), 0u);
    EXPECT_EQ(MyComponentId(), own());
    EXPECT_STREQ(ComponentName(own()), moxName);
    EXPECT_EQ(installedLines(), 1);
    EXPECT_EQ(dmisp::registrations(), 1u);

    // A second start finds it and neither installs nor migrates.
    UnregisterWithSL();
    EXPECT_EQ(dmisp::registrations(), 0u);
    EXPECT_EQ(componentList, nullptr);
    uint64_t installs = dmisp::commandsReceived(1026), removals = dmisp::commandsReceived(1027);
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(installedLines(), 1);
    EXPECT_EQ(dmisp::commandsReceived(1026), installs);
    EXPECT_EQ(dmisp::commandsReceived(1027), removals);
}

TEST_F(Registration, FailuresGiveTheirCodes)
{
    // Registration refused.
    dmisp::injectRefuse(1);
    EXPECT_EQ(RegisterWithSL(), 2);
    EXPECT_EQ(registered, 0);
    UnregisterWithSL();
    // No own MIF and none to install.
    setenv("UXDMIPATH", (dir + "/nothing").c_str(), 1);
    EXPECT_EQ(RegisterWithSL(), 3);
    EXPECT_EQ(componentList, nullptr);
    EXPECT_EQ(installedLines(), 0);
}

TEST_F(Registration, CataloguesSupportedComponents)
{
    std::string error;
    uint32_t baseboard = dmisp::install(MOX_SOURCE_DIR "/mifs/baseboard.mif", &error);
    ASSERT_NE(baseboard, 0u) << error;
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(BaseboardComponentId(), baseboard);
    EXPECT_EQ(GetMifId(baseboard), 1u);
    EXPECT_STREQ(ComponentName(baseboard), "Zorek Tessarin Baseboard");
    EXPECT_EQ(IsStandardEventSupported(baseboard), 1u);
    EXPECT_EQ(IsStandardEventSupported(own()), 0u);
    int entries = 0;
    for (ComponentInfo* c = componentList; c != nullptr; c = c->next)
        ++entries;
    EXPECT_EQ(entries, 2) << "the own component and the baseboard";

    // Installed again while the daemon runs: a second entry, the first answers.
    DmiString* name = NewDmiString("Zorek Tessarin Baseboard");
    AddComponentToList(name, 4242);
    SLDeleteString(name);
    EXPECT_EQ(GetComponentId(1), baseboard);
    ASSERT_NE(componentList->next->next, nullptr);
    EXPECT_EQ(componentList->next->next->componentId, 4242u);
}

// Makes the first component listing of the supported-components walk (the
// first one after the own entry was named) answer with status 512.
bool entryNamed = false;
bool warned = false;
uint32_t warnFirstWalkStep(void* block)
{
    uint32_t code = loadWordAt(block, 1);
    if (code == 512)
        entryNamed = true;
    else if (code == 514 && entryNamed && !warned) {
        warned = true;
        dmisp::injectListingStatus512(1);
    }
    return DmiInvoke(block);
}

TEST_F(Registration, ListingWithStatus512StillAddsTheComponent)
{
    std::string error;
    uint32_t baseboard = dmisp::install(MOX_SOURCE_DIR "/mifs/baseboard.mif", &error);
    ASSERT_NE(baseboard, 0u) << error;
    entryNamed = warned = false;
    SLDmiInvoke = warnFirstWalkStep;
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_TRUE(warned);
    EXPECT_EQ(BaseboardComponentId(), baseboard) << "listed first, with status 512";
}

// A provider that answers the listing after `staleAfter` with status 512 and
// leaves the confirm as it was: the previous component once more.
uint32_t staleAfter = 0;
unsigned staleAnswers = 0;
uint32_t staleListing(void* block)
{
    if (loadWordAt(block, 1) == 514 && loadWordAt(block, 16) == staleAfter) {
        ++staleAnswers;
        storeWordAt(block, 11, 512);
        dmiConfirmFunc(block);
        return 0;
    }
    return DmiInvoke(block);
}

TEST_F(Registration, StaleListingEndsTheWalk)
{
    std::string error;
    uint32_t baseboard = dmisp::install(MOX_SOURCE_DIR "/mifs/baseboard.mif", &error);
    ASSERT_NE(baseboard, 0u) << error;
    ASSERT_EQ(RegisterWithSL(), 0);
    UnregisterWithSL();
    staleAfter = std::max(baseboard, own());
    staleAnswers = 0;
    SLDmiInvoke = staleListing;
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_GE(staleAnswers, 1u);
    EXPECT_LE(staleAnswers, 2u) << "one stale answer per walk";
    int entries = 0;
    for (ComponentInfo* c = componentList; c != nullptr; c = c->next)
        ++entries;
    EXPECT_EQ(entries, 2);
}

class SupportedRows : public Registration {
protected:
    void start(const std::vector<std::string>& supported)
    {
        ownmif::Rows rows;
        rows.supported = supported;
        install(ownmif::text("2.93", rows));
        ASSERT_EQ(RegisterWithSL(), 0);
    }
    size_t entries()
    {
        size_t n = 0;
        for (ComponentInfo* c = componentList; c != nullptr; c = c->next)
            ++n;
        return n;
    }
    void add(const char* name, uint32_t id)
    {
        DmiString* s = NewDmiString(name);
        AddComponentToList(s, id);
        SLDeleteString(s);
    }
};

TEST_F(SupportedRows, NameMustMatchExactly)
{
    start({"1, \"Zorek Tessarin Baseboard\"", "7, \"Storage Shelf\""});
    add("zorek tessarin baseboard", 900);
    add("Zorek Tessarin Baseboard ", 901);
    add("Storage Shel", 902);
    AddComponentToList(nullptr, 903);
    EXPECT_EQ(entries(), 1u);
    add("Storage Shelf", 904);
    EXPECT_EQ(GetMifId(904), 7u);
    add("Zorek Tessarin Baseboard", 905);
    EXPECT_EQ(GetMifId(905), 1u);
    EXPECT_EQ(entries(), 3u);
}

TEST_F(SupportedRows, RowWithoutNameEndsTheSearch)
{
    start({"1, \"Zorek Tessarin Baseboard\"", "3, unknown", "7, \"Storage Shelf\""});
    add("Storage Shelf", 900);
    EXPECT_EQ(entries(), 1u) << "rows behind a nameless row are not reached";
    add("Zorek Tessarin Baseboard", 901);
    EXPECT_EQ(GetMifId(901), 1u);
}

TEST_F(SupportedRows, EmptyTableSupportsNothing)
{
    start({});
    add("Zorek Tessarin Baseboard", 900);
    EXPECT_EQ(entries(), 1u);
}

TEST(CarryOverBands, VersionTextsPickTheirGroups)
{
    struct Case {
        const char* version;
        bool migrates;
        int keyFormat, read, written;
    } cases[] = {
        {"2.40", true, 0, 3, 4},  {"2.50", true, 0, 3, 4},   {"2.51", true, 1, 4, 4},
        {"2.510", true, 1, 4, 4}, {"2.60", true, 1, 4, 4},   {"2.90", true, 1, 4, 4},
        {"2.91", true, 2, 10, 10}, {"2.92", true, 2, 10, 10}, {"2.93", false, 0, 0, 0},
        {"3.0", false, 0, 0, 0},  {"abc", true, 0, 3, 4},    {"nan", false, 0, 0, 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.version);
        CarryOverBand band{-1, -1, -1};
        ASSERT_EQ(moxCarryOverBand(static_cast<float>(atof(c.version)), &band), c.migrates);
        if (c.migrates) {
            EXPECT_EQ(band.keyFormat, c.keyFormat);
            EXPECT_EQ(band.groupRead, c.read);
            EXPECT_EQ(band.groupWritten, c.written);
        }
    }
}

// Carry-over between test MIFs: the old one installed, the new one in a MIF
// directory of its own.
class CarryOver : public Registration {
protected:
    void SetUp() override
    {
        Registration::SetUp();
        setenv("UXDMIPATH", mifDirectoryWith("mox.mif", ownmif::current()).c_str(), 1);
    }

    // (7, 8, enable) of the new MIF's vendor and standard rows.
    std::vector<std::string> vendorRow()
    {
        std::vector<std::string> k{"1", "33", "3", "0", "-2147483648", "0"};
        return {value(4, 7, k), value(4, 8, k), value(4, 30, k), value(4, 17, k)};
    }
    std::vector<std::string> standardRow()
    {
        std::vector<std::string> k{"1", "50", "1", "0", "0", "4", "7", "8"};
        return {value(10, 7, k), value(10, 8, k), value(10, 30, k), value(10, 17, k)};
    }
};

const std::vector<std::string> vendorDefault{"0", "0", "1", "new alert"};
const std::vector<std::string> standardDefault{"0", "0", "1", "new alert"};

TEST_F(CarryOver, EachBandReadsItsGroup)
{
    struct Case {
        const char* version;
        std::vector<std::string> vendor, standard;
    } cases[] = {
        {"2.50", {"1", "0", "0", "new alert"}, standardDefault},
        {"abc", {"1", "0", "0", "new alert"}, standardDefault},
        {"2.51", {"0", "1", "0", "new alert"}, standardDefault},
        {"2.90", {"0", "1", "0", "new alert"}, standardDefault},
        {"2.91", vendorDefault, {"1", "1", "0", "new alert"}},
        {"2.92", vendorDefault, {"1", "1", "0", "new alert"}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.version);
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db-" + c.version, false, &error), 0) << error;
        install(ownmif::old(c.version));
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_EQ(version(), "2.93");
        EXPECT_EQ(vendorRow(), c.vendor);
        EXPECT_EQ(standardRow(), c.standard);
        UnregisterWithSL();
    }
}

TEST_F(CarryOver, CurrentVersionIsLeftAlone)
{
    for (const char* v : {"2.93", "nan"}) {
        SCOPED_TRACE(v);
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db-" + v, false, &error), 0) << error;
        install(ownmif::old(v));
        uint32_t before = own();
        ASSERT_EQ(RegisterWithSL(), 0);
        EXPECT_EQ(dmisp::commandsReceived(1027), 0u);
        EXPECT_EQ(own(), before);
        EXPECT_EQ(version(), v);
        UnregisterWithSL();
    }
}

TEST_F(CarryOver, MissingNewMifKeepsTheOldOne)
{
    setenv("UXDMIPATH", (dir + "/empty").c_str(), 1);
    install(ownmif::old("2.60"));
    uint32_t before = own();
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(dmisp::commandsReceived(1027), 0u) << "nothing uninstalled";
    EXPECT_EQ(own(), before);
    EXPECT_EQ(version(), "2.60");
    EXPECT_EQ(MyComponentId(), before);
}

// Refuses the uninstall, or the install that follows it.
bool refuseUninstall = false;
bool uninstalled = false;
uint32_t refuseAfterUninstall(void* block)
{
    uint32_t code = loadWordAt(block, 1);
    if (code == 1027) {
        if (refuseUninstall)
            dmisp::injectRefuse(1);
        uninstalled = true;
    } else if (code == 1026 && uninstalled) {
        dmisp::injectRefuse(1);
    }
    return DmiInvoke(block);
}

TEST_F(CarryOver, FailedReinstallEndsInFailureThree)
{
    install(ownmif::old("2.40"));
    refuseUninstall = false;
    uninstalled = false;
    SLDmiInvoke = refuseAfterUninstall;
    EXPECT_EQ(RegisterWithSL(), 3);
    EXPECT_EQ(componentList, nullptr);
    EXPECT_EQ(own(), 0u);
    EXPECT_TRUE(dmisp::components().empty()) << "no table written anywhere";
}

TEST_F(CarryOver, FailedUninstallKeepsTheOldOne)
{
    install(ownmif::old("2.60"));
    uint32_t before = own();
    refuseUninstall = true;
    uninstalled = false;
    SLDmiInvoke = refuseAfterUninstall;
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(own(), before);
    EXPECT_EQ(version(), "2.60");
    EXPECT_EQ(dmisp::commandsReceived(1026), 0u);
}

TEST_F(CarryOver, RowsWithoutKeysEndTheRead)
{
    install(ownmif::old("2.93"));
    ASSERT_EQ(RegisterWithSL(), 0);
    // The ComponentID group has no keys: the first row has no key list, and
    // asking for the row after "no keys" would give the first row again.
    moxNewKeyFormat = 0;
    moxActionTableGroup = 1;
    ActionRow* first = GetNewActionRow();
    ASSERT_NE(first, nullptr);
    uint64_t before = dmisp::commandsReceived();
    EXPECT_EQ(ReadMOXActionsTable(h, first), 0);
    EXPECT_LT(dmisp::commandsReceived() - before, 20u);
    EXPECT_EQ(first->keyList, nullptr);
    EXPECT_EQ(first->next, nullptr);
    EXPECT_EQ(WriteMOXActionsTable(h, first), 0) << "a row without keys is not written";
    EXPECT_EQ(DeleteActionTable(first), 0);
}

TEST_F(CarryOver, ReadCopiesIntegerAttributesAndKeys)
{
    install(ownmif::old("2.93"));
    ASSERT_EQ(RegisterWithSL(), 0);
    moxNewKeyFormat = 0;
    moxActionTableGroup = 3;
    ActionRow* first = GetNewActionRow();
    ASSERT_EQ(ReadMOXActionsTable(h, first), 0);
    ASSERT_NE(first->next, nullptr);
    EXPECT_EQ(first->next->next, nullptr);
    std::map<uint32_t, int32_t> pairs;
    for (int i = 0; i < first->count; ++i)
        pairs[first->pairs[i].attributeId] = first->pairs[i].value;
    EXPECT_EQ(pairs, (std::map<uint32_t, int32_t>{
                         {1, 1}, {2, 33}, {3, 3}, {4, 0}, {5, INT32_MIN}, {6, 0}, {7, 1}, {8, 0}}))
        << "attribute 17 is a string and is not kept";
    ASSERT_NE(first->keyList, nullptr);
    EXPECT_EQ(first->keyList->count, 5u);
    EXPECT_EQ(DeleteActionTable(first), 0);
}

TEST(ActionRows, KeyListWideningAndArguments)
{
    SLKeyList k{};
    k.count = 5;
    for (uint32_t i = 0; i < 5; ++i)
        k.keys[i] = SLKeyEntry{i + 1, 5, nullptr};
    uint32_t zero = 0;
    moxNewKeyFormat = 1;
    EXPECT_EQ(ModifyKeyList(&k, &zero), 0);
    EXPECT_EQ(k.count, 5u) << "only the group-3 layout is widened";
    EXPECT_EQ(ModifyKeyList(nullptr, &zero), 0);
    moxNewKeyFormat = 0;
    EXPECT_EQ(ModifyKeyList(&k, &zero), 0);
    EXPECT_EQ(k.count, 6u);
    EXPECT_EQ(k.firstWord, 4u);
    EXPECT_EQ(k.keys[5].attributeId, 6u);
    EXPECT_EQ(k.keys[5].type, 5u);
    EXPECT_EQ(k.keys[5].value, &zero);
    EXPECT_EQ(ModifyKeyList(&k, &zero), -1) << "six keys are not widened again";
    EXPECT_EQ(UnModifyKeyList(&k), 0);
    EXPECT_EQ(k.count, 5u);
    EXPECT_EQ(k.keys[5].value, nullptr);
    EXPECT_EQ(ModifyKeyList(nullptr, &zero), -1);
    EXPECT_EQ(UnModifyKeyList(nullptr), -1);

    EXPECT_EQ(DeleteActionTable(nullptr), 1);
    EXPECT_EQ(FillActionTable(nullptr, nullptr), 1);
    EXPECT_EQ(ReadMOXActionsTable(nullptr, nullptr), 1);
    EXPECT_EQ(WriteMOXActionsTable(nullptr, nullptr), 1);
    ActionRow* row = GetNewActionRow();
    ASSERT_NE(row, nullptr);
    EXPECT_EQ(row->count, 0);
    EXPECT_EQ(row->pairs, nullptr);
    EXPECT_EQ(row->keyList, nullptr);
    EXPECT_EQ(row->next, nullptr);
    EXPECT_EQ(DeleteActionTable(row), 0);
}

} // namespace
