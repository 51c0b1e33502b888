#!/usr/bin/env bash
# cpack builds the Debian package: lintian finds no error and no warning,
# Depends is computed for the i386 runtimes, and the contents are the
# installation. Then dpkg installs, upgrades, removes and purges it in a
# throwaway root (an overlay over / in a private mount namespace, where
# deb-systemd-invoke records its calls as if systemd ran),
# checking the files, the enablement link and the administrator's state.
#   package_deb.sh BUILD_DIR SOURCE_DIR
# Needs root for the namespace; otherwise it reports itself skipped (77).
set -uo pipefail
build=$1 source=$2
. "$source/tests/install/common.sh"
if [ "$(id -u)" -ne 0 ] || ! unshare -m true 2>/dev/null; then
    echo "SKIPPED: needs root and a private mount namespace (unshare -m)"
    exit 77
fi

out=$(mktemp -d)
trap 'rm -rf "$out"' EXIT
# The same tree twice: the release, and a later version to upgrade to.
for version in 2.93 2.94; do
    cpack -G DEB --config "$build/CPackConfig.cmake" -B "$out" -D CPACK_PACKAGE_VERSION=$version \
        >"$out/cpack.log" 2>&1 || { cat "$out/cpack.log"; fail "cpack $version failed"; finish; }
done
deb=$out/mox_2.93_i386.deb
lintian --fail-on error,warning "$deb" >"$out/lintian.log" 2>&1 || fail "lintian: $(cat "$out/lintian.log")"
[ "$(dpkg-deb -f "$deb" Depends)" = "libc6 (>= 2.34), libgcc-s1 (>= 7), libstdc++6 (>= 12)" ] ||
    fail "Depends: $(dpkg-deb -f "$deb" Depends)"
dpkg-deb -x "$deb" "$out/root"
check_tree "$out/root"

exec unshare -m --propagation private bash -s "$out" "$source" <<'INSIDE'
set -uo pipefail
out=$1 source=$2
. "$source/tests/install/common.sh"
r=$out/merged
mkdir "$out/layer" "$r" && mount -t tmpfs tmpfs "$out/layer" && mkdir "$out/layer/up" "$out/layer/work" &&
    mount -t overlay overlay -o "lowerdir=/,upperdir=$out/layer/up,workdir=$out/layer/work" "$r" &&
    mount --rbind /dev "$r/dev" && mount -t proc proc "$r/proc" && mount -t tmpfs tmpfs "$r/run" &&
    mount -t tmpfs tmpfs "$r/tmp" || { fail "cannot make the throwaway root"; finish; }
cp "$out"/mox_2.9[34]_i386.deb "$r/tmp/"
# systemd "runs": the maintainer scripts start and stop the daemon through
# deb-systemd-invoke, which records the calls here.
mkdir -p "$r/run/systemd/system"
printf '#!/bin/sh\necho "$*" >>/tmp/calls\n' >"$r/usr/bin/deb-systemd-invoke" && chmod 755 "$r/usr/bin/deb-systemd-invoke"
in_root() { chroot "$r" "$@"; }
dpkg_do() { in_root dpkg --no-triggers "$@" >"$r/tmp/dpkg.log" 2>&1 || fail "dpkg $*: $(cat "$r/tmp/dpkg.log")"; }
# state VERSION|- ENABLED(yes|no) : package status and the enablement link.
link=/etc/systemd/system/multi-user.target.wants/mox.service
state() {
    local status
    status=$(in_root dpkg-query -W -f '${Status} ${Version}' mox 2>/dev/null)
    [ "$status" = "$1" ] || fail "after $step: status '$status', expected '$1'"
    if [ "$2" = yes ]; then
        [ "$(readlink "$r$link")" = /lib/systemd/system/mox.service ] || fail "after $step: no enablement link"
    else
        [ ! -e "$r$link" ] && [ ! -L "$r$link" ] || fail "after $step: enablement link present"
    fi
}
calls() { [ "$(cat "$r/tmp/calls" 2>/dev/null)" = "$1" ] || fail "after $step: calls '$(cat "$r/tmp/calls")'"; rm -f "$r/tmp/calls"; }

step="install 2.93"
dpkg_do -i /tmp/mox_2.93_i386.deb
state "install ok installed 2.93" yes
calls "start mox.service"
for f in $expected_files; do [ -f "$r$f" ] || fail "after $step: no $f"; done
# What the administrator and the running daemon add.
echo "notificationonly = true" >"$r/usr/local/ubo/bin/mox.cfg"
mkdir -p "$r/var/lib/dmisp" && echo database >"$r/var/lib/dmisp/component-1.mif"

step="upgrade to 2.94"
dpkg_do -i /tmp/mox_2.94_i386.deb
state "install ok installed 2.94" yes
calls "restart mox.service"

step="upgrade of a disabled unit"
rm "$r$link"   # systemctl disable mox
dpkg_do -i /tmp/mox_2.94_i386.deb
state "install ok installed 2.94" no
calls "restart mox.service"
ln -s /lib/systemd/system/mox.service "$r$link"   # systemctl enable mox

step="remove"
dpkg_do -r mox
state "deinstall ok config-files 2.94" yes
calls "stop mox.service"
[ "$(readlink "$r/etc/systemd/system/mox.service")" = /dev/null ] || fail "after $step: the unit is not masked"
for f in /usr/local/ubo/bin/mox /lib/systemd/system/mox.service; do [ ! -e "$r$f" ] || fail "after $step: $f left"; done
[ -f "$r/usr/local/ubo/bin/mox.cfg" ] || fail "after $step: mox.cfg removed"
[ -f "$r/var/lib/dmisp/component-1.mif" ] || fail "after $step: the provider database removed"

step="purge"
dpkg_do -P mox
state "" no
for f in /etc/systemd/system/mox.service /var/lib/systemd/deb-systemd-helper-enabled/mox.service.dsh-also \
    /var/lib/dmisp; do [ ! -e "$r$f" ] && [ ! -L "$r$f" ] || fail "after $step: $f left"; done
[ -f "$r/usr/local/ubo/bin/mox.cfg" ] || fail "after $step: the administrator's mox.cfg removed"
finish
INSIDE
