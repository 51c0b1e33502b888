# Holds a private mount and network namespace for one testbed.
#
# Run as `unshare -m -n -- python3 nsholder.py CONFIG.json` by testbed.py. It
# brings the loopback interface up, lays the testbed's temporary tree over the
# fixed paths the daemon uses, prints "ready" and then waits until its standard
# input is closed. Every process of the testbed joins the namespaces with
# nsenter; when the last of them ends, the namespaces go away with their mounts.
#
# Paths that do not exist on the host are made to exist inside the namespace
# only: the nearest existing parent directory is covered by an overlay whose
# upper layer lives in the temporary tree, so nothing on the host changes.

import json
import os
import subprocess
import sys


def run(*args):
    subprocess.run(args, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE)


def ensure(scratch, number, path, directory):
    # Makes `path` exist inside the namespace (a directory or a file), under
    # overlay `number` when the host lacks it.
    if os.path.exists(path):
        return
    if not path.startswith("/dev/"):  # /dev is a tmpfs of our own
        parent = os.path.dirname(path)
        while not os.path.isdir(parent):
            parent = os.path.dirname(parent)
        parent = os.path.realpath(parent)
        if parent == "/":
            raise RuntimeError("refusing to cover / to create " + path)
        layer = os.path.join(scratch, "overlay%d" % number)
        os.makedirs(layer + "/upper")
        os.makedirs(layer + "/work")
        run("mount", "-t", "overlay", "overlay", "-o",
            "lowerdir=%s,upperdir=%s/upper,workdir=%s/work" % (parent, layer, layer), parent)
    os.makedirs(path if directory else os.path.dirname(path), exist_ok=True)
    if not directory:
        open(path, "a").close()


def main():
    with open(sys.argv[1]) as f:
        config = json.load(f)
    run("ip", "link", "set", "lo", "up")

    # /dev: a tmpfs of our own, so that /dev/kob and /dev/log are the
    # testbed's; the few devices programs need are bound from the host.
    hostdev = os.path.join(config["scratch"], "hostdev")
    os.makedirs(hostdev, exist_ok=True)
    run("mount", "--bind", "/dev", hostdev)
    run("mount", "-t", "tmpfs", "-o", "mode=755", "tmpfs", "/dev")
    for name in ("null", "zero", "urandom", "random", "full", "tty"):
        if os.path.exists(os.path.join(hostdev, name)):
            open("/dev/" + name, "a").close()
            run("mount", "--bind", os.path.join(hostdev, name), "/dev/" + name)
    for name, target in (("fd", "/proc/self/fd"), ("stdin", "/proc/self/fd/0"),
                         ("stdout", "/proc/self/fd/1"), ("stderr", "/proc/self/fd/2")):
        os.symlink(target, "/dev/" + name)
    os.mkdir("/dev/shm")
    run("mount", "-t", "tmpfs", "tmpfs", "/dev/shm")
    run("umount", hostdev)

    for number, (source, target) in enumerate(config["binds"]):
        ensure(config["scratch"], number, target, os.path.isdir(source))
        run("mount", "--bind", source, target)

    sys.stdout.write("ready\n")
    sys.stdout.flush()
    sys.stdin.read()


if __name__ == "__main__":
    try:
        main()
    except Exception as e:  # reported to the testbed, which fails the test
        detail = e.stderr.decode(errors="replace").strip() if isinstance(e, subprocess.CalledProcessError) else ""
        sys.stdout.write("failed: %r %s\n" % (e, detail))
        sys.stdout.flush()
        sys.exit(1)
