#include "base/text.h"

void moxBlankControls(char* text)
{
    if (text == nullptr)
        return;
    for (; *text != '\0'; ++text) {
        auto byte = static_cast<unsigned char>(*text);
        if (byte < 0x20 || byte == 0x7F)
            *text = ' ';
    }
}
