#!/usr/bin/env bash
# The module exports its two tables and their two getters and nothing else, and
# links no platform library: the process that loads it provides the platform.
set -euo pipefail
module=$1

exported=$(nm -D --defined-only "$module" | awk '{print $3}' | LC_ALL=C sort | xargs)
expected="GetAPICheckTable GetAPITable gCheckTable gTable"
if [ "$exported" != "$expected" ]; then
  echo "exported: $exported"
  echo "expected: $expected"
  exit 1
fi

if readelf -d "$module" | grep NEEDED | grep -i kova; then
  echo "the module links a platform library"
  exit 1
fi
echo "exports and dependencies as expected"
