# Sourced with a build folder as $1: exports the paths of that build's programs
# that webapp/tests/system.mjs starts.
kova_webapp_here=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
kova_build=$(cd "$1" && pwd)
export KOVA_WEBAPID=$kova_build/host/kova-webapid
export KOVA_TOOL=$kova_build/platform/tools/kova
export KOVASTATD=$kova_build/daemons/statd/kovastatd
export KOVAPERFEVENTD=$kova_build/daemons/perfeventd/kovaperfeventd
export KOVA_MODULES=$kova_build/resourcemonitor/KOVA.ResourceMonitor.so:$kova_build/usage/KOVA.ResourceMonitor.Usage.so
export KOVA_TEXTS=$kova_webapp_here/../../platform/data/texts
export KOVA_INSTALL_SERVICE=$kova_webapp_here/../../daemons/install-service.sh
export KOVA_SCREENSHOTS=${KOVA_SCREENSHOTS:-$kova_build/screenshots}
