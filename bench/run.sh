#!/usr/bin/env bash
# Builds the x64 tree and runs the benchmarks under wine64 in the build
# tree's Wine prefix. Each figure is printed next to its floor, measured in
# the same run, with their ratio and the target where there is one.
#
#   bench/run.sh                  every figure
#   bench/run.sh exec output      only these cross-process figures
#                                 (exec, output, interrupt, watchdog);
#                                 the in-process ones always run
set -euo pipefail
cd "$(dirname "$0")/.."
root=$PWD
bin=$root/build/x64/bin
wine64=/usr/lib/wine/wine64
wineserver=/usr/lib/wine/wineserver
export WINEPREFIX=$root/build/wineprefix WINESERVER=$wineserver WINEDEBUG=-all WINEDLLOVERRIDES="mscoree,mshtml="

cmake --preset x64 >/dev/null
cmake --build --preset x64 --target repl_xproc_bench repl_inproc_bench >/dev/null

# A session that is already running (tests, other tools) is used and left
# running; one started here is stopped at the end.
mkdir -p "$WINEPREFIX"
if "$wineserver" -p </dev/null >/dev/null 2>&1; then
    trap '"$wineserver" -k || true' EXIT
fi
"$root/cmake/wine-session.sh" start "$WINEPREFIX" "$wine64" "$wineserver"

echo "machine: $(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2- | sed 's/^ *//'), $(nproc) cores;" \
     "$("$wine64" --version 2>/dev/null || echo wine); $(date -u '+%Y-%m-%d %H:%M UTC')"
echo
echo "== in process"
(cd "$bin" && "$wine64" ./repl_inproc_bench.exe)
echo
echo "== across processes"
(cd "$bin" && "$wine64" ./repl_xproc_bench.exe "$@")
