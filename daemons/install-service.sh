#!/usr/bin/env bash
# Installs a daemon of this folder as a platform service into a system root:
# its description <dir>/NAME.conf, written to ROOT/etc/kova/services/NAME.conf
# with the command running PROGRAM with OPTIONs and, with --user, ACCOUNT as the
# account the service runs as.
#
#   install-service.sh [--user ACCOUNT] ROOT NAME [PROGRAM [OPTION...]]
#
# PROGRAM is by default ROOT/usr/sbin/NAME, where `cmake --install <build>
# --prefix ROOT/usr` puts it. For example, a demo whose performance-event rules
# take a tenth of their time:
#   install-service.sh var/demo kovaperfeventd "" --time-scale 0.1
#
# A daemon with an installer of its own (<dir>/install-service.sh) needs more
# than its description: NAME is handed to that installer, with ROOT, --user and
# PROGRAM, and OPTIONs are refused. That installer prepares the service and
# then has this script write the description, with KOVA_SERVICE_PREPARED=NAME.
set -euo pipefail

usage() {
  echo "usage: install-service.sh [--user ACCOUNT] ROOT NAME [PROGRAM [OPTION...]]" >&2
  exit 2
}

die() {
  echo "install-service.sh: $*" >&2
  exit 1
}

case "${1:-}" in -h | --help) usage ;; esac
account=""
if [ "${1:-}" = --user ]; then
  [ $# -ge 2 ] && [ -n "$2" ] || usage
  account=$2
  shift 2
fi
[ $# -ge 2 ] || usage
[ -d "$1" ] || die "$1: no such directory"
root=$(cd "$1" && pwd)
name=$2
shift 2
description=
for candidate in "$(dirname "$0")"/*/"$name.conf"; do
  [ -f "$candidate" ] && description=$candidate
done
[ -n "$description" ] || die "no daemon here is named $name"

own=$(dirname "$description")/install-service.sh
if [ -x "$own" ] && [ "${KOVA_SERVICE_PREPARED:-}" != "$name" ]; then
  [ $# -le 1 ] || die "$name takes no options: its own installer $own sets its command"
  args=("$root")
  [ -z "$account" ] || args+=(--user "$account")
  [ -z "${1:-}" ] || args+=("$1")
  exec "$own" "${args[@]}"
fi

program=${1:-}
[ $# -gt 0 ] && shift
[ -n "$program" ] || program=$root/usr/sbin/$name
[ -x "$program" ] || die "$program: not an executable program"
program=$(cd "$(dirname "$program")" && pwd)/$(basename "$program")
if [ -n "$account" ]; then
  case "$account" in *\"* | *[[:space:]]*) die "$account: an account's name can't hold blanks or quotes" ;; esac
  id -u "$account" >/dev/null 2>&1 || die "no account $account"
fi

# The platform splits the command at blanks, and double quotes group words.
command=""
for word in "$program" "$@"; do
  case "$word" in
    *\"*) die "$word: a word can't hold a double quote" ;;
    *[[:space:]]*) word="\"$word\"" ;;
  esac
  command+="${command:+ }$word"
done

services=$root/etc/kova/services
mkdir -p "$services"
temporary=$(mktemp "$services/.$name.conf.XXXXXX")
trap 'rm -f "$temporary"' EXIT
{
  user_written=false
  while IFS= read -r line; do
    case "$line" in
      command=*) printf 'command="%s"\n' "$command" ;;
      user=*)
        if [ -n "$account" ]; then printf 'user="%s"\n' "$account"; else printf '%s\n' "$line"; fi
        user_written=true
        ;;
      *) printf '%s\n' "$line" ;;
    esac
  done <"$description"
  if [ -n "$account" ] && ! $user_written; then printf 'user="%s"\n' "$account"; fi
} >"$temporary"
chmod 644 "$temporary"
mv "$temporary" "$services/$name.conf"
