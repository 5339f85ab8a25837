#!/usr/bin/env bash
# Times the "list" method (a page of 50, no filter) over a synthetic log against
# the shell pipeline that answers the same question from the same text,
#   LC_ALL=C sort -t$'\t' -k3,3r | head -50
# in the same run, and prints the ratio list / pipeline (below 1 is faster).
#
#   bench/compare_sort.sh [lines]    lines: 10000, 100000 or 1000000 (default)
set -euo pipefail
cd "$(dirname "$0")/.."

lines=${1:-1000000}
runs=${RUNS:-5}
build=${BUILD_DIR:-build/release}

cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" -j "$(nproc)" --target log_bench >/dev/null
bench="$build/bench/log_bench"

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
"$bench" --emit "$lines" >"$work/log.txt"

median() { sort -n | awk '{ v[NR] = $1 } END { print v[int((NR + 1) / 2)] }'; }

# sort is cut off by head's early exit, so its status is not checked.
pipeline_ms=$(
  for ((i = 0; i < runs; i++)); do
    start=$EPOCHREALTIME
    { LC_ALL=C sort -t$'\t' -k3,3r "$work/log.txt" | head -50 >/dev/null; } || true
    awk -v s="$start" -v e="$EPOCHREALTIME" 'BEGIN { printf "%.1f\n", (e - s) * 1000 }'
  done | median
)

list_ms=$("$bench" --benchmark_filter="BM_LogList/lines:$lines/keyword:0" \
  --benchmark_repetitions="$runs" --benchmark_format=csv 2>/dev/null |
  awk -F, '/real_time"?,/ && !/_(mean|median|stddev|cv)/ { print $3 }' | median)

awk -v n="$lines" -v l="$list_ms" -v p="$pipeline_ms" 'BEGIN {
  printf "lines %d: list %.1f ms, sort | head %.1f ms, ratio %.2f\n", n, l, p, l / p
}'
