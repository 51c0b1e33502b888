#include <cstring>

#include "mif/mif.h"
#include "providerenv.h"
#include "sl/slkey.h"
#include "testmif.h"

namespace {

class Catalogue : public ProviderTest {
protected:
    uint32_t component = 0;

    void SetUp() override
    {
        ProviderTest::SetUp();
        component = install(testComponentMif());
        registerManagement();
        componentList = newComponentInfo(component);
        ASSERT_NE(componentList, nullptr);
    }
};

TEST_F(Catalogue, EntryCarriesTheListedName)
{
    EXPECT_STREQ(ComponentName(component), "Catalogue Test");
    EXPECT_EQ(GetMifId(component), 0u);
    EXPECT_EQ(MyComponentId(), component);
}

TEST_F(Catalogue, SecondLookupIssuesNoCommand)
{
    struct Lookup {
        const char* what;
        void (*run)(SLHandle* h, uint32_t c);
    } lookups[] = {
        {"group name", [](SLHandle* hd, uint32_t c) { GroupName(hd, c, 2); }},
        {"key lists", [](SLHandle* hd, uint32_t c) { GroupKeyList(hd, c, 2); }},
        {"attribute name", [](SLHandle* hd, uint32_t c) { AttributeName(hd, c, 1, 2); }},
        {"attribute type", [](SLHandle* hd, uint32_t c) { AttributeType(hd, c, 1, 3); }},
        {"enumeration", [](SLHandle* hd, uint32_t c) { AttributeEnumerationString(hd, c, 1, 2, 1); }},
        {"description", [](SLHandle* hd, uint32_t c) { AttributeDescription(hd, c, 1, 1); }},
    };
    for (const auto& lookup : lookups) {
        lookup.run(h, component);
        uint64_t before = dmisp::commandsReceived();
        lookup.run(h, component);
        EXPECT_EQ(dmisp::commandsReceived(), before) << lookup.what;
    }
    EXPECT_STREQ(GroupName(h, component, 2), "Named Rows");
    EXPECT_STREQ(AttributeName(h, component, 1, 2), "State");
    EXPECT_EQ(AttributeType(h, component, 1, 3), 8u);
    EXPECT_EQ(AttributeType(h, component, 1, 4), 11u);
    EXPECT_STREQ(AttributeDescription(h, component, 1, 1), "A plain integer");
}

TEST_F(Catalogue, UnknownIdsGiveFallbacksWithoutCommands)
{
    const uint32_t stranger = component + 100;
    uint64_t before = dmisp::commandsReceived();
    EXPECT_STREQ(ComponentName(stranger), "Unknown Component");
    EXPECT_STREQ(GroupName(h, stranger, 1), "Unknown Group");
    EXPECT_STREQ(AttributeName(h, stranger, 1, 1), "Unknown Attribute");
    EXPECT_EQ(AttributeType(h, stranger, 1, 1), 0u);
    EXPECT_EQ(GroupKeyList(h, stranger, 2), nullptr);
    EXPECT_EQ(AttributeEnumerationString(h, stranger, 1, 2, 1), nullptr);
    EXPECT_EQ(AttributeDescription(h, stranger, 1, 1), nullptr);
    EXPECT_EQ(GetMifId(stranger), 0u);
    EXPECT_EQ(IsStandardEventSupported(stranger), 0u);
    EXPECT_EQ(dmisp::commandsReceived(), before);

    // Known component, unknown group or attribute: the listing fails and
    // nothing is cached, so the next lookup asks again.
    EXPECT_STREQ(GroupName(h, component, 77), "Unknown Group");
    EXPECT_STREQ(AttributeName(h, component, 1, 77), "Unknown Attribute");
    EXPECT_EQ(AttributeType(h, component, 1, 77), 0u);
    before = dmisp::commandsReceived();
    EXPECT_STREQ(GroupName(h, component, 77), "Unknown Group");
    EXPECT_GT(dmisp::commandsReceived(), before);
}

TEST_F(Catalogue, DuplicateEnumerationValueGivesTheLaterText)
{
    ASSERT_STREQ(GroupName(h, component, 1), "Scalars");
    // The provider's MIF reader refuses an enumeration that lists a value twice.
    scriptedAttribute() = ScriptedAttribute{99, 5, {{0, "Off"}, {1, "On"}, {1, "Running"}, {2, "Failed"}}};
    SLDmiInvoke = answerScriptedAttribute;
    EXPECT_STREQ(AttributeName(h, component, 1, 99), "Scripted");
    SLDmiInvoke = DmiInvoke;
    EXPECT_STREQ(AttributeEnumerationString(h, component, 1, 99, 0), "Off");
    EXPECT_STREQ(AttributeEnumerationString(h, component, 1, 99, 1), "Running");
    EXPECT_STREQ(AttributeEnumerationString(h, component, 1, 99, 2), "Failed");
    EXPECT_EQ(AttributeEnumerationString(h, component, 1, 99, 3), nullptr);
    AttributeInfo* a = pAttributeInfo(h, component, 1, 99);
    ASSERT_NE(a, nullptr);
    EXPECT_EQ(a->enumCount, 4u);
    EnumList* e = AttributeEnumList(h, component, 1, 99);
    ASSERT_NE(e, nullptr);
    EXPECT_STREQ(e->name, "Failed") << "reverse listing order";

    // From the provider's own listing.
    EXPECT_STREQ(AttributeEnumerationString(h, component, 1, 2, 1), "On");
    EXPECT_EQ(AttributeEnumList(h, component, 1, 1), nullptr) << "plain integer";
}

uint32_t keyValue(const SLKeyList* k)
{
    return k->keys[0].value != nullptr ? loadWord(k->keys[0].value) : 0xFFFFFFFF;
}

TEST_F(Catalogue, KeyListChainFollowsTheRows)
{
    SLKeyList* k = GroupKeyList(h, component, 2);
    std::vector<uint32_t> keys;
    for (; k != nullptr; k = k->next) {
        ASSERT_EQ(k->count, 1u);
        EXPECT_EQ(k->keys[0].attributeId, 1u);
        EXPECT_EQ(k->keys[0].type, 5u);
        keys.push_back(keyValue(k));
    }
    EXPECT_EQ(keys, (std::vector<uint32_t>{10, 20, 30}));

    EXPECT_EQ(GroupKeyList(h, component, 1), nullptr) << "scalar group";
    SLKeyList* single = GroupKeyList(h, component, 3);
    ASSERT_NE(single, nullptr);
    EXPECT_EQ(keyValue(single), 1u);
    EXPECT_EQ(single->next, nullptr);
}

TEST_F(Catalogue, StandardEventsAndMifIdsFollowTheEntries)
{
    ComponentInfo* second = appendToList(componentList, 555, 1);
    ASSERT_NE(second, nullptr);
    ComponentInfo* again = appendToList(componentList, 555, 7);
    ASSERT_NE(again, nullptr);
    EXPECT_EQ(second->name, nullptr) << "a component the provider cannot list keeps a null name";
    EXPECT_EQ(ComponentName(555), nullptr);
    EXPECT_EQ(GetMifId(555), 1u) << "the first entry answers";
    EXPECT_EQ(BaseboardComponentId(), 555u);
    EXPECT_EQ(GetComponentId(7), 555u);
    EXPECT_EQ(standardEventSupported(555), 0);
    EXPECT_EQ(second->standardEvents, 1u);
    EXPECT_EQ(again->standardEvents, 1u);
    EXPECT_EQ(IsStandardEventSupported(555), 1u);
    EXPECT_EQ(IsStandardEventSupported(component), 0u);
    // The own entry comes first, so mif id 0 still names it.
    second->mifId = 0;
    EXPECT_EQ(MyComponentId(), component);
    EXPECT_EQ(appendToList(nullptr, 1, 1), nullptr);
}

} // namespace
