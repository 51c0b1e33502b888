// The baseboard's front-panel status display.
#pragma once

// 0 when the status-display group is known, -1 otherwise.
int LcdInitialize(void);
// Shows `text` on the display line, cut or padded to 32 characters.
void WriteLCD(const char* text);
