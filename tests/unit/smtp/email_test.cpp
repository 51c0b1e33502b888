// Composition of the alert from the baseboard's e-mail settings (provider)
// as a scripted server receives it.
#include "base/sleep.h"
#include "provider.h"
#include "smtppeer.h"
#include "smtp/email.h"
#include "smtp/smtp.h"

namespace {

TEST_F(Provider, FromTheBaseboardSettingsAsTheServerReceivesIt)
{
    uint32_t board = install("baseboard.mif", true);
    manage();
    catalogue(board, 1);
    char host[MOX_HOST_NAME_SIZE] = {};
    ASSERT_EQ(moxHostName(host), 0);
    smtpSetLimitMs(300); // the server says nothing after the subject line
    moxSetSleepHook([](unsigned) {});
    // The settings: a non-ASCII sender, two recipients, a group name carrying a line feed; then
    // the default sender and recipient.
    ASSERT_EQ(dmisp::setValue(board, 1012, 1, {}, "127.0.0.1"), 0u);
    dmisp::setValue(board, 1012, 2, {}, "ops\xe9@example.org");
    dmisp::setValue(board, 1012, 3, {}, "a@example.org;b@example.org");
    EventRecord record{};
    record.eventKind = EVENT_STANDARD;
    record.componentName = "Zorek Tessarin Baseboard";
    record.groupName = "Fan\r\nRSET";
    record.severityText = "Critical";
    ScriptedServer peer(acceptingScript(2));
    smtpSetPort(peer.port());
    testing::internal::CaptureStderr();
    MoxSendEmail(nullptr, &record);
    testing::internal::GetCapturedStderr();
    EXPECT_EQ(peer.received(), "HELO 127.0.0.1\r\nMAIL FROM:<ops @example.org>\r\nRCPT TO:<a@example.org>\r\n"
                               "RCPT TO:<b@example.org>\r\nDATA\r\nSUBJECT:Zorek Server Management Alert:" +
                                   std::string(host) + "\r\nCheck Fan  RSET at server " + host +
                                   "\r\nEvent Type:Unknown\r\nEvent Severity:Critical\r\nComponent:Zorek Tessarin "
                                   "Baseboard\r\nGroup:Fan  RSET\r\nInstance:Unknown\r\n.\r\nQUIT\r\n");
    EXPECT_EQ(pEmailConfig, nullptr);
    EXPECT_TRUE(lines().empty()) << "a delivered alert logs nothing";
    // Sender and recipients not set: both are admin at this host.
    dmisp::setValue(board, 1012, 2, {}, ""), dmisp::setValue(board, 1012, 3, {}, "");
    ScriptedServer defaults(acceptingScript(1));
    smtpSetPort(defaults.port());
    MoxSendEmail(nullptr, &record);
    const std::string admin = "admin@" + std::string(host);
    EXPECT_NE(defaults.received().find("MAIL FROM:<" + admin + ">\r\nRCPT TO:<" + admin + ">\r\nDATA"),
              std::string::npos);
    // Without a server address nothing is sent or logged.
    dmisp::setValue(board, 1012, 1, {}, "");
    smtpSetPort(1);
    record = EventRecord{};
    MoxSendEmail(nullptr, &record);
    EXPECT_TRUE(lines().empty());
    smtpSetPort(25);
    smtpSetLimitMs(8000);
    moxSetSleepHook(nullptr);
}

} // namespace
