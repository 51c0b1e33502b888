// Action dispatch and the local notifications.
#pragma once

#include <cstdint>

#include "events/eventrecord.h"
#include "sl/sltypes.h"

// Every action handler receives the event's indication and record; results
// are ignored.
typedef int (*ActionHandler)(SLHandle* indication, EventRecord* record);

// An explanation: what the matchers and the dispatcher would do for an event,
// told line by line instead of done. They take one where they act; null means
// carry the actions out.
struct Explanation {
    void (*line)(void* context, const char* text); // one line, without its line end
    void* context;
};
// One formatted line, control bytes as blanks; nothing when `explain` is null.
void explainLine(const Explanation* explain, const char* format, ...) __attribute__((format(printf, 2, 3)));
// The keys of a key list as "id=value ...", for an explanation.
void explainKeys(const SLKeyList* keys, char* out, unsigned size);
// The event record's kind, component and values, as one explanation line.
void explainRecord(const Explanation* explain, const EventRecord* record);

// Tells what an action would do for the event without doing anything of it:
// each line it gives to `explain` goes out behind the action's name.
typedef void (*ActionDescriber)(SLHandle* indication, EventRecord* record, const Explanation* explain);

struct ActionEntry {
    uint32_t code; // 0 ends the table
    ActionHandler handler;
    ActionDescriber describe = nullptr;
    const char* name = nullptr; // as mox(8) names the action
};

// Action code and the position of its switch in an actions-table row read
// after attribute 6; the table order is the order in which actions run.
struct ActionOrder {
    uint32_t code; // 0 ends the table
    uint32_t position;
};
extern const ActionOrder ActionID[];
extern const ActionEntry lscActions[];

// Runs the handler of `code` when `value` is non-zero.
void DoAction(uint32_t code, uint32_t value, SLHandle* indication, EventRecord* record);
// The same, or with an explanation the description of what the handler would
// do; it then does nothing.
void dispatchAction(uint32_t code, uint32_t value, SLHandle* indication, EventRecord* record,
                    const Explanation* explain);
// The name of action `code` in the handler table, null for none.
const char* actionName(uint32_t code);
// Whether action `code` controls the system (shutdown, power off, reset, NMI).
bool isSystemControlAction(uint32_t code);

int ConsoleMessage(SLHandle* indication, EventRecord* record);
int BeepSpeaker(SLHandle* indication, EventRecord* record);
// Hands the event to the alarm daemon, then writes its system-log line.
int LogEvent(SLHandle* indication, EventRecord* record);
int BroadcastMessage(SLHandle* indication, EventRecord* record);
int writeToLCD(SLHandle* indication, EventRecord* record);
int issuePage(SLHandle* indication, EventRecord* record);
int MoxIdLedOff(SLHandle* indication, EventRecord* record);
int MoxIdLedBlink(SLHandle* indication, EventRecord* record);
int shutdownOS(SLHandle* indication, EventRecord* record);
int shutdownAndPowerOff(SLHandle* indication, EventRecord* record);
int shutdownAndresetsystem(SLHandle* indication, EventRecord* record);
int powerOff(SLHandle* indication, EventRecord* record);
int resetSystem(SLHandle* indication, EventRecord* record);
int issueNMI(SLHandle* indication, EventRecord* record);

// The event message in a new SL string (caller deletes it with
// SLDeleteString); null when it cannot be created.
char* createEventMessage(EventRecord* record);
// The text naming the row the event concerns: "Not Applicable" without a key
// list, else the row's name, else its first key's value. `handle` is a working
// handle whose confirm buffer is overwritten.
void rowLabel(SLHandle* handle, EventRecord* record, char* out, unsigned size);

// The handler table DoAction consults; tests record the calls with their own.
const ActionEntry* actionsSetHandlers(const ActionEntry* table);
