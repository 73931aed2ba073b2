#!/usr/bin/env bash
# plzc install and plzc compress against what a user would pick instead, on one corpus in one
# run: the seeded 256 MiB mixed tree of make_corpus.py (seed 1) on /dev/shm is installed with
# plzc install and compressed in place with plzc compress -j 2 (a copy), once with each engine
# (libdeflate, the default; isal through --fast; zlib, the reference), packed with mksquashfs
# (gzip level 5, 64 KiB blocks, 2 processors), and its 64 KiB chunks deflated at level 5 and
# inflated back by raw zlib on one and two threads (the ceiling for zlib-format chunks). Every
# tree compressed in place is then read back with plzc cat by every engine, and by zlib's
# inflate alone (Benchmarks/zlibReadBack), and compared with the corpus; plzc cat of the tree
# is timed with the default engine against raw zlib inflate on one thread, in three rounds of a
# ceiling run and a cat run each (medians; every other command is run once). Prints one table of throughput (MB = 10^6
# bytes of logical data per second) and stored/logical ratio, with the ratios to mksquashfs
# and to the 2-thread ceiling.
#
# Usage: Benchmarks/installBench.sh [--bench-dir DIR] [--plzc PLZC] [--work DIR]
#   --bench-dir  the peers' tools (make_corpus.py, zlib_ceiling.c); default ../shared/bench
#                beside this checkout, or $BENCH_DIR
#   --plzc       the plzc binary (default: build/Tools/plzc/plzc of this checkout)
#   --work       where corpus and outputs go (default /dev/shm; must hold compressed files)
# Not part of CI. Installs squashfs-tools when mksquashfs is missing (as root).
set -euo pipefail

repo=$(cd "$(dirname "$0")/.." && pwd)
bench=${BENCH_DIR:-$repo/../shared/bench}
plzc=$repo/build/Tools/plzc/plzc
parent=/dev/shm
while [ $# -gt 0 ]; do
  case "$1" in
    --bench-dir) bench=$2; shift 2 ;;
    --plzc) plzc=$2; shift 2 ;;
    --work) parent=$2; shift 2 ;;
    -h|--help) sed -n '2,/^set -e/p' "$0" | sed '$d; s/^# \{0,1\}//'; exit 0 ;;
    *) echo "installBench: unknown argument '$1' (see --help)" >&2; exit 2 ;;
  esac
done
for f in make_corpus.py zlib_ceiling.c; do
  [ -f "$bench/$f" ] || { echo "installBench: no $f in $bench (give --bench-dir)" >&2; exit 1; }
done
[ -x "$plzc" ] || { echo "installBench: $plzc is not built (cmake --build build --target plzc)" >&2; exit 1; }
zlibReadBack=$(dirname "$plzc")/../../Benchmarks/zlibReadBack
[ -x "$zlibReadBack" ] || { echo "installBench: $zlibReadBack is not built (cmake --build build)" >&2; exit 1; }
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
declare -A s_install o_install s_compress o_compress
for engine in "${engines[@]}"; do
  choice=(--engine "$engine")
  if [ "$engine" = isal ]; then choice=(--fast); fi
  s_install[$engine]=$(seconds "$plzc" install --no-progress "${choice[@]}" -j 2 "$corpus" "$work/installed")
  o_install[$engine]=$(stored "$work/installed")
  rm -rf "$work/installed"

  cp -a "$corpus" "$work/copy"
  sync
  s_compress[$engine]=$(seconds "$plzc" compress --no-progress "${choice[@]}" -j 2 "$work/copy")
  o_compress[$engine]=$(stored "$work/copy")
  readBack "$work/copy"
  # The default engine's tree is kept for the timed plzc cat below.
  if [ "$engine" = libdeflate ]; then mv "$work/copy" "$work/catTree"; else rm -rf "$work/copy"; fi
done

s_squash=$(seconds mksquashfs "$corpus" "$work/out.sqsh" -comp gzip -Xcompression-level 5 -b 65536 -processors 2 \
  -noappend -no-progress)
o_squash=$(stat -c %s "$work/out.sqsh")
rm -f "$work/out.sqsh"

# Three rounds: zlib_ceiling (one timed run of each figure after its own warm-up run), then at
# once plzc cat of every file of the default engine's tree, in as few processes as the command
# line allows (xargs uses 128 KiB of it unless told more). A slow moment of this shared machine
# then slows both sides of a round alike. Every figure is the median of the three rounds; the
# cat ratio is the median of the rounds' own ratios.
line=$(xargs --show-limits </dev/null 2>&1 | awk -F: '/actually use/ {print $2 + 0; exit}')
rounds=$work/rounds.tsv  # round, figure, seconds, stored bytes
: >"$rounds"
for round in 1 2 3; do
  "$work/zlib_ceiling" "$corpus" 1 >"$work/ceiling.txt"
  awk -F'\t' -v OFS='\t' -v round="$round" '/^zlib-5/ {sub(/^zlib-5 64K chunks /, "", $1); print round, $1, $2, $3}' \
    "$work/ceiling.txt" >>"$rounds"
  s=$(seconds sh -c "cd '$work/catTree' && xargs -0 -s '$line' '$plzc' cat <'$work/files' >/dev/null")
  printf '%s\tcat\t%s\t0\n' "$round" "$s" >>"$rounds"
done
rm -rf "$work/catTree"
# median FIGURE: the middle one of the three rounds' seconds.
median() { awk -F'\t' -v f="$1" '$2 == f {print $3}' "$rounds" | sort -n | sed -n 2p; }
s_ceiling1=$(median "deflate 1T")
s_ceiling2=$(median "deflate 2T")
s_inflate1=$(median "inflate 1T")
s_cat=$(median cat)
o_ceiling=$(awk -F'\t' '$2 == "deflate 1T" {print $4; exit}' "$rounds")
# Each round's raw inflate over its cat; the middle one.
r_cat=$(awk -F'\t' '$2 == "inflate 1T" {inf[$1] = $3} $2 == "cat" {cat[$1] = $3}
                     END {for (r in cat) print inf[r] / cat[r]}' "$rounds" | sort -n | sed -n 2p)

echo "# $(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2 | xargs), $(nproc) cores, $(uname -r), load average $(cut -d' ' -f1-3 /proc/loadavg)"
echo "# zlib $(dpkg-query -W -f '${Version}' zlib1g 2>/dev/null), libdeflate $(dpkg-query -W -f '${Version}' libdeflate0 2>/dev/null), isa-l $(dpkg-query -W -f '${Version}' libisal2 2>/dev/null), $(mksquashfs -version 2>&1 | sed -n 1p), $("$plzc" --version)"
echo "# corpus: make_corpus.py --size-mb 256 --seed 1: $files files, $bytes bytes; one run each (the raw ceiling and cat: median of 3 rounds); MB = 10^6 bytes"
echo "# every tree compressed in place read back by libdeflate, isal and zlib through plzc cat, and by zlib's inflate alone: identical to the corpus"
{
  for engine in "${engines[@]}"; do
    echo "install $engine ${s_install[$engine]} ${o_install[$engine]}"
    echo "compress $engine ${s_compress[$engine]} ${o_compress[$engine]}"
  done
} | awk -v b="$bytes" -v sq="$s_squash" -v oq="$o_squash" -v z1="$s_ceiling1" -v z2="$s_ceiling2" -v oz="$o_ceiling" \
        -v cat="$s_cat" -v inf1="$s_inflate1" -v rcat="$r_cat" '
  function row(name, s, o) {
    printf "%-40s %8.2f %8.1f %7.3f %9.2f %9.2f %9.3f\n", name, s, b / s / 1e6, o / b, sq / s, z2 / s, (o / b) / (oq / b)
  }
  { kind[NR] = $1; engine[NR] = $2; secs[NR] = $3; out[NR] = $4 }
  END {
    printf "%-40s %8s %8s %7s %9s %9s %9s\n", "", "seconds", "MB/s", "ratio", "speed/sq", "speed/z2", "ratio/sq"
    for (i = 1; i <= NR; i++) {
      name = "plzc " kind[i] " -j 2 " (engine[i] == "isal" ? "--fast (isal)" : "--engine " engine[i])
      row(name, secs[i], out[i])
      if (engine[i] == "libdeflate") { di[kind[i]] = secs[i]; do_[kind[i]] = out[i] }
      if (engine[i] == "isal") { fi[kind[i]] = secs[i]; fo[kind[i]] = out[i] }
    }
    row("mksquashfs gzip-5 64K -processors 2", sq, oq)
    row("raw zlib-5 64 KiB chunks, 1 thread", z1, oz)
    row("raw zlib-5 64 KiB chunks, 2 threads", z2, oz)
    printf "%-40s %8.2f %8.1f\n", "plzc cat of the compressed tree", cat, b / cat / 1e6
    printf "%-40s %8.2f %8.1f\n", "raw zlib inflate, 1 thread", inf1, b / inf1 / 1e6
    print ""
    for (k in di) {
      printf "default engine, %s: %.2f x mksquashfs (target at least 2), ratio %.3f against %.3f (target: no worse)\n",
             k, sq / di[k], do_[k] / b, oq / b
      printf "--fast, %s: %.2f x mksquashfs (target at least 4), ratio %.3f (target at most 0.49)\n", k, sq / fi[k], fo[k] / b
    }
    printf "plzc cat: %.2f x raw zlib inflate on one thread, median of the rounds (target at least 2)\n", rcat
  }'
