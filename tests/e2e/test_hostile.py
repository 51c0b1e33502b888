"""The daemon among hostile or unlucky neighbours: an alarm peer that stops
reading, a /dev/kob that is no FIFO, a configuration file and a marker that
are FIFOs, an SMTP server that never accepts, and closed standard
descriptors. Each scenario proves that the events still go their whole way."""

import os
import sys
import time

from testbed import LOG_INFO, BedTestCase, require

INSTALLED = "MOX - installed mox.mif\n"
MOX_COMPONENT = "Zorek Tessarin Server Manager - Mox"
TEMPERATURE_CRITICAL_ROW = [1, 20, 3, 0, 0, 0, 2, 2]
LOG, RESET, EMAIL = 9, 15, 20
# A process called kobd that holds /dev/kob open (both ends, so it counts as
# the reader) and never reads.
STUCK_PEER = "exec 3<>/dev/kob; exec -a kobd sleep 600"
FILL_PIPE = """import os
fd = os.open("/dev/kob", os.O_RDWR | os.O_NONBLOCK)
try:
    while True:
        os.write(fd, b"x")
except BlockingIOError:
    pass
"""
# A listener on the SMTP port whose accept queue is full: the kernel drops
# every further handshake, so a connect would wait for minutes.
BLACK_HOLE = """import socket, time
s = socket.socket()
s.bind(("127.0.0.1", 25))
s.listen(0)
fill = []
for _ in range(3):
    c = socket.socket()
    c.setblocking(False)
    c.connect_ex(("127.0.0.1", 25))
    fill.append(c)
time.sleep(0.5)
print("ready", flush=True)
time.sleep(600)
"""


def is_type_line(message):
    return message.startswith("TYPE:Temperature Critical ")


class HostileTest(BedTestCase):

    def setUp(self):
        require("MOX_DMICTL", "the provider's client tool")

    def started_bed(self, name, mox_args=None, before=None):
        bed = self.bed(name)
        baseboard = int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")))
        if before:
            before(bed)
        begun = time.monotonic()
        mox = bed.spawn(mox_args) if mox_args else bed.start_mox()
        self.assertLogged(bed, INSTALLED, LOG_INFO)
        self.assertTrue(bed.wait_registered(), "start-up did not settle: %r" % mox.stderr.data)
        settled = time.monotonic() - begun
        mox_id = bed.component_id(MOX_COMPONENT)
        # The baseboard's temperature event made critical, with the given actions.
        bed.dmictl("set", baseboard, 20, 1, "3")
        bed.dmictl("set", baseboard, 20, 2, "16")
        return bed, mox, baseboard, mox_id, settled

    def switch_on(self, bed, mox_id, actions):
        keys = [a for v in TEMPERATURE_CRITICAL_ROW for a in ("-k", str(v))]
        for attribute in actions:
            bed.dmictl("set", mox_id, 10, attribute, "1", *keys)

    def fake_peer(self, bed):
        peer = bed.spawn(["bash", "-c", STUCK_PEER])
        deadline = time.monotonic() + 10
        while b"kobd" not in open("/proc/%d/cmdline" % peer.pid, "rb").read():
            self.assertLess(time.monotonic(), deadline, "the fake peer did not start")
            time.sleep(0.05)
        bed.write("run", "kobLock", "%d\n" % peer.pid)
        return peer

    def test_stuck_peer_and_black_hole_smtp_before_a_reset(self):
        require("MOX_OBX_PRELOAD", "the simulated OBX driver")
        bed, mox, baseboard, mox_id, _ = self.started_bed("stuck")
        bed.dmictl("set", baseboard, 1012, 1, "127.0.0.1")
        bed.dmictl("set", baseboard, 1012, 3, "ops@example.org")
        self.switch_on(bed, mox_id, [LOG, EMAIL, RESET])
        bed.run(["mkfifo", "/dev/kob"])
        self.fake_peer(bed)
        self.assertEqual(bed.run([sys.executable, "-c", FILL_PIPE]).returncode, 0)
        hole = bed.spawn([sys.executable, "-c", BLACK_HOLE])
        self.assertTrue(hole.stdout.wait_for(b"ready\n", 10), hole.stderr.data)

        raised = time.monotonic()
        bed.dmictl("event", baseboard, 20, "--instance", 2, "-k", 1)
        # The full pipe is reported and the event goes on: its log line, the
        # e-mail's bounded connect, then the reset at the controller.
        self.assertLogged(bed, lambda m: m.startswith("Error writing to pipe at file descriptor "), LOG_INFO)
        self.assertLogged(bed, is_type_line, 3)
        failed = bed.log.wait_for(lambda m: "Email Alert failed - sockets library error! Error Value=110," in m, 15)
        self.assertIsNotNone(failed, bed.log.snapshot())
        deadline = raised + 8 + 3 + 4
        while "watchdog started: countdown 1" not in bed.obx_log() and time.monotonic() < deadline:
            time.sleep(0.05)
        reset_after = time.monotonic() - raised
        self.assertIn("watchdog started: countdown 1", bed.obx_log(), mox.stderr.data)
        self.assertGreaterEqual(reset_after, 8 + 3 - 0.5, "the connect did not wait for the server")
        self.assertLess(reset_after, 8 + 3 + 4)

        # The worker is free: the next event is handled too.
        mark = bed.log.mark()
        bed.dmictl("event", baseboard, 20, "--instance", 2, "-k", 1)
        self.assertIsNotNone(bed.log.wait_for(is_type_line, 10, start=mark), bed.log.snapshot())

    def test_odd_files_and_closed_standard_descriptors(self):
        def prepare(bed):
            os.mkfifo(os.path.join(bed.paths["cfg"], "mox.cfg"))
            bed.write("run", "precious", "precious bytes\n")
            bed.run(["ln", "-s", "/var/run/precious", "/dev/kob"])
        # Started with standard output and error closed, mox.cfg a FIFO.
        mox_args = ["bash", "-c", 'exec >&- 2>&-; exec "$0"', require("MOX_BIN", "the mox daemon")]
        bed, mox, baseboard, mox_id, settled = self.started_bed("odd", mox_args, prepare)
        self.assertLess(settled, 15)
        self.switch_on(bed, mox_id, [LOG])
        self.fake_peer(bed)
        bed.dmictl("event", baseboard, 20, "--instance", 2, "-k", 1)
        self.assertLogged(bed, is_type_line, 3)
        with open(os.path.join(bed.paths["run"], "precious")) as f:
            self.assertEqual(f.read(), "precious bytes\n")
        # Nothing but proper log lines reached the log socket: no start-up
        # text as raw datagrams through a descriptor the socket took.
        raw = [e for e in bed.log.snapshot() if e.priority is None]
        self.assertEqual(raw, [])
        self.assertTrue(mox.running())

    def test_marker_fifo_still_disables(self):
        bed = self.bed("marker")
        os.mkfifo(os.path.join(bed.paths["work"], "vornmox.not"))
        mox = bed.start_mox()
        self.assertEqual(mox.wait(10), 0, mox.stderr.data)
        self.assertEqual(mox.stdout.data, b"Mox has been disabled.\n")
