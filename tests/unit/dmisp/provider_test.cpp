#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <sstream>
#include <sys/wait.h>

#include "client.h"
#include "dmisp/database.h"

using namespace dmisptest;

namespace {

std::string readAll(const std::string& path)
{
    std::ifstream in(path);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

class DmispDatabase : public ProviderTest {};

TEST_F(DmispDatabase, RestartFindsTheSameComponentsIdsRowsAndValues)
{
    uint32_t a = installSample();
    uint32_t b = installSample();
    uint32_t c = installSample();
    ASSERT_TRUE(dmisp::uninstall(b));
    // Changes through a command and through the interface.
    Client client;
    ASSERT_EQ(client.registerApp(false), 0u);
    client.begin(769);
    client.set(16, c);
    client.set(17, 1);
    client.set(20, 3);
    client.set(21, 88);
    storeWordAt(client.block(), 22, 3);
    memcpy(client.block() + 92, "9.9", 3);
    ASSERT_EQ(client.run(), 0u);
    ASSERT_EQ(dmisp::setValue(a, 30, 2, {"3"}, "Rear \"fan\"\n"), 0u);
    ASSERT_EQ(dmisp::setValue(a, 30, 4, {"1"}, "-5000000000"), 0u);
    ASSERT_EQ(dmisp::setValue(a, 20, 9, {}, "0"), 0u);
    auto before = dmisp::components();
    auto rowsBefore = dmisp::rows(a, 30);
    std::string mifBefore = dmisp::componentMif(a);

    std::string error;
    ASSERT_EQ(dmisp::reset(dir_, false, &error), 0) << error;
    EXPECT_TRUE(dmisp::loadErrors().empty());
    auto after = dmisp::components();
    ASSERT_EQ(after.size(), 2u);
    EXPECT_EQ(after[0].id, a);
    EXPECT_EQ(after[1].id, c);
    EXPECT_EQ(dmisp::rows(a, 30), rowsBefore);
    EXPECT_EQ(dmisp::componentMif(a), mifBefore);
    std::string value;
    ASSERT_EQ(dmisp::getValue(c, 1, 3, {}, &value), 0u);
    EXPECT_EQ(value, "9.9");
    ASSERT_EQ(dmisp::getValue(a, 30, 2, {"3"}, &value), 0u);
    EXPECT_EQ(value, "Rear \"fan\"\n");
    ASSERT_EQ(dmisp::getValue(a, 20, 9, {}, &value), 0u);
    EXPECT_EQ(value, "0");
    // Keys still index the rows, and ids are not given out twice.
    ASSERT_EQ(dmisp::getValue(a, 30, 4, {"1"}, &value), 0u);
    EXPECT_EQ(value, "-5000000000");
    EXPECT_EQ(installSample(), c + 1);
}

TEST_F(DmispDatabase, ACorruptOrHalfWrittenFileTakesNothingElseDown)
{
    uint32_t a = installSample();
    dmisp::shutdown();
    std::ofstream(dir_ + "/component-7.mif") << "start component\n name = \"Half\"\n start gro";
    std::ofstream(dir_ + "/component-5.mif") << "\x7f\x45\x4c\x46 binary";
    // A write interrupted before its rename leaves only a temporary file.
    std::ofstream(dir_ + "/component-" + std::to_string(a) + ".mif.tmp") << "start comp";
    std::string error;
    ASSERT_EQ(dmisp::reset(dir_, false, &error), 0) << error;
    auto errors = dmisp::loadErrors();
    ASSERT_EQ(errors.size(), 2u);
    EXPECT_EQ(errors[0].find(dir_ + "/component-"), 0u);
    EXPECT_NE(errors[0].find(".mif:"), std::string::npos) << errors[0];
    ASSERT_EQ(dmisp::components().size(), 1u);
    EXPECT_EQ(dmisp::components()[0].name, "Test Board");
    std::ifstream tmp(dir_ + "/component-" + std::to_string(a) + ".mif.tmp");
    EXPECT_FALSE(tmp.good()) << "stale temporary file removed";
    EXPECT_EQ(installSample(), 8u) << "ids of unreadable files are not reused";
}

TEST_F(DmispDatabase, OneProviderAtATimeHoldsTheDirectory)
{
    dmisp::Database second;
    std::string error;
    EXPECT_FALSE(second.open(dir_, 50, &error));
    EXPECT_NE(error.find("locked"), std::string::npos) << error;
    dmisp::shutdown();
    EXPECT_TRUE(second.open(dir_, 0, &error)) << error;
    second.close();
}

TEST_F(DmispDatabase, FilesAreRewrittenOnEveryChange)
{
    uint32_t a = installSample();
    std::string path = dir_ + "/component-" + std::to_string(a) + ".mif";
    EXPECT_NE(readAll(path).find("{2, \"Memory\", 1200"), std::string::npos);
    ASSERT_EQ(dmisp::setValue(a, 30, 3, {"2"}, "1250"), 0u);
    EXPECT_NE(readAll(path).find("{2, \"Memory\", 1250"), std::string::npos);
    // A value that does not fit changes neither memory nor file.
    EXPECT_EQ(dmisp::setValue(a, 30, 2, {"2"}, std::string(17, 'x')), static_cast<uint32_t>(dmisp::StatusBadValue));
    EXPECT_EQ(readAll(path).find(std::string(17, 'x')), std::string::npos);
    ASSERT_TRUE(dmisp::uninstall(a));
    EXPECT_FALSE(std::ifstream(path).good());
    EXPECT_TRUE(dmisp::writeFileAtomically(dir_ + "/x", "new"));
    EXPECT_EQ(readAll(dir_ + "/x"), "new");
    EXPECT_FALSE(dmisp::writeFileAtomically(dir_ + "/missing/x", "new"));
}

TEST_F(DmispDatabase, StartsOnFirstUseFromTheEnvironment)
{
    uint32_t a = installSample();
    dmisp::shutdown();
    EXPECT_EQ(dmisp::databaseDirectory(), "");
    setenv("DMISP_DB", dir_.c_str(), 1);
    std::string socket = dir_ + "/other.sock";
    setenv("DMISP_SOCKET", socket.c_str(), 1);
    Client client;
    EXPECT_EQ(client.registerApp(false), 0u); // the first DmiInvoke opens it
    unsetenv("DMISP_DB");
    unsetenv("DMISP_SOCKET");
    EXPECT_EQ(dmisp::databaseDirectory(), dir_);
    EXPECT_EQ(dmisp::controlSocketPath(), socket);
    std::string out;
    EXPECT_EQ(dmisp::controlRequest(socket, {"list"}, &out), 0);
    EXPECT_EQ(out, std::to_string(a) + "\tTest Board\n");
    dmisp::shutdown();
    EXPECT_EQ(dmisp::controlRequest(socket, {"list"}, &out), -1) << "nobody listens once it is closed";
}

// The command-line client against a running provider, and on the
// database alone when no provider runs.
class DmispTool : public ProviderTest {
protected:
    bool serveControl() override { return true; }
    int dmictl(const std::string& args, std::string* out)
    {
        std::string cmd = std::string(DMICTL_PATH) + " --db '" + dir_ + "' " + args + " 2>&1";
        FILE* p = popen(cmd.c_str(), "r");
        out->clear();
        char buf[4096];
        size_t n;
        while ((n = fread(buf, 1, sizeof buf, p)) > 0)
            out->append(buf, n);
        int status = pclose(p);
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
};

TEST_F(DmispTool, ListsGetsSetsAndRaisesAnEventThatTheApplicationReceives)
{
    Client client;
    ASSERT_EQ(client.registerApp(true), 0u);
    std::string path = dir_ + "/board.mif";
    std::ofstream(path) << sampleMif();
    std::string out;
    ASSERT_EQ(dmictl("install " + path, &out), 0) << out;
    EXPECT_EQ(out, "1\n");
    takeIndications();
    const struct {
        std::string args;
        int code;
        std::string out; // expected output, or its beginning when it ends in "..."
    } cases[] = {
        {"list", 0, "1\tTest Board\n"},
        {"groups 'Test Board'", 0, "1\tComponentID\tDMTF|ComponentID|001\n20\tVoltage Events\t..."},
        {"attributes 1 40", 0, "1\tError State\tinteger\tread-only\t0=None\t2=Overheat\n2\tCode\tinteger\tread-only\n"},
        {"rows 1 'DMTF|Voltage Probe|001'", 0, "1\tCPU\t0\t0\t19950101120000.000000+000\t0\t9\t5\n..."},
        {"get 1 30 Label -k 2", 0, "Memory\n"},
        {"set 1 30 6 Bad -k 2", 0, ""},
        {"get 1 30 6 -k 2", 0, "1\n"},
        {"set 1 30 6 Worse -k 2", 1, "value does not fit the attribute\n"},
        {"get 1 30 3 -k 9", 1, "not found\n"},
        {"get 1 30 3", 1, "keys do not name a row of this group\n"},
        {"get 7 30 3", 1, "no component 7\n"},
        {"get 1", 2, "usage: dmictl..."},
        {"frobnicate", 2, "unknown command frobnicate\n..."},
        {"event 1 20 --instance 30 -k 2", 0, ""},
        {"event 1 40", 1, "group 40 is not of class EventGeneration|...\n"},
        {"vendor-event 1 40", 0, ""},
        {"fault busy 1", 0, ""},
        {"fault sideways", 2, "usage..."},
    };
    for (const auto& tc : cases) {
        EXPECT_EQ(dmictl(tc.args, &out), tc.code) << tc.args << "\n" << out;
        if (tc.out.size() > 3 && tc.out.compare(tc.out.size() - 3, 3, "...") == 0)
            EXPECT_EQ(out.substr(0, tc.out.size() - 3), tc.out.substr(0, tc.out.size() - 3)) << tc.args;
        else
            EXPECT_EQ(out, tc.out) << tc.args;
    }
    auto events = takeIndications();
    ASSERT_EQ(events.size(), 2u);
    IndicationHandle standard(events[0]);
    EXPECT_EQ(SLEventClassCount(standard.h), 2u);
    SLEventSelectRowCnf(standard.h, 1, 0);
    EXPECT_EQ(SLRowUnsignedValue(standard.h, 5), 1u) << "the value set through the tool";
    IndicationHandle vendor(events[1]);
    EXPECT_EQ(text(SLEventClassString(vendor.h, 0)), "Zorek|Error|001");
    // The busy fault set through the tool reaches DmiInvoke.
    client.begin(513);
    EXPECT_EQ(client.send(), dmisp::InvokeBusy);
}

TEST_F(DmispTool, WorksOnTheDatabaseWhenNoProviderRuns)
{
    dmisp::shutdown();
    std::string path = dir_ + "/board.mif";
    std::ofstream(path) << sampleMif();
    std::string bad = dir_ + "/bad.mif";
    std::ofstream(bad) << "start component\n  name = \"x\"\n  start table\nend component\n";
    std::string out;
    EXPECT_EQ(dmictl("install " + path, &out), 0) << out;
    EXPECT_EQ(dmictl("install " + bad, &out), 1);
    EXPECT_EQ(out, bad + ":4: expected 'end table', found 'end' 'component'\n");
    EXPECT_EQ(dmictl("set 1 1 Version 3.0", &out), 0) << out;
    EXPECT_EQ(dmictl("event 1 20", &out), 3);
    EXPECT_NE(out.find("no provider is running"), std::string::npos) << out;
    // The daemon's provider starts later and finds it.
    std::string error;
    ASSERT_EQ(dmisp::reset(dir_, true, &error), 0) << error;
    std::string value;
    ASSERT_EQ(dmisp::getValue(1, 1, 3, {}, &value), 0u);
    EXPECT_EQ(value, "3.0");
    // While it runs, the tool goes through its socket.
    EXPECT_EQ(dmictl("status", &out), 0) << out;
    EXPECT_NE(out.find("database\t" + dir_), std::string::npos) << out;
}

TEST_F(DmispTool, ListsTheShippedMifsAndRaisesAnEventFromThem)
{
    const std::string mifs = MOX_SOURCE_DIR "/mifs";
    if (!std::ifstream(mifs + "/mox.mif").good() || !std::ifstream(mifs + "/baseboard.mif").good())
        GTEST_SKIP() << "no shipped MIFs in " << mifs;
    Client client;
    ASSERT_EQ(client.registerApp(true), 0u);
    std::string out;
    for (const char* file : {"baseboard.mif", "mox.mif"})
        ASSERT_EQ(dmictl(std::string("install ") + mifs + "/" + file, &out), 0) << out;
    ASSERT_EQ(dmictl("list", &out), 0);
    EXPECT_EQ(out, "1\tZorek Tessarin Baseboard\n2\tZorek Tessarin Server Manager - Mox\n");
    takeIndications();
    // Every event-generation group of the baseboard names its instance
    // group by class in attribute 5; raise one event per group, with the
    // instance group's first row.
    unsigned raised = 0;
    for (const dmisp::GroupInfo& g : dmisp::groups(1)) {
        if (g.className.rfind("EventGeneration|", 0) != 0)
            continue;
        std::string instanceClass;
        ASSERT_EQ(dmisp::getValue(1, g.id, 5, {}, &instanceClass), 0u) << g.name;
        uint32_t instance = 0;
        for (const dmisp::GroupInfo& i : dmisp::groups(1))
            if (i.className == instanceClass)
                instance = i.id;
        ASSERT_NE(instance, 0u) << instanceClass;
        std::string key = dmisp::rows(1, instance).at(0).at(0);
        ASSERT_EQ(dmictl("event 1 " + std::to_string(g.id) + " --instance " + std::to_string(instance) + " -k " + key,
                         &out),
                  0)
            << out;
        auto events = takeIndications();
        ASSERT_EQ(events.size(), 1u);
        IndicationHandle h(events[0]);
        EXPECT_EQ(text(SLEventClassString(h.h, 0)), g.className);
        EXPECT_EQ(text(SLEventClassString(h.h, 1)), instanceClass);
        SLEventSelectRowCnf(h.h, 1, 0);
        EXPECT_EQ(SLRowGroupId(h.h), instance);
        EXPECT_EQ(std::to_string(SLRowIntegerValue(h.h, 0)), key);
        ++raised;
    }
    EXPECT_GE(raised, 4u);
}

} // namespace
