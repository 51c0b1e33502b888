#!/usr/bin/env bash
# cmake --install into a DESTDIR lays out exactly the expected files, keeps an
# existing configuration, and the installed daemon runs against the installed
# provider library.
#   install_tree.sh BUILD_DIR SOURCE_DIR
set -uo pipefail
build=$1 source=$2
. "$source/tests/install/common.sh"

stage=$(mktemp -d)
trap 'rm -rf "$stage"' EXIT
# A site's configuration is already there: the installation must not touch it.
mkdir -p "$stage/usr/local/ubo/bin"
printf 'notificationonly = true\n' >"$stage/usr/local/ubo/bin/mox.cfg"

if ! DESTDIR=$stage cmake --install "$build" >"$stage.log" 2>&1; then
    cat "$stage.log"; rm -f "$stage.log"
    fail "cmake --install failed"; finish
fi
rm -f "$stage.log"

[ "$(cat "$stage/usr/local/ubo/bin/mox.cfg")" = "notificationonly = true" ] || fail "mox.cfg was changed"
rm "$stage/usr/local/ubo/bin/mox.cfg"
check_tree "$stage"

# ldd resolves the provider library inside the DESTDIR when the library
# directory is prepended, as the RUNPATH does on the installed system.
lib=$stage/usr/local/ubo/lib
resolved=$(LD_LIBRARY_PATH=$lib ldd "$stage/usr/local/ubo/bin/mox" | sed -n 's/^\s*libdmisp\.so => \(\S*\).*/\1/p')
[ "$resolved" = "$lib/libdmisp.so" ] || fail "ldd resolves libdmisp.so to '$resolved'"
run_disabled "$stage"

# Without the library directory the daemon cannot start: the run above really
# used the installed library (only when no installed copy sits at the RUNPATH).
if [ ! -e /usr/local/ubo/lib/libdmisp.so ]; then
    status=0
    (cd "$stage" && "$stage/usr/local/ubo/bin/mox" >/dev/null 2>&1) || status=$?
    [ "$status" -eq 127 ] || fail "the daemon started without its provider library (status $status)"
fi
finish
