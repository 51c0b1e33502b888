// A scripted SMTP peer on 127.0.0.1 for the client's tests: it accepts one
// connection, plays its script (send texts, wait for texts, pause, drip, close)
// and records every byte it receives until the client closes.
#pragma once

#include <arpa/inet.h>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <netinet/in.h>
#include <poll.h>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <vector>

struct ScriptStep {
    enum Kind { Send, Expect, Pause, Drip, Close, Reset } kind;
    std::string text; // Send, Drip: the bytes; Expect: the text awaited
    int ms = 0;       // Pause: its length; Drip: the gap between bytes
};

inline ScriptStep say(std::string text)
{
    return {ScriptStep::Send, std::move(text), 0};
}
inline ScriptStep expect(std::string text)
{
    return {ScriptStep::Expect, std::move(text), 0};
}
inline ScriptStep pauseMs(int ms)
{
    return {ScriptStep::Pause, "", ms};
}
inline ScriptStep drip(std::string text, int gapMs)
{
    return {ScriptStep::Drip, std::move(text), gapMs};
}
inline ScriptStep hangUp()
{
    return {ScriptStep::Close, "", 0};
}
inline ScriptStep resetConnection()
{
    return {ScriptStep::Reset, "", 0};
}

class ScriptedServer {
public:
    explicit ScriptedServer(std::vector<ScriptStep> script) : script_(std::move(script))
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
        thread_ = std::thread([this] { run(); });
    }

    ~ScriptedServer()
    {
        join();
        close(listener_);
    }

    uint16_t port() const { return port_; }

    // Waits for the client to close (or the server's own 30-second guard).
    const std::string& received()
    {
        join();
        return received_;
    }

    // Whether every Expect step of the script was met.
    bool scriptMet()
    {
        join();
        return scriptMet_;
    }

private:
    static constexpr int GUARD_MS = 30000;

    void join()
    {
        if (thread_.joinable())
            thread_.join();
    }

    // Reads what is there within the guard; false on end of stream.
    bool readSome(int fd)
    {
        pollfd p{fd, POLLIN, 0};
        if (poll(&p, 1, GUARD_MS) <= 0)
            return false;
        char buffer[4096];
        ssize_t got = recv(fd, buffer, sizeof buffer, 0);
        if (got <= 0)
            return false;
        received_.append(buffer, static_cast<size_t>(got));
        return true;
    }

    void run()
    {
        pollfd p{listener_, POLLIN, 0};
        if (poll(&p, 1, GUARD_MS) <= 0)
            return;
        int fd = accept(listener_, nullptr, nullptr);
        if (fd < 0)
            return;
        size_t cursor = 0;
        bool open = true;
        for (const ScriptStep& step : script_) {
            if (!open)
                break;
            switch (step.kind) {
            case ScriptStep::Send: {
                size_t sent = 0;
                while (sent < step.text.size()) {
                    ssize_t n = send(fd, step.text.data() + sent, step.text.size() - sent, MSG_NOSIGNAL);
                    if (n <= 0)
                        break;
                    sent += static_cast<size_t>(n);
                }
                break;
            }
            case ScriptStep::Expect:
                for (;;) {
                    size_t found = received_.find(step.text, cursor);
                    if (found != std::string::npos) {
                        cursor = found + step.text.size();
                        break;
                    }
                    if (!readSome(fd)) {
                        scriptMet_ = false;
                        open = false;
                        break;
                    }
                }
                break;
            case ScriptStep::Pause:
                std::this_thread::sleep_for(std::chrono::milliseconds(step.ms));
                break;
            case ScriptStep::Drip:
                for (char c : step.text) {
                    if (send(fd, &c, 1, MSG_NOSIGNAL) != 1)
                        break;
                    std::this_thread::sleep_for(std::chrono::milliseconds(step.ms));
                }
                break;
            case ScriptStep::Close:
                close(fd);
                fd = -1;
                open = false;
                break;
            case ScriptStep::Reset: {
                linger hard{1, 0};
                setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
                close(fd);
                fd = -1;
                open = false;
                break;
            }
            }
        }
        if (fd >= 0) {
            while (readSome(fd)) {
            }
            close(fd);
        }
    }

    std::vector<ScriptStep> script_;
    int listener_ = -1;
    uint16_t port_ = 0;
    std::thread thread_;
    std::string received_;
    bool scriptMet_ = true;
};
