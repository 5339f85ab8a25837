# Sourced by the host's load benchmarks: a temporary system root with both
# modules and an administrator, kova-webapid started over it, and wrk runs.
# `build_host [TARGET...]` builds build/release with the host and the targets.
# After `start_host [TARGET...] [-- HOST_OPTION...]` (builds, then starts the
# host with the options), $root, $build, $url, $sid and $host (the monitor's
# pid) are set; everything started is stopped on exit.

build=build/release
root=
host=
collector=
cleanup() {
  for pid in $host $collector; do kill -TERM "$pid" 2>/dev/null && wait "$pid" 2>/dev/null; done
  [ -z "$root" ] || rm -rf "$root"
}
trap cleanup EXIT

build_host() {
  cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
  cmake --build "$build" -j "$(nproc)" --target kova-webapid kova_command resourcemonitor \
    usage_module "$@" >/dev/null
}

start_host() {
  local targets=() options=()
  while [ $# -gt 0 ] && [ "$1" != -- ]; do targets+=("$1"); shift; done
  [ $# -eq 0 ] || { shift; options=("$@"); }
  build_host "${targets[@]}"
  root=$(mktemp -d /tmp/kova_bench.XXXXXX)
  chmod 755 "$root"
  export KOVA_ROOT=$root
  mkdir -p "$root/etc" "$root/tmp" "$root/modules" "$root/usr/share/kova/www"
  chmod 1777 "$root/tmp"
  cp -r platform/data/texts "$root/usr/share/kova/"
  # One small file in the static folder, the cheapest answer the host gives.
  cp webapp/www/favicon.svg "$root/usr/share/kova/www/"
  cp "$build/resourcemonitor/KOVA.ResourceMonitor.so" "$build/usage/KOVA.ResourceMonitor.Usage.so" \
    "$root/modules/"
  printf 'resourcemonitor_realtime_max="30"\nresourcemonitor_history="no"\n' >"$root/etc/kovainfo.conf"
  echo "bench password" | "$build/platform/tools/kova" user add admin --admin

  local args=(--port 0 --modules "$root/modules") port=
  [ "$(id -u)" -ne 0 ] || args+=(--user nobody)
  "$build/host/kova-webapid" "${args[@]}" "${options[@]}" 2>"$root/host.log" &
  host=$!
  for _ in $(seq 100); do
    # The host's log appears once the host has started.
    port=$(sed -n 's|.*listening on http://127.0.0.1:\([0-9]*\)/.*|\1|p' "$root/host.log" 2>/dev/null ||
      true)
    [ -z "$port" ] || break
    sleep 0.1
  done
  [ -n "$port" ] || { cat "$root/host.log" >&2; exit 1; }
  url=http://127.0.0.1:$port/webapi/entry.cgi
  sid=$(curl -s -d 'api=KOVA.API.Auth&version=1&method=login&account=admin&password=bench+password' \
    "$url" | sed -n 's/.*"sid":"\([0-9a-f]*\)".*/\1/p')
  [ -n "$sid" ] || { echo "cannot sign in" >&2; exit 1; }
}

# wrk_start CONNECTIONS SECONDS URL [WRK OPTION...]: runs wrk with latency
# percentiles (two threads for more than one connection) and prints its report.
wrk_start() {
  local connections=$1 seconds=$2 target=$3
  shift 3
  wrk -t $((connections > 1 ? 2 : 1)) -c "$connections" -d "${seconds}s" --latency "$@" "$target"
}

# wrk_header: the heading of the rows wrk_report prints.
wrk_header() {
  printf '%-38s %5s %9s %9s %9s %8s %8s  %s\n' run conns req/s p50 p99 requests errors \
    "errors: socket (connect/read/write/timeout), non-2xx, not a success"
}

# wrk_report NAME CONNECTIONS REPORT: prints wrk's REPORT as one row and leaves
# its figures in $rps, $p50, $p99, $p50_ms, $p99_ms, $requests, $errors and its
# parts $socket_errors (of which $sockets gives each kind), $non_2xx and $failed
# (2xx answers that are not a success, as bench/count_failures.lua counts them;
# 0 without it).
rps=
p50=
p99=
p50_ms=
p99_ms=
requests=
errors=
socket_errors=
sockets=
non_2xx=
failed=
wrk_report() {
  local name=$1 connections=$2 out=$3
  rps=$(awk '/^Requests\/sec:/ {print $2}' <<<"$out")
  p50=$(awk '$1 == "50%" {print $2}' <<<"$out")
  p99=$(awk '$1 == "99%" {print $2}' <<<"$out")
  requests=$(awk '/ requests in / {print $1}' <<<"$out")
  sockets=$(awk '/Socket errors/ {gsub(",", ""); s = $4 "/" $6 "/" $8 "/" $10} END {print s ? s : "0/0/0/0"}' \
    <<<"$out")
  socket_errors=$(awk -F/ '{print $1 + $2 + $3 + $4}' <<<"$sockets")
  non_2xx=$(awk '/Non-2xx/ {n += $NF} END {print n + 0}' <<<"$out")
  failed=$(awk '/^failed answers:/ {n += $3} END {print n + 0}' <<<"$out")
  errors=$((socket_errors + non_2xx + failed))
  p50_ms=$(to_ms "$p50")
  p99_ms=$(to_ms "$p99")
  printf '%-38s %5s %9s %9s %9s %8s %8s  %s (%s), %s, %s\n' "$name" "$connections" "${rps:--}" \
    "${p50:--}" "${p99:--}" "${requests:-0}" "$errors" "$socket_errors" "$sockets" "$non_2xx" "$failed"
}

# to_ms TIME: wrk's "812.00us", "1.20ms" or "2.01s" in milliseconds.
to_ms() {
  awk -v v="$1" 'BEGIN { n = v + 0; if (v ~ /us$/) n /= 1000; else if (v ~ /[^m]s$/) n *= 1000
                         else if (v ~ /m$/) n *= 60000; print n }'
}

# wrk_run NAME CONNECTIONS SECONDS URL [WRK OPTION...]: wrk_start, then wrk_report.
wrk_run() {
  local name=$1 connections=$2 out
  shift 2
  out=$(wrk_start "$connections" "$@")
  wrk_report "$name" "$connections" "$out"
}
