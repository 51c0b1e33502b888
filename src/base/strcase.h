// Case-insensitive comparisons returning only -1, 0 or 1.
#pragma once

// Compares at most n characters; a non-positive n gives 0. Bytes from 0x80 up
// are taken as negative values and so sort below ASCII. A null string sorts
// before any other.
int strnicmp(const char* a, const char* b, int n);
int stricmp(const char* a, const char* b);
