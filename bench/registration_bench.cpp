// Start-up registration against provider databases of 1, 20 and 100
// components: wall time of RegisterWithSL and the DMI commands it issued.
// Plain timed driver; prints one table. It registers as the daemon does.
//   registration_bench [largest database (100 components)] [repeats (5)]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <unistd.h>
#include <vector>

#include "daemon/startup.h"
#include "dmisp/dmisp.h"
#include "mif/mif.h"
#include "sl/sl.h"

namespace {

// A small component with an event-generation group and a three-row table.
std::string componentText(int i)
{
    std::string n = std::to_string(i);
    return "start component\n    name = \"Bench Component " + n +
           "\"\n    description = \"bench\"\n"
           "    start group\n        name = \"Events\"\n        class = \"EventGeneration|Bench|001\"\n"
           "        id = 2\n        start attribute\n            name = \"Event Type\"\n            id = 1\n"
           "            type = integer\n            access = read-only\n            value = 1\n"
           "        end attribute\n    end group\n"
           "    start group\n        name = \"Probes\"\n        class = \"Bench|Probe|001\"\n        id = 3\n"
           "        key = 1\n        start attribute\n            name = \"Index\"\n            id = 1\n"
           "            type = integer\n            access = read-only\n            value = 0\n"
           "        end attribute\n    end group\n"
           "    start table\n        name = \"Probes\"\n        class = \"Bench|Probe|001\"\n        id = 3\n"
           "        { 1 }\n        { 2 }\n        { 3 }\n    end table\nend component\n";
}

double registerOnce(uint64_t* commands)
{
    uint64_t before = dmisp::commandsReceived();
    auto start = std::chrono::steady_clock::now();
    int rc = RegisterWithSL();
    auto end = std::chrono::steady_clock::now();
    *commands = dmisp::commandsReceived() - before;
    if (rc != 0) {
        fprintf(stderr, "RegisterWithSL failed with %d\n", rc);
        exit(1);
    }
    UnregisterWithSL();
    return std::chrono::duration<double, std::milli>(end - start).count();
}

} // namespace

int main(int argc, char** argv)
{
    const int largest = argc > 1 ? std::atoi(argv[1]) : 100;
    const int repeats = std::max(1, argc > 2 ? std::atoi(argv[2]) : 5);
    SLInitialize();
    RegisterWithSLCalls(daemonRegistrationCalls());
    setenv("UXDMIPATH", MOX_SOURCE_DIR "/mifs", 1);
    char pattern[] = "/tmp/moxbenchXXXXXX";
    if (mkdtemp(pattern) == nullptr)
        return 1;
    std::string dir = pattern;
    printf("%-11s %-26s %12s %12s %10s\n", "components", "start", "median ms", "min ms", "commands");
    for (int count : {1, 20, 100}) {
        if (count > largest && count != 1)
            break;
        std::string db = dir + "/db" + std::to_string(count);
        std::string error;
        if (dmisp::reset(db, false, &error) != 0) {
            fprintf(stderr, "%s\n", error.c_str());
            return 1;
        }
        // The baseboard (supported) and count - 1 other components.
        if (dmisp::install(MOX_SOURCE_DIR "/mifs/baseboard.mif", &error) == 0) {
            fprintf(stderr, "%s\n", error.c_str());
            return 1;
        }
        for (int i = 1; i < count; ++i)
            dmisp::installText(componentText(i), "bench.mif");

        uint64_t firstCommands = 0;
        double first = registerOnce(&firstCommands);
        printf("%-11d %-26s %12.2f %12.2f %10llu\n", count, "first (installs mox.mif)", first, first,
               static_cast<unsigned long long>(firstCommands));

        std::vector<double> times(static_cast<size_t>(repeats));
        uint64_t commands = 0;
        for (double& t : times)
            t = registerOnce(&commands);
        std::sort(times.begin(), times.end());
        printf("%-11d %-26s %12.2f %12.2f %10llu\n", count, "later (own MIF current)", times[repeats / 2], times[0],
               static_cast<unsigned long long>(commands));
    }
    dmisp::shutdown();
    std::filesystem::remove_all(dir);
    return 0;
}
