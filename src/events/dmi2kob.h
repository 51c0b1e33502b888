// Hand-off of logged events to the sibling alarm daemon kobd.
#pragma once

#include <cstdint>

#include "events/eventrecord.h"

// The record written to the alarm daemon's FIFO; host byte order.
struct AlarmRecord {
    uint8_t recordType; // always 1
    uint8_t padding1[3];
    uint32_t componentId;
    uint32_t groupId;
    uint32_t eventGroupId;
    uint32_t severity;
    uint32_t instance;
    uint8_t powerFlag; // group name holds "Voltage" or "Power"
    uint8_t padding2[3];
};
static_assert(sizeof(AlarmRecord) == 28);

// Writes one record for the event when kobd runs: bytes written (28), or 0.
int KOBProcessAlarm(EventRecord* record);
// The instance of the record: the first key's value of a group's row, else 0.
uint32_t getRowName(EventRecord* record);

// Where the hand-off looks: the lock file, the FIFO and the command line of a
// process ("%s" stands for the process id).
struct KobPaths {
    const char* lockFile;
    const char* fifo;
    const char* cmdline;
    unsigned openWaitMs; // how long to wait for the reader to open the FIFO
};
KobPaths defaultKobPaths();
// What the lock file says of the alarm peer; the process id it names in `pid`.
// Looks only: the hand-off removes a stale lock and the FIFO.
enum class KobPeer {
    None,    // no lock file that can be read
    Stale,   // it names no process id, or a process that is not kobd
    Gone,    // the process it names cannot be looked at (ended); left alone
    Running, // kobd runs
};
KobPeer kobPeerAt(const KobPaths& paths, char (&pid)[20]);
int kobProcessAlarmAt(const KobPaths& paths, EventRecord* record);
AlarmRecord makeAlarmRecord(EventRecord* record);
