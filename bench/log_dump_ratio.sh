#!/usr/bin/env bash
# Times the fetch of a performance-event log of N events (`kova log dump`, the
# KOVALogGet1 copy) against cat of the store's segments into a file, in the
# same run, over a temporary system root, and prints min/median/max of RUNS
# runs and the ratio of the medians: how close the fetch is to a plain copy.
#
#   bench/log_dump_ratio.sh [N]    N events, 1000000 by default; RUNS=5
set -euo pipefail
cd "$(dirname "$0")/.."

lines=${1:-1000000}
runs=${RUNS:-5}
build=${BUILD_DIR:-build/release}

cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" -j "$(nproc)" --target log_bench kova_command >/dev/null
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
root="$work/root"
mkdir -p "$root/etc" "$root/tmp"
echo "log_max_records=\"$lines\"" >"$root/etc/kovainfo.conf"
KOVA_ROOT=$root "$build/bench/log_bench" fill time "$lines"

spread() { sort -n | awk '{ v[NR] = $1 } END { printf "%s %s %s\n", v[1], v[int((NR + 1) / 2)], v[NR] }'; }
elapsed_ms() { awk -v s="$1" -v e="$EPOCHREALTIME" 'BEGIN { printf "%.1f\n", (e - s) * 1000 }'; }

read -r d_min d_med d_max < <(for ((i = 0; i < runs; i++)); do
  rm -f "$work/dump.txt"
  start=$EPOCHREALTIME
  KOVA_ROOT=$root "$build/platform/tools/kova" log dump >"$work/dump.txt"
  elapsed_ms "$start"
done | spread)
read -r c_min c_med c_max < <(for ((i = 0; i < runs; i++)); do
  rm -f "$work/copy.txt"
  start=$EPOCHREALTIME
  cat "$root"/var/log/kova/perfevent/*.log >"$work/copy.txt"
  elapsed_ms "$start"
done | spread)
cmp -s "$work/dump.txt" "$work/copy.txt" || { echo "the fetch differs from the segments" >&2; exit 1; }
[ "$(wc -l <"$work/dump.txt")" -eq "$lines" ] || { echo "the fetch lacks lines" >&2; exit 1; }
awk -v n="$lines" -v d="$d_min $d_med $d_max" -v c="$c_min $c_med $c_max" -v dm="$d_med" -v cm="$c_med" \
  'BEGIN { printf "%d events: fetch %s ms, cat %s ms, ratio %.2f\n", n, d, c, dm / cm }'
