#include <gtest/gtest.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include "simdriver.h"

namespace {

using Obx = SimDriverTest;
using Bytes = std::vector<uint8_t>;

std::string describe(const ObxSimRequest& r)
{
    char text[64];
    snprintf(text, sizeof text, "flags %u timeout %u to 0x%02x netfn 0x%02x cmd 0x%02x lun %u data", r.flags, r.timeout,
             r.rsSlaveAddress, r.netFunction, r.command, r.rsLun);
    std::string out = text;
    for (uint8_t b : r.data)
        out += " " + std::to_string(b);
    return out;
}

TEST_F(Obx, RequestRecords)
{
    const uint8_t data[2] = {7, 9};
    struct Row {
        const char* name;
        std::function<int()> call;
        std::string request; // the last request the controller saw
        std::string log;     // a line the driver logged, if any
    } rows[] = {
        {"identity on first use", [] { return open_obx() == 1 ? 0 : 1; },
         "flags 0 timeout 400000 to 0x20 netfn 0x06 cmd 0x01 lun 0 data", ""},
        {"timed", [&] { const ObxpRequest r = {0x02, 0x20, 0, 0x00, 0, data, 1};
                        uint8_t out[64], cc; uint32_t n; return SendTimedObxpRequest(&r, 3, out, &n, &cc); },
         "flags 0 timeout 3000 to 0x20 netfn 0x00 cmd 0x02 lun 0 data 7", ""},
        {"asynchronous", [&] { const ObxpRequest r = {0x01, 0x20, 0, 0x06, 0, data, 2};
                               uint8_t sequence = 0; return SendAsyncObxpRequest(&r, &sequence); },
         "flags 1 timeout 0 to 0x20 netfn 0x06 cmd 0x01 lun 0 data 7 9", ""},
        {"i2c write-read", [&] { const I2cRequest r = {0xA0, 0x01, 4, data, 2};
                                 uint8_t out[64], cc; uint32_t n; return SendTimedI2cRequest(&r, 5, out, &n, &cc); },
         "flags 0 timeout 5000 to 0x20 netfn 0x06 cmd 0x52 lun 0 data 1 160 4 7 9", ""},
        {"after-shutdown code", [] { return SetShutDownCode(400, 2); },
         "flags 0 timeout 400000 to 0x20 netfn 0x06 cmd 0x01 lun 0 data", "shutdown code 2 delay 400"},
    };
    for (const Row& row : rows) {
        SetUp();
        EXPECT_EQ(row.call(), ObxResultOk) << row.name;
        ASSERT_FALSE(obxsimRequests().empty()) << row.name;
        EXPECT_EQ(describe(obxsimRequests().back()), row.request) << row.name;
        EXPECT_TRUE(row.log.empty() || logged(row.log)) << row.name << ": " << actions();
    }
}

TEST_F(Obx, ControllerClassAndDriverFaults)
{
    struct Row {
        uint8_t versionByte;
        uint32_t dataLength;
        uint32_t expected;
    } rows[] = {{0x51, 15, 0x51}, {0x51, 11, 0x51}, {0x02, 11, 0x01}, {0x51, 10, 0x90}, {0x02, 1, 0x90}};
    for (const Row& row : rows) {
        SetUp();
        obxsimSetDeviceId(row.versionByte, row.dataLength);
        EXPECT_EQ(open_obx(), 1);
        EXPECT_EQ(GetIpmiVersion(), row.expected) << int(row.versionByte) << " " << row.dataLength;
    }
    // A count beyond the out-buffer, or request data beyond the in-buffer, never copies.
    SetUp();
    ASSERT_EQ(open_obx(), 1);
    obxsimInjectFault(ObxIoctlSendMessage, -1, -1, ObxSimOverlong);
    Bytes out(63, 0x11), big(52, 1);
    uint32_t n = 0;
    uint8_t cc = 0;
    const ObxpRequest probe = {0x02, 0x20, 0, 0x00, 0, big.data(), 1}, tooBig = {0x02, 0x20, 0, 0x00, 0, big.data(), 52};
    EXPECT_EQ(SendTimedObxpRequest(&probe, 3, out.data(), &n, &cc), ObxResultError);
    EXPECT_EQ(out, Bytes(63, 0x11));
    size_t seen = obxsimRequests().size();
    EXPECT_EQ(SendTimedObxpRequest(&tooBig, 3, out.data(), &n, &cc), ObxResultError);
    EXPECT_EQ(obxsimRequests().size(), seen);
}

TEST_F(Obx, MessageResponses)
{
    // The IPMB response to a Get Device ID request from 0x81 with sequence 2:
    // 0x81, net function 0x1C, checksum 0x63, 0x20, 0x08, command 0x01, the
    // reply 0x00 0x55 and the checksum of 0x20..0x55.
    const uint8_t message[7] = {0x20, 0x18, 0xC8, 0x81, 0x08, 0x01, 0x57}, reply[2] = {0x00, 0x55};
    const Bytes ipmb = {0x81, 0x1C, 0x63, 0x20, 0x08, 0x01, 0x00, 0x55, 0x82};
    using Send = int (*)(const uint8_t*, const uint8_t*, int32_t, int);
    using SendEx = int (*)(const uint8_t*, const uint8_t*, int32_t, int, uint8_t, uint8_t);
    struct Row {
        const char* version;
        Send send;
        SendEx sendEx;
        uint8_t command;
        Bytes prefix;
    } rows[] = {
        {"1.5", SendTimedEmpMessageResponse, nullptr, 0x34, {0x01}},
        {"1.5", SendTimedLanMessageResponse, nullptr, 0x34, {0x02}},
        {"1.5", nullptr, SendTimedLanMessageResponse_Ex, 0x34, {0x05, 0x33}},
        {"1.0", nullptr, SendTimedEmpMessageResponse_Ex, 0x34, {0x01, 0x33}},
        {"0.9", SendTimedEmpMessageResponse, nullptr, 0x7A, {}},
        {"0.9", nullptr, SendTimedLanMessageResponse_Ex, 0x7A, {0x33}},
    };
    for (const Row& row : rows) {
        SetUp();
        ASSERT_EQ(obxsimSetIpmiVersion(row.version), 0);
        EXPECT_EQ(row.send ? row.send(message, reply, 2, 3) : row.sendEx(message, reply, 2, 3, 0x33, 5), ObxResultOk);
        std::vector<ObxSimRequest> sent = requestsFor(0x06, row.command);
        ASSERT_EQ(sent.size(), 1u) << row.version << " " << int(row.prefix.size());
        Bytes expected = row.prefix;
        expected.insert(expected.end(), ipmb.begin(), ipmb.end());
        EXPECT_EQ(sent[0].data, expected) << row.version << " " << int(row.prefix.size());
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
    length = sizeof buffer;
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultNoMessage);

    // Physical memory: a file standing at 0xE0000; the mapping starts on the page.
    std::string contents(0x2000, '\0');
    for (size_t i = 0; i < contents.size(); ++i)
        contents[i] = static_cast<char>(i * 7 + i / 256);
    std::string path = "/tmp/moxobxmem" + std::to_string(getpid());
    std::ofstream(path, std::ios::binary) << contents;
    obxsimSetMemory(path.c_str(), 0xE0000);
    void* mapped = nullptr;
    ASSERT_EQ(MapPhysicalMemory(0xE0923, 16, &mapped), ObxResultOk);
    EXPECT_EQ(std::memcmp(mapped, contents.data() + 0x923, 16), 0);
    EXPECT_TRUE(logged("mmap physical 0xe0000 length 2355")) << actions();
    EXPECT_EQ(UnmapPhysicalMemory(mapped, 16), ObxResultOk);
    EXPECT_TRUE(logged("munmap length 2355"));
    EXPECT_EQ(UnmapPhysicalMemory(mapped, -1), ObxResultError);
    unlink(path.c_str());
}

} // namespace
