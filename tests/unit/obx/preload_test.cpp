#include <gtest/gtest.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <elf.h>
#include <fstream>
#include <spawn.h>
#include <sstream>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace {

std::string readFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

std::vector<std::string> lines(const std::string& text)
{
    std::vector<std::string> result;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);)
        result.push_back(line);
    return result;
}

bool contains(const std::vector<std::string>& all, const std::string& line)
{
    for (const std::string& entry : all)
        if (entry == line)
            return true;
    return false;
}

struct ProbeRun {
    int status = -1;
    std::string output;
    std::vector<std::string> log;
    long milliseconds = 0;
};

class Preload : public ::testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/obxpreloadXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir = pattern;
    }
    void TearDown() override { std::system(("rm -rf " + dir).c_str()); }

    // Runs the probe with the preload library and the given OBXSIM_ settings.
    ProbeRun run(std::vector<std::string> environment, std::vector<std::string> extra = {},
                 const char* program = OBX_PROBE)
    {
        ProbeRun result;
        std::string logPath = dir + "/obx.log";
        std::string outputPath = dir + "/output";
        unlink(logPath.c_str());
        environment.push_back(std::string("LD_PRELOAD=") + OBX_PRELOAD);
        environment.push_back("OBXSIM_LOG=" + logPath);
        std::vector<char*> envp;
        for (std::string& entry : environment)
            envp.push_back(entry.data());
        envp.push_back(nullptr);
        std::vector<std::string> arguments = {program};
        if (program == std::string(OBX_PROBE))
            arguments.push_back(dir + "/scratch");
        arguments.insert(arguments.end(), extra.begin(), extra.end());
        std::vector<char*> argv;
        for (std::string& argument : arguments)
            argv.push_back(argument.data());
        argv.push_back(nullptr);

        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_addopen(&actions, 1, outputPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        auto start = std::chrono::steady_clock::now();
        pid_t pid = 0;
        if (posix_spawn(&pid, program, &actions, nullptr, argv.data(), envp.data()) == 0)
            waitpid(pid, &result.status, 0);
        result.milliseconds = static_cast<long>(
            std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start).count());
        posix_spawn_file_actions_destroy(&actions);
        result.output = readFile(outputPath);
        result.log = lines(readFile(logPath));
        return result;
    }
    std::string dir;
};

TEST(PreloadLibrary, IsBuiltForI386)
{
    std::string image = readFile(OBX_PRELOAD);
    ASSERT_GE(image.size(), sizeof(Elf32_Ehdr));
    Elf32_Ehdr header;
    std::memcpy(&header, image.data(), sizeof header);
    EXPECT_EQ(header.e_ident[EI_CLASS], ELFCLASS32);
    EXPECT_EQ(header.e_machine, EM_386);
}

TEST_F(Preload, ServesTheDeviceAndPassesEverythingElseThrough)
{
    // A page of "physical memory" at 0xFED00000, above 2 GiB.
    std::string memory(4096, '\0');
    memory[0x10] = 0x12, memory[0x11] = 0x34, memory[0x12] = 0x56, memory[0x13] = 0x78;
    std::ofstream(dir + "/memory", std::ios::binary) << memory;
    ProbeRun r = run({"OBXSIM_IPMI=1.0", "OBXSIM_MEMORY=" + dir + "/memory", "OBXSIM_MEMORY_BASE=fed00000"},
                {"fed00010"});
    ASSERT_TRUE(WIFEXITED(r.status)) << r.status;
    EXPECT_EQ(WEXITSTATUS(r.status), 0);
    EXPECT_EQ(r.output, "file ok\npipe ok\nmap 0 12345678\nreset 0\nclass 0x01\n");
    // The real three-second wait between arming and starting.
    EXPECT_GE(r.milliseconds, 3000);
    const std::vector<std::string> expected = {
        "open /dev/obx read-only",
        "mmap physical 0xfed00000 length 20",
        "close /dev/obx",
        "munmap length 20",
        "open /dev/obx read-write",
        "get device id",
        "watchdog set: use 0x04 action hard reset countdown 1",
        "watchdog started: countdown 1",
        "watchdog expired: hard reset",
    };
    EXPECT_EQ(r.log, expected);
    EXPECT_EQ(readFile(dir + "/scratch"), std::string("passed through", 15));
}

TEST_F(Preload, ConfiguredFaultsReachTheProgram)
{
    ProbeRun r = run({"OBXSIM_FAULT=06.24:cc=c0"});
    ASSERT_TRUE(WIFEXITED(r.status));
    EXPECT_EQ(r.output, "file ok\npipe ok\nreset 1\nclass 0x51\n");
    EXPECT_LT(r.milliseconds, 3000); // no sleep after a failed arming
    EXPECT_TRUE(contains(r.log, "refused: netfn 0x06 cmd 0x24 completion code 0xc0"));
    EXPECT_FALSE(contains(r.log, "watchdog started: countdown 1"));

    r = run({"OBXSIM_NODEV=1"});
    EXPECT_EQ(r.output, "file ok\npipe ok\nreset 1\nclass 0x00\n");
    EXPECT_TRUE(r.log.empty());
}

TEST_F(Preload, ServesThe32BitOffsetCalls)
{
    std::string memory(8192, '\0');
    memory[4097] = 0x5C;
    std::ofstream(dir + "/memory", std::ios::binary) << memory;
    ProbeRun r = run({"OBXSIM_MEMORY=" + dir + "/memory", "OBXSIM_MEMORY_BASE=e0000"}, {"e1000"}, OBX_PROBE32);
    ASSERT_TRUE(WIFEXITED(r.status));
    EXPECT_EQ(WEXITSTATUS(r.status), 0);
    EXPECT_EQ(r.output, "writable refused\nbyte 5c\nclose 0\nclose again -1\n");
    const std::vector<std::string> expected = {
        "open /dev/obx read-only", "mmap physical 0xe1000 length 4096", "mmap physical 0xe1000 length 4096",
        "munmap length 4096",      "close /dev/obx",
    };
    EXPECT_EQ(r.log, expected);
}

} // namespace
