#!/usr/bin/env bash
# A private Postfix instance for the alert delivery test: listens on
# 127.0.0.1:PORT, relays for loopback clients, and holds every message in its
# own queue under DIR (nothing is delivered). Runs in the foreground; stop it
# with "postfix -c DIR/etc stop". Needs root and Debian's postfix package.
set -euo pipefail
dir=$1
port=$2
mkdir -p "$dir/etc" "$dir/queue" "$dir/data"
chown postfix "$dir/data"
sed "s/^smtp      inet  n       -       y       -       -       smtpd$/127.0.0.1:$port inet n - n - - smtpd/" \
  /usr/share/postfix/master.cf.dist > "$dir/etc/master.cf"
grep -q "^127.0.0.1:$port inet" "$dir/etc/master.cf"
cat > "$dir/etc/main.cf" <<CONF
compatibility_level = 3.6
queue_directory = $dir/queue
data_directory = $dir/data
mail_owner = postfix
setgid_group = postdrop
inet_interfaces = 127.0.0.1
inet_protocols = ipv4
myhostname = mx.test
mydestination =
alias_maps =
alias_database =
mynetworks = 127.0.0.0/8
smtpd_recipient_restrictions = permit_mynetworks, reject
header_checks = regexp:$dir/etc/hold
maillog_file = /dev/stdout
CONF
echo '/^/ HOLD' > "$dir/etc/hold"
exec /usr/sbin/postfix -c "$dir/etc" start-fg
