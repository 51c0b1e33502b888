#include <gtest/gtest.h>

#include <atomic>
#include <csignal>
#include <netdb.h>
#include <pthread.h>
#include <syslog.h>
#include <thread>

#include "scripted_server.h"
#include "smtp_test_support.h"

namespace {

const std::string GREETING = "220 mx.test ESMTP\r\n";
// A NUL first, high bytes, a line end, then a number too late to count.
const char GARBAGE[] = "\0\xff\xfe\x01\r\n\x80\x90junk 250\r\n";

// A server that accepts everything: one "250" for HELO, MAIL and each of
// `recipients` RCPT commands, "354" for DATA, nothing after the subject line,
// "250" after the end of the data, "221" for QUIT.
std::vector<ScriptStep> acceptingScript(int recipients)
{
    std::vector<ScriptStep> s = {say(GREETING), expect("\r\n"), say("250 mx.test\r\n"), expect("\r\n"),
                                 say("250 2.1.0 Ok\r\n")};
    for (int i = 0; i < recipients; i++) {
        s.push_back(expect("\r\n"));
        s.push_back(say("250 2.1.5 Ok\r\n"));
    }
    for (ScriptStep step : {expect("DATA\r\n"), say("354 End data with <CR><LF>.<CR><LF>\r\n"), expect("\r\n.\r\n"),
                            say("250 2.0.0 Ok: queued\r\n"), expect("QUIT\r\n"), say("221 2.0.0 Bye\r\n")})
        s.push_back(step);
    return s;
}

const std::string BODY = "Check Fan 1 at server alpha\n"
                         "Event Type:Warning\n"
                         "Event Severity:Non-Critical\n"
                         "Component:Baseboard\n"
                         "Group:Fan 1\n"
                         "Instance:CPU 1\n";
const std::string DATA_SENT = "Check Fan 1 at server alpha\r\n"
                              "Event Type:Warning\r\n"
                              "Event Severity:Non-Critical\r\n"
                              "Component:Baseboard\r\n"
                              "Group:Fan 1\r\n"
                              "Instance:CPU 1\r\n"
                              ".\r\n";

using SmtpDialogue = SmtpTest;

TEST_F(SmtpDialogue, FullDialogueSendsExactBytesForDottedAndNamedServer)
{
    for (const char* server : {"127.0.0.1", "localhost"}) {
        SCOPED_TRACE(server);
        SleepCapture::requests().clear();
        // Three recipients, "," and ";" as separators, an empty item between
        // two adjacent separators, blanks kept.
        Alert alert(server, "alerts@example.org", "ops@example.org,boss@example.org;;pager@example.org",
                    "Zorek Server Management Alert:alpha", BODY);
        ScriptedServer peer(acceptingScript(3));
        Outcome out = runDialogue(alert, peer.port());
        EXPECT_EQ(out.result, 1);
        EXPECT_EQ(out.standardError, "");
        EXPECT_TRUE(LogCapture::take().empty());
        EXPECT_EQ(peer.received(), std::string("HELO ") + server +
                                       "\r\n"
                                       "MAIL FROM:<alerts@example.org>\r\n"
                                       "RCPT TO:<ops@example.org>\r\n"
                                       "RCPT TO:<boss@example.org>\r\n"
                                       "RCPT TO:<pager@example.org>\r\n"
                                       "DATA\r\n"
                                       "SUBJECT:Zorek Server Management Alert:alpha\r\n" +
                                       DATA_SENT + "QUIT\r\n");
        EXPECT_TRUE(peer.scriptMet());
        // The server stays silent after the subject line: the stage passes on
        // the 354 of the data stage once the reply limit has run out.
        EXPECT_GE(out.ms, static_cast<long long>(LIMIT_MS));
        EXPECT_EQ(SleepCapture::requests(), std::vector<unsigned>{50});
    }
}

TEST_F(SmtpDialogue, ListWithoutItemsSendsNoRecipient)
{
    Alert alert("127.0.0.1", "a@x", ",;;,", "s", "b\n");
    ScriptedServer peer({say(GREETING), expect("\r\n"), say("250 hi\r\n"), expect("\r\n"), say("250 ok\r\n"),
                         expect("\r\n"), say("554 5.5.1 Error: no valid recipients\r\n")});
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 0);
    EXPECT_EQ(peer.received(), "HELO 127.0.0.1\r\nMAIL FROM:<a@x>\r\nDATA\r\n");
    std::string message = "The server[127.0.0.1] returned the following value:[554]";
    EXPECT_EQ(out.standardError, message + "\n");
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].second, failureLine(2, 17, 554, message));
}

TEST_F(SmtpDialogue, GreetingOf421EndsAtStep5WithoutHelo)
{
    Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
    ScriptedServer peer({say("421 4.3.2 Service not available\r\n")});
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 0);
    EXPECT_EQ(peer.received(), "");
    std::string message = "The server[127.0.0.1] returned the following value:[421]";
    EXPECT_EQ(out.standardError, message + "\n");
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].first, LOG_INFO);
    EXPECT_EQ(lines[0].second, failureLine(2, 5, 421, message));
}

TEST_F(SmtpDialogue, SecondRecipientNot250EndsAtStep14WithoutData)
{
    for (const char* answer : {"550 5.1.1 User unknown\r\n", "251 2.1.5 User not local; will forward\r\n"}) {
        SCOPED_TRACE(answer);
        LogCapture::take();
        int code = atoi(answer);
        Alert alert("127.0.0.1", "a@x", "first@y,second@y", "s", BODY);
        ScriptedServer peer({say(GREETING), expect("\r\n"), say("250 hi\r\n"), expect("\r\n"), say("250 ok\r\n"),
                             expect("\r\n"), say("250 ok\r\n"), expect("\r\n"), say(answer)});
        Outcome out = runDialogue(alert, peer.port());
        EXPECT_EQ(out.result, 0);
        EXPECT_EQ(peer.received(),
                  "HELO 127.0.0.1\r\nMAIL FROM:<a@x>\r\nRCPT TO:<first@y>\r\nRCPT TO:<second@y>\r\n");
        std::string message = "The server[127.0.0.1] returned the following value:[" + std::to_string(code) + "]";
        auto lines = LogCapture::take();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].second, failureLine(2, 14, code, message));
        EXPECT_EQ(out.standardError, message + "\n");
    }
}

TEST_F(SmtpDialogue, RepliesSplitOverSegmentsAreJoined)
{
    std::vector<ScriptStep> script = {say("22"), pauseMs(100), say("0 mx.test\r\n"), expect("\r\n"), say("2"),
                                      pauseMs(60), say("5"), pauseMs(60), say("0 hi\r"), pauseMs(60), say("\n"),
                                      expect("\r\n"), say("250 ok\r\n"), expect("\r\n"), say("250 ok\r\n"),
                                      expect("DATA\r\n"), say("354 go on\r\n"), expect("\r\n.\r\n"), say("250 "),
                                      pauseMs(100), say("queued\r\n"), expect("QUIT\r\n"), say("221 bye\r\n")};
    Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
    ScriptedServer peer(script);
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 1);
    EXPECT_TRUE(LogCapture::take().empty());
    EXPECT_TRUE(peer.scriptMet());
}

TEST_F(SmtpDialogue, RefusedConnectionGivesStep3WithErrorNumber)
{
    // A bound socket that does not listen: connecting to it is refused.
    int placeholder = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(bind(placeholder, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    socklen_t length = sizeof address;
    getsockname(placeholder, reinterpret_cast<sockaddr*>(&address), &length);

    struct Case {
        std::string server;
    } cases[] = {{"127.0.0.1"},
                 // Fills the slot: the message is longer than a reason text.
                 {"127.0.0.1" + std::string(EMAIL_SERVER_SIZE - 10, ' ')}};
    for (const Case& c : cases) {
        Alert alert(c.server, "a@x", "b@y", "s", BODY);
        Outcome out = runDialogue(alert, ntohs(address.sin_port));
        EXPECT_EQ(out.result, 0);
        std::string message = "Unable to connect to SMTP server[" + c.server + "]";
        EXPECT_EQ(out.standardError, message + "\n");
        auto lines = LogCapture::take();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].first, LOG_INFO);
        EXPECT_EQ(lines[0].second, failureLine(1, 3, ECONNREFUSED, message));
    }
    close(placeholder);
}

TEST_F(SmtpDialogue, UnknownServerNameGivesStep2WithResolverCode)
{
    // A name under a top-level domain reserved never to exist.
    Alert alert("mox-alerts.invalid", "a@x", "b@y", "s", BODY);
    Outcome out = runDialogue(alert, 25);
    EXPECT_EQ(out.result, 0);
    std::string message = "Server name:[mox-alerts.invalid] not found...Exiting";
    EXPECT_EQ(out.standardError, message + "\n");
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 1u);
    bool matched = false;
    for (int code : {HOST_NOT_FOUND, TRY_AGAIN, NO_RECOVERY, NO_DATA})
        matched = matched || lines[0].second == failureLine(1, 2, code, message);
    EXPECT_TRUE(matched) << lines[0].second;
}

// A hostile or broken server ends the attempt within the reply limit, with
// the step and value the reply-code rule gives, never a hang or an overrun.
TEST_F(SmtpDialogue, HostileServerEndsWithinLimits)
{
    const int L = static_cast<int>(LIMIT_MS);
    const std::string MEGABYTE(1 << 20, 'A');
    struct Case {
        const char* name;
        std::vector<ScriptStep> script;
        int step;
        int value;
        long long minMs;
        long long maxMs;
    } cases[] = {
        {"1 MB without a line end", {say(MEGABYTE)}, 5, 0, 0, L},
        {"1 MB after the greeting", {say(GREETING + MEGABYTE)}, 8, 220, 0, L},
        // The limit covers the whole reply, not each byte of it.
        {"greeting dripped", {drip(GREETING, L / 5)}, 5, 0, L, 2 * L},
        {"closed mid-greeting", {say("22"), hangUp()}, 5, 0, 0, L},
        {"closed mid-reply to HELO", {say(GREETING), expect("\r\n"), say("25"), hangUp()}, 8, 220, 0, L},
        {"binary garbage", {say(std::string(GARBAGE, sizeof GARBAGE - 1))}, 5, 0, 0, L},
        {"garbage before the number", {say("\xff\xfe" "220 ready\r\n")}, 5, 0, 0, L},
        {"greeting never comes", {pauseMs(3 * L)}, 5, 0, L, 2 * L},
        {"reply to HELO never comes", {say(GREETING), expect("\r\n"), pauseMs(3 * L)}, 8, 220, L, 2 * L},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        LogCapture::take();
        Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
        ScriptedServer peer(c.script);
        Outcome out = runDialogue(alert, peer.port());
        EXPECT_EQ(out.result, 0);
        EXPECT_GE(out.ms, c.minMs - 20); // the clocks count whole milliseconds
        EXPECT_LT(out.ms, c.maxMs);
        std::string message = "The server[127.0.0.1] returned the following value:[" + std::to_string(c.value) + "]";
        auto lines = LogCapture::take();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].second, failureLine(2, c.step, c.value, message));
        EXPECT_EQ(out.standardError, message + "\n");
    }
}

std::atomic<int> brokenPipes{0};

void countBrokenPipe(int)
{
    brokenPipes++;
}

TEST_F(SmtpDialogue, ClosedConnectionIsAnErrorResultNotSigpipe)
{
    struct sigaction counting{};
    struct sigaction previous{};
    counting.sa_handler = countBrokenPipe;
    sigaction(SIGPIPE, &counting, &previous);
    sigset_t pipeOnly;
    sigemptyset(&pipeOnly);
    sigaddset(&pipeOnly, SIGPIPE);
    sigset_t oldMask;
    pthread_sigmask(SIG_UNBLOCK, &pipeOnly, &oldMask);
    brokenPipes = 0;

    Alert alert("127.0.0.1", "a@x", "b@y,c@y", "s", BODY);
    ScriptedServer peer({say(GREETING), expect("\r\n"), say("250 hi\r\n"), hangUp()});
    Outcome out = runDialogue(alert, peer.port());
    peer.received();

    pthread_sigmask(SIG_SETMASK, &oldMask, nullptr);
    sigaction(SIGPIPE, &previous, nullptr);

    EXPECT_EQ(out.result, 0);
    EXPECT_EQ(brokenPipes.load(), 0);
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 1u);
    // The send that meets the closed connection fails: MAIL FROM if the reset
    // has already arrived, otherwise the first RCPT TO.
    bool matched = false;
    for (int value : {EPIPE, ECONNRESET}) {
        if (lines[0].second ==
                failureLine(1, 9, value, "A communication error occured while transmitting the from address ") ||
            lines[0].second == failureLine(1, 12, value, "A communication error occured..."))
            matched = true;
    }
    EXPECT_TRUE(matched) << lines[0].second;
}

TEST_F(SmtpDialogue, ControlBytesInSettingsBecomeBlanks)
{
    Alert alert("127.0.0.1\r\nQUIT", "a@x>\r\nRCPT TO:<evil@x", "ops@x\r\nDATA,b@y", "hi\r\n.\r\nQUIT",
                "Check x\r\n.\r\nMAIL FROM:<e@x>\nline\tTab\x01\x1f\x7f\n");
    ScriptedServer peer(acceptingScript(2));
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 1);
    EXPECT_EQ(peer.received(), "HELO 127.0.0.1  QUIT\r\n"
                               "MAIL FROM:<a@x>  RCPT TO:<evil@x>\r\n"
                               "RCPT TO:<ops@x  DATA>\r\n"
                               "RCPT TO:<b@y>\r\n"
                               "DATA\r\n"
                               "SUBJECT:hi  .  QUIT\r\n"
                               "Check x\r\n"
                               "..\r\n" // a body line of one "." cannot end the data
                               "MAIL FROM:<e@x>\r\n"
                               "line Tab  \x7f\r\n"
                               ".\r\n"
                               "QUIT\r\n");
}

TEST_F(SmtpDialogue, SettingsFillingTheirSlotsAreCutNotOverrun)
{
    Alert alert("", "", "", "", "");
    alert.fillWithoutTerminator(0, "127.0.0.1" + std::string(EMAIL_SERVER_SIZE, ' '));
    alert.fillWithoutTerminator(1, "s");
    alert.fillWithoutTerminator(2, "abcd@x.org,"); // 11 items and "abc" in 124 bytes
    alert.fillWithoutTerminator(3, "S");
    alert.fillWithoutTerminator(4, "line of text\n");
    ScriptedServer peer(acceptingScript(12));
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 1);
    EXPECT_TRUE(peer.scriptMet());
    std::string expected = "HELO 127.0.0.1" + std::string(EMAIL_SERVER_SIZE - 10, ' ') + "\r\n" + "MAIL FROM:<" +
                           std::string(EMAIL_SENDER_SIZE - 1, 's') + ">\r\n";
    for (int i = 0; i < 11; i++)
        expected += "RCPT TO:<abcd@x.org>\r\n";
    expected += "RCPT TO:<abc>\r\nDATA\r\nSUBJECT:" + std::string(EMAIL_SUBJECT_SIZE - 1, 'S') + "\r\n";
    const std::string& got = peer.received();
    ASSERT_EQ(got.substr(0, expected.size()), expected);
    std::string data = got.substr(expected.size());
    ASSERT_GE(data.size(), 6u + 5u);
    ASSERT_EQ(data.substr(data.size() - 6), "QUIT\r\n");
    data.resize(data.size() - 6);
    // The data fills the 1024-byte command buffer at most, ends with the one
    // terminator, and holds whole lines of the body up to the cut.
    EXPECT_LE(data.size(), 1023u);
    EXPECT_GT(data.size(), 1000u);
    ASSERT_EQ(data.substr(data.size() - 5), "\r\n.\r\n");
    std::string lines = data.substr(0, data.size() - 3);
    size_t position = 0;
    int whole = 0;
    while (position < lines.size()) {
        size_t end = lines.find("\r\n", position);
        ASSERT_NE(end, std::string::npos);
        std::string line = lines.substr(position, end - position);
        if (line != "line of text")
            EXPECT_EQ(std::string("line of text").substr(0, line.size()), line);
        else
            whole++;
        position = end + 2;
    }
    EXPECT_GE(whole, 70);
}

// The writability waits share one allowance, spent only by the waits
// themselves; other stages skip a command that could not be sent, a recipient
// waits at most three times and then fails.
std::vector<int> waitRequests;
int waitsGranted = 0;
bool slowWait(int, int timeoutMs)
{
    waitRequests.push_back(timeoutMs);
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    return true;
}
bool grantFirstWaits(int, int timeoutMs)
{
    waitRequests.push_back(timeoutMs);
    return static_cast<int>(waitRequests.size()) <= waitsGranted;
}
bool refuseSecondWait(int, int timeoutMs)
{
    waitRequests.push_back(timeoutMs);
    return waitRequests.size() != 2;
}

TEST_F(SmtpDialogue, WritabilityAllowanceIsSharedBySpentWaits)
{
    smtpSetLimitMs(1000);
    waitRequests.clear();
    smtpSetWritableHook(slowWait);
    Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
    ScriptedServer peer(acceptingScript(1));
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 1);
    // HELO, MAIL, RCPT, DATA, SUBJECT, body, QUIT. The one-second read after
    // the subject line spends none of the allowance.
    ASSERT_EQ(waitRequests.size(), 7u);
    EXPECT_EQ(waitRequests[0], 1000);
    for (size_t i = 1; i < waitRequests.size(); i++)
        EXPECT_LE(waitRequests[i], 1000 - 100 * static_cast<int>(i)) << i;
    // Had the read counted, nothing would be left for the body and QUIT.
    EXPECT_GT(waitRequests[6], 0);
}

TEST_F(SmtpDialogue, RecipientWaitsAreBoundedThenFailTheStep)
{
    waitRequests.clear();
    waitsGranted = 2; // HELO and MAIL FROM
    smtpSetWritableHook(grantFirstWaits);
    Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
    ScriptedServer peer(acceptingScript(1));
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 0);
    EXPECT_EQ(waitRequests.size(), 5u);
    EXPECT_EQ(peer.received(), "HELO 127.0.0.1\r\nMAIL FROM:<a@x>\r\n");
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].second, failureLine(1, 12, ETIMEDOUT, "A communication error occured..."));
    EXPECT_EQ(out.standardError, "A communication error occured...\n");
}

TEST_F(SmtpDialogue, CommandNotWritableIsSkippedByOtherStages)
{
    waitRequests.clear();
    smtpSetWritableHook(refuseSecondWait);
    Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
    // MAIL FROM is never sent; its empty reply passes on HELO's 250, and the
    // server takes the RCPT command for the sender command.
    ScriptedServer peer({say(GREETING), expect("\r\n"), say("250 hi\r\n"), expect("\r\n"),
                         say("503 5.5.1 Error: need MAIL command\r\n")});
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 0);
    EXPECT_EQ(peer.received(), "HELO 127.0.0.1\r\nRCPT TO:<b@y>\r\n");
    std::string message = "The server[127.0.0.1] returned the following value:[503]";
    auto lines = LogCapture::take();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].second, failureLine(2, 14, 503, message));
}

// The daemon's own limit: every alert spends the full 8 seconds after the
// subject line when the server, as usual, answers nothing there.
TEST_F(SmtpDialogue, SubjectStageWaitsTheRealEightSeconds)
{
    smtpSetLimitMs(8000);
    Alert alert("127.0.0.1", "a@x", "b@y", "s", BODY);
    ScriptedServer peer(acceptingScript(1));
    Outcome out = runDialogue(alert, peer.port());
    EXPECT_EQ(out.result, 1);
    EXPECT_GE(out.ms, 8000);
    EXPECT_LT(out.ms, 10000);
}

} // namespace
