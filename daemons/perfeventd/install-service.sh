#!/usr/bin/env bash
# Installs the service "kovaperfeventd" into a system root: its description,
# <root>/etc/kova/services/kovaperfeventd.conf, running PROGRAM with OPTIONs.
#
#   install-service.sh ROOT [PROGRAM [OPTION...]]
#
# PROGRAM is by default ROOT/usr/sbin/kovaperfeventd, where
# `cmake --install <build> --prefix ROOT/usr` puts it. For example, a demo
# whose rules take a tenth of their time:
#   install-service.sh var/demo "" --time-scale 0.1
set -euo pipefail

usage() {
  echo "usage: install-service.sh ROOT [PROGRAM [OPTION...]]" >&2
  exit 2
}
[ $# -ge 1 ] || usage
case "${1:-}" in -h | --help) usage ;; esac
[ -d "$1" ] || { echo "install-service.sh: $1: no such directory" >&2; exit 1; }
root=$(cd "$1" && pwd)
shift
program=${1:-}
[ $# -gt 0 ] && shift
[ -n "$program" ] || program=$root/usr/sbin/kovaperfeventd
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
temporary=$(mktemp "$services/.kovaperfeventd.conf.XXXXXX")
trap 'rm -f "$temporary"' EXIT
while IFS= read -r line; do
  case "$line" in
    command=*) printf 'command="%s"\n' "$command" ;;
    *) printf '%s\n' "$line" ;;
  esac
done <"$(dirname "$0")/kovaperfeventd.conf" >"$temporary"
chmod 644 "$temporary"
mv "$temporary" "$services/kovaperfeventd.conf"
