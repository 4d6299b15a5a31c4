#!/usr/bin/env bash
# Coverage-guided fuzzing of every target (or the ones named) for a given
# time each, in the fuzz preset (clang, libFuzzer, ASan+UBSan, the module,
# host and tool libraries instrumented). New inputs that add coverage are
# merged into the kept corpus fuzz/corpus/<target>/; a crash stops the
# script with the reproducer's path.
#
#   scripts/fuzz.sh [-t SECONDS] [-j JOBS] [target ...]
#
# Prints per target: executions, executions per second, coverage (edges
# reached of the counters instrumented), features, kept corpus size before
# and after, resident size ten seconds in and at the end, and its peak.
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

# ASan holds freed memory back (256 MB by default) and would hide, or fake,
# growth per input; a small quarantine keeps the resident size meaningful.
export ASAN_OPTIONS="${ASAN_OPTIONS:-quarantine_size_mb=16}"
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
summary=()
for t in "${targets[@]}"; do
  kept="fuzz/corpus/$t"
  mkdir -p "$kept" "$work/$t" "$work/$t.crash"
  log="$work/$t.log"
  before=$(ls "$kept" | wc -l)
  # New inputs go to the scratch directory; the kept corpus is read only.
  # -detect_leaks=0: each target checks after every input that the module
  # heap and the packets are back where they were; the host's bounded
  # quarantines (released packets, destroyed filters) fill during the first
  # inputs, which libFuzzer would take for leaks and rescan the heap after
  # each, at a twentieth of the speed.
  "$build/$t" -max_total_time="$seconds" -rss_limit_mb=2048 -print_final_stats=1 \
      -detect_leaks=0 \
      -artifact_prefix="$work/$t.crash/" "$work/$t" "$kept" >"$log" 2>&1 &
  pid=$!
  # libFuzzer prints the peak resident size; the current one, sampled every
  # two seconds, shows whether the process grows: the first sample taken
  # ten seconds in (the corpus loaded) and the last one.
  started=$SECONDS rss0="" rss1=""
  while kill -0 "$pid" 2>/dev/null; do
    now=$(awk '/^VmRSS/ {print int($2 / 1024)}' "/proc/$pid/status" 2>/dev/null || true)
    if [ -n "$now" ]; then
      rss1="${now}Mb"
      if [ -z "$rss0" ] && [ $((SECONDS - started)) -ge 10 ]; then rss0="$rss1"; fi
    fi
    sleep 2
  done
  if ! wait "$pid"; then
    tail -n 40 "$log"
    mkdir -p fuzz/crashes
    cp "$work/$t.crash/"* fuzz/crashes/ 2>/dev/null || true
    echo "$t: fault; reproducer in fuzz/crashes/" >&2
    exit 1
  fi
  # The kept corpus becomes the smallest set of old and new inputs that
  # reaches every feature either reached.
  mkdir -p "$work/$t.min"
  "$build/$t" -merge=1 "$work/$t.min" "$kept" "$work/$t" >"$work/$t.merge" 2>&1
  rm -f "$kept"/*
  cp "$work/$t.min"/* "$kept"/
  after=$(ls "$kept" | wc -l)
  execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")
  rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$log")
  last=$(grep -E '^#[0-9]+' "$log" | tail -n 1)
  cov=$(sed -n 's/.* cov: \([0-9]*\).*/\1/p' <<<"$last")
  ft=$(sed -n 's/.* ft: \([0-9]*\).*/\1/p' <<<"$last")
  counters=$(sed -n 's/.*Loaded [0-9]* modules *(\([0-9]*\) inline 8-bit counters).*/\1/p' "$log" | head -n 1)
  peak=$(sed -n 's/^stat::peak_rss_mb: *//p' "$log")
  summary+=("$(printf '%-16s %10s execs %7s exec/s  cov %6s of %6s  ft %7s  corpus %4s -> %4s  rss %s -> %s (peak %sMb)' \
    "$t" "$execs" "$rate" "$cov" "$counters" "$ft" "$before" "$after" "$rss0" "$rss1" "$peak")")
  echo "${summary[-1]}"
done
echo "--- ${seconds}s per target"
printf '%s\n' "${summary[@]}"
