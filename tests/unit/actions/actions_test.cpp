#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include "actions/actionlog.h"
#include "actions/actions.h"
#include "actions/uxaction.h"
#include "base/log.h"
#include "base/sleep.h"
#include "base/strcase.h"
#include "hardware/sysaction.h"
#include "simdriver.h"

namespace {

std::string calls;
std::vector<std::pair<int, std::string>> lines;
int shutDowns = 0;
std::vector<unsigned> sleeps;

TEST(Dispatch, RunOrderSwitchPositionsAndFirstMatch)
{
    std::string order;
    for (const ActionOrder* e = ActionID; e->code != 0; ++e)
        order += std::to_string(e->code) + "@" + std::to_string(e->position) + " ";
    EXPECT_EQ(order, "8@1 7@0 9@2 10@3 16@9 20@13 19@12 21@14 22@15 11@4 12@5 13@6 14@7 15@8 18@11 ");
    static const ActionEntry table[] = {{8, [](SLHandle*, EventRecord*) { return calls += "8 ", 0; }},
                                        {8, [](SLHandle*, EventRecord*) { return calls += "second ", 0; }},
                                        {20, [](SLHandle*, EventRecord*) { return calls += "20 ", 0; }}, {0, nullptr}};
    const ActionEntry* saved = actionsSetHandlers(table);
    EventRecord record{};
    // Switched off; first match only; any non-zero switch; the alert name is no action.
    for (auto [code, position] : {std::pair{8u, 0u}, {8u, 1u}, {20u, 5u}, {17u, 1u}})
        DoAction(code, position, nullptr, &record);
    actionsSetHandlers(saved);
    EXPECT_EQ(calls, "8 20 ");
}

using SystemActions = SimDriverTest;

// Each wrapper asks for its own capability bit, then passes its code and delay
// on; `word` holds that bit and whatever the code needs below.
TEST_F(SystemActions, CapabilityCodeAndDelayOfEachWrapper)
{
    const std::string armed = "watchdog set: use 0x04 action ", started = " countdown 1; watchdog started: countdown 1; ";
    struct Row { const char* name; ActionHandler handler; uint32_t bit, word; std::string effect; int shutDowns; } rows[] = {
        {"shutdownOS", shutdownOS, 0x08, 0x08, "", 1},
        {"shutdownAndPowerOff", shutdownAndPowerOff, 0x40, 0xC0, "shutdown code 2 delay 400; ", 1},
        {"shutdownAndresetsystem", shutdownAndresetsystem, 0x10, 0x30, "shutdown code 1 delay 400; ", 1},
        {"powerOff", powerOff, 0x01, 0x01, armed + "power down" + started, 0},
        {"resetSystem", resetSystem, 0x02, 0x02, armed + "hard reset" + started, 0},
        {"issueNMI", issueNMI, 0x04, 0x04, "chassis control: nmi; ", 0}};
    moxSetShutDownFunction([] { return ++shutDowns, -1; }), moxSetSleepHook([](unsigned) {});
    for (const Row& row : rows) {
        for (int run = 0; run < 3; ++run) { // allowed; its bit missing; notifications only
            SetUp(), shutDowns = 0;
            MoxActionCapabilityWord = run == 1 ? 0x7FF & ~row.bit : run == 0 ? row.word : 0x7FF;
            bNotificationOnly = run == 2 ? 1 : 0;
            EXPECT_EQ(row.handler(nullptr, nullptr), 0);
            EXPECT_EQ(actions(), run == 0 ? row.effect : "") << row.name << " " << run;
            EXPECT_EQ(shutDowns, run == 0 ? row.shutDowns : 0) << row.name << " " << run;
        }
    }
    moxSetShutDownFunction(nullptr), moxSetSleepHook(nullptr);
    MoxActionCapabilityWord = 0x7FF, bNotificationOnly = 0;
}

TEST(Notify, LogLinesAndPriorities)
{
    uint32_t key = 42;
    SLKeyList keys{0, 1, {{1, 5, &key}}, nullptr}, valueless{0, 1, {{1, 5, nullptr}}, nullptr};
    const std::string standard = "TYPE:Warm COMPONENT:Unknown GROUP:Fan SEVERITY:Unknown ROW:",
                      rest = " SYSTEM:Unknown SUBSYSTEM:Unknown\n";
    struct Row { uint32_t kind, severity; SLKeyList* keys; int priority; std::string line; } rows[] = {
        {EVENT_STANDARD, 1, nullptr, LOG_INFO, standard + "Not Applicable" + rest},
        {EVENT_STANDARD, 2, &keys, LOG_INFO, standard + "42" + rest}, // no row name: the first key
        {EVENT_STANDARD, 2, &valueless, LOG_INFO, ""}, // a key without a value is never read
        {EVENT_STANDARD, 4, nullptr, LOG_INFO, ""}, {EVENT_STANDARD, 8, nullptr, LOG_WARNING, ""},
        {EVENT_STANDARD, 16, nullptr, LOG_ERR, ""}, {EVENT_STANDARD, 32, nullptr, LOG_ERR, ""},
        {EVENT_UNKNOWN, 1, nullptr, LOG_NOTICE, "DMI Unknown Indication Unknown\n"}};
    moxSetLogHook([](int priority, const char* text) { lines.emplace_back(priority, text); });
    for (const Row& row : rows) {
        lines.clear();
        EventRecord record{};
        record.eventKind = row.kind, record.keyList = row.keys, record.severity = row.severity;
        record.groupName = "Fan", record.eventTypeText = "Warm";
        LogEvent(nullptr, &record);
        const std::string line = row.line.empty() ? standard + "Not Applicable" + rest : row.line;
        EXPECT_EQ(lines, (decltype(lines){{row.priority, line}})) << row.kind << " severity " << row.severity;
    }
    moxSetLogHook(nullptr);
}

TEST(OsServices, CaseInsensitiveComparisons)
{
    struct Row { const char *a, *b; int n, expected; } rows[] = { // n -1: stricmp
        {"ZOREK|error", "Zorek|Error", 11, 0}, {"EventGeneration", "EventGeneration|", 16, -1}, {"abc", "abd", 2, 0},
        {"abd", "ABC", 3, 1}, {"abc", "abcdef", -1, -1}, {"Same", "sAME", -1, 0}, {nullptr, "", -1, -1},
        {"", nullptr, -1, 1}, {nullptr, nullptr, -1, 0}, {"x", "y", 0, 0}, {"\xe9", "a", 1, -1}, {"a", "z", 1, -1}};
    for (const Row& r : rows)
        EXPECT_EQ(r.n < 0 ? stricmp(r.a, r.b) : strnicmp(r.a, r.b, r.n), r.expected)
            << (r.a ? r.a : "null") << " / " << (r.b ? r.b : "null") << " n=" << r.n;
}

// The action log's option follows the same rule; neither option switches the other.
TEST(OsServices, NotificationOnlyRule)
{
    struct Row { std::string content; uint32_t before, after, actionLog = 0; } rows[] = {
        {"NotificationOnly = TRUE\n", 0, 1}, {"notificationonly=false\n", 1, 0}, {"other = true\n", 0, 0},
        {"# notificationonly = true\n", 0, 0}, {"   # notificationonly = true\n", 0, 1}, // '#' only in column 1
        {"notificationonly = true\nnotificationonly = false\n", 0, 0}, {"notificationonly = false\nother\n", 1, 0},
        {std::string(490, 'x') + "notificationonly = true\n", 0, 0}, // split over two pieces
        {std::string(600, 'y') + " notificationonly true\n", 0, 1},
        {"notificationonly = true\nActionLog = TRUE\nnotificationonly = off\n", 0, 0, 1},
        {"actionlog = true\nactionlog = no\nnotificationonly = true\n", 0, 1, 0}, {"#actionlog = true\n", 0, 0, 0},
    };
    const std::string path = "/tmp/moxcfg" + std::to_string(getpid());
    for (const Row& row : rows) {
        std::ofstream(path) << row.content;
        bNotificationOnly = row.before, bActionLog = 0;
        EXPECT_EQ(processCfgFile(path.c_str()), 1);
        EXPECT_EQ(std::make_pair(bNotificationOnly, bActionLog), std::make_pair(row.after, row.actionLog))
            << row.content;
    }
    unlink(path.c_str());
    EXPECT_EQ(processCfgFile(path.c_str()), 0);
    bNotificationOnly = bActionLog = 0;
}

TEST(OsServices, DelaySleepsWholeSecondsAtLeastOne)
{
    moxSetSleepHook([](unsigned ms) { sleeps.push_back(ms); });
    for (int32_t ms : {3000, 2999, 999, 0, -5, 40000})
        MoxDelay(ms);
    moxSetSleepHook(nullptr);
    EXPECT_EQ(sleeps, (std::vector<unsigned>{3000, 2000, 1000, 1000, 1000, 40000}));
    const auto start = std::chrono::steady_clock::now(); // a real sleep keeps its sub-second part
    moxSleepMs(50);
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(50));
}

TEST(OsServices, ShutdownExecutesInitZeroWithNoBlockedSignals)
{
    // /bin/sh started as "init" "0" runs the script "0" of its working directory,
    // which records its command line and blocked signals with builtins only.
    char pattern[] = "/tmp/moxinitXXXXXX";
    const std::string dir = mkdtemp(pattern);
    std::ofstream(dir + "/0") << "while read key value; do case $key in SigBlk:) b=$value;; esac; done < /proc/$$/status\n"
                                 "tr '\\000' ' ' < /proc/$$/cmdline > record\necho \"/$b\" >> record\n";
    sigset_t all;
    sigfillset(&all);
    if (fork() == 0)
        _exit(pthread_sigmask(SIG_SETMASK, &all, nullptr) + chdir(dir.c_str()) + shutDownOsWith("/bin/sh") + 99);
    int status = 0;
    wait(&status);
    std::ifstream in(dir + "/record");
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "init 0 /0000000000000000\n") << status;
    moxSetLogHook([](int priority, const char* t) { lines.emplace_back(priority, t); }), lines.clear();
    EXPECT_EQ(shutDownOsWith("/nonexistent/init"), -1);
    moxSetLogHook(nullptr);
    EXPECT_EQ(lines, (decltype(lines){{LOG_ERR, "MOX - cannot execute /nonexistent/init for the OS shutdown: No such "
                                                "file or directory\n"}}));
}

} // namespace
