// Carry-over of the shipped older own MIFs into the shipped mox.mif.
#include <algorithm>
#include <map>

#include "mif/mif.h"
#include "providerenv.h"

namespace {

const char moxName[] = "Zorek Tessarin Server Manager - Mox";

using Keys = std::vector<std::string>;
using Values = std::map<uint32_t, std::string>; // attribute id -> value text

struct Table {
    std::vector<uint32_t> keyIds;
    std::map<Keys, Values> rows;
};

Table readTable(uint32_t component, uint32_t group)
{
    Table t;
    for (const auto& g : dmisp::groups(component)) {
        if (g.id == group)
            t.keyIds = g.keys;
    }
    std::vector<uint32_t> ids;
    for (const auto& a : dmisp::attributes(component, group))
        ids.push_back(a.id);
    std::sort(ids.begin(), ids.end());
    for (const auto& row : dmisp::rows(component, group)) {
        Values v;
        for (size_t i = 0; i < row.size() && i < ids.size(); ++i)
            v[ids[i]] = row[i];
        Keys k;
        for (uint32_t id : t.keyIds)
            k.push_back(v[id]);
        t.rows[k] = v;
    }
    return t;
}

bool isAction(uint32_t id)
{
    return id >= 7 && id <= 22 && id != 17;
}

class ShippedCarryOver : public ProviderTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(ShippedCarryOver, CustomisedSettingsReachTheNewMif)
{
    const std::string version = GetParam();
    const int oldGroup = version == "2.40" ? 3 : version == "2.60" ? 4 : 10;
    const int newGroup = oldGroup == 3 ? 4 : oldGroup;

    // The new MIF's rows as shipped, from a database of their own.
    std::string error;
    ASSERT_EQ(dmisp::reset(dir + "/fresh", false, &error), 0) << error;
    ASSERT_NE(dmisp::install(MOX_SOURCE_DIR "/mifs/mox.mif", &error), 0u) << error;
    Table shipped = readTable(dmisp::componentId(moxName), newGroup);
    ASSERT_FALSE(shipped.rows.empty());

    ASSERT_EQ(dmisp::reset(dir + "/db-" + version, false, &error), 0) << error;
    uint32_t old = dmisp::install(MOX_SOURCE_DIR "/mifs/old/mox-" + version + ".mif", &error);
    ASSERT_NE(old, 0u) << error;
    // One more setting changed by the administrator at run time.
    Table before = readTable(old, oldGroup);
    ASSERT_FALSE(before.rows.empty());
    {
        const auto& [keys, values] = *before.rows.begin();
        std::string flipped = values.at(20) == "0" ? "1" : "0";
        ASSERT_EQ(dmisp::setValue(old, oldGroup, 20, keys, flipped), 0u);
        ASSERT_EQ(dmisp::setValue(old, oldGroup, 17, keys, "Administrator's alert"), 0u);
        before = readTable(old, oldGroup);
    }

    ASSERT_EQ(RegisterWithSL(), 0);
    uint32_t own = dmisp::componentId(moxName);
    std::string v;
    ASSERT_EQ(dmisp::getValue(own, 1, 3, {}, &v), 0u);
    EXPECT_EQ(v, "2.93");
    Table after = readTable(own, newGroup);

    int carried = 0;
    for (const auto& [oldKeys, oldValues] : before.rows) {
        Keys keys = oldKeys;
        if (oldGroup == 3)
            keys.push_back("0"); // error state of a group-3 row
        auto found = after.rows.find(keys);
        if (found == after.rows.end())
            continue; // the new MIF has no such row: nothing to write
        ++carried;
        const Values& now = found->second;
        for (const auto& [id, value] : oldValues) {
            if (isAction(id)) {
                EXPECT_EQ(now.at(id), value) << "attribute " << id;
            }
        }
        uint32_t enable = oldGroup == 3 ? 6 : 30; // group 3 kept the enable flag in attribute 6
        EXPECT_EQ(now.at(30), oldValues.at(enable));
        auto shippedRow = shipped.rows.find(keys);
        ASSERT_NE(shippedRow, shipped.rows.end());
        EXPECT_EQ(now.at(17), shippedRow->second.at(17)) << "alert names come from the new MIF";
    }
    EXPECT_GE(carried, 2) << "the shipped old rows meet rows of the new MIF";
    // Rows the old MIF did not have keep the shipped settings.
    for (const auto& [keys, values] : after.rows) {
        Keys oldKeys = keys;
        if (oldGroup == 3)
            oldKeys.pop_back();
        if (before.rows.count(oldKeys) == 0 || (oldGroup == 3 && keys.back() != "0")) {
            EXPECT_EQ(values, shipped.rows.at(keys));
        }
    }

    // A second start migrates nothing.
    UnregisterWithSL();
    uint64_t removals = dmisp::commandsReceived(1027), installs = dmisp::commandsReceived(1026);
    ASSERT_EQ(RegisterWithSL(), 0);
    EXPECT_EQ(dmisp::commandsReceived(1027), removals);
    EXPECT_EQ(dmisp::commandsReceived(1026), installs);
    EXPECT_EQ(dmisp::componentId(moxName), own);
    EXPECT_EQ(readTable(own, newGroup).rows, after.rows);
}

INSTANTIATE_TEST_SUITE_P(Versions, ShippedCarryOver, ::testing::Values("2.40", "2.60", "2.92"),
                         [](const ::testing::TestParamInfo<const char*>& param) {
                             std::string name = param.param;
                             name.erase(std::remove(name.begin(), name.end(), '.'), name.end());
                             return "v" + name;
                         });

} // namespace
