// "mox --explain": what the daemon would do for an event, told without doing
// any of it.
#pragma once

#include <cstdio>

// Explains the event component C would deliver for a row of group G (the words
// after "--explain": C G [-k KEY]... [--instance G2 [-k KEY]...]), through the
// daemon's own matchers and dispatcher, to `out`. 0 explained (also when no
// row matches), 1 a bad argument, 2 the provider cannot be reached.
int moxExplain(int argc, char** argv, FILE* out);
