#include "Common/IncompressibleData.h"

#include <cstring>
#include <new>

namespace {

constexpr uint32_t kMinimumInput = 4096;
constexpr uint32_t kWindow = 16384;
constexpr uint32_t kReach = 32768;  // how far back deflate's references go
constexpr int kHashBits = 15;

uint32_t load32(const uint8_t *at) {
  uint32_t value;
  memcpy(&value, at, sizeof value);
  return value;
}

// Whether the byte frequencies of count bytes are as even as random bytes'. Chi-square over
// the 256 values, scaled by 256 * count to stay in integers:
//   sum (256 * c - count)^2 <= limit * 256 * count, limit = 2 * 255 degrees of freedom.
// Random bytes give about 255 (standard deviation 23); text gives hundreds of thousands.
bool evenFrequencies(const uint8_t *bytes, uint32_t count) {
  uint32_t counts[4][256] = {};
  uint32_t i = 0;
  for (; i + 8 <= count; i += 8) {
    uint64_t word;
    memcpy(&word, bytes + i, sizeof word);
    counts[0][word & 255]++;
    counts[1][(word >> 8) & 255]++;
    counts[2][(word >> 16) & 255]++;
    counts[3][(word >> 24) & 255]++;
    counts[0][(word >> 32) & 255]++;
    counts[1][(word >> 40) & 255]++;
    counts[2][(word >> 48) & 255]++;
    counts[3][word >> 56]++;
  }
  for (; i < count; i++) counts[0][bytes[i]]++;
  uint64_t sum = 0;
  for (int value = 0; value < 256; value++) {
    int64_t c = counts[0][value] + counts[1][value] + counts[2][value] + counts[3][value];
    int64_t deviation = 256 * c - count;
    sum += static_cast<uint64_t>(deviation * deviation);
  }
  return sum <= uint64_t{2 * 255} * 256 * count;
}

}  // namespace

bool IncompressibleCheck::looksIncompressible(const uint8_t *input, uint32_t count) {
  if (count < kMinimumInput) return false;
  if (!evenFrequencies(input, kMinimumInput)) return false;
  uint32_t windows = count / kWindow ? count / kWindow : 1;
  for (uint32_t w = 0; w < windows; w++) {
    uint32_t start = static_cast<uint32_t>(uint64_t{count} * w / windows);
    uint32_t end = static_cast<uint32_t>(uint64_t{count} * (w + 1) / windows);
    if (!evenFrequencies(input + start, end - start)) return false;
  }
  // Recurring 4-byte strings within reach. Random bytes give well under one per chunk; one in
  // 4 KiB of input is allowed.
  if (!recent_) {
    recent_.reset(new (std::nothrow) uint32_t[1u << kHashBits]);
    if (!recent_) return false;
  }
  uint32_t *recent = recent_.get();
  memset(recent, 0, sizeof(uint32_t) << kHashBits);
  uint32_t allowed = count / kMinimumInput, found = 0;
  for (uint32_t i = 0; i + 4 <= count; i++) {
    uint32_t value = load32(input + i);
    uint32_t slot = (value * 2654435761u) >> (32 - kHashBits);
    uint32_t previous = recent[slot];
    recent[slot] = i + 1;
    if (previous != 0 && i - (previous - 1) <= kReach && load32(input + previous - 1) == value && ++found > allowed)
      return false;
  }
  return true;
}
