#!/usr/bin/env bash
# mox(8) and dmictl(8) render without a warning; what mox(8) states about
# the marker files, the action codes and their run order agrees with the
# daemon's code, and dmictl(8) describes every command dmictl has.
#   manpage.sh SOURCE_DIR
set -uo pipefail
source=$1
. "$source/tests/install/common.sh"
page=$source/packaging/mox.8

for p in "$page" "$source/packaging/dmictl.8"; do
    warnings=$(LC_ALL=C MANWIDTH=80 man -l --warnings=w "$p" 2>&1 >/dev/null) && [ -z "$warnings" ] ||
        fail "man -l $p failed or warns: $warnings"
done
# One long line per paragraph, no hyphenation, plain ASCII: easy to search.
text=$(LC_ALL=C MANWIDTH=400 MANROFFOPT=-rHY=0 man -l "$page" 2>/dev/null | col -bx) || fail "man -l failed"

for heading in NAME SYNOPSIS DESCRIPTION OPTIONS "MARKER FILES" CONFIGURATION "ACTIONS TABLES" \
    "E-MAIL SETTINGS" SIGNALS "EXIT STATUS" SYSTEMD ENVIRONMENT FILES; do
    grep -qx "$heading" <<<"$text" || fail "no section $heading"
done
for fact in /usr/local/ubo/bin/mox.cfg notificationonly /var/dmi/mifs/backup/mox.mif \
    /var/run/kobLock /dev/kob /dev/obx UXDMIPATH "group 1012" "Group 10" "Group 4" \
    "mox: initialization failed, return code = 0x" "Mox has been disabled." \
    "mount -t msdos /dev/fd0 /mnt/floppy" SIGTERM SIGINT SIGQUIT SIGPWR SIGHUP \
    --version --help --test-email --check --explain actionlog Type=notify READY=1 "journalctl -u mox" "dmictl(8)"; do
    grep -qF -- "$fact" <<<"$text" || fail "does not mention $fact"
done

# Marker files in the order the daemon looks for them.
code_order=$(grep -o '"[./a-z]*\.not"' "$source/src/daemon/startup.cpp" | tr -d '"' | sed 's|^\./||' | tr '\n' ' ')
page_order=$(sed -n '/^MARKER FILES/,/^CONFIGURATION/p' <<<"$text" |
    grep -oE '(\./|/mnt/floppy/)(vornmox|mox)\.not' | sed 's|^\./||' | tr '\n' ' ')
[ "$page_order" = "$code_order" ] || fail "marker order: page '$page_order', daemon '$code_order'"

# Exit-status codes 1, 2 and 3 are explained.
status=$(sed -n '/^EXIT STATUS/,/^ENVIRONMENT/p' <<<"$text")
for code in 1 2 3; do grep -qE "^ +$code +[a-z]" <<<"$status" || fail "exit code 0x$code not explained"; done

# The table of action codes: the daemon's code-to-handler pairs (whose name,
# as --explain shows it, is the handler's), in the daemon's run order.
actions=$source/src/actions/actions.cpp
declare -A handler
while read -r code name; do handler[$code]=$name; done < <(
    sed -n '/^const ActionEntry lscActions\[\]/,/^};/p' "$actions" |
        sed -n 's/.*{\([0-9]*\), \([A-Za-z]*\), .*, "\2"}.*/\1 \2/p')
run_order=$(sed -n '/^const ActionOrder ActionID\[\]/,/^};/p' "$actions" | grep -oE '\{[0-9]+,' | tr -d '{,' | grep -vx 0)
[ "$(wc -w <<<"$run_order")" -eq 15 ] || fail "could not read the daemon's run order"
expected=$(for code in $run_order; do echo "$code ${handler[$code]}"; done)
table=$(sed -n '/^ *Code  *Action/,/operating-system shutdown replaces/p' <<<"$text" | awk '$1 ~ /^[0-9]+$/ { print $1, $2 }')
[ "$table" = "$expected" ] || fail "action table:"$'\n'"$table"$'\n'"daemon:"$'\n'"$expected"
grep -qE '^ +17 +display string' <<<"$text" || fail "attribute 17 not explained"
grep -qE '^ +30 +integer: enable flag' <<<"$text" || fail "attribute 30 not explained"

# Every command of dmictl's usage text has its entry in dmictl(8).
tool=$(LC_ALL=C MANWIDTH=400 man -l "$source/packaging/dmictl.8" 2>/dev/null | col -bx)
commands=$(grep -oE '^ +"  [a-z0-9-]+' "$source/sim/dmisp/control.cpp" | awk '{ print $2 }')
[ "$(wc -w <<<"$commands")" -ge 10 ] || fail "could not read dmictl's commands"
for c in $commands; do grep -qE "^ {7}$c( |$)" <<<"$tool" || fail "dmictl(8) does not describe $c"; done
finish
