// Fixed-order integer fields of the on-disk formats written by the compression types.
//
// The compression header and the type-4 chunk table are little-endian, the resource-fork header
// and map big-endian, whatever the host's order.
#pragma once

#include <stdint.h>

#include "Libraries/CompressData/DiskHeader.h"

namespace plzc {

inline void storeLE32(uint8_t *out, uint32_t value) {
  for (int i = 0; i < 4; i++) out[i] = static_cast<uint8_t>(value >> (8 * i));
}

inline void storeLE64(uint8_t *out, uint64_t value) {
  for (int i = 0; i < 8; i++) out[i] = static_cast<uint8_t>(value >> (8 * i));
}

inline void storeBE32(uint8_t *out, uint32_t value) {
  for (int i = 0; i < 4; i++) out[i] = static_cast<uint8_t>(value >> (8 * (3 - i)));
}

inline uint32_t loadLE32(const uint8_t *in) {
  return static_cast<uint32_t>(in[0]) | static_cast<uint32_t>(in[1]) << 8 | static_cast<uint32_t>(in[2]) << 16 |
         static_cast<uint32_t>(in[3]) << 24;
}

inline uint32_t loadBE32(const uint8_t *in) {
  return static_cast<uint32_t>(in[0]) << 24 | static_cast<uint32_t>(in[1]) << 16 | static_cast<uint32_t>(in[2]) << 8 |
         static_cast<uint32_t>(in[3]);
}

// Writes the 16-byte compression header (magic, type, logical size) at out.
inline void storeDiskHeader(uint8_t *out, uint32_t compressionType, uint64_t uncompressedSize) {
  storeLE32(out, kDecmpfsMagic);
  storeLE32(out + 4, compressionType);
  storeLE64(out + 8, uncompressedSize);
}

}  // namespace plzc
