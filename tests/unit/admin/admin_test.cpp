#include <gtest/gtest.h>

#include <cstddef>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "actions/actionlog.h"
#include "base/log.h"
#include "daemon/notify.h"

namespace {

std::string logged;

// One datagram per message to an abstract address; nothing without the variable.
TEST(Admin, NotifySocket)
{
    const std::string name = "@moxnotify." + std::to_string(getpid());
    int fd = socket(AF_UNIX, SOCK_DGRAM, 0);
    sockaddr_un a{AF_UNIX, {}};
    memcpy(a.sun_path + 1, name.data() + 1, name.size() - 1);
    ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&a), offsetof(sockaddr_un, sun_path) + name.size()), 0);
    for (bool set : {true, false}) {
        set ? setenv("NOTIFY_SOCKET", name.c_str(), 1) : unsetenv("NOTIFY_SOCKET");
        moxNotify("STATUS=Handling events");
        moxNotify("READY=1");
        char message[64];
        std::string received;
        for (ssize_t n; (n = recv(fd, message, sizeof message, MSG_DONTWAIT)) > 0;)
            received += std::string(message, static_cast<size_t>(n)) + "|";
        EXPECT_EQ(received, set ? "STATUS=Handling events|READY=1|" : "");
    }
    close(fd);
}

// Off by default: no line. On: the action and the event, DMI texts cleaned.
TEST(Admin, SystemControlLines)
{
    EventRecord record{};
    record.groupName = "Fan\nSpeed";
    moxSetLogHook([](int priority, const char* text) { logged += std::to_string(priority) + ":" + text; });
    struct Case { uint32_t on, code; bool skipped; const char* line; } cases[] = {
        {0, 1, false, ""}, {1, 1, false, "5:mox action: reset ordered for event Fan Speed of Unknown Component\n"},
        {1, 8, true, "5:mox action: NMI skipped for event Fan Speed of Unknown Component: notifications only\n"}};
    for (const Case& c : cases) {
        logged.clear();
        bActionLog = c.on;
        actionLogSystemControl(c.code, &record, c.skipped);
        EXPECT_EQ(logged, c.line);
    }
    bActionLog = 0;
    moxSetLogHook(nullptr);
}

} // namespace
