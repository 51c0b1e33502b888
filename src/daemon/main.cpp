#include <cstdio>

#include "daemon/cmdline.h"
#include "daemon/startup.h"

int main(int argc, char** argv)
{
    int status = 0;
    if (moxCommandLine(argc, argv, stdout, &status))
        return status;
    moxMain();
}
