# Events whose actions reach beyond the daemon: an e-mail alert delivered to a
# real SMTP server, the notifications-only configuration keeping the machine
# untouched, and the operating-system shutdown through /sbin/init.

import email
import email.policy
import os
import socket
import subprocess
import time

import testbed
from test_events import (TEMPERATURE_BROADCAST, TEMPERATURE_CONSOLE, TEMPERATURE_LINE, RESET, SHUTDOWN_OS,
                         EventBedCase, listening)
from testbed import LOG_EMERG, LOG_ERR, run_in_parallel


class ControlTest(EventBedCase):

    def test_email_to_a_real_smtp_server(self):
        # Debian's aiosmtpd, storing what it receives in a maildir.
        python = "/usr/bin/python3"
        if subprocess.run([python, "-c", "import aiosmtpd"], capture_output=True).returncode != 0:
            self.skipTest("python3-aiosmtpd is not installed")
        bed, mox, ids, _ = self.event_bed("realmail", email={1: "127.0.0.1", 2: "mox@example.org",
                                                             3: "ops@example.org"})
        maildir = os.path.join(bed.paths["smtp"], "maildir")
        server = bed.spawn([python, "-m", "aiosmtpd", "-n", "-l", "127.0.0.1:25",
                            "-c", "aiosmtpd.handlers.Mailbox", maildir])
        self.assertTrue(listening(server.pid, 25, 10), server.stderr.data)
        self.critical_temperature(bed, ids, [])  # its row sends e-mail as installed
        self.raise_temperature(bed, ids)
        new = os.path.join(maildir, "new")
        messages = testbed.wait_until(lambda: [os.path.join(new, n) for n in os.listdir(new)]
                                      if os.path.isdir(new) else [], 20, 0.2)
        self.assertEqual(len(messages), 1, "no mail stored; stderr %r" % mox.stderr.data)
        with open(messages[0], "rb") as f:
            message = email.message_from_binary_file(f, policy=email.policy.compat32)
        host = socket.gethostname()
        # The subject line is the only header the daemon sends.
        self.assertEqual((message["X-MailFrom"], message["X-RcptTo"], message["Subject"]),
                         ("mox@example.org", "ops@example.org", "Zorek Server Management Alert:%s" % host))
        self.assertEqual(message.get_payload(), "Check Temperature Probe at server %s\nEvent Type:Temperature Critical\n"
                         "Event Severity:Critical\nComponent:Zorek Tessarin Baseboard\nGroup:Temperature Probe\n"
                         "Instance:CPU 1\n" % host)
        # No failure line: the dialogue passed every stage.
        self.assertEqual([e.message for e in bed.log.since(0) if "Email Alert failed" in e.message], [])

    def test_notification_only_and_os_shutdown(self):
        def notification_only():
            # The same row also asks for an OS shutdown and a reset: with
            # notifications only, nothing of either may happen.
            bed, mox, ids, _ = self.event_bed("notifyonly", config="# mox options\nNotificationOnly = TRUE\n")
            self.critical_temperature(bed, ids, [SHUTDOWN_OS, RESET])
            self.raise_temperature(bed, ids)
            self.assertLogged(bed, TEMPERATURE_LINE, LOG_ERR)
            self.assertLogged(bed, TEMPERATURE_BROADCAST, LOG_EMERG)
            time.sleep(4.0)  # longer than the reset's 3 s wait
            self.assertTrue(mox.running(), "status %s" % mox.status)
            self.assertEqual(mox.stderr.data, TEMPERATURE_CONSOLE)
            if testbed.piece("MOX_OBX_PRELOAD"):
                self.assertEqual([l for l in bed.obx_log() if not l.startswith(("open", "get device id"))], [],
                                 "requests reached the simulated driver")
            self.assertFalse(os.path.exists(os.path.join(bed.paths["run"], "init.record")))

        def os_shutdown():
            bed, mox, ids, _ = self.event_bed("shutdown")
            self.critical_temperature(bed, ids, [SHUTDOWN_OS])
            self.raise_temperature(bed, ids)
            status = mox.wait(15)
            # /sbin/init replaced the daemon: same process, "init" "0".
            self.assertEqual(status, 0, mox.stderr.data)
            with open(os.path.join(bed.paths["run"], "init.record")) as f:
                record = f.read().splitlines()
            self.assertEqual(record, ["pid %d" % mox.pid, "arg init", "arg 0"])
            # The notifications of the row came first.
            self.assertEqual(mox.stderr.data, TEMPERATURE_CONSOLE)
            self.assertLogged(bed, TEMPERATURE_LINE, LOG_ERR, timeout=0)

        run_in_parallel([notification_only, os_shutdown])


if __name__ == "__main__":
    import unittest
    unittest.main()
