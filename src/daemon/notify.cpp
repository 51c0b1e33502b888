#include "daemon/notify.h"

#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

void moxNotify(const char* message)
{
    const char* path = getenv("NOTIFY_SOCKET");
    if (path == nullptr || message == nullptr)
        return;
    size_t length = strlen(path);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    // An address beginning with "@" is in the abstract namespace: NUL first.
    if ((path[0] != '/' && path[0] != '@') || length < 2 || length > sizeof address.sun_path)
        return;
    if (path[0] != '@' && length == sizeof address.sun_path)
        return; // no room for the terminator
    memcpy(address.sun_path, path, length);
    if (path[0] == '@')
        address.sun_path[0] = '\0';
    socklen_t size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length + (path[0] == '/' ? 1 : 0));
    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return;
    // Never block the daemon on a manager that does not read.
    sendto(fd, message, strlen(message), MSG_NOSIGNAL | MSG_DONTWAIT, reinterpret_cast<sockaddr*>(&address), size);
    close(fd);
}
