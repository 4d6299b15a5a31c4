#!/usr/bin/env bash
# Builds one configuration and runs its tests.
#   scripts/test.sh [debug|release|asan-ubsan|tsan]   (default: debug)
set -euo pipefail
cd "$(dirname "$0")/.."
preset="${1:-debug}"
bash scripts/install-deps.sh
cmake --preset "$preset" >/dev/null
cmake --build --preset "$preset" -j "$(nproc)"
ctest --preset "$preset" -j "$(nproc)"
