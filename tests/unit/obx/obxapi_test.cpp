#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <pthread.h>
#include <unistd.h>

#include "obx/obxapi.h"
#include "simdriver.h"

namespace {

using ObxApi = SimDriverTest;

const uint8_t nmiData[1] = {0x04};
const ObxpRequest chassisNmi = {0x02, 0x20, 0, 0x00, 0, nmiData, 1};

TEST_F(ObxApi, FirstRequestOpensAndIdentifiesOnce)
{
    EXPECT_EQ(GetIpmiVersion(), 0); // never opens the device
    EXPECT_EQ(obxsimOpenCount(), 0);

    uint8_t response[63];
    uint32_t length = 99;
    uint8_t completionCode = 0xFF;
    ASSERT_EQ(SendTimedObxpRequest(&chassisNmi, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0);
    EXPECT_EQ(length, 0u);
    ASSERT_EQ(SendTimedObxpRequest(&chassisNmi, 300, response, &length, &completionCode), ObxResultOk);

    EXPECT_EQ(obxsimOpenCount(), 1);
    std::vector<ObxSimRequest> requests = obxsimRequests();
    ASSERT_EQ(requests.size(), 3u);
    // Get Device ID first, over the same descriptor, then the two requests.
    EXPECT_EQ(requests[0].netFunction, 0x06);
    EXPECT_EQ(requests[0].command, 0x01);
    EXPECT_EQ(requests[0].rsSlaveAddress, 0x20);
    EXPECT_EQ(requests[0].timeout, 400000u);
    EXPECT_TRUE(requests[0].data.empty());
    EXPECT_EQ(requests[1].command, 0x02);
    EXPECT_EQ(requests[1].timeout, 300000u);
    EXPECT_EQ(requests[1].data, std::vector<uint8_t>{0x04});
    EXPECT_EQ(countLog("get device id"), 1u);
    EXPECT_EQ(countLog("chassis control: nmi"), 2u);
    EXPECT_NE(hDevice1, 0);
    EXPECT_EQ(GetIpmiVersion(), 0x51);
}

TEST_F(ObxApi, ClassesTheControllerByLengthAndVersionByte)
{
    struct Case {
        uint8_t versionByte;
        uint32_t dataLength;
        uint32_t expected;
    } cases[] = {
        {0x51, 15, 0x51}, {0x51, 11, 0x51}, {0x02, 11, 0x01}, {0x01, 15, 0x01}, {0x00, 15, 0x01},
        {0x51, 10, 0x90}, {0x90, 10, 0x90}, {0x02, 1, 0x90},
    };
    for (const Case& c : cases) {
        SetUp();
        obxsimSetDeviceId(c.versionByte, c.dataLength);
        EXPECT_EQ(open_obx(), 1);
        EXPECT_EQ(IpmiVersion, c.expected) << std::hex << int(c.versionByte) << " " << c.dataLength;
        EXPECT_EQ(GetIpmiVersion(), static_cast<uint8_t>(c.expected));
        EXPECT_EQ(open_obx(), 1); // already open: no second query
        EXPECT_EQ(countLog("get device id"), 1u);
        TearDown();
    }
    // The named versions of the simulated controller.
    struct Named {
        const char* name;
        uint32_t expected;
    } named[] = {{"0.9", 0x90}, {"1.0", 0x01}, {"1.5", 0x51}, {"2.0", 0x01}};
    for (const Named& n : named) {
        SetUp();
        ASSERT_EQ(obxsimSetIpmiVersion(n.name), 0);
        EXPECT_EQ(open_obx(), 1);
        EXPECT_EQ(IpmiVersion, n.expected) << n.name;
        TearDown();
    }
}

TEST_F(ObxApi, MissingDeviceIsReportedAndRetried)
{
    obxsimSetDeviceMissing(true);
    uint32_t length = 7;
    uint8_t completionCode = 0x33;
    testing::internal::CaptureStderr();
    EXPECT_EQ(SendTimedObxpRequest(&chassisNmi, 300, nullptr, &length, &completionCode), ObxResultError);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "obxapi open_obx: open(/dev/obx) failed\n: No such file or directory\n");
    EXPECT_EQ(length, 7u); // untouched
    EXPECT_EQ(completionCode, 0x33);
    EXPECT_EQ(hDevice1, 0);
    EXPECT_EQ(IpmiVersion, 0u);

    obxsimSetDeviceMissing(false);
    EXPECT_EQ(SendTimedObxpRequest(&chassisNmi, 300, nullptr, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(obxsimOpenCount(), 1);
}

TEST_F(ObxApi, FailedIdentificationClosesTheDevice)
{
    struct Case {
        ObxSimFault fault;
        uint8_t value;
        const char* line;
    } cases[] = {
        {ObxSimCompletionCode, 0xC1, "open_obx: SendTimedObxpRequest error. Ret = 0 CC = 0xC1\n"},
        {ObxSimFail, 0, "open_obx: SendTimedObxpRequest error. Ret = 1 CC = 0x0\n"},
        {ObxSimPositive, 0, "open_obx: SendTimedObxpRequest error. Ret = 1 CC = 0x0\n"},
        {ObxSimEmpty, 0, "open_obx: SendTimedObxpRequest error. Ret = 1 CC = 0x0\n"},
    };
    for (const Case& c : cases) {
        SetUp();
        obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x01, c.fault, c.value, 1);
        testing::internal::CaptureStdout();
        EXPECT_EQ(open_obx(), 0);
        EXPECT_EQ(testing::internal::GetCapturedStdout(), c.line);
        EXPECT_EQ(hDevice1, 0);
        EXPECT_EQ(IpmiVersion, 0u);
        EXPECT_EQ(countLog("close /dev/obx"), 1u);
        // The next use starts again from the beginning.
        EXPECT_EQ(open_obx(), 1);
        EXPECT_EQ(obxsimOpenCount(), 2);
        TearDown();
    }
}

TEST_F(ObxApi, DriverAnswersAndFaults)
{
    struct Case {
        ObxSimFault fault;
        uint8_t value;
        int result;
        int deviceIoControl;
        uint8_t completionCode;
        uint32_t length;
    } cases[] = {
        {ObxSimFail, 0, ObxResultError, 0, 0xAA, 0xBB},
        {ObxSimPositive, 0, ObxResultError, 0, 0xAA, 0xBB}, // a positive ioctl return is a failure
        {ObxSimEmpty, 0, ObxResultError, 1, 0xAA, 0xBB},
        {ObxSimShort, 0, ObxResultOk, 1, 0x00, 0},
        {ObxSimCompletionCode, 0xC0, ObxResultOk, 1, 0xC0, 0},
        {ObxSimOverlong, 0, ObxResultError, 1, 0xAA, 0xBB},
    };
    for (const Case& c : cases) {
        SetUp();
        ASSERT_EQ(open_obx(), 1);
        obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x01, c.fault, c.value, 2);
        // The same request through both calls.
        uint8_t response[63];
        uint32_t length = 0xBB;
        uint8_t completionCode = 0xAA;
        const ObxpRequest getDeviceId = {0x01, 0x20, 0, 0x06, 0, nullptr, 0};
        EXPECT_EQ(SendTimedObxpRequest(&getDeviceId, 300, response, &length, &completionCode), c.result)
            << c.fault;
        EXPECT_EQ(completionCode, c.completionCode) << c.fault;
        EXPECT_EQ(length, c.length) << c.fault;

        ObxDriverRequest in{};
        in.rsSlaveAddress = 0x20;
        in.command = 0x01;
        in.netFunction = 0x06;
        ObxDriverResponse out{};
        uint32_t returned = 64;
        EXPECT_EQ(DeviceIoControl(0, ObxIoctlSendMessage, &in, 64, &out, 64, &returned, nullptr), c.deviceIoControl)
            << c.fault;
        TearDown();
    }
}

TEST_F(ObxApi, NullResponseBufferStillGivesTheCompletionCode)
{
    const ObxpRequest getDeviceId = {0x01, 0x20, 0, 0x06, 0, nullptr, 0};
    uint32_t length = 99;
    uint8_t completionCode = 0xFF;
    EXPECT_EQ(SendTimedObxpRequest(&getDeviceId, 300, nullptr, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0);
    EXPECT_EQ(length, 0u);

    uint8_t response[63] = {};
    EXPECT_EQ(SendTimedObxpRequest(&getDeviceId, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(length, 15u);
    EXPECT_EQ(response[4], 0x51);
}

TEST_F(ObxApi, OverlongDriverCountNeverCopiesPastTheCallersBuffer)
{
    ASSERT_EQ(open_obx(), 1);
    obxsimInjectFault(ObxIoctlSendMessage, -1, -1, ObxSimOverlong);
    // Buffers of exactly the documented sizes, so AddressSanitizer sees any overrun.
    std::vector<uint8_t> timed(63, 0x11), i2c(33, 0x22);
    uint32_t length = 0;
    uint8_t completionCode = 0;
    EXPECT_EQ(SendTimedObxpRequest(&chassisNmi, 300, timed.data(), &length, &completionCode), ObxResultError);
    EXPECT_EQ(timed, std::vector<uint8_t>(63, 0x11));
    const I2cRequest read = {0xA0, 0x00, 4, nullptr, 0};
    EXPECT_EQ(SendTimedI2cRequest(&read, 300, i2c.data(), &length, &completionCode), ObxResultError);
    EXPECT_EQ(i2c, std::vector<uint8_t>(33, 0x22));
    uint8_t sequence = 0x77;
    EXPECT_EQ(SendAsyncObxpRequest(&chassisNmi, &sequence), ObxResultError);
    EXPECT_EQ(sequence, 0x77);
}

// A driver whose Get Device ID answer fills the whole 64-byte out-buffer.
int fullAnswerIoctl(int, unsigned long request, void* argument)
{
    ObxIoctlRecord record;
    std::memcpy(&record, argument, sizeof record);
    if (request != ObxIoctlSendMessage)
        return -1;
    auto* out = static_cast<uint8_t*>(record.outBuffer);
    std::memset(out, 0x5A, record.outSize);
    out[0] = 0x00;
    out[1 + 4] = 0x51;
    *record.bytesReturned = record.outSize;
    return 0;
}

int fakeOpen(const char*, int)
{
    return 42;
}

int fakeClose(int)
{
    return 0;
}

TEST_F(ObxApi, LongestIdentityAnswerFitsTheOpeningBuffer)
{
    const ObxOs full = {fakeOpen, fullAnswerIoctl, simMmap, obxsimMunmap, fakeClose};
    obxSetOs(&full);
    EXPECT_EQ(open_obx(), 1);
    EXPECT_EQ(IpmiVersion, 0x51u);
    hDevice1 = 0;
}

TEST_F(ObxApi, OversizedRequestDataIsRefusedBeforeTheDriver)
{
    ASSERT_EQ(open_obx(), 1);
    const size_t before = obxsimRequests().size();
    std::vector<uint8_t> data(64, 0x01);
    uint32_t length = 0;
    uint8_t completionCode = 0;
    uint8_t sequence = 0;
    uint8_t response[63];
    auto timed = [&](int32_t count) {
        ObxpRequest request = {0x40, 0x20, 0, 0x30, 0, data.data(), count};
        return SendTimedObxpRequest(&request, 300, response, &length, &completionCode);
    };
    auto async = [&](int32_t count) {
        ObxpRequest request = {0x40, 0x20, 0, 0x30, 0, data.data(), count};
        return SendAsyncObxpRequest(&request, &sequence);
    };
    auto i2c = [&](int32_t count) {
        I2cRequest request = {0xA0, 0x00, 1, data.data(), count};
        return SendTimedI2cRequest(&request, 300, response, &length, &completionCode);
    };
    EXPECT_EQ(timed(52), ObxResultError);
    EXPECT_EQ(timed(-1), ObxResultError);
    EXPECT_EQ(async(22), ObxResultError);
    EXPECT_EQ(async(-5), ObxResultError);
    EXPECT_EQ(i2c(19), ObxResultError);
    EXPECT_EQ(i2c(-1), ObxResultError);
    ObxpRequest noData = {0x40, 0x20, 0, 0x30, 0, nullptr, 3};
    EXPECT_EQ(SendTimedObxpRequest(&noData, 300, response, &length, &completionCode), ObxResultError);
    EXPECT_EQ(obxsimRequests().size(), before);

    // The largest that fit reach the driver whole.
    EXPECT_EQ(timed(51), ObxResultOk);
    EXPECT_EQ(async(21), ObxResultOk);
    EXPECT_EQ(i2c(18), ObxResultOk);
    std::vector<ObxSimRequest> requests = obxsimRequests();
    ASSERT_EQ(requests.size(), before + 3);
    EXPECT_EQ(requests[before].data.size(), 51u);
    EXPECT_EQ(requests[before + 1].data.size(), 21u);
    EXPECT_EQ(requests[before + 1].flags, 1u);
    EXPECT_EQ(requests[before + 1].timeout, 0u);
    EXPECT_EQ(requests[before + 2].data.size(), 21u);
}

TEST_F(ObxApi, I2cMasterWriteRead)
{
    obxsimSetI2cDevice(0x03, 0xA0, {0x10, 0x11, 0x12, 0x13, 0x14, 0x15});
    const uint8_t offset[1] = {0x02};
    const I2cRequest read = {0xA0, 0x03, 3, offset, 1};
    uint8_t response[33] = {};
    uint32_t length = 0;
    uint8_t completionCode = 0xFF;
    ASSERT_EQ(SendTimedI2cRequest(&read, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0);
    ASSERT_EQ(length, 3u);
    EXPECT_EQ(response[0], 0x12);
    EXPECT_EQ(response[2], 0x14);
    std::vector<ObxSimRequest> sent = requestsFor(0x06, 0x52);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].data, (std::vector<uint8_t>{0x03, 0xA0, 3, 0x02}));

    // No buffer: the length is still reported and nothing is copied.
    length = 0;
    EXPECT_EQ(SendTimedI2cRequest(&read, 300, nullptr, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(length, 3u);

    const I2cRequest absent = {0xB0, 0x03, 1, nullptr, 0};
    EXPECT_EQ(SendTimedI2cRequest(&absent, 300, response, &length, &completionCode), ObxResultOk);
    EXPECT_EQ(completionCode, 0x83);
    EXPECT_EQ(length, 0u);
}

TEST_F(ObxApi, AsyncRequestNeedsExactlyTwoBytes)
{
    uint8_t sequence = 0;
    ASSERT_EQ(SendAsyncObxpRequest(&chassisNmi, &sequence), ObxResultOk);
    EXPECT_EQ(sequence, 1);
    ASSERT_EQ(SendAsyncObxpRequest(&chassisNmi, &sequence), ObxResultOk);
    EXPECT_EQ(sequence, 2);
    obxsimInjectFault(ObxIoctlSendMessage, 0x00, 0x02, ObxSimShort, 0, 1);
    sequence = 0x77;
    EXPECT_EQ(SendAsyncObxpRequest(&chassisNmi, &sequence), ObxResultError);
    EXPECT_EQ(sequence, 0x77);
    EXPECT_EQ(SendAsyncObxpRequest(&chassisNmi, nullptr), ObxResultError);
}

TEST_F(ObxApi, ShutdownCodeRecordHoldsCodeThenDelay)
{
    EXPECT_EQ(SetShutDownCode(400, 1), ObxResultOk);
    EXPECT_EQ(SetShutDownCode(1, 2), ObxResultOk);
    EXPECT_EQ(countLog("shutdown code 1 delay 400"), 1u);
    EXPECT_EQ(countLog("shutdown code 2 delay 1"), 1u);
    obxsimInjectFault(ObxIoctlSetShutdownCode, -1, -1, ObxSimFail, 0, 1);
    EXPECT_EQ(SetShutDownCode(400, 1), ObxResultError);
    EXPECT_EQ(NTstatus[0], 0xC0000001u);
}

// The first opening is slow, so two first uses overlap.
int slowOpen(const char* path, int flags)
{
    usleep(50000);
    return obxsimOpen(path, flags);
}

TEST_F(ObxApi, ConcurrentFirstUsesOpenTheDeviceOnce)
{
    const ObxOs slow = {slowOpen, obxsimIoctl, simMmap, obxsimMunmap, obxsimClose};
    obxSetOs(&slow);
    constexpr int threadCount = 4;
    pthread_barrier_t barrier;
    pthread_barrier_init(&barrier, nullptr, threadCount);
    struct Shared {
        pthread_barrier_t* barrier;
        std::atomic<int> failures{0};
    } shared{&barrier};
    auto work = [](void* argument) -> void* {
        auto* s = static_cast<Shared*>(argument);
        pthread_barrier_wait(s->barrier);
        uint32_t length = 0;
        uint8_t completionCode = 0xFF;
        if (SendTimedObxpRequest(&chassisNmi, 300, nullptr, &length, &completionCode) != ObxResultOk ||
            completionCode != 0)
            ++s->failures;
        return nullptr;
    };
    pthread_t threads[threadCount];
    for (pthread_t& thread : threads)
        ASSERT_EQ(pthread_create(&thread, nullptr, work, &shared), 0);
    for (pthread_t& thread : threads)
        pthread_join(thread, nullptr);
    pthread_barrier_destroy(&barrier);
    EXPECT_EQ(shared.failures.load(), 0);
    EXPECT_EQ(obxsimOpenCount(), 1);
    EXPECT_EQ(countLog("get device id"), 1u);
    EXPECT_EQ(countLog("chassis control: nmi"), static_cast<size_t>(threadCount));
}

} // namespace
