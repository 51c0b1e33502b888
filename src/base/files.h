// Opening files whose type the daemon does not control.
#pragma once

#include <cstdio>

// Opens `path` for reading without ever blocking in the open (a FIFO in its
// place has no writer) and only when it is a regular file: a FIFO, device or
// directory gives null with errno EINVAL; a failed open gives null with the
// open's errno.
FILE* moxOpenRegular(const char* path);
// Whether `path` can be opened for reading; the open does not block, and the
// file's type does not matter.
bool moxCanOpen(const char* path);
