// The SL library against the substitute DMI provider: registration, MIF
// installation, listings and name mapping, rows by keys, values with keys,
// and indications delivered to a handler.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "dmisp/dmisp.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

const char boardMif[] = R"(start component
  name = "Test Board"
  start group
    name = "ComponentID"  class = "DMTF|ComponentID|001"  id = 1
    start attribute name = "Manufacturer" id = 1 type = string(32) value = "Zorek" end attribute
    start attribute name = "Version" id = 3 type = displaystring(8) value = "2.90" end attribute
  end group
  start group
    name = "Voltage Events"  class = "EventGeneration|Voltage Probe|001"  id = 20
    start attribute name = "Event Type" id = 1 type = start enum 1 = "Warning" 2 = "Failure" end enum value = 2 end attribute
    start attribute name = "Severity" id = 2 type = integer value = 16 end attribute
  end group
  start group
    name = "Voltage Probe"  class = "DMTF|Voltage Probe|001"  key = 1
    start attribute name = "Index" id = 1 type = integer end attribute
    start attribute name = "Label" id = 2 type = displaystring(16) access = read-write value = "probe" end attribute
  end group
  start table
    name = "Voltage Probe"  class = "DMTF|Voltage Probe|001"  id = 30
    {1, "CPU"}  {2, "Memory"}  {3, "Fan"}
  end table
end component
)";

std::string text(const DmiString* s)
{
    return s == nullptr ? "<null>" : std::string(dmiStringText(s), dmiStringLength(s));
}

struct Delivered {
    std::mutex lock;
    std::vector<std::string> classes;
    std::atomic<int> count{0};
};
Delivered* delivered = nullptr;

int collectingHandler(SLHandle* h)
{
    if (SLIndicationType(h) == 1) {
        std::lock_guard<std::mutex> guard(delivered->lock);
        for (uint32_t c = 0; c < SLEventClassCount(h); ++c)
            delivered->classes.push_back(text(SLEventClassString(h, c)));
    }
    ++delivered->count;
    return 0;
}

class SLProvider : public ::testing::Test {
protected:
    void SetUp() override
    {
        delivered = &seen;
        char dbTemplate[] = "/tmp/sl-dmisp-XXXXXX";
        char mifTemplate[] = "/tmp/sl-mifs-XXXXXX";
        ASSERT_NE(mkdtemp(dbTemplate), nullptr);
        ASSERT_NE(mkdtemp(mifTemplate), nullptr);
        db_ = dbTemplate;
        mifs_ = mifTemplate;
        std::ofstream(mifs_ + "/board.mif") << boardMif;
        std::string error;
        ASSERT_EQ(dmisp::reset(db_, false, &error), 0) << error;
        SLInitialize();
        ASSERT_EQ(SLDmiInvoke, &DmiInvoke);
        h_ = SLCreateHandle(0);
        ASSERT_EQ(SLDmiRegisterMgmt(h_, collectingHandler), 0);
        const char* old = std::getenv("UXDMIPATH");
        oldPath_ = old != nullptr ? old : "";
        hadPath_ = old != nullptr;
        setenv("UXDMIPATH", mifs_.c_str(), 1);
    }
    void TearDown() override
    {
        SLDmiUnregisterMgmt(h_);
        dmisp::shutdown();
        SLCleanup();
        SLInitialize();
        SLDmiInvoke = nullptr;
        if (hadPath_)
            setenv("UXDMIPATH", oldPath_.c_str(), 1);
        else
            unsetenv("UXDMIPATH");
        std::string cmd = "rm -rf '" + db_ + "' '" + mifs_ + "'";
        if (std::system(cmd.c_str()) != 0)
            ADD_FAILURE() << "cannot remove " << cmd;
        delivered = nullptr;
    }
    uint32_t install()
    {
        if (SLInstallMIF(h_, "board.mif") != 0) {
            ADD_FAILURE() << "install status " << SLCnfStatus(h_);
            return 0;
        }
        return SLMapComponentNameToId("Test Board");
    }

    SLHandle* h_ = nullptr;
    std::string db_, mifs_, oldPath_;
    bool hadPath_ = false;
    Delivered seen;
};

TEST_F(SLProvider, RegistrationGivesAManagementHandle)
{
    EXPECT_NE(SLRegisterHandle(h_), 0u);
    EXPECT_NE(SLDmiSpecificationLevel(h_), nullptr);
    EXPECT_EQ(dmisp::registrations(), 1u);
    // Later commands carry it: the provider accepts them.
    EXPECT_EQ(SLListFirstComponent(h_, nullptr), 1) << "an empty database has no first component";
    EXPECT_NE(SLCnfStatus(h_), 0u);
}

TEST_F(SLProvider, InstallListAndMapNames)
{
    uint32_t board = install();
    ASSERT_NE(board, 0u);
    EXPECT_EQ(dmisp::componentId("Test Board"), board);
    EXPECT_EQ(SLMapComponentNameToId("test board"), 0u);

    ASSERT_EQ(SLListFirstComponent(h_, nullptr), 0);
    EXPECT_EQ(SLComponentId(h_), board);
    EXPECT_EQ(text(SLComponentName(h_)), "Test Board");
    EXPECT_EQ(SLListNextComponent(h_, nullptr, board), 1) << "the end of the list";

    EXPECT_EQ(SLMapClassNameToId(board, "DMTF|Voltage Probe|001"), 30u);
    EXPECT_EQ(SLMapGroupNameToId(board, "Voltage Events"), 20u);
    EXPECT_EQ(SLMapAttributeNameToId(board, 30, "Label"), 2u);
    char* name = SLMapAttributeIdToName(board, 30, 2);
    EXPECT_STREQ(name, "Label");
    SLDeleteString(name);
    name = SLMapComponentIdToName(board);
    EXPECT_STREQ(name, "Test Board");
    SLDeleteString(name);

    float version = 0;
    ASSERT_EQ(SLGetInstalledMIFVersion(h_, "Test Board", &version), 0);
    EXPECT_FLOAT_EQ(version, 2.9f);
    EXPECT_EQ(SLInstallMIF(h_, "absent.mif"), 1);
}

TEST_F(SLProvider, ShippedMifsInstallAndReportTheirVersions)
{
    setenv("UXDMIPATH", MOX_MIF_DIR, 1);
    ASSERT_EQ(SLInstallMIF(h_, "baseboard.mif"), 0) << SLCnfStatus(h_);
    ASSERT_EQ(SLInstallMIF(h_, "mox.mif"), 0) << SLCnfStatus(h_);
    uint32_t mox = SLMapComponentNameToId("Zorek Tessarin Server Manager - Mox");
    ASSERT_NE(mox, 0u);
    EXPECT_NE(SLMapComponentNameToId("Zorek Tessarin Baseboard"), mox);
    float version = 0;
    ASSERT_EQ(SLGetInstalledMIFVersion(h_, "Zorek Tessarin Server Manager - Mox", &version), 0);
    EXPECT_FLOAT_EQ(version, 2.93f);
    ASSERT_EQ(SLGetInstalledMIFVersion(h_, "Zorek Tessarin Baseboard", &version), 0);
    EXPECT_FLOAT_EQ(version, 1.0f);
}

TEST_F(SLProvider, RowsByKeysAndValuesWithKeys)
{
    uint32_t board = install();
    ASSERT_NE(board, 0u);
    // Walk the table with the keys each row gives.
    std::vector<std::string> labels;
    SLKeyList* keys = nullptr;
    while (SLGetNextRow(h_, board, 30, 0, keys) == 0) {
        SLDeleteKeyList(keys);
        keys = SLCreateKeyList(h_);
        ASSERT_NE(keys, nullptr);
        ASSERT_EQ(keys->count, 1u);
        for (uint32_t i = 0; i < SLRowAttributeCount(h_); ++i)
            if (SLRowAttributeId(h_, i) == 2)
                labels.push_back(text(SLRowStringPtr(h_, i)));
        if (labels.size() > 5)
            break;
    }
    EXPECT_EQ(labels, (std::vector<std::string>{"CPU", "Memory", "Fan"}));
    ASSERT_NE(keys, nullptr);
    EXPECT_EQ(loadWord(keys->keys[0].value), 3u) << "the last row's key";

    // Set the label of row 3 through its keys; read it back by row and by
    // attribute.
    const char label[] = "Rear";
    uint8_t value[4 + sizeof label - 1];
    storeWord(value, sizeof label - 1);
    std::memcpy(value + 4, label, sizeof label - 1);
    ASSERT_EQ(SLSetAttribute(h_, board, 30, 2, keys, sizeof value, value), 0) << SLCnfStatus(h_);
    std::string stored;
    ASSERT_EQ(dmisp::getValue(board, 30, 2, {"3"}, &stored), 0u);
    EXPECT_EQ(stored, "Rear");
    ASSERT_EQ(SLGetAttribute(h_, board, 30, 2, keys), 0);
    EXPECT_EQ(text(SLStringPtr(h_)), "Rear");
    ASSERT_EQ(SLGetRow(h_, board, 30, 0, keys), 0);
    EXPECT_EQ(SLRowGroupId(h_), 30u);
    SLDeleteKeyList(keys);
}

TEST_F(SLProvider, EventsReachTheHandlerAndAreCompleted)
{
    uint32_t board = install();
    ASSERT_NE(board, 0u);
    // The install indication: handled on an event thread, then completed.
    ASSERT_TRUE(dmisp::waitIndicationsCompleted());
    int before = seen.count;
    ASSERT_EQ(dmisp::raiseEvent(board, {20, {}}, {30, {"2"}}), 0u);
    ASSERT_TRUE(dmisp::waitIndicationsDelivered());
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while ((seen.count.load() == before || dmisp::indicationsOutstanding() != 0) &&
           std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    EXPECT_EQ(seen.count.load(), before + 1);
    EXPECT_EQ(dmisp::indicationsOutstanding(), 0u) << "the completion callback was called";
    std::lock_guard<std::mutex> guard(seen.lock);
    ASSERT_EQ(seen.classes.size(), 2u);
    EXPECT_EQ(seen.classes[0].rfind("EventGeneration|", 0), 0u) << seen.classes[0];
}

} // namespace
