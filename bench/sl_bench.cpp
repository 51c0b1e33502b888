// Timed driver for the SL command path: get-row-by-keys commands per second
// against an in-process scripted provider (completed inline in the entry
// point, and completed from a provider thread) and, when it is built, the
// substitute provider; and the cost of one name lookup over 20 components.
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>

#ifdef MOX_HAVE_DMISP
#include <cstdlib>
#include <unistd.h>

#include "dmisp/dmisp.h"
#endif

#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slkey.h"
#include "sl/slmap.h"
#include "sl/slstring.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr uint32_t componentCount = 20;

// Writes the answer to one command into its confirm buffer.
void answer(uint8_t* block)
{
    uint32_t code = loadWordAt(block, 1);
    auto* confirm = static_cast<uint8_t*>(wordPointer(loadWordAt(block, 8)));
    uint32_t status = 0;
    if (code == 514) {
        uint32_t after = loadWordAt(block, 16);
        if (after >= componentCount) {
            status = 2; // end of the list
        } else {
            uint32_t id = after + 1;
            std::string name = "Component " + std::to_string(id);
            storeWordAt(confirm, 0, id);
            storeWordAt(confirm, 2, 100);
            storeWord(confirm + 100, static_cast<uint32_t>(name.size()));
            std::memcpy(confirm + 104, name.data(), name.size());
        }
    } else if (code == 772) {
        // A row with one integer attribute.
        storeWordAt(confirm, 0, loadWordAt(block, 17));
        storeWordAt(confirm, 1, 0);
        storeWordAt(confirm, 3, 1);
        storeWordAt(confirm, 5, loadWordAt(block, 20));
        storeWordAt(confirm, 6, DMI_INTEGER);
        storeWordAt(confirm, 7, 64);
        storeWordAt(confirm, 16, 42);
    }
    storeWordAt(block, 10, status == 0 ? 1 : 0);
    storeWordAt(block, 11, status);
}

uint32_t inlineProvider(void* block)
{
    answer(static_cast<uint8_t*>(block));
    dmiConfirmFunc(block);
    return 0;
}

// A provider thread that completes each command posted to it.
std::atomic<uint8_t*> posted{nullptr};
std::atomic<bool> stopping{false};

void providerThread()
{
    while (!stopping.load()) {
        uint8_t* block = posted.exchange(nullptr);
        if (block == nullptr) {
            std::this_thread::yield();
            continue;
        }
        answer(block);
        dmiConfirmFunc(block);
    }
}

uint32_t threadedProvider(void* block)
{
    posted.store(static_cast<uint8_t*>(block));
    return 0;
}

// A key list with one integer key.
SLKeyList* oneKey()
{
    auto* keys = static_cast<SLKeyList*>(SLCreateString(sizeof(SLKeyList)));
    std::memset(keys, 0, sizeof *keys);
    keys->count = 1;
    keys->keys[0].attributeId = 1;
    keys->keys[0].type = DMI_INTEGER;
    keys->keys[0].value = SLCreateString(4);
    storeWord(keys->keys[0].value, 7);
    return keys;
}

double commandsPerSecond(SLInvokeFunction provider, double seconds)
{
    SLDmiInvoke = provider;
    SLHandle* h = SLCreateHandle(0);
    SLKeyList* keys = oneKey();
    long commands = 0;
    auto start = Clock::now();
    auto end = start + std::chrono::duration<double>(seconds);
    while (Clock::now() < end) {
        for (int i = 0; i < 256; ++i) {
            if (SLGetRow(h, 1, 10, 2, keys) != 0 || SLRowUnsignedValue(h, 0) != 42) {
                std::fprintf(stderr, "get-row failed\n");
                return 0;
            }
        }
        commands += 256;
    }
    double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
    SLDeleteKeyList(keys);
    SLDestroyHandle(h);
    return commands / elapsed;
}

double lookupMicroseconds(double seconds)
{
    SLDmiInvoke = inlineProvider;
    const char* last = "Component 20";
    long lookups = 0;
    auto start = Clock::now();
    auto end = start + std::chrono::duration<double>(seconds);
    while (Clock::now() < end) {
        for (int i = 0; i < 64; ++i) {
            if (SLMapComponentNameToId(last) != componentCount) {
                std::fprintf(stderr, "lookup failed\n");
                return 0;
            }
        }
        lookups += 64;
    }
    double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
    return elapsed * 1e6 / lookups;
}

#ifdef MOX_HAVE_DMISP
// Get-row by keys against the substitute provider: a table of 20 rows.
double substituteProviderRate(double seconds)
{
    char directory[] = "/tmp/sl-bench-XXXXXX";
    if (mkdtemp(directory) == nullptr)
        return 0;
    std::string mif = "start component\n  name = \"Bench\"\n"
                      "  start group\n    name = \"Table\"  class = \"Zorek|Table|001\"  key = 1\n"
                      "    start attribute name = \"Index\" id = 1 type = integer end attribute\n"
                      "    start attribute name = \"Reading\" id = 2 type = integer value = 42 end attribute\n"
                      "  end group\n  start table\n    name = \"Table\"  class = \"Zorek|Table|001\"  id = 10\n";
    for (int i = 1; i <= 20; ++i)
        mif += "    {" + std::to_string(i) + ", 42}\n";
    mif += "  end table\nend component\n";
    std::string error;
    uint32_t component = 0;
    if (dmisp::reset(directory, false, &error) == 0)
        component = dmisp::installText(mif, "bench.mif", &error);
    double rate = 0;
    SLDmiInvoke = DmiInvoke;
    SLHandle* h = SLCreateHandle(0);
    if (component != 0 && SLDmiRegisterMgmt(h, nullptr) == 0) {
        SLKeyList* keys = oneKey();
        long commands = 0;
        auto start = Clock::now();
        auto end = start + std::chrono::duration<double>(seconds);
        while (Clock::now() < end && rate >= 0) {
            for (int i = 0; i < 64; ++i) {
                storeWord(keys->keys[0].value, 1 + (commands + i) % 20);
                if (SLGetRow(h, component, 10, 0, keys) != 0 || SLRowUnsignedValue(h, 1) != 42) {
                    std::fprintf(stderr, "get-row failed: status %u\n", SLCnfStatus(h));
                    rate = -1;
                    break;
                }
            }
            commands += 64;
        }
        if (rate == 0)
            rate = commands / std::chrono::duration<double>(Clock::now() - start).count();
        // 19 more components; then look up the 20th by name.
        for (int i = 2; i <= 20 && rate > 0; ++i) {
            std::string other = "start component\n  name = \"Other " + std::to_string(i) +
                                "\"\n  start group\n    name = \"G\"  class = \"Zorek|G|001\"  id = 1\n"
                                "    start attribute name = \"A\" id = 1 type = integer value = 1 end attribute\n"
                                "  end group\nend component\n";
            if (dmisp::installText(other, "other.mif", &error) == 0)
                rate = 0;
        }
        long lookups = 0;
        auto lookupStart = Clock::now();
        auto lookupEnd = lookupStart + std::chrono::duration<double>(seconds);
        while (rate > 0 && Clock::now() < lookupEnd) {
            if (SLMapComponentNameToId("Other 20") == 0) {
                std::fprintf(stderr, "lookup failed\n");
                break;
            }
            ++lookups;
        }
        if (lookups > 0)
            std::printf("name lookup over 20 components, substitute provider: %8.1f us\n",
                        std::chrono::duration<double>(Clock::now() - lookupStart).count() * 1e6 / lookups);
        SLDmiUnregisterMgmt(h);
        SLDeleteKeyList(keys);
    } else {
        std::fprintf(stderr, "substitute provider not usable: %s\n", error.c_str());
    }
    SLDestroyHandle(h);
    dmisp::shutdown();
    std::string remove = std::string("rm -rf '") + directory + "'";
    if (std::system(remove.c_str()) != 0)
        std::fprintf(stderr, "cannot remove %s\n", directory);
    return rate > 0 ? rate : 0;
}
#endif

} // namespace

int main(int argc, char** argv)
{
    double seconds = argc > 1 ? std::atof(argv[1]) : 2.0;
    SLInitialize();

    double inlineRate = commandsPerSecond(inlineProvider, seconds);
    std::printf("get-row by keys, confirm inline:            %10.0f commands/s\n", inlineRate);

    std::thread provider(providerThread);
    double threadedRate = commandsPerSecond(threadedProvider, seconds);
    stopping = true;
    provider.join();
    std::printf("get-row by keys, confirm from a thread:     %10.0f commands/s\n", threadedRate);

#ifdef MOX_HAVE_DMISP
    double substituteRate = substituteProviderRate(seconds);
    std::printf("get-row by keys, substitute provider:       %10.0f commands/s\n", substituteRate);
    if (substituteRate <= 0)
        return 1;
#endif

    double lookup = lookupMicroseconds(seconds);
    std::printf("name lookup, match at the 20th component:   %10.2f us (%.2f us per command)\n", lookup,
                lookup / componentCount);

    SLCleanup();
    return inlineRate > 0 && threadedRate > 0 && lookup > 0 ? 0 : 1;
}
