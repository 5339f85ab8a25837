#!/usr/bin/env bash
# Load on kova-webapid with wrk, all in one run, over a temporary system root:
#  - "KOVA.ResourceMonitor.Setting" `get` with a session (front-end, runner and
#    module) at 8, 64 and 1,000 connections;
#  - the host's ceiling at 64 connections, the higher of "KOVA.API.Info" `query`
#    (the front-end alone, no sign-in) and GET /favicon.svg (a static file), and
#    the ratio Setting get at 64 connections : ceiling (target at least 0.5);
#  - the resident memory and open descriptors of the monitor, the front-end and
#    the runner, sampled every 5 s during 60 s of Setting get at 64 connections;
#  - Setting get at 8 connections while one client loops "KOVA.ResourceMonitor.Log"
#    `list` (offset 0, limit 50) over a performance-event log of 10^5 records.
# An error is a socket error (a timeout among them: no answer within wrk's 2 s),
# a non-2xx answer or a 2xx answer that is not a success. Speeds are reported,
# not judged; the script exits 1 when a check fails: signing in, the answers
# before the load, the log's answers during it, the host's processes found.
#   bench/webapi_load.sh [SECONDS]   (20 s a run by default; the memory run is 60 s)
# Builds build/release first; run it on an otherwise idle machine.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-20}
[[ $seconds =~ ^[1-9][0-9]*$ ]] || { echo "usage: bench/webapi_load.sh [SECONDS]" >&2; exit 2; }
. bench/host_root.sh
status=0

# 1,000 connections take as many descriptors in wrk and in the host, which
# inherits the limit.
soft=$(ulimit -Sn)
if [ "$soft" != unlimited ] && [ "$soft" -lt 4096 ]; then ulimit -Sn "$(ulimit -Hn)" || true; fi

build_host log_fill
help=$("$build/host/kova-webapid" --help 2>&1 || true)
options=()
# wrk opens every connection from 127.0.0.1: a cap per client address below
# 1,000 would refuse most of them, and these runs measure the host, not the cap.
if grep -q -- --max-per-address <<<"$help"; then options+=(--max-per-address 2000); fi
if grep -q -- --max-connections <<<"$help"; then options+=(--max-connections 4000); fi
start_host log_fill -- "${options[@]}"

base=${url%/webapi/entry.cgi}
info="$url?api=KOVA.API.Info&version=1&method=query"
setting="$url?api=KOVA.ResourceMonitor.Setting&version=1&method=get&_sid=$sid"
log_list="$url?api=KOVA.ResourceMonitor.Log&version=1&method=list&offset=0&limit=50&_sid=$sid"
log_expect='"success":true "total":100000'

# expect NAME URL TEXT...: fails the run unless the answer to URL holds each TEXT.
expect() {
  local name=$1 target=$2 answer text
  shift 2
  answer=$(curl -s "$target" || true)
  for text in "$@"; do
    if [[ $answer != *"$text"* ]]; then
      echo "check failed: $name answered without $text: ${answer:0:300}" >&2
      exit 1
    fi
  done
}

echo "kova-webapid at $base, $(nproc) cores, open files limit $(ulimit -Sn)"
echo "host options: ${options[*]:-none (no cap per client address to raise)}"
expect "Info query" "$info" '"success":true'
expect "Setting get" "$setting" '"success":true'

start=$EPOCHREALTIME
"$build/bench/log_fill" 100000
fill_ms=$(awk -v s="$start" -v e="$EPOCHREALTIME" 'BEGIN { printf "%.0f", (e - s) * 1000 }')
expect "Log list" "$log_list" $log_expect
[ "$(curl -s "$log_list" | grep -o '"level":' | wc -l)" -eq 50 ] ||
  { echo "check failed: Log list did not give a page of 50" >&2; exit 1; }
echo "performance-event log: 10^5 records written in $fill_ms ms (log_fill, one transaction" \
  "per 10,000); Log list answers total 100000 and a page of 50"

# answered NAME: a run that got no answer at all measured nothing.
answered() {
  [ "${requests:-0}" -gt 0 ] || { echo "check failed: no answer in the run \"$1\"" >&2; status=1; }
}

static_status=$(curl -s -o "$root/favicon.out" -w '%{http_code}' "$base/favicon.svg" || true)
if [ "$static_status" = 200 ] && grep -q '<svg' "$root/favicon.out"; then static=yes; else static=; fi

echo
echo "wrk: ${seconds} s a run (the memory run 60 s), 2 threads; requests and errors are counts"
wrk_header
wrk_run "Info query (front-end alone)" 64 "$seconds" "$info" -s bench/count_failures.lua
answered "Info query"
info_rps=$rps
static_rps=
if [ -n "$static" ]; then
  KOVA_EXPECT='<svg' wrk_run "GET /favicon.svg (static file)" 64 "$seconds" "$base/favicon.svg" \
    -s bench/count_failures.lua
  answered "GET /favicon.svg"
  static_rps=$rps
fi
for connections in 8 64 1000; do
  wrk_run "Setting get" "$connections" "$seconds" "$setting" -s bench/count_failures.lua
  answered "Setting get at $connections connections"
  case $connections in
    8) alone_p99=$p99 alone_p99_ms=$p99_ms ;;
    64) setting_rps=$rps ;;
  esac
done

# The monitor is the process started; its first child is the front-end (forked
# at once), the later ones runners; their own children are named by parent.
children() { cat /proc/"$1"/task/*/children 2>/dev/null | tr ' ' '\n' | sed '/^$/d' || true; }
started() { sed 's/.*) //' /proc/"$1"/stat 2>/dev/null | awk '{print $20}' || true; }
host_processes() {
  local child grandchild n=0
  echo "$host monitor"
  for child in $(for c in $(children "$host"); do echo "$(started "$c") $c"; done |
    sort -n -k1,1 -k2,2 | awk '{print $2}'); do
    n=$((n + 1))
    if [ $n -eq 1 ]; then echo "$child front-end"; else echo "$child runner"; fi
    for grandchild in $(children "$child"); do echo "$grandchild child-of-$child"; done
  done
}
# sample PHASE: appends "PHASE ROLE PID VmRSS(KiB) DESCRIPTORS" of each host process.
sample() {
  local pid role rss fds
  while read -r pid role; do
    rss=$(awk '/^VmRSS:/ {print $2}' /proc/"$pid"/status 2>/dev/null || true)
    fds=$(ls /proc/"$pid"/fd 2>/dev/null | wc -l || true)
    [ -z "$rss" ] || echo "$1 $role $pid $rss $fds"
  done < <(host_processes) >>"$root/samples"
}
sample before
wrk_start 64 60 "$setting" -s bench/count_failures.lua >"$root/memory_run.out" &
load=$!
start=$EPOCHREALTIME
# Twelve samples, 1 s after wrk starts (its connections open) and every 5 s on.
for i in $(seq 0 11); do
  sleep "$(awk -v s="$start" -v i="$i" -v now="$EPOCHREALTIME" 'BEGIN {
    d = s + 1 + 5 * i - now; printf "%.3f", (d > 0 ? d : 0) }')"
  sample run
done
wait "$load"
wrk_report "Setting get, 60 s, memory sampled" 64 "$(cat "$root/memory_run.out")"
answered "Setting get, 60 s"
sleep 1
sample after

# One client loops Log list for the whole of the Setting get run, and a second
# longer, so that the run is covered from start to end.
KOVA_EXPECT=$log_expect wrk_start 1 $((seconds + 2)) "$log_list" -s bench/count_failures.lua \
  --timeout 10s >"$root/log_list.out" &
loop=$!
sleep 1
wrk_run "Setting get, Log list looping" 8 "$seconds" "$setting" -s bench/count_failures.lua
answered "Setting get, Log list looping"
loaded_p99=$p99 loaded_p99_ms=$p99_ms
wait "$loop"
wrk_report "Log list, 50 of 10^5 (the loop)" 1 "$(cat "$root/log_list.out")"
if [ "${requests:-0}" -eq 0 ] || [ "$non_2xx" -ne 0 ] || [ "$failed" -ne 0 ]; then
  echo "check failed: the Log list loop had $requests answers, $non_2xx non-2xx and $failed" \
    "without success:true and total 100000" >&2
  status=1
fi

echo
if [ -n "$static" ]; then
  echo "static file GET /favicon.svg: $static_rps req/s"
else
  echo "static file GET /favicon.svg: not served (HTTP $static_status), not measured"
fi
awk -v info="$info_rps" -v file="${static_rps:-0}" -v setting="$setting_rps" 'BEGIN {
  if (file > info) { ceiling = file; which = "GET /favicon.svg" } else { ceiling = info; which = "Info query" }
  printf "ceiling at 64 connections: %s, %.2f req/s\n", which, ceiling
  printf "ratio Setting get : ceiling at 64 connections = %.2f (target at least 0.5)\n",
         (ceiling > 0 ? setting / ceiling : 0)
}'
awk -v a="$alone_p99" -v b="$loaded_p99" -v am="$alone_p99_ms" -v bm="$loaded_p99_ms" 'BEGIN {
  printf "Setting get p99 at 8 connections: %s alone, %s with Log list looping (%.1f times)\n",
         a, b, (am > 0 ? bm / am : 0)
}'

echo
echo "host processes during 60 s of Setting get at 64 connections: \"before\" just before"
echo "the load, the run's samples every 5 s from 1 s in (first, last, max), \"after\" 1 s after"
awk '
  { key = $3; if (!(key in role)) { order[++n] = key; role[key] = $2 }
    if ($1 == "before") { rb[key] = $4; fb[key] = $5 }
    else if ($1 == "after") { ra[key] = $4; fa[key] = $5 }
    else {
      if (!(key in rf)) { rf[key] = $4; ff[key] = $5 }
      rl[key] = $4; fl[key] = $5; count[key]++
      if ($4 > rm[key]) rm[key] = $4
      if ($5 > fm[key]) fm[key] = $5
    } }
  function v(x) { return x == "" ? "-" : x }
  END {
    printf "%-20s %7s %7s  %-38s  %s\n", "", "", "", "VmRSS (KiB)", "open descriptors"
    printf "%-20s %7s %7s  %7s %7s %7s %7s %7s  %6s %6s %6s %6s %6s\n", "process", "pid", "samples",
           "before", "first", "last", "max", "after", "before", "first", "last", "max", "after"
    for (i = 1; i <= n; i++) {
      k = order[i]
      printf "%-20s %7s %7d  %7s %7s %7s %7s %7s  %6s %6s %6s %6s %6s\n", role[k], k, count[k],
             v(rb[k]), v(rf[k]), v(rl[k]), v(rm[k]), v(ra[k]), v(fb[k]), v(ff[k]), v(fl[k]), v(fm[k]), v(fa[k])
    }
  }' "$root/samples"
for role in front-end runner; do
  if ! awk -v r="$role" '$1 == "run" && $2 == r {found = 1} END {exit !found}' "$root/samples"; then
    echo "check failed: no $role among the host's processes" >&2
    status=1
  fi
done
exit "$status"
