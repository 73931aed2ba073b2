// The incompressible-data test lets an engine store a chunk without compressing it, so a chunk
// it accepts must be one that deflate really cannot shrink: checked against zlib at its best
// level over random bytes disturbed in the ways deflate exploits.
#include <zlib.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Common/ChunkEngine.h"
#include "Common/IncompressibleData.h"
#include "Compressors/CompressorTestHelpers.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

// Whether zlib at level 9 makes a stream of at most count bytes (the chunk would be kept
// compressed rather than stored).
bool zlibShrinks(const Bytes &input) {
  Bytes out(input.size());
  uint32_t produced = 0;
  int code = 0;
  return makeZlibChunkEncoder(9)->encode(input.data(), static_cast<uint32_t>(input.size()), out.data(),
                                         static_cast<uint32_t>(input.size()), &produced,
                                         &code) == ChunkEncoder::Result::Fit;
}

Bytes concatenate(std::initializer_list<Bytes> parts) {
  Bytes all;
  for (const Bytes &part : parts) all.insert(all.end(), part.begin(), part.end());
  return all;
}

}  // namespace

TEST(IncompressibleData, RandomBytesAreRecognisedFromFourKiBOn) {
  IncompressibleCheck check;
  for (uint32_t size : {4096u, 20000u, 65536u, 131072u}) EXPECT_TRUE(check.looksIncompressible(randomBytes(size, size).data(), size)) << size;
  Bytes small = randomBytes(4095, 1);
  EXPECT_FALSE(check.looksIncompressible(small.data(), 4095));
}

TEST(IncompressibleData, WhatDeflateCanUseIsNotTakenForRandom) {
  const uint32_t size = 65536;
  Bytes sevenBits = randomBytes(size, 2);
  for (uint8_t &byte : sevenBits) byte &= 0x7F;
  Bytes halves = randomBytes(size, 3);  // low byte values first, high ones after
  for (uint32_t i = 0; i < size; i++) halves[i] = i < size / 2 ? halves[i] & 0x7F : halves[i] | 0x80;
  Bytes block = randomBytes(30000, 4);
  const std::pair<const char *, Bytes> inputs[] = {
      {"text", compressibleBytes(size, 5)},
      {"zeros", Bytes(size, 0)},
      {"a 1000-byte random block repeated", repeatedBlock(size, 6)},
      {"30000 random bytes twice", concatenate({block, block, randomBytes(size - 60000, 11)})},
      {"seven-bit random bytes", sevenBits},
      {"two halves with different byte values", halves},
      {"random bytes around 2 KiB of zeros", concatenate({randomBytes(30000, 7), Bytes(2048, 0), randomBytes(size - 32048, 8)})},
      {"random bytes, then text", concatenate({randomBytes(size - 8192, 9), compressibleBytes(8192, 10)})},
  };
  IncompressibleCheck check;
  for (const auto &[name, input] : inputs) {
    EXPECT_TRUE(zlibShrinks(input)) << name << ": not a case deflate can shrink";
    EXPECT_FALSE(check.looksIncompressible(input.data(), size)) << name;
  }
}

// Random bytes disturbed a little (a short run of zeros, a short repeat, one or two byte values
// missing): many are judged incompressible and some are not, and zlib at level 9 shrinks none
// of the ones judged so.
TEST(IncompressibleData, NothingJudgedIncompressibleCanBeShrunk) {
  IncompressibleCheck check;
  int judged = 0, notJudged = 0;
  for (uint32_t size : {6000u, 40000u, 65536u}) {
    for (uint32_t disturbance : {0u, 12u}) {
      for (uint32_t alphabet : {256u, 255u, 254u, 240u}) {
        for (uint32_t seed = 0; seed < 8; seed++) {
          Bytes input = randomBytes(size, size + disturbance * 7 + alphabet * 11 + seed * 13);
          for (uint8_t &byte : input) byte = static_cast<uint8_t>(byte % alphabet);
          std::fill(input.begin() + size / 3, input.begin() + size / 3 + disturbance, 0);
          // A copy of earlier bytes, 3000 bytes back, as deflate would reference it.
          std::copy(input.begin() + 1000, input.begin() + 1000 + disturbance, input.begin() + 4000);
          std::string name = std::to_string(size) + " bytes, disturbance " + std::to_string(disturbance) +
                             ", alphabet " + std::to_string(alphabet) + ", seed " + std::to_string(seed);
          if (check.looksIncompressible(input.data(), size)) {
            judged++;
            EXPECT_FALSE(zlibShrinks(input)) << name;
          } else {
            notJudged++;
          }
        }
      }
    }
  }
  EXPECT_GT(judged, 40);
  EXPECT_GT(notJudged, 10);
}
