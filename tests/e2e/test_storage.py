"""What is stored survives: a carry-over start killed or failing at any write of
the provider, and a database no ordinary user or command-line process can take
from the daemon."""

import contextlib
import os
import shutil
import socket
import sys
import time

import test_registration
from test_events import LOG, TEMPERATURE_LINE, EventBedCase
from test_registration import MOX_COMPONENT
from testbed import LOG_ERR, require, run_in_parallel

BOARD = "Zorek Tessarin Baseboard"
# Another user (nobody) runs a program inside the testbed.
USER = ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"]
# As that user: hold the directory's own flock (the lock of old) and try the database's lock file.
USER_LOCKS = """import fcntl, os, sys, time
d = os.open(sys.argv[1], os.O_RDONLY | os.O_DIRECTORY); fcntl.flock(d, fcntl.LOCK_EX)
try: os.open(os.path.join(sys.argv[1], "lock"), os.O_RDONLY); print("opened", flush=True)
except PermissionError: print("refused", flush=True)
time.sleep(600)"""
# Accepts connections on argv[1] (a unix socket, or TCP port 25) and never says a word.
SILENT = """import socket, sys, time
s = socket.socket(socket.AF_UNIX) if sys.argv[1] != "25" else socket.socket()
s.bind(sys.argv[1] if sys.argv[1] != "25" else ("127.0.0.1", 25)); s.listen(8); print("ready", flush=True)
c = [s.accept() for _ in range(8)]"""
# Holds the database's lock for 1.5 s, as a command-line process would.
HOLD = """import fcntl, os, sys, time
fd = os.open(os.path.join(sys.argv[1], "lock"), os.O_RDWR); fcntl.flock(fd, fcntl.LOCK_EX)
print("held", flush=True); time.sleep(1.5)"""


class StorageTest(EventBedCase):

    def start(self, bed, fault=None):
        # One start of the daemon, stopped once it has registered: the count
        # of its storage operations, or its exit status when it ended first
        # (only a start with a fault may).
        mox = bed.start_mox({"DMISP_STORAGE_FAULT": fault} if fault else None)
        for _ in range(60):
            if not mox.running():
                self.assertTrue(fault, "a normal start ended: %r" % mox.stderr.data)
                return mox.status
            if bed.wait_registered(1):
                break
        else:
            self.fail("start with %s did not settle: %r" % (fault, mox.stderr.data))
        count = int(dict(l.split("\t") for l in bed.dmictl("status").splitlines())["storage operations"])
        mox.kill()
        return count

    def stored(self, bed):
        # Everything the daemon relies on: the own components, both actions
        # tables of the first one and the baseboard's e-mail settings.
        own = [l.split("\t")[0] for l in bed.dmictl("list").splitlines() if l.endswith("\t" + MOX_COMPONENT)]
        board = bed.component_id(BOARD)
        return (len(own), bed.dmictl("get", own[0], 1, 3), bed.dmictl("rows", own[0], 10),
                bed.dmictl("rows", own[0], 4), bed.dmictl("rows", board, 1012))

    def test_carry_over_survives_a_kill_or_failed_write_at_any_storage_operation(self):
        bed = self.bed("storage")
        db, template = bed.paths["db"], os.path.join(bed.paths["scratch"], "db")
        board = int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")))
        bed.dmictl("set", board, 1012, 1, "mail.example.org")
        bed.dmictl("set", board, 1012, 3, "ops@example.org")
        old = int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "old", "mox-2.92.mif")))
        keys = test_registration.RegistrationTest.key_ids(bed, old, 10)
        first = bed.table(old, 10)[0]
        changed = {a: "1" if first[a] == "0" else "0" for a in (7, 15, 30)}  # values no default has
        for attribute, value in changed.items():
            bed.dmictl("set", old, 10, attribute, value, *[a for k in keys for a in ("-k", first[k])])
        shutil.copytree(db, template)
        operations = self.start(bed)
        reference = self.stored(bed)
        self.assertEqual(reference[:2], (1, "2.93\n"))
        row = [r for r in bed.table(bed.component_id(MOX_COMPONENT), 10) if all(r[k] == first[k] for k in keys)]
        self.assertEqual({a: row[0][a] for a in changed}, changed)
        # Operation 1 installs the new MIF; the sets follow row by row, attribute 7 first: the set of the
        # first row's attribute 15 carries a value changed above (a failed set of a default hides itself).
        last, middle, reset = operations, operations // 2, 1 + 15 - 6
        # The faults of the starts before a normal one; every storage
        # operation with MOX_E2E_KILL_POINTS=all.
        if os.environ.get("MOX_E2E_KILL_POINTS") == "all":
            rows = [[kind % k] for k in range(1, last + 1)
                    for kind in ("kill-before:%d", "kill-after:%d", "fail:%d", "fail-from:%d")]
        else:
            rows = [["kill-before:1"], ["kill-after:1"], ["kill-before:%d" % middle], ["kill-before:%d" % last],
                    ["kill-after:%d" % last], ["fail:1"], ["fail:%d" % reset], ["fail:%d" % last], ["fail-from:2"],
                    ["kill-before:%d" % middle, "kill-before:3", "fail:%d" % middle]]
        lost, values, checked = [], 0, False
        for faults in rows:
            shutil.rmtree(db)
            shutil.copytree(template, db)
            for fault in faults:
                self.start(bed, fault)
            if not checked and bed.dmictl("list").count("\t" + MOX_COMPONENT) == 2:
                # mox --check tells an interrupted carry-over.
                checked, done = True, bed.run([require("MOX_BIN", "the mox daemon"), "--check"])
                self.assertIn(b"left by an interrupted carry-over; a start removes it\n", done.stdout)
            self.start(bed)
            got = self.stored(bed)
            if got != reference:
                lost.append(faults)
                # Values that differ: every field of every row, and each own component too many or too few.
                cells = lambda text: [c for line in text.splitlines() for c in line.split("\t")]
                values += abs(got[0] - 1) + sum(sum(a != b for a, b in zip(cells(g), cells(r))) +
                                                abs(len(cells(g)) - len(cells(r))) for g, r in zip(got[1:], reference[1:]))
        self.assertTrue(checked)
        print("%d storage operations in a carry-over start; %d fault rows, %d of them lost %d values: %s"
              % (operations, len(rows), len(lost), values, lost))
        self.assertEqual(lost, [])


    def test_no_other_user_or_command_line_process_keeps_the_daemon_out(self):
        mox_bin, dmictl = require("MOX_BIN", "the mox daemon"), require("MOX_DMICTL", "the provider's client tool")
        bed = self.bed("access")
        os.chmod(bed.root, 0o711)
        db, scratch, sock = bed.paths["db"], bed.paths["scratch"], bed.paths["dmisp_socket"]
        python = lambda script, *args, user=(): bed.spawn(list(user) + [sys.executable, "-c", script] + list(args))

        def deadline():
            # A provider that never answers is given up after 10 s.
            silent = python(SILENT, os.path.join(scratch, "silent.sock"))
            self.assertTrue(silent.stdout.wait_for(b"ready\n", 10))
            started = time.monotonic()
            code, _, err = bed.dmictl("--socket", os.path.join(scratch, "silent.sock"), "list", check=False)
            self.assertEqual((code, err.endswith("did not answer within 10 seconds\n")), (3, True), err)
            self.assertLess(time.monotonic() - started, 14)

        def access():
            # Directories another user owns or may write are refused; a new one is 0700 and closed to others.
            theirs, shared, fresh = (os.path.join(scratch, name) for name in ("theirs", "shared", "fresh"))
            os.mkdir(theirs, 0o700)
            os.chown(theirs, 65534, 65534)
            os.mkdir(shared)
            os.chmod(shared, 0o777)
            for path, reason in ((theirs, "owned by uid 65534, not by this user (uid 0); refusing it"),
                                 (shared, "writable by other users (mode 0777); refusing it")):
                mox = bed.start_mox({"DMISP_DB": path})
                self.assertEqual(mox.wait(30), 1, mox.stderr.data)
                self.assertIn(("dmisp: %s: %s\n" % (path, reason)).encode(), mox.stderr.data)
            self.assertEqual(os.listdir(theirs) + os.listdir(shared), [])
            bed.dmictl("--db", fresh, "list")
            self.assertEqual(os.stat(fresh).st_mode & 0o777, 0o700)
            done = bed.run(USER + [dmictl, "--db", fresh, "list"])
            self.assertEqual((done.returncode, done.stderr.decode()), (3, "dmictl: %s: permission denied\n" % fresh))
            # A change that cannot be stored is an error with its cause, and nothing changes.
            board = bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")).strip()
            before = bed.dmictl("mif", board)
            for command, failure in ((["set", board, 1012, 1, "x"], "cannot set the value: %s: no space left on device"),
                                     (["uninstall", board], "cannot remove component %s: %%s: read-only file system"
                                      % board)):
                done = bed.run([dmictl] + [str(a) for a in command], {"DMISP_STORAGE_FAULT": "fail:1"})
                path = "%s/component-%s.mif" % (db, board)
                self.assertEqual((done.returncode, done.stderr.decode()), (1, failure % path + "\n"))
                self.assertEqual(bed.dmictl("mif", board), before)

        run_in_parallel([deadline, access])
        ids = {"baseboard": bed.component_id(BOARD)}
        bed.dmictl("set", ids["baseboard"], 1012, 1, "127.0.0.1")
        mox = bed.start_mox()
        self.assertTrue(bed.wait_registered())
        ids["mox"] = bed.component_id(MOX_COMPONENT)
        self.critical_temperature(bed, ids, [LOG])
        mox.kill()
        # Another user holds the old lock and cannot open the new one; a test
        # alert waits on a silent SMTP server; a command-line process holds
        # the database for 1.5 s: the daemon waits for it, then holds the
        # database and hears the next event.
        user = python(USER_LOCKS, db, user=USER)
        self.assertTrue(user.stdout.wait_for(b"refused\n", 10), user.stdout.data)
        smtp = python(SILENT, "25")
        self.assertTrue(smtp.stdout.wait_for(b"ready\n", 10))
        test = bed.spawn([mox_bin, "--test-email"])
        self.assertTrue(test.stdout.wait_for(b"Sending a test alert", 20), test.stdout.data)
        hold = python(HOLD, db)
        self.assertTrue(hold.stdout.wait_for(b"held\n", 10))
        mox = bed.start_mox()
        self.assertTrue(bed.wait_registered(), mox.stderr.data)
        start = bed.log.mark()
        self.raise_temperature(bed, ids)
        self.assertLogged(bed, TEMPERATURE_LINE, LOG_ERR, start=start)
        # Sixteen silent clients and one that sends a byte every half second:
        # others are served at once, and the slow one is cut off after 5 s.
        silent = [socket.socket(socket.AF_UNIX) for _ in range(17)]
        for s in silent:
            s.connect(sock)
        slow, started = silent.pop(), time.monotonic()
        slow.sendall(b"\x01\0\0\0\x64\0\0\0")
        self.assertIn("\t" + MOX_COMPONENT, bed.dmictl("list"))
        self.assertLess(time.monotonic() - started, 3)
        with contextlib.suppress(OSError):
            while time.monotonic() - started < 12 and slow.send(b"x"):
                time.sleep(0.5)
            self.assertEqual(slow.recv(16), b"")
        self.assertTrue(4.5 < time.monotonic() - started < 8, time.monotonic() - started)
        done = bed.run(USER + [dmictl, "list"])
        self.assertEqual((done.returncode, done.stderr.decode()), (3, "%s: permission denied\n" % sock))


if __name__ == "__main__":
    import unittest
    unittest.main()
