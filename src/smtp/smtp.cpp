#include "smtp/smtp.h"

#include <arpa/inet.h>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include "base/log.h"
#include "base/sleep.h"

namespace {

std::atomic<uint16_t> gs_smtpPort{25};
std::atomic<unsigned> gs_limitMs{8000};
std::atomic<SmtpWritableHook> gs_writableHook{nullptr};

// The observer of the dialogue running on this thread, if any.
thread_local SmtpObserver gs_observer = nullptr;
thread_local void* gs_observerContext = nullptr;

void observe(int step, int errorClass, int value, const char* reply, const char* message)
{
    if (gs_observer != nullptr)
        gs_observer(gs_observerContext, SmtpStep{step, smtpStepName(step), errorClass, value, reply, message});
}

constexpr size_t COMMAND_SIZE = 1024;
constexpr size_t REPLY_SIZE = 1024;
constexpr size_t RECEIVE_SIZE = 1024;
constexpr size_t REASON_SIZE = 128;
constexpr size_t LOG_LINE_SIZE = 512;
// Writability waits one recipient's command may make before the step fails.
constexpr int RECIPIENT_WAITS = 3;

const char COMMUNICATION_ERROR[] = "A communication error occured...";
const char READ_FAILED[] = "Failed to read response from server:[%s]";
const char CONNECT_READ_FAILED[] = "Invalid response when trying to connect to server:[%s]";

int64_t nowMs()
{
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

int msLeft(int64_t deadline)
{
    int64_t left = deadline - nowMs();
    if (left < 0)
        return 0;
    return left > INT_MAX ? INT_MAX : static_cast<int>(left);
}

// Waits until the socket has room to send, at most timeoutMs (0 still polls
// once). poll, unlike select, has no limit on the descriptor's number.
bool waitWritable(int sock, int timeoutMs)
{
    SmtpWritableHook hook = gs_writableHook.load();
    if (hook != nullptr)
        return hook(sock, timeoutMs);
    const int64_t deadline = nowMs() + timeoutMs;
    for (;;) {
        pollfd p{sock, POLLOUT, 0};
        int r = poll(&p, 1, msLeft(deadline));
        if (r < 0 && errno == EINTR)
            continue;
        return r > 0;
    }
}

// Connects within timeoutMs: a server that never completes the handshake (its
// accept queue full, a black hole) must not hold the event worker, whose
// system-control actions still wait. 0, or the error number (ETIMEDOUT when
// the time ran out). The socket is blocking again afterwards.
int connectWithin(int sock, const sockaddr_in& address, int timeoutMs)
{
    int flags = fcntl(sock, F_GETFL);
    if (flags < 0 || fcntl(sock, F_SETFL, flags | O_NONBLOCK) != 0)
        return errno;
    int error = 0;
    if (connect(sock, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        error = errno;
        if (error == EINPROGRESS || error == EINTR) {
            const int64_t deadline = nowMs() + timeoutMs;
            for (;;) {
                pollfd p{sock, POLLOUT, 0};
                int r = poll(&p, 1, msLeft(deadline));
                if (r < 0 && errno == EINTR)
                    continue;
                if (r < 0) {
                    error = errno;
                } else if (r == 0) {
                    error = ETIMEDOUT;
                } else {
                    socklen_t length = sizeof error;
                    if (getsockopt(sock, SOL_SOCKET, SO_ERROR, &error, &length) != 0)
                        error = errno;
                }
                break;
            }
        }
    }
    if (error == 0 && fcntl(sock, F_SETFL, flags) != 0)
        error = errno;
    return error;
}

bool isControl(char c)
{
    return static_cast<unsigned char>(c) < 0x20;
}

// The state of one dialogue, from socket creation to close.
struct Dialogue {
    int sock = -1;
    int code = 0; // reply code; an unnumbered reply keeps it
    int allowanceMs = 0; // what is left of the writability allowance
    char server[EMAIL_SERVER_SIZE] = {}; // the server text as sent and logged
    char command[COMMAND_SIZE] = {};
    size_t commandLength = 0;
    char reply[REPLY_SIZE] = {};
};

int fail(Dialogue& d, int errorClass, int step, int value, const char* format)
{
    snprintf(d.command, sizeof d.command, format, d.server, value);
    LogErrorMessageForMoxSendEmail(errorClass, step, value, d.command);
    observe(step, errorClass, value, errorClass == 2 ? d.reply : "", d.command);
    fprintf(stderr, "%s\n", d.command);
    fflush(stderr);
    if (d.sock >= 0) {
        shutdown(d.sock, SHUT_RDWR);
        close(d.sock);
        d.sock = -1;
    }
    return 0;
}

// Appends a terminated text to the command, cut to fit.
size_t appendText(Dialogue& d, size_t n, const char* text)
{
    while (*text != '\0' && n + 1 < sizeof d.command)
        d.command[n++] = *text++;
    d.command[n] = '\0';
    return n;
}

// Builds prefix, the sanitised text (at most maxLength bytes) and suffix.
void setCommand(Dialogue& d, const char* prefix, const char* text, size_t maxLength, const char* suffix)
{
    size_t n = appendText(d, 0, prefix);
    n += smtpCopySanitized(d.command + n, sizeof d.command - n, text, maxLength);
    d.commandLength = appendText(d, n, suffix);
}

struct Stage {
    int expected;
    int sendStep;
    const char* sendMessage;
    int readStep;
    const char* readMessage;
    int codeStep;
};

// Sends the command in d.command (none when sendStep is 0), reads the reply
// and checks its code. Returns 1 when the stage passed; otherwise the failure
// has been reported, the socket closed, and 0 is returned.
int runStage(Dialogue& d, const Stage& s, int waits = 1)
{
    if (s.sendStep != 0) {
        bool writable = false;
        for (int i = 0; i < waits && !writable; i++) {
            // Each wait uses up the time it spends; reading replies does not.
            const int64_t start = nowMs();
            writable = waitWritable(d.sock, d.allowanceMs);
            const int64_t spent = nowMs() - start;
            d.allowanceMs = spent >= d.allowanceMs ? 0 : d.allowanceMs - static_cast<int>(spent);
        }
        if (writable) {
            ssize_t sent = send(d.sock, d.command, d.commandLength, MSG_NOSIGNAL);
            if (sent < 0)
                return fail(d, 1, s.sendStep, errno, s.sendMessage);
            if (static_cast<size_t>(sent) != d.commandLength)
                return fail(d, 1, s.sendStep, ETIMEDOUT, s.sendMessage);
        } else if (waits > 1) {
            // A recipient is not skipped silently: after its bounded waits the
            // step fails.
            return fail(d, 1, s.sendStep, ETIMEDOUT, s.sendMessage);
        }
    }
    if (GetResponse(d.sock, d.reply, sizeof d.reply) < 0)
        return fail(d, 3, s.readStep, 0, s.readMessage);
    d.code = smtpReplyCode(d.reply, d.code);
    if (d.code != s.expected)
        return fail(d, 2, s.codeStep, d.code, "The server[%s] returned the following value:[%d]");
    observe(s.codeStep, 0, d.code, d.reply, nullptr);
    return 1;
}

} // namespace

const char* smtpStepName(int step)
{
    static const char* const names[] = {"connect", "greeting", "HELO", "MAIL FROM", "RCPT TO",
                                        "DATA", "subject", "message body", "QUIT"};
    if (step < 1 || step > 26)
        return "unknown step";
    return step <= 3 ? names[0] : names[(step - 4) / 3 + 1];
}

int smtpSendObserved(EmailConfig* config, SmtpObserver observer, void* context)
{
    gs_observer = observer;
    gs_observerContext = context;
    int result = _MoxSendEmail(config);
    gs_observer = nullptr;
    gs_observerContext = nullptr;
    return result;
}

void smtpSetPort(uint16_t port)
{
    gs_smtpPort.store(port);
}

void smtpSetLimitMs(unsigned milliseconds)
{
    gs_limitMs.store(milliseconds);
}

void smtpSetWritableHook(SmtpWritableHook hook)
{
    gs_writableHook.store(hook);
}

void smtpSanitize(char* text)
{
    if (text == nullptr)
        return;
    for (; *text != '\0'; text++) {
        if (isControl(*text))
            *text = ' ';
    }
}

size_t smtpCopySanitized(char* out, size_t outSize, const char* text, size_t maxLength)
{
    if (out == nullptr || outSize == 0)
        return 0;
    size_t n = 0;
    if (text != nullptr) {
        for (; n < maxLength && n + 1 < outSize && text[n] != '\0'; n++)
            out[n] = isControl(text[n]) ? ' ' : text[n];
    }
    out[n] = '\0';
    return n;
}

int smtpReplyCode(const char* reply, int previous)
{
    if (reply == nullptr)
        return previous;
    const char* p = reply;
    while (*p == ' ' || (*p >= '\t' && *p <= '\r'))
        p++;
    bool negative = false;
    if (*p == '+' || *p == '-') {
        negative = *p == '-';
        p++;
    }
    if (*p < '0' || *p > '9')
        return previous;
    long long value = 0;
    for (; *p >= '0' && *p <= '9'; p++) {
        if (value <= static_cast<long long>(INT_MAX) + 1)
            value = value * 10 + (*p - '0');
    }
    if (negative)
        value = -value;
    if (value > INT_MAX)
        return INT_MAX;
    if (value < INT_MIN)
        return INT_MIN;
    return static_cast<int>(value);
}

bool smtpHasLineEnd(const char* bytes, size_t length)
{
    if (bytes == nullptr)
        return false;
    for (size_t i = 0; i + 1 < length; i++) {
        char a = bytes[i];
        char b = bytes[i + 1];
        if ((a == '\r' || a == '\n') && (b == '\r' || b == '\n'))
            return true; // "\r\n", "\n\r", "\n\n", "\r\r"
    }
    return false;
}

bool smtpNextRecipient(const char* list, size_t length, size_t* position, size_t* start, size_t* itemLength)
{
    if (list == nullptr || position == nullptr || start == nullptr || itemLength == nullptr)
        return false;
    size_t p = *position;
    for (;;) {
        while (p < length && (list[p] == ',' || list[p] == ';'))
            p++;
        if (p >= length || list[p] == '\0') {
            *position = p;
            return false;
        }
        size_t begin = p;
        while (p < length && list[p] != '\0' && list[p] != ',' && list[p] != ';')
            p++;
        *start = begin;
        *itemLength = p - begin;
        *position = p;
        return true;
    }
}

size_t smtpBuildData(const char* body, size_t bodyLength, char* out, size_t outSize)
{
    // Room kept at the end: the line end of an unfinished line, ".\r\n" and
    // the terminator byte.
    constexpr size_t OPEN_LINE_TAIL = 6;
    constexpr size_t CLOSED_LINE_TAIL = 4;
    if (out == nullptr || outSize < OPEN_LINE_TAIL) {
        if (out != nullptr && outSize > 0)
            out[0] = '\0';
        return 0;
    }
    size_t n = 0;
    bool lineStart = true;
    for (size_t i = 0; body != nullptr && i < bodyLength && body[i] != '\0'; i++) {
        char c = body[i];
        if (c == '\r' && i + 1 < bodyLength && body[i + 1] == '\n')
            continue; // a CR LF pair is one line end
        if (c == '\n') {
            if (n + 2 + CLOSED_LINE_TAIL > outSize)
                break;
            out[n++] = '\r';
            out[n++] = '\n';
            lineStart = true;
            continue;
        }
        // A line's leading "." is doubled so that no body line can end the data.
        size_t need = (lineStart && c == '.') ? 2 : 1;
        if (n + need + OPEN_LINE_TAIL > outSize)
            break;
        if (need == 2)
            out[n++] = '.';
        out[n++] = isControl(c) ? ' ' : c;
        lineStart = false;
    }
    if (!lineStart) {
        out[n++] = '\r';
        out[n++] = '\n';
    }
    memcpy(out + n, ".\r\n", 4);
    return n + 3;
}

int moxHostName(char* out)
{
    if (out == nullptr)
        return -1;
    out[0] = '\0';
    // Large enough for any host name; a smaller area makes gethostname fail
    // for long names.
    char name[65] = {};
    if (gethostname(name, sizeof name) != 0)
        return -1;
    name[sizeof name - 1] = '\0';
    smtpCopySanitized(out, MOX_HOST_NAME_SIZE, name, MOX_HOST_NAME_SIZE - 1);
    return 0;
}

void moxDefaultAddress(const char* hostName, char* out, size_t size)
{
    if (out == nullptr || size == 0)
        return;
    snprintf(out, size, "admin@%s", hostName != nullptr ? hostName : "");
}

int GetResponse(int sock, char* out, int size)
{
    if (sock < 0 || out == nullptr || size < 1)
        return -1;
    out[0] = '\0';
    char area[RECEIVE_SIZE];
    size_t received = 0;
    // One limit for the whole reply, however it is cut into pieces.
    const int64_t deadline = nowMs() + gs_limitMs.load();
    while (received < RECEIVE_SIZE - 1) {
        pollfd p{sock, POLLIN, 0};
        int r = poll(&p, 1, msLeft(deadline));
        if (r < 0 && errno == EINTR)
            continue;
        if (r <= 0)
            break;
        ssize_t got = recv(sock, area + received, RECEIVE_SIZE - 1 - received, 0);
        if (got < 0 && errno == EINTR)
            continue;
        if (got <= 0)
            break;
        received += static_cast<size_t>(got);
        area[received] = '\0';
        if (smtpHasLineEnd(area, received)) {
            size_t length = strnlen(area, received);
            if (length > static_cast<size_t>(size) - 1)
                length = static_cast<size_t>(size) - 1;
            memcpy(out, area, length);
            out[length] = '\0';
            return static_cast<int>(length);
        }
    }
    return 0;
}

int LogErrorMessageForMoxSendEmail(int errorClass, int step, int value, const char* message)
{
    char reason1[REASON_SIZE];
    char reason2[REASON_SIZE];
    char reason3[REASON_SIZE];
    char line[LOG_LINE_SIZE];
    snprintf(reason1, sizeof reason1, "%s", "Mox email alert was not sent");
    if (errorClass == 3)
        snprintf(reason2, sizeof reason2, "%s", "An invalid response was receieved or a command timed out");
    else
        snprintf(reason2, sizeof reason2, "%s", message != nullptr ? message : "");
    snprintf(reason3, sizeof reason3, "The last command returned the following values:%d, %d", step, value);
    switch (errorClass) {
    case 1:
        snprintf(line, sizeof line, "mox - Email Alert failed - sockets library error! Error Value=%d,Reason:%s %s %s\n",
                 value, reason1, reason2, reason3);
        break;
    case 2:
        snprintf(line, sizeof line,
                 "mox - Email Alert failed - smtp command failed in step[%d]!,ErrorCode:[%d], Reason: %s %s %s\n", step,
                 value, reason1, reason2, reason3);
        break;
    case 3:
        snprintf(line, sizeof line, "mox - Email Alert failed - command timeout!, Reason:%s %s %s\n", reason1, reason2,
                 reason3);
        break;
    default:
        return 0;
    }
    moxLog(LOG_INFO, "%s\n", line);
    return 0;
}

int _MoxSendEmail(EmailConfig* config)
{
    if (config == nullptr)
        return 0;
    Dialogue d;
    smtpCopySanitized(d.server, sizeof d.server, config->server, EMAIL_SERVER_SIZE - 1);

    d.sock = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (d.sock < 0)
        return fail(d, 1, 1, errno, "Unable to initialize socket for communication...Exiting");

    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(gs_smtpPort.load());
    in_addr_t dotted = inet_addr(d.server);
    if (dotted != INADDR_NONE) {
        address.sin_addr.s_addr = dotted;
    } else {
        hostent* host = gethostbyname(d.server);
        if (host == nullptr || host->h_addrtype != AF_INET || host->h_length != 4 || host->h_addr_list[0] == nullptr)
            return fail(d, 1, 2, host == nullptr ? h_errno : NO_ADDRESS, "Server name:[%s] not found...Exiting");
        memcpy(&address.sin_addr, host->h_addr_list[0], 4);
    }

    const unsigned limit = gs_limitMs.load();
    int connectError = connectWithin(d.sock, address, limit > INT_MAX ? INT_MAX : static_cast<int>(limit));
    if (connectError != 0)
        return fail(d, 1, 3, connectError, "Unable to connect to SMTP server[%s]");

    // No send may block for longer than the limit, whatever the server does.
    timeval sendLimit{static_cast<time_t>(limit / 1000), static_cast<suseconds_t>((limit % 1000) * 1000)};
    setsockopt(d.sock, SOL_SOCKET, SO_SNDTIMEO, &sendLimit, sizeof sendLimit);
    // One allowance for all the writability waits of the dialogue.
    d.allowanceMs = limit > INT_MAX ? INT_MAX : static_cast<int>(limit);

    if (!runStage(d, {220, 0, nullptr, 4, CONNECT_READ_FAILED, 5}))
        return 0;

    setCommand(d, "HELO ", d.server, EMAIL_SERVER_SIZE - 1, "\r\n");
    if (!runStage(d, {250, 6, "Unable to send HELO command to server:[%s]", 7, CONNECT_READ_FAILED, 8}))
        return 0;

    setCommand(d, "MAIL FROM:<", config->sender, EMAIL_SENDER_SIZE - 1, ">\r\n");
    if (!runStage(d, {250, 9, "A communication error occured while transmitting the from address ", 10, READ_FAILED,
                      11}))
        return 0;

    char recipients[EMAIL_RECIPIENTS_SIZE];
    size_t listLength =
        smtpCopySanitized(recipients, sizeof recipients, config->recipients, EMAIL_RECIPIENTS_SIZE - 1);
    size_t position = 0;
    size_t start = 0;
    size_t itemLength = 0;
    while (smtpNextRecipient(recipients, listLength, &position, &start, &itemLength)) {
        setCommand(d, "RCPT TO:<", recipients + start, itemLength, ">\r\n");
        if (!runStage(d, {250, 12, COMMUNICATION_ERROR, 13, READ_FAILED, 14}, RECIPIENT_WAITS))
            return 0;
    }

    setCommand(d, "DATA\r\n", "", 0, "");
    if (!runStage(d, {354, 15, COMMUNICATION_ERROR, 16, READ_FAILED, 17}))
        return 0;

    // The server answers nothing here: the read ends empty at its limit and
    // the 354 of the data stage still holds.
    setCommand(d, "SUBJECT:", config->subject, EMAIL_SUBJECT_SIZE - 1, "\r\n");
    if (!runStage(d, {354, 18, COMMUNICATION_ERROR, 19, READ_FAILED, 20}))
        return 0;

    size_t bodyLength = config->body != nullptr ? strnlen(config->body, EMAIL_BODY_SIZE - 1) : 0;
    d.commandLength = smtpBuildData(config->body, bodyLength, d.command, sizeof d.command);
    if (!runStage(d, {250, 21, COMMUNICATION_ERROR, 22, READ_FAILED, 23}))
        return 0;

    setCommand(d, "QUIT\r\n", "", 0, "");
    if (!runStage(d, {221, 24, COMMUNICATION_ERROR, 25, READ_FAILED, 26}))
        return 0;

    shutdown(d.sock, SHUT_RDWR);
    moxSleepMs(50);
    close(d.sock);
    return 1;
}
