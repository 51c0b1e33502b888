// The sample configuration shipped with the daemon, read by the daemon's own
// configuration reader: as shipped it changes nothing; with the "#" taken off
// the line it tells the reader to uncomment, notifications-only is on.
#include "actions/uxaction.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>
#include <unistd.h>

namespace {

std::string readSample()
{
    std::ifstream in(MOX_SAMPLE_CONFIG);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

class SampleConfig : public ::testing::Test {
protected:
    void SetUp() override
    {
        sample = readSample();
        ASSERT_FALSE(sample.empty()) << MOX_SAMPLE_CONFIG;
        char name[] = "/tmp/moxcfgXXXXXX";
        int fd = mkstemp(name);
        ASSERT_GE(fd, 0);
        close(fd);
        path = name;
    }
    void TearDown() override
    {
        unlink(path.c_str());
        bNotificationOnly = 0;
    }
    uint32_t readWith(const std::string& text, uint32_t before)
    {
        std::ofstream(path) << text;
        bNotificationOnly = before;
        EXPECT_EQ(processCfgFile(path.c_str()), 1);
        return bNotificationOnly;
    }
    std::string sample;
    std::string path;
};

TEST_F(SampleConfig, AsShippedChangesNothing)
{
    // Every line mentioning the option is a comment, so neither value moves.
    EXPECT_EQ(readWith(sample, 0), 0u);
    EXPECT_EQ(readWith(sample, 1), 1u);
}

TEST_F(SampleConfig, UncommentedLineTurnsTheOptionOn)
{
    const std::string commented = "\n#notificationonly = true\n";
    size_t at = sample.find(commented);
    ASSERT_NE(at, std::string::npos) << "the sample has no line to uncomment";
    std::string edited = sample;
    edited.erase(at + 1, 1);
    EXPECT_EQ(readWith(edited, 0), 1u);

    // The same line with false, as the sample's rules say, turns it off.
    std::string off = edited;
    off.replace(off.find("= true", at), 6, "= false");
    EXPECT_EQ(readWith(off, 1), 0u);
}

} // namespace
