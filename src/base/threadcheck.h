// What the thread checkers (valgrind's helgrind and DRD) cannot see for
// themselves: they know locks but not C++ atomics, so an ordering that an
// atomic provides is described to them with client requests. Outside valgrind
// each costs a few instructions and does nothing; without valgrind's headers
// the macros compile to nothing.
#pragma once

#if __has_include(<valgrind/helgrind.h>)
#include <valgrind/helgrind.h>
// The word at `address` is only accessed atomically.
#define MOX_ATOMIC_WORD(address) ANNOTATE_BENIGN_RACE_SIZED(address, sizeof *(address), "atomic word")
// Everything this thread wrote before is seen by a thread that then passes
// MOX_RECEIVE on the same object (a release store and its acquire load).
#define MOX_PUBLISH(object) ANNOTATE_HAPPENS_BEFORE(object)
#define MOX_RECEIVE(object) ANNOTATE_HAPPENS_AFTER(object)
#else
#define MOX_ATOMIC_WORD(address) ((void)(address))
#define MOX_PUBLISH(object) ((void)(object))
#define MOX_RECEIVE(object) ((void)(object))
#endif
