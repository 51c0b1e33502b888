// The command line: a version flag, a help flag, the e-mail test, the check
// and the explanation of an event. The
// daemon itself takes no arguments: with none, or with any other, it starts
// as it always has.
#pragma once

#include <cstdio>

// Handles "--version", "--help", "--test-email" and "--check" as the only
// argument, and "--explain" with its own.
// Returns true with *status set when the process should exit with it; false
// when the daemon is to start.
bool moxCommandLine(int argc, char** argv, FILE* out, int* status);
