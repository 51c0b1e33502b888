#!/usr/bin/env python3
"""Proves that check_mifs.py finds real inconsistencies: each case breaks one
thing in a copy of the MIF directory and expects the check to fail with a
message naming it. Usage: test_check_mifs.py <mifs directory>"""

import os
import shutil
import sys
import tempfile
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)
import check_mifs  # noqa: E402

SOURCE = HERE

# (name, file, text to replace, replacement, part of the expected message)
CASES = [
    ("own version too low", "mox.mif",
     'value = "2.93"', 'value = "2.92"', "carried over again"),
    ("own component renamed", "mox.mif",
     'name = "Zorek Tessarin Server Manager - Mox"',
     'name = "Zorek Tessarin Server Manager - mox"', "component name"),
    ("supported name differs in case", "mox.mif",
     '{ 1, "Zorek Tessarin Baseboard" }', '{ 1, "Zorek Tessarin baseboard" }',
     "no MIF here"),
    ("standard table key set", "mox.mif",
     "key = 1,2,3,4,5,6,31,32", "key = 1,2,3,4,5,6,31", "keys"),
    ("alert name moved off 17", "mox.mif",
     'name = "Alert Name"\n            id = 17', 'name = "Alert Name"\n            id = 23',
     "integer expected"),
    ("action switch moved off its id", "mox.mif",
     'name = "ID LED Off"\n            id = 21', 'name = "ID LED Off"\n            id = 24',
     "action 21 is not at position 14"),
    ("enable flag moved off 30", "mox.mif",
     'name = "Enabled"\n            id = 30', 'name = "Enabled"\n            id = 29',
     "no enable flag"),
    ("row one value short", "mox.mif",
     "0, 0, 0, 0, 0, 1, 2, 2 }   // returned to normal",
     "0, 0, 0, 0, 0, 1, 2 }   // returned to normal", "row has 24 values"),
    ("baseboard standard row with a severity", "mox.mif",
     "{ 1, 20, 2, 0, 0, 0,", "{ 1, 20, 2, 0, 0, 8,", "severity key 0"),
    ("event type without a row", "mox.mif",
     '{ 1, 22, 2, 0, 0, 0, 0, 1, 1, 0, 0, 0, 0, 0, 0, 0, "", 0, 0, 0, 0, 0, 1, 3, 4 }',
     "", "event type 2"),
    ("row for an event type that does not exist", "mox.mif",
     "{ 1, 22, 3, 0, 0, 0,", "{ 1, 22, 9, 0, 0, 0,", "event type 9"),
    ("row for a missing instance", "mox.mif",
     "{ 1, 20, 3, 4, 0, 0,", "{ 1, 20, 3, 7, 0, 0,", "instance 7"),
    ("baseboard vendor row with an error state", "mox.mif",
     "{ 1, 3, 0, 1, -2147483648, 0,", "{ 1, 3, 0, 1, -2147483648, 2,", "error state 0"),
    ("vendor row for a missing attribute", "mox.mif",
     "{ 1, 4, 0, 1, -2147483648, 0,", "{ 1, 4, 0, 9, -2147483648, 0,", "attribute 9"),
    ("two rows with the same keys", "mox.mif",
     "{ 1, 3, 0, 1, -2147483648, 0,", "{ 1, 2, 0, 1, -2147483648, 0,", "two rows"),
    ("action switch not an integer", "mox.mif",
     '{ 1, 0, 0, 0, 0, 0, 0, 1, 1,', '{ 1, 0, 0, 0, 0, 0, 0, "1", 1,', "integer expected"),
    ("old row keys missing in the new table", "old/mox-2.40.mif",
     "{ 1, 2, 0, 1, -2147483648, 1,", "{ 1, 2, 0, 2, -2147483648, 1,", "have no row"),
    ("old row equal to the new defaults", "old/mox-2.92.mif",
     '{ 1, 20, 3, 0, 0, 0, 1, 1, 1, 1, 0, 0, 0, 0, 0, 1, "Legacy Temperature", 0, 1, 0,',
     '{ 1, 20, 3, 0, 0, 0, 0, 1, 1, 1, 0, 0, 0, 0, 0, 1, "Legacy Temperature", 0, 0, 1,',
     "equal the defaults"),
    ("old version in the wrong band", "old/mox-2.60.mif",
     'value = "2.60"', 'value = "2.95"', "not be carried over"),
    ("system control text", "baseboard.mif",
     '1 = "Issue an NMI"', '1 = "Issue NMI"', "Issue an NMI"),
    ("system control rests at a request", "baseboard.mif",
     '1 = "Initiate Reset"\n            end enum\n            access = read-write\n'
     '            storage = specific\n            value = "No Action"',
     '1 = "Initiate Reset"\n            end enum\n            access = read-write\n'
     '            storage = specific\n            value = "Initiate Reset"', "neutral"),
    ("paging text", "baseboard.mif", '1 = "Page"', '1 = "Page Now"', "'Page'"),
    ("status display width", "baseboard.mif",
     "type = displaystring(32)\n            access = read-write\n            storage = specific\n"
     '            value = "                                "',
     "type = displaystring(31)\n            access = read-write\n            storage = specific\n"
     '            value = "                               "', "status display"),
    ("e-mail server set by default", "baseboard.mif",
     'description = "Host name or dotted IPv4 address."\n            type = displaystring(124)\n'
     '            access = read-write\n            storage = specific\n            value = ""',
     'description = "Host name or dotted IPv4 address."\n            type = displaystring(124)\n'
     '            access = read-write\n            storage = specific\n            value = "mail"',
     "empty by default"),
    ("event group names a missing class", "baseboard.mif",
     'value = "Zorek|Voltage Probe|001"', 'value = "Zorek|Voltage Probes|001"', "attribute 5"),
    ("event group without the instance flag", "baseboard.mif",
     'name = "Instance Data Present"\n            id = 9', 'name = "Instance Data Present"\n            id = 11',
     "no attribute 9"),
    ("vendor error group renamed", "baseboard.mif",
     'class = "Zorek|Error|001"', 'class = "Zorek|Fault|001"', "vendor error group"),
    ("bad escape", "baseboard.mif",
     'description = "Addresses separated by \\",\\"', 'description = "Addresses separated by \\q"',
     "bad escape"),
    ("value longer than its string", "baseboard.mif",
     '{ 1, "CPU 1", 45,', '{ 1, "CPU 1 with a name far longer than 32", 45,', "longer than 32"),
    ("table for a missing group", "enclosure.mif",
     'class = "Zorek|Drive Bay|001"\n        id = 2\n        // Bay Number',
     'class = "Zorek|Drive Bays|001"\n        id = 2\n        // Bay Number', "refers to no group"),
]


class BrokenCopies(unittest.TestCase):
    def test_shipped_files_pass(self):
        problems, nfiles = check_mifs.check(SOURCE)
        self.assertEqual(problems, [])
        self.assertGreaterEqual(nfiles, 6)

    def test_each_break_is_found(self):
        for name, fn, old, new, expect in CASES:
            with self.subTest(name), tempfile.TemporaryDirectory() as tmp:
                d = os.path.join(tmp, "mifs")
                shutil.copytree(SOURCE, d, ignore=shutil.ignore_patterns("*.py", "__pycache__"))
                path = os.path.join(d, fn)
                with open(path, encoding="latin-1") as f:
                    text = f.read()
                self.assertTrue(old in text, f"{name}: pattern not found")
                with open(path, "w", encoding="latin-1") as f:
                    f.write(text.replace(old, new, 1))   # the first occurrence
                problems, _ = check_mifs.check(d)
                self.assertTrue(any(expect in p for p in problems),
                                f"{name}: expected {expect!r} in {problems}")


if __name__ == "__main__":
    if len(sys.argv) > 1:
        SOURCE = os.path.abspath(sys.argv.pop(1))
    unittest.main()
