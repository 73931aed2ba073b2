#!/usr/bin/env bash
# How plzc compress scales from one worker thread to two: the same mixed tree (256 MiB by
# default) is copied twice and compressed in place with -j 1 and with -j 2 in the same run,
# several times with the order alternating; prints the times, throughputs and the ratio.
#
# Usage: Benchmarks/plzcScaling.sh [PLZC [WORKDIR]]
#   PLZC     the plzc binary (default: build/Tools/plzc/plzc of this checkout)
#   WORKDIR  a directory on a volume that holds compressed files (default /dev/shm)
# Environment: CORPUS_MB (default 256), RUNS (default 3), MAKE_CORPUS (a make_corpus.py; by
# default ../shared/bench/make_corpus.py beside this checkout, when it exists; otherwise the
# corpus comes from 'plzc demo --generate-only').
set -euo pipefail

repo=$(cd "$(dirname "$0")/.." && pwd)
plzc=$(realpath "${1:-$repo/build/Tools/plzc/plzc}")
parent=${2:-/dev/shm}
corpus_mb=${CORPUS_MB:-256}
runs=${RUNS:-3}
make_corpus=${MAKE_CORPUS:-$repo/../shared/bench/make_corpus.py}

[ -x "$plzc" ] || { echo "plzcScaling: $plzc is not built" >&2; exit 1; }
"$plzc" volume "$parent" >/dev/null || { "$plzc" volume "$parent" >&2; exit 1; }
work=$(mktemp -d "$parent/plzc-scaling.XXXXXX")
trap 'rm -rf "$work"' EXIT

if [ -f "$make_corpus" ] && command -v python3 >/dev/null; then
  source="make_corpus.py --size-mb $corpus_mb --seed 1"
  python3 "$make_corpus" "$work/corpus" --size-mb "$corpus_mb" --seed 1 >/dev/null
else
  source="plzc demo --generate-only --size-mb $corpus_mb"
  "$plzc" demo --generate-only --size-mb "$corpus_mb" --no-progress "$work" >/dev/null
  mv "$work"/plzc-demo-* "$work/corpus"
fi
bytes=$(find "$work/corpus" -type f -printf '%s\n' | awk '{s += $1} END {print s + 0}')
files=$(find "$work/corpus" -type f | wc -l)

# compress_once JOBS: "wall cpu" seconds of 'plzc compress -j JOBS' on a fresh copy of the
# corpus (cpu: user and system time of the process, all threads).
compress_once() {
  rm -rf "$work/copy"
  cp -a "$work/corpus" "$work/copy"
  local TIMEFORMAT='%R %U %S' times
  times=$( { time "$plzc" compress --no-progress -j "$1" "$work/copy" >/dev/null; } 2>&1 ) || {
    echo "plzcScaling: plzc compress -j $1 failed: $times" >&2
    exit 1
  }
  awk '{printf "%s %.2f", $1, $2 + $3}' <<<"$times"
}

printf 'plzc compress, -j 1 against -j 2\n'
printf 'corpus: %s files, %.1f MiB (%s)\n' "$files" "$(awk -v b="$bytes" 'BEGIN {print b / 1048576}')" "$source"
printf 'machine: %s processors, load average %s\n' "$(nproc)" "$(cut -d' ' -f1-3 /proc/loadavg)"
# Wall seconds and MB/s (10^6 bytes) of each, the CPU seconds of each (all threads), and the
# ratio of the wall times. When other work holds the processors, j2's CPU/wall stays below 2.
printf '%-4s %8s %8s %8s %8s %8s %8s %7s\n' run "j1 s" "j1 MB/s" "j1 cpu" "j2 s" "j2 MB/s" "j2 cpu" ratio
ratios=()
for run in $(seq 1 "$runs"); do
  # Alternate the order so that a change in the machine's load weighs on both sides.
  if [ $((run % 2)) -eq 1 ]; then
    read -r one one_cpu <<<"$(compress_once 1)"
    read -r two two_cpu <<<"$(compress_once 2)"
  else
    read -r two two_cpu <<<"$(compress_once 2)"
    read -r one one_cpu <<<"$(compress_once 1)"
  fi
  ratio=$(awk -v a="$one" -v b="$two" 'BEGIN {printf "%.2f", a / b}')
  ratios+=("$ratio")
  awk -v r="$run" -v a="$one" -v ac="$one_cpu" -v b="$two" -v bc="$two_cpu" -v n="$bytes" -v q="$ratio" \
    'BEGIN {printf "%-4s %8.2f %8.1f %8.2f %8.2f %8.1f %8.2f %7s\n", r, a, n / a / 1e6, ac, b, n / b / 1e6, bc, q}'
done
printf 'load average after: %s\n' "$(cut -d' ' -f1-3 /proc/loadavg)"
"$plzc" info -r "$work/copy" | sed 's/^/last copy: /'
median=$(printf '%s\n' "${ratios[@]}" | sort -n | awk '{v[NR] = $1} END {print (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2}')
printf 'median speed-up of -j 2 over -j 1: %s (target: at least 1.7)\n' "$median"
