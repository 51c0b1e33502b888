#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <syslog.h>

#include "dmisp/dmisp.h"
#include "mif/mif.h"
#include "daemon/events.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "smtppeer.h"
#include "sl/sl.h"
#include "smtp/email.h"

namespace {

constexpr uint32_t emailGroup = 1012;

// The daemon registered with a provider holding the shipped baseboard, whose
// e-mail settings group starts empty.
class EmailComposition : public ::testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/moxemailXXXXXX";
        std::string dir = mkdtemp(pattern);
        std::string error;
        ASSERT_EQ(dmisp::reset(dir + "/db", false, &error), 0) << error;
        board_ = dmisp::install(MOX_SOURCE_DIR "/mifs/baseboard.mif", &error);
        ASSERT_NE(board_, 0u) << error;
        setenv("UXDMIPATH", MOX_SOURCE_DIR "/mifs", 1);
        SLInitialize();
        RegisterWithSLCalls(RegistrationCalls{EventHandler, [] { SysCtrlInitialize(); LcdInitialize(); }});
        ASSERT_EQ(RegisterWithSL(), 0);
        ASSERT_EQ(BaseboardComponentId(), board_);
        ASSERT_EQ(moxHostName(host_), 0);
        smtpSetLimitMs(300); // the silent subject stage
        moxSetSleepHook(SleepCapture::hook);
        moxSetLogHook(LogCapture::hook);
        LogCapture::take();
    }
    void TearDown() override
    {
        moxSetLogHook(nullptr);
        moxSetSleepHook(nullptr);
        smtpSetLimitMs(8000);
        smtpSetPort(25);
        UnregisterWithSL();
        SLCleanup();
        dmisp::shutdown();
    }
    void set(uint32_t attribute, const std::string& value)
    {
        ASSERT_EQ(dmisp::setValue(board_, emailGroup, attribute, {}, value), 0u);
    }
    // Sends the alert of `record` to a server that accepts it; what it received.
    std::string send(EventRecord* record, int recipients)
    {
        ScriptedServer peer(acceptingScript(recipients));
        smtpSetPort(peer.port());
        testing::internal::CaptureStderr();
        MoxSendEmail(nullptr, record);
        testing::internal::GetCapturedStderr();
        EXPECT_EQ(pEmailConfig, nullptr);
        return peer.received();
    }

    uint32_t board_ = 0;
    char host_[MOX_HOST_NAME_SIZE] = {};
};

EventRecord voltageRecord()
{
    EventRecord record{};
    record.eventKind = EVENT_STANDARD;
    record.componentName = "Zorek Tessarin Baseboard";
    record.groupName = "Voltage Probe";
    record.eventTypeText = "Upper Critical";
    record.severityText = "Critical";
    return record;
}

TEST_F(EmailComposition, NoServerSendsNothingAndLogsNothing)
{
    smtpSetPort(1); // nobody listens: a connection would be logged as step 3
    EventRecord record = voltageRecord();
    testing::internal::CaptureStderr();
    MoxSendEmail(nullptr, &record);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
    EXPECT_TRUE(LogCapture::take().empty());
    EXPECT_EQ(pEmailConfig, nullptr);
}

TEST_F(EmailComposition, DefaultAddressesSubjectAndBody)
{
    set(1, "127.0.0.1");
    EventRecord record = voltageRecord();
    std::string admin = std::string("admin@") + host_;
    std::string got = send(&record, 1);
    EXPECT_EQ(got, "HELO 127.0.0.1\r\n"
                   "MAIL FROM:<" + admin + ">\r\n"
                   "RCPT TO:<" + admin + ">\r\n"
                   "DATA\r\n"
                   "SUBJECT:Zorek Server Management Alert:" + host_ + "\r\n"
                   "Check Voltage Probe at server " + host_ + "\r\n"
                   "Event Type:Upper Critical\r\n"
                   "Event Severity:Critical\r\n"
                   "Component:Zorek Tessarin Baseboard\r\n"
                   "Group:Voltage Probe\r\n"
                   "Instance:Unknown\r\n"
                   ".\r\n"
                   "QUIT\r\n");
    EXPECT_TRUE(LogCapture::take().empty()) << "a delivered alert logs nothing";
}

TEST_F(EmailComposition, SettingsAndDmiTextsNeverInjectCommands)
{
    set(1, "127.0.0.1");
    set(2, "ops\xe9@example.org");
    set(3, "a@example.org;b@example.org");
    EventRecord record = voltageRecord();
    record.groupName = "Fan\r\nRSET";
    record.eventTypeText = nullptr;
    std::string got = send(&record, 2);
    EXPECT_NE(got.find("MAIL FROM:<ops @example.org>\r\n"), std::string::npos) << got;
    EXPECT_NE(got.find("RCPT TO:<a@example.org>\r\nRCPT TO:<b@example.org>\r\n"), std::string::npos) << got;
    EXPECT_NE(got.find("Check Fan  RSET at server "), std::string::npos) << got;
    EXPECT_NE(got.find("Event Type:Unknown\r\n"), std::string::npos) << got;
    EXPECT_EQ(got.find("\r\nRSET"), std::string::npos) << "a DMI text became a command";
}

} // namespace
