// Deterministic sample contents for tests and fuzz seeds. Free of GoogleTest, so that the fuzz
// targets share them.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace plzctest {

// Deterministic pseudo-random bytes.
std::vector<uint8_t> randomBytes(size_t count, uint32_t seed);
// Deterministic text lines that deflate shrinks several times over, but not to nothing.
std::vector<uint8_t> compressibleBytes(size_t count, uint32_t seed);

}  // namespace plzctest
