#!/usr/bin/env bash
# The web app in Debian's chromium over the real platform: the bytes of its
# first load against uPlot's alone, the main thread's script time per one-second
# update of the overview with an hour of samples in its charts against uPlot
# drawing the same data alone, and the JS heap over MINUTES of live updates
# against its size after the first minute.
#   bench/webapp_bench.sh [MINUTES]   (10 by default)
# Builds build/release first; kovastatd runs its clock 20 times as fast, so that
# the charts hold an hour after 3 minutes (each update then brings 20 samples a
# series, not one: the update time is an upper bound).
set -euo pipefail
cd "$(dirname "$0")/.."
build=build/release
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" -j "$(nproc)" --target kova-webapid kova_command resourcemonitor \
  usage_module kovastatd kovaperfeventd webapp >/dev/null
source webapp/tests/env.sh "$build"
export KOVA_WWW=$PWD/$build/www
node bench/webapp_bench.mjs "${1:-10}"
