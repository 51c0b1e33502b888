// A minimal alarm daemon: writes its process id into the lock file, makes the
// FIFO, and prints every 28-byte alarm record it reads from it, one line each.
//
//   kobd [-l lockfile] [-f fifo] [-n count]
//
// Stops after `count` records when given, else on SIGTERM or SIGINT, removing
// its lock file and FIFO.
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace {

volatile sig_atomic_t stop = 0;

void onSignal(int)
{
    stop = 1;
}

uint32_t word(const unsigned char* at)
{
    uint32_t value;
    memcpy(&value, at, 4);
    return value;
}

} // namespace

int main(int argc, char** argv)
{
    const char* lockFile = "/var/run/kobLock";
    const char* fifo = "/dev/kob";
    long limit = -1;
    int opt;
    while ((opt = getopt(argc, argv, "l:f:n:")) != -1) {
        switch (opt) {
        case 'l': lockFile = optarg; break;
        case 'f': fifo = optarg; break;
        case 'n': limit = strtol(optarg, nullptr, 10); break;
        default:
            fprintf(stderr, "usage: kobd [-l lockfile] [-f fifo] [-n count]\n");
            return 2;
        }
    }
    struct sigaction action {};
    action.sa_handler = onSignal;
    sigaction(SIGTERM, &action, nullptr);
    sigaction(SIGINT, &action, nullptr);

    unlink(fifo);
    if (mkfifo(fifo, 0600) != 0) {
        fprintf(stderr, "kobd: cannot make %s: %s\n", fifo, strerror(errno));
        return 1;
    }
    // The lock appears complete (written aside, then renamed): a reader never
    // sees it empty, which it would take for a stale lock.
    std::string partial = std::string(lockFile) + ".new";
    FILE* lock = fopen(partial.c_str(), "w");
    if (lock == nullptr || fprintf(lock, "%d\n", static_cast<int>(getpid())) < 0 || fclose(lock) != 0 ||
        rename(partial.c_str(), lockFile) != 0) {
        fprintf(stderr, "kobd: cannot write %s: %s\n", lockFile, strerror(errno));
        unlink(partial.c_str());
        unlink(fifo);
        return 1;
    }
    printf("kobd: pid %d, reading %s\n", static_cast<int>(getpid()), fifo);
    fflush(stdout);

    long seen = 0;
    while (!stop && (limit < 0 || seen < limit)) {
        int fd = open(fifo, O_RDONLY);
        if (fd < 0) {
            if (errno == EINTR)
                continue;
            break;
        }
        unsigned char record[28];
        ssize_t got;
        while (!stop && (got = read(fd, record, sizeof record)) > 0) {
            if (got != sizeof record) {
                printf("kobd: short record of %zd bytes\n", got);
                continue;
            }
            printf("alarm ");
            for (unsigned char byte : record)
                printf("%02x", byte);
            printf(" type=%u component=%u group=%u eventGroup=%u severity=%u instance=%u power=%u\n",
                   record[0], word(record + 4), word(record + 8), word(record + 12), word(record + 16),
                   word(record + 20), record[24]);
            fflush(stdout);
            if (limit >= 0 && ++seen >= limit)
                break;
        }
        close(fd);
    }
    unlink(lockFile);
    unlink(fifo);
    return 0;
}
