// "mox --check": what the daemon will rely on, checked read-only.
#pragma once

#include <cstdio>

// One line per check to `out`, starting "ok", "warning" or "error" and a short
// reason. 0 without errors, 1 with errors, 2 when the provider cannot be
// reached.
int moxCheck(FILE* out);
