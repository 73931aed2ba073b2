// Type 3: a file of at most one 128 KiB chunk whose chunk, compressed or stored, fits behind
// the 16-byte header inside the header attribute (3802 bytes in all).
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/commonUtils.h"
#include "Compressors/Zlib/ByteOrder.h"
#include "Compressors/Zlib/Type3/compressorType3.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Compressors/Zlib/Type3/compressorType3Imp";

namespace {

struct Type3Context {
  uint32_t compressionLevel;
};

struct Type3State {
  FileHandle *handle;     // compression only
  const char *path;       // compression only
  const void *attribute;  // decompression only: length (host-order uint32), then the attribute
  uint64_t fileSize;
  uint32_t payloadLength;
};

void printTooManyChunks() {
  fputs("too many chunks for type 3", stdout);
  fflush(stdout);
}

int emitBytesType3(void *opaque, uint64_t chunkCount, uint64_t chunkIndex, uint8_t *buffer, uint32_t length) {
  auto *state = static_cast<Type3State *>(opaque);
  if (chunkIndex != 0) {
    printTooManyChunks();
    return -1;
  }
  if (static_cast<uint64_t>(length) + kDiskHeaderSize > kMaxType3AttributeSize) return -1;
  state->payloadLength = length;
  // The engine left the header's room in front of the chunk: the attribute goes out in one piece.
  plzc::storeDiskHeader(buffer, 3, state->fileSize);
  if (state->handle->setxattr(state->handle, kDecmpfsXattrName, buffer, length + kDiskHeaderSize, 0, 0) != 0) {
    PLZC_ERR("%s:%d: setxattr %s: %s\n", state->handle->path, strerror(errno));
    return -1;
  }
  return 0;
}

uint32_t supplyChunkType3(void *opaque, uint64_t chunkIndex, uint8_t *buffer, uint32_t capacity) {
  auto *state = static_cast<Type3State *>(opaque);
  if (chunkIndex != 0) {
    printTooManyChunks();
    return kChunkError;
  }
  if (!state->attribute) {
    PLZC_ERR("%s:%d: null attr: %s\n", strerror(errno));
    return kChunkError;
  }
  uint32_t attributeLength;
  memcpy(&attributeLength, state->attribute, sizeof attributeLength);
  const uint8_t *attribute = static_cast<const uint8_t *>(state->attribute) + sizeof attributeLength;
  if (attributeLength < kDiskHeaderSize) {
    // No payload length can be taken from an attribute shorter than the header.
    errno = EINVAL;
    PLZC_ERR("%s:%d: sz %d is greater than cmpSize %d: %s\n", static_cast<int>(attributeLength - kDiskHeaderSize),
             static_cast<int>(capacity), strerror(errno));
    return kChunkError;
  }
  if (static_cast<uint64_t>(attributeLength) > static_cast<uint64_t>(capacity) + kDiskHeaderSize) {
    PLZC_ERR("%s:%d: vnode_fetch_compressed_attr: %s\n", strerror(errno));
    return kChunkError;
  }
  uint32_t payloadLength = attributeLength - kDiskHeaderSize;
  memcpy(buffer, attribute + kDiskHeaderSize, payloadLength);
  return payloadLength;
}

int doCompressType3(Type3State *state, int32_t level) {
  if (state->fileSize > kType3ChunkSize) return -1;
  return chunkingCompressor(state->handle, 1, kType3ChunkSize, kMaxType3AttributeSize,
                            static_cast<int32_t>(kDiskHeaderSize), 0, state, emitBytesType3, supplyChunkType3,
                            level);
}

}  // namespace

void *initCompressorType3(void *initArg1, void *initArg2, int32_t compressionLevel, int32_t allowLargeResourceForks) {
  auto *context = static_cast<Type3Context *>(sys::calloc(1, sizeof(Type3Context)));
  if (context) context->compressionLevel = static_cast<uint32_t>(compressionLevel);
  return context;
}

void freeContextType3(void *context) { free(context); }

int compressFileType3(FileHandle *handle, const char *path, int64_t size, void *context) {
  if (size == 0) return 0;
  if (size < 0) return -1;
  Type3State state = {};
  state.handle = handle;
  state.path = path;
  state.fileSize = static_cast<uint64_t>(size);
  return doCompressType3(&state, static_cast<int32_t>(static_cast<Type3Context *>(context)->compressionLevel));
}

int64_t doUncompressType3(FileHandle *handle, int64_t offset, uint64_t size, uint32_t vectorCount,
                          const struct iovec *vectors, const void *attribute) {
  Type3State state = {};
  state.attribute = attribute;
  return chunkingDecompressor(offset, size, vectorCount, vectors, kType3ChunkSize, 0, 0, &state, supplyChunkType3);
}

int64_t decodeAttributeType3(const uint8_t *attribute, uint32_t length, uint8_t *out) {
  if (length <= kDiskHeaderSize || length > kMaxType3AttributeSize) return -1;
  return decodeWholeChunk(attribute + kDiskHeaderSize, length - kDiskHeaderSize, out, kType3ChunkSize);
}
