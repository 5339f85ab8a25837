#!/usr/bin/env bash
# Checks the fleet's Prometheus and Alertmanager files with the tools that read
# them: promtool (Debian's prometheus) and amtool (prometheus-alertmanager).
# Fails when a tool is missing: both are dependencies, installed by
# scripts/setup.
set -euo pipefail
dir=$(cd "$(dirname "$0")" && pwd)

for tool in promtool amtool; do
  if ! command -v "$tool" >/dev/null; then
    echo "check.sh: $tool is missing; scripts/setup installs it" >&2
    exit 1
  fi
done
promtool check config "$dir/prometheus.yml"
promtool check rules "$dir/rules/kova.rules.yml"
promtool test rules "$dir/tests/kova.rules.test.yml"
amtool check-config "$dir/alertmanager.yml"
