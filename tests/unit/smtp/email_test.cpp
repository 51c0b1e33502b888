// Composition of the alert from the baseboard's e-mail settings (provider)
// as a scripted server receives it.
#include "base/sleep.h"
#include "provider.h"
#include "smtppeer.h"
#include "smtp/email.h"
#include "smtp/smtp.h"

namespace {

class Email : public Provider {};

TEST_F(Email, FromTheBaseboardSettingsAsTheServerReceivesIt)
{
    uint32_t board = install("baseboard.mif", true);
    manage();
    catalogue(board, 1);
    char host[MOX_HOST_NAME_SIZE] = {};
    ASSERT_EQ(moxHostName(host), 0);
    const std::string admin = std::string("admin@") + host, subject = std::string("Alert:") + host + "\r\nCheck ",
                      tail = std::string(" at server ") + host + "\r\nEvent Type:";
    const std::string end = "\r\nEvent Severity:Critical\r\nComponent:Zorek Tessarin Baseboard\r\nGroup:";
    smtpSetLimitMs(300); // the server says nothing after the subject line
    moxSetSleepHook([](unsigned) {});
    struct Row { const char* sender; const char* recipients; const char* group; const char* type; int count; std::string expected; } rows[] = {
        {nullptr, nullptr, "Voltage Probe", "Upper Critical", 1,
         "MAIL FROM:<" + admin + ">\r\nRCPT TO:<" + admin + ">\r\nDATA\r\nSUBJECT:Zorek Server Management " + subject +
             "Voltage Probe" + tail + "Upper Critical" + end + "Voltage Probe"},
        {"ops\xe9@example.org", "a@example.org;b@example.org", "Fan\r\nRSET", nullptr, 2,
         "MAIL FROM:<ops @example.org>\r\nRCPT TO:<a@example.org>\r\nRCPT TO:<b@example.org>\r\nDATA\r\n"
         "SUBJECT:Zorek Server Management " + subject + "Fan  RSET" + tail + "Unknown" + end + "Fan  RSET"}};
    ASSERT_EQ(dmisp::setValue(board, 1012, 1, {}, "127.0.0.1"), 0u);
    for (const auto& r : rows) {
        SCOPED_TRACE(r.group);
        if (r.sender != nullptr) {
            dmisp::setValue(board, 1012, 2, {}, r.sender);
            dmisp::setValue(board, 1012, 3, {}, r.recipients);
        }
        EventRecord record{};
        record.eventKind = EVENT_STANDARD;
        record.componentName = "Zorek Tessarin Baseboard";
        record.groupName = r.group;
        record.eventTypeText = r.type;
        record.severityText = "Critical";
        ScriptedServer peer(acceptingScript(r.count));
        smtpSetPort(peer.port());
        testing::internal::CaptureStderr();
        MoxSendEmail(nullptr, &record);
        testing::internal::GetCapturedStderr();
        EXPECT_EQ(peer.received(), "HELO 127.0.0.1\r\n" + r.expected + "\r\nInstance:Unknown\r\n.\r\nQUIT\r\n");
        EXPECT_EQ(pEmailConfig, nullptr);
        EXPECT_TRUE(lines().empty()) << "a delivered alert logs nothing";
    }
    // Without a server address nothing is sent or logged.
    dmisp::setValue(board, 1012, 1, {}, "");
    smtpSetPort(1);
    EventRecord record{};
    MoxSendEmail(nullptr, &record);
    EXPECT_TRUE(lines().empty());
    smtpSetPort(25);
    smtpSetLimitMs(8000);
    moxSetSleepHook(nullptr);
}

} // namespace
