// Replies of a hostile SMTP server, and the same bytes as a recipient list and
// a mail body. The reply arrives on a socket in the pieces the first byte
// chooses and is read by GetResponse; the list is split into recipients; the
// body is built into the data, which must never carry a bare control byte.
// The reply is written from a thread of its own: written first, a reply in
// one-byte pieces would fill the socket buffer and wait for ever on a reader
// that never starts; the reader closing its end releases the writer.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

#include "smtp/smtp.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = (smtpSetLimitMs(50), 0);
    (void)once;
    int pair[2];
    if (size > 4096 || socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0)
        return 0;
    size_t piece = size == 0 ? 1 : (data[0] % 64) + 1;
    std::thread writer([&] {
        for (size_t at = 0; at < size; at += piece)
            if (send(pair[1], data + at, size - at < piece ? size - at : piece, MSG_NOSIGNAL) < 0)
                break;
        shutdown(pair[1], SHUT_WR);
    });
    char reply[1024];
    int length = GetResponse(pair[0], reply, sizeof reply);
    close(pair[0]);
    writer.join();
    close(pair[1]);
    if (length < 0 || length > 1023 || strlen(reply) != static_cast<size_t>(length))
        abort();
    if (length == 0 && smtpReplyCode(reply, 354) != 354)
        abort(); // an empty reply keeps the previous code

    const std::string text(reinterpret_cast<const char*>(data), size);
    size_t position = 0, start = 0, item = 0;
    while (smtpNextRecipient(text.c_str(), text.size(), &position, &start, &item)) {
        if (item == 0 || start + item > text.size() || position > text.size() ||
            text.substr(start, item).find_first_of(std::string(",;\0", 3)) != std::string::npos)
            abort();
    }
    char out[256 + 6];
    size_t outSize = 6 + (size == 0 ? 0 : data[0] % 200);
    size_t built = smtpBuildData(text.c_str(), text.size(), out, outSize);
    if (built >= outSize || strlen(out) != built || built < 3 || memcmp(out + built - 3, ".\r\n", 3) != 0)
        abort();
    for (size_t i = 0; i < built; ++i) {
        bool crlf = (out[i] == '\r' && out[i + 1] == '\n') || (out[i] == '\n' && i > 0 && out[i - 1] == '\r');
        if (static_cast<unsigned char>(out[i]) < 0x20 && !crlf)
            abort(); // a bare control byte reached the data
    }
    return 0;
}
