// The alarm daemon's lock file, any bytes, against a private directory that
// stands in for /proc: process 4242 is "kobd", 4343 another program, every
// other id no process. The FIFO is a real one with a reader kept open here.
// A lock naming the peer gets one 28-byte record; nothing outside the paths
// is touched.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "base/log.h"
#include "events/dmi2kob.h"

namespace {

std::string dir, lock, fifo;
int reader = -1;

void writeFile(const std::string& p, const void* data, size_t size)
{
    FILE* f = fopen(p.c_str(), "wb");
    if (f == nullptr || fwrite(data, 1, size, f) != size || fclose(f) != 0)
        abort();
}

int initialise()
{
    char pattern[] = "/dev/shm/moxfuzzkobXXXXXX";
    if (mkdtemp(pattern) == nullptr)
        abort();
    dir = pattern;
    lock = dir + "/lock";
    fifo = dir + "/fifo";
    writeFile(dir + "/4242", "kobd\0-f\0", 8);
    writeFile(dir + "/4343", "kobdx\0", 6);
    moxSetLogHook([](int, const char*) {});
    return 0;
}

// A lock whose first word is this id (blanks before, a blank or the end after).
bool names(const uint8_t* data, size_t size, const char* id)
{
    std::string text(reinterpret_cast<const char*>(data), size);
    size_t at = text.find_first_not_of(" \t\n");
    return at != std::string::npos && text.compare(at, 4, id) == 0 &&
           (at + 4 == size || strchr(" \t\n", text[at + 4]) != nullptr);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    if (size > 256)
        return 0;
    struct stat st;
    if (stat(fifo.c_str(), &st) != 0 || !S_ISFIFO(st.st_mode)) {
        // A stale lock takes the FIFO with it: a new one and a new reader.
        if (reader >= 0)
            close(reader);
        if (mkfifo(fifo.c_str(), 0600) != 0 || (reader = open(fifo.c_str(), O_RDONLY | O_NONBLOCK)) < 0)
            abort();
    }
    writeFile(lock, data, size);
    SLKeyList keys{};
    uint32_t instance = 7;
    keys.count = 1;
    keys.keys[0].value = &instance;
    EventRecord record{};
    record.componentId = 3;
    record.groupId = 5;
    record.keyList = &keys;
    record.groupName = "Power Unit";
    int written = kobProcessAlarmAt(KobPaths{lock.c_str(), fifo.c_str(), (dir + "/%s").c_str(), 10}, &record);
    char got[64];
    ssize_t n = read(reader, got, sizeof got);
    if (written != (n < 0 ? 0 : n) || (written != 0 && written != 28))
        abort(); // what was reported is what the reader received, one record
    if (names(data, size, "4242") && (written != 28 || stat(lock.c_str(), &st) != 0))
        abort(); // the peer gets its record and keeps its lock
    if (names(data, size, "4343") && stat(lock.c_str(), &st) == 0)
        abort(); // a lock left by another program is stale
    if (stat((dir + "/4242").c_str(), &st) != 0 || stat((dir + "/4343").c_str(), &st) != 0)
        abort();
    return 0;
}
