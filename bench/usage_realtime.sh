#!/usr/bin/env bash
# One "KOVA.ResourceMonitor.Usage" `realtime` answer of 20 series x 60 s, through
# kova-webapid, the module and kovastatd over this machine's /proc, one request
# at a time (target: p50 under 5 ms), against "KOVA.ResourceMonitor.Setting"
# `get`, the same path through the host's runner and a module without the
# collector, in the same run. Prints requests per second, p50 and p99 of each,
# and the ratio of the p50s; an answer that is not a success is an error.
#   bench/usage_realtime.sh [SECONDS]   (30 by default)
# Builds build/release first; it waits a minute for the collector's samples.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-30}
. bench/host_root.sh
start_host kovastatd

"$build/daemons/statd/kovastatd" --database "host=$root/nowhere dbname=none" 2>"$root/statd.log" &
collector=$!
catalog=
for _ in $(seq 100); do
  catalog=$(curl -s "$url?api=KOVA.ResourceMonitor.Usage&version=1&method=catalog&_sid=$sid")
  [ "$(grep -o '"id":' <<<"$catalog" | wc -l)" -ge 20 ] && break
  sleep 0.1
done
# The first 20 series of the catalog, as a JSON array.
series=$(grep -o '"id":"[^"]*"' <<<"$catalog" | awk 'NR <= 20' | sed 's/"id"://' | paste -sd, -)
[ "$(tr ',' '\n' <<<"$series" | wc -l)" -eq 20 ] || { echo "fewer than 20 series: $catalog" >&2; exit 1; }
echo "waiting 61 s for a minute of samples"
sleep 61
path="/webapi/entry.cgi?api=KOVA.ResourceMonitor.Usage&version=1&method=realtime&_sid=$sid"
path+="&series=$(printf '[%s]' "$series" | sed 's/"/%22/g; s/,/%2C/g; s/\[/%5B/g; s/\]/%5D/g')"
answer=$(curl -s "${url%/webapi/entry.cgi}$path&since=$(($(date +%s) - 60))")
samples=$(grep -o '"times":\[[^]]*\]' <<<"$answer" | awk 'NR == 1' | tr ',' '\n' | wc -l)
[ "$(grep -o '"times":' <<<"$answer" | wc -l)" -eq 20 ] && [ "$samples" -ge 59 ] &&
  [ "$samples" -le 61 ] || { echo "unexpected answer: ${answer:0:300}" >&2; exit 1; }
echo "an answer holds 20 series of $samples samples ($(wc -c <<<"$answer") bytes)"

echo "wrk: 1 connection, ${seconds} s each"
wrk_header
wrk_run KOVA.ResourceMonitor.Setting/get 1 "$seconds" \
  "$url?api=KOVA.ResourceMonitor.Setting&version=1&method=get&_sid=$sid" -s bench/count_failures.lua
baseline=$p50_ms
# Each request asks for the last 60 s.
KOVA_SINCE=60 wrk_run "KOVA.ResourceMonitor.Usage/realtime" 1 "$seconds" \
  "${url%/webapi/entry.cgi}$path" -s bench/count_failures.lua
awk -v a="$p50_ms" -v b="$baseline" \
  'BEGIN {printf "p50 Usage/realtime %.2f ms (target under 5 ms) : Setting/get %.2f ms = %.2f\n", a, b, a / b}'
