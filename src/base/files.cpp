#include "base/files.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

int openNonBlocking(const char* path)
{
    return open(path, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
}

} // namespace

FILE* moxOpenRegular(const char* path)
{
    int fd = openNonBlocking(path);
    if (fd < 0)
        return nullptr;
    struct stat status;
    if (fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
        close(fd);
        errno = EINVAL;
        return nullptr;
    }
    // Reads of a regular file do not block; the flag is dropped for clarity.
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) & ~O_NONBLOCK);
    FILE* file = fdopen(fd, "r");
    if (file == nullptr)
        close(fd);
    return file;
}

bool moxCanOpen(const char* path)
{
    int fd = openNonBlocking(path);
    if (fd < 0)
        return false;
    close(fd);
    return true;
}
