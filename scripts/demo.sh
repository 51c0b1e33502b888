#!/usr/bin/env bash
# Builds Mox and what it runs against (the substitute DMI provider and its
# client tool, the simulated OBX driver, the alarm peer), then runs a narrated
# scenario with the real daemon in the end-to-end testbed: start-up, three
# events of different kinds and what each produced, and the stop on SIGTERM.
# Needs root: the testbed uses private mount and network namespaces.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
echo "demo: building (the first build takes a minute or two)"
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo -DMOX_BUILD_TESTS=ON >/dev/null
cmake --build build -j"${JOBS:-2}" --target mox dmisp dmictl kobd obxpreload e2e_initstub >/dev/null

b=$PWD/build
MOX_BIN=$b/bin/mox MOX_SOURCE_DIR=$PWD MOX_INIT_STUB=$b/bin/e2e_initstub \
  MOX_DMICTL=$b/bin/dmictl MOX_KOBD=$b/bin/kobd MOX_OBX_PRELOAD=$b/lib/libobxpreload.so \
  exec python3 scripts/demo.py
