// The event queue and its worker thread.
//
// Indications arrive on short-lived SL event threads; EventHandler copies each
// into the queue, and one detached worker takes them in order, classifies them
// by indication type and class string, and runs the matchers.
#pragma once

#include <cstdint>

#include "actions/actions.h"
#include "sl/sltypes.h"

// The indication handler: queues a copy of `handle` (never takes `handle`
// itself); drops it while no worker runs. Always 0.
int EventHandler(SLHandle* handle);
// Empties the queue and starts the worker; the thread-creation result.
int CreateEventHandler(void);
// Stops the worker, then frees every handle still queued.
int DestroyEventHandler(void);
// Tells the worker to stop and returns once it has left its loop.
void KillEventThread(void);
// Handles taken from the queue so far, of every indication type.
unsigned EventsHandled(void);

// What the worker calls for each class of event; tests replace them.
struct EventCallees {
    void (*standard)(SLHandle* indication);
    void (*vendor)(SLHandle* indication);
    void (*unknown)(SLHandle* indication);
    void (*installed)(SLHandle* indication);
};
EventCallees eventsSetCallees(const EventCallees& callees);
EventCallees eventsDefaultCallees();
// Workers inside their loop (at most one).
int eventsWorkersRunning();
// Handles waiting in the queue.
unsigned eventsQueued();
// Runs the worker's classification of one handle on the calling thread.
void processEvent(SLHandle* handle);
// The class of an event indication as the worker tells it by its class 0
// string: EVENT_VENDOR, EVENT_STANDARD or EVENT_UNKNOWN; 0 without a class.
uint32_t eventClass(SLHandle* handle);
// The worker's handling of one event indication, told to `explain` instead of
// carried out: nothing is done.
void explainEventActions(SLHandle* handle, const Explanation* explain);
