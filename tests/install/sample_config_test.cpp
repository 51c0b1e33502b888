// The shipped sample configuration read by the daemon's own reader: as shipped
// it changes nothing; each commented "#option = true" line, uncommented, turns
// its option on (and with "false" off) and leaves the other options alone.
#include "actions/actionlog.h"
#include "actions/uxaction.h"

#include <gtest/gtest.h>

#include <fstream>
#include <regex>

TEST(SampleConfig, AsShippedNothingUncommentedTurnsItsOptionOn)
{
    const std::pair<std::string, uint32_t*> flags[] = {{"notificationonly", &bNotificationOnly},
                                                       {"actionlog", &bActionLog}};
    std::vector<std::string> lines;
    std::ifstream in(MOX_SAMPLE_CONFIG);
    for (std::string line; std::getline(in, line);)
        lines.push_back(line + "\n");
    // The options on after reading the sample with line `edited` replaced.
    auto read = [&](size_t edited, const std::string& with, uint32_t before) {
        std::string on, path = testing::TempDir() + "mox.cfg";
        std::ofstream out(path);
        for (size_t i = 0; i < lines.size(); ++i)
            out << (i == edited ? with : lines[i]);
        out.close();
        for (auto& [name, flag] : flags)
            if (flag != nullptr)
                *flag = before;
        EXPECT_EQ(processCfgFile(path.c_str()), 1);
        for (auto& [name, flag] : flags)
            on += flag != nullptr && *flag != 0 ? name + " " : "";
        return on;
    };
    const std::string all = read(lines.size(), "", 1); // as shipped: every option kept on
    EXPECT_EQ(read(lines.size(), "", 0), "");
    int options = 0;
    for (size_t i = 0; i < lines.size(); ++i) {
        std::smatch m;
        if (!std::regex_match(lines[i], m, std::regex("#(\\w+) *= *true\n")) || ++options == 0)
            continue;
        const std::string name = m[1], line = lines[i].substr(1);
        size_t at = all.find(name + " ");
        ASSERT_NE(at, std::string::npos) << name << ": an option this reader does not set";
        EXPECT_EQ(read(i, line, 0), name + " ");
        EXPECT_EQ(read(i, std::regex_replace(line, std::regex("true"), "false"), 1),
                  std::string(all).erase(at, name.size() + 1)) << name;
    }
    EXPECT_GE(options, 1) << "the sample has no line to uncomment";
}
