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
. bench/host_root.sh
start_host

echo "wrk: $connections connections, ${seconds} s each"
wrk_run KOVA.API.Info/query "$connections" "$seconds" "$url?api=KOVA.API.Info&version=1&method=query"
ceiling=$rps
wrk_run KOVA.ResourceMonitor.Setting/get "$connections" "$seconds" \
  "$url?api=KOVA.ResourceMonitor.Setting&version=1&method=get&_sid=$sid"
awk -v a="$rps" -v b="$ceiling" 'BEGIN {printf "ratio Setting/get : Info/query = %.2f\n", a / b}'
