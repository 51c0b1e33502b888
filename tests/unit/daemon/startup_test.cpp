#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <string>
#include <syslog.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "base/log.h"
#include "daemon/startup.h"

namespace {

std::vector<std::string> commands;
bool floppyPresent;
std::vector<std::pair<int, std::string>> logged;

int fakeRun(const char* command)
{
    commands.emplace_back(command);
    return std::string(command).rfind("mount ", 0) == 0 && !floppyPresent ? 32 : 0;
}

struct Scenario {
    const char* name;
    std::vector<std::string> localFiles;  // in the working directory
    bool floppy;
    std::vector<std::string> floppyFiles; // on the mounted floppy
    int expected;
    std::string out;                       // standard output
    std::vector<std::string> ran;          // commands run
};

const std::string mountCmd = "mount -t msdos /dev/fd0 /mnt/floppy 2>/dev/null";
const std::string umountCmd = "umount /mnt/floppy 2>/dev/null";

TEST(MarkerCheck, OrdersAndMessages)
{
    const Scenario scenarios[] = {
        {"local mox.not", {"mox.not"}, false, {}, 4, "", {}},
        {"local vornmox.not", {"vornmox.not"}, true, {"mox.not"}, 4, "", {}},
        {"no floppy",
         {},
         false,
         {},
         0,
         "Checking for mox configurations ..\nThere is no floppy found in floppy drive\nProceeding with loading mox ..\n",
         {mountCmd}},
        {"floppy with both",
         {},
         true,
         {"mox.not", "vornmox.not"},
         4,
         "Checking for mox configurations ..\nfile mox.not  found in floppy\n",
         {mountCmd, umountCmd}},
        {"floppy with vornmox.not",
         {},
         true,
         {"vornmox.not"},
         4,
         "Checking for mox configurations ..\nfile vornmox.not found in floppy\n",
         {mountCmd, umountCmd}},
        {"empty floppy",
         {},
         true,
         {},
         0,
         "Checking for mox configurations ..\nCouldn't find any mox configuration files in floppy drive\n"
         "Proceeding with loading mox ..\n",
         {mountCmd, umountCmd}},
    };
    for (const Scenario& s : scenarios) {
        char pattern[] = "/tmp/moxmarkXXXXXX";
        std::string dir = mkdtemp(pattern);
        std::string floppy = dir + "/floppy";
        mkdir(floppy.c_str(), 0755);
        for (const auto& f : s.localFiles)
            std::ofstream(dir + "/" + f) << "";
        for (const auto& f : s.floppyFiles)
            std::ofstream(floppy + "/" + f) << "";
        std::string vorn = dir + "/vornmox.not", mox = dir + "/mox.not";
        std::string fmox = floppy + "/mox.not", fvorn = floppy + "/vornmox.not";
        char* buffer = nullptr;
        size_t size = 0;
        FILE* out = open_memstream(&buffer, &size);
        MarkerCheck check{vorn.c_str(), mox.c_str(), fmox.c_str(), fvorn.c_str(),
                          mountCmd.c_str(), umountCmd.c_str(), fakeRun, out};
        commands.clear();
        logged.clear();
        floppyPresent = s.floppy;
        moxSetLogHook([](int priority, const char* text) { logged.emplace_back(priority, text); });
        int result = checkForMoxNot(check);
        moxSetLogHook(nullptr);
        fclose(out);
        EXPECT_EQ(result, s.expected) << s.name;
        EXPECT_EQ(std::string(buffer, size), s.out) << s.name;
        EXPECT_EQ(commands, s.ran) << s.name;
        // Each message is logged at LOG_ERR; the first one with a leading line feed.
        std::string log;
        for (const auto& [priority, text] : logged) {
            EXPECT_EQ(priority, LOG_ERR);
            log += text;
        }
        EXPECT_EQ(log, s.out.empty() ? "" : "\n" + s.out) << s.name;
        free(buffer);
    }
}

TEST(MarkerCheck, UnreadableMarkerDoesNotDisable)
{
    char pattern[] = "/tmp/moxmarkXXXXXX";
    std::string dir = mkdtemp(pattern);
    chmod(dir.c_str(), 0755);
    std::string mox = dir + "/mox.not";
    std::ofstream(mox) << "";
    chmod(mox.c_str(), 0);
    std::string none = dir + "/none";
    // Root reads every file: check as an unprivileged user in a child.
    pid_t child = fork();
    if (child == 0) {
        if (geteuid() == 0 && setuid(65534) != 0)
            _exit(90);
        FILE* out = fopen("/dev/null", "w");
        MarkerCheck check{none.c_str(), mox.c_str(), none.c_str(), none.c_str(), "mount", "umount", fakeRun, out};
        floppyPresent = false;
        _exit(checkForMoxNot(check));
    }
    int status = 0;
    waitpid(child, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
}

} // namespace
