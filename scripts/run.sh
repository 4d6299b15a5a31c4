#!/usr/bin/env bash
# Builds the tools and runs the main job: the module loaded into the
# userspace host, a filter on a virtual NIC, and a built-in capture of
# frames pushed through it in both directions. Arguments go to sluice-run
# (try --help).
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh
cmake --preset tools >/dev/null
cmake --build --preset tools -j "$(nproc)" --target sluice-run >/dev/null
exec build/tools/sluice-run "$@"
