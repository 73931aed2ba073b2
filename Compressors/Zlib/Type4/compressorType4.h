// Type 4: chunks of 64 KiB in the resource fork, laid out as a one-resource fork with a chunk
// table, and a 16-byte header attribute.
#pragma once

#include <stdint.h>
#include <sys/uio.h>

#include "Common/FileHandle.h"

constexpr uint32_t kType4ChunkSize = 65536;

void *initCompressorType4(void *initArg1, void *initArg2, int32_t compressionLevel, int32_t allowLargeResourceForks);
void freeContextType4(void *context);
// 0 when the file was compressed (as a fork, or in the type-3 form when its one chunk is small
// enough), -1 otherwise; a failed or refused fork is removed again.
int compressFileType4(FileHandle *handle, const char *path, int64_t size, void *context);
int64_t doUncompressType4(FileHandle *handle, int64_t offset, uint64_t size, uint32_t vectorCount,
                          const struct iovec *vectors, const void *attribute);

// Reading a fork back strictly, chunk by chunk, to check what an interrupted run left behind.
struct Type4ForkShape {
  uint32_t chunkCount;  // at fork offset 260, the first thing the compressor writes
  bool finished;        // the fork's head and map are written and agree with its length
};
// 0 with *shape when the fork holds a non-zero chunk count and is one this type writes: its
// first 260 bytes all zero (the head and map are written after the chunks: a fork still being
// written), or a head whose length the fork ends at (the map not yet written), or a head and
// map that agree with its length (finished). -1 otherwise: not a fork this type writes, or
// unreadable (errno set).
int readForkShapeType4(FileHandle *handle, Type4ForkShape *shape);
// Decodes chunk `index` of the fork whole into out (room for kType4ChunkSize bytes): the bytes
// produced; 0 when its table entry was never written (zero, or past the fork's end); -1 when
// the entry or the chunk cannot be read, or the chunk is not one complete chunk (Adler-32
// checked).
int64_t decodeChunkType4(FileHandle *handle, uint32_t index, uint8_t *out);
