#!/usr/bin/env bash
# Checks that 32-bit and 64-bit Windows programs work in a prefix made by
# make-prefix.sh: builds tools/x86emu/probe.cpp for both architectures and
# runs it (COM basics, a type library, threads, exceptions, debug output),
# then a 64-bit program starting a 32-bit one, and a 32-bit crash, which
# must end the process rather than hang it. Prints the start-up time of a
# 32-bit process.
#
#   check.sh <x86emu-dir> <prefix-dir>
#
# Uses a Wine session of its own on the prefix (stopped at the end), so do
# not run it while tests use the same prefix. Exit code 0 when everything
# passed, 2 when 32-bit programs cannot run here, 1 on any failure.
set -euo pipefail

[[ $# -eq 2 ]] || { echo "usage: check.sh <x86emu-dir> <prefix-dir>" >&2; exit 64; }
here=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
emu=$(cd "$1" && pwd)
# shellcheck source=/dev/null
source "$emu/x86emu.env"
if [[ $X86EMU_MODE == unavailable ]]; then
    echo "x86emu: 32-bit programs cannot run here: $X86EMU_REASON"
    exit 2
fi
"$here/make-prefix.sh" "$2" "$emu" >/dev/null
prefix=$(cd "$2" && pwd)

# Build the probe for both architectures (static: no MinGW runtime DLLs).
src=$here/../../tools/x86emu/probe.cpp
mkdir -p "$emu/probe"
for arch in i686 x86_64; do
    exe=$emu/probe/probe-$arch.exe
    if [[ ! -f $exe || $src -nt $exe ]]; then
        "$arch-w64-mingw32-g++-posix" -std=c++17 -O1 -Wall -Wextra -Werror -static \
            -o "$exe" "$src" -lole32 -loleaut32 -luuid
    fi
done

export WINEPREFIX=$prefix WINESERVER=$X86EMU_WINESERVER WINEDEBUG=-all
export WINEDLLOVERRIDES="mscoree,mshtml=" LD_PRELOAD=$X86EMU_LD_PRELOAD
"$WINESERVER" -p
trap '"$WINESERVER" -k 2>/dev/null || true' EXIT
"$X86EMU_WINE64" wineboot </dev/null >/dev/null 2>&1

failed=0
# run <name> <expected exit code | nonzero> <output pattern> <command...>
run() {
    local name=$1 want=$2 pattern=$3 out rc=0
    shift 3
    out=$(cd "$emu/probe" && timeout 120 "$@" 2>&1 | tr -d '\r') || rc=$?
    if { [[ $want == nonzero ]] && ((rc != 0 && rc != 124)); } ||
        { [[ $want != nonzero ]] && ((rc == want)); }; then
        if grep -Eq "$pattern" <<<"$out"; then
            echo "ok: $name"
            return
        fi
    fi
    echo "FAILED: $name (exit code $rc)"
    sed 's/^/    /' <<<"$out"
    failed=1
}
run "64-bit probe" 0 'probe: all [0-9]+ checks ok' "$X86EMU_WINE64" probe-x86_64.exe
run "32-bit probe" 0 'probe: all [0-9]+ checks ok' "$X86EMU_WINE32" probe-i686.exe
run "64-bit program starts a 32-bit one" 0 'probe: 32-bit process' \
    "$X86EMU_WINE64" probe-x86_64.exe --run probe-i686.exe
run "32-bit crash ends the process" nonzero '' "$X86EMU_WINE32" probe-i686.exe --crash

# Start-up time of a 32-bit process in the running session: about 0.4 s
# emulated, 0.05 s native; a minute when the address-space reservation
# falls back to bisecting (the shim is not loaded or does not work).
t0=$(date +%s.%N)
for _ in 1 2 3; do
    (cd "$emu/probe" && timeout 120 "$X86EMU_WINE32" probe-i686.exe --start) || failed=1
done
t1=$(date +%s.%N)
avg=$(awk "BEGIN { printf \"%.2f\", ($t1 - $t0) / 3 }")
echo "x86emu: 32-bit process start-up: $avg s ($X86EMU_MODE)"
if awk "BEGIN { exit !($avg > 10) }"; then
    echo "FAILED: 32-bit start-up takes over 10 s"
    failed=1
fi
exit $failed
