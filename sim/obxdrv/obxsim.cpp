// The simulated OBX driver and management controller.
//
// Environment (read by obxsimConfigureFromEnv):
//   OBXSIM_LOG                file the event log is appended to, one line per event
//   OBXSIM_IPMI               "0.9", "1.0", "1.5" (default), "2.0" or a version byte "0xNN"
//   OBXSIM_DEVICE_ID_LENGTH   data bytes of the Get Device ID answer (1-15)
//   OBXSIM_NODEV              "1": opening /dev/obx fails with ENOENT
//   OBXSIM_MEMORY             file mapped read-only as physical memory
//   OBXSIM_MEMORY_BASE        physical address of the file's first byte (hex, page aligned)
//   OBXSIM_I2C                devices "BB.AA=hexbytes;..." (bus and address in hex)
//   OBXSIM_FAULT              faults "TARGET:FAULT[#COUNT];..." where TARGET is
//                             NN.CC (net function, command), a 4-digit ioctl
//                             code or "*", and FAULT is fail, positive, empty,
//                             short, overlong or cc=XX (all hex)
#include "obxdrv/obxsim.h"

#include <cerrno>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dlfcn.h>
#include <fcntl.h>
#include <map>
#include <pthread.h>
#include <set>
#include <sys/mman.h>
#include <unistd.h>

namespace {

static_assert(sizeof(void*) == 4, "the driver's records carry 4-byte pointers: build for i386");

// The driver's view of the ioctl record: ten 32-bit words.
struct DriverRecord {
    uint32_t reserved[3];
    uint32_t status;
    uint32_t inBuffer;
    uint32_t inSize;
    uint32_t outBuffer;
    uint32_t outSize;
    uint32_t bytesReturned;
    uint32_t overlapped;
};
static_assert(sizeof(DriverRecord) == 40);

enum : uint32_t {
    ioctlSendMessage = 0x1082,
    ioctlGetAsyncMessage = 0x1088,
    ioctlSetShutdownCode = 0x1092,
    ioctlStartAsyncPoll = 0x1094,
    ioctlRegisterAsync = 0x1098,
    ioctlUnregisterAsync = 0x109A,
    ioctlCheckAsync = 0x109C,
};

enum : uint32_t {
    statusSuccess = 0,
    statusUnsuccessful = 0xC0000001u,
    statusInvalidParameter = 0xC000000Du,
    statusBufferTooSmall = 0xC0000023u,
    statusNoMessage = 0xE0070012u,
};

const uint32_t registrationHandle = 0x0B0E0001u;

// The C library's calls, found past this code so that a preloaded copy of the
// simulator does not call itself.
struct Libc {
    int (*open)(const char*, int, ...);
    int (*close)(int);
    void* (*mmap64)(void*, size_t, int, int, int, int64_t);
    int (*munmap)(void*, size_t);
};

const Libc& libc()
{
    static const Libc table = [] {
        Libc t;
        t.open = reinterpret_cast<int (*)(const char*, int, ...)>(dlsym(RTLD_NEXT, "open"));
        t.close = reinterpret_cast<int (*)(int)>(dlsym(RTLD_NEXT, "close"));
        t.mmap64 = reinterpret_cast<void* (*)(void*, size_t, int, int, int, int64_t)>(dlsym(RTLD_NEXT, "mmap64"));
        t.munmap = reinterpret_cast<int (*)(void*, size_t)>(dlsym(RTLD_NEXT, "munmap"));
        return t;
    }();
    return table;
}

struct Fault {
    uint32_t ioctlCode;
    int netFunction;
    int command;
    ObxSimFault fault;
    uint8_t value;
    int remaining; // 0: for ever
};

struct Message {
    uint32_t sequence;
    std::vector<uint8_t> bytes; // as delivered
};

struct State {
    // configuration
    uint8_t versionByte = 0x51;
    uint32_t deviceIdLength = 15;
    bool missing = false;
    std::string logFile;
    std::string memoryFile;
    uint64_t memoryBase = 0;
    std::map<uint16_t, std::vector<uint8_t>> i2c; // bus << 8 | address
    std::vector<Fault> faults;
    // driver
    std::set<int> descriptors;
    std::map<uintptr_t, size_t> mappings;
    int opens = 0;
    uint8_t asyncSequence = 0;
    std::vector<Message> messages;
    uint32_t nextMessage = 1;
    uint32_t lastFetched = 0;
    bool registered = false;
    // watchdog
    bool watchdogSet = false;
    uint8_t timerUse = 0;
    uint8_t timerAction = 0;
    uint16_t countdown = 0;
    bool watchdogRunning = false;
    uint64_t generation = 0;
    // record
    std::vector<std::string> log;
    std::vector<ObxSimRequest> requests;
};

pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t changed = PTHREAD_COND_INITIALIZER;
// Never destroyed: a watchdog thread may outlive the tests' use of it.
State& state = *new State;

class Lock {
public:
    Lock() { pthread_mutex_lock(&mutex); }
    ~Lock() { pthread_mutex_unlock(&mutex); }
    Lock(const Lock&) = delete;
    Lock& operator=(const Lock&) = delete;
};

// Called with the mutex held.
void logLine(const char* format, ...) __attribute__((format(printf, 1, 2)));
void logLine(const char* format, ...)
{
    char text[256];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(text, sizeof text, format, arguments);
    va_end(arguments);
    state.log.emplace_back(text);
    pthread_cond_broadcast(&changed);
    if (!state.logFile.empty()) {
        int fd = libc().open(state.logFile.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
        if (fd >= 0) {
            std::string line = std::string(text) + "\n";
            ssize_t written = write(fd, line.data(), line.size());
            (void)written;
            libc().close(fd);
        }
    }
}

std::string hex(const uint8_t* bytes, size_t count)
{
    std::string text;
    char part[4];
    for (size_t i = 0; i < count; ++i) {
        snprintf(part, sizeof part, i == 0 ? "%02x" : " %02x", bytes[i]);
        text += part;
    }
    return count == 0 ? "-" : text;
}

const char* timerActionName(uint8_t action)
{
    switch (action & 0x07) {
    case 0x00:
        return "no action";
    case 0x01:
        return "hard reset";
    case 0x02:
        return "power down";
    case 0x03:
        return "power cycle";
    default:
        return "reserved action";
    }
}

timespec deadlineAfter(unsigned milliseconds)
{
    timespec at;
    clock_gettime(CLOCK_REALTIME, &at);
    uint64_t nanoseconds = static_cast<uint64_t>(at.tv_nsec) + static_cast<uint64_t>(milliseconds % 1000) * 1000000u;
    at.tv_sec += static_cast<time_t>(milliseconds / 1000 + nanoseconds / 1000000000u);
    at.tv_nsec = static_cast<long>(nanoseconds % 1000000000u);
    return at;
}

struct Countdown {
    uint64_t generation;
    unsigned milliseconds;
};

// One thread per start of the watchdog; a later start, a stop or a reset of the
// simulator changes the generation and so ends it without effect.
void* watchdogThread(void* argument)
{
    Countdown countdown = *static_cast<Countdown*>(argument);
    delete static_cast<Countdown*>(argument);
    timespec deadline = deadlineAfter(countdown.milliseconds);
    Lock lock;
    while (state.generation == countdown.generation) {
        if (pthread_cond_timedwait(&changed, &mutex, &deadline) == ETIMEDOUT)
            break;
    }
    if (state.generation == countdown.generation && state.watchdogRunning) {
        state.watchdogRunning = false;
        logLine("watchdog expired: %s", timerActionName(state.timerAction));
    }
    return nullptr;
}

// Called with the mutex held.
void startWatchdog(void)
{
    state.watchdogRunning = true;
    ++state.generation;
    pthread_cond_broadcast(&changed);
    auto* countdown = new Countdown{state.generation, state.countdown * 100u};
    // The thread must not take the host process's signals.
    sigset_t all, previous;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &previous);
    pthread_t thread;
    if (pthread_create(&thread, nullptr, watchdogThread, countdown) == 0)
        pthread_detach(thread);
    else
        delete countdown;
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
}

void stopWatchdog(void)
{
    state.watchdogRunning = false;
    ++state.generation;
    pthread_cond_broadcast(&changed);
}

// The controller: one IPMI request in, completion code and data out.
std::vector<uint8_t> controllerAnswer(uint8_t netFunction, uint8_t command, const std::vector<uint8_t>& data)
{
    if (netFunction == 0x06 && command == 0x01) {
        const uint8_t identity[15] = {0x20, 0x01, 0x01, 0x00, state.versionByte, 0x8F, 0x00, 0x00,
                                      0x00, 0x01, 0x00, 0x00, 0x00, 0x00, 0x00};
        logLine("get device id");
        std::vector<uint8_t> answer{0x00};
        answer.insert(answer.end(), identity, identity + state.deviceIdLength);
        return answer;
    }
    if (netFunction == 0x06 && command == 0x24) {
        if (data.size() != 6)
            return {0xC7};
        state.timerUse = data[0];
        state.timerAction = data[1];
        state.countdown = static_cast<uint16_t>(data[4] | data[5] << 8);
        state.watchdogSet = true;
        if ((data[0] & 0x40) == 0)
            stopWatchdog();
        logLine("watchdog set: use 0x%02x action %s countdown %u", data[0], timerActionName(data[1]),
                state.countdown);
        return {0x00};
    }
    if (netFunction == 0x06 && command == 0x22) {
        if (!state.watchdogSet)
            return {0x80}; // not initialised
        logLine("watchdog started: countdown %u", state.countdown);
        startWatchdog();
        return {0x00};
    }
    if (netFunction == 0x00 && command == 0x02) {
        if (data.size() != 1)
            return {0xC7};
        static const char* const controls[] = {"power down", "power up", "power cycle", "hard reset", "nmi",
                                               "soft shutdown"};
        uint8_t control = data[0] & 0x0F;
        if (control > 5)
            return {0xCC};
        logLine("chassis control: %s", controls[control]);
        return {0x00};
    }
    if (netFunction == 0x06 && command == 0x52) {
        if (data.size() < 3)
            return {0xC7};
        const uint8_t bus = data[0], address = data[1], readCount = data[2];
        const size_t writeCount = data.size() - 3;
        logLine("i2c write-read: bus 0x%02x address 0x%02x read %u write %zu", bus, address, readCount, writeCount);
        auto device = state.i2c.find(static_cast<uint16_t>(bus << 8 | address));
        if (device == state.i2c.end())
            return {0x83}; // no acknowledge
        // The first byte written selects the offset, as on a serial EEPROM.
        size_t offset = writeCount > 0 ? data[3] : 0;
        std::vector<uint8_t> answer{0x00};
        for (size_t i = 0; i < readCount; ++i)
            answer.push_back(offset + i < device->second.size() ? device->second[offset + i] : 0xFF);
        return answer;
    }
    if (netFunction == 0x06 && (command == 0x34 || command == 0x7A)) {
        logLine("message response: cmd 0x%02x data %s", command, hex(data.data(), data.size()).c_str());
        return {0x00};
    }
    logLine("request netfn 0x%02x cmd 0x%02x: invalid command", netFunction, command);
    return {0xC1};
}

Fault* findFault(uint32_t code, int netFunction, int command)
{
    for (Fault& fault : state.faults) {
        if (fault.ioctlCode != 0 && fault.ioctlCode != code)
            continue;
        if (code == ioctlSendMessage && ((fault.netFunction >= 0 && fault.netFunction != netFunction) ||
                                         (fault.command >= 0 && fault.command != command)))
            continue;
        if (code != ioctlSendMessage && (fault.netFunction >= 0 || fault.command >= 0))
            continue;
        return &fault;
    }
    return nullptr;
}

void* at(uint32_t word)
{
    return reinterpret_cast<void*>(static_cast<uintptr_t>(word));
}

void setStatus(const DriverRecord& record, uint32_t status)
{
    if (record.status != 0)
        std::memcpy(at(record.status), &status, sizeof status);
}

// Result of one ioctl: the answer's bytes, or a refusal with its status.
struct Outcome {
    bool refused = false;
    uint32_t status = statusSuccess;
    int error = 0;
    std::vector<uint8_t> answer;
};

Outcome refuse(uint32_t status, int error)
{
    Outcome outcome;
    outcome.refused = true;
    outcome.status = status;
    outcome.error = error;
    return outcome;
}

uint32_t loadWord(const uint8_t* at)
{
    uint32_t value;
    std::memcpy(&value, at, sizeof value);
    return value;
}

// A controller that refuses (`refusal` non-zero) answers with that completion
// code and does nothing.
Outcome sendMessage(const DriverRecord& record, const uint8_t* in, uint8_t refusal)
{
    if (in == nullptr || record.inSize < 13 || record.outBuffer == 0 || record.outSize < 1)
        return refuse(statusInvalidParameter, EINVAL);
    ObxSimRequest request;
    request.flags = loadWord(in);
    request.timeout = loadWord(in + 4);
    request.rsSlaveAddress = in[8];
    request.command = in[9];
    request.netFunction = in[10];
    request.rsLun = in[11];
    if (in[12] > record.inSize - 13)
        return refuse(statusInvalidParameter, EINVAL);
    request.data.assign(in + 13, in + 13 + in[12]);
    state.requests.push_back(request);
    Outcome outcome;
    if (refusal != 0) {
        logLine("refused: netfn 0x%02x cmd 0x%02x completion code 0x%02x", request.netFunction, request.command,
                refusal);
        outcome.answer = {refusal};
    } else if (request.flags == 1) {
        uint8_t sequence = ++state.asyncSequence;
        logLine("async request: netfn 0x%02x cmd 0x%02x sequence %u", request.netFunction, request.command,
                sequence);
        outcome.answer = {0x00, sequence};
    } else if (request.rsSlaveAddress != 0x20) {
        outcome.answer = {0xFF}; // no such responder
    } else {
        outcome.answer = controllerAnswer(request.netFunction, request.command, request.data);
    }
    return outcome;
}

std::vector<uint8_t> delivered(uint32_t channel, uint8_t privilege, int session, const std::vector<uint8_t>& bytes)
{
    std::vector<uint8_t> out;
    if (state.deviceIdLength > 10) {
        out.push_back(static_cast<uint8_t>((channel & 0x0F) | (privilege & 0x0F) << 4));
        if (session >= 0)
            out.push_back(static_cast<uint8_t>(session));
    }
    out.insert(out.end(), bytes.begin(), bytes.end());
    return out;
}

Outcome driverAnswer(uint32_t code, const DriverRecord& record, uint8_t refusal)
{
    const auto* in = static_cast<const uint8_t*>(at(record.inBuffer));
    switch (code) {
    case ioctlSendMessage:
        return sendMessage(record, in, refusal);
    case ioctlGetAsyncMessage: {
        if (in == nullptr || record.inSize < 8)
            return refuse(statusInvalidParameter, EINVAL);
        uint32_t after = loadWord(in + 4);
        for (const Message& message : state.messages) {
            if (message.sequence > after) {
                Outcome outcome;
                outcome.answer.resize(4);
                std::memcpy(outcome.answer.data(), &message.sequence, 4);
                outcome.answer.insert(outcome.answer.end(), message.bytes.begin(), message.bytes.end());
                if (message.sequence > state.lastFetched)
                    state.lastFetched = message.sequence;
                logLine("async message fetched: sequence %u", message.sequence);
                return outcome;
            }
        }
        return refuse(statusNoMessage, EAGAIN);
    }
    case ioctlSetShutdownCode: {
        if (in == nullptr || record.inSize < 8)
            return refuse(statusInvalidParameter, EINVAL);
        logLine("shutdown code %u delay %u", loadWord(in), loadWord(in + 4));
        return {};
    }
    case ioctlStartAsyncPoll:
        logLine("async poll started");
        return {};
    case ioctlRegisterAsync: {
        if (record.outBuffer == 0 || record.outSize < 4)
            return refuse(statusInvalidParameter, EINVAL);
        state.registered = true;
        logLine("async registered");
        Outcome outcome;
        outcome.answer.resize(4);
        std::memcpy(outcome.answer.data(), &registrationHandle, 4);
        return outcome;
    }
    case ioctlUnregisterAsync:
    case ioctlCheckAsync: {
        if (in == nullptr || record.inSize < 4 || !state.registered || loadWord(in) != registrationHandle)
            return refuse(statusInvalidParameter, EINVAL);
        if (code == ioctlUnregisterAsync) {
            state.registered = false;
            logLine("async unregistered");
            return {};
        }
        bool waiting = !state.messages.empty() && state.messages.back().sequence > state.lastFetched;
        return waiting ? Outcome{} : refuse(statusNoMessage, EAGAIN);
    }
    default:
        logLine("ioctl 0x%lx: unknown request", static_cast<unsigned long>(code));
        return refuse(statusInvalidParameter, ENOTTY);
    }
}

bool parseHexBytes(const std::string& text, std::vector<uint8_t>& bytes)
{
    if (text.size() % 2 != 0)
        return false;
    for (size_t i = 0; i < text.size(); i += 2) {
        char* end = nullptr;
        std::string pair = text.substr(i, 2);
        unsigned long value = strtoul(pair.c_str(), &end, 16);
        if (*end != '\0')
            return false;
        bytes.push_back(static_cast<uint8_t>(value));
    }
    return true;
}

std::vector<std::string> split(const std::string& text, char separator)
{
    std::vector<std::string> parts;
    size_t start = 0;
    for (;;) {
        size_t end = text.find(separator, start);
        std::string part = text.substr(start, end == std::string::npos ? std::string::npos : end - start);
        if (!part.empty())
            parts.push_back(part);
        if (end == std::string::npos)
            return parts;
        start = end + 1;
    }
}

bool parseHex(const std::string& text, unsigned long& value)
{
    if (text.empty())
        return false;
    char* end = nullptr;
    value = strtoul(text.c_str(), &end, 16);
    return *end == '\0';
}

// "TARGET:FAULT[#COUNT]"
bool parseFault(const std::string& rule)
{
    size_t colon = rule.find(':');
    if (colon == std::string::npos)
        return false;
    std::string target = rule.substr(0, colon);
    std::string fault = rule.substr(colon + 1);
    int count = 0;
    size_t hash = fault.find('#');
    if (hash != std::string::npos) {
        count = atoi(fault.c_str() + hash + 1);
        fault.resize(hash);
    }
    uint32_t code = 0;
    int netFunction = -1, command = -1;
    unsigned long value = 0;
    size_t dot = target.find('.');
    if (target == "*") {
    } else if (dot != std::string::npos) {
        unsigned long n, c;
        if (!parseHex(target.substr(0, dot), n) || !parseHex(target.substr(dot + 1), c))
            return false;
        code = ioctlSendMessage;
        netFunction = static_cast<int>(n);
        command = static_cast<int>(c);
    } else if (parseHex(target, value)) {
        code = static_cast<uint32_t>(value);
    } else {
        return false;
    }
    ObxSimFault kind;
    uint8_t completion = 0;
    if (fault == "fail")
        kind = ObxSimFail;
    else if (fault == "positive")
        kind = ObxSimPositive;
    else if (fault == "empty")
        kind = ObxSimEmpty;
    else if (fault == "short")
        kind = ObxSimShort;
    else if (fault == "overlong")
        kind = ObxSimOverlong;
    else if (fault.rfind("cc=", 0) == 0 && parseHex(fault.substr(3), value)) {
        kind = ObxSimCompletionCode;
        completion = static_cast<uint8_t>(value);
    } else
        return false;
    state.faults.push_back({code, netFunction, command, kind, completion, count});
    return true;
}

} // namespace

void obxsimReset(void)
{
    Lock lock;
    stopWatchdog();
    uint64_t generation = state.generation;
    std::set<int> descriptors = state.descriptors;
    state = State{};
    state.generation = generation;
    state.descriptors = descriptors; // still open in the host
}

int obxsimSetIpmiVersion(const char* version)
{
    std::string text = version;
    uint8_t versionByte;
    uint32_t length = 15;
    unsigned long value = 0;
    if (text == "0.9") {
        versionByte = 0x90;
        length = 10;
    } else if (text == "1.0")
        versionByte = 0x01;
    else if (text == "1.5")
        versionByte = 0x51;
    else if (text == "2.0")
        versionByte = 0x02;
    else if (text.rfind("0x", 0) == 0 && parseHex(text.substr(2), value) && value <= 0xFF)
        versionByte = static_cast<uint8_t>(value);
    else
        return -1;
    obxsimSetDeviceId(versionByte, length);
    return 0;
}

void obxsimSetDeviceId(uint8_t versionByte, uint32_t dataLength)
{
    Lock lock;
    state.versionByte = versionByte;
    state.deviceIdLength = dataLength < 1 ? 1 : dataLength > 15 ? 15 : dataLength;
}

void obxsimSetDeviceMissing(bool missing)
{
    Lock lock;
    state.missing = missing;
}

void obxsimSetLogFile(const char* path)
{
    Lock lock;
    state.logFile = path != nullptr ? path : "";
}

void obxsimSetMemory(const char* path, uint64_t base)
{
    Lock lock;
    state.memoryFile = path != nullptr ? path : "";
    state.memoryBase = base;
}

void obxsimSetI2cDevice(uint8_t bus, uint8_t address, const std::vector<uint8_t>& contents)
{
    Lock lock;
    state.i2c[static_cast<uint16_t>(bus << 8 | address)] = contents;
}

uint32_t obxsimQueueMessage(uint32_t channel, uint8_t privilege, int session, const std::vector<uint8_t>& bytes)
{
    Lock lock;
    uint32_t sequence = state.nextMessage++;
    state.messages.push_back({sequence, delivered(channel, privilege, session, bytes)});
    return sequence;
}

void obxsimInjectFault(uint32_t ioctlCode, int netFunction, int command, ObxSimFault fault, uint8_t value, int count)
{
    Lock lock;
    state.faults.push_back({ioctlCode, netFunction, command, fault, value, count});
}

int obxsimConfigureFromEnv(void)
{
    int result = 0;
    if (const char* log = getenv("OBXSIM_LOG"))
        obxsimSetLogFile(log);
    if (const char* version = getenv("OBXSIM_IPMI"))
        result |= obxsimSetIpmiVersion(version);
    if (const char* length = getenv("OBXSIM_DEVICE_ID_LENGTH")) {
        Lock lock;
        state.deviceIdLength = static_cast<uint32_t>(atoi(length));
        if (state.deviceIdLength < 1 || state.deviceIdLength > 15) {
            state.deviceIdLength = 15;
            result = -1;
        }
    }
    if (const char* missing = getenv("OBXSIM_NODEV"))
        obxsimSetDeviceMissing(strcmp(missing, "1") == 0);
    if (const char* memory = getenv("OBXSIM_MEMORY")) {
        unsigned long long base = 0;
        if (const char* text = getenv("OBXSIM_MEMORY_BASE"))
            base = strtoull(text, nullptr, 16);
        obxsimSetMemory(memory, base);
    }
    if (const char* devices = getenv("OBXSIM_I2C")) {
        for (const std::string& device : split(devices, ';')) {
            size_t dot = device.find('.'), equals = device.find('=');
            unsigned long bus, address;
            std::vector<uint8_t> bytes;
            if (dot == std::string::npos || equals == std::string::npos || equals < dot ||
                !parseHex(device.substr(0, dot), bus) || !parseHex(device.substr(dot + 1, equals - dot - 1), address) ||
                !parseHexBytes(device.substr(equals + 1), bytes)) {
                result = -1;
                continue;
            }
            obxsimSetI2cDevice(static_cast<uint8_t>(bus), static_cast<uint8_t>(address), bytes);
        }
    }
    if (const char* faults = getenv("OBXSIM_FAULT")) {
        Lock lock;
        for (const std::string& rule : split(faults, ';'))
            if (!parseFault(rule))
                result = -1;
    }
    return result;
}

std::vector<std::string> obxsimLog(void)
{
    Lock lock;
    return state.log;
}

std::vector<ObxSimRequest> obxsimRequests(void)
{
    Lock lock;
    return state.requests;
}

bool obxsimWaitForLog(const std::string& line, unsigned timeoutMs)
{
    timespec deadline = deadlineAfter(timeoutMs);
    Lock lock;
    for (;;) {
        for (const std::string& entry : state.log)
            if (entry == line)
                return true;
        if (pthread_cond_timedwait(&changed, &mutex, &deadline) == ETIMEDOUT)
            return false;
    }
}

int obxsimOpenCount(void)
{
    Lock lock;
    return state.opens;
}

int obxsimOpen(const char* path, int flags)
{
    if (path == nullptr || strcmp(path, "/dev/obx") != 0) {
        errno = ENOENT;
        return -1;
    }
    Lock lock;
    if (state.missing) {
        errno = ENOENT;
        return -1;
    }
    int fd = libc().open("/dev/null", (flags & O_ACCMODE) | O_CLOEXEC);
    if (fd < 0)
        return -1;
    state.descriptors.insert(fd);
    ++state.opens;
    logLine("open /dev/obx %s", (flags & O_ACCMODE) == O_RDONLY ? "read-only" : "read-write");
    return fd;
}

bool obxsimIsDevice(int fd)
{
    Lock lock;
    return state.descriptors.count(fd) != 0;
}

int obxsimIoctl(int fd, unsigned long request, void* argument)
{
    Lock lock;
    if (state.descriptors.count(fd) == 0) {
        errno = EBADF;
        return -1;
    }
    if (argument == nullptr) {
        errno = EFAULT;
        return -1;
    }
    DriverRecord record;
    std::memcpy(&record, argument, sizeof record);
    const uint32_t code = static_cast<uint32_t>(request);
    const auto* in = static_cast<const uint8_t*>(at(record.inBuffer));
    const bool send = code == ioctlSendMessage && in != nullptr && record.inSize >= 13;
    Fault* fault = findFault(code, send ? in[10] : -1, send ? in[9] : -1);
    Fault applied{};
    const bool faulted = fault != nullptr;
    if (faulted) {
        applied = *fault;
        if (fault->remaining > 0 && --fault->remaining == 0)
            state.faults.erase(state.faults.begin() + (fault - state.faults.data()));
        if (applied.fault == ObxSimFail || applied.fault == ObxSimPositive) {
            logLine("fault: ioctl 0x%x %s", code, applied.fault == ObxSimFail ? "failed" : "returned 1");
            if (applied.fault == ObxSimPositive)
                return 1;
            setStatus(record, statusUnsuccessful);
            errno = EIO;
            return -1;
        }
    }
    const uint8_t refusal = faulted && applied.fault == ObxSimCompletionCode ? applied.value : 0;
    Outcome outcome = driverAnswer(code, record, refusal);
    if (outcome.refused) {
        setStatus(record, outcome.status);
        errno = outcome.error;
        return -1;
    }
    std::vector<uint8_t>& answer = outcome.answer;
    uint32_t returned = static_cast<uint32_t>(answer.size());
    if (faulted) {
        switch (applied.fault) {
        case ObxSimCompletionCode:
            answer = {applied.value};
            returned = 1;
            break;
        case ObxSimShort:
            answer.resize(answer.empty() ? 0 : 1);
            returned = static_cast<uint32_t>(answer.size());
            break;
        case ObxSimEmpty:
            answer.clear();
            returned = 0;
            break;
        case ObxSimOverlong:
            if (answer.size() > record.outSize)
                answer.resize(record.outSize);
            answer.resize(record.outSize, 0xEE);
            returned = record.outSize + 16;
            break;
        default:
            break;
        }
        logLine("fault: ioctl 0x%x answered with %u bytes", code, returned);
    }
    if (answer.size() > record.outSize || (!answer.empty() && record.outBuffer == 0)) {
        setStatus(record, statusBufferTooSmall);
        errno = EOVERFLOW;
        return -1;
    }
    if (!answer.empty())
        std::memcpy(at(record.outBuffer), answer.data(), answer.size());
    if (record.bytesReturned != 0)
        std::memcpy(at(record.bytesReturned), &returned, sizeof returned);
    setStatus(record, statusSuccess);
    return 0;
}

void* obxsimMmap(void* address, size_t length, int protection, int flags, int fd, int64_t offset)
{
    Lock lock;
    if (state.descriptors.count(fd) == 0) {
        errno = EBADF;
        return MAP_FAILED;
    }
    logLine("mmap physical 0x%llx length %zu", static_cast<unsigned long long>(offset), length);
    // Physical memory is read-only to the driver's users.
    if ((protection & PROT_WRITE) != 0) {
        errno = EACCES;
        return MAP_FAILED;
    }
    if (state.memoryFile.empty() || offset < 0 || static_cast<uint64_t>(offset) < state.memoryBase) {
        errno = ENXIO;
        return MAP_FAILED;
    }
    int memory = libc().open(state.memoryFile.c_str(), O_RDONLY | O_CLOEXEC);
    if (memory < 0)
        return MAP_FAILED;
    void* mapped = libc().mmap64(address, length, protection, flags, memory,
                                 static_cast<int64_t>(static_cast<uint64_t>(offset) - state.memoryBase));
    int error = errno;
    libc().close(memory);
    if (mapped != MAP_FAILED)
        state.mappings[reinterpret_cast<uintptr_t>(mapped)] = length;
    errno = error;
    return mapped;
}

int obxsimMunmap(void* address, size_t length)
{
    Lock lock;
    auto mapping = state.mappings.find(reinterpret_cast<uintptr_t>(address));
    int result = libc().munmap(address, length);
    if (mapping != state.mappings.end() && result == 0) {
        logLine("munmap length %zu", length);
        state.mappings.erase(mapping);
    }
    return result;
}

int obxsimClose(int fd)
{
    Lock lock;
    if (state.descriptors.erase(fd) == 0) {
        errno = EBADF;
        return -1;
    }
    logLine("close /dev/obx");
    return libc().close(fd);
}
