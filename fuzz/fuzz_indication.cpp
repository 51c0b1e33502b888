// Indications from a hostile provider: the bytes are one indication as the
// provider would deliver it (its length word and completion callback are set
// to the truth). It goes through SLIndicationFunc onto an SL event thread and
// into the worker's classification and both matchers' record building, with
// the real matchers and a provider that refuses every command, so every
// catalogue and actions-table lookup fails and only the indication is read.
#include <atomic>
#include <cstdint>
#include <cstdlib>
#include <cstring>
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

uint32_t refuse(void*)
{
    return 1;
}

void complete(void*)
{
    completed.store(1);
}

int handler(SLHandle* h)
{
    processEvent(h);
    return 0;
}

// The own component (id 100) and three supported components with MIF ids 1
// (the baseboard), 2 and 5; component ids 1 to 3 are in every seed.
void buildCatalogue()
{
    deleteComponentList(componentList);
    componentList = newComponentInfo(100);
    for (uint32_t id : {1u, 2u, 3u}) {
        ComponentInfo* c = appendToList(componentList, id, id == 3 ? 5 : id);
        if (c != nullptr)
            c->standardEvents = 1;
    }
}

int initialise()
{
    SLInitialize();
    SLDmiInvoke = refuse;
    moxSetLogHook([](int, const char*) {});
    moxSetSleepHook([](unsigned) {});
    SLEventSetHandler(handler);
    buildCatalogue();
    return 0;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int once = initialise();
    (void)once;
    if (size < 52 || size > 64 * 1024)
        return 0;
    // The provider's own buffer, exactly as long as the indication.
    std::vector<uint8_t> indication(data, data + size);
    storeWordAt(indication.data(), 2, static_cast<uint32_t>(size));
    storeWordAt(indication.data(), 11, pointerWord(reinterpret_cast<void*>(&complete)));
    completed.store(0);
    unsigned before = EventsHandled();
    SLIndicationFunc(indication.data());
    while (completed.load() == 0)
        sched_yield();
    if (EventsHandled() != before + 1)
        abort(); // every delivered indication is classified exactly once
    // An installed component may have grown the catalogue.
    buildCatalogue();
    return 0;
}
