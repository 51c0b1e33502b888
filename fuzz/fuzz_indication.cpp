// Indications from a hostile provider: the bytes are one indication as the
// provider would deliver it (its length word and completion callback set to
// the truth). It goes through SLIndicationFunc onto an SL event thread, into
// the worker's classification and both matchers' record building, with a
// provider that refuses every command, so only the indication is read.
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <sched.h>
#include <vector>

#include "base/log.h"
#include "base/sleep.h"
#include "daemon/events.h"
#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slevent.h"
#include "sl/slstring.h"

namespace {

std::atomic<int> completed{0};

void complete(void*)
{
    completed.store(1);
}

// The own component (id 100) and supported components 1 to 3 with MIF ids 1
// (the baseboard), 2 and 5; component ids 1 to 3 are in every seed.
int buildCatalogue()
{
    deleteComponentList(componentList);
    componentList = newComponentInfo(100);
    for (uint32_t id : {1u, 2u, 3u})
        if (ComponentInfo* c = appendToList(componentList, id, id == 3 ? 5 : id))
            c->standardEvents = 1;
    return 0;
}

int initialise()
{
    SLInitialize();
    SLDmiInvoke = [](void*) -> uint32_t { return 1; };
    moxSetLogHook([](int, const char*) {});
    moxSetSleepHook([](unsigned) {});
    SLEventSetHandler([](SLHandle* h) { return processEvent(h), 0; });
    return buildCatalogue();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    if (size < 52 || size > 64 * 1024)
        return 0;
    std::vector<uint8_t> indication(data, data + size); // exactly as long as the indication
    storeWordAt(indication.data(), 2, static_cast<uint32_t>(size));
    storeWordAt(indication.data(), 11, pointerWord(reinterpret_cast<void*>(&complete)));
    completed.store(0);
    unsigned before = EventsHandled();
    SLIndicationFunc(indication.data());
    // Every indication is completed: one that is not is a fault, not a wait for ever.
    const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (completed.load() == 0)
        std::chrono::steady_clock::now() < until ? sched_yield() : (abort(), 0);
    if (EventsHandled() != before + 1)
        abort(); // every delivered indication is classified exactly once
    buildCatalogue(); // an installed component may have grown it
    return 0;
}
