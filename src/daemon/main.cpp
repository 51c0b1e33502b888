#include "daemon/startup.h"

int main()
{
    moxMain();
}
