// The OBX driver interface: the daemon's road to the management controller.
//
// The driver's character device /dev/obx takes one ioctl per request; the
// third argument is an ObxIoctlRecord shaped like a Windows-style device-control
// call. The interface opens the device on first use, classes the controller by
// its Get Device ID answer and keeps that state for the life of the process.
//
// Results: 0 ObxResultOk, 1 ObxResultError, 3 ObxResultNoMessage,
// 4 ObxResultUnsupported; DeviceIoControl alone gives 1 for success.
#pragma once

#include <cstddef>
#include <cstdint>
#include <sys/types.h>

enum : int {
    ObxResultOk = 0,
    ObxResultError = 1,
    ObxResultNoMessage = 3,
    ObxResultUnsupported = 4,
};

// The driver's request codes (ioctl request numbers).
enum : uint32_t {
    ObxIoctlSendMessage = 0x1082,
    ObxIoctlGetAsyncMessage = 0x1088,
    ObxIoctlSetShutdownCode = 0x1092,
    ObxIoctlStartAsyncPoll = 0x1094,
    ObxIoctlRegisterAsync = 0x1098,
    ObxIoctlUnregisterAsync = 0x109A,
    ObxIoctlCheckAsync = 0x109C,
};

// Controller classes held in IpmiVersion.
enum : uint32_t {
    ObxIpmi09 = 0x90,
    ObxIpmi15 = 0x51,
    ObxIpmi10 = 0x01,
};

// The driver's status when a fetch finds no message waiting.
constexpr uint32_t ObxStatusNoMessage = 0xE0070012u;

// Sizes of the buffers handed to the driver with ObxIoctlSendMessage: the timed
// request uses 64 bytes, every other sender 34. Both hold 13 header bytes.
constexpr uint32_t obxTimedBufferSize = 64;
constexpr uint32_t obxShortBufferSize = 34;
constexpr uint32_t obxRequestHeaderSize = 13;
constexpr uint32_t obxAsyncMessageBufferSize = 37;

// Process-wide state. hDevice1 is 0 while the device is not open; IpmiVersion
// is 0 until the first successful open, then 0x90, 0x51 or 0x01. The driver
// leaves the status of a failed request in NTstatus[0].
extern int hDevice1;
extern uint32_t IpmiVersion;
extern uint32_t NTstatus[2];
// 0 until a registration for asynchronous messages succeeds.
extern uint32_t AsyncEventHandle;
// The OBX device, "/dev/obx".
extern const char* const obxDevicePath;

// Third argument of every ioctl (40 bytes on i386).
struct ObxIoctlRecord {
    uint32_t reserved[3];
    uint32_t* status;
    const void* inBuffer;
    uint32_t inSize;
    void* outBuffer;
    uint32_t outSize;
    uint32_t* bytesReturned;
    void* overlapped;
};

// One request to the controller, as the caller describes it (13 bytes).
struct __attribute__((packed)) ObxpRequest {
    uint8_t command;
    uint8_t rsSlaveAddress;
    uint8_t busType; // carried, not forwarded to the driver
    uint8_t netFunction;
    uint8_t rsLun;
    const uint8_t* data;
    int32_t dataLength;
};

// In-buffer of ObxIoctlSendMessage; the 34-byte senders use its first 34 bytes.
struct ObxDriverRequest {
    uint32_t flags; // 0 timed, 1 asynchronous
    uint32_t timeout; // the caller's time-out times 1000
    uint8_t rsSlaveAddress;
    uint8_t command;
    uint8_t netFunction;
    uint8_t rsLun;
    uint8_t dataLength;
    uint8_t data[obxTimedBufferSize - obxRequestHeaderSize];
};

// Out-buffer of ObxIoctlSendMessage; the driver reports 1 + data bytes.
struct ObxDriverResponse {
    uint8_t completionCode;
    uint8_t data[obxTimedBufferSize - 1];
};

// An I2C master write-read, as the caller describes it (11 bytes).
struct __attribute__((packed)) I2cRequest {
    uint8_t slaveAddress;
    uint8_t busType;
    uint8_t readCount;
    const uint8_t* writeData;
    int32_t writeCount;
};

// In-buffer of ObxIoctlSetShutdownCode: the code comes first.
struct ObxShutdownCodeRecord {
    uint32_t code; // 1 reset, 2 power off, once the OS is down
    uint32_t delay; // tenths of a second
};

static_assert(sizeof(void*) == 4, "the OBX records carry 4-byte pointers: build for i386");
static_assert(sizeof(ObxIoctlRecord) == 40);
static_assert(offsetof(ObxIoctlRecord, status) == 12);
static_assert(offsetof(ObxIoctlRecord, inBuffer) == 16);
static_assert(offsetof(ObxIoctlRecord, inSize) == 20);
static_assert(offsetof(ObxIoctlRecord, outBuffer) == 24);
static_assert(offsetof(ObxIoctlRecord, outSize) == 28);
static_assert(offsetof(ObxIoctlRecord, bytesReturned) == 32);
static_assert(offsetof(ObxIoctlRecord, overlapped) == 36);
static_assert(sizeof(ObxpRequest) == 13);
static_assert(offsetof(ObxpRequest, netFunction) == 3);
static_assert(offsetof(ObxpRequest, rsLun) == 4);
static_assert(offsetof(ObxpRequest, data) == 5);
static_assert(offsetof(ObxpRequest, dataLength) == 9);
static_assert(sizeof(ObxDriverRequest) == obxTimedBufferSize);
static_assert(offsetof(ObxDriverRequest, timeout) == 4);
static_assert(offsetof(ObxDriverRequest, rsSlaveAddress) == 8);
static_assert(offsetof(ObxDriverRequest, command) == 9);
static_assert(offsetof(ObxDriverRequest, netFunction) == 10);
static_assert(offsetof(ObxDriverRequest, rsLun) == 11);
static_assert(offsetof(ObxDriverRequest, dataLength) == 12);
static_assert(offsetof(ObxDriverRequest, data) == obxRequestHeaderSize);
static_assert(sizeof(ObxDriverResponse) == obxTimedBufferSize);
static_assert(sizeof(I2cRequest) == 11);
static_assert(offsetof(I2cRequest, readCount) == 2);
static_assert(offsetof(I2cRequest, writeData) == 3);
static_assert(offsetof(I2cRequest, writeCount) == 7);
static_assert(sizeof(ObxShutdownCodeRecord) == 8);

// The operating-system calls of this module. The C library serves them unless
// a test installs a table of its own (a simulated driver).
struct ObxOs {
    int (*open)(const char* path, int flags);
    int (*ioctl)(int fd, unsigned long request, void* argument);
    void* (*mmap)(void* address, size_t length, int protection, int flags, int fd, off_t offset);
    int (*munmap)(void* address, size_t length);
    int (*close)(int fd);
};
// Null restores the C library. The table must outlive its use.
void obxSetOs(const ObxOs* os);

// 1 when the device is open (now or already), 0 when opening or
// identification failed. Safe against concurrent first uses.
int open_obx(void);
// 1 when the ioctl returned 0, else 0. The handle is ignored.
int DeviceIoControl(int handle, uint32_t code, const void* inBuffer, uint32_t inSize, void* outBuffer,
                    uint32_t outSize, uint32_t* bytesReturned, void* overlapped);

// `response` holds at least 63 bytes, or is null. 0 when the driver carried the
// request and returned at least the completion code; the caller tests it.
int SendTimedObxpRequest(const ObxpRequest* request, int timeout, uint8_t* response, uint32_t* responseLength,
                         uint8_t* completionCode);
// `response` holds at least 33 bytes, or is null.
int SendTimedI2cRequest(const I2cRequest* request, int timeout, uint8_t* response, uint32_t* responseLength,
                        uint8_t* completionCode);
int SendAsyncObxpRequest(const ObxpRequest* request, uint8_t* sequenceNumber);
// Note the order: delay (tenths of a second) first, then the code.
int SetShutDownCode(uint32_t delay, uint32_t code);
uint8_t GetIpmiVersion(void);

// Answers to a message that reached the controller over its EMP or LAN channel.
int SendTimedEmpMessageResponse(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                int timeout);
int SendTimedEmpMessageResponse_Ex(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                   int timeout, uint8_t sessionHandle, uint8_t channel);
int SendTimedLanMessageResponse(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                int timeout);
int SendTimedLanMessageResponse_Ex(const uint8_t* message, const uint8_t* response, int32_t responseLength,
                                   int timeout, uint8_t sessionHandle, uint8_t channel);

int StartAsyncMesgPoll(void);
int RegisterForObxAsyncMessageNotification(uint32_t* handle);
int UnRegisterForObxAsyncMessageNotification(uint32_t handle);
int IsAsyncMessageAvailable(uint32_t handle);
// `length` holds the buffer's capacity on entry and the message length on
// return; `sequence` the position in the controller's message stream.
int GetAsyncObxpMessage(uint8_t* message, uint32_t* length, int timeout, uint32_t* sequence, uint32_t channel);
int GetAsyncObxpMessage_Ex(uint8_t* message, uint32_t* length, int timeout, uint32_t* sequence, uint32_t channel,
                           uint8_t* sessionHandle, uint8_t* privilege);

// Maps physical memory read-only; *mapped receives the address of `address`.
int MapPhysicalMemory(uint32_t address, int32_t length, void** mapped);
int UnmapPhysicalMemory(void* mapped, int32_t length);
