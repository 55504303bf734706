#!/usr/bin/env bash
# Installs what is missing, builds both architectures, and runs a short
# scripted session: the reference console client drives the test host (a
# stand-in for python.exe) with ReplServer.dll under Wine, then shows the
# host's log.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
scripts/prepare-wine.sh
scripts/build.sh

export WINEPREFIX=$PWD/build/wineprefix WINESERVER=/usr/lib/wine/wineserver WINEDEBUG=-all
export WINEDLLOVERRIDES="mscoree,mshtml="
top=$PWD
cmake/wine-session.sh start "$WINEPREFIX" /usr/lib/wine/wine64 "$WINESERVER"
trap '"$top/cmake/wine-session.sh" stop "$WINEPREFIX" /usr/lib/wine/wine64 "$WINESERVER"' EXIT
cd build/x64/bin
echo "== demo session (client: replconsole.exe, host: repl_testhost.exe + ReplServer.dll)"
/usr/lib/wine/wine64 ./replconsole.exe --no-color --log --script "Z:$top/tools/console/demo.txt" 2>&1 | tr -d '\r'
