#include "daemon/events.h"

#include <atomic>
#include <cstring>
#include <ctime>
#include <pthread.h>

#include "actions/actions.h"
#include "base/threadcheck.h"
#include "base/strcase.h"
#include "events/eventrecord.h"
#include "events/oldevent.h"
#include "events/stdevent.h"
#include "hardware/lcd.h"
#include "hardware/sysctrl.h"
#include "mif/mif.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"

namespace {

std::atomic<int> eventThreadRunning{0};
std::atomic<int> threadId{0}; // 1 while the worker is inside its loop
std::atomic<unsigned> numberOfEvents{0};
std::atomic<int> workersInLoop{0}; // for tests: never more than one

// The queue owns the handles on it; the worker is its only remover.
SLHandleListHead slHandleList;

const char* const zorekEventClassName = "Zorek|Error";
const char* const stdEventClassName = "EventGeneration|";

void unknownEventActions(SLHandle* handle)
{
    EventRecord record{};
    record.eventKind = EVENT_UNKNOWN;
    record.componentId = SLEventComponentId(handle, 0);
    record.componentName = ComponentName(record.componentId);
    LogEvent(handle, &record);
}

void installActions(SLHandle* handle)
{
    uint32_t id = SLComponentId(handle);
    AddComponentToList(SLComponentName(handle), id);
    SysCtrlInitialize();
    LcdInitialize();
}

// Set before the worker starts; read by the worker only.
EventCallees callees = eventsDefaultCallees();

void sleepOneSecond()
{
    timespec second{1, 0};
    nanosleep(&second, nullptr);
}

// Wakes the idle worker when an indication is queued (or it is told to stop);
// without a wake-up it still looks at the queue once a second.
pthread_mutex_t wakeMutex = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t wakeCondition;
unsigned wakeUps = 0; // under wakeMutex

void initWake()
{
    pthread_condattr_t attributes;
    pthread_condattr_init(&attributes);
    pthread_condattr_setclock(&attributes, CLOCK_MONOTONIC);
    pthread_cond_init(&wakeCondition, &attributes);
    pthread_condattr_destroy(&attributes);
}

void wakeWorker()
{
    pthread_mutex_lock(&wakeMutex);
    ++wakeUps;
    pthread_cond_signal(&wakeCondition);
    pthread_mutex_unlock(&wakeMutex);
}

// Waits at most a second unless a wake-up came since the last wait.
void waitForWork()
{
    pthread_mutex_lock(&wakeMutex);
    if (wakeUps == 0) {
        timespec until{};
        clock_gettime(CLOCK_MONOTONIC, &until);
        until.tv_sec += 1;
        pthread_cond_timedwait(&wakeCondition, &wakeMutex, &until);
    }
    wakeUps = 0;
    pthread_mutex_unlock(&wakeMutex);
}

// The class string's first 16 characters, read whatever the string's length
// word says (the class test is a prefix test), but never past the end of the
// indication: its stated length, within the handle's buffer.
void classPrefix(SLHandle* handle, const DmiString* classString, char (&prefix)[17])
{
    std::memset(prefix, 0, sizeof prefix);
    const char* text = dmiStringText(classString);
    uint32_t limit = handle->confirmSize;
    uint32_t stated = loadWordAt(handle->command, 2);
    if (SLIndicationType(handle) < 256 && stated < limit)
        limit = stated;
    const char* end = reinterpret_cast<const char*>(handle->confirm) + limit;
    size_t available = text < end ? static_cast<size_t>(end - text) : 0;
    std::memcpy(prefix, text, available < 16 ? available : 16);
}

void eventActions(SLHandle* handle)
{
    const EventCallees& calls = callees;
    switch (eventClass(handle)) {
    case EVENT_VENDOR:
        calls.vendor(handle);
        break;
    case EVENT_STANDARD:
        calls.standard(handle);
        break;
    case EVENT_UNKNOWN:
        calls.unknown(handle);
        break;
    default:
        break;
    }
}

void* eventHandlerThread(void*)
{
    threadId = 1;
    ++workersInLoop;
    while (eventThreadRunning == 1) {
        SLHandle* handle = SLHeadHandle(slHandleList.get());
        if (handle == nullptr) {
            waitForWork();
            continue;
        }
        processEvent(handle);
        SLDestroyHandle(handle);
    }
    --workersInLoop;
    MOX_PUBLISH(&threadId); // the worker's last writes precede the flag
    threadId = 0;
    return nullptr;
}

} // namespace

uint32_t eventClass(SLHandle* handle)
{
    if (SLEventClassCount(handle) == 0)
        return 0;
    const DmiString* classString = SLEventClassStringUnchecked(handle, 0);
    if (classString == nullptr)
        return 0;
    char prefix[17];
    classPrefix(handle, classString, prefix);
    if (strnicmp(prefix, zorekEventClassName, 11) == 0)
        return EVENT_VENDOR;
    if (strnicmp(prefix, stdEventClassName, 16) == 0)
        return EVENT_STANDARD;
    return EVENT_UNKNOWN;
}

void explainEventActions(SLHandle* handle, const Explanation* explain)
{
    uint32_t kind = eventClass(handle);
    const DmiString* classString = kind != 0 ? SLEventClassString(handle, 0) : nullptr;
    if (classString != nullptr)
        explainLine(explain, "event class \"%.*s\": %s", static_cast<int>(dmiStringLength(classString)),
                    dmiStringText(classString),
                    kind == EVENT_STANDARD ? "a standard event" : kind == EVENT_VENDOR ? "a vendor event" : "unknown");
    switch (kind) {
    case EVENT_VENDOR:
        zorekEventActions(handle, explain);
        break;
    case EVENT_STANDARD:
        stdEventActions(handle, explain);
        break;
    default:
        explainLine(explain, "the event's class is neither standard nor vendor: only its unknown-event log line");
        break;
    }
}

EventCallees eventsDefaultCallees()
{
    return EventCallees{StdEventActions, ZorekEventActions, unknownEventActions, installActions};
}

EventCallees eventsSetCallees(const EventCallees& replacement)
{
    EventCallees previous = callees;
    callees = replacement;
    return previous;
}

void processEvent(SLHandle* handle)
{
    ++numberOfEvents;
    switch (SLIndicationType(handle)) {
    case 1:
        eventActions(handle);
        break;
    case 2:
        callees.installed(handle);
        break;
    case 3:
        // An uninstalled component stays in the catalogue.
        SLComponentId(handle);
        break;
    default:
        break;
    }
}

int EventHandler(SLHandle* handle)
{
    if (eventThreadRunning == 0)
        return 0;
    SLHandle* copy = SLDupHandle(handle);
    if (copy == nullptr)
        return 0;
    SLUnlinkHandle(copy);
    SLEnqueueHandle(slHandleList.get(), copy);
    wakeWorker();
    return 0;
}

int CreateEventHandler(void)
{
    slInitHandleList(slHandleList.get());
    static pthread_once_t wakeOnce = PTHREAD_ONCE_INIT;
    pthread_once(&wakeOnce, initWake);
    eventThreadRunning = 1;
    // Counted as running from here, not from its first step: a KillEventThread
    // that comes before the thread has started must still wait for it, or a
    // later CreateEventHandler could leave two workers on one queue.
    threadId = 1;
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    pthread_t thread;
    int rc = pthread_create(&thread, &attributes, eventHandlerThread, nullptr);
    pthread_attr_destroy(&attributes);
    if (rc != 0)
        threadId = 0;
    return rc;
}

void KillEventThread(void)
{
    eventThreadRunning = 0;
    if (threadId == 1)
        wakeWorker();
    while (threadId == 1)
        sleepOneSecond();
    MOX_RECEIVE(&threadId);
}

int DestroyEventHandler(void)
{
    KillEventThread();
    return SLDestroyAllHandles(slHandleList.get());
}

unsigned EventsHandled(void)
{
    return numberOfEvents;
}

int eventsWorkersRunning()
{
    return workersInLoop;
}

unsigned eventsQueued()
{
    return slHandleListLength(slHandleList.get());
}
