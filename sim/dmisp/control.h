// The control socket: a unix stream socket on which the command-line
// client and tests send requests that runControl executes.
//
// Request: a 32-bit argument count, then each argument as a 32-bit length
// and its bytes. Reply: the 32-bit exit code, a 32-bit length and the
// output text. One request per connection.
#pragma once

#include <string>

namespace dmisp {

// Starts serving `path` on a thread of its own; false with *error.
bool startControl(const std::string& path, std::string* error);
// Stops the thread and removes the socket; nothing when not serving.
void stopControl();

} // namespace dmisp
