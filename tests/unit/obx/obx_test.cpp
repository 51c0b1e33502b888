#include <gtest/gtest.h>

#include <cstring>
#include <fstream>

#include "simdriver.h"

namespace {

using Obx = SimDriverTest;
using Bytes = std::vector<uint8_t>;

TEST_F(Obx, RequestRecords)
{
    const uint8_t data[2] = {7, 9};
    uint8_t out[64], cc, sequence;
    uint32_t n;
    // request: the last one's flags, timeout / 1000, address, net function, command, LUN, data
    struct Row { const char* name; std::function<int()> call; Bytes request; } rows[] = {
        {"timed", [&] { const ObxpRequest r = {0x02, 0x20, 0, 0x00, 1, data, 1};
                        return SendTimedObxpRequest(&r, 3, out, &n, &cc); }, {0, 3, 0x20, 0x00, 0x02, 1, 7}},
        {"asynchronous", [&] { const ObxpRequest r = {0x01, 0x22, 0, 0x06, 0, data, 2};
                               return SendAsyncObxpRequest(&r, &sequence); }, {1, 0, 0x22, 0x06, 0x01, 0, 7, 9}},
        {"i2c write-read", [&] { const I2cRequest r = {0xA0, 0x01, 4, data, 2};
                                 return SendTimedI2cRequest(&r, 5, out, &n, &cc); }, {0, 5, 0x20, 0x06, 0x52, 0, 1, 0xA0, 4, 7, 9}}};
    for (const Row& row : rows) {
        SetUp();
        ASSERT_EQ(row.call(), ObxResultOk) << row.name;
        const ObxSimRequest r = obxsimRequests().back();
        Bytes seen = {uint8_t(r.flags), uint8_t(r.timeout / 1000), r.rsSlaveAddress, r.netFunction, r.command, r.rsLun};
        seen.insert(seen.end(), r.data.begin(), r.data.end());
        EXPECT_EQ(seen, row.request) << row.name << " timeout " << r.timeout;
    }
    // The after-shutdown code record: code, then delay in tenths of a second.
    EXPECT_EQ(SetShutDownCode(400, 2), ObxResultOk);
    EXPECT_TRUE(logged("shutdown code 2 delay 400")) << actions();
}

TEST_F(Obx, ControllerClassAndDriverFaults)
{
    struct Row { uint8_t versionByte; uint32_t dataLength, expected; } rows[] = {
        {0x51, 15, 0x51}, {0x51, 11, 0x51}, {0x02, 11, 0x01}, {0x51, 10, 0x90}, {0x02, 1, 0x90}};
    for (const Row& row : rows) {
        SetUp();
        obxsimSetDeviceId(row.versionByte, row.dataLength);
        EXPECT_EQ(open_obx(), 1);
        EXPECT_EQ(GetIpmiVersion(), row.expected) << int(row.versionByte) << " " << row.dataLength;
    }
    // A count beyond the out-buffer, or request data beyond the in-buffer, never copies.
    obxsimInjectFault(ObxIoctlSendMessage, -1, -1, ObxSimOverlong);
    Bytes out(63, 0x11), big(52, 1);
    uint32_t n = 0;
    uint8_t cc = 0;
    const ObxpRequest probe = {0x02, 0x20, 0, 0x00, 0, big.data(), 1}, tooBig = {0x02, 0x20, 0, 0x00, 0, big.data(), 52};
    EXPECT_EQ(SendTimedObxpRequest(&probe, 3, out.data(), &n, &cc), ObxResultError);
    EXPECT_EQ(out, Bytes(63, 0x11));
    size_t sent = obxsimRequests().size();
    EXPECT_EQ(SendTimedObxpRequest(&tooBig, 3, out.data(), &n, &cc), ObxResultError);
    EXPECT_EQ(obxsimRequests().size(), sent);
    // A positive ioctl result is a failure too.
    obxsimInjectFault(ObxIoctlSetShutdownCode, -1, -1, ObxSimPositive);
    EXPECT_EQ(SetShutDownCode(1, 1), ObxResultError);

    // Opening fails: no device (the perror line), or Get Device ID refused (its
    // line; the device is closed again and opened anew on the next request).
    SetUp();
    obxsimSetDeviceMissing(true);
    testing::internal::CaptureStderr();
    EXPECT_EQ(open_obx(), 0);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "obxapi open_obx: open(/dev/obx) failed\n: No such file or directory\n");
    SetUp();
    obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x01, ObxSimCompletionCode, 0xC1, 1);
    testing::internal::CaptureStdout();
    EXPECT_EQ(SetShutDownCode(1, 1), ObxResultError);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "open_obx: SendTimedObxpRequest error. Ret = 0 CC = 0xC1\n");
    EXPECT_TRUE(hDevice1 == 0 && logged("close /dev/obx")) << actions();
    EXPECT_EQ(SetShutDownCode(1, 1), ObxResultOk);
    EXPECT_EQ(obxsimOpenCount(), 2);
}

TEST_F(Obx, MessageResponses)
{
    // The IPMB response to a Get Device ID request from 0x81 with sequence 2:
    // 0x81, net function 0x1C, checksum 0x63, 0x20, 0x08, command 0x01, the
    // reply 0x00 0x55 and the checksum of 0x20..0x55.
    const uint8_t message[7] = {0x20, 0x18, 0xC8, 0x81, 0x08, 0x01, 0x57}, reply[2] = {0x00, 0x55};
    const Bytes ipmb = {0x81, 0x1C, 0x63, 0x20, 0x08, 0x01, 0x00, 0x55, 0x82};
    auto emp = [&] { return SendTimedEmpMessageResponse(message, reply, 2, 3); };
    auto lanEx = [&] { return SendTimedLanMessageResponse_Ex(message, reply, 2, 3, 0x33, 5); };
    struct Row { const char* version; std::function<int()> send; uint8_t command; Bytes prefix; } rows[] = {
        {"1.5", emp, 0x34, {0x01}}, {"1.5", lanEx, 0x34, {0x05, 0x33}}, {"0.9", emp, 0x7A, {}}, {"0.9", lanEx, 0x7A, {0x33}}};
    for (const Row& row : rows) {
        SetUp();
        ASSERT_EQ(obxsimSetIpmiVersion(row.version), 0);
        EXPECT_EQ(row.send(), ObxResultOk);
        Bytes expected = row.prefix;
        expected.insert(expected.end(), ipmb.begin(), ipmb.end());
        std::vector<ObxSimRequest> sent = requestsFor(0x06, row.command);
        EXPECT_EQ(sent.empty() ? Bytes{} : sent[0].data, expected) << row.version << " " << row.prefix.size();
    }
}

TEST_F(Obx, AsyncFetchAndMemoryMapping)
{
    // Privilege 4 in bits 7-4 of the channel byte: only bits 3-0 name the channel.
    obxsimQueueMessage(2, 4, -1, {0x20, 0x18});
    obxsimQueueMessage(1, 4, -1, {0x20, 0x1C, 0x03});
    obxsimQueueMessage(6, 3, 0x42, {0x20, 0x14});
    uint8_t buffer[64], session = 0, privilege = 0;
    uint32_t length = sizeof buffer, sequence = 0;
    ASSERT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultOk); // passes over channel 2
    EXPECT_EQ(Bytes(buffer, buffer + length), (Bytes{0x20, 0x1C, 0x03}));
    EXPECT_EQ(sequence, 2u);
    length = sizeof buffer;
    ASSERT_EQ(GetAsyncObxpMessage_Ex(buffer, &length, 1, &sequence, 6, &session, &privilege), ObxResultOk);
    EXPECT_EQ(Bytes(buffer, buffer + length), (Bytes{0x20, 0x14}));
    EXPECT_EQ(std::make_pair(session, privilege), std::make_pair(uint8_t{0x42}, uint8_t{3}));
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultNoMessage);

    // Physical memory: a file standing at 0xE0000; the mapping starts on the page.
    std::string contents(0x2000, '\0'), path = "/tmp/moxobxmem" + std::to_string(getpid());
    for (size_t i = 0; i < contents.size(); ++i)
        contents[i] = static_cast<char>(i * 7 + i / 256);
    std::ofstream(path, std::ios::binary) << contents;
    obxsimSetMemory(path.c_str(), 0xE0000);
    void* mapped = nullptr;
    ASSERT_EQ(MapPhysicalMemory(0xE0923, 16, &mapped), ObxResultOk);
    EXPECT_EQ(std::memcmp(mapped, contents.data() + 0x923, 16), 0);
    EXPECT_EQ(UnmapPhysicalMemory(mapped, 16), ObxResultOk);
    EXPECT_EQ(UnmapPhysicalMemory(mapped, -1), ObxResultError);
    obxsimSetMemory(path.c_str(), 0xFED00000); // above 2 GiB the file offset stays positive
    ASSERT_EQ(MapPhysicalMemory(0xFED00010, 16, &mapped), ObxResultOk);
    EXPECT_EQ(std::memcmp(mapped, contents.data() + 0x10, 16), 0);
    EXPECT_EQ(UnmapPhysicalMemory(mapped, 16), ObxResultOk);
    EXPECT_EQ(actions(), "async message fetched: sequence 1; async message fetched: sequence 2; async message "
                         "fetched: sequence 3; mmap physical 0xe0000 length 2355; close /dev/obx; munmap length 2355; "
                         "mmap physical 0xfed00000 length 32; close /dev/obx; munmap length 32; ");
    unlink(path.c_str());
}

} // namespace
