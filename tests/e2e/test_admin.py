"""What an administrator checks before trusting the daemon, in one bed: the
version flag, readiness on a service manager's notify socket, the action log,
the explanation of an event, the check and the test alert while the daemon
runs."""

import os
import re
import socket
import time

from test_events import (EMAIL, INSTALLED, MOX_COMPONENT, RESET, TEMPERATURE_CONSOLE, TEMPERATURE_LINE, EventBedCase,
                         keys)
from testbed import LOG_INFO, LOG_NOTICE, require

PROBE = "event Temperature Probe of Zorek Tessarin Baseboard"


class AdminTest(EventBedCase):

    def test_version_readiness_action_log_and_test_alert(self):
        require("MOX_OBX_PRELOAD", "the simulated OBX driver")
        bed = self.bed("admin")
        mox_bin = require("MOX_BIN", "the mox daemon")
        for flag, expected in (("--version", b"mox 2.93\n"), ("--help", b"Usage: mox [--version")):
            started = time.monotonic()
            done = bed.run([mox_bin, flag], timeout=10)
            self.assertEqual((done.returncode, done.stderr), (0, b""), flag)
            self.assertTrue(done.stdout.startswith(expected), done.stdout)
            self.assertLess(time.monotonic() - started, 3, flag)
        for mode in (["--check"], ["--explain", "1", "20"]):  # a database that cannot be opened: no provider
            done = bed.run([mox_bin] + mode, {"DMISP_DB": "/proc/none"})
            self.assertEqual(done.returncode, 2, mode)
        self.assertEqual(done.stderr.splitlines()[-1], b"mox: the DMI service provider cannot be reached")
        # No marker check, no floppy probe, no log line, no provider contact.
        time.sleep(0.3)
        self.assertEqual(bed.log.snapshot(tag=None), [])
        self.assertEqual(os.listdir(bed.paths["db"]), [])

        # No SMTP server set while the default actions rows ask for e-mail.
        ids = {"baseboard": int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")))}
        bed.dmictl("set", ids["baseboard"], 1012, 3, "ops@example.org")
        bed.write("cfg", "mox.cfg", "# log what I do\nActionLog = TRUE\n")
        notify = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.addCleanup(notify.close)
        notify.bind(os.path.join(bed.root, "notify.sock"))
        notify.settimeout(60)
        mox = bed.start_mox({"NOTIFY_SOCKET": os.path.join(bed.root, "notify.sock")})
        messages = []
        while "READY=1" not in messages:
            messages.append(notify.recv(4096).decode())
        ready_at = time.monotonic()
        self.assertEqual(messages, ["STATUS=Checking marker files", "STATUS=Registering with the DMI service provider",
                                    "STATUS=Handling events", "READY=1"])
        # Registration (the daemon's MIF installed) came before readiness.
        self.assertLess(self.assertLogged(bed, INSTALLED, LOG_INFO, timeout=0).arrival, ready_at)
        self.assertTrue(bed.wait_registered(timeout=5))
        ids["mox"] = bed.component_id(MOX_COMPONENT)
        self.assertLogged(bed, lambda m: re.fullmatch(
            r"mox action: warning: [1-9]\d* actions-table rows ask for e-mail but no SMTP server is set "
            r"\(baseboard group 1012, attribute 1\)\n", m) is not None, LOG_NOTICE, timeout=0)

        bed.dmictl("set", ids["baseboard"], 1012, 1, "127.0.0.1")
        server = bed.start_smtp()
        self.critical_temperature(bed, ids, [EMAIL, RESET])
        self.explain_and_check(bed, ids, mox_bin)
        start = bed.log.mark()
        self.raise_temperature(bed, ids)
        mailed = self.assertLogged(bed, "mox action: e-mail alert for %s delivered to server[127.0.0.1]\n" % PROBE,
                                   LOG_NOTICE, timeout=30, start=start)
        reset = self.assertLogged(bed, "mox action: reset ordered for %s\n" % PROBE, LOG_NOTICE, start=start)
        entries = bed.log.snapshot()
        self.assertLess(entries.index(mailed), entries.index(reset))

        # The test alert, while the daemon holds the provider's database.
        done = bed.run([mox_bin, "--test-email"], timeout=60)
        out = done.stdout.decode()
        self.assertEqual(done.returncode, 0, out + done.stderr.decode())
        for line in ("greeting: 220 testbed ESMTP", "RCPT TO: 250 recipient ok", "message body: 250 queued",
                     "QUIT: 221 bye", "mox: the test alert was delivered to 127.0.0.1"):
            self.assertIn(line + "\n", out)
        sessions = bed.smtp_sessions(2, 5)
        self.assertEqual(len(sessions), 2)
        self.assertIn("RCPT TO:<ops@example.org>", [c.get("received") for c in sessions[1]["commands"]])
        self.assertTrue(sessions[1]["data"].startswith(
            "SUBJECT:Zorek Server Management Alert:%s (test)\r\nThis is a test alert from mox at server %s.\r\n"
            % ((socket.gethostname(),) * 2)), sessions[1]["data"])
        self.assertTrue(mox.running())

        # A server that refuses the recipient: the step and its reason, status 1.
        server.kill()
        os.remove(os.path.join(bed.paths["smtp"], "ready"))
        bed.start_smtp({"rcpt": "550 no such user"})
        done = bed.run([mox_bin, "--test-email"], timeout=60)
        self.assertEqual(done.returncode, 1, done.stdout)
        self.assertIn("RCPT TO: failed in step 14: The server[127.0.0.1] returned the following value:[550]"
                      " - reply: 550 no such user\n", done.stdout.decode())
        # The daemon's next alert fails the same way, and the action log says where.
        start = bed.log.mark()
        self.raise_temperature(bed, ids)
        self.assertLogged(bed, "mox action: e-mail alert for %s failed in step 14 (RCPT TO): The server[127.0.0.1] "
                          "returned the following value:[550]\n" % PROBE, LOG_NOTICE, timeout=30, start=start)

    def explain_and_check(self, bed, ids, mox_bin):
        # What the daemon would do for the critical temperature, through its
        # own matcher and dispatcher; none of it is done.
        peer = bed.start_kobd()
        writes = lambda: re.search(r"^writes\t(\d+)$", bed.dmictl("status"), re.M).group(1)
        before, obx, start = writes(), bed.obx_log(), bed.log.mark()
        explain = lambda *args: bed.run([mox_bin, "--explain"] + [str(a) for a in (ids["baseboard"],) + args])
        done = explain(20, "--instance", 2, "-k", 1)
        self.assertEqual((done.returncode, done.stderr), (0, b""), done.stdout)
        host, tried = socket.gethostname(), "keys 1=1 2=20 3=3 4=%d 5=0 6=0 31=2 32=2"
        self.assertEqual(done.stdout.decode().splitlines(), [
            'event class "EventGeneration|Temperature Probe|001": a standard event',
            "standard event of component %d (Zorek Tessarin Baseboard): event group 20, type 3 (Temperature "
            "Critical), severity 16 (Critical), system 2 (Environment), subsystem 2 (Temperature Sensor), group 2 "
            "(Temperature Probe), instance 1" % ids["baseboard"],
            "actions table: group 10 of component %d" % ids["mox"],
            "try 1: %s: no row" % (tried % 1), "try 2: %s: row found" % (tried % 0),
            'row enabled, alert name "Temperature Critical"',
            "action 8 ConsoleMessage: standard error: " + TEMPERATURE_CONSOLE.decode().rstrip("\n"),
            "action 9 LogEvent: alarm record component %d group 2 event group 20 severity 16 instance 1 power 0 to "
            "/dev/kob (kobd runs, process %d)" % (ids["baseboard"], peer.pid),
            "action 9 LogEvent: system log at err: " + TEMPERATURE_LINE.rstrip("\n"),
            'action 10 writeToLCD: LCD (group 30, attribute 8 of component %d): "Check: Temperature Probe        "'
            % ids["baseboard"],
            "action 16 BroadcastMessage: system log at emerg (every logged-in user): Please check group Temperature "
            "Probe on this machine",
            'action 20 MoxSendEmail: e-mail through server 127.0.0.1 port 25 from admin@%s to ops@example.org, '
            'subject "Zorek Server Management Alert:%s"' % (host, host),
            "action 15 resetSystem: system-control request 1 (reset) with delay 200 ms"])
        # A vendor event: the order of the four lookups.
        tries = [l for l in explain(10, "--instance", 6, "-k", 1).stdout.decode().splitlines() if l.startswith("try")]
        self.assertEqual(tries, ["try 1: keys 1=%d 2=6 3=1 4=1 5=0 6=0: no row" % ids["baseboard"],
                                 "try 2: keys 1=%d 2=6 3=1 4=1 5=-2147483648 6=0: row found" % ids["baseboard"]])
        # Under notificationonly (read by the explanation as the daemon reads it at its start).
        bed.write("cfg", "mox.cfg", "notificationonly = true\n")
        self.assertEqual(explain(20, "--instance", 2, "-k", 1).stdout.decode().splitlines()[-1],
                         "action 15 resetSystem: skipped: notificationonly is set")
        bed.write("cfg", "mox.cfg", "ActionLog = TRUE\n")
        # No trace: no log line, no write to the provider, nothing to the
        # controller, the SMTP server or the alarm peer.
        time.sleep(0.5)
        self.assertEqual(bed.log.since(start, tag=None), [])
        self.assertEqual((writes(), bed.obx_log(), bed.smtp_sessions(1, 0)), (before, obx, []))
        self.assertNotIn(b"alarm ", peer.stdout.data)
        # Bad arguments: no such row, a group that raises no event, no such component.
        bad = [explain(20, "--instance", 2, "-k", 77), explain(2, "-k", 1), bed.run([mox_bin, "--explain", "99", "20"])]
        self.assertEqual([(d.returncode, d.stdout) for d in bad], [(1, b"")] * 3)

        # The check: rows asking for two system-control actions, /dev/obx
        # missing, then a marker file, then neither.
        for attribute in (14, 15):
            bed.dmictl("set", ids["mox"], 10, attribute, "1", *keys([1, 20, 2, 0, 0, 0, 2, 2]))
        check = lambda: bed.run([mox_bin, "--check"])
        done = check()
        self.assertEqual(done.returncode, 1, done.stdout)
        self.assertEqual(done.stdout.decode().splitlines(), [
            "ok the DMI service provider answers (DMI 1.1, Mox substitute DMI service provider)",
            "ok own MIF installed: component %d, version 2.93; a start carries nothing over" % ids["mox"],
            "ok actions table group 10 (standard events): 20 rows, 20 enabled",
            "warning actions table group 10: 1 enabled row asks for more than one system-control action, of which "
            "only the first in run order can happen (first: keys 1=1 2=20 3=2 4=0 5=0 6=0 31=2 32=2: powerOff, "
            "resetSystem)",
            "ok actions table group 4 (vendor events): 12 rows, 12 enabled",
            "ok 14 enabled rows ask for e-mail, sent through server 127.0.0.1",
            "ok /usr/local/ubo/bin/mox.cfg read: notificationonly off, actionlog on",
            "ok no marker file in the working directory %s (the floppy is not looked at)" % bed.paths["work"],
            "error 2 enabled rows ask for system control but /dev/obx is not present as a device",
            "ok alarm peer kobd runs (process %d) and /dev/kob is a FIFO" % peer.pid])
        self.assertEqual(bed.run(["mknod", "/dev/obx", "c", "1", "3"]).returncode, 0)
        bed.write("work", "mox.not", "")
        done = check()
        self.assertEqual(done.returncode, 1, done.stdout)
        self.assertIn("error ./mox.not in the working directory %s disables the daemon\n" % bed.paths["work"],
                      done.stdout.decode())
        self.assertIn("ok /dev/obx present: 2 enabled rows ask for system control\n", done.stdout.decode())
        os.remove(os.path.join(bed.paths["work"], "mox.not"))
        self.assertEqual(check().returncode, 0)
        self.assertEqual((bed.log.since(start, tag=None), writes()), ([], before))
