// The configuration file, any bytes. The flag must come out as a plain
// model of the rule says: the file is read in pieces of at most 499 bytes
// ending at a line feed; a piece starting with "#" is skipped; a piece that
// holds "notificationonly" (any case, up to its first NUL) sets the flag to
// whether it also holds "true".
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <unistd.h>

#include "actions/uxaction.h"

namespace {

std::string path;

uint32_t model(const uint8_t* data, size_t size, uint32_t flag)
{
    size_t at = 0;
    while (at < size) {
        size_t end = at;
        while (end < size && end - at < 499 && data[end] != '\n')
            ++end;
        if (end < size && end - at < 499)
            ++end; // the line feed belongs to the piece
        std::string piece(reinterpret_cast<const char*>(data + at), end - at);
        at = end;
        piece = piece.substr(0, piece.find('\0'));
        if (!piece.empty() && piece[0] == '#')
            continue;
        for (char& c : piece)
            c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
        if (piece.find("notificationonly") != std::string::npos)
            flag = piece.find("true") != std::string::npos ? 1 : 0;
    }
    return flag;
}

int initialise()
{
    char pattern[] = "/dev/shm/moxfuzzcfgXXXXXX";
    int fd = mkstemp(pattern);
    if (fd < 0)
        abort();
    close(fd);
    path = pattern;
    atexit([] { unlink(path.c_str()); });
    return 0;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    FILE* file = fopen(path.c_str(), "wb");
    if (file == nullptr)
        abort();
    fwrite(data, 1, size, file);
    fclose(file);
    uint32_t start = size > 0 ? data[0] & 1 : 0;
    bNotificationOnly = start;
    if (processCfgFile(path.c_str()) != 1)
        abort();
    if (bNotificationOnly != model(data, size, start))
        abort();
    return 0;
}
