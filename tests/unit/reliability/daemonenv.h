// The daemon registered with a fresh substitute provider, as start-up leaves
// it: RegisterWithSL and CreateEventHandler, the real worker and matchers.
// The own MIF's standard table has one row for the test board's voltage
// events that asks for the log action only; the log hook counts the lines.
#pragma once

#include <atomic>
#include <string>

#include "dmisp/dmisp.h"

class RegisteredDaemon {
public:
    // Sets up the database in a new temporary folder and registers; false
    // (with *error) when any step fails. withWorker: start the event worker.
    bool start(std::string* error, bool withWorker = true);
    // Stops the worker, unregisters, releases SL memory, closes the provider.
    void stop();
    // Only SLCleanup, no command (for a provider that no longer confirms),
    // then the provider is closed; stop() does nothing afterwards.
    void abandon();
    // Raises one voltage event of the test board (severity 8, no instance).
    uint32_t raiseVoltage();
    // Waits until the provider delivered and got back every indication and
    // the worker has processed `handled` events in all; false after timeoutMs.
    bool drain(unsigned handled, unsigned timeoutMs);

    uint32_t board = 0;
    std::string dir;
    bool running = false;
    static std::atomic<unsigned> logLines; // event log lines ("TYPE:...")
    static std::atomic<unsigned> otherLines;
};
