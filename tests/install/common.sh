# Shared by the installation tests: failure reporting and the expected layout.
# Sourced with the build directory in $build and the source tree in $source.

failures=0
fail() {
    echo "FAIL: $*" >&2
    failures=$((failures + 1))
}
finish() {
    if [ "$failures" -ne 0 ]; then
        echo "$failures check(s) failed" >&2
        exit 1
    fi
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

    local mox=$root/usr/local/ubo/bin/mox lib=$root/usr/local/ubo/lib/libdmisp.so
    [ -x "$mox" ] || fail "mox is not executable"
    [ -x "$root/usr/local/ubo/bin/dmictl" ] || fail "dmictl is not executable"
    local what
    what=$(file -b "$mox")
    case $what in
        "ELF 32-bit LSB "*"executable, Intel 80386"*) ;;
        *) fail "mox is not an i386 executable: $what" ;;
    esac
    what=$(file -b "$lib")
    case $what in
        "ELF 32-bit LSB shared object, Intel 80386"*) ;;
        *) fail "libdmisp.so is not an i386 shared library: $what" ;;
    esac

    # The daemon and the tool find the provider library at its installed
    # place, and nowhere in the build tree.
    local prog runpath
    for prog in "$mox" "$root/usr/local/ubo/bin/dmictl"; do
        runpath=$(readelf -d "$prog" | sed -n 's/.*(RUNPATH).*\[\(.*\)\]/\1/p')
        [ "$runpath" = /usr/local/ubo/lib ] || fail "RUNPATH of $prog is '$runpath'"
        readelf -d "$prog" | grep 'NEEDED.*\[libdmisp\.so\]' >/dev/null || fail "$prog does not need libdmisp.so"
    done

    # The destinations are the paths compiled into the daemon.
    local path
    for path in /usr/local/ubo/bin/mox.cfg /var/dmi/mifs/backup; do
        strings -n 8 "$mox" | grep -xF "$path" >/dev/null || fail "the daemon does not use $path"
    done

    cmp -s "$root/var/dmi/mifs/backup/mox.mif" "$source/mifs/mox.mif" || fail "mox.mif differs from the source"
    cmp -s "$root/lib/systemd/system/mox.service" "$source/packaging/mox.service" || fail "unit differs"
    cmp -s "$root/usr/local/ubo/bin/mox.cfg.example" "$source/packaging/mox.cfg.example" || fail "sample differs"
    local page
    for page in mox dmictl; do
        gzip -dc "$root/usr/share/man/man8/$page.8.gz" | cmp -s - "$source/packaging/$page.8" || fail "$page.8 differs"
    done
}
