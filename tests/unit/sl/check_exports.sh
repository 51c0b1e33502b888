#!/bin/sh
# Compares the symbols the daemon defines in its dynamic symbol table with the
# list of SL operations the provider resolves by name (44 of them). Names that
# start with an underscore belong to the C library's start-up files and the
# toolchain.
set -eu
expected=$(sed -n 's/^ *\([A-Za-z_][A-Za-z0-9_]*\) *;.*$/\1/p' "$2" | sort)
actual=$(nm -D --defined-only "$1" | awk '{ print $NF }' | grep -v '^_' | sort)
count=$(printf '%s\n' "$expected" | grep -c .)
[ "$count" -eq 44 ] || { echo "the export list names $count operations, not 44"; exit 1; }
[ "$expected" = "$actual" ] || { printf 'expected:\n%s\nactual in %s:\n%s\n' "$expected" "$1" "$actual"; exit 1; }
echo "$count exported SL operations match"
