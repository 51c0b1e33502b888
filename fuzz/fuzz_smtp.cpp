// Replies of a hostile SMTP server. The bytes arrive on a socket in the
// pieces the first byte chooses and are read by GetResponse with its line
// rule; the reply code is scanned from what it passes on. The same bytes
// also drive the pure rules: the line-end test, the recipient split and the
// data builder, each against its documented guarantees.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <sys/socket.h>
#include <unistd.h>

#include "smtp/smtp.h"

namespace {

int initialise()
{
    smtpSetLimitMs(50);
    return 0;
}

bool naiveLineEnd(const uint8_t* b, size_t n)
{
    for (size_t i = 0; i + 1 < n; ++i) {
        char a = static_cast<char>(b[i]), c = static_cast<char>(b[i + 1]);
        if ((a == '\r' || a == '\n') && (c == '\r' || c == '\n'))
            return true;
    }
    return false;
}

void reply(const uint8_t* data, size_t size)
{
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0)
        return;
    size_t piece = size == 0 ? 1 : (data[0] % 64) + 1;
    for (size_t at = 0; at < size; at += piece) {
        size_t n = size - at < piece ? size - at : piece;
        if (send(pair[1], data + at, n, MSG_NOSIGNAL) != static_cast<ssize_t>(n))
            break;
    }
    shutdown(pair[1], SHUT_WR);
    char out[1024];
    int length = GetResponse(pair[0], out, sizeof out);
    if (length < 0 || length > 1023 || strlen(out) != static_cast<size_t>(length))
        abort();
    // A reply is passed on only when the bytes received (at most 1023) hold a line end.
    if (length > 0 && !naiveLineEnd(data, size < 1023 ? size : 1023))
        abort();
    int code = smtpReplyCode(out, 354);
    if (length == 0 && code != 354)
        abort(); // an empty reply keeps the previous code
    close(pair[0]);
    close(pair[1]);
}

void rules(const uint8_t* data, size_t size)
{
    const char* bytes = reinterpret_cast<const char*>(data);
    if (smtpHasLineEnd(bytes, size) != naiveLineEnd(data, size))
        abort();
    std::string text(bytes, size);
    size_t position = 0, start = 0, length = 0, items = 0;
    while (smtpNextRecipient(text.c_str(), text.size(), &position, &start, &length)) {
        if (length == 0 || start + length > text.size() || position > text.size() || ++items > text.size())
            abort();
        for (size_t i = start; i < start + length; ++i) {
            if (text[i] == ',' || text[i] == ';' || text[i] == '\0')
                abort();
        }
    }
    size_t outSize = 6 + (size == 0 ? 0 : data[0] % 200);
    char out[256 + 6];
    size_t built = smtpBuildData(text.c_str(), text.size(), out, outSize);
    if (built >= outSize || strlen(out) != built || built < 3 || memcmp(out + built - 3, ".\r\n", 3) != 0)
        abort();
    for (size_t i = 0; i < built; ++i) {
        unsigned char c = static_cast<unsigned char>(out[i]);
        bool crlf = (c == '\r' && out[i + 1] == '\n') || (c == '\n' && i > 0 && out[i - 1] == '\r');
        if (c < 0x20 && !crlf)
            abort(); // a bare control byte reached the data
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    if (size > 4096)
        return 0;
    reply(data, size);
    rules(data, size);
    return 0;
}
