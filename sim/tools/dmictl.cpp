// dmictl: command-line client of the substitute DMI service provider.
//
// Sends its command to the provider serving the control socket. When no
// provider listens there, it opens the database directory itself (taking
// its lock), so that MIFs can be installed and values read or set before
// the daemon starts; events and faults need a running provider.
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "dmisp/dmisp.h"

int main(int argc, char** argv)
{
    const char* env = std::getenv("DMISP_DB");
    std::string db = (env != nullptr && *env != '\0') ? env : "/var/lib/dmisp";
    env = std::getenv("DMISP_SOCKET");
    std::string socket = (env != nullptr && *env != '\0') ? env : "";
    std::vector<std::string> args;
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        if ((a == "--db" || a == "--socket") && i + 1 < argc && args.empty()) {
            (a == "--db" ? db : socket) = argv[++i];
            continue;
        }
        args.push_back(a);
    }
    if (socket.empty())
        socket = db + "/control.sock";
    std::string out;
    int code = dmisp::controlRequest(socket, args, &out);
    if (code < 0) {
        // Nobody listens: work on the database directly.
        const std::string cmd = args.empty() ? "" : args[0];
        if (cmd == "event" || cmd == "vendor-event" || cmd == "install-event" || cmd == "uninstall-event" ||
            cmd == "fault" || cmd == "status") {
            std::fprintf(stderr, "dmictl: no provider is running (nothing listens on %s)\n", socket.c_str());
            return 3;
        }
        std::string error;
        if (!cmd.empty() && cmd != "help" && cmd != "--help" &&
            dmisp::reset(db, false, &error) != 0) {
            std::fprintf(stderr, "dmictl: %s\n", error.c_str());
            return 3;
        }
        code = dmisp::runControl(args, &out);
        dmisp::shutdown();
    }
    std::fputs(out.c_str(), code == 0 ? stdout : stderr);
    return code;
}
