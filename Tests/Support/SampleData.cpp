#include "SampleData.h"

#include <cstdio>
#include <random>

namespace plzctest {

std::vector<uint8_t> randomBytes(size_t count, uint32_t seed) {
  std::mt19937 generator(seed);
  std::vector<uint8_t> bytes(count);
  for (auto &byte : bytes) byte = static_cast<uint8_t>(generator());
  return bytes;
}

std::vector<uint8_t> compressibleBytes(size_t count, uint32_t seed) {
  std::vector<uint8_t> bytes;
  bytes.reserve(count + 64);
  uint32_t state = seed;
  while (bytes.size() < count) {
    state = state * 1103515245 + 12345;
    char line[64];
    int n = snprintf(line, sizeof line, "entry %u value %u name item-%u\n", static_cast<unsigned>(bytes.size()),
                     (state >> 16) % 1000, (state >> 8) % 97);
    bytes.insert(bytes.end(), line, line + n);
  }
  bytes.resize(count);
  return bytes;
}

}  // namespace plzctest
