// "mox --test-email": a test alert sent with the e-mail settings the DMI
// service provider holds, every SMTP step shown with the server's reply.
#pragma once

#include <cstdio>

// Reads the settings (nothing is installed or migrated and no event is
// taken), sends the test alert and writes each step to `out`. 0 when the
// server took the alert; 1 when a step failed, no server is set or the
// provider cannot be reached.
int moxTestEmail(FILE* out);
