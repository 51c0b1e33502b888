#!/usr/bin/env bash
# The installed tree, mounted at its fixed paths in a private mount namespace,
# runs as the systemd unit describes it: systemd-analyze accepts the unit and
# rates its exposure at most 5.0; the
# daemon started with the unit's ExecStart, WorkingDirectory and Environment
# (no LD_LIBRARY_PATH: the RUNPATH finds the library) is disabled by a marker
# file in that directory; without one it installs mox.mif from the MIF
# directory into an empty provider database, keeps running, and stops with
# status 0 on the unit's KillSignal, not before 10 seconds after its start.
#   install_runs.sh BUILD_DIR SOURCE_DIR
# Needs root for the namespace; otherwise it reports itself skipped (77).
set -uo pipefail
build=$1 source=$2
. "$source/tests/install/common.sh"

if [ "${1:-}" != --inside ] && { [ "$(id -u)" -ne 0 ] || ! unshare -m true 2>/dev/null; }; then
    echo "SKIPPED: needs root and a private mount namespace (unshare -m)"
    exit 77
fi

stage=$(mktemp -d)
trap 'rm -rf "$stage"' EXIT
DESTDIR=$stage cmake --install "$build" >/dev/null || { fail "cmake --install failed"; finish; }

exec unshare -m --propagation private bash -s "$stage" "$source" <<'INSIDE'
set -uo pipefail
stage=$1 source=$2
. "$source/tests/install/common.sh"
unit=$stage/lib/systemd/system/mox.service

# The fixed paths, and nothing else of the host below them.
mount -t tmpfs tmpfs /usr/local && mkdir /usr/local/ubo &&
    mount --bind "$stage/usr/local/ubo" /usr/local/ubo || { fail "cannot mount /usr/local/ubo"; finish; }
mount -t tmpfs tmpfs /var && mkdir -p /var/dmi /var/lib && ln -s /run /var/run &&
    mount --bind "$stage/var/dmi" /var/dmi || { fail "cannot mount /var/dmi"; finish; }

verify=$(systemd-analyze verify --man=no "$unit" 2>&1) || fail "systemd-analyze verify failed"
[ -z "$verify" ] || fail "systemd-analyze verify: $verify"
systemd-analyze security --offline=true --threshold=50 "$unit" >/dev/null 2>&1 ||
    fail "exposure above 5.0: $(systemd-analyze security --offline=true "$unit" 2>&1 | tail -1)"

value() { sed -n "s/^$1=//p" "$unit"; }
exec_start=$(value ExecStart) workdir=$(value WorkingDirectory)
settings="$(value Type) $(value KillSignal) $exec_start $workdir"
[ "$settings" = "notify SIGTERM /usr/local/ubo/bin/mox /usr/local/ubo/bin" ] || fail "unit settings: $settings"
mapfile -t environment < <(value Environment)
[ "${#environment[@]}" -gt 0 ] || fail "no Environment"
# StateDirectory= makes the provider's database directory.
mkdir -p "/var/lib/$(value StateDirectory)"

# No floppy drive: a mount that finds no medium.
stubs=$(mktemp -d)
printf '#!/bin/sh\nexit 32\n' >"$stubs/mount" && printf '#!/bin/sh\n' >"$stubs/umount" && chmod +x "$stubs"/*
# Called in a subshell each time (command substitution or background), which
# the daemon then replaces, so $! is the daemon's own process id.
start() {
    cd "$workdir" && exec env -i PATH="$stubs:/usr/sbin:/usr/bin:/sbin:/bin" "${environment[@]}" $exec_start
}

touch "$workdir/mox.not"
out=$(start 2>&1)
[ "$?:$out" = "0:Mox has been disabled." ] || fail "disabled: printed $out"
rm "$workdir/mox.not"

log=$(mktemp)
began=$(date +%s)
start >"$log" 2>&1 &
pid=$!
# Registration installs the daemon's own MIF into the empty database.
database=$(printf '%s\n' "${environment[@]}" | sed -n 's/^DMISP_DB=//p')
timeout 10 bash -c "until grep -qs 'Zorek Tessarin Server Manager - Mox' '$database'/component-*.mif; do sleep 0.2; done" ||
    fail "mox.mif was not installed into $database: $(ls "$database")"
sleep 1
kill -0 "$pid" 2>/dev/null || fail "the daemon ended: $(cat "$log")"
kill -TERM "$pid"
wait "$pid"
status=$?
elapsed=$(( $(date +%s) - began ))
[ "$status" -eq 0 ] || fail "after SIGTERM: status $status"
[ "$elapsed" -ge 10 ] || fail "stopped after $elapsed s, before 10 s"
expected="Checking for mox configurations ..
There is no floppy found in floppy drive
Proceeding with loading mox .."
[ "$(cat "$log")" = "$expected" ] || fail "the daemon printed: $(cat "$log")"
rm -rf "$stubs" "$log"
finish
INSIDE
