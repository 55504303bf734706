#!/usr/bin/env bash
# Configures and builds both architectures (x86 first: the x64 tests read
# the 32-bit DLL's type library back). Quiet unless something fails.
set -euo pipefail
cd "$(dirname "$0")/.."
mkdir -p build
for preset in x86 x64; do
    log=build/$preset-build.log
    if ! { cmake --preset "$preset" && cmake --build --preset "$preset"; } >"$log" 2>&1; then
        cat "$log" >&2
        echo "build of $preset failed" >&2
        exit 1
    fi
    echo "built $preset"
done
