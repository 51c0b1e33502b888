#!/usr/bin/env bash
# Builds the fuzz targets with clang and runs them. Two modes:
#   fuzz/run.sh SECONDS [TARGET...]     the open-ended campaign: SECONDS of
#                                       wall-clock time per target
#   fuzz/run.sh --runs N [TARGET...]    the test command's entry: replays the
#                                       checked-in corpus and every regression
#                                       input, then N executions from seed 1
#                                       on a fresh working corpus, so the same
#                                       tree gets the same verdict
# Targets: indication confirm smtp mif config lockfile. New inputs go to a
# working corpus in the build folder, never into the repository. Exits
# non-zero when a target finds a fault; crash inputs are left in
# build-fuzz/artifacts/. An input that found a fault belongs, once the fault
# is mended, in fuzz/regressions/TARGET/: every build replays it from then on.
set -euo pipefail
runs=
if [ "${1:-}" = --runs ]; then
  runs=${2:?usage: fuzz/run.sh --runs N [TARGET...]}
  shift 2
else
  seconds=${1:?usage: fuzz/run.sh SECONDS [TARGET...] | fuzz/run.sh --runs N [TARGET...]}
  shift
fi
here=$(cd "$(dirname "$0")" && pwd)
build=${MOX_FUZZ_BUILD:-$here/../build-fuzz}
targets=("$@")
[ ${#targets[@]} -gt 0 ] || targets=(indication confirm smtp mif config lockfile)

# Where the kernel cannot run i386 programs and qemu's user-mode emulator
# stands in (scripts/setup.sh), libFuzzer is not dependable: runs hang at exit
# and the sanitizer's allocator trips over the emulated address space. The
# campaign is then skipped (77: CTest's skip code), never passed; the gcc
# build's replay tests (fuzz.replay.*) still run the corpus and the
# regression inputs there.
if grep -qs '^enabled' /proc/sys/fs/binfmt_misc/qemu-i386; then
  echo "fuzz: i386 programs run under an emulator here; the fuzz campaign needs a kernel that runs them"
  exit 77
fi

CC=${CC:-clang-14} CXX=${CXX:-clang++-14} cmake -S "$here" -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$build" -j2 >/dev/null

mkdir -p "$build/artifacts"
status=0
printf '%-11s %12s %8s  %s\n' target executions exec/s result
for t in "${targets[@]}"; do
  work="$build/corpus/$t"
  log="$build/fuzz_$t.log"
  seeds=("$here/corpus/$t")
  [ -d "$here/regressions/$t" ] && seeds+=("$here/regressions/$t")
  # Leak checks are off: LeakSanitizer stops the world with ptrace, which the
  # user-mode emulator that runs i386 programs on some kernels does not offer.
  options=(-timeout=10 -detect_leaks=0 -rss_limit_mb=2048 -max_len=8192 -artifact_prefix="$build/artifacts/$t-"
           -print_final_stats=1)
  rc=0
  if [ -n "$runs" ]; then
    rm -rf "$work"
    mkdir -p "$work"
    # Every known input once (files named one by one are run, not fuzzed),
    # then the seeded campaign.
    mapfile -t known < <(find "${seeds[@]}" -type f | sort)
    { "$build/fuzz_$t" "${options[@]}" "${known[@]}" &&
      "$build/fuzz_$t" "${options[@]}" -seed=1 -runs="$runs" "$work" "${seeds[@]}"; } >"$log" 2>&1 || rc=$?
  else
    mkdir -p "$work"
    "$build/fuzz_$t" "${options[@]}" -max_total_time="$seconds" "$work" "${seeds[@]}" >"$log" 2>&1 || rc=$?
  fi
  executed=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -1)
  rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$log" | tail -1)
  if [ $rc -eq 0 ]; then result="no finding"; else result="FAULT (see $log)"; status=1; fi
  printf '%-11s %12s %8s  %s\n' "$t" "${executed:-?}" "${rate:-?}" "$result"
done
exit $status
