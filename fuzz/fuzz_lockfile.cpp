// The alarm daemon's lock file, any bytes, against a private directory that
// stands in for /proc: process 4242 is "kobd" (a regular file stands in for
// the FIFO), process 4343 is another program, every other id is no process.
// The hand-off must send a record only for the peer, remove the files only
// for a stale lock, and never touch anything outside its paths.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "base/log.h"
#include "events/dmi2kob.h"

namespace {

std::string dir, lock, fifo, cmdline;

void writeFile(const std::string& p, const void* data, size_t size)
{
    FILE* f = fopen(p.c_str(), "wb");
    if (f == nullptr)
        abort();
    fwrite(data, 1, size, f);
    fclose(f);
}

bool exists(const std::string& p)
{
    struct stat st;
    return stat(p.c_str(), &st) == 0;
}

int initialise()
{
    char pattern[] = "/dev/shm/moxfuzzkobXXXXXX";
    if (mkdtemp(pattern) == nullptr)
        abort();
    dir = pattern;
    lock = dir + "/lock";
    fifo = dir + "/fifo";
    cmdline = dir + "/%s";
    writeFile(dir + "/4242", "kobd\0-f\0", 8);
    writeFile(dir + "/4343", "kobdx\0", 6);
    moxSetLogHook([](int, const char*) {});
    return 0;
}

// The first whitespace-separated word of the lock, as fscanf "%19s" reads it.
std::string firstWord(const uint8_t* data, size_t size)
{
    size_t at = 0;
    while (at < size && strchr(" \t\n\v\f\r", data[at]) != nullptr && data[at] != '\0')
        ++at;
    std::string word;
    while (at < size && word.size() < 19 && (data[at] == '\0' || strchr(" \t\n\v\f\r", data[at]) == nullptr))
        word += static_cast<char>(data[at++]);
    return word;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    if (size > 256)
        return 0;
    writeFile(lock, data, size);
    writeFile(fifo, "", 0);
    SLKeyList keys{};
    uint32_t instance = 7;
    keys.count = 1;
    keys.keys[0].value = &instance;
    EventRecord record{};
    record.componentId = 3;
    record.groupId = 5;
    record.keyList = &keys;
    record.groupName = "Power Unit";
    KobPaths paths{lock.c_str(), fifo.c_str(), cmdline.c_str(), 10};
    int written = kobProcessAlarmAt(paths, &record);

    // The C string ends at a NUL inside the word.
    std::string word = firstWord(data, size);
    word = word.substr(0, word.find('\0'));
    bool peer = word == "4242";
    bool stale = word == "4343" || word.empty() || word.find_first_not_of("0123456789") != std::string::npos;
    if (peer) {
        struct stat st;
        if (written != 28 || stat(fifo.c_str(), &st) != 0 || st.st_size != 28 || !exists(lock))
            abort();
    } else if (written != 0) {
        abort();
    }
    if (stale == exists(lock) && !peer)
        abort(); // a stale lock is removed, any other is left alone
    if (!exists(dir + "/4242") || !exists(dir + "/4343"))
        abort();
    return 0;
}
