// Composition of the alert from the baseboard's e-mail settings (provider)
// as a scripted server receives it.
#include "base/sleep.h"
#include "provider.h"
#include "scripted_server.h"
#include "smtp/email.h"
#include "smtp/smtp.h"

namespace {

class EmailComposition : public Provider {};

TEST_F(EmailComposition, SettingsAndTextsAsTheServerReceivesThem)
{
    uint32_t board = installShipped("baseboard.mif");
    manage();
    catalogue(board, 1);
    char host[MOX_HOST_NAME_SIZE] = {};
    ASSERT_EQ(moxHostName(host), 0);
    const std::string admin = std::string("admin@") + host, check = std::string(" at server ") + host + "\r\n";
    smtpSetLimitMs(300); // the server says nothing after the subject line
    moxSetSleepHook([](unsigned) {});
    struct Row {
        const char* sender;    // attribute 2, not set when null
        const char* recipients; // attribute 3
        const char* group;
        const char* type;
        int count;
        std::string expected;
    } rows[] = {
        {nullptr, nullptr, "Voltage Probe", "Upper Critical", 1,
         "HELO 127.0.0.1\r\nMAIL FROM:<" + admin + ">\r\nRCPT TO:<" + admin + ">\r\nDATA\r\n"
         "SUBJECT:Zorek Server Management Alert:" + host + "\r\nCheck Voltage Probe" + check +
         "Event Type:Upper Critical\r\nEvent Severity:Critical\r\nComponent:Zorek Tessarin Baseboard\r\n"
         "Group:Voltage Probe\r\nInstance:Unknown\r\n.\r\nQUIT\r\n"},
        {"ops\xe9@example.org", "a@example.org;b@example.org", "Fan\r\nRSET", nullptr, 2,
         "HELO 127.0.0.1\r\nMAIL FROM:<ops @example.org>\r\nRCPT TO:<a@example.org>\r\nRCPT TO:<b@example.org>\r\n"
         "DATA\r\nSUBJECT:Zorek Server Management Alert:" + std::string(host) + "\r\nCheck Fan  RSET" + check +
         "Event Type:Unknown\r\nEvent Severity:Critical\r\nComponent:Zorek Tessarin Baseboard\r\n"
         "Group:Fan  RSET\r\nInstance:Unknown\r\n.\r\nQUIT\r\n"},
    };
    ASSERT_EQ(dmisp::setValue(board, 1012, 1, {}, "127.0.0.1"), 0u);
    for (const auto& r : rows) {
        SCOPED_TRACE(r.group);
        if (r.sender != nullptr) {
            ASSERT_EQ(dmisp::setValue(board, 1012, 2, {}, r.sender), 0u);
            ASSERT_EQ(dmisp::setValue(board, 1012, 3, {}, r.recipients), 0u);
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
        EXPECT_EQ(peer.received(), r.expected);
        EXPECT_EQ(pEmailConfig, nullptr);
        EXPECT_TRUE(lines().empty()) << "a delivered alert logs nothing";
    }
    // Without a server address nothing is sent or logged.
    ASSERT_EQ(dmisp::setValue(board, 1012, 1, {}, ""), 0u);
    smtpSetPort(1);
    EventRecord record{};
    MoxSendEmail(nullptr, &record);
    EXPECT_TRUE(lines().empty());
    smtpSetPort(25);
    smtpSetLimitMs(8000);
    moxSetSleepHook(nullptr);
}

} // namespace
