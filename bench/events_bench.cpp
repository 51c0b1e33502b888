// Events through the registered daemon with the substitute provider: the
// real worker, matchers and actions. Prints one table:
//   events/s, log action only (burst of N, worker busy throughout)
//   events/s, log + LCD + page
//   heap bytes per queued event (worker held up by a slow provider)
//   resident memory and heap in use after 10,000 and after 100,000 events, queue drained
//   (under qemu's user-mode emulator the resident figure grows with every
//   thread ever started, whatever the program frees: the heap figure is the
//   daemon's own)
//   idle event-to-log latency, median and 99th percentile, 200 events 200 ms apart
// Usage: events_bench [events per burst (5000)] [total for the memory check (100000)]
//                     [latency samples (200)]
// It registers as the daemon does and exits 1 when an event is not handled
// within a minute or a figure shows that nothing was measured; the test
// command runs it with tiny sizes (label bench) so that it cannot rot.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <malloc.h>
#include <string>
#include <thread>
#include <vector>

#include "base/log.h"
#include "daemon/events.h"
#include "daemon/startup.h"
#include "dmisp/dmisp.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "testmifs.h"

namespace {

using Clock = std::chrono::steady_clock;

std::atomic<unsigned> logLines{0};
std::atomic<int64_t> lastLogNs{0};

int64_t nowNs()
{
    return std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now().time_since_epoch()).count();
}

void countLine(int, const char* text)
{
    if (std::strncmp(text, "TYPE:", 5) == 0) {
        lastLogNs = nowNs();
        ++logLines;
    }
}

// A standard-table row of the test board's voltage events (type 4).
std::string row(int instance, std::initializer_list<int> actions)
{
    std::string r = "1, 20, 4, " + std::to_string(instance) + ", 0, 0";
    for (int id = 7; id <= 22; ++id) {
        bool on = std::find(actions.begin(), actions.end(), id) != actions.end();
        r += id == 17 ? ", \"\"" : on ? ", 1" : ", 0";
    }
    return r + ", 1, 1, 2";
}

// The test board with a status display and a paging group.
std::string boardWithPanel()
{
    std::string text = boardMif("Test Board");
    std::string panel =
        "start group\n name = \"Status Display\"\n class = \"Zorek|Status Display|002\"\n id = 40\n"
        "start attribute\n name = \"Contents\"\n id = 8\n type = displaystring(128)\n access = read-write\n"
        " value = \"\"\nend attribute\nend group\n"
        "start group\n name = \"Paging\"\n class = \"Zorek|Paging Config|001\"\n id = 41\n"
        "start attribute\n name = \"Page Control\"\n id = 6\n type = displaystring(16)\n access = read-write\n"
        " value = \"\"\nend attribute\nend group\n";
    size_t end = text.rfind("end component");
    return text.substr(0, end) + panel + text.substr(end);
}

long residentKb()
{
    FILE* f = std::fopen("/proc/self/statm", "r");
    long pages = 0, resident = 0;
    if (f != nullptr) {
        if (std::fscanf(f, "%ld %ld", &pages, &resident) != 2)
            resident = 0;
        std::fclose(f);
    }
    return resident * (sysconf(_SC_PAGESIZE) / 1024);
}

uint32_t board = 0;

void raise(bool panel)
{
    dmisp::EventRow instance;
    if (panel)
        instance = {3, {"1"}};
    if (dmisp::raiseEvent(board, {20, {"8"}}, instance) != 0) {
        std::fprintf(stderr, "raiseEvent failed\n");
        std::exit(1);
    }
}

// Waits until `done` holds; a minute without a handled event ends the run.
template <typename Done>
void waitFor(Done done, const char* what)
{
    unsigned handled = EventsHandled();
    for (auto until = Clock::now() + std::chrono::seconds(60); !done();) {
        if (EventsHandled() != handled)
            handled = EventsHandled(), until = Clock::now() + std::chrono::seconds(60);
        if (Clock::now() > until) {
            std::fprintf(stderr, "no progress for a minute: %s (%u events handled)\n", what, EventsHandled());
            std::exit(1);
        }
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
}

void waitHandled(unsigned target)
{
    waitFor([target] { return EventsHandled() >= target && eventsQueued() == 0; }, "events handled");
}

// Events per second from the worker's first take of the burst to its last.
double burst(unsigned n, bool panel)
{
    unsigned start = EventsHandled();
    for (unsigned i = 0; i < n; ++i)
        raise(panel);
    dmisp::waitIndicationsDelivered(60000);
    // The idle worker may still be in its one-second poll: time from its first take.
    waitFor([start] { return EventsHandled() != start; }, "first event of a burst");
    unsigned first = EventsHandled();
    auto t0 = Clock::now();
    waitHandled(start + n);
    double s = std::chrono::duration<double>(Clock::now() - t0).count();
    return (start + n - first) / s;
}

} // namespace

int main(int argc, char** argv)
{
    unsigned n = std::max(2u, argc > 1 ? static_cast<unsigned>(std::atoi(argv[1])) : 5000u);
    unsigned total = argc > 2 ? static_cast<unsigned>(std::atoi(argv[2])) : 100000;
    int samples = std::max(1, argc > 3 ? std::atoi(argv[3]) : 200);
    char pattern[] = "/tmp/moxeventsbenchXXXXXX";
    if (mkdtemp(pattern) == nullptr)
        return 1;
    std::string dir = pattern;
    std::string error;
    if (dmisp::reset(dir + "/db", false, &error) != 0 ||
        dmisp::installText(ownMif(OwnMif{"2.93", {"1, \"Test Board\""}, {}, {}, {row(0, {9}), row(1, {9, 10, 19})}}),
                           "own.mif", &error) == 0 ||
        (board = dmisp::installText(boardWithPanel(), "board.mif", &error)) == 0) {
        std::fprintf(stderr, "%s\n", error.c_str());
        return 1;
    }
    setenv("UXDMIPATH", dir.c_str(), 1);
    moxSetLogHook(countLine);
    SLInitialize();
    RegisterWithSLCalls(daemonRegistrationCalls());
    if (RegisterWithSL() != 0 || CreateEventHandler() != 0) {
        std::fprintf(stderr, "registration failed\n");
        return 1;
    }
    dmisp::waitIndicationsCompleted(20000);
    waitHandled(EventsHandled());
    burst(20, true); // warm the catalogue

    double logOnly = burst(n, false);
    double panel = burst(n / 2, true);
    unsigned lcdWrites = 0;
    {
        std::string contents;
        if (dmisp::getValue(board, 40, 8, {}, &contents) == 0 && !contents.empty())
            lcdWrites = 1;
    }

    // Memory per queued event: the worker is held by a slow confirm while a
    // burst queues up.
    malloc_trim(0);
    size_t heapBefore = mallinfo2().uordblks;
    unsigned handledBefore = EventsHandled();
    dmisp::injectConfirmDelay(3000);
    raise(false); // the worker takes this one and waits for its confirm
    waitFor([handledBefore] { return EventsHandled() != handledBefore; }, "event held by the slow confirm");
    const unsigned queuedBurst = std::min(2000u, n);
    for (unsigned i = 0; i < queuedBurst; ++i)
        raise(false);
    dmisp::waitIndicationsCompleted(60000);
    unsigned queued = eventsQueued();
    size_t heapQueued = mallinfo2().uordblks;
    dmisp::injectConfirmDelay(0);
    waitHandled(handledBefore + queuedBurst + 1);
    double perEvent = queued != 0 ? double(heapQueued - heapBefore) / queued : 0;

    // Resident memory once drained, after 10,000 and after `total` events.
    unsigned done = 0;
    long rss10k = 0;
    size_t heap10k = 0;
    while (done < total) {
        unsigned chunk = std::min(5000u, total - done);
        unsigned start = EventsHandled();
        for (unsigned i = 0; i < chunk; ++i)
            raise(false);
        dmisp::waitIndicationsDelivered(60000);
        waitHandled(start + chunk);
        done += chunk;
        if (done == 10000)
            rss10k = residentKb(), heap10k = mallinfo2().uordblks;
    }
    long rssTotal = residentKb();
    size_t heapTotal = mallinfo2().uordblks;

    // Idle latency: each event raised while the worker idles, 200 ms apart.
    std::vector<double> latency;
    for (int i = 0; i < samples; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        unsigned lines = logLines;
        int64_t t0 = nowNs();
        raise(false);
        waitFor([lines] { return logLines != lines; }, "log line of an idle event");
        latency.push_back((lastLogNs - t0) / 1e6);
    }
    std::sort(latency.begin(), latency.end());

    std::printf("%-52s %14.0f\n", "events/s, log only (worker, substitute provider)", logOnly);
    std::printf("%-52s %14.0f\n", "events/s, log + LCD + page", panel);
    std::printf("%-52s %14s\n", "  (LCD contents written)", lcdWrites ? "yes" : "NO");
    std::printf("%-52s %14.0f\n", "heap bytes per queued event", perEvent);
    std::printf("%-52s %14u\n", "  (events queued at the peak)", queued);
    std::printf("%-52s %14ld\n", "resident KiB after 10,000 events, drained", rss10k);
    std::printf("%-52s %14ld\n", ("resident KiB after " + std::to_string(total) + " events, drained").c_str(),
                rssTotal);
    std::printf("%-52s %14zu\n", "heap bytes in use after 10,000 events, drained", heap10k);
    std::printf("%-52s %14zu\n", ("heap bytes in use after " + std::to_string(total) + " events, drained").c_str(),
                heapTotal);
    std::printf("%-52s %14.1f\n", "idle event-to-log latency median, ms", latency[latency.size() / 2]);
    std::printf("%-52s %14.1f\n", "idle event-to-log latency p99, ms", latency[latency.size() * 99 / 100]);

    // A run that measured nothing fails, whatever its times.
    bool measured = logOnly > 0 && panel > 0 && lcdWrites && queued > 0 && !latency.empty();
    if (!measured)
        std::fprintf(stderr, "nothing measured: an event road did not run\n");

    DestroyEventHandler();
    UnregisterWithSL();
    SLCleanup();
    dmisp::shutdown();
    std::filesystem::remove_all(dir);
    return measured ? 0 : 1;
}
