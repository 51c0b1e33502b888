#!/usr/bin/env bash
# Builds Mox and runs the daemon on the simulated platform in a scratch
# directory, narrating what it does, then stops it with SIGTERM.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo -DMOX_BUILD_TESTS=OFF >/dev/null
cmake --build build -j"${JOBS:-2}" --target mox >/dev/null

work=$(mktemp -d /tmp/moxdemo.XXXXXX)
mkdir -p "$work/bin" "$work/db"
# No floppy drive here: a mount that finds no medium.
printf '#!/bin/sh\nexit 32\n' >"$work/bin/mount"
printf '#!/bin/sh\nexit 0\n' >"$work/bin/umount"
chmod +x "$work/bin/mount" "$work/bin/umount"

echo "demo: starting mox in $work (no marker files, no floppy)"
(cd "$work" && PATH="$work/bin:$PATH" DMISP_DB="$work/db" UXDMIPATH="$PWD/mifs" \
  exec "$OLDPWD/build/bin/mox") &
pid=$!
sleep 3
echo "demo: mox (pid $pid) is running; sending SIGHUP, which it consumes"
kill -HUP "$pid"
sleep 1
echo "demo: sending SIGTERM; mox exits once its first 10 seconds are over"
kill -TERM "$pid"
status=0
wait "$pid" || status=$?
echo "demo: mox exited with status $status"
rm -rf "$work"
