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
# dpkg_do STEP DPKG-ARGUMENTS...
dpkg_do() {
    step=$1 && shift
    in_root dpkg --no-triggers "$@" >"$r/tmp/dpkg.log" 2>&1 || fail "dpkg $*: $(cat "$r/tmp/dpkg.log")"
}
# state STATUS LINK-TARGET CALLS: the package status, the enablement link
# (its target, or nothing at all), the calls of deb-systemd-invoke.
link=/etc/systemd/system/multi-user.target.wants/mox.service unit=/lib/systemd/system/mox.service
state() {
    local got
    got="$(in_root dpkg-query -W -f '${Status} ${Version}' mox 2>/dev/null)|$(readlink "$r$link" || ls "$r$link" 2>/dev/null)"
    got+="|$(cat "$r/tmp/calls" 2>/dev/null)"
    [ "$got" = "$1|$2|$3" ] || fail "after $step: '$got', expected '$1|$2|$3'"
    rm -f "$r/tmp/calls"
}

dpkg_do "install 2.93" -i /tmp/mox_2.93_i386.deb
state "install ok installed 2.93" $unit "start mox.service"
for f in $expected_files; do [ -f "$r$f" ] || fail "after $step: no $f"; done
# What the administrator and the running daemon add.
echo "notificationonly = true" >"$r/usr/local/ubo/bin/mox.cfg"
mkdir -p "$r/var/lib/dmisp" && echo database >"$r/var/lib/dmisp/component-1.mif"

dpkg_do "upgrade to 2.94" -i /tmp/mox_2.94_i386.deb
state "install ok installed 2.94" $unit "restart mox.service"

rm "$r$link"   # systemctl disable mox
dpkg_do "upgrade of a disabled unit" -i /tmp/mox_2.94_i386.deb
state "install ok installed 2.94" "" "restart mox.service"
ln -s $unit "$r$link"   # systemctl enable mox

dpkg_do remove -r mox
state "deinstall ok config-files 2.94" $unit "stop mox.service"
[ "$(readlink "$r/etc/systemd/system/mox.service")" = /dev/null ] || fail "after $step: the unit is not masked"
for f in /usr/local/ubo/bin/mox /lib/systemd/system/mox.service; do [ ! -e "$r$f" ] || fail "after $step: $f left"; done
for f in /usr/local/ubo/bin/mox.cfg /var/lib/dmisp/component-1.mif; do [ -f "$r$f" ] || fail "after $step: $f removed"; done

dpkg_do purge -P mox
state "" "" ""
for f in /etc/systemd/system/mox.service /var/lib/systemd/deb-systemd-helper-enabled/mox.service.dsh-also \
    /var/lib/dmisp; do [ ! -e "$r$f" ] && [ ! -L "$r$f" ] || fail "after $step: $f left"; done
[ -f "$r/usr/local/ubo/bin/mox.cfg" ] || fail "after $step: the administrator's mox.cfg removed"
finish
INSIDE
