// A simulated OBX driver and management controller.
//
// It answers the driver's ioctl records as the driver behind /dev/obx would:
// Get Device ID with a chosen IPMI version, the watchdog (Set and Reset
// Watchdog Timer, countdown in 100 ms steps, expiry recorded as the hard reset
// or power down it would cause), Chassis Control, Master Write-Read from a small
// I2C table, the after-shutdown code, asynchronous messages with sequence
// numbers, and read-only mapping of a file as physical memory. Everything it
// is asked and does is recorded in an event log (kept in memory, and appended
// to a file when one is named). Faults can be injected per request.
//
// Descriptors handed out are real descriptors of /dev/null, so their numbers
// never clash with the process's other files.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

// Back to a fresh controller: IPMI 1.5, no log file, no faults, no messages,
// no I2C devices, no memory file, watchdog stopped, log and requests cleared.
void obxsimReset(void);
// Reads the OBXSIM_* environment variables (see obxsim.cpp); 0 when all were
// understood, -1 otherwise.
int obxsimConfigureFromEnv(void);

// "0.9" (an answer of 10 data bytes), "1.0", "1.5", "2.0" or a version byte
// such as "0x02" (15 data bytes); 0 when understood.
int obxsimSetIpmiVersion(const char* version);
// The Get Device ID answer: its IPMI Version byte and its number of data bytes (1-15).
void obxsimSetDeviceId(uint8_t versionByte, uint32_t dataLength);
// Opening /dev/obx fails with ENOENT when missing.
void obxsimSetDeviceMissing(bool missing);
void obxsimSetLogFile(const char* path);
// The file whose offset 0 is physical address `base` (page aligned).
void obxsimSetMemory(const char* path, uint64_t base);
void obxsimSetI2cDevice(uint8_t bus, uint8_t address, const std::vector<uint8_t>& contents);

// Queues an asynchronous message from `channel`; returns its sequence number.
// On an IPMI 0.9 controller `bytes` are delivered as they are; otherwise they
// follow a byte of channel (bits 3-0) and privilege (bits 7-4) and, when
// `session` is not negative, a session-handle byte.
uint32_t obxsimQueueMessage(uint32_t channel, uint8_t privilege, int session, const std::vector<uint8_t>& bytes);

enum ObxSimFault {
    ObxSimFail, // the ioctl returns -1 (EIO) with a driver status
    ObxSimPositive, // the ioctl returns 1
    ObxSimCompletionCode, // the controller answers with completion code `value` only
    ObxSimEmpty, // bytes returned 0
    ObxSimShort, // the answer cut to its completion code
    ObxSimOverlong, // bytes returned reports 16 more than the out-buffer holds
};
// Applies `fault` to the next `count` matching requests (0: to every one).
// `ioctlCode` 0 matches every code; `netFunction`/`command` -1 match any
// (they are compared for ObxIoctlSendMessage only).
void obxsimInjectFault(uint32_t ioctlCode, int netFunction, int command, ObxSimFault fault, uint8_t value = 0,
                       int count = 0);

// What the simulated controller saw and did.
struct ObxSimRequest {
    uint32_t flags;
    uint32_t timeout;
    uint8_t rsSlaveAddress;
    uint8_t netFunction;
    uint8_t command;
    uint8_t rsLun;
    std::vector<uint8_t> data;
};
std::vector<std::string> obxsimLog(void);
std::vector<ObxSimRequest> obxsimRequests(void);
// Waits up to `timeoutMs` for a log line equal to `line`; true when it came.
bool obxsimWaitForLog(const std::string& line, unsigned timeoutMs);
int obxsimOpenCount(void);

// The driver's side of the OS calls. obxsimOpen serves only "/dev/obx".
int obxsimOpen(const char* path, int flags);
bool obxsimIsDevice(int fd);
int obxsimIoctl(int fd, unsigned long request, void* record);
void* obxsimMmap(void* address, size_t length, int protection, int flags, int fd, int64_t offset);
// Unmaps through the C library; a mapping made by obxsimMmap is logged.
int obxsimMunmap(void* address, size_t length);
// Closes a descriptor of the device; -1 (EBADF) for any other.
int obxsimClose(int fd);
