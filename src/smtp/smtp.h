// SMTP client of the e-mail alerts.
//
// _MoxSendEmail delivers one composed alert over a fixed, strictly sequential
// dialogue on TCP port 25: greeting, HELO, MAIL FROM, one RCPT TO per
// recipient, DATA, the subject line, the body with its terminator, QUIT. Every
// stage expects one exact reply code; the first deviation ends the attempt with
// one system-log line (LogErrorMessageForMoxSendEmail) and one line on standard
// error. There is no retry and no queue.
//
// What the client guarantees about its input, whoever composed it:
// - every text is read only up to its slot size less one, so a slot without a
//   terminator is cut, never overrun;
// - control bytes (every byte below 0x20, CR and LF among them) in the server,
//   sender, recipient and subject texts are sent as blanks, and so are the
//   server texts that appear in log lines and on standard error;
// - in the body, a line feed (or a CR LF pair) is a line end and goes out as
//   CR LF; every other control byte is sent as a blank; a line beginning with
//   "." gets a second "." (the receiver removes it); the body is followed by
//   ".\r\n", so the data ends with the one standard CR LF . CR LF.
// A line feed inside a text that the composer copies into the body from DMI
// would therefore become a line end: the composer passes such texts through
// smtpSanitize before it appends them to the body.
#pragma once

#include <cstddef>
#include <cstdint>

// Sizes of the five slots of EmailConfig, terminator included.
enum : size_t {
    EMAIL_SERVER_SIZE = 125,
    EMAIL_SENDER_SIZE = 125,
    EMAIL_RECIPIENTS_SIZE = 125,
    EMAIL_SUBJECT_SIZE = 255,
    EMAIL_BODY_SIZE = 1024,
};

// One alert: five zero-filled heap texts, in this order.
struct EmailConfig {
    char* server;     // host name or dotted IPv4 address
    char* sender;     // envelope sender
    char* recipients; // addresses separated by "," or ";"
    char* subject;
    char* body;       // lines ended by a line feed
};

// Runs the whole dialogue for one alert. Returns 1 when every stage succeeded,
// 0 otherwise (the failure has then been logged and written to standard error).
// The recipient list is not changed.
int _MoxSendEmail(EmailConfig* config);

// One step of a dialogue as an observer sees it: a stage that passed
// (errorClass 0, step the stage's last step number) or the step that failed
// (errorClass, step and value as given to LogErrorMessageForMoxSendEmail).
struct SmtpStep {
    int step;
    const char* name;    // the stage: "greeting", "HELO", "MAIL FROM", ...
    int errorClass;      // 0 passed; 1 socket call, 2 reply code, 3 no reply
    int value;           // the reply code, or the failure's value
    const char* reply;   // the server's reply as read ("" when none)
    const char* message; // the failure message; null when the stage passed
};
using SmtpObserver = void (*)(void* context, const SmtpStep& step);

// _MoxSendEmail with an observer called on the calling thread after every
// stage that passed and at the failure, if any.
int smtpSendObserved(EmailConfig* config, SmtpObserver observer, void* context);

// The stage a step number belongs to ("connect" for steps 1 to 3).
const char* smtpStepName(int step);

// Reads one reply of at most 1023 bytes within the reply limit (8 seconds over
// the whole reply). Returns the length of the text placed in out (at most
// size - 1), 0 when no complete line arrived, -1 for invalid arguments.
int GetResponse(int sock, char* out, int size);

// Logs the failure of a step at LOG_INFO. errorClass: 1 socket-library call
// failed (value: error number or resolver code), 2 unexpected reply code
// (value: the code), 3 no reply (value 0). Returns 0.
int LogErrorMessageForMoxSendEmail(int errorClass, int step, int value, const char* message);

// Replaces every byte below 0x20 of a terminated text by a blank, in place.
// For DMI-sourced texts that the composer puts into the subject or body.
void smtpSanitize(char* text);

// The local host name, cut at 48 characters, control bytes as blanks, into
// out (at least 49 bytes). Returns 0, or -1 when gethostname fails.
enum : size_t { MOX_HOST_NAME_SIZE = 49 };
int moxHostName(char* out);

// The default address "admin@" and the host name, cut to fit out.
void moxDefaultAddress(const char* hostName, char* out, size_t size);

// Byte-level rules of the dialogue, free of I/O.

// The reply code of a reply text: white space skipped, an optional sign,
// decimal digits (saturated at the int range). Without digits the previous
// code is kept.
int smtpReplyCode(const char* reply, int previous);

// Whether the bytes hold "\r\n", "\n\r", "\n\n" or "\r\r" anywhere (embedded
// NUL bytes included).
bool smtpHasLineEnd(const char* bytes, size_t length);

// Finds the next recipient of a list at or after *position: items are
// separated by "," or ";", empty items are skipped, blanks are kept. Stops at
// the terminator or after length bytes. Gives the item's start and length and
// moves *position past it; returns false when no item is left.
bool smtpNextRecipient(const char* list, size_t length, size_t* position, size_t* start, size_t* itemLength);

// Builds the data sent after the subject line: the body's first bodyLength
// bytes (less if a terminator comes first) converted as described above,
// followed by ".\r\n". What does not fit out is cut at a line boundary or
// within the line, never inside a CR LF; out is always terminated and always
// ends with the terminator (outSize must be at least 6). Returns the length.
size_t smtpBuildData(const char* body, size_t bodyLength, char* out, size_t outSize);

// Copies at most maxLength bytes of a text into out (cut to fit, terminated),
// control bytes as blanks. Returns the length copied.
size_t smtpCopySanitized(char* out, size_t outSize, const char* text, size_t maxLength);

// Test seam: the port the dialogue connects to (25) and the length in
// milliseconds of the reply limit and the writability allowance (8000).
void smtpSetPort(uint16_t port);
void smtpSetLimitMs(unsigned milliseconds);
// Test seam: replaces the writability wait (the socket, the milliseconds the
// wait may take; true when the socket became writable). Null restores poll.
using SmtpWritableHook = bool (*)(int sock, int timeoutMs);
void smtpSetWritableHook(SmtpWritableHook hook);
