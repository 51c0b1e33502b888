// The one scripted SMTP peer of the tests. On 127.0.0.1 it accepts one
// connection; for each step of its script it waits until the bytes received
// since the previous step hold the step's text, then sends the step's reply.
// It records everything it receives until the client closes.
#pragma once

#include <arpa/inet.h>
#include <mutex>
#include <netinet/in.h>
#include <poll.h>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <utility>
#include <vector>

#include "base/log.h"
#include "base/sleep.h"

using PeerScript = std::vector<std::pair<std::string, std::string>>; // awaited text, reply

class ScriptedServer {
public:
    explicit ScriptedServer(PeerScript script)
    {
        listener_ = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address);
        listen(listener_, 1);
        socklen_t length = sizeof address;
        getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &length);
        port_ = ntohs(address.sin_port);
        thread_ = std::thread([this, script] { run(script); });
    }
    ~ScriptedServer()
    {
        received();
        close(listener_);
    }
    uint16_t port() const { return port_; }
    const std::string& received()
    {
        if (thread_.joinable())
            thread_.join();
        return received_;
    }

private:
    // Within a 10-second guard; false at the end of the stream.
    bool readSome(int fd)
    {
        pollfd p{fd, POLLIN, 0};
        char buffer[4096];
        ssize_t got = poll(&p, 1, 10000) > 0 ? recv(fd, buffer, sizeof buffer, 0) : 0;
        if (got > 0)
            received_.append(buffer, static_cast<size_t>(got));
        return got > 0;
    }
    void run(const PeerScript& script)
    {
        pollfd p{listener_, POLLIN, 0};
        int fd = poll(&p, 1, 10000) > 0 ? accept(listener_, nullptr, nullptr) : -1;
        size_t cursor = 0;
        for (const auto& [awaited, reply] : script) {
            size_t found = 0;
            while (fd >= 0 && (found = received_.find(awaited, cursor)) == std::string::npos)
                if (!readSome(fd))
                    return (void)close(fd);
            cursor = found + awaited.size();
            send(fd, reply.data(), reply.size(), MSG_NOSIGNAL);
        }
        while (fd >= 0 && readSome(fd)) {
        }
        close(fd);
    }

    int listener_ = -1;
    uint16_t port_ = 0;
    std::thread thread_;
    std::string received_;
};

// Accepts everything: nothing is answered to the subject line.
inline PeerScript acceptingScript(int recipients)
{
    PeerScript s = {{"", "220 mx.test ESMTP\r\n"}, {"\r\n", "250 mx.test\r\n"}, {"\r\n", "250 2.1.0 Ok\r\n"}};
    for (int i = 0; i < recipients; i++)
        s.push_back({"\r\n", "250 2.1.5 Ok\r\n"});
    s.insert(s.end(), {{"DATA\r\n", "354 End data\r\n"}, {"\r\n.\r\n", "250 2.0.0 Ok\r\n"}, {"QUIT\r\n", "221 Bye\r\n"}});
    return s;
}

// The system log and the sleeps, captured.
struct LogCapture {
    static inline std::mutex mutex;
    static inline std::vector<std::pair<int, std::string>> lines;
    static void hook(int priority, const char* text)
    {
        std::lock_guard<std::mutex> lock(mutex);
        lines.emplace_back(priority, text);
    }
    static std::vector<std::pair<int, std::string>> take()
    {
        std::lock_guard<std::mutex> lock(mutex);
        return std::exchange(lines, {});
    }
};
struct SleepCapture {
    static std::vector<unsigned>& requests()
    {
        static std::vector<unsigned> r;
        return r;
    }
    static void hook(unsigned ms) { requests().push_back(ms); }
};
