// Process entry: marker files, the start-up sequence and the stop.
#pragma once

#include <cstdio>

#include "mif/mif.h"

// The process entry's work; never returns.
[[noreturn]] void moxMain();
// 4: a marker file disables the daemon; 0: start-up proceeds.
int check_for_moxnot(void);
void* mainThread(void* unused);
// What the daemon registers with: its indication handler, and the search for
// the baseboard's groups that ends a registration. Whatever registers as the
// daemon does (init_routine, the benchmarks) passes it to RegisterWithSLCalls.
RegistrationCalls daemonRegistrationCalls();
// 0, or the non-zero result of RegisterWithSL.
int init_routine(void);
int unload(void);
// Registration ends by finding the baseboard groups, system control first.
void findBaseboardGroups();
// Opens /dev/null on each of descriptors 0, 1 and 2 that is closed: the number
// opened, or -1 when /dev/null cannot be opened.
int openStandardDescriptors();

// Where the marker check looks and how it runs the floppy commands.
struct MarkerCheck {
    const char* localVornmox;
    const char* localMox;
    const char* floppyMox;
    const char* floppyVornmox;
    const char* mountCommand;
    const char* umountCommand;
    int (*run)(const char* command); // system() in the daemon
    FILE* out;                       // standard output in the daemon
};
MarkerCheck defaultMarkerCheck();
// The marker file in the working directory that disables the daemon (the
// first found), or null; the floppy is not looked at.
const char* localMarker(const MarkerCheck& check);
int checkForMoxNot(const MarkerCheck& check);
