#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <functional>
#include <cstdlib>
#include <mutex>
#include <string>
#include <syslog.h>
#include <thread>
#include <vector>

#include "actions/actions.h"
#include "actions/uxaction.h"
#include "base/log.h"
#include "daemon/events.h"
#include "dmisp/dmisp.h"
#include "mif/mif.h"
#include "base/sleep.h"
#include "obx/obxapi.h"
#include "simdriver.h"
#include "sl/sl.h"
#include "sl/slevent.h"
#include "sl/slhandle.h"
#include "testmifs.h"

namespace {

using Codes = std::vector<uint32_t>;

std::mutex recordedLock;
Codes recorded;
EventRecord lastRecord;
std::vector<std::pair<int, std::string>> logged;

template <uint32_t Code>
int recordAction(SLHandle*, EventRecord* record)
{
    std::lock_guard<std::mutex> guard(recordedLock);
    recorded.push_back(Code);
    lastRecord = *record;
    lastRecord.keyList = nullptr; // owned by the matcher
    return 0;
}

const ActionEntry recordingTable[] = {
    {7, recordAction<7>},   {8, recordAction<8>},   {9, recordAction<9>},   {10, recordAction<10>},
    {11, recordAction<11>}, {12, recordAction<12>}, {13, recordAction<13>}, {14, recordAction<14>},
    {15, recordAction<15>}, {16, recordAction<16>}, {18, recordAction<18>}, {19, recordAction<19>},
    {20, recordAction<20>}, {21, recordAction<21>}, {22, recordAction<22>}, {0, nullptr},
};

// A row of the standard table (keys 1-6, actions 7..6+n, 30, 31, 32).
std::string stdRow(int mif, int group, int type, int instance, int severity, Codes on, int enabled = 1, int n = 16)
{
    std::string row = "{ " + std::to_string(mif) + ", " + std::to_string(group) + ", " + std::to_string(type) + ", " +
                      std::to_string(instance) + ", 0, " + std::to_string(severity);
    for (int id = 7; id < 7 + n; ++id) {
        bool set = false;
        for (uint32_t c : on)
            set = set || c == static_cast<uint32_t>(id);
        row += id == 17 ? ", \"\"" : set ? ", 1" : ", 0";
    }
    return row + ", " + std::to_string(enabled) + ", 1, 2 }\n";
}

std::string vendorRow(int mif, int group, int instance, int attribute, long value, int state, Codes on)
{
    std::string row = "{ " + std::to_string(mif) + ", " + std::to_string(group) + ", " + std::to_string(instance) +
                      ", " + std::to_string(attribute) + ", " + std::to_string(value) + ", " + std::to_string(state);
    for (int id = 7; id <= 22; ++id) {
        bool set = false;
        for (uint32_t c : on)
            set = set || c == static_cast<uint32_t>(id);
        row += id == 17 ? ", \"\"" : set ? ", 1" : ", 0";
    }
    return row + ", 1 }\n";
}

// The daemon registered with a fresh provider database holding the given
// own MIF, the test board (MIF id 1), the other board (MIF id 2) and a
// board the daemon does not support.
class Events : public ::testing::Test {
protected:
    void start(const std::string& own)
    {
        char pattern[] = "/tmp/moxeventsXXXXXX";
        dir_ = mkdtemp(pattern);
        std::string error;
        ASSERT_EQ(dmisp::reset(dir_ + "/db", false, &error), 0) << error;
        ownId_ = dmisp::installText(own, "own.mif", &error);
        ASSERT_NE(ownId_, 0u) << error;
        board_ = dmisp::installText(boardMif("Test Board"), "board.mif", &error);
        ASSERT_NE(board_, 0u) << error;
        other_ = dmisp::installText(boardMif("Other Board"), "other.mif", &error);
        unsupported_ = dmisp::installText(boardMif("Unlisted Board"), "unlisted.mif", &error);
        setenv("UXDMIPATH", dir_.c_str(), 1);
        SLInitialize();
        ASSERT_EQ(RegisterWithSL(), 0);
        ASSERT_EQ(GetMifId(board_), 1u);
        // Each indication is processed on its SL event thread as the worker
        // would, without the worker's one-second idle polls.
        SLEventSetHandler([](SLHandle* h) {
            processEvent(h);
            return 0;
        });
        settle(); // the installs above announce themselves too
        recorded.clear();
        logged.clear();
        saved_ = actionsSetHandlers(recordingTable);
        moxSetLogHook([](int priority, const char* text) {
            std::lock_guard<std::mutex> guard(recordedLock);
            logged.emplace_back(priority, text);
        });
    }
    void TearDown() override
    {
        moxSetLogHook(nullptr);
        actionsSetHandlers(saved_);
        UnregisterWithSL();
        SLCleanup();
        dmisp::shutdown();
    }
    // Waits until every indication raised so far has been handled: the
    // provider hears of an indication's completion only then.
    static void settle()
    {
        EXPECT_TRUE(dmisp::waitIndicationsCompleted(10000));
    }
    Codes deliver(const std::function<uint32_t()>& raise)
    {
        unsigned before = EventsHandled();
        EXPECT_EQ(raise(), 0u);
        settle();
        EXPECT_EQ(EventsHandled(), before + 1);
        std::lock_guard<std::mutex> guard(recordedLock);
        Codes got = recorded;
        recorded.clear();
        return got;
    }
    // A voltage event of `component` with severity `severity` (8 or 16) and
    // the instance row `key` (0: no instance class).
    Codes voltage(uint32_t component, int key, int severity = 8)
    {
        return deliver([=] {
            dmisp::EventRow instance;
            if (key != 0)
                instance = {3, {std::to_string(key)}};
            return dmisp::raiseEvent(component, {20, {std::to_string(severity)}}, instance);
        });
    }
    // A vendor error of `component` with the voltage probe row `key` (0: only class 0).
    Codes vendor(uint32_t component, int key)
    {
        return deliver([=] {
            dmisp::EventRow instance;
            if (key != 0)
                instance = {3, {std::to_string(key)}};
            return dmisp::raiseVendorEvent(component, {30, {}}, instance);
        });
    }

    std::string dir_;
    uint32_t ownId_ = 0, board_ = 0, other_ = 0, unsupported_ = 0;
    const ActionEntry* saved_ = nullptr;
};

TEST_F(Events, StandardRowSelection)
{
    struct Case {
        const char* what;
        std::string rows;
        int board; // 1 test board, 2 other board, 3 unsupported, 0 own component
        int key;
        int severity;
        Codes expected;
    } cases[] = {
        {"exact instance row", stdRow(1, 20, 4, 1, 0, {9, 8}) + stdRow(1, 20, 4, 0, 0, {7}), 1, 1, 8, {8, 9}},
        {"falls back to instance 0", stdRow(1, 20, 4, 1, 0, {9, 8}) + stdRow(1, 20, 4, 0, 0, {7}), 1, 2, 8, {7}},
        {"disabled row runs nothing and does not fall back",
         stdRow(1, 20, 4, 1, 0, {8}, 0) + stdRow(1, 20, 4, 0, 0, {7}), 1, 1, 8, {}},
        {"baseboard severity 16 uses the severity-0 row", stdRow(1, 20, 4, 1, 0, {16, 10}), 1, 1, 16, {10, 16}},
        {"other kinds match their severity", stdRow(2, 20, 4, 1, 8, {9}) + stdRow(2, 20, 4, 1, 0, {7}), 2, 1, 8, {9}},
        {"other kinds: no row for severity 16", stdRow(2, 20, 4, 1, 8, {9}), 2, 1, 16, {}},
        {"unsupported component", stdRow(1, 20, 4, 0, 0, {8}), 3, 1, 8, {}},
        {"run order", stdRow(1, 20, 4, 1, 0, {7, 8, 9, 10, 11, 12, 13, 14, 15, 16, 18, 19, 20, 21, 22}), 1, 1, 8,
         {8, 7, 9, 10, 16, 20, 19, 21, 22, 11, 12, 13, 14, 15, 18}},
        {"no row at all", stdRow(1, 21, 4, 0, 0, {8}), 1, 1, 8, {}},
    };
    for (const Case& c : cases) {
        start(ownMif(c.rows, vendorRow(1, 0, 0, 0, 0, 0, {8})));
        uint32_t component = c.board == 1 ? board_ : c.board == 2 ? other_ : c.board == 3 ? unsupported_ : ownId_;
        EXPECT_EQ(voltage(component, c.key, c.severity), c.expected) << c.what;
        TearDown();
    }
    start(ownMif(stdRow(1, 20, 4, 1, 0, {8}), ""));
}

TEST_F(Events, StandardRecordFields)
{
    start(ownMif(stdRow(1, 20, 4, 1, 0, {8}), ""));
    ASSERT_EQ(voltage(board_, 1), Codes{8});
    EXPECT_EQ(lastRecord.eventKind, 1u);
    EXPECT_EQ(lastRecord.componentId, board_);
    EXPECT_STREQ(lastRecord.componentName, "Test Board");
    EXPECT_EQ(lastRecord.eventGroupId, 20u);
    EXPECT_EQ(lastRecord.groupId, 3u);
    EXPECT_STREQ(lastRecord.groupName, "Voltage Probe");
    EXPECT_EQ(lastRecord.eventType, 4u);
    EXPECT_STREQ(lastRecord.eventTypeText, "Voltage Above Upper Critical");
    EXPECT_EQ(lastRecord.severity, 8u);
    EXPECT_STREQ(lastRecord.severityText, "Critical");
    EXPECT_STREQ(lastRecord.systemText, "Power");
    EXPECT_STREQ(lastRecord.subsystemText, "Voltage");
}

TEST_F(Events, ShortRowsRunOnlyTheFirstEntries)
{
    // Rows read after attribute 6 hold 7..12, 30, 31 and 32: nine attributes,
    // so the walk stops after nine entries and positions past them read 0.
    start(ownMif(stdRow(1, 20, 4, 1, 0, {7, 8, 9, 10, 11, 12}, 1, 6), "", 6));
    EXPECT_EQ(voltage(board_, 1), (Codes{8, 7, 9, 10}));
}

TEST_F(Events, VendorFallbackOrder)
{
    const long any = -2147483648L;
    struct Case {
        const char* what;
        std::string rows;
        int board;
        int key;
        Codes expected;
    } cases[] = {
        {"exact row", vendorRow(1, 3, 1, 1, 0, 0, {8}) + vendorRow(1, 3, 1, 1, any, 0, {9}) +
                          vendorRow(1, 3, 0, 1, 0, 0, {7}) + vendorRow(1, 3, 0, 1, any, 0, {10}),
         1, 1, {8}},
        {"any value of the instance before the value on any instance",
         vendorRow(1, 3, 1, 1, any, 0, {9}) + vendorRow(1, 3, 0, 1, 0, 0, {7}) + vendorRow(1, 3, 0, 1, any, 0, {10}),
         1, 1, {9}},
        {"the value on any instance", vendorRow(1, 3, 0, 1, 0, 0, {7}) + vendorRow(1, 3, 0, 1, any, 0, {10}), 1, 1, {7}},
        {"any value on any instance", vendorRow(1, 3, 0, 1, any, 0, {10}), 1, 2, {10}},
        {"only class 0", vendorRow(1, 0, 0, 0, 0, 0, {16}), 1, 0, {16}},
        {"other kinds use value and state", vendorRow(2, 3, 1, 1, 1, 2, {9}) + vendorRow(2, 3, 1, 1, 0, 0, {7}), 2, 1,
         {9}},
        {"no row", vendorRow(1, 5, 0, 1, any, 0, {10}), 1, 1, {}},
    };
    for (const Case& c : cases) {
        start(ownMif(stdRow(1, 20, 4, 1, 0, {8}), c.rows));
        Codes got = vendor(c.board == 1 ? board_ : other_, c.key);
        EXPECT_EQ(got, c.expected) << c.what;
        if (c.key == 1 && !c.expected.empty() && got == c.expected) {
            EXPECT_EQ(lastRecord.eventKind, 2u);
            EXPECT_EQ(lastRecord.groupId, 3u);
            EXPECT_EQ(lastRecord.attributeId, 1u);
            EXPECT_EQ(lastRecord.attributeValue, 1u);
            EXPECT_EQ(lastRecord.errorState, 2u);
            EXPECT_STREQ(lastRecord.attributeName, "Index");
        }
        TearDown();
    }
    start(ownMif(stdRow(1, 20, 4, 1, 0, {8}), ""));
}

} // namespace

namespace {

// The real handlers, with the system log captured.
class Notifications : public Events {
protected:
    void start(const std::string& own)
    {
        Events::start(own);
        actionsSetHandlers(nullptr);
    }
    std::vector<std::pair<int, std::string>> lines()
    {
        std::lock_guard<std::mutex> guard(recordedLock);
        auto got = logged;
        logged.clear();
        return got;
    }
};

using Lines = std::vector<std::pair<int, std::string>>;

TEST_F(Notifications, StandardEventTexts)
{
    start(ownMif(stdRow(1, 20, 4, 1, 0, {8, 9, 16}) + stdRow(1, 20, 4, 0, 0, {9}), ""));
    testing::internal::CaptureStderr();
    voltage(board_, 1, 8);
    std::string console = testing::internal::GetCapturedStderr();
    EXPECT_EQ(console, "MOX: Event type \"Voltage Above Upper Critical\" reported for \"Voltage Probe\" group.\n");
    EXPECT_EQ(lines(), (Lines{{LOG_WARNING, "TYPE:Voltage Above Upper Critical COMPONENT:Test Board GROUP:Voltage Probe "
                                            "SEVERITY:Critical ROW:CPU Core SYSTEM:Power SUBSYSTEM:Voltage\n"},
                              {LOG_EMERG, "Please check group Voltage Probe on this machine\n\n"}}));

    struct Case {
        int key, severity, priority;
        const char* row;
        const char* severityText;
    } cases[] = {
        {2, 16, LOG_ERR, "3.3V", "Fatal"},
        {2, 4, LOG_INFO, "3.3V", "Non-Critical"},
    };
    for (const Case& c : cases) {
        voltage(board_, c.key, c.severity);
        std::string expected = std::string("TYPE:Voltage Above Upper Critical COMPONENT:Test Board GROUP:Voltage Probe "
                                           "SEVERITY:") +
                               c.severityText + " ROW:" + c.row + " SYSTEM:Power SUBSYSTEM:Voltage\n";
        EXPECT_EQ(lines(), (Lines{{c.priority, expected}})) << c.severity;
    }
}

TEST_F(Notifications, RowLabels)
{
    start(ownMif(stdRow(1, 20, 4, 0, 0, {9}), ""));
    // The fan table has neither "Short Name" nor "Description": its first key.
    deliver([&] { return dmisp::raiseEvent(board_, {20, {"8"}}, {5, {"4"}}); });
    auto got = lines();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_NE(got[0].second.find(" ROW:4 SYSTEM:"), std::string::npos) << got[0].second;
    // No instance data: no key list.
    voltage(board_, 0, 8);
    got = lines();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_NE(got[0].second.find(" ROW:Not Applicable SYSTEM:"), std::string::npos) << got[0].second;
}

TEST_F(Notifications, VendorEventTexts)
{
    start(ownMif(stdRow(1, 20, 4, 0, 0, {9}), vendorRow(1, 3, 0, 1, -2147483648L, 0, {8, 9}) +
                                                     vendorRow(1, 0, 0, 0, 0, 0, {9})));
    testing::internal::CaptureStderr();
    vendor(board_, 1);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "MOX: Event reported for Index attribute in the Voltage Probe group.\n");
    EXPECT_EQ(lines(), (Lines{{LOG_ERR, "NAME:Failed COMPONENT:Test Board GROUP:Voltage Probe ROW:CPU Core "
                                        "ATTRIBUTE:Index N/A\n"}}));
    vendor(board_, 0);
    EXPECT_EQ(lines(), (Lines{{LOG_ERR, "NAME:Failed COMPONENT:Test Board GROUP:Unknown Group ROW:Not Applicable "
                                        "ATTRIBUTE:Unknown Attribute N/A\n"}}));
}

TEST_F(Notifications, UnknownClassIsLoggedByTheWorker)
{
    start(ownMif(stdRow(1, 20, 4, 0, 0, {9}), ""));
    SLHandle* h = SLCreateHandle(0);
    std::memset(h->command, 0, SL_COMMAND_SIZE);
    std::memset(h->confirm, 0, h->confirmSize);
    storeWordAt(h->command, 1, 1);
    storeWordAt(h->command, 2, 4096);
    storeWordAt(h->confirm, 0, 1);        // one class
    storeWordAt(h->confirm, 1, board_);   // its component
    storeWordAt(h->confirm, 2, 100);      // class string
    storeWordAt(h->confirm, 25, 14);
    std::memcpy(h->confirm + 104, "DMTF|Other|001", 14);
    processEvent(h);
    SLDestroyHandle(h);
    EXPECT_EQ(lines(), (Lines{{LOG_NOTICE, "DMI Unknown Indication Test Board\n"}}));
}

TEST_F(Notifications, ResetReachesTheControllerUnlessNotificationsOnly)
{
    obxsimReset();
    hDevice1 = 0;
    IpmiVersion = 0;
    obxSetOs(&simOs);
    moxSetSleepHook([](unsigned) {}); // the 3 s before the watchdog starts
    start(ownMif(stdRow(1, 20, 4, 1, 0, {8, 9, 15}), ""));

    bNotificationOnly = 1;
    testing::internal::CaptureStderr();
    voltage(board_, 1, 8);
    bNotificationOnly = 0;
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "MOX: Event type \"Voltage Above Upper Critical\" reported for \"Voltage Probe\" group.\n");
    EXPECT_EQ(lines().size(), 1u) << "the log line";
    EXPECT_EQ(obxsimOpenCount(), 0) << "nothing reached the driver";
    EXPECT_TRUE(obxsimRequests().empty());

    // The same row without the setting arms and starts the watchdog.
    testing::internal::CaptureStderr();
    voltage(board_, 1, 8);
    testing::internal::GetCapturedStderr();
    EXPECT_TRUE(obxsimWaitForLog("watchdog expired: hard reset", 3000));

    moxSetSleepHook(nullptr);
    if (hDevice1 != 0)
        obxsimClose(hDevice1);
    hDevice1 = 0;
    obxSetOs(nullptr);
}

} // namespace
