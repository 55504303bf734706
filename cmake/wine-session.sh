#!/usr/bin/env bash
# Starts or stops the Wine session that all tests of one run share.
# Keeping one wineserver alive makes each test program start in ~0.1 s
# instead of ~3 s.
set -euo pipefail
action=$1 prefix=$2 wine64=$3 wineserver=$4
export WINEPREFIX=$prefix WINESERVER=$wineserver WINEDEBUG=-all WINEDLLOVERRIDES="mscoree,mshtml="
case $action in
start)
    mkdir -p "$prefix"
    # Fails harmlessly when a session of this prefix is already running.
    "$wineserver" -p </dev/null >/dev/null 2>&1 || true
    # The first start creates the prefix; later ones only start services.
    "$wine64" wineboot </dev/null >/dev/null 2>&1
    # Let a crash end the program instead of waiting for a debugger.
    "$wine64" reg delete 'HKLM\Software\Microsoft\Windows NT\CurrentVersion\AeDebug' /v Debugger /f \
        </dev/null >/dev/null 2>&1 || true
    ;;
stop)
    # Another test run of the same tree still needs the session: leave it.
    others=$(pgrep -x ctest | grep -v -x "$PPID" || true)
    [[ -n $others || ${REPL_WINE_KEEP:-0} == 1 ]] || "$wineserver" -k || true
    ;;
esac
