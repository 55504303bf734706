#!/usr/bin/env bash
# Makes 32-bit Windows programs runnable (natively or under user-mode
# emulation) and creates the shared Wine prefix after that, so that its
# 32-bit half is populated. Where 32-bit programs cannot run, the x86 build
# falls back to its static checks.
set -euo pipefail
cd "$(dirname "$0")/.."
mkdir -p build
emu=$PWD/build/x86emu prefix=$PWD/build/wineprefix
if [[ $(id -u) -eq 0 ]] || sudo -n true 2>/dev/null; then
    sudo=""
    [[ $(id -u) -eq 0 ]] || sudo="sudo"
    $sudo scripts/x86emu/setup.sh "$emu" >build/x86emu-setup.log 2>&1 ||
        { cat build/x86emu-setup.log >&2; echo "32-bit setup failed" >&2; exit 1; }
    grep -E '^X86EMU_MODE=' "$emu/x86emu.env" || true
fi
if [[ -f $emu/x86emu.env ]] && ! grep -q '^X86EMU_MODE=.*unavailable' "$emu/x86emu.env"; then
    scripts/x86emu/make-prefix.sh "$prefix" "$emu" >build/wineprefix.log 2>&1 ||
        { cat build/wineprefix.log >&2; echo "Wine prefix creation failed" >&2; exit 1; }
fi
