"""A narrated run of the real mox daemon in the testbed (scripts/demo.sh).

Starts the daemon against the substitute DMI provider with the sample
baseboard installed, an SMTP server, the alarm peer and the simulated
management controller; raises three events of different kinds and shows what
each produced; then stops the daemon with SIGTERM.
"""

import os
import signal
import sys
import time
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests", "e2e"))
import testbed  # noqa: E402

LEVELS = ["emerg", "alert", "crit", "err", "warning", "notice", "info", "debug"]


def say(text):
    print("\n==> " + text, flush=True)


def show(label, text):
    for i, line in enumerate(text.splitlines() or [""]):
        print("    %-14s %s" % (label if i == 0 else "", line), flush=True)


class Demo:
    def __init__(self, bed):
        self.bed = bed
        self.log_mark = 0
        self.out_mark = 0
        self.err_mark = 0
        self.obx_mark = 0
        self.alarm_mark = 0
        self.mail_mark = 0
        self.mox = None
        self.kobd = None

    def news(self, settle=0.5):
        """Prints what the daemon produced since the last call."""
        time.sleep(settle)
        out = self.mox.stdout.data[self.out_mark:]
        self.out_mark += len(out)
        if b"\x07" in out:
            show("bell", "BEL (0x07) written to standard output")
            out = out.replace(b"\x07", b"")
        if out:
            show("stdout", out.decode(errors="replace"))
        err = self.mox.stderr.data[self.err_mark:]
        self.err_mark += len(err)
        if err:
            show("stderr", err.decode(errors="replace"))
        entries = self.bed.log.since(self.log_mark, tag="mox")
        self.log_mark = self.bed.log.mark()
        for e in entries:
            show("syslog <%d>" % e.priority, "[%s] %r" % (LEVELS[e.level], e.message))
        if self.kobd is not None:
            lines = [l for l in self.kobd.stdout.data.decode().splitlines() if l.startswith("alarm")]
            for line in lines[self.alarm_mark:]:
                record, _, fields = line[len("alarm "):].partition(" ")
                show("alarm record", record)
                show("", fields)
            self.alarm_mark = len(lines)
        sessions = self.bed.smtp_sessions(self.mail_mark + 1, 0)
        for session in sessions[self.mail_mark:]:
            for c in session["commands"]:
                if "received" in c:
                    show("smtp <-", c["received"])
            show("mail text", session["data"].replace("\r\n", "\n"))
        self.mail_mark = len(sessions)
        obx = self.bed.obx_log()
        for line in obx[self.obx_mark:]:
            show("controller", line)
        self.obx_mark = len(obx)

    def lcd(self, baseboard):
        show("LCD", "[%s]" % self.bed.dmictl("get", baseboard, 30, 8).rstrip("\n"))


def main():
    bed = testbed.Testbed("demo")
    try:
        bed.start()
    except unittest.SkipTest as e:
        print("demo: cannot run the testbed: %s" % e, file=sys.stderr)
        print("demo: run it as root (the testbed uses private mount and network namespaces)", file=sys.stderr)
        return 1
    demo = Demo(bed)
    started = time.monotonic()
    try:
        say("A fresh DMI provider database with the sample baseboard's MIF installed (dmictl install)")
        baseboard = bed.dmictl("install", os.path.join(bed.paths["mifs"], "baseboard.mif")).strip()
        bed.dmictl("set", baseboard, 1012, 1, "127.0.0.1")
        bed.dmictl("set", baseboard, 1012, 3, "ops@example.org")
        show("components", bed.dmictl("list"))
        show("e-mail", "SMTP server 127.0.0.1 (a small server inside the testbed), recipient ops@example.org")
        bed.start_smtp()
        demo.kobd = bed.start_kobd()
        show("alarm peer", "kobd is running (lock /var/run/kobLock, FIFO /dev/kob)")

        say("Starting mox: no marker files, no floppy in the drive")
        demo.mox = bed.start_mox()
        bed.wait_registered()
        demo.news(0)
        mox_id = bed.component_id("Zorek Tessarin Server Manager - Mox")
        show("components", bed.dmictl("list"))

        say("An administrator switches the beep and a hardware reset on for critical temperatures")
        row = [a for k in (1, 20, 3, 0, 0, 0, 2, 2) for a in ("-k", str(k))]
        for attribute in (7, 15):
            bed.dmictl("set", mox_id, 10, attribute, "1", *row)
        show("actions row", "group 10, keys 1 20 3 0 0 0 2 2: beep on, reset on")

        say("Event 1: critical temperature on probe CPU 1 (a standard DMI event)")
        bed.dmictl("set", baseboard, 20, 1, "3")
        bed.dmictl("set", baseboard, 20, 2, "16")
        bed.dmictl("event", baseboard, 20, "--instance", 2, "-k", 1)
        demo.news(1.0)
        show("", "... the e-mail alert is on its way (the client waits 8 s after its subject line)")
        deadline = time.monotonic() + 20
        while not any(l.startswith("watchdog expired") for l in bed.obx_log()) and time.monotonic() < deadline:
            time.sleep(0.2)
        demo.news(0.2)
        demo.lcd(baseboard)

        say("Event 2: a vendor error event (class Zorek|Error) naming power supply 1")
        bed.dmictl("set", baseboard, 10, 1, "1")  # error state Warning
        bed.dmictl("vendor-event", baseboard, 10, "--instance", 5, "-k", 1)
        demo.news(1.0)
        demo.lcd(baseboard)

        say("Event 3: the temperature is back to normal (logged only, at info priority)")
        bed.dmictl("set", baseboard, 20, 1, "1")
        bed.dmictl("set", baseboard, 20, 2, "4")
        bed.dmictl("event", baseboard, 20, "--instance", 2, "-k", 1)
        demo.news(1.0)

        say("Stopping mox with SIGTERM")
        demo.mox.signal(signal.SIGTERM)
        status = demo.mox.wait(15)
        show("exit status", str(status))
        print("\ndemo: done in %.1f s" % (time.monotonic() - started))
        return 0 if status == 0 else 1
    finally:
        bed.close()


if __name__ == "__main__":
    sys.exit(main())
