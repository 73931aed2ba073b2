#!/usr/bin/env bash
# Fuzzes the library: configures and builds the fuzz build directory (clang, libFuzzer, the
# library instrumented and checked by AddressSanitizer and UndefinedBehaviorSanitizer), writes
# each target's seeds, and runs each target for the time asked, one after the other. Prints a
# table of executions per second and coverage (cov and ft of libFuzzer's final line) per
# target, and exits non-zero when any target found a crash, a leak, a sanitizer report, a
# timeout or a broken invariant.
#
# Usage: Tests/fuzz/run.sh [--cpu] [SECONDS_PER_TARGET] [TARGET...]
#   --cpu               count SECONDS_PER_TARGET in CPU seconds of the target's process, not in
#                       wall seconds (a shared machine then still gives each target its time)
#   SECONDS_PER_TARGET  default 20
#   TARGET              a name such as Decmpfs (or DecmpfsFuzzer); default every target
#
# What each target found is kept in the build directory: the corpus grown
# (fuzz-corpus/<Target>/, reused by later runs), the crashing inputs (fuzz-artifacts/<Target>/)
# and the log (fuzz-logs/<Target>.log). A crashing input, once minimised
# (<Target>Fuzzer -minimize_crash=1 -runs=10000 INPUT), goes to Tests/fuzz/regressions/<Target>/
# with the fix; the ordinary test suite runs every file there.
#
# Environment: PLZC_FUZZ_BUILD_DIR (default build-fuzz), PLZC_FUZZ_JOBS (build jobs, default 2).
set -euo pipefail
cd "$(dirname "$0")/../.."

cpu_time=0
if [ "${1:-}" = --cpu ]; then
  cpu_time=1
  shift
fi
seconds=${1:-20}
if [ $# -gt 0 ]; then shift; fi
if ! [[ $seconds =~ ^[0-9]+$ ]] || [ "$seconds" -lt 1 ]; then
  echo "run.sh: SECONDS_PER_TARGET must be a positive number, not '$seconds'" >&2
  exit 2
fi
build=${PLZC_FUZZ_BUILD_DIR:-build-fuzz}

targets=()
if [ $# -gt 0 ]; then
  for target in "$@"; do targets+=("${target%Fuzzer}"); done
else
  for source in Tests/fuzz/*Fuzzer.cpp; do
    name=$(basename "$source" .cpp)
    targets+=("${name%Fuzzer}")
  done
fi
for target in "${targets[@]}"; do
  if [ ! -f "Tests/fuzz/${target}Fuzzer.cpp" ]; then
    echo "run.sh: no fuzz target '$target' (Tests/fuzz/${target}Fuzzer.cpp)" >&2
    exit 2
  fi
done

for tool in clang clang++; do
  if ! command -v $tool >/dev/null; then
    echo "run.sh: $tool is missing: run Scripts/setup.sh as root" >&2
    exit 2
  fi
done
cmake -S . -B "$build" -G Ninja -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ -DPLZC_FUZZ=ON >/dev/null
cmake --build "$build" -j "${PLZC_FUZZ_JOBS:-2}" --target "${targets[@]/%/Fuzzer}"

scratch=$(mktemp -d /dev/shm/plzc-fuzz-run.XXXXXX)
trap 'rm -rf "$scratch"' EXIT
export PLZC_FUZZ_SCRATCH=$scratch
for symbolizer in /usr/lib/llvm-14/bin/llvm-symbolizer "$(command -v llvm-symbolizer || true)"; do
  if [ -x "$symbolizer" ]; then
    export ASAN_SYMBOLIZER_PATH=$symbolizer
    break
  fi
done
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=0}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}

mkdir -p "$build/fuzz-logs"
rows=()
failed=0
for target in "${targets[@]}"; do
  binary=$build/Tests/fuzz/${target}Fuzzer
  seeds=$build/fuzz-seeds/$target
  corpus=$build/fuzz-corpus/$target
  artifacts=$build/fuzz-artifacts/$target
  regressions=Tests/fuzz/regressions/$target
  log=$build/fuzz-logs/$target.log
  rm -rf "$seeds"
  mkdir -p "$corpus" "$artifacts"
  if ! "$binary" --seeds="$seeds" >"$log" 2>&1; then
    echo "run.sh: $target could not write its seeds; see $log" >&2
    rows+=("$(printf '%-16s %10s %12s %8s %8s %6s  %s' "$target" - - - - - "FAILED: seeds")")
    failed=1
    continue
  fi
  corpora=("$corpus" "$seeds")
  if [ -d "$regressions" ]; then corpora+=("$regressions"); fi
  echo "== $target: ${seconds}s"
  status=0
  # The first directory receives the inputs found; the others are read only. The library's
  # messages about bad inputs are dropped (-close_fd_mask=3); libFuzzer and the sanitizers
  # still write to the log.
  options=(-print_final_stats=1 -close_fd_mask=3 -timeout=30 -rss_limit_mb=2560 -artifact_prefix="$artifacts/")
  if [ $cpu_time -eq 1 ]; then
    # Stopped with SIGINT once its CPU time (user + system, in clock ticks) reaches the budget;
    # libFuzzer then prints its final statistics and exits, which is no failure.
    "$binary" "${options[@]}" "${corpora[@]}" >>"$log" 2>&1 &
    pid=$!
    ticks=$(getconf CLK_TCK)
    while kill -0 $pid 2>/dev/null; do
      used=$(awk '{print $14 + $15}' /proc/$pid/stat 2>/dev/null || echo 0)
      if [ "$used" -ge $((seconds * ticks)) ]; then
        kill -INT $pid 2>/dev/null || true
        break
      fi
      sleep 1
    done
    wait $pid || status=$?
    if [ $status -ne 0 ] && grep -q 'libFuzzer: run interrupted; exiting' "$log"; then status=0; fi
    cpu=$(awk -v t="$used" -v k="$ticks" 'BEGIN {printf "%.0f", t / k}')
  else
    "$binary" -max_total_time="$seconds" "${options[@]}" "${corpora[@]}" >>"$log" 2>&1 || status=$?
    cpu=-
  fi
  runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -1)
  speed=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$log" | tail -1)
  final=$(grep -E '^#[0-9]+[[:space:]]+(DONE|INITED|NEW|REDUCE|pulse)' "$log" | tail -1 || true)
  cov=$(sed -n 's/.* cov: \([0-9]*\).*/\1/p' <<<"$final")
  ft=$(sed -n 's/.* ft: \([0-9]*\).*/\1/p' <<<"$final")
  verdict=ok
  if [ $status -ne 0 ] || grep -qE '^(==[0-9]+==ERROR|SUMMARY: )' "$log"; then
    reason=$(grep -m1 -oE '(ERROR: [A-Za-z]+: [a-z-]+|ERROR: libFuzzer: [a-z -]+|SUMMARY: [^(]*)' "$log" || true)
    verdict="FAILED (exit $status): ${reason:-see log} ($log)"
    failed=1
  fi
  rows+=("$(printf '%-16s %10s %12s %8s %8s %6s  %s' "$target" "${runs:--}" "${speed:--}" "${cov:--}" "${ft:--}" "$cpu" "$verdict")")
done

echo
printf '%-16s %10s %12s %8s %8s %6s  %s\n' target runs execs/s cov ft cpu-s result
for row in "${rows[@]}"; do echo "$row"; done
if [ $failed -ne 0 ]; then
  echo "run.sh: a target failed; crashing inputs are in $build/fuzz-artifacts/<target>/" >&2
  exit 1
fi
