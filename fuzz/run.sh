#!/usr/bin/env bash
# Builds the fuzz targets with clang and runs each for SECONDS seconds from
# its checked-in seed corpus (new inputs go to a working corpus in the build
# folder, never into the repository). Exits non-zero when a target finds a
# fault; crash inputs are left in build-fuzz/artifacts/.
#   fuzz/run.sh SECONDS [TARGET...]     targets: indication confirm smtp mif config lockfile
set -euo pipefail
seconds=${1:?usage: fuzz/run.sh SECONDS [TARGET...]}
shift
here=$(cd "$(dirname "$0")" && pwd)
build=${MOX_FUZZ_BUILD:-$here/../build-fuzz}
targets=("$@")
[ ${#targets[@]} -gt 0 ] || targets=(indication confirm smtp mif config lockfile)

# Where the kernel cannot run i386 programs and qemu's user-mode emulator
# stands in (scripts/setup.sh), libFuzzer is not dependable: runs hang at exit
# and the sanitizer's allocator trips over the emulated address space. The
# campaign is then skipped (77: CTest's skip code), never passed.
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
  mkdir -p "$work"
  log="$build/fuzz_$t.log"
  rc=0
  # Leak checks are off: LeakSanitizer stops the world with ptrace, which the
  # user-mode emulator that runs i386 programs on some kernels does not offer.
  "$build/fuzz_$t" -max_total_time="$seconds" -timeout=10 -detect_leaks=0 -rss_limit_mb=2048 -max_len=8192 \
    -artifact_prefix="$build/artifacts/$t-" -print_final_stats=1 "$work" "$here/corpus/$t" >"$log" 2>&1 || rc=$?
  runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -1)
  rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$log" | tail -1)
  if [ $rc -eq 0 ]; then result="no finding"; else result="FAULT (see $log)"; status=1; fi
  printf '%-11s %12s %8s  %s\n' "$t" "${runs:-?}" "${rate:-?}" "$result"
done
exit $status
