// The compression types and the caller's compressor context.
//
// allCompressors has one row per type number 0 to 4; rows 0 to 2 are empty, row 3 is the
// type-3 compressor (data inside the header attribute), row 4 the type-4 compressor (chunks in
// the resource fork). A CompressorContext holds which types to try, in which order, with which
// zlib level, and the statistics of what was done.
#pragma once

#include <pthread.h>
#include <stdint.h>
#include <sys/uio.h>

#include "Common/FileHandle.h"

// One compression type's operations.
struct CompressorOps {
  // Returns the type's own context for this level and large-fork permission.
  void *(*init)(void *initArg1, void *initArg2, int32_t compressionLevel, int32_t allowLargeResourceForks);
  void (*freeContext)(void *context);
  // 0 when the file was compressed and its attributes written through the handle, -1 when this
  // type could not or would not compress it.
  int (*compressFile)(FileHandle *handle, const char *path, int64_t size, void *context);
  // Produces size bytes from offset into the vectors; attribute is the header attribute as
  // read, preceded by its length (a host-order uint32). Bytes produced, or -1.
  int64_t (*doUncompress)(FileHandle *handle, int64_t offset, uint64_t size, uint32_t vectorCount,
                          const struct iovec *vectors, const void *attribute);
  // Logical bytes per chunk: the smallest unit a read decodes, 0 for an empty row.
  uint32_t chunkSize;
};

constexpr int kRegisteredCompressors = 5;
constexpr int kMaxCompressorEntries = 255;

extern const CompressorOps allCompressors[kRegisteredCompressors];

// The row that reads files of this type, or null when the type cannot be decompressed here.
const CompressorOps *compressorForReading(uint32_t compressionType);

struct CompressorContext {
  int32_t inPlace;                  // attributes land on the file itself
  int32_t truncateAndRestoreTimes;  // after success: data fork to 0, times restored
  int32_t setCompressedFlag;        // after success: flags become the compressed flag
  const CompressorOps *compressors[kMaxCompressorEntries];
  uint32_t compressorTypes[kMaxCompressorEntries];
  int32_t compressorCount;
  void **compressorContexts;  // owned, one per entry
  uint32_t *successCounts;    // owned, one per entry; atomic adds
  int32_t compressionLevel;
  uint8_t allowLargeResourceForks;
  uint8_t verifyChecksums;
  pthread_mutex_t tocLock;  // serialises table-of-contents appends
  int32_t tocFd;            // -1 unless writing a table of contents
  // Statistics; atomic adds only.
  int32_t filesSeen;
  int32_t filesCompressed;
  int64_t bytesCompressed;
  int64_t bytesCompressedRounded;
  int64_t bytesNotCompressed;
  int64_t bytesNotCompressedRounded;
};
