#include <gtest/gtest.h>

#include <netdb.h>
#include <numeric>
#include <optional>
#include <syslog.h>

#include "smtp/smtp.h"
#include "smtppeer.h"

namespace {

int writable = 0; // writability waits that succeed before every later one fails

std::string failed(int step, int code, const std::string& server = "127.0.0.1")
{
    std::string s = std::to_string(step), c = std::to_string(code);
    return "mox - Email Alert failed - smtp command failed in step[" + s + "]!,ErrorCode:[" + c + "], Reason: Mox "
           "email alert was not sent The server[" + server + "] returned the following value:[" + c + "] The last "
           "command returned the following values:" + s + ", " + c + "\n\n";
}

TEST(Smtp, DialogueStagesAndFailureLines)
{
    const PeerScript ok = acceptingScript(1);
    auto upTo = [&ok](long stage, std::string reply, PeerScript more = {}) {
        PeerScript s(ok.begin(), ok.begin() + stage + 1);
        s.back().second = reply;
        s.insert(s.end(), more.begin(), more.end());
        return s;
    };
    const std::string commands[] = {"HELO 127.0.0.1\r\n", "MAIL FROM:<a@x>\r\n", "RCPT TO:<b@y>\r\n", "DATA\r\n",
                                    "SUBJECT:s\r\n",      "b\r\n.\r\n",           "QUIT\r\n"};
    auto sent = [&commands](int n) { return std::accumulate(commands, commands + n, std::string()); };
    const std::string socketsLine = "mox - Email Alert failed - sockets library error! Error Value=";
    const char* const nowhere = "no-such-host.invalid";
    const std::string notFound = std::to_string(gethostbyname(nowhere) == nullptr ? h_errno : -1);
    struct Row { // script empty: nobody listens; log empty: delivered
        const char* name;
        PeerScript script;
        std::string received, log;
        int writable = 1000;
        std::string sender = "a@x", recipients = "b@y", subject = "s", body = "b\n", server = "127.0.0.1";
    } rows[] = {
        {"delivered; control bytes blanked, dots doubled", acceptingScript(3),
         "HELO 127.0.0.1\r\nMAIL FROM:<a@x  RSET>\r\nRCPT TO:<b@y>\r\nRCPT TO:< c@z>\r\nRCPT TO:<d@w>\r\nDATA\r\n"
         "SUBJECT:s t\r\none\r\n..two\r\nthr ee\r\n.\r\nQUIT\r\n",
         "", 1000, "a@x\r\nRSET", "b@y, c@z;;d@w", "s\nt", "one\n.two\r\nthr\x01" "ee"},
        {"greeting", upTo(0, "421 busy\r\n"), sent(0), failed(5, 421)}, {"HELO", upTo(1, "500 no\r\n"), sent(1), failed(8, 500)},
        // Silence keeps the previous code: 0 before the greeting, 220 after HELO.
        {"empty greeting", upTo(0, ""), sent(0), failed(5, 0)},
        {"silent after HELO", upTo(1, ""), sent(1), failed(8, 220)},
        {"server by host name", upTo(1, "500 no\r\n"), "HELO localhost\r\n", failed(8, 500, "localhost"), 1000, "a@x",
         "b@y", "s", "b\n", "localhost"},
        {"host name not found", {}, "", socketsLine + notFound + ",Reason:Mox email alert was not sent Server name:[" +
         nowhere + "] not found...Exiting The last command returned the following values:2, " + notFound + "\n\n",
         1000, "a@x", "b@y", "s", "b\n", nowhere},
        {"MAIL", upTo(2, "550 no\r\n"), sent(2), failed(11, 550)}, {"RCPT", upTo(3, "251 fwd\r\n"), sent(3), failed(14, 251)},
        {"DATA", upTo(4, "554 no\r\n"), sent(4), failed(17, 554)},
        {"subject answered", upTo(4, "354 go\r\n", {{"SUBJECT:s\r\n", "250 ok\r\n"}}), sent(5), failed(20, 250)},
        {"body", upTo(5, "451 later\r\n"), sent(6), failed(23, 451)}, {"QUIT", upTo(6, "500 no\r\n"), sent(7), failed(26, 500)},
        {"recipient never writable", upTo(2, "250 ok\r\n"), sent(2),
         socketsLine + "110,Reason:Mox email alert was not sent A communication error occured... The last command "
                       "returned the following values:12, 110\n\n", 2},
        {"connection refused", {}, "",
         socketsLine + "111,Reason:Mox email alert was not sent Unable to connect to SMTP server[127.0.0.1] The last "
                       "command returned the following values:3, 111\n\n"}};
    moxSetLogHook(LogCapture::hook), moxSetSleepHook(SleepCapture::hook), smtpSetLimitMs(300);
    smtpSetWritableHook([](int, int) { return writable-- > 0; });
    for (Row& row : rows) {
        SCOPED_TRACE(row.name);
        std::optional<ScriptedServer> peer;
        if (!row.script.empty())
            peer.emplace(row.script);
        smtpSetPort(peer ? peer->port() : 1);
        writable = row.writable;
        EmailConfig config{row.server.data(), row.sender.data(), row.recipients.data(), row.subject.data(),
                           row.body.data()};
        testing::internal::CaptureStderr();
        EXPECT_EQ(_MoxSendEmail(&config), row.log.empty() ? 1 : 0);
        std::string err = testing::internal::GetCapturedStderr();
        EXPECT_EQ(peer ? peer->received() : "", row.received);
        EXPECT_EQ(LogCapture::take(), (row.log.empty() ? decltype(LogCapture::lines){} : decltype(LogCapture::lines){{LOG_INFO, row.log}}));
        EXPECT_EQ(err.empty(), row.log.empty()) << err;
        EXPECT_TRUE(row.writable != 2 || writable == -3) << "a recipient gets three writability waits";
    }
    moxSetLogHook(nullptr), moxSetSleepHook(nullptr), smtpSetWritableHook(nullptr);
}

TEST(Smtp, ReplyPiecesAndLineEnds)
{
    struct Row { std::vector<std::string> pieces; int gapMs, size, length; std::string text; } rows[] = {
        {{"22", "0 mx", "\r\n"}, 50, 1024, 8, "220 mx\r\n"}, {{"250 a\n\n"}, 0, 1024, 7, "250 a\n\n"},
        {{"250 a\n"}, 0, 1024, 0, ""}, {{std::string("250 a\0b\r\n", 9)}, 0, 1024, 5, "250 a"}, // one LF: nothing; a NUL ends
        {{"250 a\r\n"}, 0, 4, 3, "250"},                          // cut to the caller's size
        {{"2", "5", "0", " ", "a", "\r", "\n"}, 60, 1024, 0, ""}}; // one limit for the whole reply
    smtpSetLimitMs(300);
    for (const Row& row : rows) {
        int ends[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, ends), 0);
        std::thread writer([&] {
            for (const std::string& piece : row.pieces) {
                EXPECT_EQ(write(ends[1], piece.data(), piece.size()), static_cast<ssize_t>(piece.size()));
                std::this_thread::sleep_for(std::chrono::milliseconds(row.gapMs));
            }
        });
        char out[1024] = {};
        const int length = GetResponse(ends[0], out, row.size);
        EXPECT_EQ(std::make_pair(length, std::string(out)), std::make_pair(row.length, row.text)) << row.pieces[0];
        writer.join();
        close(ends[0]), close(ends[1]);
    }
}

} // namespace
