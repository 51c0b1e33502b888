// Standard and vendor matching against the substitute provider, and the
// alarm hand-off to the alarm daemon.
#include <csignal>
#include <cstdlib>
#include <fstream>
#include <future>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include "actions/actions.h"
#include "base/bytes.h"
#include "events/dmi2kob.h"
#include "provider.h"
#include "sl/slaccess.h"
#include "sl/slevent.h"

namespace {

using Codes = std::vector<uint32_t>;
Codes recorded;
EventRecord lastRecord;

template <uint32_t Code>
int recordAction(SLHandle*, EventRecord* record)
{
    std::lock_guard<std::mutex> guard(Provider::lock());
    recorded.push_back(Code);
    lastRecord = *record;
    return 0;
}

const ActionEntry recordingTable[] = {{7, recordAction<7>},   {8, recordAction<8>},   {9, recordAction<9>},
    {10, recordAction<10>}, {11, recordAction<11>}, {12, recordAction<12>}, {16, recordAction<16>}, {0, nullptr}};

// Keys: MIF id, group, type, instance, 0, severity; then enable, system, subsystem.
std::string stdRow(const char* keys, std::initializer_list<int> on, const char* enabled = "1", int n = 16)
{
    return actionRow(keys, on, std::string(", ") + enabled + ", 1, 2", n);
}
// Keys: MIF id, group, instance, attribute, value, state; then enable.
std::string vendorRow(const char* keys, std::initializer_list<int> on) { return actionRow(keys, on, ", 1"); }

// The daemon registered with the given actions tables, the test board (MIF
// id 1) and the other board (2); each indication is processed on its SL
// event thread as the worker would.
class Events : public Provider {
protected:
    uint32_t component[3] = {};
    const ActionEntry* saved = nullptr;

    void start(OwnMif m)
    {
        freshDatabase();
        component[0] = install(ownMif(m));
        component[1] = install(boardMif("Test Board"));
        component[2] = install(boardMif("Other Board"));
        ASSERT_EQ(RegisterWithSL(), 0);
        SLEventSetHandler([](SLHandle* e) { return processEvent(e), 0; });
        ASSERT_TRUE(dmisp::waitIndicationsCompleted(10000)); // the installs announce themselves
        recorded.clear();
        saved = actionsSetHandlers(recordingTable);
    }
    void TearDown() override { actionsSetHandlers(saved), Provider::TearDown(); }
    // The actions run for an event of board `b` (0: a vendor error) with
    // the voltage-probe row `key` (0: no instance).
    Codes raise(int b, int key, int severity = 0, uint32_t group = 20)
    {
        dmisp::EventRow instance;
        if (key != 0)
            instance = {3, {std::to_string(key)}};
        EXPECT_EQ(severity == 0 ? dmisp::raiseVendorEvent(component[b], {30, {}}, instance)
                                : dmisp::raiseEvent(component[b], {group, {std::to_string(severity)}}, instance), 0u);
        EXPECT_TRUE(dmisp::waitIndicationsCompleted(10000));
        std::lock_guard<std::mutex> guard(lock());
        return std::exchange(recorded, {});
    }
};

TEST_F(Events, StandardAndVendorRowSelectionAndRowsClaimingTooManyAttributes)
{
    const char* exact = "1, 3, 1, 1, 0, 0";
    const char* anyValue = "1, 3, 1, 1, -2147483648, 0";
    const char* anyInstance = "1, 3, 0, 1, 0, 0";
    const char* anyBoth = "1, 3, 0, 1, -2147483648, 0";
    struct Row { const char* what; std::vector<std::string> rows; int board, key, severity; uint32_t group; Codes expected; } rows[] = {
        {"exact instance row", {stdRow("1, 20, 4, 1, 0, 0", {9, 8}), stdRow("1, 20, 4, 0, 0, 0", {7})}, 1, 1, 8, 20, {8, 9}},
        {"falls back to instance 0", {stdRow("1, 20, 4, 1, 0, 0", {9}), stdRow("1, 20, 4, 0, 0, 0", {7})}, 1, 2, 8, 20, {7}},
        {"disabled row, no fallback", {stdRow("1, 20, 4, 1, 0, 0", {8}, "0"), stdRow("1, 20, 4, 0, 0, 0", {7})},
         1, 1, 8, 20, {}},
        {"baseboard severity 16 on the severity-0 row", {stdRow("1, 20, 4, 1, 0, 0", {16, 10})}, 1, 1, 16, 20, {10, 16}},
        {"other kinds by severity", {stdRow("2, 20, 4, 1, 0, 8", {9}), stdRow("2, 20, 4, 1, 0, 0", {7})}, 2, 1, 8, 20, {9}},
        {"a 6-attribute event row runs nothing", {actionRow("1, 21, 4, 0, 0, 0", {8}, ", 1, 1, 0")}, 1, 0, 8, 21, {}},
        // Vendor rows (severity 0): exact, any value, any instance, both, in that order.
        {"vendor exact", {vendorRow(exact, {8}), vendorRow(anyValue, {9}), vendorRow(anyInstance, {7}), vendorRow(anyBoth, {10})}, 1, 1, 0, 0, {8}},
        {"vendor any value", {vendorRow(anyValue, {9}), vendorRow(anyInstance, {7}), vendorRow(anyBoth, {10})}, 1, 1, 0, 0, {9}},
        {"vendor any instance", {vendorRow(anyInstance, {7}), vendorRow(anyBoth, {10})}, 1, 1, 0, 0, {7}},
        {"vendor other board", {vendorRow("2, 3, 1, 1, 1, 2", {9}), vendorRow("2, 3, 1, 1, 0, 0", {7})}, 2, 1, 0, 0, {9}},
    };
    for (const Row& r : rows) {
        SCOPED_TRACE(r.what);
        OwnMif m;
        (r.severity == 0 ? m.vendor : m.standard) = r.rows;
        start(m);
        EXPECT_EQ(raise(r.board, r.key, r.severity, r.group), r.expected);
    }
    EXPECT_EQ(lastRecord.eventKind, 2u);
    EXPECT_EQ(lastRecord.errorState, 2u);
    // The vendor line's priority follows the error value (the baseboard's one row serves every
    // value); a group that cannot be listed gets no broadcast, and the line still comes.
    OwnMif v;
    v.vendor = {vendorRow(anyBoth, {9, 16})};
    start(v);
    actionsSetHandlers(nullptr);
    for (auto [error, priority] :
         {std::pair{0, LOG_INFO}, {1, LOG_WARNING}, {2, LOG_ERR}, {3, LOG_ERR}, {-1, LOG_ERR}}) {
        SLDmiInvoke = error >= 0 ? SLInvokeFunction(DmiInvoke) : [](void* b) -> uint32_t { // group listings refused
            return loadWordAt(b, 1) == 516 ? 1 : DmiInvoke(b);
        };
        ASSERT_EQ(dmisp::setValue(component[1], 30, 1, {}, std::to_string(error < 0 ? 2 : error)), 0u);
        lines(), raise(1, 1);
        std::vector<int> priorities;
        for (const auto& line : lines())
            priorities.push_back(line.first);
        EXPECT_EQ(priorities, (error < 0 ? std::vector{priority} : std::vector{priority, LOG_EMERG})) << error;
    }
    // Rows read after attribute 6 of nine attributes: only nine entries run.
    OwnMif m;
    m.actions = 6;
    m.standard = {stdRow("1, 20, 4, 1, 0, 0", {7, 8, 9, 10, 11, 12}, "1", 6)};
    start(m);
    EXPECT_EQ(raise(1, 1, 8), (Codes{8, 7, 9, 10}));
    // A row that claims four billion attributes made the matcher walk every one
    // (hours on the worker); only the entries inside the indication are walked.
    m.actions = 16;
    m.standard = {stdRow("1, 20, 4, 0, 0, 0", {8})};
    start(m);
    SLEventSetHandler([](SLHandle* e) {
        SLEventSelectRowCnf(e, 0, 0);
        storeWordAt(const_cast<uint8_t*>(pGetRow(e)), 3, 0xFFFFFFF0u);
        auto done = std::async(std::launch::async, [e] { processEvent(e); });
        if (done.wait_for(std::chrono::seconds(10)) != std::future_status::ready) {
            ADD_FAILURE() << "still walking after 10 s";
            std::_Exit(1); // the walk cannot be interrupted
        }
        return 0;
    });
    EXPECT_EQ(raise(1, 0, 8), Codes{8});
}

TEST(AlarmRecord, Bytes)
{
    uint32_t three = 3;
    SLKeyList key{};
    key.count = 1;
    key.keys[0] = {1, 5, &three};
    struct Row { uint32_t kind, group; const char* groupName; const char* bytes; } rows[] = {
        {1, 12, "Power Supply", "01000000070000000c00000009000000100000000300000001000000"},
        {1, 12, "power supply", "01000000070000000c00000009000000100000000300000000000000"},
        {2, 0, nullptr, "01000000070000000000000009000000100000000000000000000000"},
    };
    for (const auto& r : rows) {
        EventRecord record{};
        record = {r.kind, 7, r.group, 0, 0, 0, &key, 9, 0, 16, 0, 0, nullptr, r.groupName, nullptr, nullptr, nullptr,
                  nullptr, nullptr, nullptr};
        AlarmRecord alarm = makeAlarmRecord(&record);
        std::string hex;
        for (size_t i = 0; i < sizeof alarm; ++i)
            hex += std::string(1, "0123456789abcdef"[reinterpret_cast<uint8_t*>(&alarm)[i] >> 4]) +
                   "0123456789abcdef"[reinterpret_cast<uint8_t*>(&alarm)[i] & 15];
        EXPECT_EQ(hex, r.bytes) << r.groupName;
    }
    key.keys[0].value = nullptr;
    EventRecord record{};
    record.groupId = 4;
    record.keyList = &key;
    EXPECT_EQ(getRowName(&record), 0u) << "a key without a value";
}

// The lock file names the alarm daemon's pid: anything else is a stale lock,
// removed with the FIFO; a live peer that never opens the FIFO costs at most
// the open wait.
TEST(AlarmHandOff, LocksAndPeers)
{
    signal(SIGPIPE, SIG_IGN);
    char pattern[] = "/tmp/moxkobXXXXXX";
    const std::string dir = mkdtemp(pattern), lock = dir + "/kobLock", fifo = dir + "/kob";
    const KobPaths paths{lock.c_str(), fifo.c_str(), "/proc/%s/cmdline", 300};
    // lock: null no lock file, "%" the pid of a sleeper called `program`.
    struct Row { const char* lock; const char* program; bool lockKept, fifoKept; } rows[] = {
        {nullptr, "", false, true},      {"", "", false, false},         {"self\n", "", false, false},
        {"/etc/passwd\n", "", false, false}, {"12x\n", "", false, false}, {"999999999\n", "", true, true},
        {"%", "kobdx", false, false},    {"%", "/usr/sbin/kobd", false, false}, {"%", "kobd", true, true},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(std::string(r.lock ? r.lock : "none") + r.program);
        unlink(lock.c_str());
        mkfifo(fifo.c_str(), 0600);
        pid_t pid = 0;
        if (r.lock != nullptr && r.lock[0] == '%') {
            if ((pid = fork()) == 0) {
                execl("/bin/sleep", r.program, "20", static_cast<char*>(nullptr));
                _exit(1);
            }
            for (std::string cmd; cmd.rfind(r.program, 0) != 0;) // until the exec is done
                std::getline(std::ifstream("/proc/" + std::to_string(pid) + "/cmdline"), cmd, '\0');
            std::ofstream(lock) << pid << "\n";
        } else if (r.lock != nullptr) {
            std::ofstream(lock) << r.lock;
        }
        EventRecord record{};
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(kobProcessAlarmAt(paths, &record), 0);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1500));
        struct stat st;
        EXPECT_EQ(stat(lock.c_str(), &st) == 0, r.lockKept);
        EXPECT_EQ(stat(fifo.c_str(), &st) == 0, r.fifoKept);
        if (pid != 0) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }
    EXPECT_EQ(defaultKobPaths().openWaitMs, 2000u);
    std::filesystem::remove_all(dir);
}

} // namespace
