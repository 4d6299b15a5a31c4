#!/usr/bin/env bash
# Builds every tool and runs the main job: the module loaded into the
# userspace host, a filter on a virtual NIC, and a built-in capture of
# frames pushed through it in both directions. Arguments go to sluice-run
# (try --help); the tools are left in build/tools/.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh
echo "configuring (build/tools)..." >&2
cmake --preset tools >/dev/null
echo "building the tools..." >&2
tools=()
for src in tools/*.cpp; do tools+=("$(basename "$src" .cpp)"); done
# Ninja's progress lines go to stderr, so sluice-run's output stays clean.
cmake --build --preset tools -j "$(nproc)" --target "${tools[@]}" >&2
echo "built: ${tools[*]} in build/tools/" >&2
exec build/tools/sluice-run "$@"
