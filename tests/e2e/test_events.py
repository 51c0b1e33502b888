# Events through the real daemon: raised by the substitute provider, matched in
# the daemon's actions tables, and carried out on every channel a person or the
# machine sees (standard error and output, system log, alarm peer, e-mail, the
# baseboard's LCD, paging and ID-LED groups, the simulated management
# controller).

import os
import shutil
import socket
import struct
import tempfile
import time

import testbed
from testbed import LOG_EMERG, LOG_ERR, LOG_INFO, LOG_WARNING, BedTestCase, require

MOX_COMPONENT = "Zorek Tessarin Server Manager - Mox"
BASEBOARD = "Zorek Tessarin Baseboard"
START_LINES = (b"Checking for mox configurations ..\n"
               b"There is no floppy found in floppy drive\n"
               b"Proceeding with loading mox ..\n")
INSTALLED = "MOX - installed mox.mif\n"
# Keys of the standard actions row for a critical baseboard temperature on
# any probe: MIF id, event group, event type, instance, 0, severity, system,
# subsystem.
TEMPERATURE_CRITICAL_ROW = [1, 20, 3, 0, 0, 0, 2, 2]
# Action switches (attribute ids of an actions row).
BEEP, CONSOLE, LOG, LCD, SHUTDOWN_OS, RESET, BROADCAST, PAGE, EMAIL, LED_BLINK = 7, 8, 9, 10, 11, 15, 16, 19, 20, 22
TEMPERATURE_LINE = ("TYPE:Temperature Critical COMPONENT:Zorek Tessarin Baseboard GROUP:Temperature Probe "
                    "SEVERITY:Critical ROW:CPU 1 SYSTEM:Environment SUBSYSTEM:Temperature Sensor\n")
TEMPERATURE_CONSOLE = b'MOX: Event type "Temperature Critical" reported for "Temperature Probe" group.\n'
TEMPERATURE_BROADCAST = "Please check group Temperature Probe on this machine\n\n"


def keys(values):
    return [arg for v in values for arg in ("-k", str(v))]


def alarm(component, group, event_group, severity, instance, power):
    # The 28-byte record the daemon writes to the alarm peer, as kobd prints it.
    return struct.pack("<B3xIIIIIB3x", 1, component, group, event_group, severity, instance, power).hex()


def listening(pid, port, timeout):
    # True once a TCP socket of the network namespace of `pid` listens on `port`.
    deadline = time.monotonic() + timeout
    while time.monotonic() < deadline:
        with open("/proc/%d/net/tcp" % pid) as f:
            if any(l.split()[1].endswith(":%04X" % port) and l.split()[3] == "0A" for l in f.readlines()[1:]):
                return True
        time.sleep(0.05)
    return False


class EventBedCase(BedTestCase):
    # Helpers of the event scenarios: a daemon beside the sample baseboard.

    def setUp(self):
        require("MOX_DMICTL", "the provider's client tool")

    def event_bed(self, name, config=None, email=None, kobd=False, extra_components=(), vendor_rows=(),
                  merge=False):
        # A running daemon with the sample baseboard installed; returns the
        # bed, the daemon, the component ids and the alarm peer (or None).
        # `vendor_rows` are added to the vendor actions table of the bed's copy
        # of mox.mif before the daemon installs it.
        bed = self.bed(name)
        if vendor_rows:
            path = os.path.join(bed.paths["mifs"], "mox.mif")
            with open(path) as f:
                text = f.read()
            anchor = "        // Storage enclosure (MIF id 2): error state"
            self.assertEqual(text.count(anchor), 1)
            text = text.replace(anchor, "".join("        %s\n" % row for row in vendor_rows) + anchor)
            with open(path, "w") as f:
                f.write(text)
        ids = {"baseboard": int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")))}
        for label, path in extra_components:
            ids[label] = int(bed.dmictl("install", path))
        if email:
            for attribute, value in email.items():
                bed.dmictl("set", ids["baseboard"], 1012, attribute, value)
        if config is not None:
            bed.write("cfg", "mox.cfg", config)
        peer = bed.start_kobd() if kobd else None
        mox = bed.start_mox(merge=merge)
        self.assertLogged(bed, INSTALLED, LOG_INFO)
        self.assertTrue(bed.wait_registered(), "start-up did not settle: %r" % mox.stderr.data)
        ids["mox"] = bed.component_id(MOX_COMPONENT)
        return bed, mox, ids, peer

    def critical_temperature(self, bed, ids, switches):
        # Makes the baseboard's temperature event critical and switches the
        # given actions on in its actions row (an administrator's change).
        bed.dmictl("set", ids["baseboard"], 20, 1, "3")   # Temperature Critical
        bed.dmictl("set", ids["baseboard"], 20, 2, "16")  # severity Critical
        for attribute in switches:
            bed.dmictl("set", ids["mox"], 10, attribute, "1", *keys(TEMPERATURE_CRITICAL_ROW))

    def raise_temperature(self, bed, ids):
        # The event names probe 1 of the temperature table as its instance.
        bed.dmictl("event", ids["baseboard"], 20, "--instance", 2, "-k", 1)



class EventTest(EventBedCase):

    def test_road_of_one_standard_event(self):
        require("MOX_KOBD", "the alarm peer kobd")
        require("MOX_OBX_PRELOAD", "the simulated OBX driver")
        bed, mox, ids, peer = self.event_bed(
            "road", kobd=True, email={1: "127.0.0.1", 3: "ops@example.org;duty@example.org"}, merge=True)
        bed.start_smtp()
        self.critical_temperature(bed, ids, [BEEP, PAGE, LED_BLINK, RESET])
        log_start = bed.log.mark()
        self.raise_temperature(bed, ids)
        # When each line of the simulated controller's log was first seen
        # (polled every 20 ms, so at most that late plus the load's lag).
        seen = {}
        deadline = time.monotonic() + 60
        while "watchdog expired: hard reset" not in seen and time.monotonic() < deadline:
            now = time.monotonic()
            for line in bed.obx_log():
                seen.setdefault(line, now)
            time.sleep(0.02)
        host = socket.gethostname()

        # Console line, then the bell (standard error and output share one
        # pipe here, so their order is the daemon's).
        self.assertEqual(mox.stdout.data, START_LINES + TEMPERATURE_CONSOLE + b"\x07")
        # The alarm record: component, table group 2 (the instance's), event
        # group 20, severity 16, instance 1, no power group.
        self.assertTrue(peer.stdout.wait_for(b"\n", 2))
        lines = [l for l in peer.stdout.data.decode().splitlines() if l.startswith("alarm ")]
        self.assertEqual([l.split()[1] for l in lines], [alarm(ids["baseboard"], 2, 20, 16, 1, 0)], lines)
        # System log: the event line at its severity's priority, then the
        # broadcast at LOG_EMERG, and nothing else from the daemon.
        self.assertEqual([(e.level, e.facility, e.message) for e in bed.log.since(log_start)],
                         [(LOG_ERR, 1, TEMPERATURE_LINE), (LOG_EMERG, 1, TEMPERATURE_BROADCAST)])
        # The e-mail.
        sessions = bed.smtp_sessions(1, 5)
        self.assertEqual(len(sessions), 1)
        session = sessions[0]
        received = [c["received"] for c in session["commands"] if "received" in c]
        self.assertEqual(received, ["HELO 127.0.0.1", "MAIL FROM:<admin@%s>" % host, "RCPT TO:<ops@example.org>",
                                    "RCPT TO:<duty@example.org>", "DATA", "QUIT"])
        self.assertEqual(session["data"],
                         "SUBJECT:Zorek Server Management Alert:%s\r\n"
                         "Check Temperature Probe at server %s\r\n"
                         "Event Type:Temperature Critical\r\n"
                         "Event Severity:Critical\r\n"
                         "Component:Zorek Tessarin Baseboard\r\n"
                         "Group:Temperature Probe\r\n"
                         "Instance:CPU 1\r\n" % (host, host))
        self.assertEqual(session["unread"], "")
        # No server answers the subject line: the client waits 8 s for it.
        at = {c["received"]: c["at"] for c in session["commands"] if "received" in c}
        self.assertGreaterEqual(at["QUIT"] - at["DATA"], 8.0)
        # LCD, page and ID LED in the baseboard's groups.
        self.assertEqual(bed.dmictl("get", ids["baseboard"], 30, 8), "Check: Temperature Probe".ljust(32) + "\n")
        self.assertEqual(bed.dmictl("get", ids["baseboard"], 32, 6), "1\n")   # Page
        self.assertEqual(bed.dmictl("get", ids["baseboard"], 31, 25), "2\n")  # LED Blink
        # The reset: armed with a 100 ms countdown after the e-mail's QUIT,
        # started after the 3 s wait, and the simulated controller resets
        # the machine.
        requests = [l for l in bed.obx_log() if l.startswith(("watchdog", "chassis"))]
        armed, started = "watchdog set: use 0x04 action hard reset countdown 1", "watchdog started: countdown 1"
        self.assertEqual(requests, [armed, started, "watchdog expired: hard reset"], mox.stdout.data)
        self.assertGreater(seen[armed], at["QUIT"])
        self.assertGreaterEqual(seen[started] - seen[armed], 2.8)

    def test_vendor_event(self):
        # The baseboard's vendor row (1,6,1,1,wildcard,0) of mox.mif (keys MIF
        # id, group, instance, attribute, value, error state) asks for the
        # console, log, LCD, broadcast, page and e-mail (none configured here);
        # instance 1 with any value finds it. Error state Warning sets the
        # log line's priority.
        bed, mox, ids, _ = self.event_bed("vendor")
        bed.dmictl("set", ids["baseboard"], 10, 1, "1")
        start = bed.log.mark()
        bed.dmictl("vendor-event", ids["baseboard"], 10, "--instance", 6, "-k", 1)
        line = ("NAME:Warning COMPONENT:Zorek Tessarin Baseboard GROUP:Chassis Intrusion ROW:1 "
                "ATTRIBUTE:Sensor Number N/A\n")
        self.assertLogged(bed, line, LOG_WARNING, start=start)
        self.assertLogged(bed, "Please check group Chassis Intrusion on this machine\n\n", LOG_EMERG, start=start)
        console = b"MOX: Event reported for Sensor Number attribute in the Chassis Intrusion group.\n"
        self.assertTrue(mox.stderr.wait_for(console, 5))
        time.sleep(0.5)
        self.assertEqual(len(bed.log.since(start)), 2, bed.log.since(start))
        self.assertEqual(bed.dmictl("get", ids["baseboard"], 30, 8), "Check: Chassis Intrusion".ljust(32) + "\n")
        self.assertEqual(bed.dmictl("get", ids["baseboard"], 32, 6), "1\n")
        self.assertEqual(mox.stderr.data, console)
        self.assertEqual(mox.stdout.data, START_LINES)

    def test_alarm_peer_under_another_program_name_is_a_stale_lock(self):
        # kobd started by its full path: its command line does not name
        # "kobd", so the daemon takes the lock for a stale one and removes the
        # lock file and the FIFO at the first event; the event's other actions
        # go on.
        kobd = require("MOX_KOBD", "the alarm peer kobd")
        bed, mox, ids, _ = self.event_bed("stale")
        lock, fifo = os.path.join(bed.paths["run"], "kobLock"), "/dev/kob"
        peer = testbed._started(bed.spawn([kobd]), lock, "kobd")
        self.assertEqual(bed.run(["test", "-p", fifo]).returncode, 0)
        start = bed.log.mark()
        bed.dmictl("vendor-event", ids["baseboard"], 10)
        self.assertLogged(bed, "NAME:Normal COMPONENT:Zorek Tessarin Baseboard GROUP:Unknown Group "
                               "ROW:Not Applicable ATTRIBUTE:Unknown Attribute N/A\n", LOG_INFO, start=start)
        self.assertFalse(os.path.exists(lock))
        self.assertNotEqual(bed.run(["test", "-e", fifo]).returncode, 0, "the FIFO was left")
        self.assertNotIn(b"alarm ", peer.stdout.data)

    def test_unsupported_component_and_component_installed_while_running(self):
        # A component that the supported-components group does not list.
        scratch = tempfile.mkdtemp(prefix="moxe2e-library.")
        self.addCleanup(shutil.rmtree, scratch, True)
        with open(os.path.join(os.environ["MOX_SOURCE_DIR"], "mifs", "enclosure.mif")) as f:
            text = f.read()
        self.assertIn("Zorek Tessarin Storage Enclosure", text)
        library = os.path.join(scratch, "library.mif")
        with open(library, "w") as f:
            f.write(text.replace("Zorek Tessarin Storage Enclosure", "Zorek Tessarin Tape Library"))
        bed, mox, ids, peer = self.event_bed("catalogue", kobd=True, extra_components=[("library", library)])
        start = bed.log.mark()
        bed.dmictl("event", ids["library"], 20, "--instance", 2, "-k", 1)
        # A supported event behind it shows when the first has been handled.
        bed.dmictl("vendor-event", ids["baseboard"], 10)
        vendor_line = ("NAME:Normal COMPONENT:Zorek Tessarin Baseboard GROUP:Unknown Group ROW:Not Applicable "
                       "ATTRIBUTE:Unknown Attribute N/A\n")
        self.assertLogged(bed, vendor_line, LOG_INFO, start=start)
        self.assertEqual([e.message for e in bed.log.since(start)], [vendor_line])
        console = b"MOX: Event reported for Unknown attribute in the Unknown group.\n"
        mox.stderr.wait_for(console, 5)  # the pipe may lag behind the log socket
        self.assertEqual(mox.stderr.data, console)

        # The enclosure installed while the daemon runs joins the catalogue,
        # and its events are served.
        enclosure = int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "enclosure.mif")))
        time.sleep(0.5)  # the install indication reaches the daemon first
        start = bed.log.mark()
        bed.dmictl("event", enclosure, 20, "--instance", 2, "-k", 1)
        drive_line = ("TYPE:Drive Failed COMPONENT:Zorek Tessarin Storage Enclosure GROUP:Drive Bay "
                      "SEVERITY:Critical ROW:Bay 1 SYSTEM:Storage SUBSYSTEM:Disk Drive\n")
        self.assertLogged(bed, drive_line, LOG_ERR, start=start)
        self.assertLogged(bed, "Please check group Drive Bay on this machine\n\n", LOG_EMERG, start=start)
        self.assertEqual(bed.dmictl("get", ids["baseboard"], 30, 8), "Check: Drive Bay".ljust(32) + "\n")
        self.assertTrue(mox.stderr.wait_for(b'MOX: Event type "Drive Failed" reported for "Drive Bay" group.\n', 2))
        # Alarm records: the baseboard's vendor event (group 0) and the
        # enclosure's drive event (table group 2, event group 20, severity
        # 16, bay 1); none for the unsupported component.
        self.assertTrue(peer.stdout.wait_for(b"instance=1", 2), peer.stdout.data)
        lines = [l.split()[1] for l in peer.stdout.data.decode().splitlines() if l.startswith("alarm ")]
        self.assertEqual(lines, [alarm(ids["baseboard"], 0, 0, 0, 0, 0), alarm(enclosure, 2, 20, 16, 1, 0)])


if __name__ == "__main__":
    import unittest
    unittest.main()
