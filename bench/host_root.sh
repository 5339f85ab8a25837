# Sourced by the host's load benchmarks: a temporary system root with both
# modules and an administrator, kova-webapid started over it, and wrk runs.
# After `start_host [TARGET...]` (builds build/release with the targets), $root,
# $build, $url and $sid are set; everything started is stopped on exit.

build=build/release
root=
host=
collector=
cleanup() {
  for pid in $host $collector; do kill -TERM "$pid" 2>/dev/null && wait "$pid" 2>/dev/null; done
  [ -z "$root" ] || rm -rf "$root"
}
trap cleanup EXIT

start_host() {
  cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
  cmake --build "$build" -j "$(nproc)" --target kova-webapid kova_command resourcemonitor \
    usage_module "$@" >/dev/null
  root=$(mktemp -d /tmp/kova_bench.XXXXXX)
  chmod 755 "$root"
  export KOVA_ROOT=$root
  mkdir -p "$root/etc" "$root/tmp" "$root/modules" "$root/usr/share/kova"
  chmod 1777 "$root/tmp"
  cp -r platform/data/texts "$root/usr/share/kova/"
  cp "$build/resourcemonitor/KOVA.ResourceMonitor.so" "$build/usage/KOVA.ResourceMonitor.Usage.so" \
    "$root/modules/"
  printf 'resourcemonitor_realtime_max="30"\nresourcemonitor_history="no"\n' >"$root/etc/kovainfo.conf"
  echo "bench password" | "$build/platform/tools/kova" user add admin --admin

  local args=(--port 0 --modules "$root/modules") port=
  [ "$(id -u)" -ne 0 ] || args+=(--user nobody)
  "$build/host/kova-webapid" "${args[@]}" 2>"$root/host.log" &
  host=$!
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
}

# wrk_run NAME CONNECTIONS SECONDS URL [WRK OPTION...]: prints wrk's figures as
# "NAME req/s p50 p99 errors" and leaves req/s and p50 (ms) in $rps and $p50_ms.
# Errors are wrk's: socket errors and answers other than 2xx.
rps=
p50_ms=
wrk_run() {
  local name=$1 connections=$2 seconds=$3 target=$4 out p50 p99 errors
  shift 4
  out=$(wrk -t $((connections > 1 ? 2 : 1)) -c "$connections" -d "${seconds}s" --latency "$@" "$target")
  rps=$(awk '/^Requests\/sec:/ {print $2}' <<<"$out")
  p50=$(awk '$1 == "50%" {print $2}' <<<"$out")
  p99=$(awk '$1 == "99%" {print $2}' <<<"$out")
  errors=$(awk '/Non-2xx/ {n += $NF} /Socket errors/ {gsub(",", ""); n += $4 + $6 + $8 + $10}
                /^failed answers:/ {n += $3} END {print n + 0}' <<<"$out")
  p50_ms=$(awk -v v="$p50" 'BEGIN {
    n = v + 0; if (v ~ /us$/) n /= 1000; else if (v ~ /[^m]s$/) n *= 1000; print n }')
  printf '%-34s %10s req/s  p50 %-9s p99 %-9s errors %s\n' "$name" "$rps" "$p50" "$p99" "$errors"
}
