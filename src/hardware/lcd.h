// The baseboard's front-panel status display: one line of 32 characters held
// in an attribute of the status-display group.
#pragma once

#include <cstdint>

// Group id of the status-display group in the baseboard component and the id
// of its contents attribute (7 for the first display form, 8 for the
// second); 0 until found, then kept for the life of the process.
extern uint32_t LcdGroupId;
extern uint32_t LcdContentsAttrId;

// The two display forms, with the number of characters compared (case
// ignored) at the start of a group's class string.
extern const char Lcd1ClassString[];
extern const int Lcd1ClassLength;
extern const char Lcd2ClassString[];
extern const int Lcd2ClassLength;

// Characters on the display line.
constexpr int LcdWidth = 32;

// 0 when the status-display group is known (found now or earlier), -1 otherwise.
int LcdInitialize(void);
// The display line WriteLCD shows for `text`: cut or padded with blanks to
// exactly 32 characters, terminated.
void LcdLine(const char* text, char (&line)[LcdWidth + 1]);
// Shows `text` on the display line, cut or padded with blanks to exactly 32
// characters (a null text shows a blank line).
void WriteLCD(const char* text);
// Shows 32 blanks.
void ClearLCD(void);
// Reads the display line into `buffer` (at least 33 bytes): up to 32
// characters and a NUL. Leaves the buffer untouched when the display is not
// known or no handle can be had.
void ReadLCD(char* buffer);
