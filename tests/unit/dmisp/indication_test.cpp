#include <gtest/gtest.h>

#include "client.h"

using namespace dmisptest;

namespace {

class DmispIndications : public ProviderTest {
protected:
    void SetUp() override
    {
        ProviderTest::SetUp();
        ASSERT_EQ(client_.registerApp(true), 0u);
        component_ = installSample();
        auto installed = takeIndications();
        ASSERT_EQ(installed.size(), 1u);
        install_ = installed[0];
    }
    std::vector<uint8_t> one()
    {
        auto all = takeIndications();
        EXPECT_EQ(all.size(), 1u);
        return all.empty() ? std::vector<uint8_t>() : all[0];
    }
    static uint32_t w(const std::vector<uint8_t>& ind, uint32_t offset) { return loadWord(ind.data() + offset); }
    static std::string s(const std::vector<uint8_t>& ind, uint32_t offset)
    {
        return std::string(reinterpret_cast<const char*>(ind.data() + offset + 4), w(ind, offset));
    }
    Client client_;
    uint32_t component_ = 0;
    std::vector<uint8_t> install_;
};

TEST_F(DmispIndications, StandardEventWithTwoClassesByteForByte)
{
    ASSERT_EQ(dmisp::setValue(component_, 30, 3, {"2"}, "1300"), 0u);
    ASSERT_EQ(dmisp::raiseEvent(component_, {20, {}}, {30, {"2"}}), 0u);
    std::vector<uint8_t> ind = one();
    ASSERT_EQ(ind.size(), 591u);
    // Header: level check, type, length, component, date, completion, data.
    EXPECT_EQ(w(ind, 0), 0x444D4931u);
    EXPECT_EQ(w(ind, 4), 1u);
    EXPECT_EQ(w(ind, 8), 591u);
    EXPECT_EQ(w(ind, 12), component_);
    EXPECT_EQ(ind[16 + 14], '.'); // yyyymmddHHMMSS.uuuuuu+ooo
    EXPECT_EQ(ind[16 + 21], '+');
    EXPECT_EQ(ind[16 + 25], 0);
    EXPECT_NE(w(ind, 44), 0u);
    EXPECT_EQ(w(ind, 48), 52u);
    // Event data: two classes (component, class string, row count, rows).
    EXPECT_EQ(w(ind, 52), 2u);
    const uint32_t classes[8] = {component_, 392, 1, 88, component_, 487, 1, 248};
    for (uint32_t i = 0; i < 8; ++i)
        EXPECT_EQ(w(ind, 56 + 4 * i), classes[i]) << "class word " << i;
    EXPECT_EQ(s(ind, 392), "EventGeneration|Voltage Probe|001");
    EXPECT_EQ(s(ind, 487), "DMTF|Voltage Probe|001");
    // Rows back to back: 16 + 16 x 9 bytes, then 16 + 16 x 8.
    const uint32_t row0[4] = {20, 0, 0, 9}, row1[4] = {30, 1, 513, 8};
    for (uint32_t i = 0; i < 4; ++i) {
        EXPECT_EQ(w(ind, 88 + 4 * i), row0[i]);
        EXPECT_EQ(w(ind, 248 + 4 * i), row1[i]);
    }
    EXPECT_EQ(w(ind, 88 + 16 + 4), 1u);      // attribute 1
    EXPECT_EQ(w(ind, 88 + 16 + 12), 429u);   // its value, after the class string
    EXPECT_EQ(w(ind, 429), 2u);
    EXPECT_EQ(w(ind, 513), 1u); // key: attribute 1, integer, value 2
    EXPECT_EQ(w(ind, 517), 5u);
    EXPECT_EQ(w(ind, 521), 525u);
    EXPECT_EQ(w(ind, 525), 2u);

    // The SL accessors read it the same way.
    IndicationHandle h(ind);
    EXPECT_EQ(SLIndicationType(h.h), 1u);
    EXPECT_EQ(SLEventClassCount(h.h), 2u);
    EXPECT_EQ(text(SLEventClassString(h.h, 0)), "EventGeneration|Voltage Probe|001");
    SLEventSelectRowCnf(h.h, 0, 0);
    EXPECT_EQ(SLRowGroupId(h.h), 20u);
    EXPECT_EQ(SLRowUnsignedValue(h.h, 1), 16u); // severity
    EXPECT_EQ(text(SLRowStringPtr(h.h, 4)), "DMTF|Voltage Probe|001");
    EXPECT_EQ(SLRowUnsignedValue(h.h, 8), 1u); // instance data flag
    SLEventSelectRowCnf(h.h, 1, 0);
    EXPECT_EQ(SLRowGroupId(h.h), 30u);
    EXPECT_EQ(SLRowAttributeCount(h.h), 8u);
    EXPECT_EQ(SLRowUnsignedValue(h.h, 2), 1300u) << "current value from the database";
    EXPECT_EQ(text(SLRowStringPtr(h.h, 1)), "Memory");
    EXPECT_EQ(SLRowAttributePtr(h.h, 7), nullptr); // write-only
    EXPECT_EQ(dmisp::indicationsOutstanding(), 0u) << "the completion callback freed it";
}

TEST_F(DmispIndications, RowOffsetArrayLayoutForAnotherLevelCheck)
{
    dmisp::setIndicationLevelCheck(0x444D4932);
    ASSERT_EQ(dmisp::raiseEvent(component_, {20, {}}, {30, {"3"}}), 0u);
    std::vector<uint8_t> ind = one();
    EXPECT_EQ(w(ind, 0), 0x444D4932u);
    EXPECT_EQ(w(ind, 56 + 12), 88u);  // class 0: array of row offsets
    EXPECT_EQ(w(ind, 88), 92u);
    EXPECT_EQ(w(ind, 72 + 12), 252u); // class 1
    EXPECT_EQ(w(ind, 252), 256u);
    IndicationHandle h(ind);
    SLEventSelectRowCnf(h.h, 1, 0);
    EXPECT_EQ(SLRowGroupId(h.h), 30u);
    EXPECT_EQ(text(SLRowStringPtr(h.h, 1)), "Fan");
    SLEventSelectRowCnf(h.h, 0, 0);
    EXPECT_EQ(SLRowAttributeCount(h.h), 9u);
}

TEST_F(DmispIndications, VendorEventAndRefusedEvents)
{
    ASSERT_EQ(dmisp::raiseVendorEvent(component_, {40, {}}, {30, {"1"}}), 0u);
    std::vector<uint8_t> ind = one();
    IndicationHandle h(ind);
    EXPECT_EQ(text(SLEventClassString(h.h, 0)), "Zorek|Error|001");
    SLEventSelectRowCnf(h.h, 0, 0);
    EXPECT_EQ(SLRowUnsignedValue(h.h, 0), 2u); // error state first
    SLEventSelectRowCnf(h.h, 1, 0);
    EXPECT_EQ(text(SLRowStringPtr(h.h, 1)), "CPU");

    ASSERT_EQ(dmisp::raiseVendorEvent(component_, {40, {}}), 0u);
    IndicationHandle single(one());
    EXPECT_EQ(SLEventClassCount(single.h), 1u);

    const struct {
        bool vendor;
        uint32_t component;
        dmisp::EventRow first, instance;
        uint32_t status;
    } refused[] = {
        {false, component_, {40, {}}, {}, dmisp::StatusBadValue},   // not an event-generation group
        {true, component_, {20, {}}, {}, dmisp::StatusBadValue},    // not a vendor error group
        {false, component_, {20, {}}, {30, {}}, dmisp::StatusBadKeys},
        {false, component_, {20, {}}, {30, {"x"}}, dmisp::StatusBadKeys},
        {false, component_, {20, {}}, {30, {"4"}}, dmisp::StatusNotFound},
        {false, component_, {21, {}}, {}, dmisp::StatusNotFound},
        {false, 99, {20, {}}, {}, dmisp::StatusNotFound},
    };
    for (const auto& r : refused) {
        uint32_t status = r.vendor ? dmisp::raiseVendorEvent(r.component, r.first, r.instance)
                                   : dmisp::raiseEvent(r.component, r.first, r.instance);
        EXPECT_EQ(status, r.status) << r.first.group << " " << r.instance.group;
    }
    EXPECT_TRUE(takeIndications().empty());
}

TEST_F(DmispIndications, ComponentInstalledAndUninstalled)
{
    // The install in SetUp raised type 2 with the component record at the
    // data offset.
    EXPECT_EQ(w(install_, 4), 2u);
    EXPECT_EQ(w(install_, 12), component_);
    EXPECT_EQ(w(install_, 48), 52u);
    EXPECT_EQ(w(install_, 52), component_);
    EXPECT_EQ(w(install_, 60), 80u);
    EXPECT_EQ(s(install_, 80), "Test Board");
    EXPECT_EQ(w(install_, 64), 4u);
    IndicationHandle h(install_);
    EXPECT_EQ(SLComponentId(h.h), component_);
    EXPECT_EQ(text(SLComponentName(h.h)), "Test Board");
    EXPECT_EQ(text(SLComponentGroupName(h.h, 3)), "Zorek|Error|001");

    ASSERT_TRUE(dmisp::uninstall(component_));
    std::vector<uint8_t> gone = one();
    EXPECT_EQ(w(gone, 4), 3u);
    IndicationHandle g(gone);
    EXPECT_EQ(text(SLComponentName(g.h)), "Test Board");
    EXPECT_EQ(dmisp::raiseInstallEvent(component_, true), static_cast<uint32_t>(dmisp::StatusNotFound));

    uint32_t again = installSample();
    takeIndications();
    ASSERT_EQ(dmisp::raiseInstallEvent(again, false), 0u);
    EXPECT_EQ(w(one(), 4), 3u);
    EXPECT_NE(dmisp::componentId("Test Board"), 0u) << "raising the indication removes nothing";
}

TEST_F(DmispIndications, CompletionCallbackGivesTheIndicationBack)
{
    received().complete = false; // the application keeps it for now
    unsigned before = dmisp::indicationsDelivered();
    ASSERT_EQ(dmisp::raiseEvent(component_, {20, {}}), 0u);
    ASSERT_TRUE(dmisp::waitIndicationsDelivered());
    EXPECT_EQ(dmisp::indicationsDelivered(), before + 1);
    EXPECT_EQ(dmisp::indicationsOutstanding(), 1u);
    // The application unregisters: nothing more is delivered to it.
    client_.begin(257);
    ASSERT_EQ(client_.run(), 0u);
    ASSERT_EQ(dmisp::raiseEvent(component_, {20, {}}), 0u);
    ASSERT_TRUE(dmisp::waitIndicationsDelivered());
    EXPECT_EQ(dmisp::indicationsDelivered(), before + 1);
    std::vector<void*> kept;
    {
        std::lock_guard<std::mutex> lock(received().mu);
        kept.swap(received().kept);
    }
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_FALSE(dmisp::waitIndicationsCompleted(50));
    std::thread later([&] { complete(kept[0]); });
    EXPECT_TRUE(dmisp::waitIndicationsCompleted());
    later.join();
    EXPECT_EQ(dmisp::indicationsOutstanding(), 0u);
    takeIndications();
}

} // namespace
