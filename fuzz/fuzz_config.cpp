// The configuration file, any bytes, read by the daemon's reader. Without the
// option's name anywhere in the file (any case) the flag must not move.
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <unistd.h>

#include "actions/uxaction.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static const std::string path = "/dev/shm/moxfuzzcfg." + std::to_string(getpid());
    FILE* file = fopen(path.c_str(), "wb");
    if (file == nullptr || fwrite(data, 1, size, file) != size || fclose(file) != 0)
        abort();
    std::string text(reinterpret_cast<const char*>(data), size);
    for (char& c : text)
        c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
    uint32_t start = size > 0 ? data[0] & 1 : 0;
    bNotificationOnly = start;
    if (processCfgFile(path.c_str()) != 1)
        abort();
    unlink(path.c_str());
    if (text.find("notificationonly") == std::string::npos && bNotificationOnly != start)
        abort();
    return 0;
}
