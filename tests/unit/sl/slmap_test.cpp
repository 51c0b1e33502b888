#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "scripted_provider.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

using sltest::ConfirmWriter;
using sltest::Reply;
using sltest::ScriptedProvider;

struct Attribute {
    uint32_t id;
    std::string name;
    std::string value; // a DMI string value
};

struct Group {
    uint32_t id;
    std::string name;
    std::string className;
    std::vector<Attribute> attributes;
};

struct Component {
    uint32_t id;
    std::string name;
    std::vector<Group> groups;
};

// A provider database answered through the scripted provider: the list
// commands for one entry (the one named, or the next after the one named)
// and get-attribute of a string value. Anything else, or a missing entry,
// gets status 2.
class Database {
public:
    std::vector<Component> components;

    Reply answer(const uint8_t* block) const
    {
        uint32_t code = loadWordAt(block, 1);
        uint32_t w16 = loadWordAt(block, 16), w17 = loadWordAt(block, 17), w18 = loadWordAt(block, 18);
        uint32_t w20 = loadWordAt(block, 20);
        Reply reply;
        reply.status = 2;
        reply.count = 0;
        auto found = [&](std::function<void(ConfirmWriter&)> write) {
            reply.status = 0;
            reply.count = 1;
            reply.fill = [write](uint8_t* confirm, uint32_t size) {
                ConfirmWriter w{confirm, size};
                write(w);
            };
        };
        switch (code) {
        case 512:
        case 514:
            if (const Component* c = pick(components, w16, code == 514))
                found([c](ConfirmWriter& w) {
                    w.word(0, c->id);
                    w.word(8, c->name.empty() ? 0 : 100);
                    w.string(100, c->name);
                });
            break;
        case 516:
        case 518:
            if (const Component* c = find(components, w16))
                if (const Group* g = pick(c->groups, w17, code == 518))
                    found([g](ConfirmWriter& w) {
                        w.word(0, g->id);
                        w.word(4, g->name.empty() ? 0 : 100);
                        w.word(8, g->className.empty() ? 0 : 200);
                        w.string(100, g->name);
                        w.string(200, g->className);
                    });
            break;
        case 520:
        case 522:
            if (const Component* c = find(components, w16))
                if (const Group* g = find(c->groups, w17))
                    if (const Attribute* a = pick(g->attributes, w18, code == 522))
                        found([a](ConfirmWriter& w) {
                            w.word(0, a->id);
                            w.word(4, 100);
                            w.string(100, a->name);
                        });
            break;
        case 768:
            if (const Component* c = find(components, w16))
                if (const Group* g = find(c->groups, w17))
                    if (const Attribute* a = find(g->attributes, w20))
                        found([a](ConfirmWriter& w) {
                            w.word(8, DMI_DISPLAYSTRING);
                            w.word(12, a->value.empty() ? 0 : 100);
                            w.string(100, a->value);
                        });
            break;
        default:
            break;
        }
        return reply;
    }

private:
    template <typename T>
    static const T* find(const std::vector<T>& list, uint32_t id)
    {
        for (const T& item : list)
            if (item.id == id)
                return &item;
        return nullptr;
    }
    // The entry named, or for a list-next command the one after it (after 0:
    // the first).
    template <typename T>
    static const T* pick(const std::vector<T>& list, uint32_t id, bool next)
    {
        if (!next)
            return find(list, id);
        if (id == 0)
            return list.empty() ? nullptr : &list[0];
        for (size_t i = 0; i + 1 < list.size(); ++i)
            if (list[i].id == id)
                return &list[i + 1];
        return nullptr;
    }
};

Database sampleDatabase()
{
    Database db;
    db.components = {
        {1, "Baseboard", {{1, "ComponentID", "DMTF|ComponentID|001", {{1, "Manufacturer", "Zorek"}, {3, "Version", "2.9"}}}}},
        {4, "Mox", {{2, "Other", "Zorek|Other|001", {}},
                    {5, "ComponentID", "DMTF|ComponentID|001", {{3, "Version", "2.90"}}},
                    {9, "Second ComponentID", "DMTF|ComponentID|001", {{3, "Version", "1.0"}}}}},
        {7, "NoVersion", {{1, "ComponentID", "DMTF|ComponentID|001", {{3, "Version", ""}}}}},
        {8, "", {}},
        {12, "Fans", {{3, "", "Zorek|Fans|001", {}}, {6, "Fan Table", "Zorek|Fan|001", {}}}},
    };
    return db;
}

class SLMap : public ::testing::Test {
protected:
    void SetUp() override
    {
        db = sampleDatabase();
        provider.responder = [this](const uint8_t* block) { return db.answer(block); };
    }
    ScriptedProvider provider;
    Database db;
};

std::string take(char* s)
{
    std::string result = s == nullptr ? "<null>" : s;
    SLDeleteString(s);
    return result;
}

TEST_F(SLMap, NameToIdWalks)
{
    struct Case {
        const char* name;
        std::function<uint32_t()> lookup;
        uint32_t id;
        size_t commands; // one per object listed up to the match, or to the end plus one
    };
    std::vector<Case> cases = {
        {"first component", [] { return SLMapComponentNameToId("Baseboard"); }, 1, 1},
        {"later component", [] { return SLMapComponentNameToId("Fans"); }, 12, 5},
        {"name differing in case", [] { return SLMapComponentNameToId("fans"); }, 0, 6},
        {"prefix only", [] { return SLMapComponentNameToId("Fan"); }, 0, 6},
        {"null name", [] { return SLMapComponentNameToId(nullptr); }, 0, 0},
        {"group by name", [] { return SLMapGroupNameToId(12, "Fan Table"); }, 6, 2},
        {"group absent", [] { return SLMapGroupNameToId(12, "Nothing"); }, 0, 3},
        {"group of unknown component", [] { return SLMapGroupNameToId(99, "Fan Table"); }, 0, 1},
        {"class: the first in list order", [] { return SLMapClassNameToId(4, "DMTF|ComponentID|001"); }, 5, 2},
        {"attribute", [] { return SLMapAttributeNameToId(1, 1, "Version"); }, 3, 2},
        {"attribute absent", [] { return SLMapAttributeNameToId(1, 1, "version"); }, 0, 3},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        size_t before = provider.blocks.size();
        unsigned live = slLiveStringCount();
        EXPECT_EQ(c.lookup(), c.id);
        EXPECT_EQ(provider.blocks.size() - before, c.commands);
        EXPECT_EQ(slLiveStringCount(), live) << "the lookup's handle is released";
    }
    // The walk asks after the id of the previous entry, without a filter.
    EXPECT_EQ(provider.code(0), 514u);
    EXPECT_EQ(provider.word(0, 16), 0u);
    EXPECT_EQ(provider.word(0, 17), 0u);
}

TEST_F(SLMap, WalkEndsWhenTheProviderRepeatsItself)
{
    // Answers every list-next with the same entry: its id is the one asked
    // after from the second command on.
    provider.responder = [](const uint8_t*) {
        Reply r;
        r.fill = [](uint8_t* confirm, uint32_t size) {
            ConfirmWriter w{confirm, size};
            w.word(0, 3);
            w.word(8, 100);
            w.string(100, "Other");
        };
        return r;
    };
    EXPECT_EQ(SLMapComponentNameToId("Wanted"), 0u);
    EXPECT_EQ(provider.blocks.size(), 2u);
}

TEST_F(SLMap, IdToName)
{
    EXPECT_EQ(take(SLMapComponentIdToName(4)), "Mox");
    EXPECT_EQ(provider.code(0), 512u);
    EXPECT_EQ(provider.word(0, 17), 0u) << "no filter";
    EXPECT_EQ(take(SLMapGroupIdToName(12, 6)), "Fan Table");
    EXPECT_EQ(provider.code(1), 516u);
    EXPECT_EQ(take(SLMapAttributeIdToName(1, 1, 3)), "Version");
    EXPECT_EQ(provider.code(2), 520u);
    EXPECT_EQ(take(SLMapComponentIdToName(5)), "<null>");
    EXPECT_EQ(take(SLMapGroupIdToName(12, 4)), "<null>");
    EXPECT_EQ(take(SLMapGroupIdToName(12, 3)), "<null>") << "entry without a name";
    EXPECT_EQ(take(SLMapAttributeIdToName(1, 1, 2)), "<null>");
}

DmiString* dmi(const std::string& s)
{
    return NewDmiString(s.c_str());
}

TEST(SLMatch, ExactAndPrefix)
{
    struct Case {
        const char* d;
        const char* s;
        int exact;
        int prefix;
    } cases[] = {
        {"EventGeneration|Fan", "EventGeneration|Fan", 1, 1},
        {"EventGeneration|Fan", "eventgeneration|", 0, 1},
        {"EventGeneration|Fan", "EventGeneration|", 0, 1},
        {"Event", "EventGeneration|", 0, 0},
        {"Mox", "mox", 0, 1},
        {"Mox", "Mo", 0, 1},
        {"Mox", "Moxa", 0, 0},
        {"", "", 1, 1},
        {"abc", "", 0, 1},
        {"Zorek|Error", "Zorek|Errors", 0, 0},
    };
    for (const Case& c : cases) {
        DmiString* d = dmi(c.d);
        EXPECT_EQ(IsExactMatch(d, c.s), c.exact) << c.d << " / " << c.s;
        EXPECT_EQ(PrefixMatches(d, c.s), c.prefix) << c.d << " / " << c.s;
        SLDeleteString(d);
    }
    DmiString* d = dmi("x");
    EXPECT_EQ(IsExactMatch(nullptr, "x"), 0);
    EXPECT_EQ(IsExactMatch(d, nullptr), 0);
    EXPECT_EQ(PrefixMatches(nullptr, "x"), 0);
    EXPECT_EQ(PrefixMatches(d, nullptr), 0);
    SLDeleteString(d);
    // A DMI string whose count is shorter than its storage: only the counted
    // characters take part.
    uint8_t raw[8] = {2, 0, 0, 0, 'a', 'b', 'c', 'd'};
    EXPECT_EQ(IsExactMatch(reinterpret_cast<DmiString*>(raw), "ab"), 1);
    EXPECT_EQ(IsExactMatch(reinterpret_cast<DmiString*>(raw), "abc"), 0);
}

// Restores UXDMIPATH when a test has changed it.
class MifPath {
public:
    MifPath()
    {
        const char* v = std::getenv("UXDMIPATH");
        had_ = v != nullptr;
        if (had_)
            old_ = v;
    }
    ~MifPath()
    {
        if (had_)
            setenv("UXDMIPATH", old_.c_str(), 1);
        else
            unsetenv("UXDMIPATH");
    }

private:
    bool had_;
    std::string old_;
};

TEST_F(SLMap, InstallMifPath)
{
    MifPath keep;
    SLHandle* h = SLCreateHandle(0);
    auto sentPath = [&](size_t i) { return std::string(reinterpret_cast<const char*>(provider.blocks[i].data()) + 84); };

    unsetenv("UXDMIPATH");
    provider.push(Reply{});
    ASSERT_EQ(SLInstallMIF(h, "mox.mif"), 0);
    EXPECT_EQ(provider.code(0), 1026u);
    EXPECT_EQ(provider.word(0, 16), 0u);
    EXPECT_EQ(sentPath(0), "/var/dmi/mifs/backup/mox.mif");
    EXPECT_EQ(provider.word(0, 20), sentPath(0).size());

    setenv("UXDMIPATH", "/opt/mifs/", 1);
    provider.push(Reply{});
    ASSERT_EQ(SLInstallMIF(h, "mox.mif"), 0);
    EXPECT_EQ(sentPath(1), "/opt/mifs//mox.mif") << "the slash is added regardless";

    EXPECT_EQ(SLInstallMIF(nullptr, "mox.mif"), 1);
    EXPECT_EQ(SLInstallMIF(h, nullptr), 1);
    setenv("UXDMIPATH", std::string(5000, 'd').c_str(), 1);
    EXPECT_EQ(SLInstallMIF(h, "mox.mif"), 1);
    EXPECT_EQ(provider.blocks.size(), 2u) << "refused paths are not sent";
}

TEST_F(SLMap, InstalledMifVersion)
{
    SLHandle* h = SLCreateHandle(0);
    float baseboard = 0, mox = 0;
    ASSERT_EQ(SLGetInstalledMIFVersion(h, "Baseboard", &baseboard), 0);
    ASSERT_EQ(SLGetInstalledMIFVersion(h, "Mox", &mox), 0);
    EXPECT_FLOAT_EQ(baseboard, 2.9f);
    EXPECT_EQ(mox, baseboard) << "2.90 and 2.9 are the same version";
    EXPECT_EQ(provider.code(provider.blocks.size() - 1), 768u);
    EXPECT_EQ(provider.word(provider.blocks.size() - 1, 17), 5u) << "the first ComponentID group";

    float untouched = -1;
    EXPECT_EQ(SLGetInstalledMIFVersion(h, "Absent", &untouched), 1);
    EXPECT_EQ(SLGetInstalledMIFVersion(h, "Fans", &untouched), 1) << "no ComponentID group";
    EXPECT_EQ(SLGetInstalledMIFVersion(h, "NoVersion", &untouched), 1) << "a confirm without a value";
    EXPECT_EQ(SLGetInstalledMIFVersion(nullptr, "Mox", &untouched), 1);
    EXPECT_EQ(SLGetInstalledMIFVersion(h, nullptr, &untouched), 1);
    EXPECT_EQ(untouched, -1);
}

} // namespace
