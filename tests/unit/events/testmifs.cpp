#include "testmifs.h"

namespace {

std::string intAttribute(int id, const std::string& name, const std::string& value = "0")
{
    return "start attribute\n name = \"" + name + "\"\n id = " + std::to_string(id) +
           "\n type = integer\n access = read-write\n value = " + value + "\nend attribute\n";
}

std::string actionAttributes(int n)
{
    std::string out;
    for (int id = 7; id < 7 + n; ++id) {
        if (id == 17)
            out += "start attribute\n name = \"Alert\"\n id = 17\n type = displaystring(64)\n access = read-write\n"
                   " value = \"\"\nend attribute\n";
        else
            out += intAttribute(id, "Action " + std::to_string(id));
    }
    return out + intAttribute(30, "Enabled", "1");
}

} // namespace

std::string ownMif(const std::string& standardRows, const std::string& vendorRows, int n)
{
    return "start component\n name = \"Zorek Tessarin Server Manager - Mox\"\n"
           "start group\n name = \"ComponentID\"\n class = \"DMTF|ComponentID|001\"\n id = 1\n"
           "start attribute\n name = \"Version\"\n id = 3\n type = displaystring(8)\n value = \"2.93\"\nend attribute\n"
           "end group\n"
           "start group\n name = \"Supported\"\n class = \"Zorek|Mox Supported Components|001\"\n id = 2\n key = 1\n" +
           intAttribute(1, "MIF Id") +
           "start attribute\n name = \"Component\"\n id = 2\n type = displaystring(64)\n value = \"\"\nend attribute\n"
           "end group\n"
           "start table\n name = \"Supported\"\n class = \"Zorek|Mox Supported Components|001\"\n id = 2\n"
           " { 1, \"Test Board\" }\n { 2, \"Other Board\" }\nend table\n"
           "start group\n name = \"Vendor Actions\"\n class = \"Zorek|Mox Vendor Event Actions|001\"\n id = 4\n"
           " key = 1,2,3,4,5,6\n" +
           intAttribute(1, "MIF") + intAttribute(2, "Group") + intAttribute(3, "Instance") + intAttribute(4, "Attribute") +
           intAttribute(5, "Value") + intAttribute(6, "State") + actionAttributes(n) +
           "end group\n"
           "start table\n name = \"Vendor Actions\"\n class = \"Zorek|Mox Vendor Event Actions|001\"\n id = 4\n" +
           vendorRows +
           "end table\n"
           "start group\n name = \"Standard Actions\"\n class = \"Zorek|Mox Standard Event Actions|001\"\n id = 10\n"
           " key = 1,2,3,4,5,6,31,32\n" +
           intAttribute(1, "MIF") + intAttribute(2, "Group") + intAttribute(3, "Type") + intAttribute(4, "Instance") +
           intAttribute(5, "Zero") + intAttribute(6, "Severity") + actionAttributes(n) + intAttribute(31, "System") +
           intAttribute(32, "Subsystem") +
           "end group\n"
           "start table\n name = \"Standard Actions\"\n class = \"Zorek|Mox Standard Event Actions|001\"\n id = 10\n" +
           standardRows + "end table\nend component\n";
}

std::string boardMif(const std::string& name)
{
    return "start component\n name = \"" + name +
           "\"\n"
           "start enum\n name = \"Severity\"\n 0x04 = \"Non-Critical\"\n 0x08 = \"Critical\"\n 0x10 = \"Fatal\"\nend enum\n"
           // event generation for the voltage probes: 8 attributes
           "start group\n name = \"Voltage Event Generation\"\n class = \"EventGeneration|Voltage Probe|001\"\n"
           " id = 20\n key = 2\n"
           "start attribute\n name = \"Event Type\"\n id = 1\n type = start enum\n 4 = \"Voltage Above Upper Critical\"\n"
           " end enum\n value = 4\nend attribute\n"
           "start attribute\n name = \"Event Severity\"\n id = 2\n type = \"Severity\"\n value = 0x08\nend attribute\n"
           "start attribute\n name = \"State\"\n id = 3\n type = integer\n value = 1\nend attribute\n"
           "start attribute\n name = \"Reserved\"\n id = 4\n type = integer\n value = 0\nend attribute\n"
           "start attribute\n name = \"Instance Class\"\n id = 5\n type = displaystring(64)\n"
           " value = \"Zorek|Voltage Probe|001\"\nend attribute\n"
           "start attribute\n name = \"Event System\"\n id = 6\n type = start enum\n 1 = \"Power\"\n end enum\n"
           " value = 1\nend attribute\n"
           "start attribute\n name = \"Event Subsystem\"\n id = 7\n type = start enum\n 2 = \"Voltage\"\n end enum\n"
           " value = 2\nend attribute\n"
           "start attribute\n name = \"Solution\"\n id = 8\n type = integer\n value = 0\nend attribute\n"
           "start attribute\n name = \"Instance Data Present\"\n id = 9\n type = integer\n value = 1\nend attribute\n"
           "end group\n"
           "start table\n name = \"Voltage Event Generation\"\n class = \"EventGeneration|Voltage Probe|001\"\n id = 20\n"
           " { 4, 0x08, 1, 0, \"Zorek|Voltage Probe|001\", 1, 2, 0, 1 }\n"
           " { 4, 0x10, 1, 0, \"Zorek|Voltage Probe|001\", 1, 2, 0, 1 }\n"
           " { 4, 0x04, 1, 0, \"Zorek|Voltage Probe|001\", 1, 2, 0, 1 }\n"
           "end table\n"
           // a short event-generation group: 6 attributes only
           "start group\n name = \"Short Event Generation\"\n class = \"EventGeneration|Short|001\"\n id = 21\n"
           "start attribute\n name = \"Event Type\"\n id = 1\n type = integer\n value = 4\nend attribute\n"
           "start attribute\n name = \"Event Severity\"\n id = 2\n type = integer\n value = 8\nend attribute\n"
           "start attribute\n name = \"A\"\n id = 3\n type = integer\n value = 0\nend attribute\n"
           "start attribute\n name = \"B\"\n id = 4\n type = integer\n value = 0\nend attribute\n"
           "start attribute\n name = \"C\"\n id = 5\n type = displaystring(8)\n value = \"\"\nend attribute\n"
           "start attribute\n name = \"D\"\n id = 6\n type = integer\n value = 1\nend attribute\n"
           "end group\n"
           // the instance table
           "start group\n name = \"Voltage Probe\"\n class = \"Zorek|Voltage Probe|001\"\n id = 3\n key = 1\n"
           "start attribute\n name = \"Index\"\n id = 1\n type = integer\n value = 0\nend attribute\n"
           "start attribute\n name = \"Short Name\"\n id = 2\n type = displaystring(32)\n value = \"\"\nend attribute\n"
           "start attribute\n name = \"Reading\"\n id = 3\n type = start enum\n 0 = \"Normal\"\n 1 = \"Too High\"\n end enum\n"
           " value = 0\nend attribute\n"
           "end group\n"
           "start table\n name = \"Voltage Probe\"\n class = \"Zorek|Voltage Probe|001\"\n id = 3\n"
           " { 1, \"CPU Core\", 1 }\n { 2, \"3.3V\", 0 }\n { 7, \"\", 0 }\nend table\n"
           // a table without a name attribute
           "start group\n name = \"Fan\"\n class = \"Zorek|Fan|001\"\n id = 5\n key = 1\n"
           "start attribute\n name = \"Index\"\n id = 1\n type = integer\n value = 0\nend attribute\n"
           "start attribute\n name = \"Speed\"\n id = 2\n type = integer\n value = 0\nend attribute\n"
           "end group\n"
           "start table\n name = \"Fan\"\n class = \"Zorek|Fan|001\"\n id = 5\n { 4, 1200 }\nend table\n"
           // vendor error group: first attribute the error state
           "start group\n name = \"Board Errors\"\n class = \"Zorek|Error|001\"\n id = 30\n"
           "start attribute\n name = \"Error State\"\n id = 1\n type = start enum\n 0 = \"OK\"\n"
           " 1 = \"Warning\"\n 2 = \"Failed\"\n end enum\n value = 2\nend attribute\n"
           "end group\n"
           "end component\n";
}
