#!/usr/bin/env bash
# Installs every Debian package that building, testing and running Plenzo needs, and builds
# libdeflate 1.23 (the default chunk engine) from Debian's own source archive into /usr/local:
# Debian 12 ships libdeflate 1.14, which writes the same streams about 16% more slowly.
# Run as root on a fresh Debian 12 machine; does nothing more when all is in place.
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config   # toolchain
  libgtest-dev libgmock-dev libbenchmark-dev     # tests and benchmarks
  zlib1g-dev libmd-dev libplist-dev              # chunk codec, digests, property lists
  libisal-dev curl ca-certificates               # the fast engine; fetching libdeflate's source
  attr e2fsprogs util-linux mount                # getfattr, mkfs.ext4, loop mounts in tests
  clang libclang-rt-14-dev llvm-14               # fuzz targets: libFuzzer, sanitizer runtimes, symbolizer
  valgrind                                       # memcheck of the engines and plzc (Tests/memcheck.sh)
  libfuse3-dev fuse3 rsync                       # plzc mount, and copying out of it in tests
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
libdeflate_version=1.23
libdeflate_sha256=1ab18349b9fb0ce8a0ca4116bded725be7dcbfa709e19f6f983d99df1fb8b25f
libdeflate_url=http://deb.debian.org/debian/pool/main/libd/libdeflate/libdeflate_${libdeflate_version}.orig.tar.gz
have_libdeflate=$(PKG_CONFIG_PATH=/usr/local/lib/pkgconfig pkg-config --modversion libdeflate 2>/dev/null || true)
if [ ${#missing[@]} -eq 0 ] && [ "$have_libdeflate" = "$libdeflate_version" ]; then
  exit 0
fi
if [ "$(id -u)" -ne 0 ]; then
  echo "setup.sh: missing packages: ${missing[*]:-none}; libdeflate in /usr/local: ${have_libdeflate:-none}" \
       "(want $libdeflate_version); run this script as root to install them" >&2
  exit 1
fi
if [ ${#missing[@]} -gt 0 ]; then
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi

# libdeflate: a static, position-independent library (linked into libplenzo), so that the
# program never meets Debian's older shared one at run time. The archive is checked against
# the digest Debian published for it. Without it (no network, another archive), Debian's own
# libdeflate 1.14 is installed instead: the same streams, written more slowly.
if [ "$have_libdeflate" != "$libdeflate_version" ]; then
  work=$(mktemp -d)
  trap 'rm -rf "$work"' EXIT
  if ! curl -sSfL --retry 3 -o "$work/src.tar.gz" "$libdeflate_url"; then
    problem="cannot fetch $libdeflate_url"
  elif ! echo "$libdeflate_sha256  $work/src.tar.gz" | sha256sum -c --quiet - >/dev/null 2>&1; then
    problem="$libdeflate_url does not have the expected SHA-256"
  else
    problem=""
  fi
  if [ -n "$problem" ]; then
    echo "setup.sh: $problem; installing Debian's libdeflate-dev (1.14, slower) instead" >&2
    DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends libdeflate-dev
    exit 0
  fi
  tar -xzf "$work/src.tar.gz" -C "$work"
  cmake -S "$work/libdeflate-$libdeflate_version" -B "$work/build" -G Ninja -DCMAKE_BUILD_TYPE=Release \
    -DCMAKE_INSTALL_PREFIX=/usr/local -DCMAKE_INSTALL_LIBDIR=lib -DCMAKE_POSITION_INDEPENDENT_CODE=ON \
    -DLIBDEFLATE_BUILD_SHARED_LIB=OFF -DLIBDEFLATE_BUILD_GZIP=OFF >/dev/null
  cmake --build "$work/build" >/dev/null
  cmake --install "$work/build" >/dev/null
  echo "setup.sh: libdeflate $libdeflate_version installed in /usr/local"
fi
