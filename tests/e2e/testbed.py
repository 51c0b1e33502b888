# The end-to-end testbed: the built mox binary, unchanged, in namespaces of its own.
#
# A Testbed is a temporary tree plus a private mount and network namespace in
# which that tree is laid over the fixed paths the daemon uses:
#
#     /usr/local/ubo/bin   <- TREE/cfg       (mox.cfg)
#     /var/run             <- TREE/run       (kobLock, init.record)
#     /dev                    a tmpfs of its own (null, zero, random, urandom bound
#                             from the host; kobd makes the FIFO /dev/kob there)
#     /dev/log             <- TREE/log.sock  (a datagram socket this module reads)
#     /mnt/floppy          <- TREE/floppy
#     /sbin/init           <- the init stub  (records its arguments)
#
# The daemon runs with TREE/work as its working directory, with stub `mount` and
# `umount` commands first on PATH (this machine's kernel has no msdos or vfat
# filesystem, so a floppy image cannot really be mounted; the stubs make the
# files of TREE/medium appear in /mnt/floppy, or report no medium), with the
# provider's database in TREE/db (DMISP_DB, control socket DMISP_SOCKET), a copy
# of the MIF directory in TREE/mifs (UXDMIPATH) and, when it was built, the
# simulated OBX driver preloaded (LD_PRELOAD). An SMTP server on 127.0.0.1:25
# and the alarm peer kobd run in the same namespaces when a scenario asks.
#
# Paths of the built programs come from the environment that CTest sets (see
# CMakeLists.txt): MOX_BIN, MOX_SOURCE_DIR, MOX_INIT_STUB and, once built,
# MOX_OBX_PRELOAD, MOX_KOBD, MOX_DMISP_TOOL.

import contextlib
import json
import os
import re
import shutil
import signal
import socket
import subprocess
import sys
import tempfile
import threading
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))

LOG_EMERG, LOG_ALERT, LOG_CRIT, LOG_ERR, LOG_WARNING, LOG_NOTICE, LOG_INFO, LOG_DEBUG = range(8)
LOG_USER = 1  # facility number; the daemon never chooses one, so syslog(3) uses user

# "<PRI>Mmm dd hh:mm:ss TAG: MESSAGE" as syslog(3) and logger(1) send it.
_SYSLOG_LINE = re.compile(r"<(\d+)>([A-Z][a-z]{2} [ \d]\d \d\d:\d\d:\d\d) ([^:\[ ]*)(?:\[(\d+)\])?: (.*)", re.S)


def piece(name):
    # The path of a built piece from the environment, or None.
    value = os.environ.get(name, "")
    return value if value and os.path.exists(value) else None


def require(name, what):
    path = piece(name)
    if path is None:
        raise unittest.SkipTest("%s is not available (%s unset: not built, or left out of a sanitizer build)"
                                % (what, name))
    return path


class LogEntry:
    def __init__(self, raw, arrival):
        self.raw, self.arrival, text = raw, arrival, raw.decode("latin-1")
        match = _SYSLOG_LINE.match(text)
        self.priority, self.tag, self.pid, self.message = None, None, None, text
        if match:
            self.priority, self.tag, self.message = int(match.group(1)), match.group(3), match.group(5)
            self.pid = int(match.group(4)) if match.group(4) else None
        self.level = None if self.priority is None else self.priority & 7
        self.facility = None if self.priority is None else self.priority >> 3

    def __repr__(self):
        return "<%s>%s: %r" % (self.priority, self.tag, self.message)


class SyslogReceiver:
    # Reads the datagrams sent to the testbed's /dev/log.

    def __init__(self, path):
        self.sock = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.sock.bind(path)
        os.chmod(path, 0o666)
        self.entries = []
        self.cond = threading.Condition()
        threading.Thread(target=self._run, daemon=True).start()

    def _run(self):
        while True:
            try:
                raw = self.sock.recv(65536)
            except OSError:
                return
            with self.cond:
                self.entries.append(LogEntry(raw, time.monotonic()))
                self.cond.notify_all()

    def close(self):
        with contextlib.suppress(OSError):
            self.sock.shutdown(socket.SHUT_RDWR)
        self.sock.close()

    def snapshot(self, tag=None):
        return self.since(0, tag)

    def mark(self):
        # A position in the log, for since() and wait_for(start=...).
        with self.cond:
            return len(self.entries)

    def since(self, start, tag="mox"):
        # The entries from position `start` on, of one tag (None: all).
        with self.cond:
            return [e for e in self.entries[start:] if tag is None or e.tag == tag]

    def wait_for(self, message, timeout, tag="mox", start=0):
        # The first entry from `start` on whose message equals `message` (a
        # string) or satisfies it (a callable); None when none came in time.
        test = message if callable(message) else (lambda m: m == message)
        find = lambda: next((e for e in self.entries[start:] if (tag is None or e.tag == tag) and test(e.message)), None)
        with self.cond:
            return self.cond.wait_for(find, timeout)


class Stream:
    # Collects what a process writes to one pipe, with arrival times.

    def __init__(self, pipe):
        self.pipe, self.data, self.first_arrival, self.eof = pipe, b"", None, False
        self.cond = threading.Condition()
        threading.Thread(target=self._run, daemon=True).start()

    def _run(self):
        while True:
            chunk = os.read(self.pipe.fileno(), 65536)
            with self.cond:
                if not chunk:
                    self.eof = True
                    self.cond.notify_all()
                    return
                if self.first_arrival is None:
                    self.first_arrival = time.monotonic()
                self.data += chunk
                self.cond.notify_all()

    def wait_for(self, needle, timeout):
        # True once `needle` (bytes) has arrived.
        with self.cond:
            self.cond.wait_for(lambda: needle in self.data or self.eof, timeout)
            return needle in self.data

    def wait_eof(self, timeout):
        with self.cond:
            return self.cond.wait_for(lambda: self.eof, timeout)


class Process:
    # A process started inside the testbed, with its output collected.

    def __init__(self, args, env, cwd, stdin=subprocess.DEVNULL, merge=False):
        # With `merge` standard error goes into the standard-output pipe, so
        # the two keep the order in which the process wrote them (then
        # `stderr` is the same stream as `stdout`).
        self.popen = subprocess.Popen(args, env=env, cwd=cwd, stdin=stdin, stdout=subprocess.PIPE,
                                      stderr=subprocess.STDOUT if merge else subprocess.PIPE)
        self.pid = self.popen.pid
        self.stdout = Stream(self.popen.stdout)
        self.stderr = self.stdout if merge else Stream(self.popen.stderr)
        self.ended = self.status = None
        self._done = threading.Event()
        threading.Thread(target=self._wait, daemon=True).start()

    def _wait(self):
        self.status = self.popen.wait()
        self.ended = time.monotonic()
        self._done.set()

    def wait(self, timeout):
        # The exit status (negative: killed by that signal), or None if the
        # process still runs after `timeout` seconds.
        if not self._done.wait(timeout):
            return None
        self.stdout.wait_eof(2)
        self.stderr.wait_eof(2)
        return self.status

    def running(self):
        return not self._done.is_set()

    def signal(self, number):
        if self.running():
            os.kill(self.pid, number)

    def kill(self):
        if self.running():
            try:
                os.kill(self.pid, signal.SIGKILL)
            except ProcessLookupError:
                pass
            self._done.wait(5)


class Testbed:
    def __init__(self, name="bed", mifs=True, binds=(), unset=()):
        # `binds`: further [source, path] pairs laid over the namespace;
        # `unset`: variables of the daemon's environment to leave out.
        self.extra_binds = [list(b) for b in binds]
        self.unset = list(unset)
        self.root = tempfile.mkdtemp(prefix="moxe2e-%s." % name)
        self.paths = {}
        for part in ("work", "cfg", "run", "floppy", "stubs", "db", "smtp", "scratch", "ns"):
            self.paths[part] = os.path.join(self.root, part)
            os.mkdir(self.paths[part])
        for part, name in (("medium", "medium"), ("log", "log.sock"), ("dmisp_socket", "dmisp.sock"), ("mifs", "mifs")):
            self.paths[part] = os.path.join(self.root, name)
        source_mifs = os.path.join(os.environ.get("MOX_SOURCE_DIR", ""), "mifs")
        if mifs and os.path.isdir(source_mifs):
            shutil.copytree(source_mifs, self.paths["mifs"])
        else:
            os.mkdir(self.paths["mifs"])
        self.holder = None
        self.log = None
        self.processes = []
        self._write_stubs()

    # ---- set-up ----------------------------------------------------------

    def _write_stubs(self):
        medium, floppy = self.paths["medium"], "/mnt/floppy"
        # Each call is also sent to the testbed's system log under the tag
        # "stub", so its order among the daemon's own lines can be checked.
        mount = """#!/bin/sh
logger -u /dev/log -t stub "mount $*" 2>/dev/null
[ -d '%s' ] || { echo "mount: %s: no medium found on /dev/fd0." >&2; exit 32; }
cp -a '%s'/. '%s'/ || exit 32
""" % (medium, floppy, medium, floppy)
        umount = """#!/bin/sh
logger -u /dev/log -t stub "umount $*" 2>/dev/null
find '%s' -mindepth 1 -delete; exit 0
""" % floppy
        for name, text in (("mount", mount), ("umount", umount)):
            path = os.path.join(self.paths["stubs"], name)
            with open(path, "w") as f:
                f.write(text)
            os.chmod(path, 0o755)

    def floppy(self, files):
        # Puts a medium holding `files` (name -> text) in the floppy drive;
        # None takes it out again.
        shutil.rmtree(self.paths["medium"], ignore_errors=True)
        if files is not None:
            os.mkdir(self.paths["medium"])
            for name, text in files.items():
                self.write("medium", name, text)

    def write(self, part, name, text, mode=0o644):
        path = os.path.join(self.paths[part], name)
        with open(path, "w") as f:
            f.write(text)
        os.chmod(path, mode)
        return path

    def start(self):
        # Creates the namespaces; skips the test when that is not possible.
        if os.geteuid() != 0:
            raise unittest.SkipTest("the testbed needs root for its namespaces")
        if shutil.which("unshare") is None or shutil.which("nsenter") is None:
            raise unittest.SkipTest("unshare/nsenter (util-linux) not installed")
        probe = subprocess.run(["unshare", "-m", "-n", "true"], capture_output=True)
        if probe.returncode != 0:
            raise unittest.SkipTest("cannot create namespaces: %s" % probe.stderr.decode().strip())
        init_stub = require("MOX_INIT_STUB", "the /sbin/init stub")
        self._preload()  # made now, before processes start from several threads
        self.log = SyslogReceiver(self.paths["log"])
        binds = [[self.paths["log"], "/dev/log"], [self.paths["cfg"], "/usr/local/ubo/bin"],
                 [self.paths["run"], "/var/run"], [self.paths["floppy"], "/mnt/floppy"], [init_stub, "/sbin/init"]]
        config = {"scratch": self.paths["ns"], "binds": binds + self.extra_binds}
        config_path = os.path.join(self.root, "ns.json")
        with open(config_path, "w") as f:
            json.dump(config, f)
        self.holder = subprocess.Popen(["unshare", "-m", "-n", "--", sys.executable,
                                        os.path.join(HERE, "nsholder.py"), config_path],
                                       stdin=subprocess.PIPE, stdout=subprocess.PIPE)
        line = self.holder.stdout.readline().decode().strip()
        if line != "ready":
            self.holder.wait(5)
            raise RuntimeError("testbed namespace set-up failed: %s" % line)
        return self

    def env(self, extra=None):
        env = {"PATH": self.paths["stubs"] + ":/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
               "LANG": "C", "HOME": self.root, "DMISP_DB": self.paths["db"],
               "DMISP_SOCKET": self.paths["dmisp_socket"], "UXDMIPATH": self.paths["mifs"],
               "OBXSIM_LOG": os.path.join(self.root, "obx.log")}
        if self._preload():
            env["LD_PRELOAD"] = self._preload()
        env.update({k: os.environ[k] for k in ("ASAN_OPTIONS", "UBSAN_OPTIONS") if k in os.environ})
        env.update(extra or {})
        for key in self.unset:
            env.pop(key, None)
        return env

    def _preload(self):
        # The LD_PRELOAD value that attaches the simulated OBX driver.
        #
        # The library is i386, as the daemon is; the daemon's own children
        # (the shell of its mount commands) are native programs, which would
        # complain on standard error about a library of the wrong class. So the
        # path goes through ld.so's $LIB token: it names the simulated driver
        # for 32-bit programs and the C library, loaded by them anyway, for
        # 64-bit ones.
        library = piece("MOX_OBX_PRELOAD")
        if library is None:
            return None
        base = os.path.join(self.root, "preload")
        if not os.path.isdir(base):
            with open("/proc/self/maps") as maps:
                native_libc = next((p for p in (l.split()[-1] for l in maps)
                                    if os.path.basename(p).startswith("libc.so")), None)
            for lib, target in (("lib32", library), ("lib/i386-linux-gnu", library),
                                ("lib/x86_64-linux-gnu", native_libc), ("lib64", native_libc)):
                if target:
                    os.makedirs(os.path.join(base, lib))
                    os.symlink(target, os.path.join(base, lib, "libobxpreload.so"))
        return base + "/$LIB/libobxpreload.so"

    def inside(self, args):
        return ["nsenter", "-t", str(self.holder.pid), "-m", "-n", "--wd=" + self.paths["work"], "--"] + list(args)

    def spawn(self, args, extra_env=None, stdin=subprocess.DEVNULL, merge=False):
        # Starts a program inside the namespaces (nsenter execs it, so the
        # process id is the program's own).
        process = Process(self.inside(args), self.env(extra_env), self.paths["work"], stdin=stdin, merge=merge)
        self.processes.append(process)
        return process

    def run(self, args, extra_env=None, timeout=30):
        # Runs a program inside the namespaces to its end.
        return subprocess.run(self.inside(args), env=self.env(extra_env), cwd=self.paths["work"],
                              capture_output=True, timeout=timeout)

    def start_mox(self, extra_env=None, merge=False):
        return self.spawn([require("MOX_BIN", "the mox daemon")], extra_env, merge=merge)

    def dmictl(self, *args, check=True):
        # Runs the provider's client tool inside the testbed: its standard
        # output, or (status, output, error) with check=False.
        tool = require("MOX_DMICTL", "the provider's client tool")
        done = self.run([tool] + [str(a) for a in args])
        out, err = done.stdout.decode(), done.stderr.decode()
        if not check:
            return done.returncode, out, err
        if done.returncode != 0:
            raise AssertionError("dmictl %s: status %d: %s%s" % (" ".join(map(str, args)), done.returncode, out, err))
        return out

    def wait_registered(self, timeout=20, quiet=0.5):
        # Waits until the daemon has registered with the provider and its
        # start-up has finished: its last start-up step, the event worker,
        # leaves no trace of its own, so the sign is that the provider has
        # counted no further command for `quiet` seconds after the
        # registration. True when that came in time.
        deadline = time.monotonic() + timeout
        last, since = None, None
        while time.monotonic() < deadline:
            code, out, _ = self.dmictl("status", check=False)
            fields = dict(line.split("\t", 1) for line in out.splitlines() if "\t" in line) if code == 0 else {}
            if fields.get("registrations") == "1":
                commands = fields.get("commands")
                now = time.monotonic()
                if commands != last:
                    last, since = commands, now
                elif now - since >= quiet:
                    return True
            time.sleep(0.1)
        return False

    def component_id(self, name):
        # The id of the installed component called `name`, or None.
        for line in self.dmictl("list").splitlines():
            cid, _, cname = line.partition("\t")
            if cname == name:
                return int(cid)
        return None

    def table(self, component, group):
        # The rows of a table group as dicts attribute id -> text.
        ids = [int(line.split("\t")[0]) for line in self.dmictl("attributes", component, group).splitlines()]
        return [dict(zip(ids, line.split("\t"))) for line in self.dmictl("rows", component, group).splitlines()]

    def start_kobd(self, *args):
        # Starts the alarm peer under the program name "kobd", which the
        # daemon checks in its command line; None until it has made its FIFO.
        kobd = require("MOX_KOBD", "the alarm peer kobd")
        process = self.spawn(["kobd"] + list(args), {"PATH": os.path.dirname(kobd) + ":/usr/bin:/bin"})
        return _started(process, os.path.join(self.paths["run"], "kobLock"), "kobd")

    def obx_log(self):
        # The simulated OBX driver's event log, one line per event.
        try:
            with open(os.path.join(self.root, "obx.log")) as f:
                return f.read().splitlines()
        except FileNotFoundError:
            return []

    def start_smtp(self, replies=None):
        if replies:
            self.write("smtp", "replies.json", json.dumps(replies))
        server = self.spawn([sys.executable, os.path.join(HERE, "smtpserver.py"), self.paths["smtp"]])
        return _started(server, os.path.join(self.paths["smtp"], "ready"), "the SMTP server")

    def smtp_sessions(self, count, timeout):
        # The first `count` finished SMTP sessions (fewer if they did not come).
        def names():
            return sorted(n for n in os.listdir(self.paths["smtp"]) if n.startswith("session-") and n.endswith(".json"))
        wait_until(lambda: len(names()) >= count, timeout, 0.05)
        return [json.load(open(os.path.join(self.paths["smtp"], n))) for n in names()]

    def close(self):
        for process in self.processes:
            process.kill()
        if self.holder is not None:
            with contextlib.suppress(OSError):
                self.holder.stdin.close()
            try:
                self.holder.wait(10)
            except subprocess.TimeoutExpired:
                self.holder.kill()
                self.holder.wait()
        if self.log is not None:
            self.log.close()
        if os.environ.get("MOX_E2E_KEEP"):
            print("testbed kept in", self.root, file=sys.stderr)
        else:
            shutil.rmtree(self.root, ignore_errors=True)


class BedTestCase(unittest.TestCase):
    # A test case with helpers to open testbeds that are closed afterwards.

    def bed(self, name="bed", **kwargs):
        bed = Testbed(name, **kwargs)
        self.addCleanup(bed.close)
        bed.start()
        return bed

    def assertLogged(self, bed, message, level, timeout=10, tag="mox", start=0):
        entry = bed.log.wait_for(message, timeout, tag=tag, start=start)
        self.assertIsNotNone(entry, "no system-log line %r; got %r" % (message, bed.log.snapshot()))
        self.assertEqual(entry.facility, LOG_USER, entry)
        self.assertEqual(entry.level, level, entry)
        return entry


def wait_until(condition, timeout, step=0.1):
    # The first true value of condition(), or its last value after `timeout`.
    deadline = time.monotonic() + timeout
    while True:
        value = condition()
        if value or time.monotonic() > deadline:
            return value
        time.sleep(step)


def _started(process, path, what):
    # The process once `path` exists (its sign of being ready).
    if not wait_until(lambda: os.path.exists(path) or not process.running(), 20, 0.02) or not process.running():
        raise RuntimeError("%s did not start: %r" % (what, process.stderr.data))
    return process


def run_in_parallel(functions):
    # Runs the callables on threads of their own; re-raises the first failure.
    errors = [None] * len(functions)

    def call(i, f):
        try:
            f()
        except BaseException as e:  # carried to the caller
            errors[i] = e

    threads = [threading.Thread(target=call, args=(i, f)) for i, f in enumerate(functions)]
    for t in threads:
        t.start()
    for t in threads:
        t.join()
    for e in errors:
        if e is not None:
            raise e
