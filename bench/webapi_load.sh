#!/usr/bin/env bash
# Load on kova-webapid with wrk, in one run: "KOVA.ResourceMonitor.Setting"
# `get` with a session (front-end, runner and module) against "KOVA.API.Info"
# `query` (the front-end alone, no sign-in): the host's own ceiling. Prints
# requests per second, p50 and p99 latency of each, and the ratio.
#   bench/webapi_load.sh [SECONDS] [CONNECTIONS]   (30 and 8 by default)
# Builds build/release first; run it on an otherwise idle machine.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-30}
connections=${2:-8}

build=build/release
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" -j "$(nproc)" --target kova-webapid kova_command resourcemonitor >/dev/null

root=$(mktemp -d /tmp/kova_bench.XXXXXX)
chmod 755 "$root"
host=
cleanup() {
  [ -z "$host" ] || { kill -TERM "$host" 2>/dev/null; wait "$host" 2>/dev/null || true; }
  rm -rf "$root"
}
trap cleanup EXIT
export KOVA_ROOT=$root
mkdir -p "$root/etc" "$root/tmp" "$root/modules" "$root/usr/share/kova"
chmod 1777 "$root/tmp"
cp -r platform/data/texts "$root/usr/share/kova/"
cp "$build/resourcemonitor/KOVA.ResourceMonitor.so" "$root/modules/"
printf 'resourcemonitor_realtime_max="30"\nresourcemonitor_history="no"\n' >"$root/etc/kovainfo.conf"
echo "bench password" | "$build/platform/tools/kova" user add admin --admin

args=(--port 0 --modules "$root/modules")
[ "$(id -u)" -ne 0 ] || args+=(--user nobody)
"$build/host/kova-webapid" "${args[@]}" 2>"$root/host.log" &
host=$!
port=
for _ in $(seq 100); do
  port=$(sed -n 's|.*listening on http://127.0.0.1:\([0-9]*\)/.*|\1|p' "$root/host.log")
  [ -z "$port" ] || break
  sleep 0.1
done
[ -n "$port" ] || { cat "$root/host.log" >&2; exit 1; }
url=http://127.0.0.1:$port/webapi/entry.cgi
sid=$(curl -s -d 'api=KOVA.API.Auth&version=1&method=login&account=admin&password=bench+password' \
  "$url" | sed -n 's/.*"sid":"\([0-9a-f]*\)".*/\1/p')
[ -n "$sid" ] || { echo "cannot sign in" >&2; exit 1; }

# run NAME URL: prints wrk's figures as "NAME req/s p50 p99 errors"; leaves req/s in $rps.
rps=
run() {
  local out p50 p99 errors
  out=$(wrk -t 2 -c "$connections" -d "${seconds}s" --latency "$2")
  rps=$(awk '/^Requests\/sec:/ {print $2}' <<<"$out")
  p50=$(awk '$1 == "50%" {print $2}' <<<"$out")
  p99=$(awk '$1 == "99%" {print $2}' <<<"$out")
  errors=$(awk '/Non-2xx/ {n += $NF} /Socket errors/ {gsub(",", ""); n += $4 + $6 + $8 + $10}
                END {print n + 0}' <<<"$out")
  printf '%-32s %10s req/s  p50 %-9s p99 %-9s errors %s\n' "$1" "$rps" "$p50" "$p99" "$errors"
}

echo "wrk: 2 threads, $connections connections, ${seconds} s each"
run KOVA.API.Info/query "$url?api=KOVA.API.Info&version=1&method=query"
ceiling=$rps
run KOVA.ResourceMonitor.Setting/get \
  "$url?api=KOVA.ResourceMonitor.Setting&version=1&method=get&_sid=$sid"
awk -v a="$rps" -v b="$ceiling" 'BEGIN {printf "ratio Setting/get : Info/query = %.2f\n", a / b}'
