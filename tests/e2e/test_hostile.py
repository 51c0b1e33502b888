"""The daemon among hostile or unlucky neighbours, in one run: closed standard
descriptors and a FIFO for mox.cfg at start, a /dev/kob that is no FIFO, then
an alarm peer that stops reading and an SMTP server that never accepts before
a reset, and a FIFO marker. Each step proves the events still go their way."""

import os
import sys
import time

from test_events import EMAIL, INSTALLED, LOG, MOX_COMPONENT, RESET, EventBedCase
from testbed import LOG_ERR, LOG_INFO, require

# A process called kobd that holds /dev/kob open (both ends, so it counts as
# the reader) and never reads.
STUCK_PEER = "exec 3<>/dev/kob; exec -a kobd sleep 600"
# A non-blocking write larger than the pipe fills it to the brim.
FILL_PIPE = 'import os; os.write(os.open("/dev/kob", os.O_RDWR | os.O_NONBLOCK), b"x" * (1 << 20))'
# A listener on the SMTP port whose accept queue is full: the kernel drops
# every further handshake, so a connect would wait for minutes.
BLACK_HOLE = """import socket, time
s = socket.socket(); s.bind(("127.0.0.1", 25)); s.listen(0)
fill = [socket.socket() for _ in range(3)]
for c in fill: c.setblocking(False); c.connect_ex(("127.0.0.1", 25))
time.sleep(0.5); print("ready", flush=True); time.sleep(600)
"""


def is_type_line(message):
    return message.startswith("TYPE:Temperature Critical ")


class HostileTest(EventBedCase):

    def fake_peer(self, bed):
        peer = bed.spawn(["bash", "-c", STUCK_PEER])
        self.assertTrue(any(b"kobd" in open("/proc/%d/cmdline" % peer.pid, "rb").read() or time.sleep(0.05)
                            for _ in range(200)), "the fake peer did not start")
        bed.write("run", "kobLock", "%d\n" % peer.pid)

    def test_hostile_neighbours(self):
        require("MOX_OBX_PRELOAD", "the simulated OBX driver")
        mox_bin = require("MOX_BIN", "the mox daemon")
        bed = self.bed("hostile")
        ids = {"baseboard": int(bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")))}
        os.mkfifo(os.path.join(bed.paths["cfg"], "mox.cfg"))
        bed.write("run", "precious", "precious bytes\n")
        bed.run(["ln", "-s", "/var/run/precious", "/dev/kob"])
        # Started with standard output and error closed, mox.cfg a FIFO.
        mox = bed.spawn(["bash", "-c", 'exec >&- 2>&-; exec "$0"', mox_bin])
        self.assertLogged(bed, INSTALLED, LOG_INFO)
        self.assertTrue(bed.wait_registered(), "start-up did not settle")
        ids["mox"] = bed.component_id(MOX_COMPONENT)
        self.critical_temperature(bed, ids, [LOG])
        # /dev/kob a symlink to an ordinary file: nothing is written there.
        self.fake_peer(bed)
        self.raise_temperature(bed, ids)
        self.assertLogged(bed, is_type_line, LOG_ERR)
        with open(os.path.join(bed.paths["run"], "precious")) as f:
            self.assertEqual(f.read(), "precious bytes\n")
        # Nothing but proper log lines reached the log socket: no start-up
        # text as raw datagrams through a descriptor the socket took.
        self.assertEqual([e for e in bed.log.snapshot() if e.priority is None], [])

        # A peer that never reads, its pipe full; an SMTP server that never accepts.
        bed.dmictl("set", ids["baseboard"], 1012, 1, "127.0.0.1")
        bed.dmictl("set", ids["baseboard"], 1012, 3, "ops@example.org")
        self.critical_temperature(bed, ids, [EMAIL, RESET])
        bed.run(["rm", "/dev/kob"])
        bed.run(["mkfifo", "/dev/kob"])
        self.fake_peer(bed)
        self.assertEqual(bed.run([sys.executable, "-c", FILL_PIPE]).returncode, 0)
        hole = bed.spawn([sys.executable, "-c", BLACK_HOLE])
        self.assertTrue(hole.stdout.wait_for(b"ready\n", 10), hole.stderr.data)
        start, raised = bed.log.mark(), time.monotonic()
        self.raise_temperature(bed, ids)
        # The full pipe is reported and the event goes on: its log line, the
        # e-mail's bounded connect, then the reset at the controller.
        self.assertLogged(bed, lambda m: m.startswith("Error writing to pipe at file descriptor "), LOG_INFO,
                          start=start)
        self.assertLogged(bed, is_type_line, LOG_ERR, start=start)
        self.assertLogged(bed, lambda m: "Email Alert failed - sockets library error! Error Value=110," in m, LOG_INFO,
                          timeout=15, start=start)
        while "watchdog started: countdown 1" not in bed.obx_log() and time.monotonic() < raised + 15:
            time.sleep(0.05)
        reset_after = time.monotonic() - raised
        self.assertIn("watchdog started: countdown 1", bed.obx_log())
        self.assertGreaterEqual(reset_after, 8 + 3 - 0.5, "the connect did not wait for the server")
        self.assertLess(reset_after, 8 + 3 + 4)
        # The worker is free: the next event is handled too.
        start = bed.log.mark()
        self.raise_temperature(bed, ids)
        self.assertLogged(bed, is_type_line, LOG_ERR, start=start)
        self.assertTrue(mox.running())

        # A FIFO marker still disables a second daemon, at once.
        os.mkfifo(os.path.join(bed.paths["work"], "vornmox.not"))
        done = bed.run([mox_bin], timeout=10)
        self.assertEqual((done.returncode, done.stdout), (0, b"Mox has been disabled.\n"), done.stderr)
