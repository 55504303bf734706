#!/usr/bin/env bash
# Creates (or repairs) a Wine prefix in which both 64-bit programs
# (/usr/lib/wine/wine64) and 32-bit programs (/usr/lib/wine/wine) run,
# sharing one 64-bit wineserver.
#
#   make-prefix.sh <prefix-dir> [<x86emu-dir>]
#
# <x86emu-dir> is the directory given to setup.sh; its x86emu.env says how
# 32-bit programs run here (without it, X86EMU_LD_PRELOAD and friends are
# taken from the environment). Run setup.sh first: a prefix created before
# 32-bit programs could run has an empty syswow64, and this script then
# repairs it.
#
# Exit codes: 0 the prefix is ready; 2 32-bit programs cannot run on this
# machine (setup.sh said "unavailable"), nothing done; anything else is an
# error. Idempotent: a prefix that was made ready before is left alone.
#
# To run a program in the prefix afterwards:
#   export WINEPREFIX=<prefix-dir> WINESERVER=$X86EMU_WINESERVER WINEDEBUG=-all
#   export LD_PRELOAD=$X86EMU_LD_PRELOAD      # literal $LIB inside
#   $X86EMU_WINE32 prog32.exe                 # 32-bit programs
#   $X86EMU_WINE64 prog64.exe                 # 64-bit programs
set -euo pipefail

[[ $# -ge 1 && $# -le 2 ]] || { echo "usage: make-prefix.sh <prefix-dir> [<x86emu-dir>]" >&2; exit 64; }
if [[ $# -eq 2 ]]; then
    # shellcheck source=/dev/null
    source "$2/x86emu.env"
fi
mode=${X86EMU_MODE:-native}
wine32=${X86EMU_WINE32:-/usr/lib/wine/wine}
wine64=${X86EMU_WINE64:-/usr/lib/wine/wine64}
wineserver=${X86EMU_WINESERVER:-/usr/lib/wine/wineserver}

log() { echo "x86emu: $*"; }

if [[ $mode == unavailable ]]; then
    log "32-bit programs cannot run here (${X86EMU_REASON:-see setup.sh}); no prefix made"
    exit 2
fi
mkdir -p "$1"
prefix=$(cd "$1" && pwd)

export WINEPREFIX=$prefix WINESERVER=$wineserver WINEDEBUG=-all
export WINEDLLOVERRIDES="mscoree,mshtml="   # no Mono or Gecko installer
export LD_PRELOAD=${X86EMU_LD_PRELOAD:-}
marker=$prefix/.x86emu-ready
wow_kernel32=$prefix/drive_c/windows/syswow64/kernel32.dll

# What a crash does: Wine starts the AeDebug "Debugger" command, or
# "winedbg --auto" when there is no such value. 64-bit processes keep that
# default (winedbg prints a backtrace and the process ends). For 32-bit
# processes (the Wow6432Node view) the value is set empty, so that nothing
# starts: a 32-bit winedbg cannot read an emulated process's memory and
# would wait forever.
key64='Software\Microsoft\Windows NT\CurrentVersion\AeDebug'
key32='Software\Wow6432Node\Microsoft\Windows NT\CurrentVersion\AeDebug'
# Prints the Debugger line of a key as saved in system.reg, where the
# section header doubles each backslash.
saved_debugger() {
    SECT="[${1//\\/\\\\}]" awk '
        index($0, "[") == 1 { in_sect = (index($0, ENVIRON["SECT"]) == 1) }
        in_sect && /^"Debugger"=/ { print }' "$prefix/system.reg" 2>/dev/null || true
}
crash_settings_ok() {
    [[ -z $(saved_debugger "$key64") && $(saved_debugger "$key32") == '"Debugger"=""' ]]
}

if [[ -f $marker && -f $wow_kernel32 ]] && crash_settings_ok; then
    log "prefix $prefix is ready"
    exit 0
fi

# A wineserver that already serves this prefix (a test session) is left
# running; one started here is waited for at the end, so that the registry
# is saved.
read -r dev ino < <(stat -c '%d %i' "$prefix")
id=$(printf 'server-%x-%x' "$dev" "$ino")
server_was_running=0
for s in "${TMPDIR:-/tmp}"/wine-*/"$id"/socket "${TMPDIR:-/tmp}/.wine-$(id -u)/$id/socket"; do
    [[ -S $s ]] && server_was_running=1
done

start=$SECONDS
if [[ ! -f $marker || ! -f $wow_kernel32 ]]; then
    "$wine64" wineboot </dev/null >/dev/null 2>&1
    if [[ ! -f $wow_kernel32 ]]; then
        # Made while 32-bit programs could not run: make wineboot redo the
        # whole set-up, the 32-bit half included.
        log "syswow64 is empty; setting the prefix up again"
        rm -f "$prefix/.update-timestamp"
        "$wine64" wineboot </dev/null >/dev/null 2>&1
    fi
    [[ -f $wow_kernel32 ]] || { echo "make-prefix.sh: $prefix still has no 32-bit system DLLs" >&2; exit 1; }
fi

"$wine64" reg delete "HKLM\\$key64" /v Debugger /f </dev/null >/dev/null 2>&1 || true
for key in "$key64" "$key32"; do
    "$wine64" reg add "HKLM\\$key" /v Auto /t REG_SZ /d 1 /f </dev/null >/dev/null
done
"$wine64" reg add "HKLM\\$key32" /v Debugger /t REG_SZ /d '' /f </dev/null >/dev/null

# Check through the 32-bit loader: it runs, and sees the empty value.
if ! out=$("$wine32" reg query "HKLM\\$key64" /v Debugger </dev/null 2>&1 | tr -d '\r') ||
    ! grep -Eq '^ +Debugger +REG_SZ *$' <<<"$out"; then
    echo "make-prefix.sh: 32-bit 'reg query' in $prefix did not show an empty Debugger:" >&2
    echo "$out" >&2
    exit 1
fi

if [[ $server_was_running == 0 ]]; then
    timeout 60 "$wineserver" -w || true
fi
touch "$marker"
log "prefix $prefix made ready in $((SECONDS - start)) s ($mode)"
