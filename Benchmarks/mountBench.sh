#!/usr/bin/env bash
# Reading compressed files through plzc mount, against plzc cat (catFile) on the same files and
# against the plain tree, all in one run on tmpfs: MB/s of the files of 1 MiB and more and the
# ratio mount/catFile, then the open-and-read time of the files of 4 KiB and less. Each tuning
# of the mount is measured by turning it back off in turn.
#
# Usage: Benchmarks/mountBench.sh [PLZC [WORKDIR]]
#   PLZC     the plzc binary (default: build/Tools/plzc/plzc of this checkout)
#   WORKDIR  a directory on a volume that holds compressed files (default /dev/shm)
# Environment: CORPUS_MB (default 256), RUNS (default 5; the best time of each is shown), MAKE_CORPUS (a make_corpus.py; by default
# ../shared/bench/make_corpus.py beside this checkout, when it exists; otherwise the corpus comes
# from 'plzc demo --generate-only'). Needs root (or user mounts) and /dev/fuse.
set -euo pipefail

repo=$(cd "$(dirname "$0")/.." && pwd)
plzc=$(realpath "${1:-$repo/build/Tools/plzc/plzc}")
parent=${2:-/dev/shm}
corpus_mb=${CORPUS_MB:-256}
runs=${RUNS:-5}
make_corpus=${MAKE_CORPUS:-$repo/../shared/bench/make_corpus.py}

[ -x "$plzc" ] || { echo "mountBench: $plzc is not built" >&2; exit 1; }
[ -e /dev/fuse ] || { echo "mountBench: /dev/fuse is absent" >&2; exit 1; }
work=$(mktemp -d "$parent/plzc-mountbench.XXXXXX")
mnt="$work/mnt"
cleanup() {
  mountpoint -q "$mnt" 2>/dev/null && { fusermount3 -u "$mnt" || umount -l "$mnt"; }
  rm -rf "$work"
}
trap cleanup EXIT

if [ -f "$make_corpus" ] && command -v python3 >/dev/null; then
  source="make_corpus.py --size-mb $corpus_mb --seed 1"
  python3 "$make_corpus" "$work/plain" --size-mb "$corpus_mb" --seed 1 >/dev/null
else
  source="plzc demo --generate-only --size-mb $corpus_mb"
  "$plzc" demo --generate-only --size-mb "$corpus_mb" --no-progress "$work" >/dev/null
  mv "$work"/plzc-demo-* "$work/plain"
fi
cp -a "$work/plain" "$work/comp"
"$plzc" compress --no-progress "$work/comp" >/dev/null
mkdir "$mnt"

(cd "$work/plain" && find . -type f -size +1023k -printf '%P\n' | sort) >"$work/large"
(cd "$work/plain" && find . -type f -size -4097c -printf '%P\n' | sort) >"$work/small"
large_bytes=$(cd "$work/plain" && tr '\n' '\0' <"$work/large" | du -cb --files0-from=- | tail -1 | cut -f1)
small_count=$(wc -l <"$work/small")
compressed_large=$(cd "$work/comp" && tr '\n' '\0' <"$work/large" | xargs -0 "$plzc" info 2>/dev/null |
                   awk '$1 == 3 || $1 == 4' | wc -l)

# seconds COMMAND...: wall seconds of the command, its output discarded.
seconds() {
  local TIMEFORMAT='%R' t
  t=$( { time "$@" >/dev/null; } 2>&1 ) || { echo "mountBench: '$*' failed: $t" >&2; exit 1; }
  echo "$t"
}
read_large() { (cd "$1" && tr '\n' '\0' <"$work/large" | xargs -0 cat); }
read_small() { (cd "$1" && tr '\n' '\0' <"$work/small" | xargs -0 cat); }
cat_large() { (cd "$work/comp" && tr '\n' '\0' <"$work/large" | xargs -0 "$plzc" cat); }
mbps() { awk -v b="$large_bytes" -v s="$1" 'BEGIN {printf "%.0f", b / 1e6 / s}'; }
per_file_us() { awk -v n="$small_count" -v s="$1" 'BEGIN {printf "%.1f", s * 1e6 / n}'; }

mount_with() {
  "$plzc" mount "$@" "$work/comp" "$mnt"
}
unmount() { fusermount3 -u "$mnt"; }

printf 'plzc mount: sequential reads through the mount against plzc cat and the plain tree\n'
printf 'corpus: %s (%s files >= 1 MiB, %.1f MiB, %s of them compressed; %s files <= 4 KiB)\n' "$source" \
  "$(wc -l <"$work/large")" "$(awk -v b="$large_bytes" 'BEGIN {print b / 1048576}')" "$compressed_large" "$small_count"
printf 'machine: %s processors, load average %s; best of %s runs, the runs interleaved\n\n' "$(nproc)" \
  "$(cut -d' ' -f1-3 /proc/loadavg)" "$runs"

# The mount variants: a label, then the options that turn one tuning back off.
labels=("mount, as tuned" "  with 1 MiB requests (-o max_read=1048576)" "  single-threaded (-s)"
        "  without keeping pages (-o no_keep_cache)" "  attributes never cached (-o attr_timeout=0)")
options=("" "-o max_read=1048576" "-s" "-o no_keep_cache" "-o attr_timeout=0")
declare -A best

# keep NAME SECONDS: remembers the smallest time seen under NAME.
keep() {
  if [ -z "${best[$1]:-}" ] || awk -v a="$2" -v b="${best[$1]}" 'BEGIN {exit !(a < b)}'; then best[$1]=$2; fi
}

for run in $(seq 1 "$runs"); do
  keep plain "$(seconds read_large "$work/plain")"
  keep cat "$(seconds cat_large)"
  keep small_plain "$(seconds read_small "$work/plain")"
  for i in "${!labels[@]}"; do
    # A fresh mount: the first read is cold, the second finds the kernel's pages when kept.
    # shellcheck disable=SC2086
    mount_with ${options[$i]}
    keep "first$i" "$(seconds read_large "$mnt")"
    keep "again$i" "$(seconds read_large "$mnt")"
    keep "small$i" "$(seconds read_small "$mnt")"
    unmount
  done
done

printf '%-46s %8s %8s %10s %10s %14s\n' "files >= 1 MiB, read with cat" seconds "MB/s" "mount/cat" "2nd read s" "<= 4 KiB us/file"
printf '%-46s %8.3f %8s %10s %10s %14s\n' "plain tree on tmpfs" "${best[plain]}" "$(mbps "${best[plain]}")" "" "" \
  "$(per_file_us "${best[small_plain]}")"
printf '%-46s %8.3f %8s\n' "plzc cat (catFile) of the compressed tree" "${best[cat]}" "$(mbps "${best[cat]}")"
for i in "${!labels[@]}"; do
  printf '%-46s %8.3f %8s %10.2f %10.3f %14s\n' "${labels[$i]}" "${best[first$i]}" "$(mbps "${best[first$i]}")" \
    "$(awk -v c="${best[cat]}" -v m="${best[first$i]}" 'BEGIN {print c / m}')" "${best[again$i]}" \
    "$(per_file_us "${best[small$i]}")"
done
