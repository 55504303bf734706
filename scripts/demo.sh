#!/usr/bin/env bash
# Installs what is missing, builds both DLLs and shows what they export.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
scripts/prepare-wine.sh
scripts/build.sh
for arch in x86:i686 x64:x86_64; do
    preset=${arch%%:*} triplet=${arch#*:}
    echo "== build/$preset/bin/ReplServer.dll"
    $triplet-w64-mingw32-objdump -p build/$preset/bin/ReplServer.dll |
        awk '/\[Ordinal\/Name Pointer\] Table/{on=1;print;next} on&&NF{print} on&&!NF{exit}'
done
