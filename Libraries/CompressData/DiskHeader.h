// The compression header shared by every reader and writer of compressed files.
//
// "com.tavix.decmpfs" begins with a 16-byte little-endian header: magic "fpmc" (0x636D7066),
// the compression type, the logical size. Type 3 keeps its compressed bytes after the header
// in the same attribute (at most 3802 bytes in all); type 4 keeps exactly the header there and
// its chunks in "com.tavix.ResourceFork". A compressed file carries the flag 0x20.
#pragma once

#include <stdint.h>

#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"

#define PLZC_DECMPFS_NAME "com.tavix.decmpfs"

constexpr const char *kDecmpfsXattrName = PLZC_DECMPFS_NAME;
constexpr const char *kResourceForkXattrName = PLZC_RESOURCE_FORK_NAME;
constexpr uint32_t kDecmpfsMagic = 0x636D7066;
constexpr uint32_t kCompressedFlag = kFlagCompressed;
constexpr int kShowCompressionOption = kXattrShowCompression;
constexpr uint32_t kDiskHeaderSize = 16;
constexpr uint32_t kMaxType3AttributeSize = 3802;
// The longest header attribute a reader takes in. Writers make at most 3802 bytes, but a
// damaged file may claim any length, which must not turn into an allocation of that size.
constexpr int64_t kMaxReadableHeaderSize = 1048576;

struct DiskHeader {
  uint32_t magic;
  uint32_t compressionType;
  uint64_t uncompressedSize;
};
static_assert(sizeof(DiskHeader) == kDiskHeaderSize, "the header is 16 bytes on disk");

// The header attribute as the decompressors receive it: its length, then its bytes.
struct AttrBuffer {
  uint32_t attrSize;
  uint8_t attribute[];
};

// 1 when the running kernel decompresses compressed files itself, 0 when the library must.
// Computed once per process.
int osSupportsDecmpfs(void);
