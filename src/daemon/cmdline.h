// The command line: a version flag, a help flag and the e-mail test. The
// daemon itself takes no arguments: with none, or with any other, it starts
// as it always has.
#pragma once

#include <cstdio>

// Handles "--version", "--help" and "--test-email" as the only argument.
// Returns true with *status set when the process should exit with it; false
// when the daemon is to start.
bool moxCommandLine(int argc, char** argv, FILE* out, int* status);
