// The substitute provider's contract: the confirms and indications it writes
// read through the SL accessors as the daemon reads them. The end-to-end
// testbed is worth what this table pins.
#include <gtest/gtest.h>

#include <cstdlib>

#include "dmisp/dmisp.h"
#include "scripted_provider.h"

namespace {

const char board[] = R"(start component name = "Test Board"
  start group name = "Voltage Events" class = "EventGeneration|Voltage Probe|001" id = 20
    start attribute name = "Event Type" id = 1 type = integer value = 2 end attribute
  end group
  start group name = "Voltage Probe" class = "DMTF|Voltage Probe|001" key = 1
    start attribute name = "Index" id = 1 type = integer end attribute
    start attribute name = "Label" id = 2 type = displaystring(16) end attribute
  end group
  start table name = "Voltage Probe" class = "DMTF|Voltage Probe|001" id = 30 {1, "CPU"} {2, "Memory"} end table
end component)";

std::string str(uint32_t n) { return std::to_string(static_cast<int32_t>(n)) + " "; }
std::string seen;

// Events only: class 1 is the instance row behind the event-generation row.
int handler(SLHandle* h)
{
    SLEventSelectRowCnf(h, 1, 0);
    if (SLIndicationType(h) == 1)
        seen = str(SLEventClassCount(h)) + str(SLKeyCount(h)) + str(SLRowGroupId(h)) + text(SLRowStringPtr(h, 1)) +
            " " + text(SLEventClassString(h, 0));
    return 0;
}

TEST(ProviderContract, ConfirmsAndIndicationsReadThroughTheAccessors)
{
    char dir[] = "/tmp/sl-contract-XXXXXX";
    ASSERT_TRUE(mkdtemp(dir) && dmisp::reset(dir, false) == 0);
    SLInitialize();
    SLHandle* h = SLCreateHandle(0);
    ASSERT_EQ(SLDmiRegisterMgmt(h, handler), 0);
    uint32_t c = dmisp::installText(board, "board.mif");
    SLKeyList* keys = nullptr;
    std::tuple<const char*, std::function<int()>, std::function<std::string()>, std::string> rows[] = {
        {"group", [&] { return SLListGroup(h, c, 30); },
            [&] { return str(SLKeyCount(h)) + text(SLGroupName(h, 0)) + "/" + text(SLGroupClassName(h, 0)); },
            "1 Voltage Probe/DMTF|Voltage Probe|001"},
        {"first row", [&] { return SLGetFirstRow(h, c, 30, 0, nullptr); },
            [&] { return str(SLRowGroupId(h)) + str(SLRowAttributeCount(h)) + str(SLRowIntegerValue(h, 0)) +
                      text(SLRowStringPtr(h, 1)); }, "30 2 1 CPU"},
        {"get by the row's keys", [&] { return SLGetAttribute(h, c, 30, 2, keys = SLCreateKeyList(h)); },
            [&] { return str(SLAttributeType(h, 0)) + text(SLStringPtr(h)); }, "8 CPU"},
        {"next row by keys", [&] { return SLGetNextRow(h, c, 30, 0, keys); },
            [&] { return str(SLRowIntegerValue(h, 0)) + text(SLRowStringPtr(h, 1)); }, "2 Memory"}};
    for (const auto& [name, command, read, want] : rows) {
        ASSERT_EQ(command(), 0) << name << ": status " << SLCnfStatus(h);
        EXPECT_EQ(read(), want) << name;
    }
    for (uint32_t level : {SL_LEVEL_CHECK, 0u}) { // rows back to back, or an array of their offsets
        dmisp::setIndicationLevelCheck(level);
        ASSERT_TRUE(dmisp::raiseEvent(c, {20, {}}, {30, {"2"}}) == 0 && dmisp::waitIndicationsCompleted());
        EXPECT_EQ(seen, "2 1 30 Memory EventGeneration|Voltage Probe|001") << "level check " << level;
    }
    SLDmiUnregisterMgmt(h);
    dmisp::shutdown();
    SLCleanup();
    EXPECT_EQ(std::system(("rm -rf " + std::string(dir)).c_str()), 0);
}

} // namespace
