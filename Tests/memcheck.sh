#!/usr/bin/env bash
# Runs the chunk engines' tests and plzc itself under Valgrind's memcheck, which sees what the
# sanitized builds cannot: reads of memory that was never written, in our code and in the
# engines' libraries (built without instrumentation). A stream made from such a read can differ
# from run to run for the same bytes. Exits non-zero on any report.
#
# Usage: Tests/memcheck.sh [BUILD_DIR]   (default build; plzc and ChunkEngineTests built there)
# Environment: PLZC_TEST_DIR, where the demo corpora go (default /dev/shm).
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
command -v valgrind >/dev/null || { echo "memcheck.sh: valgrind is missing (Scripts/setup.sh installs it)" >&2; exit 1; }
for binary in Tools/plzc/plzc Tests/ChunkEngineTests; do
  [ -x "$build/$binary" ] || { echo "memcheck.sh: $build/$binary is not built" >&2; exit 1; }
done

memcheck=(valgrind --quiet --error-exitcode=99 --track-origins=yes)
status=0
run() {
  local name=$1
  shift
  if "$@" >"$log" 2>&1; then
    echo "memcheck: $name: clean"
  else
    echo "memcheck: $name: FAILED (exit $?)" >&2
    cat "$log" >&2
    status=1
  fi
}
log=$(mktemp)
trap 'rm -f "$log"' EXIT

# Every engine's encoder and decoder, through their own tests.
run ChunkEngineTests "${memcheck[@]}" "$build/Tests/ChunkEngineTests"
# plzc compressing a small mixed corpus on four threads and reading every file back, with each
# engine.
for engine in libdeflate isal zlib; do
  run "plzc demo, $engine" env PLZC_ENGINE=$engine "${memcheck[@]}" "$build/Tools/plzc/plzc" demo --size-mb=3 \
    --seed=2 -j 4 --no-progress "${PLZC_TEST_DIR:-/dev/shm}"
done
exit $status
