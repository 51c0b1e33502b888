# Shared by the installation tests: failure reporting and the expected layout.
# Sourced with the build directory in $build and the source tree in $source.

failures=0
fail() { echo "FAIL: $*" >&2; failures=$((failures + 1)); }
finish() {
    [ "$failures" -eq 0 ] || { echo "$failures check(s) failed" >&2; exit 1; }
    echo "all checks passed"
    exit 0
}

# Every regular file an installation holds, and nothing else.
expected_files="\
/lib/systemd/system/mox.service
/usr/local/ubo/bin/dmictl
/usr/local/ubo/bin/mox
/usr/local/ubo/bin/mox.cfg.example
/usr/local/ubo/lib/libdmisp.so
/usr/share/doc/mox/changelog.gz
/usr/share/doc/mox/copyright
/usr/share/lintian/overrides/mox
/usr/share/man/man8/dmictl.8.gz
/usr/share/man/man8/mox.8.gz
/var/dmi/mifs/backup/mox.mif"

# check_tree ROOT: the files of an installation below ROOT (a DESTDIR or an
# unpacked package) are the expected ones, with the expected contents.
check_tree() {
    local root=$1 found
    found=$(cd "$root" && find . -type f -o -type l | sed 's/^\.//' | sort)
    [ "$found" = "$expected_files" ] || fail "files below $root:"$'\n'"$found"$'\n'"expected:"$'\n'"$expected_files"

    local mox=$root/usr/local/ubo/bin/mox prog runpath pair
    case $(file -b "$mox") in "ELF 32-bit LSB "*"executable, Intel 80386"*) ;; *) fail "mox is not i386" ;; esac
    case $(file -b "$root/usr/local/ubo/lib/libdmisp.so") in
        "ELF 32-bit LSB shared object, Intel 80386"*) ;; *) fail "libdmisp.so is not an i386 library" ;; esac
    # The daemon and the tool find the provider library at its installed
    # place, and nowhere in the build tree.
    for prog in "$mox" "$root/usr/local/ubo/bin/dmictl"; do
        [ -x "$prog" ] || fail "$prog is not executable"
        runpath=$(readelf -d "$prog" | sed -n 's/.*(RUNPATH).*\[\(.*\)\]/\1/p')
        [ "$runpath" = /usr/local/ubo/lib ] || fail "RUNPATH of $prog is '$runpath'"
        readelf -d "$prog" | grep 'NEEDED.*\[libdmisp\.so\]' >/dev/null || fail "$prog does not need libdmisp.so"
    done
    # The destinations are the paths compiled into the daemon.
    for pair in /usr/local/ubo/bin/mox.cfg /var/dmi/mifs/backup; do
        strings -n 8 "$mox" | grep -xF "$pair" >/dev/null || fail "the daemon does not use $pair"
    done
    for pair in var/dmi/mifs/backup/mox.mif:mifs/mox.mif lib/systemd/system/mox.service:packaging/mox.service \
        usr/local/ubo/bin/mox.cfg.example:packaging/mox.cfg.example; do
        cmp -s "$root/${pair%%:*}" "$source/${pair#*:}" || fail "${pair%%:*} differs from ${pair#*:}"
    done
    for pair in mox dmictl; do
        gzip -dc "$root/usr/share/man/man8/$pair.8.gz" | cmp -s - "$source/packaging/$pair.8" || fail "$pair.8 differs"
    done
}
