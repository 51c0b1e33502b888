#include <gtest/gtest.h>

#include <climits>
#include <cstdio>
#include <random>
#include <sched.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include "smtp_test_support.h"

namespace {

TEST(SmtpReplyCode, ScansLikeDecimalConversionAndKeepsPreviousWithoutNumber)
{
    struct Case {
        const char* reply;
        int previous;
        int expected;
    } cases[] = {
        {"220 mx ESMTP\r\n", 0, 220},
        {"250-first\r\n250 last\r\n", 0, 250}, // only the first number counts
        {"", 354, 354},
        {" \t\r\n", 354, 354},
        {"\r\n354 late", 0, 354}, // leading white space, line ends included, is skipped
        {"ready 220\r\n", 7, 7},
        {"\xff" "220\r\n", 7, 7},
        {"+221 bye", 0, 221},
        {"-12 odd", 0, -12},
        {"- 5", 9, 9},
        {"2a50", 0, 2},
        {"0", 5, 0},
        {"00000000000000000000250 x", 0, 250},
        {"99999999999999 x", 0, INT_MAX},
        {"-99999999999999", 0, INT_MIN},
        {"2147483647", 0, INT_MAX},
        {"-2147483648", 0, INT_MIN},
    };
    for (const Case& c : cases)
        EXPECT_EQ(smtpReplyCode(c.reply, c.previous), c.expected) << c.reply;
    EXPECT_EQ(smtpReplyCode(nullptr, 42), 42);

    // Random short replies agree with the C library's "%d " wherever that
    // conversion is defined (at most nine digits).
    std::mt19937 random(1234);
    const char alphabet[] = " \t\r\n+-0123456789ax\xff";
    for (int i = 0; i < 20000; i++) {
        std::string reply;
        int length = random() % 10;
        for (int k = 0; k < length; k++)
            reply += alphabet[random() % (sizeof alphabet - 1)];
        int scanned = -777;
        if (sscanf(reply.c_str(), "%d ", &scanned) != 1)
            scanned = -777;
        EXPECT_EQ(smtpReplyCode(reply.c_str(), -777), scanned) << reply;
    }
}

TEST(SmtpLineEnd, FindsAnyOfFourPairsAnywhere)
{
    struct Case {
        std::string bytes;
        bool expected;
    } cases[] = {
        {"220 ok\r\n", true},    {"220 ok\n\r", true},   {"220 ok\n\n", true},
        {"220 ok\r\r", true},    {"\r\n220", true},      {"2\r\n20", true},
        {"220 ok\n", false},     {"220 ok\r", false},    {"\r", false},
        {"", false},             {"\rx\n", false},       {"220 ok", false},
        {std::string("\0\0\r\n", 4), true}, // past NUL bytes too
        {std::string("a\0\n\n", 4), true},  {std::string("\r\0\n", 3), false},
    };
    for (const Case& c : cases)
        EXPECT_EQ(smtpHasLineEnd(c.bytes.data(), c.bytes.size()), c.expected) << testing::PrintToString(c.bytes);
    // The length bounds the search.
    EXPECT_FALSE(smtpHasLineEnd("ab\r\n", 3));
    EXPECT_FALSE(smtpHasLineEnd(nullptr, 4));
}

TEST(SmtpRecipients, SplitAtCommaAndSemicolonSkippingEmptyItems)
{
    struct Case {
        std::string list;
        size_t length; // npos: the whole list
        std::vector<std::string> items;
    } cases[] = {
        {"a@x,b@y;c@z", std::string::npos, {"a@x", "b@y", "c@z"}},
        {"a@x,,b@y;;;c@z", std::string::npos, {"a@x", "b@y", "c@z"}},
        {",;a@x;", std::string::npos, {"a@x"}},
        {" a@x , b@y ", std::string::npos, {" a@x ", " b@y "}}, // blanks are kept
        {"", std::string::npos, {}},
        {",;,;", std::string::npos, {}},
        {"only", std::string::npos, {"only"}},
        {"abc,def", 5, {"abc", "d"}},
        {std::string("a,b\0,c", 6), 6, {"a", "b"}}, // the terminator ends the list
    };
    for (const Case& c : cases) {
        size_t length = c.length == std::string::npos ? c.list.size() : c.length;
        std::vector<std::string> got;
        size_t position = 0;
        size_t start = 0;
        size_t itemLength = 0;
        while (smtpNextRecipient(c.list.data(), length, &position, &start, &itemLength)) {
            ASSERT_LE(start + itemLength, length);
            got.emplace_back(c.list.data() + start, itemLength);
            ASSERT_LT(got.size(), 100u);
        }
        EXPECT_EQ(got, c.items) << c.list;
    }
}

TEST(SmtpData, BodyLinesEndInCrLfFollowedByOneTerminator)
{
    struct Case {
        std::string body;
        std::string data;
    } cases[] = {
        {"L1\nL2\n", "L1\r\nL2\r\n.\r\n"},
        {"", ".\r\n"},
        {"no line end", "no line end\r\n.\r\n"},
        {"a\r\nb\n", "a\r\nb\r\n.\r\n"},
        {"x\n\ny\n", "x\r\n\r\ny\r\n.\r\n"},
        {"a\rb\x01\tc\x1f\x7f\n", "a b  c \x7f\r\n.\r\n"}, // a lone CR is no line end
        {".\n", "..\r\n.\r\n"},
        {"x\n.hidden\n..two\n", "x\r\n..hidden\r\n...two\r\n.\r\n"},
        {"x\r\n.\r\nMAIL FROM:<e@x>\n", "x\r\n..\r\nMAIL FROM:<e@x>\r\n.\r\n"},
        {"a.b\n", "a.b\r\n.\r\n"},
    };
    char out[64];
    for (const Case& c : cases) {
        size_t n = smtpBuildData(c.body.data(), c.body.size(), out, sizeof out);
        EXPECT_EQ(std::string(out, n), c.data) << c.body;
        EXPECT_EQ(strlen(out), n);
    }
}

// Whatever the body and the room, the data fits, ends with the standard
// terminator and holds no line that would end it early.
TEST(SmtpData, RandomBodiesNeverOverrunOrEndEarly)
{
    std::mt19937 random(99);
    const char alphabet[] = "\r\n\n.x \x01";
    for (int i = 0; i < 5000; i++) {
        std::string body;
        size_t length = random() % 1100;
        for (size_t k = 0; k < length; k++)
            body += alphabet[random() % (sizeof alphabet - 1)];
        size_t room = 6 + random() % 1100;
        std::vector<char> out(room + 8, '#');
        size_t n = smtpBuildData(body.data(), body.size(), out.data(), room);
        ASSERT_LT(n, room);
        ASSERT_EQ(out[n], '\0');
        for (size_t k = room; k < out.size(); k++)
            ASSERT_EQ(out[k], '#') << "written past the room";
        std::string data(out.data(), n);
        ASSERT_GE(data.size(), 3u);
        ASSERT_EQ(data.substr(data.size() - 3), ".\r\n");
        if (data.size() > 3) {
            ASSERT_EQ(data.substr(data.size() - 5), "\r\n.\r\n");
        }
        // Every CR is followed by LF and every LF preceded by CR.
        for (size_t k = 0; k < data.size(); k++) {
            if (data[k] == '\r') {
                ASSERT_TRUE(k + 1 < data.size() && data[k + 1] == '\n');
            }
            if (data[k] == '\n') {
                ASSERT_TRUE(k > 0 && data[k - 1] == '\r');
            }
            ASSERT_FALSE(static_cast<unsigned char>(data[k]) < 0x20 && data[k] != '\r' && data[k] != '\n');
        }
        // The only line made of a single "." is the last.
        std::string content = "\r\n" + data.substr(0, data.size() - 3);
        ASSERT_EQ(content.find("\r\n.\r\n"), std::string::npos) << testing::PrintToString(data);
        // With room for everything nothing is lost: undoing the conversion
        // gives the body (CR LF and LF as LF, control bytes as blanks).
        if (room >= 2 * body.size() + 6) {
            std::string expected;
            for (size_t k = 0; k < body.size(); k++) {
                if (body[k] == '\r' && k + 1 < body.size() && body[k + 1] == '\n')
                    continue;
                expected += (body[k] == '\n') ? '\n' : (static_cast<unsigned char>(body[k]) < 0x20 ? ' ' : body[k]);
            }
            if (!expected.empty() && expected.back() != '\n')
                expected += '\n';
            std::string undone;
            size_t p = 0;
            std::string lines = data.substr(0, data.size() - 3);
            while (p < lines.size()) {
                size_t end = lines.find("\r\n", p);
                std::string line = lines.substr(p, end - p);
                if (!line.empty() && line[0] == '.')
                    line.erase(0, 1);
                undone += line + "\n";
                p = end + 2;
            }
            ASSERT_EQ(undone, expected);
        }
    }
}

TEST(SmtpSanitize, ControlBytesBecomeBlanksWithinBounds)
{
    std::string all;
    for (int c = 1; c < 0x20; c++)
        all += static_cast<char>(c);
    all += "a\x7f\x80\xff";
    std::string expected = std::string(0x1f, ' ') + "a\x7f\x80\xff";

    std::string text = all;
    smtpSanitize(text.data());
    EXPECT_EQ(text, expected);
    smtpSanitize(nullptr);

    struct Case {
        size_t outSize;
        size_t maxLength;
        std::string copied;
    } cases[] = {
        {64, 100, expected},
        {64, 3, "   "},
        {6, 100, "     "},
        {1, 100, ""},
    };
    for (const Case& c : cases) {
        std::vector<char> out(c.outSize + 1, '#');
        size_t n = smtpCopySanitized(out.data(), c.outSize, all.c_str(), c.maxLength);
        EXPECT_EQ(std::string(out.data(), n), c.copied);
        EXPECT_EQ(out[n], '\0');
        EXPECT_EQ(out[c.outSize], '#');
    }
}

TEST(SmtpLog, ThreeClassFormatsAtInfoWithCutReasons)
{
    LogCapture::take();
    moxSetLogHook(LogCapture::hook);
    std::string longMessage(300, 'm');
    EXPECT_EQ(LogErrorMessageForMoxSendEmail(1, 3, 111, "Unable to connect to SMTP server[mx]"), 0);
    EXPECT_EQ(LogErrorMessageForMoxSendEmail(2, 5, 421, "The server[mx] returned the following value:[421]"), 0);
    EXPECT_EQ(LogErrorMessageForMoxSendEmail(3, 19, 0, "Failed to read response from server:[mx]"), 0);
    EXPECT_EQ(LogErrorMessageForMoxSendEmail(2, 14, 550, longMessage.c_str()), 0);
    EXPECT_EQ(LogErrorMessageForMoxSendEmail(4, 1, 1, "never passed"), 0);
    moxSetLogHook(nullptr);
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 4u);
    for (const auto& line : lines)
        EXPECT_EQ(line.first, LOG_INFO);
    EXPECT_EQ(lines[0].second, "mox - Email Alert failed - sockets library error! Error Value=111,Reason:Mox email "
                               "alert was not sent Unable to connect to SMTP server[mx] The last command returned the "
                               "following values:3, 111\n\n");
    EXPECT_EQ(lines[1].second, "mox - Email Alert failed - smtp command failed in step[5]!,ErrorCode:[421], Reason: "
                               "Mox email alert was not sent The server[mx] returned the following value:[421] The "
                               "last command returned the following values:5, 421\n\n");
    EXPECT_EQ(lines[2].second, "mox - Email Alert failed - command timeout!, Reason:Mox email alert was not sent An "
                               "invalid response was receieved or a command timed out The last command returned the "
                               "following values:19, 0\n\n");
    EXPECT_EQ(lines[3].second, "mox - Email Alert failed - smtp command failed in step[14]!,ErrorCode:[550], Reason: "
                               "Mox email alert was not sent " +
                                   std::string(127, 'm') +
                                   " The last command returned the following values:14, 550\n\n");
}

TEST(SmtpGetResponse, InvalidArgumentsGiveMinusOne)
{
    char out[8] = "x";
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
    EXPECT_EQ(GetResponse(-1, out, sizeof out), -1);
    EXPECT_EQ(GetResponse(pair[0], nullptr, 8), -1);
    EXPECT_EQ(GetResponse(pair[0], out, 0), -1);
    // A reply longer than the output is cut to it.
    ASSERT_EQ(write(pair[1], "250 a long reply\r\n", 18), 18);
    EXPECT_EQ(GetResponse(pair[0], out, sizeof out), 7);
    EXPECT_STREQ(out, "250 a l");
    close(pair[0]);
    close(pair[1]);
}

// The host name as the kernel holds it, up to its 64 bytes, in a UTS
// namespace of a child process so that the machine's name is untouched.
std::string hostNameOf(const std::string& name, int* status)
{
    int pipeFds[2];
    if (pipe(pipeFds) != 0)
        return "";
    pid_t child = fork();
    if (child == 0) {
        close(pipeFds[0]);
        char out[MOX_HOST_NAME_SIZE + 8];
        memset(out, '#', sizeof out);
        int result = 2;
        if (unshare(CLONE_NEWUTS) == 0 && sethostname(name.data(), name.size()) == 0)
            result = moxHostName(out) == 0 ? 0 : 1;
        if (result == 0 && out[MOX_HOST_NAME_SIZE] != '#')
            result = 3;
        if (write(pipeFds[1], out, strnlen(out, MOX_HOST_NAME_SIZE)) < 0)
            result = 4;
        _exit(result);
    }
    close(pipeFds[1]);
    std::string got;
    char buffer[128];
    ssize_t n;
    while ((n = read(pipeFds[0], buffer, sizeof buffer)) > 0)
        got.append(buffer, static_cast<size_t>(n));
    close(pipeFds[0]);
    int raw = 0;
    waitpid(child, &raw, 0);
    *status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
    return got;
}

TEST(SmtpHostName, LongNamesAreCutAt48AndControlBytesBlanked)
{
    struct Case {
        std::string name;
        std::string expected;
    } cases[] = {
        {"alpha", "alpha"},
        {std::string(48, 'h'), std::string(48, 'h')},
        {std::string(64, 'h'), std::string(48, 'h')}, // gethostname needs more than 48 bytes here
        {"a\nb\rc", "a b c"},
    };
    for (const Case& c : cases) {
        int status = -1;
        std::string got = hostNameOf(c.name, &status);
        if (status == 2)
            GTEST_SKIP() << "no permission to set a host name in a UTS namespace";
        EXPECT_EQ(status, 0);
        EXPECT_EQ(got, c.expected);
    }
    char out[MOX_HOST_NAME_SIZE];
    char reference[65] = {};
    ASSERT_EQ(moxHostName(out), 0);
    ASSERT_EQ(gethostname(reference, sizeof reference - 1), 0);
    EXPECT_EQ(std::string(out), std::string(reference).substr(0, 48));
}

TEST(SmtpHostName, DefaultAddressIsAdminAtHostName)
{
    char out[EMAIL_SENDER_SIZE];
    moxDefaultAddress("alpha", out, sizeof out);
    EXPECT_STREQ(out, "admin@alpha");
    moxDefaultAddress(std::string(48, 'h').c_str(), out, sizeof out);
    EXPECT_EQ(std::string(out), "admin@" + std::string(48, 'h'));
    char small[8];
    moxDefaultAddress("alphabet", small, sizeof small);
    EXPECT_STREQ(small, "admin@a");
}

} // namespace
