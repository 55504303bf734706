#!/usr/bin/env bash
# Checks a built ReplServer.dll from the outside: its machine type, that it
# exports exactly the seven KxRepl* entry points (undecorated) and nothing
# else, and that it imports system DLLs only (no mingw runtime DLLs).
set -euo pipefail
objdump=$1 dll=$2 arch=$3
dump=$("$objdump" -p "$dll")
fail() { echo "FAIL: $*" >&2; exit 1; }

case $arch in
    X86)   want_format=pei-i386;     want_magic=010b ;;
    AMD64) want_format=pei-x86-64;   want_magic=020b ;;
    *) fail "unknown architecture $arch" ;;
esac
"$objdump" -f "$dll" | grep -q "file format $want_format" || fail "not $want_format"
grep -q "^Magic[[:space:]]*$want_magic" <<<"$dump" || fail "optional header magic is not $want_magic"

# Exports: the name column of the [Ordinal/Name Pointer] table.
exports=$(awk '/\[Ordinal\/Name Pointer\] Table/{on=1;next} on&&/^[[:space:]]*\[/{print $NF;next} on&&!NF{on=0}' <<<"$dump" | sort)
expected=$(printf '%s\n' KxReplFreeString KxReplGetString KxReplGetUserInput KxReplPrint KxReplQuit KxReplRun KxReplSetResult | sort)
if [[ "$exports" != "$expected" ]]; then
    echo "exports found:"; echo "$exports"
    fail "export table is not exactly the seven KxRepl* functions"
fi

# Imports: only DLLs that ship with Windows.
imports=$(grep -i 'DLL Name:' <<<"$dump" | awk '{print tolower($3)}' | sort -u)
allowed='^(kernel32|user32|ole32|oleaut32|advapi32|msvcrt|ucrtbase|api-ms-win-[a-z0-9-]+|ntdll|rpcrt4|shell32|combase)\.dll$'
while read -r name; do
    [[ -z $name ]] && continue
    [[ $name =~ $allowed ]] || fail "imports non-system DLL $name"
done <<<"$imports"
grep -q '^kernel32.dll$' <<<"$imports" || fail "no kernel32 import: import table not read"
echo "ok: $dll ($want_format) exports the seven entry points and imports: $(tr '\n' ' ' <<<"$imports")"
