#!/usr/bin/env bash
# Runs the log dump benchmark and prints the time of KOVALogGet1 as a ratio of
# the sqlite3 shell's time for the same table, measured in the same run.
# Usage: bench/log_dump_ratio.sh [BUILD_DIR]   (a Release build; build/release
# by default, configured and built when missing)
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build/release}
if [ ! -x "$build/bench/log_dump_bench" ]; then
  cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
  cmake --build "$build" -j 2 --target log_dump_bench >/dev/null
fi
"$build/bench/log_dump_bench" --benchmark_format=csv 2>/dev/null | awk -F, '
  /^"BM_/ && $9 == "true" { print "benchmark failed: " $1 " " $10; failed = 1 }
  /^"BM_KOVALogGet1/ { kova = $3 }
  /^"BM_Sqlite3Shell/ { shell = $3 }
  END {
    if (failed || kova <= 0 || shell <= 0) { print "benchmark failed"; exit 1 }
    printf "KOVALogGet1 %.0f ms, sqlite3 shell %.0f ms, ratio %.2f (target <= 1.0)\n",
           kova, shell, kova / shell
  }'
