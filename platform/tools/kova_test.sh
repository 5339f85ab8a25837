#!/usr/bin/env bash
# The kova command on a temporary system root: each group's work, its help,
# and a clear message with a non-zero exit on failure.
set -uo pipefail
kova=$1
KOVA_ROOT=$(mktemp -d /tmp/kova_cmd.XXXXXX)
export KOVA_ROOT
trap '"$kova" service stop sleeper >/dev/null 2>&1; rm -rf "$KOVA_ROOT"' EXIT
mkdir -p "$KOVA_ROOT/etc/kova/services"
failures=0

# expect CODE OUTPUT-PATTERN COMMAND...: the command exits with CODE and its
# standard output and error match the extended regular expression.
expect() {
  local code=$1 pattern=$2
  shift 2
  local out status
  out=$("$kova" "$@" 2>&1)
  status=$?
  if [ "$status" -ne "$code" ] || ! grep -Eq -- "$pattern" <<<"$out"; then
    echo "FAILED: kova $* -> $status: $out (wanted $code, /$pattern/)"
    failures=$((failures + 1))
  fi
}

expect 0 'usage: kova conf' conf --help
expect 2 'usage: kova conf' conf get
expect 1 'has no key resourcemonitor_history' conf get resourcemonitor_history
expect 0 '^$' conf set resourcemonitor_history yes
expect 0 '^yes$' conf get resourcemonitor_history
expect 1 'cannot set bad key: invalid argument' conf set "bad key" x
expect 0 '^$' conf set --file /etc/other.conf k "two words"
expect 0 '^two words$' conf get --file /etc/other.conf k
expect 2 'unknown option --fast' conf get --fast k

cat >"$KOVA_ROOT/etc/kova/services/sleeper.conf" <<'CONF'
command="/bin/sleep 300"
display_name="Sleeper"
CONF
expect 0 'usage: kova service' service --help
expect 0 '^sleeper	stopped	Sleeper$' service list
expect 3 'sleeper stopped' service status sleeper
expect 0 '^$' service start sleeper
expect 0 'sleeper running' service status sleeper
expect 0 '^$' service stop sleeper
expect 3 'sleeper stopped' service status sleeper
expect 1 'cannot start ghost: no such service is described' service start ghost
printf 'command="/bin/sleep 300"\nuser="kova-no-such-account"\n' \
  >"$KOVA_ROOT/etc/kova/services/orphan.conf"
expect 1 'cannot start orphan: its account kova-no-such-account does not exist' service start orphan
printf 'command="/bin/sleep 300"\nuser="%s"\n' "$(id -un)" >"$KOVA_ROOT/etc/kova/services/linked.conf"
mkdir -p "$KOVA_ROOT/run" && ln -s /tmp "$KOVA_ROOT/run/linked"
expect 1 'cannot start linked: its runtime folder /run/linked is a symbolic link' service start linked
expect 2 'usage: kova service' service restart sleeper

expect 0 'usage: kova log' log --help
expect 0 '^$' log dump
expect 0 '^$' log write --user admin --source perfevent Warning "CPU of smb at 97%"
expect 0 '^$' log write Critical "memory at 99%"
expect 0 '^1	Warning	[0-9]{4}/[0-9]{2}/[0-9]{2} [0-9:]{8}	admin	perfevent	CPU of smb at 97%$' log dump
expect 0 "	$(id -un)	kova	memory at 99%" log dump
expect 1 'cannot write the log record: invalid argument' log write warning x
expect 1 'cannot dump the log: not found' log dump --type 4
expect 2 'usage: kova log' log dump --type x
expect 0 '^$' log clean
expect 0 '^$' log dump

expect 0 'usage: kova lun' lun --help
expect 0 '^$' lun add --size-mb 2048 --location /volume1 lun-1 "Backup LUN"
expect 1 'cannot add lun-1: invalid argument' lun add lun-1 Again
expect 0 '^lun-1	Backup LUN	2048	/volume1$' lun list
expect 0 '^$' lun remove lun-1
expect 1 'cannot remove lun-1: not found' lun remove lun-1
expect 2 "unknown command nothing" nothing

echo "kova command: $(($(grep -c "^expect" "$0") - failures)) passed, $failures failed"
[ "$failures" -eq 0 ]
