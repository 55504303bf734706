#!/usr/bin/env bash
# Makes 32-bit Windows programs runnable on this machine with Debian's
# wine32, natively where the kernel runs 32-bit x86 programs, otherwise
# under qemu-i386 user-mode emulation registered through binfmt_misc.
#
#   setup.sh [--emulate] [--require] <dir>
#
# <dir>        where the emulation shim is built and the result recorded
#              (for example <build>/x86emu); no spaces or colons, because
#              LD_PRELOAD splits on them
# --emulate    use emulation even where 32-bit programs run natively (to try
#              the emulated set-up on a developer machine)
# --require    exit 2 instead of 0 when 32-bit programs cannot be made to run
#
# Idempotent and quick when everything is in place. Installing and
# registering need root; without it, whatever is already there is used.
#
# Result: <dir>/x86emu.env (shell) and <dir>/x86emu.cmake (CMake) set
#   X86EMU_MODE        native | emulated | unavailable
#   X86EMU_REASON      why, in words
#   X86EMU_WINE32      the 32-bit Wine loader (/usr/lib/wine/wine)
#   X86EMU_WINE64      the 64-bit Wine loader (/usr/lib/wine/wine64)
#   X86EMU_WINESERVER  the one wineserver both loaders share
#   X86EMU_LD_PRELOAD  the LD_PRELOAD value for every Wine process, with a
#                      literal $LIB (empty in native mode)
# and the same lines are printed. The exit code is 0 in all three modes
# (2 for "unavailable" with --require); anything else is an error.
set -euo pipefail

here=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
shim_src=$here/../../tools/x86emu/mmap_shim.c
wine32=/usr/lib/wine/wine
wine64=/usr/lib/wine/wine64
wineserver=/usr/lib/wine/wineserver
binfmt=/proc/sys/fs/binfmt_misc
qemu=/usr/bin/qemu-i386-static
# i386 ELF executables and shared objects (e_machine 3, e_type 2 or 3), as
# in qemu's own binfmt table.
magic='\x7fELF\x01\x01\x01\x00\x00\x00\x00\x00\x00\x00\x00\x00\x02\x00\x03\x00'
mask='\xff\xff\xff\xff\xff\xfe\xfe\x00\xff\xff\xff\xff\xff\xff\xff\xff\xfe\xff\xff\xff'

emulate=0 require=0 dir=
for arg in "$@"; do
    case $arg in
    --emulate) emulate=1 ;;
    --require) require=1 ;;
    -*) echo "setup.sh: unknown option $arg" >&2; exit 64 ;;
    *) dir=$arg ;;
    esac
done
[[ -n $dir ]] || { echo "usage: setup.sh [--emulate] [--require] <dir>" >&2; exit 64; }
mkdir -p "$dir"
dir=$(cd "$dir" && pwd)
if [[ $dir == *[[:space:]:]* ]]; then
    echo "setup.sh: $dir contains a space or a colon, which LD_PRELOAD cannot carry" >&2
    exit 64
fi

log() { echo "x86emu: $*"; }
is_root() { [[ $(id -u) -eq 0 ]]; }

# Writes the result files, prints them, and exits.
finish() {
    local mode=$1 reason=${2//[$'\n\'']/ } preload=
    [[ $mode == emulated ]] && preload="$dir/\$LIB/shim.so"
    cat >"$dir/x86emu.env" <<EOF
X86EMU_MODE=$mode
X86EMU_REASON='$reason'
X86EMU_WINE32=$wine32
X86EMU_WINE64=$wine64
X86EMU_WINESERVER=$wineserver
X86EMU_LD_PRELOAD='$preload'
EOF
    cat >"$dir/x86emu.cmake" <<EOF
set(X86EMU_MODE $mode)
set(X86EMU_REASON [=[$reason]=])
set(X86EMU_WINE32 $wine32)
set(X86EMU_WINE64 $wine64)
set(X86EMU_WINESERVER $wineserver)
set(X86EMU_LD_PRELOAD [=[$preload]=])
EOF
    log "$reason"
    cat "$dir/x86emu.env"
    if [[ $mode == unavailable && $require == 1 ]]; then exit 2; fi
    exit 0
}

# --- a tiny static 32-bit program: prints "i386" and exits with 7 -------
elf=$dir/elf32-check
if [[ ! -x $elf ]]; then
    gcc -m32 -nostdlib -ffreestanding -static -O1 -o "$elf" -x c - <<'EOF'
/* write(1, "i386\n", 5); exit(7); through the 32-bit system call gate */
static const char text[] = "i386\n";
void _start(void)
{
    __asm__ volatile("int $0x80" ::"a"(4), "b"(1), "c"(text), "d"(5) : "memory");
    __asm__ volatile("int $0x80" ::"a"(1), "b"(7));
}
EOF
fi
runs_elf32() { [[ $("$elf" 2>/dev/null; echo $?) == $'i386\n7' ]]; }

# The binfmt_misc entry (any name) that hands i386 ELF to an interpreter.
i386_handler() {
    local f
    [[ -e $binfmt/register ]] || return 1
    for f in "$binfmt"/*; do
        [[ -f $f && $f != */register && $f != */status ]] || continue
        if grep -qx 'enabled' "$f" && grep -qx 'magic 7f454c4601010100000000000000000002000300' "$f"; then
            echo "$f"
            return 0
        fi
    done
    return 1
}

# --- which way 32-bit programs will run ---------------------------------
if handler=$(i386_handler); then
    mode=emulated
    log "i386 programs already go to $(sed -n 's/^interpreter //p' "$handler") ($handler)"
elif [[ $emulate == 0 ]] && runs_elf32; then
    mode=native
    log "this kernel runs 32-bit x86 programs natively; no emulation needed"
else
    mode=emulated
fi

# --- packages (Debian's only) --------------------------------------------
need=(wine32:i386)
[[ $mode == emulated ]] && need+=(qemu-user-static)
missing=()
for p in "${need[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
if ((${#missing[@]})); then
    is_root || finish unavailable "not root, and ${missing[*]} not installed"
    log "installing ${missing[*]}"
    start=$SECONDS
    dpkg --print-foreign-architectures | grep -qx i386 || dpkg --add-architecture i386
    export DEBIAN_FRONTEND=noninteractive
    # An unreachable extra source makes update complain; the install decides.
    apt-get update -q >/dev/null || log "apt-get update reported errors; trying the install anyway"
    # Installing i386 libraries can upgrade their amd64 twins (Multi-Arch:
    # same packages must have one version); --no-remove refuses any removal.
    if ! apt-get install -y -q --no-install-recommends --no-remove "${missing[@]}" >"$dir/apt.log" 2>&1; then
        tail -n 20 "$dir/apt.log" >&2
        finish unavailable "apt-get could not install ${missing[*]} (see $dir/apt.log)"
    fi
    log "installed in $((SECONDS - start)) s"
fi
"$wine64" --version >/dev/null || { echo "setup.sh: $wine64 no longer runs" >&2; exit 1; }

# --- binfmt_misc registration ---------------------------------------------
if [[ $mode == emulated && -z ${handler:-} ]]; then
    is_root || finish unavailable "32-bit programs do not run here, and registering qemu needs root"
    if [[ ! -e $binfmt/register ]]; then
        mount -t binfmt_misc binfmt_misc "$binfmt" 2>/dev/null ||
            finish unavailable "binfmt_misc cannot be mounted"
    fi
    [[ $(cat "$binfmt/status") == enabled ]] || echo 1 >"$binfmt/status"
    if [[ -e $binfmt/qemu-i386 ]]; then
        echo 1 >"$binfmt/qemu-i386"     # registered but switched off
    else
        # F: open the interpreter now, O/C: pass the program open, with its
        # own credentials. echo -e is not needed: the kernel decodes \x.
        echo ":qemu-i386:M::$magic:$mask:$qemu:FOC" >"$binfmt/register" 2>/dev/null ||
            finish unavailable "the kernel refused the binfmt_misc registration"
    fi
    log "registered $qemu for i386 programs"
fi
if ! runs_elf32; then
    finish unavailable "a 32-bit test program still does not run (mode $mode)"
fi

# --- the shim: 32-bit for the 32-bit loader, an empty twin for 64-bit ---
# ld.so expands a literal $LIB in LD_PRELOAD to lib/i386-linux-gnu in
# 32-bit processes and lib/x86_64-linux-gnu in 64-bit ones (Debian's
# multiarch directories), so one value serves both loaders.
so32=$dir/lib/i386-linux-gnu/shim.so
so64=$dir/lib/x86_64-linux-gnu/shim.so
mkdir -p "${so32%/*}" "${so64%/*}"
if [[ ! -f $so32 || $shim_src -nt $so32 ]]; then
    gcc -m32 -O2 -Wall -Wextra -Werror -nostdlib -ffreestanding -fno-stack-protector -fPIC \
        -shared -Wl,-soname,shim.so -o "$so32.tmp" "$shim_src"
    mv "$so32.tmp" "$so32"
fi
if [[ ! -f $so64 ]]; then
    gcc -O2 -nostdlib -shared -Wl,-soname,shim.so -o "$so64.tmp" -x c /dev/null
    mv "$so64.tmp" "$so64"
fi

# --- both loaders start --------------------------------------------------
preload=
[[ $mode == emulated ]] && preload="$dir/\$LIB/shim.so"
for loader in "$wine32" "$wine64"; do
    if ! out=$(LD_PRELOAD=$preload "$loader" --version 2>&1) || [[ $out != wine-* ]]; then
        finish unavailable "$loader --version failed: $out"
    fi
done

if [[ $mode == native ]]; then
    finish native "32-bit programs run natively; run them with $wine32"
fi
finish emulated "32-bit programs run under $qemu; run them with $wine32 and the shim preloaded"
