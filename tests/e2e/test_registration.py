# Registration of the real daemon with the substitute DMI provider: its own MIF
# installed into an empty database, refusal, a missing MIF, and the carry-over of
# an older MIF's actions table.

import fcntl
import os
import shutil
import time

from testbed import LOG_ERR, LOG_INFO, BedTestCase, require, run_in_parallel, wait_until

MOX_COMPONENT = "Zorek Tessarin Server Manager - Mox"
START_LINES = ("Checking for mox configurations ..\n"
               "There is no floppy found in floppy drive\n"
               "Proceeding with loading mox ..\n")
INSTALLED = "MOX - installed mox.mif\n"
# Integer attributes of an actions-table row that the carry-over keeps:
# the action switches (17 is the alert name, a string) and the enable flag.
SWITCHES = [a for a in range(7, 23) if a != 17] + [30]


class RegistrationTest(BedTestCase):

    def setUp(self):
        require("MOX_DMICTL", "the provider's client tool")

    def test_empty_database_gets_mox_mif_and_a_restart_keeps_it(self):
        bed = self.bed("register")
        mox = bed.start_mox()
        self.assertLogged(bed, INSTALLED, LOG_INFO)
        time.sleep(1.0)
        self.assertTrue(mox.running(), "status %s, stderr %r" % (mox.status, mox.stderr.data))
        self.assertEqual(mox.stdout.data.decode(), START_LINES)
        component = self.current_mox(bed)
        self.assertIsNotNone(component, bed.dmictl("list"))
        # The daemon registered once with the provider that serves it.
        self.assertIn("registrations\t1\n", bed.dmictl("status"))
        mox.kill()
        before = len(bed.log.snapshot("mox"))
        self.second_start(bed, component)
        self.assertEqual([e.message for e in bed.log.snapshot("mox")[before:]],
                         ["\n" + START_LINES.splitlines(True)[0]] + START_LINES.splitlines(True)[1:])

    def second_start(self, bed, component):
        # A second start finds the MIF current: nothing installed, nothing
        # migrated (a migration reinstalls and so changes the component id).
        again = bed.start_mox()
        self.assertTrue(again.stdout.wait_for(b"Proceeding with loading mox ..\n", 10))
        self.assertTrue(wait_until(lambda: "registrations\t1\n" in bed.dmictl("status", check=False)[1], 10))
        time.sleep(1.0)
        self.assertTrue(again.running(), again.stderr.data)
        self.assertEqual(self.current_mox(bed), component)
        again.kill()

    def test_initialisation_failures(self):
        def refused():
            # The provider refuses every command while another provider
            # holds its database: registration fails with 2.
            bed = self.bed("refused")
            lock = os.open(os.path.join(bed.paths["db"], "lock"), os.O_RDWR | os.O_CREAT, 0o600)
            self.addCleanup(os.close, lock)
            fcntl.flock(lock, fcntl.LOCK_EX)
            self.failure(bed, 2)

        def no_mif():
            # No mox.mif where the daemon installs MIFs from: 3.
            bed = self.bed("nomif", mifs=False)
            self.failure(bed, 3)

        run_in_parallel([refused, no_mif])

    def failure(self, bed, code):
        mox = bed.start_mox()
        status = mox.wait(15)
        line = "mox: initialization failed, return code = 0x%x" % code
        self.assertEqual(status, 1, mox.stderr.data)
        self.assertEqual(mox.stdout.data.decode(), START_LINES + "MOX ERROR, " + line + "\n")
        self.assertLogged(bed, line + "\n", LOG_ERR)
        self.assertEqual(bed.log.snapshot("mox")[-1].message, line + "\n")
        if code == 3:
            self.assertEqual(bed.dmictl("list"), "")

    def test_carry_over_of_older_actions_tables(self):
        # version -> (table group in the old MIF, group written in the new,
        #             keys added to the old rows' to give the new rows')
        cases = {"2.40": (3, 4, ["0"]), "2.60": (4, 4, []), "2.92": (10, 10, [])}

        def case(version, old_group, new_group, added_keys):
            def check():
                bed = self.bed("carry")
                old_file = os.path.join(bed.paths["scratch"], "mox-%s.mif" % version)
                shutil.copy(os.path.join(bed.paths["mifs"], "old", "mox-%s.mif" % version), old_file)
                old_id = int(bed.dmictl("install", old_file))
                key_ids = self.key_ids(bed, old_id, old_group)
                # An administrator's change, to values no default has (2.40's
                # enable flag, attribute 6, is attribute 30 now).
                first = bed.table(old_id, old_group)[0]
                for attribute in (7, 6) if old_group == 3 else (7,):
                    bed.dmictl("set", old_id, old_group, attribute, str(attribute),
                               *[a for k in key_ids for a in ("-k", first[k])])
                # (new keys, attribute) -> value; the enable flag of 2.40 was
                # attribute 6.
                expected = {}
                for old in bed.table(old_id, old_group):
                    for a in SWITCHES:
                        source = 6 if (a == 30 and old_group == 3) else a
                        if source in old:
                            expected[(tuple([old[k] for k in key_ids] + added_keys), a)] = old[source]
                changed = (tuple([first[k] for k in key_ids] + added_keys), 7)
                self.assertEqual(expected[changed], "7", version)

                # What a start would carry over, told by mox --check before it
                # (warnings only: the old tables are replaced).
                check = bed.run([require("MOX_BIN", "the mox daemon"), "--check"])
                self.assertIn("warning own MIF installed: component %d, version %g; a start installs the new mox.mif "
                              "and carries actions table group %d over into group %d\n"
                              % (old_id, float(version), old_group, new_group), check.stdout.decode())
                self.assertEqual(check.returncode, 0, check.stdout)
                mox = bed.start_mox()
                # The old MIF goes last, once the new one holds every value.
                self.assertTrue(bed.wait_registered(60), "%s: %s" % (version, mox.stderr.data))
                new_id = self.current_mox(bed)
                self.assertTrue(new_id, "%s: mox.mif 2.93 never appeared; %s" % (version, mox.stderr.data))
                self.assertNotEqual(new_id, old_id, version)
                self.assertEqual(len(bed.dmictl("list").splitlines()), 1, version)
                new_key_ids = self.key_ids(bed, new_id, new_group)

                def carried():
                    # The new table's values at the old rows' mapped keys (rows
                    # the new MIF does not have are dropped).
                    new = {(tuple(row[k] for k in new_key_ids), a): row.get(a)
                           for row in bed.table(new_id, new_group) for a in SWITCHES}
                    return {key: new[key] for key in expected if key in new}
                got = carried()
                self.assertIn(changed, got, version)
                if old_group == 3:
                    self.assertEqual(got[(changed[0], 30)], "6", version)
                self.assertEqual(got, {k: expected[k] for k in got}, version)
                self.assertIsNone(bed.log.wait_for(INSTALLED, 0), version)
                table = bed.table(new_id, new_group)
                mox.kill()
                self.second_start(bed, new_id)
                self.assertEqual(bed.table(new_id, new_group), table, version)
            return check

        run_in_parallel([case(v, *c) for v, c in cases.items()])

    @staticmethod
    def current_mox(bed):
        # The own component's id once its version reads 2.93, else None.
        code, out, _ = bed.dmictl("list", check=False)
        for line in out.splitlines() if code == 0 else []:
            cid, _, name = line.partition("\t")
            if name == MOX_COMPONENT:
                code, version, _ = bed.dmictl("get", cid, 1, 3, check=False)
                if code == 0 and version == "2.93\n":
                    return int(cid)
        return None

    @staticmethod
    def key_ids(bed, component, group):
        for line in bed.dmictl("groups", component).splitlines():
            fields = line.split("\t")
            if int(fields[0]) == group:
                return [int(k) for k in fields[3].split()[1:]]
        raise AssertionError("group %d not listed" % group)


if __name__ == "__main__":
    import unittest
    unittest.main()
