#!/usr/bin/env bash
# Installs the service "pgsql" into a system root, running PROGRAM as ACCOUNT:
# gives ACCOUNT the folder of the cluster on the volume behind the share link
# /var/services/pgsql (and makes the link, to /volume1/@database/pgsql, when
# there is none) and the log <root>/var/log/kova/pgsql.log, checks as ACCOUNT
# that the program can run there, and only then has ../install-service.sh write
# the description <root>/etc/kova/services/pgsql.conf. The socket folder
# <root>/run/pgsql is the service's runtime folder: the platform makes it for
# ACCOUNT at each start.
#
#   install-service.sh ROOT [--user ACCOUNT] [PROGRAM]
#
# ACCOUNT is "kovapgsql" (scripts/setup makes it) when run as root; anyone else
# installs the service for their own account. PROGRAM is by default
# ROOT/usr/sbin/kova-pgsql, where `cmake --install <build> --prefix ROOT/usr`
# puts it; the script runs it with --check as ACCOUNT.
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
  account=${account:-kovapgsql}
  if [ "$account" = kovapgsql ]; then
    id -u kovapgsql >/dev/null 2>&1 || die "no account kovapgsql: run scripts/setup, which makes it"
  fi
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
if [ -L "$link" ]; then
  # The link names a system path, a relative one from /var/services.
  target=$(readlink "$link")
  [[ $target == /* ]] || target=/var/services/$target
else
  [ ! -e "$link" ] || die "$link is there but no symbolic link"
  target=/volume1/@database/pgsql
fi
folder=$root$(realpath -ms -- "$target")
# A cluster stays with the account that made it: its files are that account's.
if [ -e "$folder/data" ] && [ "$(stat -c %u "$folder/data")" != "$(id -u "$account")" ]; then
  die "the cluster in $folder/data belongs to $(stat -c %U "$folder/data"): install the service for that account (--user), or move the cluster away for a new one to be made for $account"
fi
if [ ! -L "$link" ]; then
  mkdir -p "$root/var/services"
  ln -s "$target" "$link"
fi
# <root>/run holds the runtime folders, which the platform makes at each start.
mkdir -p "$folder" "$root/run" "$root/var/log/kova" || die "can't make the service's folders"
own "$folder" 0700
touch "$root/var/log/kova/pgsql.log" || die "can't make the log $root/var/log/kova/pgsql.log"
own "$root/var/log/kova/pgsql.log" 0640

# The program's own checks, as the account: folders within reach, the socket's
# path short enough, a PostgreSQL server installed.
as_account test -x "$program" ||
  die "the account $account can't run $program: a folder on its way is closed to it"
KOVA_ROOT=$root as_account "$program" --check ||
  die "the service can't run as $account in $root (the reason is above)"

KOVA_SERVICE_PREPARED=pgsql "$(dirname "$0")/../install-service.sh" --user "$account" \
  "$root" pgsql "$program" --log /var/log/kova/pgsql.log
