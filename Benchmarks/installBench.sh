#!/usr/bin/env bash
# plzc install and plzc compress against what a user would pick instead, on one corpus in one
# run: the seeded 256 MiB mixed tree of make_corpus.py (seed 1) on /dev/shm is installed with
# plzc install and compressed in place with plzc compress -j 2 (a copy), once with each engine
# (libdeflate, the default; isal through --fast; zlib, the reference), packed with mksquashfs
# (gzip level 5, 64 KiB blocks, 2 processors), and its 64 KiB chunks deflated at level 5 and
# inflated back by raw zlib on one and two threads (the ceiling for zlib-format chunks); the
# default engine's tree is read back whole, by plzc cat (processes included) and by catFile on
# every file in one process (Benchmarks/catTreeBench, after a warm-up pass as zlib's figures
# have), each timed against raw zlib inflate on one thread. All of it
# is done in rounds (3 by default); each figure is the median of its rounds, each ratio the
# median of the rounds' own ratios. In the first round every tree compressed in place is read
# back with plzc cat by every engine, and by zlib's inflate alone (Benchmarks/zlibReadBack),
# and compared with the corpus. Prints one table of throughput (MB = 10^6 bytes of logical data
# per second) and stored/logical ratio, with the ratios to mksquashfs and to the 2-thread
# ceiling, then each round's ratios.
#
# Usage: Benchmarks/installBench.sh [--bench-dir DIR] [--plzc PLZC] [--work DIR] [--rounds N]
#   --bench-dir  the peers' tools (make_corpus.py, zlib_ceiling.c); default ../shared/bench
#                beside this checkout, or $BENCH_DIR
#   --plzc       the plzc binary (default: build/Tools/plzc/plzc of this checkout)
#   --work       where corpus and outputs go (default /dev/shm; must hold compressed files)
#   --rounds     how many times every figure is taken (default 3)
# Not part of CI. Installs squashfs-tools when mksquashfs is missing (as root).
set -euo pipefail

repo=$(cd "$(dirname "$0")/.." && pwd)
bench=${BENCH_DIR:-$repo/../shared/bench}
plzc=$repo/build/Tools/plzc/plzc
parent=/dev/shm
rounds=3
while [ $# -gt 0 ]; do
  case "$1" in
    --rounds) rounds=$2; shift 2 ;;
    --bench-dir) bench=$2; shift 2 ;;
    --plzc) plzc=$2; shift 2 ;;
    --work) parent=$2; shift 2 ;;
    -h|--help) sed -n '2,/^set -e/p' "$0" | sed '$d; s/^# \{0,1\}//'; exit 0 ;;
    *) echo "installBench: unknown argument '$1' (see --help)" >&2; exit 2 ;;
  esac
done
[[ "$rounds" =~ ^[1-9][0-9]*$ ]] || { echo "installBench: --rounds takes a positive number, not '$rounds'" >&2; exit 2; }
for f in make_corpus.py zlib_ceiling.c; do
  [ -f "$bench/$f" ] || { echo "installBench: no $f in $bench (give --bench-dir)" >&2; exit 1; }
done
[ -x "$plzc" ] || { echo "installBench: $plzc is not built (cmake --build build --target plzc)" >&2; exit 1; }
zlibReadBack=$(dirname "$plzc")/../../Benchmarks/zlibReadBack
catTreeBench=$(dirname "$plzc")/../../Benchmarks/catTreeBench
for tool in "$zlibReadBack" "$catTreeBench"; do
  [ -x "$tool" ] || { echo "installBench: $tool is not built (cmake --build build)" >&2; exit 1; }
done
"$plzc" volume "$parent" >/dev/null || { "$plzc" volume "$parent" >&2; exit 1; }
if ! command -v mksquashfs >/dev/null; then
  [ "$(id -u)" -eq 0 ] || { echo "installBench: mksquashfs is missing; install squashfs-tools" >&2; exit 1; }
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends squashfs-tools >/dev/null
fi

work=$(mktemp -d "$parent/plzc-install-bench.XXXXXX")
trap 'rm -rf "$work"' EXIT
corpus=$work/corpus
python3 "$bench/make_corpus.py" "$corpus" --size-mb 256 --seed 1 >/dev/null
gcc -O2 -o "$work/zlib_ceiling" "$bench/zlib_ceiling.c" -lz -lpthread
bytes=$(find "$corpus" -type f -printf '%s\n' | awk '{s += $1} END {print s + 0}')
files=$(find "$corpus" -type f | wc -l)

# seconds COMMAND...: wall seconds of one run; the command's output goes to $work/last.log.
seconds() {
  local start end
  start=$(date +%s.%N)
  "$@" >"$work/last.log" 2>&1 || { echo "installBench: failed: $*" >&2; cat "$work/last.log" >&2; exit 1; }
  end=$(date +%s.%N)
  awk -v a="$start" -v b="$end" 'BEGIN {printf "%.3f", b - a}'
}
# stored TREE: the bytes its files take as plzc counts them (attributes of compressed files,
# data of plain ones).
stored() { "$plzc" info -r "$1" | awk '$1 == "stored" {print $2}'; }

sync
# The corpus's files in one order, and the digest of their bytes end to end, for the
# read-back checks.
(cd "$corpus" && find . -type f -print0 | sort -z) >"$work/files"
expected=$(cd "$corpus" && xargs -0 cat <"$work/files" | sha256sum)
# readBack TREE: every engine reads every file of TREE, in the same order; each must give the
# corpus's bytes.
readBack() {
  local reader got
  for reader in libdeflate isal zlib; do
    got=$(cd "$1" && xargs -0 "$plzc" cat --engine "$reader" <"$work/files" | sha256sum)
    if [ "$got" != "$expected" ]; then
      echo "installBench: $1 read back by $reader differs from the corpus" >&2
      exit 1
    fi
  done
  # And by zlib's inflate alone, without the library's reading code.
  "$zlibReadBack" "$corpus" "$1" >"$work/zlib-readback.txt" || { cat "$work/zlib-readback.txt" >&2; exit 1; }
}

engines=(libdeflate isal zlib)
line=$(xargs --show-limits </dev/null 2>&1 | awk -F: '/actually use/ {print $2 + 0; exit}')
results=$work/results.tsv  # round, figure, seconds, stored bytes
: >"$results"
record() { printf '%s\t%s\t%s\t%s\n' "$round" "$1" "$2" "$3" >>"$results"; }
# Every figure is taken once per round, the rounds one after the other: a slow moment of this
# shared machine then slows one round, not one figure, and each round's ratios compare figures
# measured minutes apart at most. The read-back checks are made in the first round.
for round in $(seq "$rounds"); do
  for engine in "${engines[@]}"; do
    choice=(--engine "$engine")
    if [ "$engine" = isal ]; then choice=(--fast); fi
    s=$(seconds "$plzc" install --no-progress "${choice[@]}" -j 2 "$corpus" "$work/installed")
    record "install $engine" "$s" "$(stored "$work/installed")"
    rm -rf "$work/installed"

    cp -a "$corpus" "$work/copy"
    sync
    s=$(seconds "$plzc" compress --no-progress "${choice[@]}" -j 2 "$work/copy")
    record "compress $engine" "$s" "$(stored "$work/copy")"
    if [ "$round" = 1 ]; then readBack "$work/copy"; fi
    # The default engine's tree is kept for the timed plzc cat below.
    if [ "$engine" = libdeflate ]; then mv "$work/copy" "$work/catTree"; else rm -rf "$work/copy"; fi
  done

  s=$(seconds mksquashfs "$corpus" "$work/out.sqsh" -comp gzip -Xcompression-level 5 -b 65536 -processors 2 \
    -noappend -no-progress)
  record mksquashfs "$s" "$(stat -c %s "$work/out.sqsh")"
  rm -f "$work/out.sqsh"

  # zlib_ceiling: one timed run of each figure after its own warm-up run; then at once plzc cat
  # of every file of the default engine's tree, in as few processes as the command line allows
  # (xargs uses 128 KiB of it unless told more).
  "$work/zlib_ceiling" "$corpus" 1 >"$work/ceiling.txt"
  while IFS=$'\t' read -r name s o; do record "${name#zlib-5 64K chunks }" "$s" "$o"; done \
    < <(grep '^zlib-5' "$work/ceiling.txt")
  s=$(seconds sh -c "cd '$work/catTree' && xargs -0 -s '$line' '$plzc' cat <'$work/files' >/dev/null")
  record cat "$s" 0
  s=$("$catTreeBench" "$work/catTree" "$work/files")
  record catFile "$s" 0
  rm -rf "$work/catTree"
done

echo "# $(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2 | xargs), $(nproc) cores, $(uname -r), load average $(cut -d' ' -f1-3 /proc/loadavg)"
echo "# $("$plzc" --version | tr '\n' ';' | sed 's/;$//; s/;/; /'), $(mksquashfs -version 2>&1 | sed -n 1p)"
echo "# corpus: make_corpus.py --size-mb 256 --seed 1: $files files, $bytes bytes; $rounds rounds: every figure is the median of its rounds, every ratio to a peer the median of the rounds' own ratios; MB = 10^6 bytes"
echo "# every tree compressed in place read back by libdeflate, isal and zlib through plzc cat, and by zlib's inflate alone: identical to the corpus"
awk -F'\t' -v b="$bytes" -v rounds="$rounds" '
  function median(values, n,    i, j, t) {
    for (i = 2; i <= n; i++) for (j = i; j > 1 && values[j - 1] > values[j]; j--) { t = values[j]; values[j] = values[j - 1]; values[j - 1] = t }
    return n % 2 ? values[(n + 1) / 2] : (values[n / 2] + values[n / 2 + 1]) / 2
  }
  # The median over the rounds of figure f, or of f over g (per round) when g is given.
  function med(f, g,    r, v) {
    for (r = 1; r <= rounds; r++) v[r] = g == "" ? secs[r, f] : secs[r, g] / secs[r, f]
    return median(v, rounds)
  }
  { secs[$1, $2] = $3; if ($1 == 1) stored[$2] = $4 }
  function row(name, f) {
    printf "%-40s %8.2f %8.1f %7.3f %9.2f %9.2f %9.3f\n", name, med(f), b / med(f) / 1e6, stored[f] / b,
           med(f, "mksquashfs"), med(f, "deflate 2T"), stored[f] / stored["mksquashfs"]
  }
  END {
    printf "%-40s %8s %8s %7s %9s %9s %9s\n", "", "seconds", "MB/s", "ratio", "speed/sq", "speed/z2", "ratio/sq"
    split("install compress", kinds, " ")
    split("libdeflate isal zlib", engines, " ")
    for (e = 1; e <= 3; e++) for (k = 1; k <= 2; k++)
      row("plzc " kinds[k] " -j 2 " (engines[e] == "isal" ? "--fast (isal)" : "--engine " engines[e]), kinds[k] " " engines[e])
    row("mksquashfs gzip-5 64K -processors 2", "mksquashfs")
    row("raw zlib-5 64 KiB chunks, 1 thread", "deflate 1T")
    row("raw zlib-5 64 KiB chunks, 2 threads", "deflate 2T")
    printf "%-40s %8.2f %8.1f\n", "plzc cat of the compressed tree", med("cat"), b / med("cat") / 1e6
    printf "%-40s %8.2f %8.1f\n", "catFile of every file, one process", med("catFile"), b / med("catFile") / 1e6
    printf "%-40s %8.2f %8.1f\n", "raw zlib inflate, 1 thread", med("inflate 1T"), b / med("inflate 1T") / 1e6
    print ""
    for (k = 1; k <= 2; k++) {
      printf "default engine, %s: %.2f x mksquashfs (target at least 2), ratio %.3f against %.3f (target: no worse)\n",
             kinds[k], med(kinds[k] " libdeflate", "mksquashfs"), stored[kinds[k] " libdeflate"] / b, stored["mksquashfs"] / b
      printf "--fast, %s: %.2f x mksquashfs (target at least 4), ratio %.3f (target at most 0.49)\n",
             kinds[k], med(kinds[k] " isal", "mksquashfs"), stored[kinds[k] " isal"] / b
    }
    printf "catFile of the tree: %.2f x raw zlib inflate on one thread (target at least 2)\n", med("catFile", "inflate 1T")
    printf "plzc cat of the tree, processes included: %.2f x raw zlib inflate on one thread\n", med("cat", "inflate 1T")
    printf "\nper round, x mksquashfs (install, compress; --fast install, compress), and x inflate (catFile, plzc cat):\n"
    for (r = 1; r <= rounds; r++)
      printf "  round %d: %.2f %.2f; %.2f %.2f; catFile %.2f, cat %.2f\n", r,
             secs[r, "mksquashfs"] / secs[r, "install libdeflate"], secs[r, "mksquashfs"] / secs[r, "compress libdeflate"],
             secs[r, "mksquashfs"] / secs[r, "install isal"], secs[r, "mksquashfs"] / secs[r, "compress isal"],
             secs[r, "inflate 1T"] / secs[r, "catFile"], secs[r, "inflate 1T"] / secs[r, "cat"]
  }' "$results"
