#include "testmifs.h"

std::string attribute(int id, const std::string& type, const std::string& value, const std::string& name)
{
    return "start attribute\n name = \"" + (name.empty() ? "A" + std::to_string(id) : name) + "\"\n id = " +
           std::to_string(id) + "\n type = " + type + "\n access = read-write\n value = " + value + "\nend attribute\n";
}

namespace {

std::string integers(int from, int to)
{
    std::string out;
    for (int id = from; id <= to; ++id)
        out += attribute(id, "integer");
    return out;
}

std::string table(int id, const std::string& cls, const std::string& keys, const std::string& attributes,
                  const std::vector<std::string>& rows)
{
    std::string head = " name = \"Table " + std::to_string(id) + "\"\n class = \"" + cls + "\"\n id = " +
                       std::to_string(id) + "\n";
    std::string text = "start group\n" + head + (keys.empty() ? "" : " key = " + keys + "\n") + attributes +
                       "end group\nstart table\n" + head;
    for (const auto& row : rows)
        text += " { " + row + " }\n";
    return text + "end table\n";
}

} // namespace

std::string actionRow(const std::string& keys, std::initializer_list<int> on, const std::string& tail, int n,
                      const std::string& alert)
{
    std::string row = keys;
    for (int id = 7; id < 7 + n; ++id) {
        bool set = false;
        for (int c : on)
            set = set || c == id;
        row += id == 17 ? ", \"" + alert + "\"" : set ? ", 1" : ", 0";
    }
    return row + tail;
}

std::string ownMif(const OwnMif& m)
{
    std::string actions = integers(7, 16) + attribute(17, "displaystring(64)", "\"\"") + integers(18, 6 + m.actions);
    if (m.actions < 11)
        actions = integers(7, 6 + m.actions);
    std::string t = "start component\n name = \"Zorek Tessarin Server Manager - Mox\"\n"
                    "start group\n name = \"ComponentID\"\n class = \"DMTF|ComponentID|001\"\n id = 1\n"
                    "start attribute\n name = \"Version\"\n id = 3\n type = displaystring(16)\n value = \"" +
                    m.version + "\"\nend attribute\nend group\n";
    t += table(2, "Zorek|Mox Supported Components|001", "1",
               attribute(1, "integer") + attribute(2, "displaystring(64)", "\"\""), m.supported);
    if (!m.group3.empty())
        t += table(3, "Zorek|Mox Vendor Event Actions|001", "1,2,3,4,5", integers(1, 6) + actions, m.group3);
    t += table(4, "Zorek|Mox Vendor Event Actions|001", "1,2,3,4,5,6", integers(1, 6) + actions + integers(30, 30),
               m.vendor);
    t += table(10, "Zorek|Mox Standard Event Actions|001", "1,2,3,4,5,6,31,32",
               integers(1, 6) + actions + integers(30, 32), m.standard);
    return t + "end component\n";
}

std::string boardMif(const std::string& name)
{
    const std::string probe = "\"Zorek|Voltage Probe|001\"";
    const std::string generation =
        attribute(1, "start enum\n 4 = \"Voltage Above Upper Critical\"\n end enum", "4") +
        attribute(2, "\"Severity\"", "0x08") +
        integers(3, 4) + attribute(5, "displaystring(64)", probe) +
        attribute(6, "start enum\n 1 = \"Power\"\n end enum", "1") +
        attribute(7, "start enum\n 2 = \"Voltage\"\n end enum", "2") + integers(8, 9);
    return "start component\n name = \"" + name + "\"\n" +
           "start enum\n name = \"Severity\"\n 0x04 = \"Non-Critical\"\n 0x08 = \"Critical\"\n 0x10 = \"Fatal\"\n"
           "end enum\n" +
           table(20, "EventGeneration|Voltage Probe|001", "2", generation,
                 {"4, 0x08, 1, 0, " + probe + ", 1, 2, 0, 1", "4, 0x10, 1, 0, " + probe + ", 1, 2, 0, 1",
                  "4, 0x04, 1, 0, " + probe + ", 1, 2, 0, 1"}) +
           "start group\n name = \"Short\"\n class = \"EventGeneration|Short|001\"\n id = 21\n" +
           attribute(1, "integer", "4") + attribute(2, "integer", "8") + integers(3, 4) +
           attribute(5, "displaystring(8)", "\"\"") + attribute(6, "integer", "1") + "end group\n" +
           table(3, "Zorek|Voltage Probe|001", "1",
                 attribute(1, "integer") + "start attribute\n name = \"Short Name\"\n id = 2\n"
                 " type = displaystring(32)\n value = \"\"\nend attribute\n" + attribute(3, "integer"),
                 {"1, \"CPU Core\", 1", "2, \"3.3V\", 0", "7, \"\", 0"}) +
           table(5, "Zorek|Fan|001", "1", integers(1, 2), {"4, 1200"}) +
           "start group\n name = \"Board Errors\"\n class = \"Zorek|Error|001\"\n id = 30\n" +
           attribute(1, "start enum\n 0 = \"OK\"\n 1 = \"Warning\"\n 2 = \"Failed\"\n 3 = \"Lost\"\n end enum", "2") +
           "end group\nend component\n";
}

std::string mifComponent(const std::string& name, std::initializer_list<std::string> groups)
{
    std::string text = "start component\n name = \"" + name + "\"\n";
    for (const auto& g : groups)
        text += g;
    return text + "end component\n";
}

std::string mifGroup(const std::string& name, const std::string& cls, unsigned id,
                     std::initializer_list<unsigned> strings, unsigned enumId, std::initializer_list<const char*> texts)
{
    std::string text = "start group\n name = \"" + name + "\"\n class = \"" + cls + "\"\n id = " + std::to_string(id) +
                       "\n";
    for (unsigned s : strings)
        text += attribute(static_cast<int>(s), "displaystring(32)", "\"\"");
    if (enumId != 0) {
        std::string e = "start enum\n 0 = \"No Action\"\n";
        int value = 1;
        for (const char* t : texts)
            e += " " + std::to_string(value++) + " = \"" + t + "\"\n";
        text += attribute(static_cast<int>(enumId), e + " end enum", "\"No Action\"");
    }
    return text + "end group\n";
}
