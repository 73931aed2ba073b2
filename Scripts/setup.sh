#!/usr/bin/env bash
# Installs every Debian package that building, testing and running Plenzo needs.
# Run as root on a fresh Debian 12 machine; does nothing more when all are present.
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config   # toolchain
  libgtest-dev libgmock-dev libbenchmark-dev     # tests and benchmarks
  zlib1g-dev libmd-dev libplist-dev              # chunk codec, digests, property lists
  libdeflate-dev libisal-dev                     # the faster chunk engines
  attr e2fsprogs util-linux mount                # getfattr, mkfs.ext4, loop mounts in tests
  clang libclang-rt-14-dev llvm-14               # fuzz targets: libFuzzer, sanitizer runtimes, symbolizer
  valgrind                                       # memcheck of the engines and plzc (Tests/memcheck.sh)
  libfuse3-dev fuse3 rsync                       # plzc mount, and copying out of it in tests
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi
if [ "$(id -u)" -ne 0 ]; then
  echo "setup.sh: missing packages: ${missing[*]}; run this script as root to install them" >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends "${missing[@]}"
