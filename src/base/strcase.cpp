#include "base/strcase.h"

#include <climits>

namespace {

int lowerSigned(char c)
{
    int value = static_cast<signed char>(c);
    if (value >= 'A' && value <= 'Z')
        value += 'a' - 'A';
    return value;
}

int compare(const char* a, const char* b, long n)
{
    if (a == nullptr || b == nullptr)
        return a == b ? 0 : (a == nullptr ? -1 : 1);
    for (long i = 0; i < n; ++i) {
        if (a[i] == '\0')
            return b[i] == '\0' ? 0 : -1;
        if (b[i] == '\0')
            return 1;
        int x = lowerSigned(a[i]);
        int y = lowerSigned(b[i]);
        if (x != y)
            return x < y ? -1 : 1;
    }
    return 0;
}

} // namespace

int strnicmp(const char* a, const char* b, int n)
{
    return compare(a, b, n);
}

int stricmp(const char* a, const char* b)
{
    return compare(a, b, LONG_MAX);
}
