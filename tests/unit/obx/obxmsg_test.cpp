#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <unistd.h>

#include "obx/obxapi.h"
#include "simdriver.h"

namespace {

using ObxMessages = SimDriverTest;

// A Get Device ID request (net function 0x06) from requester 0x81, sequence 2.
const uint8_t answered[7] = {0x20, 0x18, 0xC8, 0x81, 0x08, 0x01, 0x57};
const uint8_t reply[2] = {0x00, 0x55};

enum class Responder { Emp, EmpEx, Lan, LanEx };

int respondWith(Responder responder, const uint8_t* message, const uint8_t* bytes, int32_t count)
{
    switch (responder) {
    case Responder::Emp:
        return SendTimedEmpMessageResponse(message, bytes, count, 300);
    case Responder::EmpEx:
        return SendTimedEmpMessageResponse_Ex(message, bytes, count, 300, 0x33, 5);
    case Responder::Lan:
        return SendTimedLanMessageResponse(message, bytes, count, 300);
    default:
        return SendTimedLanMessageResponse_Ex(message, bytes, count, 300, 0x33, 5);
    }
}

TEST_F(ObxMessages, ResponsesCarryChannelSessionAndBothChecksums)
{
    // The IPMB response to `answered`: requester 0x81, net function 0x07 with
    // LUN 0 (0x1C), checksum 0x63; then 0x20, sequence 0x08, command 0x01, the
    // reply 0x00 0x55 and the checksum of 0x20..0x55, 0x82.
    const std::vector<uint8_t> ipmb = {0x81, 0x1C, 0x63, 0x20, 0x08, 0x01, 0x00, 0x55, 0x82};
    struct Case {
        const char* version;
        Responder responder;
        uint8_t command;
        std::vector<uint8_t> prefix;
    } cases[] = {
        {"1.5", Responder::Emp, 0x34, {0x01}},         {"1.5", Responder::Lan, 0x34, {0x02}},
        {"1.5", Responder::EmpEx, 0x34, {0x05, 0x33}}, {"1.5", Responder::LanEx, 0x34, {0x05, 0x33}},
        {"1.0", Responder::EmpEx, 0x34, {0x01, 0x33}}, {"1.0", Responder::LanEx, 0x34, {0x02, 0x33}},
        {"1.0", Responder::Lan, 0x34, {0x02}},         {"0.9", Responder::Emp, 0x7A, {}},
        {"0.9", Responder::LanEx, 0x7A, {0x33}},
    };
    for (const Case& c : cases) {
        // Every case is the process's first use: the class must be known
        // before the record is built.
        SetUp();
        ASSERT_EQ(obxsimSetIpmiVersion(c.version), 0);
        EXPECT_EQ(respondWith(c.responder, answered, reply, 2), ObxResultOk);
        std::vector<ObxSimRequest> sent = requestsFor(0x06, c.command);
        ASSERT_EQ(sent.size(), 1u) << c.version << " " << int(c.responder);
        std::vector<uint8_t> expected = c.prefix;
        expected.insert(expected.end(), ipmb.begin(), ipmb.end());
        EXPECT_EQ(sent[0].data, expected) << c.version << " " << int(c.responder);
        EXPECT_EQ(sent[0].rsSlaveAddress, 0x20);
        EXPECT_EQ(sent[0].timeout, 300000u);
        TearDown();
    }
}

TEST_F(ObxMessages, ResponseKeepsTheLunsOfTheMessage)
{
    // Requester LUN 1 and responder LUN 2: response net function 0x1D, sequence 0x0A.
    const uint8_t message[6] = {0x20, 0x1A, 0xC6, 0x81, 0x09, 0x01};
    EXPECT_EQ(SendTimedEmpMessageResponse(message, reply, 1, 300), ObxResultOk);
    std::vector<ObxSimRequest> sent = requestsFor(0x06, 0x34);
    ASSERT_EQ(sent.size(), 1u);
    const std::vector<uint8_t> expected = {0x01, 0x81, 0x1D, 0x62, 0x20, 0x0A, 0x01, 0x00, 0xD5};
    EXPECT_EQ(sent[0].data, expected);
}

TEST_F(ObxMessages, ResponseResultAndLimits)
{
    ASSERT_EQ(open_obx(), 1);
    std::vector<uint8_t> bytes(16, 0x00);
    // 21 data bytes at most: 14 reply bytes without prefix, 13 with a channel, 12 with a session too.
    struct Case {
        const char* version;
        Responder responder;
        int32_t fits;
    } cases[] = {
        {"0.9", Responder::Emp, 14}, {"1.5", Responder::Emp, 13}, {"1.5", Responder::LanEx, 12},
        {"0.9", Responder::EmpEx, 13},
    };
    for (const Case& c : cases) {
        SetUp();
        ASSERT_EQ(obxsimSetIpmiVersion(c.version), 0);
        ASSERT_EQ(open_obx(), 1);
        EXPECT_EQ(respondWith(c.responder, answered, bytes.data(), c.fits + 1), ObxResultError);
        EXPECT_EQ(respondWith(c.responder, answered, bytes.data(), -1), ObxResultError);
        EXPECT_EQ(obxsimRequests().size(), 1u); // only the identity query
        EXPECT_EQ(respondWith(c.responder, answered, bytes.data(), c.fits), ObxResultOk);
        TearDown();
    }
    SetUp();
    // A refusal, a non-zero completion code or an answer of other than one byte fails.
    ObxSimFault faults[] = {ObxSimFail, ObxSimEmpty, ObxSimOverlong};
    for (ObxSimFault fault : faults) {
        obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x34, fault, 0, 1);
        EXPECT_EQ(SendTimedEmpMessageResponse(answered, reply, 2, 300), ObxResultError) << fault;
    }
    obxsimInjectFault(ObxIoctlSendMessage, 0x06, 0x34, ObxSimCompletionCode, 0xC3, 1);
    EXPECT_EQ(SendTimedEmpMessageResponse(answered, reply, 2, 300), ObxResultError);
    EXPECT_EQ(SendTimedEmpMessageResponse(answered, reply, 2, 300), ObxResultOk);
    EXPECT_EQ(SendTimedEmpMessageResponse(nullptr, reply, 2, 300), ObxResultError);
}

TEST_F(ObxMessages, RegistrationAndAvailability)
{
    uint32_t handle = 0;
    EXPECT_EQ(RegisterForObxAsyncMessageNotification(nullptr), ObxResultError);
    ASSERT_EQ(RegisterForObxAsyncMessageNotification(&handle), ObxResultOk);
    EXPECT_NE(handle, 0u);
    EXPECT_EQ(AsyncEventHandle, handle);
    uint32_t again = 0;
    EXPECT_EQ(RegisterForObxAsyncMessageNotification(&again), ObxResultError);
    EXPECT_EQ(countLog("async registered"), 1u); // the second was not asked of the driver

    EXPECT_EQ(IsAsyncMessageAvailable(handle + 1), ObxResultError);
    EXPECT_EQ(IsAsyncMessageAvailable(handle), ObxResultError); // nothing waiting
    obxsimQueueMessage(1, 4, -1, {0x20, 0x18, 0xC8, 0x81, 0x04, 0x01, 0x7A});
    EXPECT_EQ(IsAsyncMessageAvailable(handle), ObxResultOk);
    EXPECT_EQ(StartAsyncMesgPoll(), ObxResultOk);
    EXPECT_EQ(countLog("async poll started"), 1u);

    EXPECT_EQ(UnRegisterForObxAsyncMessageNotification(handle + 1), ObxResultError);
    EXPECT_EQ(UnRegisterForObxAsyncMessageNotification(handle), ObxResultOk);
    EXPECT_EQ(AsyncEventHandle, 0u);
    EXPECT_EQ(IsAsyncMessageAvailable(handle), ObxResultError);
    // Unregistered, the process may register again.
    EXPECT_EQ(RegisterForObxAsyncMessageNotification(&handle), ObxResultOk);

    // A refused registration leaves none behind.
    SetUp();
    obxsimInjectFault(ObxIoctlRegisterAsync, -1, -1, ObxSimFail, 0, 1);
    EXPECT_EQ(RegisterForObxAsyncMessageNotification(&handle), ObxResultError);
    EXPECT_EQ(AsyncEventHandle, 0u);
    EXPECT_EQ(RegisterForObxAsyncMessageNotification(&handle), ObxResultOk);
}

const std::vector<uint8_t> body1 = {0x20, 0x18, 0xC8, 0x81, 0x04, 0x01, 0x7A};
const std::vector<uint8_t> body2 = {0x20, 0x18, 0xC8, 0x83, 0x08, 0x02, 0x71, 0x09};
const std::vector<uint8_t> body3 = {0x20, 0x18, 0xC8, 0x85, 0x0C, 0x03};

// The messages carry privilege 4 in bits 7-4 of their first byte; the channel
// is bits 3-0, so they are still delivered to the call without a session.
TEST_F(ObxMessages, FetchPassesOverOtherChannels)
{
    obxsimQueueMessage(2, 4, -1, body1);
    obxsimQueueMessage(3, 4, -1, body2);
    obxsimQueueMessage(1, 4, -1, body3);
    uint8_t buffer[64];
    uint32_t length = sizeof buffer;
    uint32_t sequence = 0;
    ASSERT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultOk);
    EXPECT_EQ(std::vector<uint8_t>(buffer, buffer + length), body3);
    EXPECT_EQ(sequence, 3u);
    length = sizeof buffer;
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultNoMessage);
    EXPECT_EQ(NTstatus[0], ObxStatusNoMessage);

    // A channel that has no message passes over all of them.
    sequence = 0;
    length = sizeof buffer;
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 7), ObxResultNoMessage);
    EXPECT_EQ(sequence, 3u);
    // Any other refusal is an error.
    sequence = 0;
    obxsimInjectFault(ObxIoctlGetAsyncMessage, -1, -1, ObxSimFail, 0, 1);
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 2), ObxResultError);
    EXPECT_EQ(GetAsyncObxpMessage(buffer, nullptr, 1, &sequence, 2), ObxResultError);
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, nullptr, 2), ObxResultError);
}

TEST_F(ObxMessages, FetchWithSessionAndPrivilege)
{
    obxsimQueueMessage(2, 3, 0x41, body1);
    obxsimQueueMessage(6, 4, 0x42, body2);
    uint8_t buffer[64];
    uint32_t length = sizeof buffer;
    uint32_t sequence = 0;
    uint8_t session = 0, privilege = 0;
    ASSERT_EQ(GetAsyncObxpMessage_Ex(buffer, &length, 1, &sequence, 6, &session, &privilege), ObxResultOk);
    EXPECT_EQ(std::vector<uint8_t>(buffer, buffer + length), body2);
    EXPECT_EQ(session, 0x42);
    EXPECT_EQ(privilege, 4);
    EXPECT_EQ(sequence, 2u);
    // The privilege of a message passed over is stored as well.
    sequence = 0;
    length = sizeof buffer;
    EXPECT_EQ(GetAsyncObxpMessage_Ex(buffer, &length, 1, &sequence, 9, &session, &privilege), ObxResultNoMessage);
    EXPECT_EQ(privilege, 4);
    EXPECT_EQ(GetAsyncObxpMessage_Ex(buffer, &length, 1, &sequence, 9, nullptr, &privilege), ObxResultError);
}

TEST_F(ObxMessages, FetchOnAnIpmi09ControllerMatchesTheLun)
{
    ASSERT_EQ(obxsimSetIpmiVersion("0.9"), 0);
    std::vector<uint8_t> lun0 = body1, lun2 = body2;
    lun0[1] = 0x18; // channel 1
    lun2[1] = 0x1A; // channel 0
    obxsimQueueMessage(1, 0, -1, lun0);
    obxsimQueueMessage(0, 0, -1, lun2);
    struct Case {
        uint32_t channel;
        int result;
        std::vector<uint8_t> message;
        uint32_t sequence;
    } cases[] = {{0, ObxResultOk, lun2, 2}, {1, ObxResultOk, lun0, 1}, {2, ObxResultNoMessage, {}, 2}};
    for (const Case& c : cases) {
        uint8_t buffer[64];
        uint32_t length = sizeof buffer;
        uint32_t sequence = 0;
        EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, c.channel), c.result) << c.channel;
        EXPECT_EQ(sequence, c.sequence) << c.channel;
        if (c.result == ObxResultOk) {
            EXPECT_EQ(std::vector<uint8_t>(buffer, buffer + length), c.message);
        }
    }
}

TEST_F(ObxMessages, MessageLongerThanTheBufferStaysForTheNextCall)
{
    obxsimQueueMessage(1, 4, -1, body2); // 8 bytes + the channel byte
    uint8_t buffer[64];
    uint32_t length = 8; // less than the 9 bytes fetched
    uint32_t sequence = 0;
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultError);
    EXPECT_EQ(sequence, 0u);
    length = 9;
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultOk);
    EXPECT_EQ(length, 8u);
    EXPECT_EQ(sequence, 1u);
}

TEST_F(ObxMessages, MessageShorterThanItsPrefixIsAnError)
{
    struct Case {
        const char* version;
        int session;
        std::vector<uint8_t> bytes;
        bool withSession;
        int result;
    } cases[] = {
        {"0.9", -1, {}, false, ObxResultError},     // no LUN byte to read
        {"0.9", -1, {0x20}, false, ObxResultError}, // the LUN is in byte 1
        {"1.5", -1, {}, true, ObxResultError},      // channel byte but no session byte
        {"1.5", -1, {}, false, ObxResultOk},        // channel byte alone: an empty message
    };
    for (const Case& c : cases) {
        SetUp();
        ASSERT_EQ(obxsimSetIpmiVersion(c.version), 0);
        obxsimQueueMessage(1, 0, c.session, c.bytes);
        uint8_t buffer[40];
        std::memset(buffer, 0xEE, sizeof buffer);
        uint32_t length = sizeof buffer;
        uint32_t sequence = 0;
        uint8_t session = 0, privilege = 0;
        int result = c.withSession ? GetAsyncObxpMessage_Ex(buffer, &length, 1, &sequence, 1, &session, &privilege)
                                   : GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1);
        EXPECT_EQ(result, c.result) << c.version << " " << c.bytes.size();
        if (result == ObxResultOk) {
            EXPECT_EQ(length, 0u);
        }
        EXPECT_EQ(buffer[0], 0xEE);
        TearDown();
    }
}

// A driver that keeps handing back the same message for another channel.
int stuckIoctl(int, unsigned long request, void* argument)
{
    ObxIoctlRecord record;
    std::memcpy(&record, argument, sizeof record);
    auto* out = static_cast<uint8_t*>(record.outBuffer);
    if (request == ObxIoctlSendMessage) {
        std::memset(out, 0, record.outSize);
        out[5] = 0x51;
        *record.bytesReturned = 16;
        return 0;
    }
    const uint32_t sequence = 5;
    std::memcpy(out, &sequence, 4);
    out[4] = 0x02; // channel 2
    std::memset(out + 5, 0x20, 6);
    *record.bytesReturned = 11;
    return 0;
}

int stuckOpen(const char*, int)
{
    return 43;
}

TEST_F(ObxMessages, DriverRepeatingAMessageEndsTheFetch)
{
    const ObxOs stuck = {stuckOpen, stuckIoctl, simMmap, obxsimMunmap, obxsimClose};
    obxSetOs(&stuck);
    uint8_t buffer[64];
    uint32_t length = sizeof buffer;
    uint32_t sequence = 0;
    EXPECT_EQ(GetAsyncObxpMessage(buffer, &length, 1, &sequence, 1), ObxResultError);
    EXPECT_EQ(sequence, 5u);
    hDevice1 = 0;
}

class ObxMemory : public SimDriverTest {
protected:
    void SetUp() override
    {
        SimDriverTest::SetUp();
        char pattern[] = "/tmp/obxmemXXXXXX";
        int fd = mkstemp(pattern);
        ASSERT_GE(fd, 0);
        path = pattern;
        std::vector<uint8_t> bytes(8192);
        for (size_t i = 0; i < bytes.size(); ++i)
            bytes[i] = static_cast<uint8_t>(i * 7 + (i >> 8));
        ASSERT_EQ(write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
        close(fd);
        contents = bytes;
    }
    void TearDown() override
    {
        unlink(path.c_str());
        SimDriverTest::TearDown();
    }
    std::string path;
    std::vector<uint8_t> contents;
};

TEST_F(ObxMemory, MapsAnAddressInsideAPage)
{
    struct Case {
        uint64_t base;
        uint32_t address;
        const char* mapLine;
    } cases[] = {
        {0x000E0000, 0x000E1010, "mmap physical 0xe1000 length 32"},
        {0xFED00000, 0xFED01010, "mmap physical 0xfed01000 length 32"}, // above 2 GiB
    };
    for (const Case& c : cases) {
        obxsimReset();
        forgetDevice();
        obxsimSetMemory(path.c_str(), c.base);
        void* mapped = nullptr;
        ASSERT_EQ(MapPhysicalMemory(c.address, 16, &mapped), ObxResultOk);
        EXPECT_EQ(reinterpret_cast<uintptr_t>(mapped) & 0xFFF, 0x10u);
        EXPECT_EQ(std::memcmp(mapped, contents.data() + 0x1010, 16), 0);
        EXPECT_EQ(countLog("open /dev/obx read-only"), 1u);
        EXPECT_EQ(countLog(c.mapLine), 1u);
        EXPECT_EQ(countLog("close /dev/obx"), 1u); // its own descriptor, closed at once
        EXPECT_EQ(hDevice1, 0);
        EXPECT_EQ(UnmapPhysicalMemory(mapped, 16), ObxResultOk);
        EXPECT_EQ(countLog("munmap length 32"), 1u);
    }
}

TEST_F(ObxMemory, RefusesAndReportsFailures)
{
    void* mapped = nullptr;
    EXPECT_EQ(MapPhysicalMemory(0, 16, &mapped), ObxResultError);
    EXPECT_EQ(MapPhysicalMemory(0xE0000, 0, &mapped), ObxResultError);
    EXPECT_EQ(MapPhysicalMemory(0xE0000, -4, &mapped), ObxResultError);
    EXPECT_EQ(obxsimOpenCount(), 0);

    // No memory behind the address: the mapping fails and the descriptor is closed.
    testing::internal::CaptureStderr();
    EXPECT_EQ(MapPhysicalMemory(0xE0000, 16, &mapped), ObxResultError);
    std::string text = testing::internal::GetCapturedStderr();
    EXPECT_EQ(text.rfind("obxapi MapPhysicalMemory: mmap failed\n: ", 0), 0u) << text;
    EXPECT_EQ(countLog("close /dev/obx"), 1u);

    obxsimSetDeviceMissing(true);
    testing::internal::CaptureStderr();
    EXPECT_EQ(MapPhysicalMemory(0xE0000, 16, &mapped), ObxResultError);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "obxapi MapPhysicalMemory: open(/dev/obx) failed\n: No such file or directory\n");

    // A negative length would unmap whatever follows the mapping.
    EXPECT_EQ(UnmapPhysicalMemory(reinterpret_cast<void*>(0x1000), -1), ObxResultError);
    // Unmapping pages that hold nothing succeeds, so use a range that ends
    // beyond the 32-bit address space, which munmap refuses.
    testing::internal::CaptureStderr();
    EXPECT_EQ(UnmapPhysicalMemory(reinterpret_cast<void*>(0xFFFFF010u), 0x100), ObxResultError);
    std::string unmapText = testing::internal::GetCapturedStderr();
    EXPECT_EQ(unmapText.rfind("obxapi UnmapPhysicalMemory: munmap failed\n: ", 0), 0u) << unmapText;
}

} // namespace
