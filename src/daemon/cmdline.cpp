#include "daemon/cmdline.h"

#include <cstring>

#include "daemon/check.h"
#include "daemon/emailcheck.h"
#include "daemon/explain.h"

#ifndef MOX_VERSION
#define MOX_VERSION "unknown"
#endif

namespace {

const char usage[] = "Usage: mox [--version | --help | --test-email | --check]\n"
                     "       mox --explain C G [-k KEY]... [--instance G2 [-k KEY]...]\n"
                     "Without an option mox runs as the event-response daemon.\n"
                     "  --version     print the version and exit\n"
                     "  --help        print this text and exit\n"
                     "  --test-email  send a test alert with the e-mail settings of the\n"
                     "                DMI service provider and show each SMTP step\n"
                     "  --check       check what the daemon relies on, read-only\n"
                     "  --explain     tell what the daemon would do for the event component C\n"
                     "                delivers for a row of group G, doing none of it\n";

} // namespace

bool moxCommandLine(int argc, char** argv, FILE* out, int* status)
{
    if (argc < 2 || argv == nullptr || argv[1] == nullptr)
        return false;
    if (strcmp(argv[1], "--explain") == 0) {
        *status = moxExplain(argc - 2, argv + 2, out);
        fflush(out);
        return true;
    }
    if (argc != 2)
        return false;
    if (strcmp(argv[1], "--version") == 0) {
        fprintf(out, "mox %s\n", MOX_VERSION);
        *status = 0;
    } else if (strcmp(argv[1], "--help") == 0) {
        fputs(usage, out);
        *status = 0;
    } else if (strcmp(argv[1], "--test-email") == 0) {
        *status = moxTestEmail(out);
    } else if (strcmp(argv[1], "--check") == 0) {
        *status = moxCheck(out);
    } else {
        return false;
    }
    fflush(out);
    return true;
}
