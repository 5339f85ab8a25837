#!/usr/bin/env bash
# Runs browser tests of this source tree against the programs of an existing
# build: the page of KOVA_WWW (ctest gives the build's), or else of webapp/www,
# put together first.
#   webapp/tests/run.sh BUILD_DIR [TEST_FILE...]   (default: every *.test.mjs)
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
build=$(cd "${1:?usage: run.sh BUILD_DIR [TEST_FILE...]}" && pwd)
shift
if [ -z "${KOVA_WWW:-}" ]; then
  www=$(mktemp -d)
  chmod 755 "$www"  # the front-end reads it as an unprivileged account
  trap 'rm -rf "$www"' EXIT
  node "$here/../tools/build_www.mjs" "$here/../www" "$here/../../platform/data/texts" "$www/www"
  export KOVA_WWW=$www/www
fi
source "$here/env.sh" "$build"
[ $# -gt 0 ] || set -- "$here"/*.test.mjs
node --test --test-concurrency=1 "$@"
