#!/usr/bin/env bash
# Installs a daemon of this folder as a platform service into a system root:
# its description <dir>/NAME.conf, written to ROOT/etc/kova/services/NAME.conf
# with the command running PROGRAM with OPTIONs.
#
#   install-service.sh ROOT NAME [PROGRAM [OPTION...]]
#
# PROGRAM is by default ROOT/usr/sbin/NAME, where `cmake --install <build>
# --prefix ROOT/usr` puts it. For example, a demo whose performance-event rules
# take a tenth of their time:
#   install-service.sh var/demo kovaperfeventd "" --time-scale 0.1
set -euo pipefail

usage() {
  echo "usage: install-service.sh ROOT NAME [PROGRAM [OPTION...]]" >&2
  exit 2
}
[ $# -ge 2 ] || usage
case "${1:-}" in -h | --help) usage ;; esac
[ -d "$1" ] || { echo "install-service.sh: $1: no such directory" >&2; exit 1; }
root=$(cd "$1" && pwd)
name=$2
shift 2
description=
for candidate in "$(dirname "$0")"/*/"$name.conf"; do
  [ -f "$candidate" ] && description=$candidate
done
[ -n "$description" ] || { echo "install-service.sh: no daemon here is named $name" >&2; exit 1; }
# A service with an installer of its own needs more than its description.
if [ -x "$(dirname "$description")/install-service.sh" ]; then
  echo "install-service.sh: $name has its own: $(dirname "$description")/install-service.sh" >&2
  exit 1
fi
program=${1:-}
[ $# -gt 0 ] && shift
[ -n "$program" ] || program=$root/usr/sbin/$name
[ -x "$program" ] || { echo "install-service.sh: $program: not an executable program" >&2; exit 1; }
program=$(cd "$(dirname "$program")" && pwd)/$(basename "$program")

# The platform splits the command at blanks, and double quotes group words.
command=""
for word in "$program" "$@"; do
  case "$word" in
    *\"*) echo "install-service.sh: $word: a word can't hold a double quote" >&2; exit 1 ;;
    *[[:space:]]*) word="\"$word\"" ;;
  esac
  command+="${command:+ }$word"
done

services=$root/etc/kova/services
mkdir -p "$services"
temporary=$(mktemp "$services/.$name.conf.XXXXXX")
trap 'rm -f "$temporary"' EXIT
while IFS= read -r line; do
  case "$line" in
    command=*) printf 'command="%s"\n' "$command" ;;
    *) printf '%s\n' "$line" ;;
  esac
done <"$description" >"$temporary"
chmod 644 "$temporary"
mv "$temporary" "$services/$name.conf"
