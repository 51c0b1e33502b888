// Timings of the substitute DMI provider: the round trip of one command
// (DmiInvoke to the confirm callback) and a get-row by keys on tables of
// growing size. Prints a table of medians and 99th percentiles.
//
//   dmisp_bench [iterations (20000)] [largest table (10000 rows)]
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "base/bytes.h"
#include "dmisp/dmisp.h"

extern "C" uint32_t DmiInvoke(void* commandBlock);

namespace {

constexpr uint32_t LevelCheck = 0x444D4931;

struct alignas(8) Handle {
    uint8_t block[4096];
    std::atomic<uint32_t> pending;
    uint8_t confirm[16384];
};

void* confirmed(void* block)
{
    reinterpret_cast<Handle*>(block)->pending.store(0);
    return block;
}

void begin(Handle& h, uint32_t code)
{
    std::memset(h.block, 0, sizeof h.block);
    storeWordAt(h.block, 0, LevelCheck);
    storeWordAt(h.block, 1, code);
    storeWordAt(h.block, 2, 4096);
    storeWordAt(h.block, 7, sizeof h.confirm);
    storeWordAt(h.block, 8, pointerWord(h.confirm));
}

// One command, waiting for its confirm; the confirm status.
uint32_t run(Handle& h)
{
    h.pending.store(1);
    if (DmiInvoke(h.block) != 0)
        return 0xFFFFFFFF;
    while (h.pending.load() != 0)
        std::this_thread::yield();
    return loadWordAt(h.block, 11);
}

std::string tableMif(unsigned rows)
{
    std::string s = "start component name = \"Bench " + std::to_string(rows) +
                    "\"\n start group name = \"T\" class = \"Bench|Table|001\" key = 1, 2\n"
                    "  start attribute name = \"A\" id = 1 type = integer end attribute\n"
                    "  start attribute name = \"B\" id = 2 type = integer end attribute\n";
    for (int i = 3; i <= 10; ++i)
        s += "  start attribute name = \"V" + std::to_string(i) + "\" id = " + std::to_string(i) +
             " type = integer value = " + std::to_string(i) + " end attribute\n";
    s += " end group\n start table name = \"T\" class = \"Bench|Table|001\" id = 10\n";
    for (unsigned r = 0; r < rows; ++r)
        s += "  {" + std::to_string(r % 100) + ", " + std::to_string(r / 100) + "}\n";
    return s + " end table\nend component\n";
}

struct Figures {
    double median, p99;
};

Figures summarise(std::vector<double>& us)
{
    std::sort(us.begin(), us.end());
    return {us[us.size() / 2], us[us.size() * 99 / 100]};
}

} // namespace

int main(int argc, char** argv)
{
    unsigned iterations = std::max(1, argc > 1 ? std::atoi(argv[1]) : 20000);
    unsigned largest = argc > 2 ? static_cast<unsigned>(std::atoi(argv[2])) : 10000;
    char dir[] = "/tmp/dmisp-bench-XXXXXX";
    if (mkdtemp(dir) == nullptr)
        return 1;
    std::string error;
    if (dmisp::reset(dir, false, &error) != 0) {
        std::fprintf(stderr, "%s\n", error.c_str());
        return 1;
    }
    static Handle h;
    begin(h, 256);
    storeWordAt(h.block, 16, static_cast<uint32_t>(reinterpret_cast<uintptr_t>(&confirmed)));
    if (run(h) != 0)
        return 1;
    uint32_t mgmt = loadWordAt(h.confirm, 2);

    std::printf("%-40s %10s %12s %12s\n", "operation", "rows", "median us", "p99 us");
    std::mt19937 random(1);
    for (unsigned rows : {100u, 1000u, 10000u}) {
        if (rows > largest && rows != 100)
            break;
        uint32_t component = dmisp::installText(tableMif(rows), "bench.mif", &error);
        if (component == 0) {
            std::fprintf(stderr, "%s\n", error.c_str());
            return 1;
        }
        if (rows == 100) {
            // Round trip of a small command: list one group.
            std::vector<double> us;
            for (unsigned i = 0; i < iterations; ++i) {
                begin(h, 516);
                storeWordAt(h.block, 3, mgmt);
                storeWordAt(h.block, 16, component);
                storeWordAt(h.block, 17, 10);
                auto t0 = std::chrono::steady_clock::now();
                uint32_t status = run(h);
                auto t1 = std::chrono::steady_clock::now();
                if (status != 0)
                    return 1;
                us.push_back(std::chrono::duration<double, std::micro>(t1 - t0).count());
            }
            Figures f = summarise(us);
            std::printf("%-40s %10s %12.1f %12.1f\n", "round trip (list group, 516)", "-", f.median, f.p99);
        }
        std::vector<double> us;
        for (unsigned i = 0; i < iterations; ++i) {
            unsigned r = random() % rows;
            begin(h, 772);
            storeWordAt(h.block, 3, mgmt);
            storeWordAt(h.block, 16, component);
            storeWordAt(h.block, 17, 10);
            storeWordAt(h.block, 18, 2);
            storeWordAt(h.block, 19, 84);
            storeWordAt(h.block, 20, 6);
            // Two integer keys, their values behind the entries.
            const uint32_t keys[6] = {1, 5, 108, 2, 5, 112};
            for (int k = 0; k < 6; ++k)
                storeWordAt(h.block, 21 + k, keys[k]);
            storeWordAt(h.block, 27, r % 100);
            storeWordAt(h.block, 28, r / 100);
            auto t0 = std::chrono::steady_clock::now();
            uint32_t status = run(h);
            auto t1 = std::chrono::steady_clock::now();
            if (status != 0 || loadWordAt(h.confirm + 16 + 4, 0) != 7) {
                std::fprintf(stderr, "row lookup failed: status %u\n", status);
                return 1;
            }
            us.push_back(std::chrono::duration<double, std::micro>(t1 - t0).count());
        }
        Figures f = summarise(us);
        std::printf("%-40s %10u %12.1f %12.1f\n", "get row by two keys (772, from attr 6)", rows, f.median, f.p99);
    }
    dmisp::shutdown();
    std::string cmd = std::string("rm -rf ") + dir;
    return std::system(cmd.c_str()) == 0 ? 0 : 1;
}
