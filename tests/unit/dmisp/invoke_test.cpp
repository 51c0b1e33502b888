#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <random>

#include "client.h"

using namespace dmisptest;

namespace {

class DmispInvoke : public ProviderTest {
protected:
    void SetUp() override
    {
        ProviderTest::SetUp();
        component_ = installSample();
        ASSERT_EQ(client_.registerApp(false), 0u);
    }
    uint32_t component_ = 0;
    Client client_;
};

TEST_F(DmispInvoke, RegisterConfirmHoldsLevelDescriptionAndHandle)
{
    Client other;
    ASSERT_EQ(other.registerApp(false), 0u);
    EXPECT_EQ(other.word(10), 1u);
    EXPECT_EQ(other.confirmWord(0), 12u);
    EXPECT_EQ(other.confirmString(12), "DMI 1.1");
    EXPECT_EQ(other.confirmWord(4), 23u);
    EXPECT_EQ(text(SLDmiSpecificationLevel(other.h())), "DMI 1.1");
    EXPECT_EQ(text(SLImplementationDescription(other.h())), "Mox substitute DMI service provider");
    EXPECT_EQ(SLRegisterHandle(other.h()), 2u); // the fixture registered first
    EXPECT_EQ(dmisp::registrations(), 2u);
    other.begin(257);
    EXPECT_EQ(other.run(), 0u);
    EXPECT_EQ(dmisp::registrations(), 1u);
    other.begin(257); // no longer registered
    EXPECT_EQ(other.run(), static_cast<uint32_t>(dmisp::StatusNotFound));
}

TEST_F(DmispInvoke, ComponentRecordByteForByte)
{
    client_.begin(512);
    client_.set(16, component_);
    ASSERT_EQ(client_.run(), 0u);
    EXPECT_EQ(client_.word(10), 1u);
    // id, match type, name, group count, group list, file count, file list
    const uint32_t record[7] = {component_, 0, 28, 4, 42, 0, 0};
    for (uint32_t i = 0; i < 7; ++i)
        EXPECT_EQ(client_.confirmWord(4 * i), record[i]) << "word " << i;
    EXPECT_EQ(client_.confirmString(28), "Test Board");
    // Group list: (id, class string) pairs, the strings behind the list.
    const struct {
        uint32_t id, offset;
        const char* className;
    } pairs[] = {{1, 74, "DMTF|ComponentID|001"},
                 {20, 98, "EventGeneration|Voltage Probe|001"},
                 {30, 135, "DMTF|Voltage Probe|001"},
                 {40, 161, "Zorek|Error|001"}};
    for (uint32_t i = 0; i < 4; ++i) {
        EXPECT_EQ(client_.confirmWord(42 + 8 * i), pairs[i].id);
        EXPECT_EQ(client_.confirmWord(46 + 8 * i), pairs[i].offset);
        EXPECT_EQ(client_.confirmString(pairs[i].offset), pairs[i].className);
        EXPECT_EQ(SLComponentGroupId(client_.h(), i), pairs[i].id);
        EXPECT_EQ(text(SLComponentGroupName(client_.h(), i)), pairs[i].className);
    }
    EXPECT_EQ(client_.h()->confirm[180], 0xEE) << "nothing written past the record";
    EXPECT_EQ(text(SLComponentName(client_.h())), "Test Board");
    EXPECT_EQ(SLComponentFileType(client_.h(), 0), 0u);
}

TEST_F(DmispInvoke, ListingsFollowIdOrderFiltersAndEndWithAFailure)
{
    uint32_t second = installSample();
    std::string error;
    uint32_t plain = dmisp::installText(R"(start component name = "Plain"
        start group name = "G" class = "Zorek|Other|001" id = 5
          start attribute name = "A" id = 1 type = integer value = 1 end attribute
        end group end component)",
                                        "plain.mif", &error);
    ASSERT_NE(plain, 0u) << error;
    const uint32_t End = dmisp::StatusEndOfList, NotFound = dmisp::StatusNotFound;
    const struct {
        uint32_t code, w16, w17, w18;
        const char* filter;
        uint32_t status, id; // id of entry 0 when status is 0
    } cases[] = {
        {513, 0, 0, 0, nullptr, 0, component_},
        {514, component_, 0, 0, nullptr, 0, second},
        {514, second, 0, 0, nullptr, 0, plain},
        {514, plain, 0, 0, nullptr, End, 0},
        {512, second, 0, 0, nullptr, 0, second},
        {512, 99, 0, 0, nullptr, NotFound, 0},
        {513, 0, 0, 0, "eventgeneration|", 0, component_},
        {514, second, 0, 0, "EventGeneration|", End, 0},
        {514, 0, 0, 0, "Zorek|Oth", 0, plain},
        {512, plain, 0, 0, "EventGeneration|", NotFound, 0},
        {516, component_, 30, 0, nullptr, 0, 30},
        {517, component_, 0, 0, nullptr, 0, 1},
        {518, component_, 1, 0, nullptr, 0, 20},
        {518, component_, 21, 0, nullptr, 0, 30},
        {518, component_, 40, 0, nullptr, End, 0},
        {516, component_, 31, 0, nullptr, NotFound, 0},
        {518, 99, 0, 0, nullptr, NotFound, 0},
        {521, component_, 20, 0, nullptr, 0, 1},
        {522, component_, 20, 4, nullptr, 0, 5},
        {522, component_, 20, 9, nullptr, End, 0},
        {520, component_, 20, 10, nullptr, NotFound, 0},
        {520, component_, 99, 1, nullptr, NotFound, 0},
    };
    for (const auto& tc : cases) {
        client_.begin(tc.code);
        client_.set(16, tc.w16);
        client_.set(17, tc.w17);
        client_.set(18, tc.w18);
        if (tc.filter != nullptr) {
            client_.set(17, 80);
            client_.set(20, static_cast<uint32_t>(strlen(tc.filter)));
            memcpy(client_.block() + 84, tc.filter, strlen(tc.filter));
        }
        SCOPED_TRACE(::testing::Message() << "code " << tc.code << " w16 " << tc.w16 << " w17 " << tc.w17);
        ASSERT_EQ(client_.run(), tc.status);
        if (tc.status == 0) {
            EXPECT_EQ(client_.word(10), 1u);
            EXPECT_EQ(client_.confirmWord(0), tc.id);
        } else {
            EXPECT_EQ(client_.word(10), 0u);
        }
    }
    // Descriptions: one DMI string at the start of the confirm.
    const struct {
        uint32_t code, w17, w18;
        const char* text;
    } descriptions[] = {{515, 0, 0, "a board for tests"}, {519, 20, 0, "voltage events"}, {523, 20, 1, ""}};
    for (const auto& d : descriptions) {
        client_.begin(d.code);
        client_.set(16, component_);
        client_.set(17, d.w17);
        client_.set(18, d.w18);
        ASSERT_EQ(client_.run(), 0u);
        EXPECT_EQ(text(SLDescription(client_.h())), d.text);
    }
}

TEST_F(DmispInvoke, GroupEntryCarriesKeyAttributesWithoutValues)
{
    client_.begin(516);
    client_.set(16, component_);
    client_.set(17, 30);
    ASSERT_EQ(client_.run(), 0u);
    const uint32_t entry[5] = {30, 20, 37, 1, 63};
    for (uint32_t i = 0; i < 5; ++i)
        EXPECT_EQ(client_.confirmWord(4 * i), entry[i]) << "word " << i;
    EXPECT_EQ(client_.confirmString(20), "Voltage Probe");
    EXPECT_EQ(client_.confirmString(37), "DMTF|Voltage Probe|001");
    EXPECT_EQ(client_.confirmWord(63), 1u); // attribute id
    EXPECT_EQ(client_.confirmWord(67), 5u); // type
    EXPECT_EQ(client_.confirmWord(71), 0u); // no value
    EXPECT_EQ(text(SLGroupClassName(client_.h(), 0)), "DMTF|Voltage Probe|001");
}

TEST_F(DmispInvoke, AttributeEntryWithEnumerationByteForByte)
{
    client_.begin(520);
    client_.set(16, component_);
    client_.set(17, 20);
    client_.set(18, 2);
    ASSERT_EQ(client_.run(), 0u);
    // id, name, access, type, maximum size, enumeration count and list
    const uint32_t entry[7] = {2, 28, 1, 5, 4, 2, 40};
    for (uint32_t i = 0; i < 7; ++i)
        EXPECT_EQ(client_.confirmWord(4 * i), entry[i]) << "word " << i;
    EXPECT_EQ(client_.confirmString(28), "Severity");
    const uint32_t pairs[4] = {8, 56, 16, 68};
    for (uint32_t i = 0; i < 4; ++i)
        EXPECT_EQ(client_.confirmWord(40 + 4 * i), pairs[i]);
    EXPECT_EQ(client_.confirmString(56), "Critical");
    EXPECT_EQ(client_.confirmString(68), "Major");
    EXPECT_EQ(SLEnumerationValue(client_.h(), 0, 1), 16);
    EXPECT_EQ(text(SLEnumerationName(client_.h(), 0, 1)), "Major");

    // Access and size of the other kinds.
    const struct {
        uint32_t group, attribute, access, type, size;
    } kinds[] = {{30, 2, 2, 8, 16}, {30, 4, 2, 6, 8}, {30, 5, 2, 11, 28}, {30, 8, 3, 5, 4}, {30, 7, 1, 1, 4}};
    for (const auto& k : kinds) {
        client_.begin(520);
        client_.set(16, component_);
        client_.set(17, k.group);
        client_.set(18, k.attribute);
        ASSERT_EQ(client_.run(), 0u);
        EXPECT_EQ(SLAttributeAccess(client_.h(), 0), k.access) << k.attribute;
        EXPECT_EQ(SLAttributeType(client_.h(), 0), k.type) << k.attribute;
        EXPECT_EQ(SLAttributeMaxSize(client_.h(), 0), k.size) << k.attribute;
        EXPECT_EQ(SLEnumerationListCount(client_.h(), 0), 0u);
    }
}

TEST_F(DmispInvoke, GetAttributeConfirmByTypeAndKeys)
{
    // Confirm words: attribute id, group id, type, value offset; value at 16.
    client_.begin(768);
    client_.set(16, component_);
    client_.set(17, 1);
    client_.set(20, 3);
    ASSERT_EQ(client_.run(), 0u);
    const uint32_t words[4] = {3, 1, 8, 16};
    for (uint32_t i = 0; i < 4; ++i)
        EXPECT_EQ(client_.confirmWord(4 * i), words[i]);
    EXPECT_EQ(client_.confirmString(16), "1.0");
    EXPECT_EQ(SLAttributeType(client_.h(), 7), 8u);
    EXPECT_EQ(text(SLStringPtr(client_.h())), "1.0");

    const uint32_t BadKeys = dmisp::StatusBadKeys, NotFound = dmisp::StatusNotFound;
    const struct {
        uint32_t group, attribute;
        std::vector<std::pair<uint32_t, int32_t>> keys;
        uint32_t status, type, value;
    } cases[] = {
        {30, 3, {{1, 2}}, 0, 5, 1200},
        {30, 1, {{1, 3}}, 0, 5, 3},
        {30, 7, {{1, 3}}, 0, 1, 9},
        {30, 4, {{1, 1}}, 0, 6, 0},
        {20, 2, {}, 0, 5, 16},
        {20, 2, {{1, 1}}, 0, 5, 16}, // keys of a group without keys are ignored
        {30, 8, {{1, 1}}, dmisp::StatusWriteOnly, 0, 0},
        {30, 3, {{1, 9}}, NotFound, 0, 0},
        {30, 3, {}, BadKeys, 0, 0},
        {30, 3, {{2, 1}}, BadKeys, 0, 0},
        {30, 3, {{1, 1}, {1, 1}}, BadKeys, 0, 0},
        {30, 99, {{1, 1}}, NotFound, 0, 0},
        {99, 1, {}, NotFound, 0, 0},
    };
    for (const auto& tc : cases) {
        client_.begin(768);
        client_.set(16, component_);
        client_.set(17, tc.group);
        client_.set(20, tc.attribute);
        client_.intKeys(84, tc.keys);
        SCOPED_TRACE(::testing::Message() << "group " << tc.group << " attribute " << tc.attribute);
        ASSERT_EQ(client_.run(), tc.status);
        if (tc.status == 0) {
            EXPECT_EQ(SLAttributeType(client_.h(), 0), tc.type);
            EXPECT_EQ(SLUnsignedValue(client_.h()), tc.value);
        }
    }
}

TEST_F(DmispInvoke, SetAttributeChecksTypeSizeAndAccess)
{
    auto set = [&](uint32_t group, uint32_t attribute, std::vector<std::pair<uint32_t, int32_t>> keys,
                   const std::vector<uint8_t>& value) {
        client_.begin(769);
        client_.set(16, component_);
        client_.set(17, group);
        client_.set(20, attribute);
        uint32_t at = 88;
        if (!keys.empty())
            at = client_.intKeys(88, keys);
        client_.set(21, at);
        memcpy(client_.block() + at, value.data(), value.size());
        return client_.run();
    };
    auto integer = [](int32_t v) {
        std::vector<uint8_t> b(4);
        storeWord(b.data(), static_cast<uint32_t>(v));
        return b;
    };
    auto string = [](const std::string& s) {
        std::vector<uint8_t> b(4 + s.size());
        storeWord(b.data(), static_cast<uint32_t>(s.size()));
        memcpy(b.data() + 4, s.data(), s.size());
        return b;
    };
    std::string date = "20261206112233.000000+060";
    date.resize(28, '\0');
    const uint32_t Bad = dmisp::StatusBadValue;
    const struct {
        uint32_t group, attribute;
        int32_t key; // 0: no keys
        std::vector<uint8_t> value;
        uint32_t status;
        const char* after; // value read back afterwards (row of `key`)
    } cases[] = {
        {30, 3, 1, integer(-7), 0, "-7"},
        {30, 4, 1, integer(-1), 0, "-1"}, // a 64-bit integer arrives as 4 bytes
        {30, 2, 1, string("Core"), 0, "Core"},
        {30, 2, 1, string("12345678901234567"), Bad, "Core"},
        {30, 2, 1, string(""), 0, ""},
        {30, 6, 1, integer(7), Bad, "0"}, // not in the enumeration
        {30, 6, 1, integer(1), 0, "1"},
        {30, 7, 1, integer(1), dmisp::StatusReadOnly, "9"},
        {30, 8, 1, integer(6), 0, "6"}, // write-only can be set
        {30, 5, 1, std::vector<uint8_t>(date.begin(), date.end()), 0, "20261206112233.000000+060"},
        {30, 1, 1, integer(2), dmisp::StatusReadOnly, "1"}, // a read-only key
        {30, 3, 9, integer(1), dmisp::StatusNotFound, nullptr},
        {20, 9, 0, integer(0), 0, "0"},
        {20, 1, 0, integer(1), dmisp::StatusReadOnly, "2"},
        {1, 3, 0, string("2.0"), 0, "2.0"},
    };
    for (const auto& tc : cases) {
        SCOPED_TRACE(::testing::Message() << "group " << tc.group << " attribute " << tc.attribute);
        std::vector<std::pair<uint32_t, int32_t>> keys;
        if (tc.key != 0)
            keys.push_back({1, tc.key});
        EXPECT_EQ(set(tc.group, tc.attribute, keys, tc.value), tc.status);
        if (tc.after == nullptr)
            continue;
        std::string value;
        std::vector<std::string> keyTexts;
        if (tc.key != 0)
            keyTexts.push_back(std::to_string(tc.key));
        ASSERT_EQ(dmisp::getValue(component_, tc.group, tc.attribute, keyTexts, &value), 0u);
        EXPECT_EQ(value, tc.after);
    }
    // The instrumentation's side may change a key, as long as the keys stay unique.
    EXPECT_EQ(dmisp::setValue(component_, 30, 1, {"3"}, "2"), static_cast<uint32_t>(Bad));
    EXPECT_EQ(dmisp::setValue(component_, 30, 1, {"3"}, "7"), 0u);
    std::string value;
    EXPECT_EQ(dmisp::getValue(component_, 30, 2, {"7"}, &value), 0u);
    EXPECT_EQ(value, "Fan");
    // Reserve and release check the same, without writing.
    for (uint32_t code : {770u, 771u}) {
        client_.begin(code);
        client_.set(16, component_);
        client_.set(17, 30);
        client_.set(20, 7);
        client_.intKeys(88, {{1, 1}});
        EXPECT_EQ(client_.run(), static_cast<uint32_t>(dmisp::StatusReadOnly));
        client_.set(20, 3);
        EXPECT_EQ(client_.run(), 0u);
    }
}

TEST_F(DmispInvoke, RowsCarryKeysAndStartAfterTheGivenAttribute)
{
    client_.begin(772);
    client_.set(16, component_);
    client_.set(17, 30);
    client_.set(20, 6);
    client_.intKeys(84, {{1, 2}});
    ASSERT_EQ(client_.run(), 0u);
    // Row record: group, key count, key list, attribute count; then per
    // attribute (unused, id, type, value offset); keys and values behind.
    const uint32_t words[12] = {30, 1, 48, 2, 0, 7, 1, 64, 0, 8, 5, 0};
    for (uint32_t i = 0; i < 12; ++i)
        EXPECT_EQ(client_.confirmWord(4 * i), words[i]) << "word " << i;
    EXPECT_EQ(client_.confirmWord(48), 1u);
    EXPECT_EQ(client_.confirmWord(52), 5u);
    EXPECT_EQ(client_.confirmWord(56), 60u);
    EXPECT_EQ(client_.confirmWord(60), 2u); // the key's value
    EXPECT_EQ(client_.confirmWord(64), 9u); // attribute 7
    EXPECT_EQ(SLRowAttributeId(client_.h(), 0), 7u); // position 0 is attribute 7
    EXPECT_EQ(SLRowAttributePtr(client_.h(), 1), nullptr); // write-only: no value

    // The whole row, and walking the table in row order by keys.
    client_.begin(773);
    client_.set(16, component_);
    client_.set(17, 30);
    ASSERT_EQ(client_.run(), 0u);
    EXPECT_EQ(SLRowAttributeCount(client_.h()), 8u);
    std::vector<uint32_t> order;
    for (int32_t key = static_cast<int32_t>(SLRowUnsignedValue(client_.h(), 0));;) {
        order.push_back(static_cast<uint32_t>(key));
        client_.begin(774);
        client_.set(16, component_);
        client_.set(17, 30);
        client_.intKeys(84, {{1, key}});
        uint32_t status = client_.run();
        if (status != 0) {
            EXPECT_EQ(status, static_cast<uint32_t>(dmisp::StatusEndOfList));
            break;
        }
        key = SLRowIntegerValue(client_.h(), 0);
        ASSERT_LT(order.size(), 5u);
    }
    EXPECT_EQ(order, (std::vector<uint32_t>{1, 2, 3}));

    const struct {
        uint32_t code, group;
        std::vector<std::pair<uint32_t, int32_t>> keys;
        uint32_t status, attributes, keyCount;
    } cases[] = {
        {772, 20, {}, 0, 9, 0},
        {773, 20, {}, 0, 9, 0},
        {774, 20, {}, dmisp::StatusEndOfList, 0, 0},
        {772, 30, {}, dmisp::StatusBadKeys, 0, 0},
        {774, 30, {}, dmisp::StatusBadKeys, 0, 0},
        {772, 30, {{1, 4}}, dmisp::StatusNotFound, 0, 0},
        {772, 31, {}, dmisp::StatusNotFound, 0, 0},
    };
    for (const auto& tc : cases) {
        client_.begin(tc.code);
        client_.set(16, component_);
        client_.set(17, tc.group);
        client_.intKeys(84, tc.keys);
        ASSERT_EQ(client_.run(), tc.status) << tc.code << " " << tc.group;
        if (tc.status == 0) {
            EXPECT_EQ(SLRowAttributeCount(client_.h()), tc.attributes);
            EXPECT_EQ(loadWordAt(pGetRow(client_.h()), 1), tc.keyCount);
        }
    }
}

TEST_F(DmispInvoke, MalformedBlocksFailWithoutWritingOutsideTheConfirm)
{
    const uint32_t Malformed = dmisp::StatusMalformed;
    const struct {
        const char* what;
        uint32_t code;
        std::vector<std::pair<uint32_t, uint32_t>> words; // (word, value)
        uint32_t status;
    } cases[] = {
        {"unknown code", 999, {}, Malformed},
        {"level check", 512, {{0, 0x12345678}, {16, 1}}, Malformed},
        {"key list past the block", 768, {{16, 1}, {17, 30}, {20, 3}, {18, 1}, {19, 4090}}, Malformed},
        {"key list before the parameters", 768, {{16, 1}, {17, 30}, {20, 3}, {18, 1}, {19, 8}}, Malformed},
        {"key count huge", 772, {{16, 1}, {17, 30}, {18, 0x40000000}, {19, 84}}, Malformed},
        {"key value past the block", 768, {{16, 1}, {17, 30}, {20, 3}, {18, 1}, {19, 84}, {21, 1}, {22, 5}, {23, 5000}},
         Malformed},
        {"filter past the block", 513, {{17, 4094}}, Malformed},
        {"filter count huge", 513, {{17, 80}, {20, 0xFFFFFFF0}}, Malformed},
        {"set value past the block", 769, {{16, 1}, {17, 30}, {20, 3}, {18, 1}, {19, 88}, {22, 1}, {23, 5}, {24, 100},
                                            {25, 1}, {21, 4094}}, Malformed},
        {"set string count huge", 769, {{16, 1}, {17, 1}, {20, 3}, {21, 88}, {22, 0x7FFFFFFF}}, Malformed},
        {"confirm buffer too small", 512, {{16, 1}, {7, 100}}, dmisp::StatusBufferTooSmall},
        {"confirm buffer absent", 516, {{16, 1}, {17, 30}, {8, 0}}, dmisp::StatusBufferTooSmall},
    };
    for (const auto& tc : cases) {
        client_.begin(tc.code);
        for (const auto& w : tc.words)
            client_.set(w.first, w.second);
        EXPECT_EQ(client_.run(), tc.status) << tc.what;
        EXPECT_EQ(client_.word(10), 0u) << tc.what;
        bool untouched = true;
        for (uint32_t i = 0; i < client_.h()->confirmSize; ++i)
            untouched = untouched && client_.h()->confirm[i] == 0xEE;
        EXPECT_TRUE(untouched) << tc.what;
    }
    // A component record of 180 bytes fits a buffer of exactly 180.
    client_.begin(512);
    client_.set(16, component_);
    client_.set(7, 180);
    EXPECT_EQ(client_.run(), 0u);
    EXPECT_EQ(client_.h()->confirm[180], 0xEE);
    EXPECT_EQ(DmiInvoke(nullptr), dmisp::InvokeRefused);
}

TEST_F(DmispInvoke, InstallAndUninstallCompleteBeforeDmiInvokeReturns)
{
    std::string path = dir_ + "/board.mif";
    std::ofstream(path) << sampleMif();
    std::string bad = dir_ + "/bad.mif";
    std::ofstream(bad) << "start component\n name = \"Broken\"\n start group\nend component\n";
    auto install = [&](const std::string& p) {
        client_.begin(1026);
        client_.set(3, 0);
        client_.set(17, 1);
        client_.set(18, 2);
        client_.set(19, 80);
        client_.set(20, static_cast<uint32_t>(p.size()));
        memcpy(client_.block() + 84, p.c_str(), p.size() + 1);
        EXPECT_EQ(client_.send(), 0u);
        return client_.word(11); // final when DmiInvoke returns
    };
    ASSERT_EQ(install(path), 0u);
    uint32_t id = SLInstallComponentId(client_.h());
    EXPECT_EQ(id, component_ + 1);
    EXPECT_EQ(dmisp::componentId("Test Board"), component_);
    EXPECT_EQ(dmisp::groups(id).size(), 4u);

    size_t before = dmisp::components().size();
    EXPECT_EQ(install(bad), static_cast<uint32_t>(dmisp::StatusInstallFailed));
    EXPECT_EQ(install(dir_ + "/missing.mif"), static_cast<uint32_t>(dmisp::StatusInstallFailed));
    EXPECT_EQ(dmisp::components().size(), before);

    for (uint32_t expected : {0u, static_cast<uint32_t>(dmisp::StatusNotFound)}) {
        client_.begin(1027);
        client_.set(16, id);
        EXPECT_EQ(client_.send(), 0u);
        EXPECT_EQ(client_.word(11), expected);
    }
    EXPECT_EQ(dmisp::components().size(), before - 1);
    for (uint32_t code : {1024u, 1025u}) {
        client_.begin(code);
        EXPECT_EQ(client_.send(), 0u);
        EXPECT_EQ(client_.word(11), 0u);
    }
}

TEST_F(DmispInvoke, FaultsBusyRefuseNoConfirmListingStatusAndDelay)
{
    auto listNext = [&]() {
        client_.begin(514);
        client_.set(16, 0);
    };
    uint64_t before = dmisp::commandsReceived();
    dmisp::injectBusy(2);
    listNext();
    EXPECT_EQ(client_.send(), dmisp::InvokeBusy);
    EXPECT_EQ(client_.send(), dmisp::InvokeBusy);
    EXPECT_EQ(client_.run(), 0u);
    EXPECT_EQ(dmisp::commandsReceived() - before, 3u) << "busy calls are counted too";
    EXPECT_EQ(dmisp::commandsReceived(514), 3u);

    dmisp::injectRefuse(1);
    EXPECT_EQ(client_.send(), dmisp::InvokeRefused);
    EXPECT_EQ(client_.run(), 0u);

    dmisp::injectNoConfirm(1);
    listNext();
    EXPECT_EQ(client_.send(), 0u);
    EXPECT_FALSE(client_.wait(200));
    EXPECT_EQ(client_.run(), 0u);

    dmisp::injectListingStatus512(1);
    listNext();
    EXPECT_EQ(client_.run(), static_cast<uint32_t>(dmisp::StatusListing));
    EXPECT_EQ(SLComponentId(client_.h()), component_);
    EXPECT_EQ(text(SLComponentName(client_.h())), "Test Board");
    EXPECT_EQ(client_.run(), 0u);

    dmisp::injectConfirmDelay(150);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(client_.run(), 0u);
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(150));
    dmisp::clearFaults();
    start = std::chrono::steady_clock::now();
    EXPECT_EQ(client_.run(), 0u);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(150));
}

TEST_F(DmispInvoke, CommandsWithoutAnyRegistrationAreRefused)
{
    client_.begin(257);
    ASSERT_EQ(client_.run(), 0u);
    ASSERT_EQ(dmisp::registrations(), 0u);
    client_.begin(513);
    EXPECT_EQ(client_.send(), dmisp::InvokeRefused);
    client_.begin(1025); // completes without a callback
    EXPECT_EQ(client_.send(), 0u);
}

// Random parameter words on every command code: no crash, no read outside
// the block (AddressSanitizer), nothing written past the confirm size the
// block states.
TEST_F(DmispInvoke, RandomCommandBlocksNeverWriteOutsideTheirConfirm)
{
    const uint32_t codes[] = {257, 258, 512, 513, 514, 515, 516, 517, 518, 519, 520, 521,
                              522, 523, 768, 769, 770, 771, 772, 773, 774, 1024, 1025, 4711};
    std::mt19937 random(7);
    auto pick = [&]() -> uint32_t {
        switch (random() % 6) {
        case 0: return 0;
        case 1: return random() % 8;
        case 2: return 20 + random() % 30; // group and attribute ids
        case 3: return 60 + random() % 4100; // offsets around the block
        case 4: return 0xFFFFFFFF - random() % 16;
        default: return static_cast<uint32_t>(random());
        }
    };
    for (int i = 0; i < 3000; ++i) {
        uint32_t code = codes[random() % (sizeof codes / sizeof codes[0])];
        if (code == 257)
            continue; // keeps the registration
        client_.begin(code);
        client_.set(7, 4096);
        client_.set(16, random() % 3 == 0 ? pick() : component_);
        for (uint32_t w = 17; w < 40; ++w)
            client_.set(w, pick());
        if (random() % 2 == 0) {
            // A plausible key list so that lookups go deeper.
            client_.set(18, 1 + random() % 3);
            client_.set(19, 84);
            client_.set(22, 1);
            client_.set(23, random() % 2 == 0 ? 5 : 8);
            client_.set(24, random() % 2 == 0 ? 96 : pick());
        }
        uint32_t status = client_.run();
        ASSERT_NE(status, 0xFFFFFFFFu) << "code " << code << " not confirmed";
        ASSERT_NE(status, 512u);
        ASSERT_NE(status, 522u);
        bool untouched = true;
        for (uint32_t b = 4096; b < client_.h()->confirmSize; ++b)
            untouched = untouched && client_.h()->confirm[b] == 0xEE;
        ASSERT_TRUE(untouched) << "code " << code;
    }
    // The database is unharmed by what the random sets may have changed.
    EXPECT_EQ(dmisp::components().size(), 1u);
}

} // namespace
