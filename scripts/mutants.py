#!/usr/bin/env python3
"""Plants one fault at a time in the daemon's sources and runs the tests.

A mutant is a textual change to one file of src/: a comparison flipped, a
constant moved by one, a statement deleted, a condition negated, && and ||
swapped, a bounds check dropped. The tool copies the committed tree (or the
working tree) into a scratch folder, builds it once, then for each mutant
applies the change, rebuilds what depends on it, runs the unit tests and then
the end-to-end scenarios (stopping at the first failure), and restores the
file. A mutant is killed when a test fails, survives when every test passes,
and did not build when the compiler refused it.

    scripts/mutants.py                       # the written-down sample
    scripts/mutants.py --only S03 S17        # some of it
    scripts/mutants.py --worktree            # the uncommitted tree, not HEAD
    scripts/mutants.py --candidates src/sl/sl.cpp   # list changes one could plant

The sample (scripts/mutants.txt) holds one mutant a line:
    ID | FILE | ORIGINAL TEXT | MUTATED TEXT | WHY IT MATTERS
ORIGINAL TEXT must occur exactly once in FILE (add context until it does);
MUTATED TEXT "(delete)" deletes it. "\\n" in either stands for a line feed, "\\\\n" for a backslash and n.
"""

import argparse
import collections
import json
import os
import re
import shutil
import subprocess
import sys
import tempfile
import time

ROOT = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
Mutant = collections.namedtuple("Mutant", "id path original mutated why")

# Operators for --candidates: (name, pattern, replacement).
OPERATORS = [
    ("flip <", r"(?<![<\-])<(?![<=])", ">="),
    ("flip <=", r"<=", ">"),
    ("flip >", r"(?<![>\-])>(?![>=])", "<="),
    ("flip >=", r">=", "<"),
    ("flip ==", r"==", "!="),
    ("flip !=", r"!=", "=="),
    ("&& to ||", r"&&", "||"),
    ("|| to &&", r"\|\|", "&&"),
    ("constant +1", r"(?<![\w.])(\d+)(?![\w.])", lambda m: str(int(m.group(1)) + 1)),
    ("negate if", r"if \((.*)\)$", r"if (!(\1))"),
    ("drop return value", r"return (\d+);", lambda m: "return %d;" % (1 - int(m.group(1)) if m.group(1) in "01" else 0)),
]


def read_sample(path):
    mutants = []
    with open(path) as f:
        for number, line in enumerate(f, 1):
            line = line.rstrip("\n")
            if not line.strip() or line.lstrip().startswith("#"):
                continue
            fields = [x.strip() for x in line.split(" | ")]
            if len(fields) != 5:
                sys.exit("%s:%d: want 5 fields separated by ' | ', got %d" % (path, number, len(fields)))
            unescape = lambda s: s.replace("\\\\n", "\0").replace("\\n", "\n").replace("\0", "\\n")
            mutated = "" if fields[3] == "(delete)" else unescape(fields[3])
            mutants.append(Mutant(fields[0], fields[1], unescape(fields[2]), mutated, fields[4]))
    return mutants


def interleave(mutants):
    """One mutant of each folder in turn, so that a run cut short still
    samples every folder."""
    by_folder = collections.OrderedDict()
    for m in mutants:
        by_folder.setdefault(m.path.split("/")[1], []).append(m)
    queues = list(by_folder.values())
    ordered = []
    while any(queues):
        for q in queues:
            if q:
                ordered.append(q.pop(0))
    return ordered


def resolve(tree, path):
    """The mutant's file in `tree`; a file moved to another folder of src/
    since the sample was written is found by its name."""
    if os.path.exists(os.path.join(tree, path)):
        return os.path.join(tree, path)
    name = os.path.basename(path)
    for folder, _, files in os.walk(os.path.join(tree, "src")):
        if name in files:
            return os.path.join(folder, name)
    return os.path.join(tree, path)


def check_sample(tree, mutants):
    ids = set()
    for m in mutants:
        if m.id in ids:
            sys.exit("duplicate mutant id %s" % m.id)
        ids.add(m.id)
        with open(resolve(tree, m.path)) as f:
            count = f.read().count(m.original)
        if count != 1:
            sys.exit("%s: %r occurs %d times in %s (want exactly once)" % (m.id, m.original, count, m.path))


def candidates(path):
    with open(path) as f:
        lines = f.read().split("\n")
    for number, line in enumerate(lines, 1):
        code = line.split("//")[0]
        if not code.strip() or code.lstrip().startswith("#"):
            continue
        for name, pattern, replacement in OPERATORS:
            for match in re.finditer(pattern, code):
                mutated = code[:match.start()] + re.sub(pattern, replacement, match.group(0), count=1) + code[match.end():]
                print("%s:%d: %-17s %s\n%s  -> %s" % (path, number, name, code.strip(), " " * len(path), mutated.strip()))


def run(command, cwd, log, timeout):
    with open(log, "a") as out:
        out.write("\n$ %s\n" % " ".join(command))
        out.flush()
        try:
            return subprocess.run(command, cwd=cwd, stdout=out, stderr=subprocess.STDOUT, timeout=timeout).returncode
        except subprocess.TimeoutExpired:
            out.write("timed out after %d s\n" % timeout)
            return 124


def prepare(args):
    tree = os.path.join(args.scratch, "tree")
    build = os.path.join(args.scratch, "build")
    if not os.path.isdir(tree):
        os.makedirs(tree)
        if args.worktree:
            ignore = shutil.ignore_patterns("build*", ".git", "__pycache__")
            shutil.copytree(ROOT, tree, ignore=ignore, dirs_exist_ok=True)
        else:
            archive = subprocess.run(["git", "-C", ROOT, "archive", args.rev], check=True, capture_output=True).stdout
            subprocess.run(["tar", "-x", "-C", tree], input=archive, check=True)
    log = os.path.join(args.scratch, "build.log")
    if run(["cmake", "-S", tree, "-B", build, "-DCMAKE_BUILD_TYPE=RelWithDebInfo"], tree, log, 600) != 0 or \
            run(["cmake", "--build", build, "-j%d" % args.jobs], tree, log, 3600) != 0:
        sys.exit("the unmutated tree does not build; see %s" % log)
    return tree, build


def unit_binaries(build, folder):
    """The unit-test programs, those named after the mutated folder first: the
    order changes only how soon a mutant is killed, never the verdict."""
    bindir = os.path.join(build, "bin")
    names = sorted(n for n in os.listdir(bindir) if n.startswith("test_") and os.access(os.path.join(bindir, n), os.X_OK))
    return [os.path.join(bindir, n) for n in sorted(names, key=lambda n: folder not in n)]


def test(build, args, log, folder=""):
    """0 when every test passed; the failing stage's status otherwise."""
    for label in args.labels:
        if label == "unit" and args.runner == "binaries":
            # Each program runs whole, stopping at its first failing case.
            for binary in unit_binaries(build, folder):
                rc = run([binary, "--gtest_brief=1", "--gtest_fail_fast"], build, log, args.timeout * 4)
                if rc != 0:
                    return rc
            continue
        rc = run(["ctest", "--test-dir", build, "-L", label, "--stop-on-failure", "-j%d" % args.jobs,
                  "--timeout", str(args.timeout)], build, log, args.timeout * 20)
        if rc != 0:
            return rc
    return 0


def main():
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--sample", default=os.path.join(ROOT, "scripts", "mutants.txt"))
    parser.add_argument("--only", nargs="*", default=None, help="mutant ids to run")
    parser.add_argument("--rev", default="HEAD", help="the commit to copy (default HEAD)")
    parser.add_argument("--worktree", action="store_true", help="copy the working tree instead of a commit")
    parser.add_argument("--scratch", default=None, help="scratch folder (kept; reused when it exists)")
    parser.add_argument("--labels", nargs="*", default=["unit", "e2e"], help="CTest labels, run in order")
    parser.add_argument("--runner", choices=["binaries", "ctest"], default="binaries",
                        help="unit tests: each program whole (fast), or case by case through CTest")
    parser.add_argument("--jobs", type=int, default=2)
    parser.add_argument("--timeout", type=int, default=300, help="seconds per test")
    parser.add_argument("--out", default=None, help="write the results as JSON here, one mutant at a time")
    parser.add_argument("--resume", action="store_true", help="skip the mutants already in --out")
    parser.add_argument("--candidates", metavar="FILE", help="list possible mutants of FILE and stop")
    args = parser.parse_args()
    if args.candidates:
        candidates(args.candidates)
        return 0

    mutants = interleave(read_sample(args.sample))
    if args.only is not None:
        mutants = [m for m in mutants if m.id in args.only]
    results = []
    if args.resume and args.out and os.path.exists(args.out):
        with open(args.out) as f:
            results = json.load(f)
        done = {r["id"] for r in results}
        mutants = [m for m in mutants if m.id not in done]
    args.scratch = args.scratch or tempfile.mkdtemp(prefix="moxmutants.")
    started = time.monotonic()
    tree, build = prepare(args)
    check_sample(tree, mutants)
    if not (args.resume and results) and test(build, args, os.path.join(args.scratch, "baseline.log")) != 0:
        sys.exit("the unmutated tree fails its tests; see %s/baseline.log" % args.scratch)

    for m in mutants:
        path = resolve(tree, m.path)
        with open(path) as f:
            original = f.read()
        log = os.path.join(args.scratch, "%s.log" % m.id)
        began = time.monotonic()
        try:
            with open(path, "w") as f:
                f.write(original.replace(m.original, m.mutated, 1))
            if run(["cmake", "--build", build, "-j%d" % args.jobs], tree, log, 1800) != 0:
                outcome = "no-build"
            else:
                outcome = "survived" if test(build, args, log, m.path.split("/")[1]) == 0 else "killed"
        finally:
            with open(path, "w") as f:
                f.write(original)
        seconds = time.monotonic() - began
        results.append({"id": m.id, "path": m.path, "outcome": outcome, "seconds": round(seconds, 1), "why": m.why})
        print("%-5s %-9s %6.0fs  %s: %s" % (m.id, outcome, seconds, m.path, m.why), flush=True)
        if args.out:
            with open(args.out, "w") as f:
                json.dump(results, f, indent=1)
    # Leave the build matching the tree.
    run(["cmake", "--build", build, "-j%d" % args.jobs], tree, os.path.join(args.scratch, "build.log"), 1800)

    print("\n%-10s %7s %9s %9s" % ("folder", "killed", "survived", "no-build"))
    by_folder = collections.defaultdict(collections.Counter)
    for r in results:
        by_folder[r["path"].split("/")[1]][r["outcome"]] += 1
    total = collections.Counter()
    for folder in sorted(by_folder):
        c = by_folder[folder]
        total.update(c)
        print("%-10s %7d %9d %9d" % (folder, c["killed"], c["survived"], c["no-build"]))
    print("%-10s %7d %9d %9d" % ("all", total["killed"], total["survived"], total["no-build"]))
    built = total["killed"] + total["survived"]
    if built:
        print("score: %d of %d built mutants killed (%.0f%%), %.0f min" %
              (total["killed"], built, 100.0 * total["killed"] / built, (time.monotonic() - started) / 60))
    survivors = [r for r in results if r["outcome"] == "survived"]
    if survivors:
        print("\nsurvivors:")
        for r in survivors:
            print("  %s %s: %s" % (r["id"], r["path"], r["why"]))
    return 0


if __name__ == "__main__":
    sys.exit(main())
