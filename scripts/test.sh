#!/usr/bin/env bash
# Installs what is missing, builds both architectures and runs every test.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
scripts/prepare-wine.sh
scripts/build.sh
status=0
for preset in x86 x64; do
    echo "== tests: $preset"
    ctest --preset "$preset" || status=1
done
exit $status
