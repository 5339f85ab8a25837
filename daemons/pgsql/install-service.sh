#!/usr/bin/env bash
# Installs the service "pgsql" into a system root: its description,
# <root>/etc/kova/services/pgsql.conf, running PROGRAM as ACCOUNT; the folder
# of the cluster on the volume behind the share link /var/services/pgsql (and
# the link, to /volume1/@database/pgsql, when there is none); the socket folder
# <root>/run/pgsql and the log <root>/var/log/kova/pgsql.log. All three belong
# to ACCOUNT, and the script checks that ACCOUNT can reach them.
#
#   install-service.sh ROOT [--user ACCOUNT] [PROGRAM]
#
# ACCOUNT is "postgres" (Debian's postgresql package makes it) when run as
# root; anyone else installs the service for their own account. PROGRAM is by
# default ROOT/usr/sbin/kova-pgsql, where `cmake --install <build> --prefix
# ROOT/usr` puts it; the script runs it with --check as ACCOUNT.
set -euo pipefail

usage() {
  echo "usage: install-service.sh ROOT [--user ACCOUNT] [PROGRAM]" >&2
  exit 2
}

die() {
  echo "install-service.sh: $*" >&2
  exit 1
}

positional=()
account=""
while [ $# -gt 0 ]; do
  case $1 in
    -h | --help) usage ;;
    --user) [ $# -ge 2 ] && [ -n "$2" ] || usage; account=$2; shift 2 ;;
    -*) echo "install-service.sh: unknown option $1" >&2; usage ;;
    *) positional+=("$1"); shift ;;
  esac
done
[ ${#positional[@]} -ge 1 ] && [ ${#positional[@]} -le 2 ] || usage
[ -d "${positional[0]}" ] || die "${positional[0]}: no such directory"
root=$(cd "${positional[0]}" && pwd)
program=${positional[1]:-$root/usr/sbin/kova-pgsql}
[ -x "$program" ] && [ -f "$program" ] || die "$program: not an executable program"
program=$(cd "$(dirname "$program")" && pwd)/$(basename "$program")
case $program in *\"* | *[[:space:]]*) die "$program: the path can't hold blanks or quotes" ;; esac

if [ "$(id -u)" -eq 0 ]; then
  account=${account:-postgres}
else
  account=${account:-$(id -un)}
  [ "$account" = "$(id -un)" ] || die "only root can install the service for another account than $(id -un)"
fi
id -u "$account" >/dev/null 2>&1 || die "no account $account"
[ "$(id -u "$account")" -ne 0 ] || die "PostgreSQL does not run as root: name another account"
group=$(id -gn "$account")

# as_account COMMAND...: runs COMMAND with the ids the service will have.
as_account() {
  if [ "$(id -u)" -eq 0 ]; then
    setpriv --reuid="$account" --regid="$group" --init-groups -- "$@"
  else
    "$@"
  fi
}

# own PATH MODE: gives PATH to the account with MODE.
own() {
  chown "$account:$group" "$1" 2>/dev/null && chmod "$2" "$1" 2>/dev/null ||
    die "can't give $1 to $account with mode $2"
}

link=$root/var/services/pgsql
if [ ! -L "$link" ]; then
  [ ! -e "$link" ] || die "$link is there but no symbolic link"
  mkdir -p "$root/var/services"
  ln -s /volume1/@database/pgsql "$link"
fi
# The link names a system path, a relative one from /var/services.
target=$(readlink "$link")
[[ $target == /* ]] || target=/var/services/$target
folder=$root$(realpath -ms -- "$target")
mkdir -p "$folder" "$root/run/pgsql" "$root/var/log/kova" || die "can't make the service's folders"
own "$folder" 0700
own "$root/run/pgsql" 0750
touch "$root/var/log/kova/pgsql.log" || die "can't make the log $root/var/log/kova/pgsql.log"
own "$root/var/log/kova/pgsql.log" 0640

# The program's own checks, as the account: folders within reach, the socket's
# path short enough, a PostgreSQL server installed.
as_account test -x "$program" ||
  die "the account $account can't run $program: a folder on its way is closed to it"
KOVA_ROOT=$root as_account "$program" --check ||
  die "the service can't run as $account in $root (the reason is above)"

services=$root/etc/kova/services
mkdir -p "$services"
temporary=$(mktemp "$services/.pgsql.conf.XXXXXX")
trap 'rm -f "$temporary"' EXIT
while IFS= read -r line; do
  case "$line" in
    command=*) printf 'command="%s --log /var/log/kova/pgsql.log"\n' "$program" ;;
    user=*) printf 'user="%s"\n' "$account" ;;
    *) printf '%s\n' "$line" ;;
  esac
done <"$(dirname "$0")/pgsql.conf" >"$temporary"
chmod 644 "$temporary"
mv "$temporary" "$services/pgsql.conf"
