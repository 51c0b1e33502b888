// Delivers alerts to real SMTP servers from Debian's packages started on
// loopback (python3-aiosmtpd, and a private postfix instance), and reads back
// what they stored.
#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <poll.h>
#include <sstream>
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "smtp_test_support.h"

namespace {

const char PYTHON[] = "/usr/bin/python3";

class LoopbackServer {
public:
    explicit LoopbackServer(const std::string& folder)
    {
        int out[2];
        if (pipe(out) != 0)
            return;
        pid_ = fork();
        if (pid_ == 0) {
            dup2(out[1], 1);
            close(out[0]);
            close(out[1]);
            execl(PYTHON, PYTHON, MOX_SMTPD_SCRIPT, folder.c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        close(out[1]);
        std::string line;
        pollfd p{out[0], POLLIN, 0};
        char c;
        while (line.find('\n') == std::string::npos && poll(&p, 1, 10000) > 0 && read(out[0], &c, 1) == 1)
            line += c;
        close(out[0]);
        port_ = static_cast<uint16_t>(atoi(line.c_str()));
    }
    ~LoopbackServer()
    {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, nullptr, 0);
        }
    }
    uint16_t port() const { return port_; }

private:
    pid_t pid_ = -1;
    uint16_t port_ = 0;
};

std::string readFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

using SmtpDelivery = SmtpTest;

TEST_F(SmtpDelivery, AlertIsStoredByARealServer)
{
    std::string probe = std::string(PYTHON) + " -c 'import aiosmtpd' 2>/dev/null";
    if (system(probe.c_str()) != 0)
        GTEST_SKIP() << "python3-aiosmtpd is not installed: the delivery to a real SMTP server is not checked";

    struct Case {
        const char* name;
        std::string body;   // as composed: lines ended by a bare line feed
        std::string stored; // the data as the server keeps it
    } cases[] = {
        {"alert", "Check Fan 1 at server alpha\nEvent Type:Warning\nEvent Severity:Critical\n"
                  "Component:Baseboard\nGroup:Fan 1\nInstance:CPU 1\n",
         "SUBJECT:Zorek Server Management Alert:alpha\r\nCheck Fan 1 at server alpha\r\nEvent Type:Warning\r\n"
         "Event Severity:Critical\r\nComponent:Baseboard\r\nGroup:Fan 1\r\nInstance:CPU 1\r\n"},
        // A body line of one "." reaches the server as text, not as the end.
        {"dot line", "Check x\n.\nafter the dot\n",
         "SUBJECT:Zorek Server Management Alert:alpha\r\nCheck x\r\n.\r\nafter the dot\r\n"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        char pattern[] = "/tmp/moxsmtpXXXXXX";
        std::string folder = mkdtemp(pattern);
        LoopbackServer server(folder);
        ASSERT_NE(server.port(), 0) << "the loopback SMTP server did not start";

        Alert alert("127.0.0.1", "mox@alpha.example", "ops@example.org;boss@example.org",
                    "Zorek Server Management Alert:alpha", c.body);
        Outcome out = runDialogue(alert, server.port());
        // 1 means the data was answered with 250 and QUIT with 221.
        EXPECT_EQ(out.result, 1);
        EXPECT_EQ(out.standardError, "");
        EXPECT_TRUE(LogCapture::take().empty());

        EXPECT_EQ(readFile(folder + "/message1"),
                  "MAIL FROM:mox@alpha.example\nRCPT TO:ops@example.org\nRCPT TO:boss@example.org\n\n" + c.stored);
        struct stat info{};
        EXPECT_NE(stat((folder + "/message2").c_str(), &info), 0) << "a second message was stored";
        unlink((folder + "/message1").c_str());
        rmdir(folder.c_str());
    }
}

// The MTA that refuses the bare line feeds of an alert body and takes the
// second "." of a doubled terminator for a command. The alert must be
// accepted (250 after the data, 221 for QUIT) and held in its queue whole.
std::string commandOutput(const std::string& command)
{
    std::string text;
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr)
        return text;
    char buffer[4096];
    size_t n;
    while ((n = fread(buffer, 1, sizeof buffer, pipe)) > 0)
        text.append(buffer, n);
    pclose(pipe);
    return text;
}

uint16_t freeLoopbackPort()
{
    int s = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    bind(s, reinterpret_cast<sockaddr*>(&address), sizeof address);
    socklen_t length = sizeof address;
    getsockname(s, reinterpret_cast<sockaddr*>(&address), &length);
    close(s);
    return ntohs(address.sin_port);
}

bool acceptsConnections(uint16_t port)
{
    int s = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    bool ok = connect(s, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
    close(s);
    return ok;
}

TEST_F(SmtpDelivery, AlertIsAcceptedAndHeldByPostfix)
{
    struct stat info{};
    if (stat("/usr/sbin/postfix", &info) != 0)
        GTEST_SKIP() << "postfix is not installed: the delivery to a real MTA is not checked";
    if (geteuid() != 0)
        GTEST_SKIP() << "a private postfix instance needs root: the delivery to a real MTA is not checked";

    char pattern[] = "/tmp/moxpostfixXXXXXX";
    std::string folder = mkdtemp(pattern);
    chmod(folder.c_str(), 0755);
    uint16_t port = freeLoopbackPort();
    pid_t instance = fork();
    if (instance == 0) {
        std::string log = folder + "/log";
        FILE* out = freopen(log.c_str(), "w", stdout);
        (void)out;
        execl("/bin/bash", "bash", MOX_POSTFIX_SCRIPT, folder.c_str(), std::to_string(port).c_str(),
              static_cast<char*>(nullptr));
        _exit(127);
    }
    bool up = false;
    for (int i = 0; i < 150 && !up; i++) {
        up = acceptsConnections(port);
        if (!up)
            usleep(100000);
    }

    Outcome out{};
    std::string held;
    if (up) {
        Alert alert("127.0.0.1", "mox@alpha.example", "ops@example.org;boss@example.org",
                    "Zorek Server Management Alert:alpha",
                    "Check Fan 1 at server alpha\nEvent Type:Warning\nInstance:CPU 1\n");
        out = runDialogue(alert, port);
        // The held queue file, envelope and content, as postcat shows it.
        std::string etc = folder + "/etc";
        for (int i = 0; i < 50 && held.find("Instance:CPU 1") == std::string::npos; i++) {
            held = commandOutput("for f in " + folder + "/queue/hold/*; do [ -f \"$f\" ] && /usr/sbin/postcat -c " + etc +
                                 " -e -h -b \"$f\"; done 2>/dev/null");
            if (held.find("Instance:CPU 1") == std::string::npos)
                usleep(100000);
        }
    }
    commandOutput("/usr/sbin/postfix -c " + folder + "/etc stop 2>&1");
    waitpid(instance, nullptr, 0);
    std::string log = readFile(folder + "/log");
    commandOutput("rm -rf " + folder);

    ASSERT_TRUE(up) << "postfix did not start:\n" << log;
    EXPECT_EQ(out.result, 1) << log;
    EXPECT_EQ(out.standardError, "");
    EXPECT_TRUE(LogCapture::take().empty());
    EXPECT_EQ(log.find("non-SMTP command"), std::string::npos) << log;
    EXPECT_NE(held.find("sender: mox@alpha.example\n"), std::string::npos) << held;
    EXPECT_NE(held.find("recipient: ops@example.org\n"), std::string::npos) << held;
    EXPECT_NE(held.find("recipient: boss@example.org\n"), std::string::npos) << held;
    EXPECT_NE(held.find("SUBJECT:Zorek Server Management Alert:alpha\n"), std::string::npos) << held;
    EXPECT_NE(held.find("\nCheck Fan 1 at server alpha\nEvent Type:Warning\nInstance:CPU 1\n"), std::string::npos)
        << held;
}

} // namespace
