# Start-up of the real daemon: the marker files, the floppy probe, its lines.

import os
import time

from testbed import LOG_ERR, BedTestCase, run_in_parallel

CHECKING = "Checking for mox configurations ..\n"
NO_FLOPPY = "There is no floppy found in floppy drive\n"
PROCEEDING = "Proceeding with loading mox ..\n"
NOTHING_ON_FLOPPY = "Couldn't find any mox configuration files in floppy drive\n"
DISABLED = "Mox has been disabled.\n"
MOUNT = "mount -t msdos /dev/fd0 /mnt/floppy"
UMOUNT = "umount /mnt/floppy"


def log_sequence(bed):
    # The daemon's lines and the stub mount/umount calls, in arrival order.
    return [(e.tag, e.message) for e in bed.log.snapshot() if e.tag in ("mox", "stub")]


class StartupTest(BedTestCase):

    # The floppy is stood in for by the testbed's stub mount and umount
    # commands, which make a medium's files appear in /mnt/floppy.

    def test_start_without_markers_or_floppy(self):
        bed = self.bed("plain")
        mox = bed.start_mox()
        self.assertTrue(mox.stdout.wait_for(PROCEEDING.encode(), 10), mox.stdout.data)
        time.sleep(1.5)
        self.assertTrue(mox.running(), "mox ended: status %s, stderr %r" % (mox.status, mox.stderr.data))
        self.assertTrue(mox.stdout.data.startswith((CHECKING + NO_FLOPPY + PROCEEDING).encode()),
                        mox.stdout.data)
        # The system-log copy of the first line starts with a line feed.
        sequence = log_sequence(bed)
        self.assertEqual(sequence[:4], [("mox", "\n" + CHECKING), ("stub", MOUNT),
                                        ("mox", NO_FLOPPY), ("mox", PROCEEDING)])
        for entry in bed.log.snapshot("mox")[:3]:
            self.assertEqual((entry.facility, entry.level), (1, LOG_ERR), entry)
        # Nothing was mounted, so nothing is unmounted; the mount's complaint
        # went to /dev/null, not to the daemon's standard error.
        self.assertNotIn(("stub", UMOUNT), sequence)
        self.assertNotIn(b"no medium", mox.stderr.data)

    def test_markers_disable_the_daemon(self):
        # name -> (local files, floppy files or None, expected standard output,
        #          expected sequence of log lines and stub calls)
        floppy_disabled = lambda line: (
            CHECKING + line + DISABLED,
            [("mox", "\n" + CHECKING), ("stub", MOUNT), ("stub", UMOUNT), ("mox", line), ("mox", DISABLED)])
        local_disabled = (DISABLED, [("mox", DISABLED)])
        cases = {
            "local mox.not": (["mox.not"], None) + local_disabled,
            "local vornmox.not": (["vornmox.not"], None) + local_disabled,
            "local markers and a floppy marker": (["mox.not", "vornmox.not"], {"mox.not": ""}) + local_disabled,
            "floppy mox.not": ([], {"mox.not": ""}) + floppy_disabled("file mox.not  found in floppy\n"),
            "floppy vornmox.not": ([], {"vornmox.not": "x"}) + floppy_disabled("file vornmox.not found in floppy\n"),
            "floppy with both": ([], {"vornmox.not": "", "mox.not": ""})
            + floppy_disabled("file mox.not  found in floppy\n"),
        }

        def case(name, local, floppy, stdout, sequence):
            def check():
                bed = self.bed("marker")
                for marker in local:
                    bed.write("work", marker, "")
                bed.floppy(floppy)
                mox = bed.start_mox()
                status = mox.wait(10)
                self.assertEqual(status, 0, name)
                self.assertEqual(mox.stdout.data.decode(), stdout, name)
                self.assertEqual(mox.stderr.data, b"", name)
                # The last datagram was sent before the exit; give it a moment.
                bed.log.wait_for(DISABLED, 2)
                self.assertEqual(log_sequence(bed), sequence, name)
                for entry in bed.log.snapshot("mox"):
                    self.assertEqual((entry.facility, entry.level), (1, LOG_ERR), name)
                self.assertEqual(os.listdir(bed.paths["floppy"]), [], name + ": floppy left mounted")
            return check

        run_in_parallel([case(name, *c) for name, c in cases.items()])

    def test_floppy_without_markers_is_unmounted_and_start_proceeds(self):
        bed = self.bed("floppy")
        bed.floppy({"readme.txt": "not a marker"})
        mox = bed.start_mox()
        self.assertTrue(mox.stdout.wait_for(PROCEEDING.encode(), 10), mox.stdout.data)
        self.assertIsNotNone(bed.log.wait_for(UMOUNT, 5, tag="stub"))
        time.sleep(1.0)
        self.assertTrue(mox.running(), mox.stderr.data)
        self.assertTrue(mox.stdout.data.startswith((CHECKING + NOTHING_ON_FLOPPY + PROCEEDING).encode()),
                        mox.stdout.data)
        self.assertEqual(log_sequence(bed)[:5], [
            ("mox", "\n" + CHECKING), ("stub", MOUNT), ("mox", NOTHING_ON_FLOPPY), ("mox", PROCEEDING),
            ("stub", UMOUNT)])
        self.assertEqual(os.listdir(bed.paths["floppy"]), [])


if __name__ == "__main__":
    import unittest
    unittest.main()
