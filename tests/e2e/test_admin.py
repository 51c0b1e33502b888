"""What an administrator checks before trusting the daemon, in one bed: the
version flag, readiness on a service manager's notify socket, the action log
and the test alert while the daemon runs."""

import os
import re
import socket
import time

from test_events import EMAIL, INSTALLED, MOX_COMPONENT, RESET, EventBedCase
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
