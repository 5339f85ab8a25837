#!/usr/bin/env bash
# Times the "list" method (a page of 50, no filter) on the real platform, over
# a log of N events in a temporary system root, against the shell pipeline that
# answers the same question from the log's text,
#   LC_ALL=C sort -t$'\t' -k3,3r | head -50
# as users type it (sort on every core) and with sort --parallel=1, in the same
# run. Three orders of the same events: oldest first ("time"), the clock
# stepping back an hour every 10^4 events ("steps"), and shuffled. Each list's
# page is checked against the pipeline's first 50 lines, apart from the order
# of entries of the same second. Prints min/median/max of RUNS runs, the peak
# resident memory of the list, and the ratios of the medians (below 1: faster).
#
#   bench/compare_sort.sh [N]    N events, 1000000 by default; RUNS=3
set -euo pipefail
cd "$(dirname "$0")/.."

lines=${1:-1000000}
runs=${RUNS:-3}
build=${BUILD_DIR:-build/release}

cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" -j "$(nproc)" --target log_bench kova_command >/dev/null
bench="$build/bench/log_bench"
kova="$build/platform/tools/kova"

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

# "min median max" of the numbers on standard input.
spread() { sort -n | awk '{ v[NR] = $1 } END { printf "%s %s %s\n", v[1], v[int((NR + 1) / 2)], v[NR] }'; }

# Milliseconds of one run of the pipeline with sort's extra options "$@"; the
# first 50 lines go to $work/pipeline.txt. sort is cut off by head's early
# exit, so its status is not checked.
pipeline_ms() {
  local start=$EPOCHREALTIME
  { LC_ALL=C sort "$@" -t$'\t' -k3,3r "$work/log.txt" | head -50 >"$work/pipeline.txt"; } || true
  awk -v s="$start" -v e="$EPOCHREALTIME" 'BEGIN { printf "%.1f\n", (e - s) * 1000 }'
}

# Whether the page (time, level, event) is the pipeline's head (the log's
# lines): the same times in the same order, the same entries at every time
# but the last, and entries of the last time that the log holds at that time.
check_page() {
  awk -F'\t' '
    FILENAME == ARGV[1] { page_time[FNR] = $1; page[FNR] = $1 "\t" $2 "\t" $3; n = FNR; next }
    FILENAME == ARGV[2] { head_time[FNR] = $3; head[$3 "\t" $2 "\t" $6]++; m = FNR; next }
    FNR == 1 { last = page_time[n] }
    $3 == last { at_last[$3 "\t" $2 "\t" $6]++ }
    END {
      if (n != 50 || m != 50) { print "page of " n ", pipeline of " m; exit 1 }
      for (i = 1; i <= n; ++i) {
        if (page_time[i] != head_time[i]) { print "time " i ": " page_time[i] " vs " head_time[i]; exit 1 }
        if (page_time[i] != last && !head[page[i]]--) { print "entry " i " not in the head"; exit 1 }
        if (page_time[i] == last && !at_last[page[i]]--) { print "entry " i " not in the log"; exit 1 }
      }
    }' "$work/page.txt" "$work/pipeline.txt" "$work/log.txt"
}

for order in time steps shuffled; do
  root="$work/root-$order"
  mkdir -p "$root/etc" "$root/tmp"
  echo "log_max_records=\"$lines\"" >"$root/etc/kovainfo.conf"
  KOVA_ROOT=$root "$bench" fill "$order" "$lines"
  KOVA_ROOT=$root "$kova" log dump >"$work/log.txt"
  # Both sides start from written-out files in the page cache, with a run each
  # untimed.
  sync
  pipeline_ms >/dev/null
  KOVA_ROOT=$root "$bench" list 1 "$work/page.txt" >/dev/null

  read -r p_min p_med p_max < <(for ((i = 0; i < runs; i++)); do pipeline_ms; done | spread)
  read -r s_min s_med s_max < <(for ((i = 0; i < runs; i++)); do pipeline_ms --parallel=1; done | spread)
  KOVA_ROOT=$root "$bench" list "$runs" "$work/page.txt" >"$work/list.txt"
  read -r l_min l_med l_max < <(awk '$1 == "ms" { print $2 }' "$work/list.txt" | spread)
  peak=$(awk '$1 == "peak_kib" { printf "%.1f", $2 / 1024 }' "$work/list.txt")
  pipeline_ms >/dev/null
  check_page || { echo "$order: the page is not the pipeline's head" >&2; exit 1; }

  awk -v o="$order" -v n="$lines" -v l="$l_min $l_med $l_max" -v p="$p_min $p_med $p_max" \
    -v s="$s_min $s_med $s_max" -v lm="$l_med" -v pm="$p_med" -v sm="$s_med" -v peak="$peak" 'BEGIN {
    printf "%-8s %d events  list %s ms (peak %s MiB)  sort|head %s ms  sort --parallel=1 %s ms\n",
      o, n, l, peak, p, s
    printf "%-8s ratio %.2f against sort|head, %.2f against sort --parallel=1  (page checked)\n",
      o, lm / pm, lm / sm
  }'
  rm -rf "$root"
done
