#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <syslog.h>

#include "smtp/smtp.h"
#include "smtppeer.h"

namespace {

class Smtp : public testing::Test {
protected:
    void SetUp() override
    {
        LogCapture::take();
        moxSetLogHook(LogCapture::hook);
        moxSetSleepHook(SleepCapture::hook);
        smtpSetLimitMs(300);
    }
    void TearDown() override
    {
        moxSetLogHook(nullptr);
        moxSetSleepHook(nullptr);
        smtpSetWritableHook(nullptr);
        smtpSetLimitMs(8000);
        smtpSetPort(25);
    }
};

int writable = 0; // writability waits that succeed before they all fail

std::string failed(int step, int code)
{
    return "mox - Email Alert failed - smtp command failed in step[" + std::to_string(step) + "]!,ErrorCode:[" +
           std::to_string(code) + "], Reason: Mox email alert was not sent The server[127.0.0.1] returned the "
           "following value:[" + std::to_string(code) + "] The last command returned the following values:" +
           std::to_string(step) + ", " + std::to_string(code) + "\n\n";
}

TEST_F(Smtp, DialogueStagesAndFailureLines)
{
    const PeerScript ok = acceptingScript(1);
    auto upTo = [&ok](size_t stage, std::string reply) {
        PeerScript s(ok.begin(), ok.begin() + static_cast<long>(stage) + 1);
        s.back().second = reply;
        return s;
    };
    PeerScript subject = upTo(4, "354 go\r\n");
    subject.push_back({"SUBJECT:s\r\n", "250 ok\r\n"});
    const std::string commands[] = {"HELO 127.0.0.1\r\n", "MAIL FROM:<a@x>\r\n", "RCPT TO:<b@y>\r\n", "DATA\r\n",
                                    "SUBJECT:s\r\n",      "b\r\n.\r\n",           "QUIT\r\n"};
    auto sent = [&commands](int n) {
        std::string text;
        for (int i = 0; i < n; ++i)
            text += commands[i];
        return text;
    };
    struct Row {
        const char* name;
        PeerScript script; // empty: nobody listens
        std::string received;
        std::string log; // empty: delivered
        std::string sender = "a@x", recipients = "b@y", subject = "s", body = "b\n";
        int writable = 1000;
    } rows[] = {
        {.name = "delivered, three recipients, control bytes blanked, dots doubled",
         .script = acceptingScript(3),
         .received = "HELO 127.0.0.1\r\nMAIL FROM:<a@x  RSET>\r\nRCPT TO:<b@y>\r\nRCPT TO:< c@z>\r\nRCPT TO:<d@w>\r\n"
                     "DATA\r\nSUBJECT:s t\r\none\r\n..two\r\nthr ee\r\n.\r\nQUIT\r\n",
         .log = "",
         .sender = "a@x\r\nRSET",
         .recipients = "b@y, c@z;;d@w",
         .subject = "s\nt",
         .body = "one\n.two\r\nthr\x01" "ee"},
        {.name = "greeting", .script = upTo(0, "421 busy\r\n"), .received = "", .log = failed(5, 421)},
        {.name = "HELO", .script = upTo(1, "500 no\r\n"), .received = sent(1), .log = failed(8, 500)},
        {.name = "MAIL", .script = upTo(2, "550 no\r\n"), .received = sent(2), .log = failed(11, 550)},
        {.name = "RCPT", .script = upTo(3, "251 fwd\r\n"), .received = sent(3), .log = failed(14, 251)},
        {.name = "DATA", .script = upTo(4, "554 no\r\n"), .received = sent(4), .log = failed(17, 554)},
        {.name = "SUBJECT answered", .script = subject, .received = sent(5), .log = failed(20, 250)},
        {.name = "body", .script = upTo(5, "451 later\r\n"), .received = sent(6), .log = failed(23, 451)},
        {.name = "QUIT", .script = upTo(6, "500 no\r\n"), .received = sent(7), .log = failed(26, 500)},
        {.name = "recipient never writable",
         .script = upTo(2, "250 ok\r\n"),
         .received = sent(2),
         .log = "mox - Email Alert failed - sockets library error! Error Value=110,Reason:Mox email alert was not sent "
                "A communication error occured... The last command returned the following values:12, 110\n\n",
         .writable = 2},
        {.name = "connection refused",
         .script = {},
         .received = "",
         .log = "mox - Email Alert failed - sockets library error! Error Value=111,Reason:Mox email alert was not sent "
                "Unable to connect to SMTP server[127.0.0.1] The last command returned the following values:3, 111\n\n"},
    };
    for (Row& row : rows) {
        SCOPED_TRACE(row.name);
        std::optional<ScriptedServer> peer;
        if (!row.script.empty())
            peer.emplace(row.script);
        smtpSetPort(peer ? peer->port() : 1);
        writable = row.writable;
        smtpSetWritableHook([](int, int) { return writable-- > 0; });
        std::string server = "127.0.0.1";
        EmailConfig config{server.data(), row.sender.data(), row.recipients.data(), row.subject.data(),
                           row.body.data()};
        testing::internal::CaptureStderr();
        EXPECT_EQ(_MoxSendEmail(&config), row.log.empty() ? 1 : 0);
        std::string err = testing::internal::GetCapturedStderr();
        EXPECT_EQ(peer ? peer->received() : "", row.received);
        auto lines = LogCapture::take();
        EXPECT_EQ(lines.size(), row.log.empty() ? 0u : 1u);
        for (const auto& [priority, text] : lines)
            EXPECT_EQ(std::make_pair(priority, text), std::make_pair(LOG_INFO, row.log));
        EXPECT_EQ(err.empty(), row.log.empty()) << err;
    }
}

TEST_F(Smtp, ReplyPiecesAndLineEnds)
{
    struct Row {
        std::vector<std::string> pieces;
        int gapMs, size, length;
        std::string text;
    } rows[] = {
        {{"22", "0 mx", "\r\n"}, 50, 1024, 8, "220 mx\r\n"},
        {{"250 a\n\n"}, 0, 1024, 7, "250 a\n\n"},
        {{"250 a\n\r"}, 0, 1024, 7, "250 a\n\r"},
        {{"250 a\r\r"}, 0, 1024, 7, "250 a\r\r"},
        {{"250 a\n"}, 0, 1024, 0, ""},                                // one line feed is no line end
        {{std::string("250 a\0b\r\n", 9)}, 0, 1024, 5, "250 a"},     // up to a NUL
        {{"250 a\r\n"}, 0, 4, 3, "250"},                              // cut to the caller's size
        {{"2", "5", "0", " ", "a", "\r", "\n"}, 60, 1024, 0, ""},    // one limit for the whole reply
    };
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
        EXPECT_EQ(GetResponse(ends[0], out, row.size), row.length) << row.pieces[0];
        EXPECT_EQ(std::string(out), row.text) << row.pieces[0];
        writer.join();
        close(ends[0]), close(ends[1]);
    }
}

TEST(SmtpRules, RecipientSplitting)
{
    struct Row {
        const char* list;
        size_t length;
        std::string items;
    } rows[] = {
        {"a@x,b@y;;c@z", 125, "[a@x][b@y][c@z]"}, {",;;,", 125, ""},
        {" a , b", 125, "[ a ][ b]"},           {"abc;def", 5, "[abc][d]"},
    };
    for (const Row& row : rows) {
        std::string items;
        size_t position = 0, start = 0, length = 0;
        while (smtpNextRecipient(row.list, row.length, &position, &start, &length))
            items += "[" + std::string(row.list + start, length) + "]";
        EXPECT_EQ(items, row.items) << row.list;
    }
}

} // namespace
