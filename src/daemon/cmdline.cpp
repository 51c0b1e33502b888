#include "daemon/cmdline.h"

#include <cstring>

#include "daemon/emailcheck.h"

#ifndef MOX_VERSION
#define MOX_VERSION "unknown"
#endif

namespace {

const char usage[] = "Usage: mox [--version | --help | --test-email]\n"
                     "Without an option mox runs as the event-response daemon.\n"
                     "  --version     print the version and exit\n"
                     "  --help        print this text and exit\n"
                     "  --test-email  send a test alert with the e-mail settings of the\n"
                     "                DMI service provider and show each SMTP step\n";

} // namespace

bool moxCommandLine(int argc, char** argv, FILE* out, int* status)
{
    if (argc != 2 || argv == nullptr || argv[1] == nullptr)
        return false;
    if (strcmp(argv[1], "--version") == 0) {
        fprintf(out, "mox %s\n", MOX_VERSION);
    } else if (strcmp(argv[1], "--help") == 0) {
        fputs(usage, out);
    } else if (strcmp(argv[1], "--test-email") == 0) {
        *status = moxTestEmail(out);
        fflush(out);
        return true;
    } else {
        return false;
    }
    fflush(out);
    *status = 0;
    return true;
}
