// Helpers shared by the chunking-engine, type-3 and type-4 tests: test data, attribute reads
// through a handle, and reads of a compressed file through vectors.
#pragma once

#include <fcntl.h>
#include <sys/uio.h>
#include <zlib.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Common/ChunkEngine.h"
#include "Common/FileHandle.h"
#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

namespace plzctest {

using Bytes = std::vector<uint8_t>;

// A 1000-byte random block repeated: deflate turns every repetition into a few matches.
inline Bytes repeatedBlock(size_t count, uint32_t seed) {
  Bytes block = randomBytes(1000, seed);
  Bytes out(count);
  for (size_t i = 0; i < count; i++) out[i] = block[i % block.size()];
  return out;
}

// `randomCount` random bytes followed by zeros, `count` bytes in all: its zlib stream grows by
// about one byte per random byte, which lets a test aim at a stream length.
inline Bytes randomThenZeros(size_t randomCount, size_t count, uint32_t seed) {
  Bytes out = randomBytes(randomCount, seed);
  out.resize(count, 0);
  return out;
}

// Length of the zlib-format stream the process's engine makes of these bytes at this level,
// given all the room it wants.
inline size_t zlibStreamLength(const Bytes &data, int level) {
  std::unique_ptr<ChunkEncoder> encoder = ChunkEncoder::create(currentChunkEngine(), level);
  Bytes out(compressBound(data.size()) + 64);
  uint32_t length = 0;
  int code = 0;
  EXPECT_EQ(encoder->encode(data.data(), static_cast<uint32_t>(data.size()), out.data(),
                            static_cast<uint32_t>(out.size()), &length, &code),
            ChunkEncoder::Result::Fit);
  return length;
}

// Finds `randomCount` such that randomThenZeros(randomCount, count) has a stream of exactly
// `streamLength` bytes; nullopt when none does. The length grows with the random count, about
// one byte per byte but with jumps where an engine changes its blocks, so the search bisects to
// the right neighbourhood and tries the counts around it. Where every count jumps over the
// length, bytes of a four-letter alphabet (about a quarter of a byte each) fill the gap.
inline std::optional<Bytes> dataWithStreamLength(size_t streamLength, size_t count, int level) {
  auto make = [count](size_t randomCount, size_t fourLetterCount, uint32_t seed) {
    Bytes data = randomThenZeros(randomCount, count, seed);
    Bytes letters = randomBytes(fourLetterCount, seed + 1000);
    for (size_t i = 0; i < fourLetterCount && randomCount + i < count; i++) data[randomCount + i] = letters[i] & 3;
    return data;
  };
  for (size_t fourLetters = 0; fourLetters <= 1024; fourLetters += 8) {
    for (uint32_t seed = 99; seed < (fourLetters == 0 ? 107u : 100u); seed++) {
      size_t low = 0, high = count - fourLetters;
      while (low < high) {
        size_t middle = (low + high) / 2;
        if (zlibStreamLength(make(middle, fourLetters, seed), level) < streamLength) {
          low = middle + 1;
        } else {
          high = middle;
        }
      }
      for (size_t n = low > 256 ? low - 256 : 0; n <= std::min(count - fourLetters, low + 64); n++) {
        Bytes data = make(n, fourLetters, seed);
        if (zlibStreamLength(data, level) == streamLength) return data;
      }
    }
  }
  return std::nullopt;
}

inline Bytes slice(const Bytes &data, int64_t offset, uint64_t size) {
  if (offset >= static_cast<int64_t>(data.size())) return {};
  size_t end = static_cast<size_t>(std::min<uint64_t>(data.size(), offset + size));
  return Bytes(data.begin() + offset, data.begin() + static_cast<int64_t>(end));
}

inline uint32_t loadLE32(const uint8_t *in) { return in[0] | in[1] << 8 | in[2] << 16 | uint32_t(in[3]) << 24; }
inline uint32_t loadBE32(const uint8_t *in) { return uint32_t(in[0]) << 24 | in[1] << 16 | in[2] << 8 | in[3]; }
inline uint64_t loadLE64(const uint8_t *in) { return loadLE32(in) | uint64_t(loadLE32(in + 4)) << 32; }

// The whole attribute, or nullopt when the file has none (ENOATTR).
inline std::optional<Bytes> attribute(FileHandle *fh, const char *name) {
  int64_t size = fh->getxattr(fh, name, nullptr, 0, 0, 0);
  if (size < 0) {
    EXPECT_EQ(errno, ENOATTR) << name;
    return std::nullopt;
  }
  Bytes value(static_cast<size_t>(size));
  EXPECT_EQ(fh->getxattr(fh, name, value.data(), value.size(), 0, 0), size);
  return value;
}

// The header attribute as the decompressors receive it: its length, then its bytes.
inline Bytes attrBuffer(const Bytes &attribute) {
  Bytes block(4 + attribute.size());
  uint32_t length = static_cast<uint32_t>(attribute.size());
  memcpy(block.data(), &length, 4);
  std::copy(attribute.begin(), attribute.end(), block.begin() + 4);
  return block;
}

// Vectors over `out` (size bytes) of the given lengths; the last vector takes the rest.
inline std::vector<struct iovec> splitVectors(Bytes &out, uint64_t size, const std::vector<size_t> &splits) {
  std::vector<struct iovec> vectors;
  size_t used = 0;
  for (size_t length : splits) {
    length = std::min(length, static_cast<size_t>(size) - used);
    vectors.push_back({out.data() + used, length});
    used += length;
  }
  if (used < size || vectors.empty()) vectors.push_back({out.data() + used, static_cast<size_t>(size) - used});
  return vectors;
}

// One read range of a compressed file, with the vector lengths it is read into.
struct ReadRange {
  const char *name;
  int64_t offset;
  uint64_t size;
  std::vector<size_t> splits;
};
inline std::ostream &operator<<(std::ostream &os, const ReadRange &range) { return os << range.name; }

// Plain handles on files in a scratch directory, closed after the test; faults cleared.
class CompressorTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }
  void TearDown() override {
    sys::clearFaults();
    for (FileHandle *fh : handles) fh->close(fh);
  }
  FileHandle *open(const Bytes &bytes) {
    std::string path = writeFile(dir.file("f" + std::to_string(handles.size())), bytes);
    FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
    EXPECT_NE(fh, nullptr);
    if (fh) handles.push_back(fh);
    return fh;
  }
  ScratchDir dir;
  std::vector<FileHandle *> handles;
};

// Test-name generator for cases with a `name` field.
inline constexpr auto kCaseName = [](const auto &info) { return std::string(info.param.name); };

}  // namespace plzctest
