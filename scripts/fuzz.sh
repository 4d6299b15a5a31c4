#!/usr/bin/env bash
# Coverage-guided fuzzing of every target (or the ones named) for a given
# time each, in the fuzz preset (clang, libFuzzer, ASan+UBSan, the module,
# host and tool libraries instrumented). New inputs that add coverage are
# merged into the kept corpus fuzz/corpus/<target>/; a crash stops the
# script with the reproducer's path.
#
#   scripts/fuzz.sh [-t SECONDS] [-j JOBS] [target ...]
#
# Prints per target: executions, executions per second, coverage (edges),
# features, corpus entries added, resident size at start and end.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=60
jobs=2
while getopts "t:j:" opt; do
  case "$opt" in
    t) seconds="$OPTARG" ;;
    j) jobs="$OPTARG" ;;
    *) echo "usage: $0 [-t SECONDS] [-j JOBS] [target ...]" >&2; exit 2 ;;
  esac
done
shift $((OPTIND - 1))

bash scripts/install-deps.sh fuzz
cmake --preset fuzz >/dev/null
cmake --build --preset fuzz -j "$jobs"
build=build/fuzz/fuzz
targets=("$@")
if [ ${#targets[@]} -eq 0 ]; then
  for src in fuzz/fuzz_*.cpp; do
    name=$(basename "$src" .cpp)
    [ "$name" = fuzz_support ] || targets+=("$name")
  done
fi

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
summary=()
for t in "${targets[@]}"; do
  kept="fuzz/corpus/$t"
  mkdir -p "$kept" "$work/$t" "$work/$t.crash"
  log="$work/$t.log"
  before=$(ls "$kept" | wc -l)
  # New inputs go to the scratch directory; the kept corpus is read only.
  if ! "$build/$t" -max_total_time="$seconds" -rss_limit_mb=2048 -print_final_stats=1 \
      -artifact_prefix="$work/$t.crash/" "$work/$t" "$kept" >"$log" 2>&1; then
    tail -n 40 "$log"
    mkdir -p fuzz/crashes
    cp "$work/$t.crash/"* fuzz/crashes/ 2>/dev/null || true
    echo "$t: fault; reproducer in fuzz/crashes/" >&2
    exit 1
  fi
  # Keep only what adds coverage to the kept corpus.
  "$build/$t" -merge=1 "$kept" "$work/$t" >"$work/$t.merge" 2>&1
  after=$(ls "$kept" | wc -l)
  execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")
  rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$log")
  last=$(grep -E '^#[0-9]+' "$log" | tail -n 1)
  cov=$(sed -n 's/.* cov: \([0-9]*\).*/\1/p' <<<"$last")
  ft=$(sed -n 's/.* ft: \([0-9]*\).*/\1/p' <<<"$last")
  rss0=$(grep -E '^#[0-9]+.*INITED' "$log" | sed -n 's/.* rss: \([0-9]*Mb\).*/\1/p' | head -n 1)
  rss1=$(sed -n 's/.* rss: \([0-9]*Mb\).*/\1/p' <<<"$last")
  summary+=("$(printf '%-16s %10s execs %7s exec/s  cov %6s  ft %7s  corpus %4s -> %4s  rss %s -> %s' \
    "$t" "$execs" "$rate" "$cov" "$ft" "$before" "$after" "$rss0" "$rss1")")
  echo "${summary[-1]}"
done
echo "--- ${seconds}s per target"
printf '%s\n' "${summary[@]}"
