#!/bin/sh
# Compares the symbols the daemon defines in its dynamic symbol table with the
# list of SL operations the provider resolves by name. Names that start with
# an underscore belong to the C library's start-up files and the toolchain.
set -eu
mox=$1
list=$2
expected=$(sed -n 's/^ *\([A-Za-z_][A-Za-z0-9_]*\) *;.*$/\1/p' "$list" | sort)
actual=$(nm -D --defined-only "$mox" | awk '{ print $NF }' | grep -v '^_' | sort)
count=$(printf '%s\n' "$expected" | grep -c .)
if [ "$count" -ne 44 ]; then
    echo "the export list names $count operations, not 44"
    exit 1
fi
if [ "$expected" != "$actual" ]; then
    echo "dynamic symbols of $mox differ from $list (< expected, > actual):"
    printf '%s\n' "$expected" > "${TMPDIR:-/tmp}/mox_exports_expected.$$"
    printf '%s\n' "$actual" | diff "${TMPDIR:-/tmp}/mox_exports_expected.$$" - || true
    rm -f "${TMPDIR:-/tmp}/mox_exports_expected.$$"
    exit 1
fi
echo "$count exported SL operations match"
