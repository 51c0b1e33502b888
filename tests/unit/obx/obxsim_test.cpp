#include <gtest/gtest.h>

#include <cstdlib>

#include "obx/obxapi.h"
#include "simdriver.h"

namespace {

using SimulatedDriver = SimDriverTest;

struct Environment {
    explicit Environment(std::vector<std::pair<const char*, const char*>> settings) : names()
    {
        for (auto& [name, value] : settings) {
            setenv(name, value, 1);
            names.push_back(name);
        }
    }
    Environment(const char* name, const char* value) : Environment(std::vector{std::pair{name, value}}) {}
    Environment(const Environment&) = delete;
    Environment& operator=(const Environment&) = delete;
    ~Environment()
    {
        for (const char* name : names)
            unsetenv(name);
    }
    std::vector<const char*> names;
};

TEST_F(SimulatedDriver, ReadsItsSettingsFromTheEnvironment)
{
    Environment environment({{"OBXSIM_IPMI", "0x02"},
                             {"OBXSIM_DEVICE_ID_LENGTH", "12"},
                             {"OBXSIM_I2C", "01.a0=c0ffee;02.50=00"},
                             {"OBXSIM_FAULT", "00.02:cc=c3#1;1092:fail"}});
    ASSERT_EQ(obxsimConfigureFromEnv(), 0);
    uint8_t response[63];
    uint32_t length = 0;
    uint8_t completionCode = 0;
    const ObxpRequest getDeviceId = {0x01, 0x20, 0, 0x06, 0, nullptr, 0};
    ASSERT_EQ(SendTimedObxpRequest(&getDeviceId, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(length, 12u);
    EXPECT_EQ(response[4], 0x02);
    EXPECT_EQ(IpmiVersion, 0x01u);

    const uint8_t offset[1] = {1};
    const I2cRequest read = {0xA0, 0x01, 2, offset, 1};
    ASSERT_EQ(SendTimedI2cRequest(&read, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0);
    ASSERT_EQ(length, 2u);
    EXPECT_EQ(response[0], 0xFF);
    EXPECT_EQ(response[1], 0xEE);

    // The NMI is refused once, then carried out; the shutdown code always fails.
    const uint8_t nmi[1] = {0x04};
    const ObxpRequest chassis = {0x02, 0x20, 0, 0x00, 0, nmi, 1};
    ASSERT_EQ(SendTimedObxpRequest(&chassis, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0xC3);
    ASSERT_EQ(SendTimedObxpRequest(&chassis, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0x00);
    EXPECT_EQ(countLog("chassis control: nmi"), 1u);
    EXPECT_EQ(SetShutDownCode(1, 1), ObxResultError);
    EXPECT_EQ(SetShutDownCode(1, 1), ObxResultError);
}

TEST_F(SimulatedDriver, RejectsSettingsItDoesNotUnderstand)
{
    const char* faults[] = {"06.24", "06.24:explode", "zz.01:fail", "06.24:cc=", "nonsense:fail"};
    for (const char* fault : faults) {
        Environment environment("OBXSIM_FAULT", fault);
        EXPECT_EQ(obxsimConfigureFromEnv(), -1) << fault;
    }
    const char* versions[] = {"1.7", "0x100", ""};
    for (const char* version : versions) {
        Environment environment("OBXSIM_IPMI", version);
        EXPECT_EQ(obxsimConfigureFromEnv(), -1) << version;
    }
    Environment i2c("OBXSIM_I2C", "01.a0=abc");
    EXPECT_EQ(obxsimConfigureFromEnv(), -1);
}

TEST_F(SimulatedDriver, WatchdogNeedsArmingBeforeItStarts)
{
    const ObxpRequest start = {0x22, 0x20, 0, 0x06, 0, nullptr, 0};
    uint32_t length = 0;
    uint8_t completionCode = 0;
    ASSERT_EQ(SendTimedObxpRequest(&start, 300, nullptr, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0x80);
    const uint8_t shortArm[2] = {0x04, 0x01};
    const ObxpRequest arm = {0x24, 0x20, 0, 0x06, 0, shortArm, 2};
    ASSERT_EQ(SendTimedObxpRequest(&arm, 300, nullptr, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0xC7);
}

} // namespace
