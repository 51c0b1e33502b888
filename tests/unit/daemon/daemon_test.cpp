#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <fstream>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "daemon/daemon.h"

namespace {

using Clock = std::chrono::steady_clock;

bool running(pid_t pid)
{
    int status;
    return waitpid(pid, &status, WNOHANG) == 0;
}

TEST(SignalHandling, CallerSuppliedTerminationSet)
{
    pid_t child = fork();
    if (child == 0) {
        sigset_t term;
        sigemptyset(&term);
        sigaddset(&term, SIGHUP);
        pthread_t thread;
        if (daemon_startSignalHandling(nullptr, &term, &thread) != 0)
            _exit(2);
        pthread_join(thread, nullptr);
        _exit(0);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    kill(child, SIGTERM);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_TRUE(running(child)) << "SIGTERM is consumed when the termination set holds only SIGHUP";
    kill(child, SIGHUP);
    int status = 0;
    waitpid(child, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST(SignalHandling, DefaultWaitSetLeavesFourSignalsOut)
{
    sigset_t set;
    ASSERT_EQ(daemon_defaultWaitSet(&set), 0);
    for (int s : {SIGALRM, SIGIO, SIGUSR1, SIGUSR2})
        EXPECT_EQ(sigismember(&set, s), 0) << s;
    for (int s : {SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGPWR, SIGCHLD, SIGPIPE})
        EXPECT_EQ(sigismember(&set, s), 1) << s;
}

TEST(DaemonServices, DescriptorLimitIsCached)
{
    resetOpenFileHandlesCache();
    EXPECT_EQ(maxOpenFileHandlesFrom([](int) -> long { return -1; }), 256);
    EXPECT_EQ(maxOpenFileHandlesFrom([](int) -> long { return 4096; }), 256) << "cached";
    resetOpenFileHandlesCache();
    EXPECT_EQ(maxOpenFileHandlesFrom([](int) -> long { return 1024; }), 1024);
    resetOpenFileHandlesCache();
}

// The real daemon in a scratch working directory, with a `mount` on PATH that
// finds no floppy.
struct Daemon {
    pid_t pid = -1;
    std::string dir;
    std::string output;
    Clock::time_point started;

    void start()
    {
        char pattern[] = "/tmp/moxprocXXXXXX";
        dir = mkdtemp(pattern);
        std::string bin = dir + "/bin";
        mkdir(bin.c_str(), 0755);
        for (const char* tool : {"mount", "umount"}) {
            std::string path = bin + "/" + tool;
            std::ofstream(path) << "#!/bin/sh\nexit 32\n";
            chmod(path.c_str(), 0755);
        }
        mkdir((dir + "/db").c_str(), 0755);
        output = dir + "/stdout";
        started = Clock::now();
        pid = fork();
        if (pid == 0) {
            if (chdir(dir.c_str()) != 0)
                _exit(97);
            int fd = open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
            dup2(fd, 1);
            setenv("PATH", (bin + ":/usr/bin:/bin").c_str(), 1);
            setenv("DMISP_DB", (dir + "/db").c_str(), 1);
            setenv("UXDMIPATH", MOX_SOURCE_DIR "/mifs", 1);
            // Default dispositions and an empty mask, as a shell would start it.
            sigset_t none;
            sigemptyset(&none);
            sigprocmask(SIG_SETMASK, &none, nullptr);
            execl(MOX_BINARY, "mox", static_cast<char*>(nullptr));
            _exit(98);
        }
    }
    std::string out() const
    {
        std::ifstream in(output);
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }
};

TEST(DaemonProcess, SignalsEndItOnlyAfterTenSecondsWithStatusZero)
{
    const int stops[] = {SIGTERM, SIGINT, SIGQUIT, SIGPWR};
    std::vector<Daemon> daemons(4);
    for (auto& d : daemons)
        d.start();
    std::this_thread::sleep_for(std::chrono::seconds(2));
    for (auto& d : daemons) {
        for (int consumed : {SIGHUP, SIGCHLD, SIGPIPE})
            kill(d.pid, consumed);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    for (size_t i = 0; i < daemons.size(); ++i) {
        ASSERT_TRUE(running(daemons[i].pid)) << "SIGHUP, SIGCHLD and SIGPIPE are consumed";
        EXPECT_EQ(daemons[i].out(),
                  "Checking for mox configurations ..\nThere is no floppy found in floppy drive\n"
                  "Proceeding with loading mox ..\n")
            << "lines reach standard output while the daemon runs";
        kill(daemons[i].pid, stops[i]);
    }
    for (size_t i = 0; i < daemons.size(); ++i) {
        int status = 0;
        waitpid(daemons[i].pid, &status, 0);
        auto lived = Clock::now() - daemons[i].started;
        ASSERT_TRUE(WIFEXITED(status)) << "signal " << stops[i] << " killed it: " << WTERMSIG(status);
        EXPECT_EQ(WEXITSTATUS(status), 0);
        EXPECT_GE(lived, std::chrono::milliseconds(9900)) << "not before the initial thread's 10 s";
    }
}

TEST(DaemonProcess, MarkerFileDisables)
{
    Daemon d;
    char pattern[] = "/tmp/moxprocXXXXXX";
    std::string dir = mkdtemp(pattern);
    std::ofstream(dir + "/mox.not") << "";
    pid_t pid = fork();
    std::string output = dir + "/stdout";
    if (pid == 0) {
        if (chdir(dir.c_str()) != 0)
            _exit(97);
        int fd = open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        dup2(fd, 1);
        execl(MOX_BINARY, "mox", static_cast<char*>(nullptr));
        _exit(98);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    std::ifstream in(output);
    std::string line;
    std::getline(in, line);
    EXPECT_EQ(line, "Mox has been disabled.");
}

} // namespace
