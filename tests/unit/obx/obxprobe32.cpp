// Uses /dev/obx through the 32-bit offset calls (open, mmap), as a program
// built without large-file support would; the preload library must serve
// those entry points as well.
//
//   obxprobe32 PHYSICAL-ADDRESS
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

static_assert(sizeof(off_t) == 4, "built without large-file support");

int main(int argc, char** argv)
{
    if (argc < 2)
        return 2;
    off_t address = static_cast<off_t>(strtoul(argv[1], nullptr, 16));
    int fd = open("/dev/obx", O_RDONLY);
    if (fd < 0)
        return 3;
    void* writable = mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_SHARED, fd, address);
    printf("writable %s\n", writable == MAP_FAILED && errno == EACCES ? "refused" : "mapped");
    void* mapped = mmap(nullptr, 4096, PROT_READ, MAP_SHARED, fd, address);
    if (mapped == MAP_FAILED)
        return 4;
    printf("byte %02x\n", static_cast<const unsigned char*>(mapped)[1]);
    munmap(mapped, 4096);
    printf("close %d\n", close(fd));
    printf("close again %d\n", close(fd)); // the descriptor is gone
    return 0;
}
