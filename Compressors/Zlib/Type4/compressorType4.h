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
