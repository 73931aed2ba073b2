// A cheap test for bytes that no deflate encoder can shrink (compressed media, archives,
// encrypted or random data), so that an engine can skip compressing a chunk that would be
// stored raw anyway.
//
// Deflate shrinks data in two ways: Huffman codes for uneven byte frequencies, and references
// to strings repeated within the last 32 KiB. The test accepts only input where neither has
// anything to work with: in every window of about 16 KiB the byte frequencies are as even as
// random bytes' (a chi-square statistic over the 256 byte values at most twice its expectation
// for random data; the Huffman saving it leaves, a few dozen bytes a window, is less than a
// dynamic block's code tables cost), and hardly any 4-byte string recurs within 32 KiB (a long
// repetition shows up as thousands of recurrences). Text and binaries fail at the first 4 KiB,
// so the test costs them next to nothing.
#pragma once

#include <stdint.h>

#include <memory>

class IncompressibleCheck {
 public:
  // True when count bytes look incompressible. Inputs under 4 KiB are never judged so.
  bool looksIncompressible(const uint8_t *input, uint32_t count);

 private:
  // Last position + 1 of each 4-byte hash (0: none); made on first use, kept for later calls.
  std::unique_ptr<uint32_t[]> recent_;
};
