#!/usr/bin/env bash
# Builds and runs every benchmark of the project and prints one table.
#   bench/run.sh            (build folder: build/, or $MOX_BUILD)
# Takes about two minutes; run it on an otherwise idle machine.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
root=$(cd "$here/.." && pwd)
build=${MOX_BUILD:-$root/build}

cmake -S "$root" -B "$build" >/dev/null
cmake --build "$build" -j2 --target sl_bench registration_bench dmisp_bench events_bench >/dev/null

out=$(mktemp -d)
trap 'rm -rf "$out"' EXIT
"$build/bin/sl_bench" >"$out/sl.txt"
"$build/bin/registration_bench" >"$out/registration.txt"
"$build/bin/dmisp_bench" >"$out/dmisp.txt"
"$build/bin/events_bench" >"$out/events.txt"

# The figure at the end of the line that begins with $2 in file $1.
figure() { grep -F -- "$2" "$1" | head -1 | awk '{print $NF}'; }
# Column $3 of the line of registration_bench for $2 components, start kind $4.
registration() { awk -v n="$2" -v kind="$3" '$1 == n && $2 == kind {print $(NF-2)}' "$1"; }

row() { printf '%-58s %14s  %s\n' "$1" "$2" "$3"; }
row "measure" "value" "unit"
row "events through the worker, log action only" "$(figure "$out/events.txt" 'events/s, log only')" "events/s"
row "events through the worker, log + LCD + page" "$(figure "$out/events.txt" 'events/s, log + LCD')" "events/s"
row "SL commands (get-row by keys, substitute provider)" \
  "$(grep -F 'get-row by keys, substitute provider' "$out/sl.txt" | awk '{print $(NF-1)}')" "commands/s"
row "keyed row lookup at 10,000 rows, median" \
  "$(awk '$NF ~ /[0-9]/ && $(NF-2) == 10000 {print $(NF-1)}' "$out/dmisp.txt")" "us"
row "keyed row lookup at 10,000 rows, p99" \
  "$(awk '$NF ~ /[0-9]/ && $(NF-2) == 10000 {print $NF}' "$out/dmisp.txt")" "us"
for n in 1 20 100; do
  row "start-up registration, $n components (own MIF current)" "$(registration "$out/registration.txt" $n later)" "ms"
  row "start-up registration, $n components (installs own MIF)" "$(registration "$out/registration.txt" $n first)" "ms"
done
row "heap per queued event" "$(figure "$out/events.txt" 'heap bytes per queued event')" "bytes"
row "resident memory after 10,000 events, queue drained" "$(figure "$out/events.txt" 'resident KiB after 10,000')" "KiB"
row "resident memory after 100,000 events, queue drained" "$(figure "$out/events.txt" 'resident KiB after 100000 events')" "KiB"
row "heap in use after 10,000 events, queue drained" "$(figure "$out/events.txt" 'heap bytes in use after 10,000')" "bytes"
row "heap in use after 100,000 events, queue drained" "$(figure "$out/events.txt" 'heap bytes in use after 100000')" "bytes"
row "idle event-to-log latency, median (200 events, 200 ms apart)" "$(figure "$out/events.txt" 'latency median')" "ms"
row "idle event-to-log latency, p99" "$(figure "$out/events.txt" 'latency p99')" "ms"
