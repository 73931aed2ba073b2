// Type 3: a small file's single chunk kept inside the header attribute, behind the header.
#pragma once

#include <stdint.h>
#include <sys/uio.h>

#include "Common/FileHandle.h"

constexpr uint32_t kType3ChunkSize = 131072;

void *initCompressorType3(void *initArg1, void *initArg2, int32_t compressionLevel, int32_t allowLargeResourceForks);
void freeContextType3(void *context);
// 0 when the header attribute with the file's data was written, -1 otherwise (too large, too
// incompressible, or the write failed). An empty file gives 0 and writes nothing.
int compressFileType3(FileHandle *handle, const char *path, int64_t size, void *context);
int64_t doUncompressType3(FileHandle *handle, int64_t offset, uint64_t size, uint32_t vectorCount,
                          const struct iovec *vectors, const void *attribute);

// Decodes the payload of a type-3 header attribute (`length` bytes, the header included) whole
// into out, which has room for kType3ChunkSize bytes: the bytes produced, or -1 when the
// attribute is too short or too long for type 3 or its payload is not one complete chunk
// (Adler-32 checked). The header's size field is not compared: that is the caller's check.
int64_t decodeAttributeType3(const uint8_t *attribute, uint32_t length, uint8_t *out);
