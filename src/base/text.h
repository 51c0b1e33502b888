// Texts that come from outside the daemon, made safe for its own outputs.
#pragma once

// Replaces every byte below 0x20 and 0x7F (DEL) of a terminated text by a
// blank, in place: a provider's text must not end a log line early, start a
// second one or carry terminal control sequences. Null is left alone.
void moxBlankControls(char* text);
