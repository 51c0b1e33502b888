// Readiness and status messages to a service manager that asks for them
// through the environment variable NOTIFY_SOCKET: one datagram per message
// on a unix datagram socket. Without the variable nothing is sent; a message
// that cannot be sent is dropped.
#pragma once

// Sends `message` (for example "READY=1" or "STATUS=Handling events").
void moxNotify(const char* message);
