// A small program run with the simulated driver preloaded. It drives the OBX
// interface and the system-control code as the daemon would, and meanwhile
// uses ordinary files, a pipe and a mapping, which must reach the C library.
//
//   obxprobe SCRATCH-FILE [PHYSICAL-ADDRESS]
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <unistd.h>

#include "hardware/sysaction.h"
#include "obx/obxapi.h"

int main(int argc, char** argv)
{
    if (argc < 2)
        return 2;
    const char* scratch = argv[1];

    int fd = open(scratch, O_RDWR | O_CREAT | O_TRUNC, 0600);
    const char text[] = "passed through";
    if (fd < 0 || write(fd, text, sizeof text) != static_cast<ssize_t>(sizeof text))
        return 3;
    void* mapped = mmap(nullptr, sizeof text, PROT_READ, MAP_SHARED, fd, 0);
    printf("file %s\n", mapped != MAP_FAILED && memcmp(mapped, text, sizeof text) == 0 ? "ok" : "failed");
    if (mapped != MAP_FAILED)
        munmap(mapped, sizeof text);
    close(fd);

    int pipeEnds[2];
    if (pipe(pipeEnds) != 0 || write(pipeEnds[1], "abc", 3) != 3)
        return 4;
    int waiting = 0;
    printf("pipe %s\n", ioctl(pipeEnds[0], FIONREAD, &waiting) == 0 && waiting == 3 ? "ok" : "failed");
    close(pipeEnds[0]);
    close(pipeEnds[1]);

    if (argc > 2) {
        void* memory = nullptr;
        uint32_t address = static_cast<uint32_t>(strtoul(argv[2], nullptr, 16));
        int result = MapPhysicalMemory(address, 4, &memory);
        printf("map %d", result);
        if (result == 0) {
            const auto* bytes = static_cast<const unsigned char*>(memory);
            printf(" %02x%02x%02x%02x", bytes[0], bytes[1], bytes[2], bytes[3]);
            UnmapPhysicalMemory(memory, 4);
        }
        printf("\n");
    }
    printf("reset %d\n", MoxInitiateSystemControlAction(1, 200));
    printf("class 0x%02x\n", GetIpmiVersion());
    fflush(stdout);
    // Leave the simulated watchdog time to run out.
    usleep(500000);
    return 0;
}
