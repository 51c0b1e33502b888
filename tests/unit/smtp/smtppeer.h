// The one scripted SMTP peer of the tests. On 127.0.0.1 it accepts one
// connection; for each step of its script it waits until the bytes received
// since the previous step hold the step's text, then sends the step's reply.
// It records everything it receives until the client closes.
#pragma once

#include <arpa/inet.h>
#include <poll.h>
#include <string>
#include <thread>
#include <unistd.h>
#include <vector>

#include "base/log.h"
#include "base/sleep.h"

using PeerScript = std::vector<std::pair<std::string, std::string>>; // awaited text, reply

class ScriptedServer {
public:
    explicit ScriptedServer(PeerScript script)
    {
        sockaddr_in address{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
        socklen_t length = sizeof address;
        listener_ = socket(AF_INET, SOCK_STREAM, 0);
        bind(listener_, reinterpret_cast<sockaddr*>(&address), length);
        listen(listener_, 1);
        getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &length);
        port_ = ntohs(address.sin_port);
        thread_ = std::thread([this, script] { run(script); });
    }
    ~ScriptedServer() { received(), close(listener_); }
    uint16_t port() const { return static_cast<uint16_t>(port_); }
    const std::string& received() { return thread_.joinable() ? thread_.join(), received_ : received_; }

private:
    // Waits for bytes within a 10-second guard; false at the end of the stream.
    bool readSome(int fd)
    {
        pollfd p{fd, POLLIN, 0};
        char buffer[4096];
        ssize_t got = poll(&p, 1, 10000) > 0 ? recv(fd, buffer, sizeof buffer, 0) : 0;
        received_.append(buffer, got > 0 ? static_cast<size_t>(got) : 0);
        return got > 0;
    }
    void run(const PeerScript& script)
    {
        pollfd p{listener_, POLLIN, 0};
        int fd = poll(&p, 1, 10000) > 0 ? accept(listener_, nullptr, nullptr) : -1;
        size_t cursor = 0, found = 0;
        for (const auto& [awaited, reply] : script) {
            while (fd >= 0 && (found = received_.find(awaited, cursor)) == std::string::npos)
                if (!readSome(fd))
                    return (void)close(fd);
            cursor = found + awaited.size();
            send(fd, reply.data(), reply.size(), MSG_NOSIGNAL);
        }
        while (fd >= 0 && readSome(fd)) {}
        close(fd);
    }
    int listener_ = -1, port_ = 0;
    std::thread thread_;
    std::string received_;
};

// Accepts everything; answers nothing to the subject line.
inline PeerScript acceptingScript(int recipients)
{
    PeerScript s = {{"", "220 mx.test ESMTP\r\n"}, {"\r\n", "250 mx.test\r\n"}, {"\r\n", "250 2.1.0 Ok\r\n"}};
    s.insert(s.end(), recipients, {"\r\n", "250 2.1.5 Ok\r\n"});
    s.insert(s.end(), {{"DATA\r\n", "354 End data\r\n"}, {"\r\n.\r\n", "250 2.0.0 Ok\r\n"}, {"QUIT\r\n", "221 Bye\r\n"}});
    return s;
}

// The system log and the sleeps, captured (the client logs on the caller's thread).
struct LogCapture {
    static inline std::vector<std::pair<int, std::string>> lines;
    static void hook(int priority, const char* text) { lines.emplace_back(priority, text); }
    static std::vector<std::pair<int, std::string>> take() { return std::exchange(lines, {}); }
};
struct SleepCapture { static inline std::vector<unsigned> sleeps; static void hook(unsigned ms) { sleeps.push_back(ms); } };
