#!/bin/sh
# Installs every shipped MIF with the provider's own parser (dmictl on a
# temporary database), then checks what no single file can show: the own
# MIF's version, a MIF for every supported component, and an older own MIF
# below that version for each actions table the carry-over reads.
# Usage: check_mifs.sh DMICTL MIFS_DIRECTORY
set -eu
dmictl=$1 mifs=$2
DMISP_DB=$(mktemp -d) && export DMISP_DB
trap 'rm -rf "$DMISP_DB"' EXIT
fail() { echo "check_mifs: $*" >&2; exit 1; }
for f in "$mifs"/*.mif; do
    "$dmictl" install "$f" >/dev/null || fail "$f is refused"
done
own=$("$dmictl" list | awk -F '\t' '$2 == "Zorek Tessarin Server Manager - Mox" { print $1 }')
[ "$("$dmictl" get "$own" 1 3)" = 2.93 ] || fail "mox.mif is not version 2.93"
"$dmictl" rows "$own" 2 | cut -f 2 | while read -r name; do
    "$dmictl" list | cut -f 2 | grep -qxF "$name" || fail "no MIF for supported component $name"
done
bands=""
for f in "$mifs"/old/*.mif; do
    rm -rf "$DMISP_DB"/*
    id=$("$dmictl" install "$f") || fail "$f is refused"
    version=$("$dmictl" get "$id" 1 3)
    # The carry-over reads group 3 below 2.51, group 4 below 2.91, group 10 below 2.93.
    group=$(awk -v v="$version" 'BEGIN { print v < 2.51 ? 3 : v < 2.91 ? 4 : v < 2.93 ? 10 : 0 }')
    [ "$group" != 0 ] || fail "$f: version $version is not below 2.93"
    [ -n "$("$dmictl" rows "$id" "$group")" ] || fail "$f: no rows in actions table $group"
    bands="$bands $group"
done
for g in 3 4 10; do
    echo "$bands " | grep -q " $g " || fail "no older own MIF whose actions table is group $g"
done
echo "check_mifs: every MIF installs; versions and actions tables consistent"
