#!/usr/bin/env bash
# Runs the side-by-side general-rule benchmark (release preset) into
# bench/results/classbench.json, then draws bench/results/classbench.png
# and prints the table for the README. With a JSON file as argument, only
# draws from it.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh bench
out=bench/results
mkdir -p "$out"
json=${1:-}
if [ -z "$json" ]; then
  cmake --preset release >/dev/null
  cmake --build --preset release -j2 --target classbench_bench
  json=$out/classbench.json
  build/release/bench/classbench_bench --benchmark_min_time=0.5 \
    --benchmark_out="$json" --benchmark_out_format=json
fi
# The Debian interpreter, which has the Debian plotting package.
py=/usr/bin/python3
[ -x "$py" ] || py=python3
"$py" bench/plot.py "$json" "$out/classbench.png"
