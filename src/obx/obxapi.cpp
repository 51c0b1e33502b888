#include "obx/obxapi.h"

#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <pthread.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <unistd.h>

#include "base/bytes.h"

int hDevice1 = 0;
uint32_t IpmiVersion = 0;
uint32_t NTstatus[2] = {0, 0};
uint32_t AsyncEventHandle = 0;
const char* const obxDevicePath = "/dev/obx";

namespace {

const char* const devicePath = obxDevicePath;

int libcOpen(const char* path, int flags)
{
    // The mode is passed although no flag needs it: with fortified calls an
    // open whose flags are not constant otherwise goes to the C library's
    // checking entry instead of open itself, past an interposed driver.
    return ::open(path, flags, 0);
}

int libcIoctl(int fd, unsigned long request, void* argument)
{
    return ::ioctl(fd, request, argument);
}

const ObxOs libcOs = {libcOpen, libcIoctl, ::mmap, ::munmap, ::close};
const ObxOs* os = &libcOs;

// Guards the opening of the device: hDevice1 and IpmiVersion are written only
// under it, so two threads making their first request at the same time cannot
// both open and identify the device.
pthread_mutex_t openMutex = PTHREAD_MUTEX_INITIALIZER;

// The largest payloads the driver buffers hold.
constexpr int32_t timedDataMax = obxTimedBufferSize - obxRequestHeaderSize; // 51
constexpr int32_t shortDataMax = obxShortBufferSize - obxRequestHeaderSize; // 21
constexpr int32_t i2cPrefix = 3; // bus type, slave address, read count
constexpr int32_t i2cWriteMax = shortDataMax - i2cPrefix; // 18

// One ioctl on a known descriptor; 1 when it returned 0.
int ioctlOn(int fd, uint32_t code, const void* inBuffer, uint32_t inSize, void* outBuffer, uint32_t outSize,
            uint32_t* bytesReturned)
{
    ObxIoctlRecord record{};
    record.status = NTstatus;
    record.inBuffer = inBuffer;
    record.inSize = inSize;
    record.outBuffer = outBuffer;
    record.outSize = outSize;
    record.bytesReturned = bytesReturned;
    record.overlapped = nullptr;
    return os->ioctl(fd, code, &record) == 0 ? 1 : 0;
}

// Sends through DeviceIoControl, or over `fd` when it is not -1 (the identity
// query made while the device is being opened).
int transfer(int fd, uint32_t code, const void* inBuffer, uint32_t inSize, void* outBuffer, uint32_t outSize,
             uint32_t* bytesReturned)
{
    if (fd != -1)
        return ioctlOn(fd, code, inBuffer, inSize, outBuffer, outSize, bytesReturned);
    return DeviceIoControl(0, code, inBuffer, inSize, outBuffer, outSize, bytesReturned, nullptr);
}

// Request data that the buffer cannot hold is refused before the driver sees it.
bool dataFits(const uint8_t* data, int32_t length, int32_t maximum)
{
    return length >= 0 && length <= maximum && (length == 0 || data != nullptr);
}

void fillRequest(ObxDriverRequest& in, const ObxpRequest& request, uint32_t flags, uint32_t timeout)
{
    in.flags = flags;
    in.timeout = timeout;
    in.rsSlaveAddress = request.rsSlaveAddress;
    in.command = request.command;
    in.netFunction = request.netFunction;
    in.rsLun = request.rsLun;
    in.dataLength = static_cast<uint8_t>(request.dataLength);
    if (request.dataLength > 0)
        std::memcpy(in.data, request.data, static_cast<size_t>(request.dataLength));
}

int sendTimed(int fd, const ObxpRequest* request, int timeout, uint8_t* response, uint32_t* responseLength,
              uint8_t* completionCode)
{
    if (request == nullptr || !dataFits(request->data, request->dataLength, timedDataMax))
        return ObxResultError;
    ObxDriverRequest in{};
    fillRequest(in, *request, 0, static_cast<uint32_t>(timeout) * 1000u);
    ObxDriverResponse out{};
    uint32_t returned = obxTimedBufferSize;
    if (!transfer(fd, ObxIoctlSendMessage, &in, obxTimedBufferSize, &out, obxTimedBufferSize, &returned))
        return ObxResultError;
    // A count beyond the out-buffer cannot be trusted; copying it would run
    // past the caller's buffer.
    if (returned == 0 || returned > obxTimedBufferSize)
        return ObxResultError;
    if (completionCode != nullptr)
        *completionCode = out.completionCode;
    if (responseLength != nullptr)
        *responseLength = 0;
    if (returned >= 2 && response != nullptr) {
        std::memcpy(response, out.data, returned - 1);
        if (responseLength != nullptr)
            *responseLength = returned - 1;
    }
    return ObxResultOk;
}

// Opens and identifies the device; called with openMutex held.
int openLocked(void)
{
    if (hDevice1 != 0)
        return 1;
    int fd = os->open(devicePath, O_RDWR);
    if (fd < 0) {
        hDevice1 = 0;
        char text[128];
        snprintf(text, sizeof text, "%s %s: open(%s) failed\n", "obxapi", "open_obx", devicePath);
        perror(text);
        return 0;
    }
    // Get Device ID. The answer may carry up to 63 data bytes.
    const ObxpRequest getDeviceId = {0x01, 0x20, 0, 0x06, 0, nullptr, 0};
    uint8_t data[obxTimedBufferSize] = {};
    uint32_t length = 0;
    uint8_t completionCode = 0;
    int result = sendTimed(fd, &getDeviceId, 400, data, &length, &completionCode);
    if (result != ObxResultOk || completionCode != 0) {
        printf("%s: SendTimedObxpRequest error. Ret = %d CC = 0x%X\n", "open_obx", result, completionCode);
        fflush(stdout);
        os->close(fd);
        hDevice1 = 0;
        return 0;
    }
    // An answer of 10 data bytes or fewer comes from an IPMI 0.9 controller;
    // otherwise data byte 4 is the IPMI Version field.
    if (length <= 10)
        IpmiVersion = ObxIpmi09;
    else
        IpmiVersion = data[4] == 0x51 ? ObxIpmi15 : ObxIpmi10;
    // Published only once the controller is classed, so no other thread sends
    // over a descriptor that may yet be closed.
    hDevice1 = fd;
    return 1;
}

// The open descriptor, opening it on first use; -1 when that failed.
int deviceDescriptor(void)
{
    pthread_mutex_lock(&openMutex);
    int fd = openLocked() ? hDevice1 : -1;
    pthread_mutex_unlock(&openMutex);
    return fd;
}

uint32_t controllerClass(void)
{
    pthread_mutex_lock(&openMutex);
    uint32_t version = IpmiVersion;
    pthread_mutex_unlock(&openMutex);
    return version;
}

// The data of an IPMI Send Message request that carries an IPMB response to
// `message` (the ObxMessage answered); `channel` -1 sends no channel byte.
int sendMessageResponse(const uint8_t* message, const uint8_t* response, int32_t responseLength, int timeout,
                        int channel, bool withSession, uint8_t sessionHandle)
{
    if (message == nullptr || responseLength < 0 || (responseLength > 0 && response == nullptr))
        return ObxResultError;
    uint8_t data[obxTimedBufferSize];
    int32_t used = 0;
    if (channel >= 0)
        data[used++] = static_cast<uint8_t>(channel);
    if (withSession)
        data[used++] = sessionHandle;
    // Header bytes, the two checksums and the response must fit in 21 bytes.
    if (used + 7 + responseLength > shortDataMax)
        return ObxResultError;
    uint8_t netFunction = static_cast<uint8_t>((message[1] & 0xFC) | 0x04 | (message[4] & 0x03));
    data[used++] = message[3];
    data[used++] = netFunction;
    data[used++] = static_cast<uint8_t>(-(message[3] + netFunction));
    int32_t summed = used;
    data[used++] = 0x20;
    data[used++] = static_cast<uint8_t>((message[4] & 0xFC) | (message[1] & 0x03));
    data[used++] = message[5];
    if (responseLength > 0)
        std::memcpy(data + used, response, static_cast<size_t>(responseLength));
    used += responseLength;
    unsigned sum = 0;
    for (int32_t i = summed; i < used; ++i)
        sum += data[i];
    data[used++] = static_cast<uint8_t>(-sum);

    ObxDriverRequest in{};
    in.flags = 0;
    in.timeout = static_cast<uint32_t>(timeout) * 1000u;
    in.rsSlaveAddress = 0x20;
    in.command = controllerClass() == ObxIpmi09 ? 0x7A : 0x34;
    in.netFunction = 0x06;
    in.rsLun = 0;
    in.dataLength = static_cast<uint8_t>(used);
    std::memcpy(in.data, data, static_cast<size_t>(used));
    ObxDriverResponse out{};
    uint32_t returned = obxShortBufferSize;
    if (!DeviceIoControl(0, ObxIoctlSendMessage, &in, obxShortBufferSize, &out, obxShortBufferSize, &returned,
                         nullptr))
        return ObxResultError;
    return returned == 1 && out.completionCode == 0 ? ObxResultOk : ObxResultError;
}

// The channel byte of a response: none on a 0.9 controller, the caller's on a
// 1.5 controller when it names one, else the fixed EMP (1) or LAN (2) channel.
int responseChannel(uint32_t version, uint8_t fixed, int callerChannel)
{
    if (version == ObxIpmi09)
        return -1;
    if (version == ObxIpmi15 && callerChannel >= 0)
        return callerChannel;
    return fixed;
}

int respond(const uint8_t* message, const uint8_t* response, int32_t responseLength, int timeout, uint8_t fixed,
            int callerChannel, bool withSession, uint8_t sessionHandle)
{
    // The class decides the record's shape, so the device is opened and the
    // controller classed before the record is built.
    if (!open_obx())
        return ObxResultError;
    int channel = responseChannel(controllerClass(), fixed, callerChannel);
    return sendMessageResponse(message, response, responseLength, timeout, channel, withSession, sessionHandle);
}

int fetchMessage(uint8_t* message, uint32_t* length, int timeout, uint32_t* sequence, uint32_t channel,
                 uint8_t* sessionHandle, uint8_t* privilege, bool withSession)
{
    if (message == nullptr || length == nullptr || sequence == nullptr)
        return ObxResultError;
    if (withSession && (sessionHandle == nullptr || privilege == nullptr))
        return ObxResultError;
    if (!open_obx())
        return ObxResultError;
    const uint32_t version = controllerClass();
    bool passedOver = false;
    for (;;) {
        uint32_t in[2] = {static_cast<uint32_t>(timeout) * 1000u, *sequence};
        uint8_t out[obxAsyncMessageBufferSize] = {};
        uint32_t returned = obxAsyncMessageBufferSize;
        if (!DeviceIoControl(0, ObxIoctlGetAsyncMessage, in, sizeof in, out, sizeof out, &returned, nullptr))
            return NTstatus[0] == ObxStatusNoMessage ? ObxResultNoMessage : ObxResultError;
        if (returned < 4 || returned > obxAsyncMessageBufferSize)
            return ObxResultError;
        const uint32_t delivered = loadWord(out);
        const uint8_t* bytes = out + 4;
        const uint32_t count = returned - 4;
        if (*length < count)
            return ObxResultError; // left for the next call: the sequence stays
        if (version == ObxIpmi09) {
            // No prefix: the responder LUN of the message names the channel.
            if (count < 2)
                return ObxResultError;
            int lun = channel == 0 ? 2 : channel == 1 ? 0 : -1;
            if (lun == (bytes[1] & 0x03)) {
                std::memcpy(message, bytes, count);
                *length = count;
                *sequence = delivered;
                return ObxResultOk;
            }
        } else if (!withSession) {
            if (count < 1)
                return ObxResultError;
            // Bits 7-4 carry the sender's privilege: comparing the whole byte
            // would pass over, and so lose, every message sent with one.
            if ((bytes[0] & 0x0Fu) == channel) {
                std::memcpy(message, bytes + 1, count - 1);
                *length = count - 1;
                *sequence = delivered;
                return ObxResultOk;
            }
        } else {
            if (count < 2)
                return ObxResultError;
            *privilege = static_cast<uint8_t>(bytes[0] >> 4);
            if ((bytes[0] & 0x0Fu) == channel) {
                *sessionHandle = bytes[1];
                std::memcpy(message, bytes + 2, count - 2);
                *length = count - 2;
                *sequence = delivered;
                return ObxResultOk;
            }
        }
        // A driver that hands back the message it was told we have seen would
        // keep this loop going for ever.
        if (passedOver && delivered == *sequence)
            return ObxResultError;
        *sequence = delivered; // pass over a message for another channel
        passedOver = true;
    }
}

} // namespace

void obxSetOs(const ObxOs* table)
{
    os = table != nullptr ? table : &libcOs;
}

int open_obx(void)
{
    return deviceDescriptor() != -1 ? 1 : 0;
}

int DeviceIoControl(int /*handle*/, uint32_t code, const void* inBuffer, uint32_t inSize, void* outBuffer,
                    uint32_t outSize, uint32_t* bytesReturned, void* /*overlapped*/)
{
    int fd = deviceDescriptor();
    if (fd == -1)
        return 0;
    return ioctlOn(fd, code, inBuffer, inSize, outBuffer, outSize, bytesReturned);
}

int SendTimedObxpRequest(const ObxpRequest* request, int timeout, uint8_t* response, uint32_t* responseLength,
                         uint8_t* completionCode)
{
    return sendTimed(-1, request, timeout, response, responseLength, completionCode);
}

int SendTimedI2cRequest(const I2cRequest* request, int timeout, uint8_t* response, uint32_t* responseLength,
                        uint8_t* completionCode)
{
    if (request == nullptr || !dataFits(request->writeData, request->writeCount, i2cWriteMax))
        return ObxResultError;
    // Master Write-Read: bus, slave address, read count, then the bytes to write.
    ObxDriverRequest in{};
    in.flags = 0;
    in.timeout = static_cast<uint32_t>(timeout) * 1000u;
    in.rsSlaveAddress = 0x20;
    in.command = 0x52;
    in.netFunction = 0x06;
    in.rsLun = 0;
    in.dataLength = static_cast<uint8_t>(request->writeCount + i2cPrefix);
    in.data[0] = request->busType;
    in.data[1] = request->slaveAddress;
    in.data[2] = request->readCount;
    if (request->writeCount > 0)
        std::memcpy(in.data + i2cPrefix, request->writeData, static_cast<size_t>(request->writeCount));
    ObxDriverResponse out{};
    uint32_t returned = obxShortBufferSize;
    if (!DeviceIoControl(0, ObxIoctlSendMessage, &in, obxShortBufferSize, &out, obxShortBufferSize, &returned,
                         nullptr))
        return ObxResultError;
    if (returned == 0 || returned > obxShortBufferSize)
        return ObxResultError;
    if (completionCode != nullptr)
        *completionCode = out.completionCode;
    if (responseLength != nullptr)
        *responseLength = returned - 1;
    if (returned > 1 && response != nullptr)
        std::memcpy(response, out.data, returned - 1);
    return ObxResultOk;
}

int SendAsyncObxpRequest(const ObxpRequest* request, uint8_t* sequenceNumber)
{
    if (request == nullptr || sequenceNumber == nullptr ||
        !dataFits(request->data, request->dataLength, shortDataMax))
        return ObxResultError;
    ObxDriverRequest in{};
    fillRequest(in, *request, 1, 0);
    ObxDriverResponse out{};
    uint32_t returned = obxShortBufferSize;
    if (!DeviceIoControl(0, ObxIoctlSendMessage, &in, obxShortBufferSize, &out, obxShortBufferSize, &returned,
                         nullptr))
        return ObxResultError;
    if (returned != 2)
        return ObxResultError;
    *sequenceNumber = out.data[0];
    return ObxResultOk;
}

int SetShutDownCode(uint32_t delay, uint32_t code)
{
    ObxShutdownCodeRecord record = {code, delay};
    uint32_t returned = 0;
    if (!DeviceIoControl(0, ObxIoctlSetShutdownCode, &record, sizeof record, nullptr, 0, &returned, nullptr))
        return ObxResultError;
    return ObxResultOk;
}

uint8_t GetIpmiVersion(void)
{
    return static_cast<uint8_t>(controllerClass() & 0xFF);
}

int SendTimedEmpMessageResponse(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                int timeout)
{
    return respond(message, response, responseLength, timeout, 1, -1, false, 0);
}

int SendTimedEmpMessageResponse_Ex(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                   int timeout, uint8_t sessionHandle, uint8_t channel)
{
    return respond(message, response, responseLength, timeout, 1, channel, true, sessionHandle);
}

int SendTimedLanMessageResponse(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                int timeout)
{
    return respond(message, response, responseLength, timeout, 2, -1, false, 0);
}

int SendTimedLanMessageResponse_Ex(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                   int timeout, uint8_t sessionHandle, uint8_t channel)
{
    return respond(message, response, responseLength, timeout, 2, channel, true, sessionHandle);
}

int StartAsyncMesgPoll(void)
{
    uint32_t returned = 0;
    return DeviceIoControl(0, ObxIoctlStartAsyncPoll, nullptr, 0, nullptr, 0, &returned, nullptr) ? ObxResultOk
                                                                                                  : ObxResultError;
}

int RegisterForObxAsyncMessageNotification(uint32_t* handle)
{
    if (handle == nullptr || AsyncEventHandle != 0)
        return ObxResultError;
    // The handle is kept only when the driver gave one; a refused call leaves
    // no half-written registration behind.
    uint32_t in = 0;
    uint32_t out = 0;
    uint32_t returned = 0;
    if (!DeviceIoControl(0, ObxIoctlRegisterAsync, &in, sizeof in, &out, sizeof out, &returned, nullptr) ||
        returned != sizeof out)
        return ObxResultError;
    AsyncEventHandle = out;
    *handle = AsyncEventHandle;
    return ObxResultOk;
}

int UnRegisterForObxAsyncMessageNotification(uint32_t handle)
{
    if (AsyncEventHandle == 0 || handle != AsyncEventHandle)
        return ObxResultError;
    uint32_t in = AsyncEventHandle;
    uint32_t out = 0;
    uint32_t returned = 0;
    if (!DeviceIoControl(0, ObxIoctlUnregisterAsync, &in, sizeof in, &out, sizeof out, &returned, nullptr))
        return ObxResultError;
    // Cleared so that the process can register again.
    AsyncEventHandle = 0;
    return ObxResultOk;
}

int IsAsyncMessageAvailable(uint32_t handle)
{
    if (AsyncEventHandle == 0 || handle != AsyncEventHandle)
        return ObxResultError;
    uint32_t in = AsyncEventHandle;
    uint32_t out = 0;
    uint32_t returned = 0;
    return DeviceIoControl(0, ObxIoctlCheckAsync, &in, sizeof in, &out, sizeof out, &returned, nullptr)
               ? ObxResultOk
               : ObxResultError;
}

int GetAsyncObxpMessage(uint8_t* message, uint32_t* length, int timeout, uint32_t* sequence, uint32_t channel)
{
    return fetchMessage(message, length, timeout, sequence, channel, nullptr, nullptr, false);
}

int GetAsyncObxpMessage_Ex(uint8_t* message, uint32_t* length, int timeout, uint32_t* sequence, uint32_t channel,
                           uint8_t* sessionHandle, uint8_t* privilege)
{
    return fetchMessage(message, length, timeout, sequence, channel, sessionHandle, privilege, true);
}

int MapPhysicalMemory(uint32_t address, int32_t length, void** mapped)
{
    if (address == 0 || length <= 0 || mapped == nullptr)
        return ObxResultError;
    char text[128];
    int fd = os->open(devicePath, O_RDONLY);
    if (fd < 0) {
        snprintf(text, sizeof text, "%s %s: open(%s) failed\n", "obxapi", "MapPhysicalMemory", devicePath);
        perror(text);
        return ObxResultError;
    }
    // Mappings start on a page; the caller's address lies `offset` bytes in.
    // The file offset is 64 bits wide, so addresses at or above 2 GiB stay positive.
    const uint32_t offset = address & 0xFFFu;
    void* base = os->mmap(nullptr, static_cast<size_t>(length) + offset, PROT_READ, MAP_SHARED, fd,
                          static_cast<off_t>(address - offset));
    if (base == MAP_FAILED) {
        snprintf(text, sizeof text, "%s %s: mmap failed\n", "obxapi", "MapPhysicalMemory");
        perror(text);
        os->close(fd);
        return ObxResultError;
    }
    os->close(fd);
    *mapped = static_cast<uint8_t*>(base) + offset;
    return ObxResultOk;
}

int UnmapPhysicalMemory(void* mapped, int32_t length)
{
    // A negative length would become a huge size and unmap whatever follows.
    if (mapped == nullptr || length <= 0)
        return ObxResultError;
    const uint32_t offset = pointerWord(mapped) & 0xFFFu;
    if (os->munmap(static_cast<uint8_t*>(mapped) - offset, static_cast<size_t>(length) + offset) != 0) {
        char text[128];
        snprintf(text, sizeof text, "%s %s: munmap failed\n", "obxapi", "UnmapPhysicalMemory");
        perror(text);
        return ObxResultError;
    }
    return ObxResultOk;
}
