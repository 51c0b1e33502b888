#!/usr/bin/env bash
# cpack builds the Debian package; its control fields and contents are checked
# with dpkg-deb, and the unpacked daemon runs against the packaged library.
#   package_deb.sh BUILD_DIR SOURCE_DIR
set -uo pipefail
build=$1 source=$2
. "$source/tests/install/common.sh"

out=$(mktemp -d)
trap 'rm -rf "$out"' EXIT
if ! cpack -G DEB --config "$build/CPackConfig.cmake" -B "$out" >"$out/cpack.log" 2>&1; then
    cat "$out/cpack.log"
    fail "cpack failed"; finish
fi
deb=$out/mox_2.93_i386.deb
[ -f "$deb" ] || { fail "no $deb: $(ls "$out")"; finish; }

field() { dpkg-deb -f "$deb" "$1"; }
[ "$(field Package)" = mox ] || fail "Package: $(field Package)"
[ "$(field Version)" = 2.93 ] || fail "Version: $(field Version)"
[ "$(field Architecture)" = i386 ] || fail "Architecture: $(field Architecture)"
[ "$(field Depends)" = "libc6:i386 (>= 2.36), libstdc++6:i386" ] || fail "Depends: $(field Depends)"
[[ "$(field Maintainer)" =~ ^[^\<]+\ \<[^@]+@[^\>]+\>$ ]] || fail "Maintainer: $(field Maintainer)"
[ -n "$(field Description)" ] || fail "no Description"

# dpkg-deb -c: every path under ./, owned by root, files with sane modes.
listing=$(dpkg-deb -c "$deb")
while read -r mode owner _ _ _ path; do
    [ "$owner" = root/root ] || fail "$path owned by $owner"
    case $path in
        ./usr/local/ubo/bin/mox | ./usr/local/ubo/bin/dmictl)
            [ "$mode" = -rwxr-xr-x ] || fail "$path mode $mode" ;;
        */) [ "$mode" = drwxr-xr-x ] || fail "$path mode $mode" ;;
        *) [ "$mode" = -rw-r--r-- ] || fail "$path mode $mode" ;;
    esac
done <<<"$listing"
listed=$(awk '$1 !~ /^d/ { sub(/^\./, "", $6); print $6 }' <<<"$listing" | sort)
[ "$listed" = "$expected_files" ] || fail "dpkg-deb -c lists:"$'\n'"$listed"

# The maintainer scripts are there and executable.
dpkg-deb -e "$deb" "$out/control"
for script in postinst prerm postrm; do
    [ -x "$out/control/$script" ] || fail "no executable $script"
    sh -n "$out/control/$script" || fail "$script has a syntax error"
done

dpkg-deb -x "$deb" "$out/root"
check_tree "$out/root"
run_disabled "$out/root"
finish
