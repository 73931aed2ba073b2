// The chunking engine: the chunk loop shared by the compression types.
//
// Chunks are encoded and decoded through the process's engine (Common/ChunkEngine.h); the
// loops here decide sizes, the stored fallback and where every byte goes, the same for every
// engine.
#include "Common/commonUtils.h"

#include <zlib.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "Common/ChunkEngine.h"
#include "Common/Diagnostics.h"
#include "Common/KeptBuffer.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Common/commonUtils";

namespace {

bool isPowerOfTwo(uint32_t value) { return value != 0 && (value & (value - 1)) == 0; }

// Frees with free() on scope exit; the engine's buffers come from sys::malloc.
struct FreeDeleter {
  void operator()(void *block) const { free(block); }
};
using Buffer = std::unique_ptr<uint8_t[], FreeDeleter>;

Buffer allocate(size_t size) { return Buffer(static_cast<uint8_t *>(sys::malloc(size))); }

// Where the compressor stood when its run failed, for the give-back.
struct ConsumedInput {
  int64_t totalRead;
  int64_t lastOffset;  // file offset of the last chunk read
  int64_t lastCount;   // bytes of it read (0 when its read failed)
  const uint8_t *lastBytes;
};

// Pushes the bytes a failed run consumed back into the handle, so that the next reader gets
// the file from offset 0: the chunks already emitted are rebuilt through supplyChunk, the last
// chunk's raw bytes are still in the input buffer.
void giveBack(FileHandle *handle, const ConsumedInput &consumed, uint32_t chunkSize, int32_t prefixBytes,
              int32_t suffixBytes, void *state, SupplyChunkFn supplyChunk) {
  int64_t consumedCount = consumed.lastOffset + consumed.lastCount;
  if (consumed.totalRead - consumed.lastCount != consumed.lastOffset)
    PLZC_ERR("%s:%d: Error: unread count mismatch: %lld vs %lld\n", static_cast<long long>(consumedCount),
             static_cast<long long>(consumed.totalRead));
  auto *unreadBuffer = static_cast<uint8_t *>(handle->unreadAlloc(handle, consumedCount));
  if (!unreadBuffer) {
    // The handle still holds the buffer of an earlier give-back: it already has the bytes.
    handle->unreadSetPos(handle, 0);
    return;
  }
  if (consumed.lastOffset > 0) {
    struct iovec vector = {unreadBuffer, static_cast<size_t>(consumed.lastOffset)};
    int64_t rebuilt = chunkingDecompressor(0, static_cast<uint64_t>(consumed.lastOffset), 1, &vector, chunkSize,
                                           prefixBytes, suffixBytes, state, supplyChunk);
    if (rebuilt != consumed.lastOffset)
      PLZC_ERR("%s:%d: Error: decmpCnt count mismatch: %lld vs %lld\n", static_cast<long long>(rebuilt),
               static_cast<long long>(consumed.lastOffset));
    // The last chunk's raw bytes belong right behind the rebuilt ones only when the rebuild
    // returned every byte emitted before them (lastOffset, or fewer after a short read).
    // Otherwise give back just the rebuilt bytes: a short give-back shows as a short file to
    // the next reader, bytes in the wrong place would not show at all.
    if (rebuilt != consumed.totalRead - consumed.lastCount) {
      handle->unreadSetPos(handle, std::max<int64_t>(rebuilt, 0));
      handle->unreadDone(handle);
      return;
    }
    handle->unreadSetPos(handle, rebuilt);
  }
  if (consumed.lastCount > 0) handle->unread(handle, consumed.lastBytes, consumed.lastCount);
  handle->unreadDone(handle);
}

// Copies up to count bytes into the vectors from (*vector, *position) on, moving to the next
// vector whenever one is full. Returns the bytes copied.
uint64_t copyIntoVectors(const uint8_t *bytes, uint64_t count, uint32_t vectorCount, const struct iovec *vectors,
                         uint32_t *vector, uint64_t *position) {
  uint64_t copied = 0;
  while (copied < count && *vector < vectorCount) {
    uint64_t room = vectors[*vector].iov_len - std::min<uint64_t>(*position, vectors[*vector].iov_len);
    uint64_t step = std::min(room, count - copied);
    if (step > 0) {
      memcpy(static_cast<uint8_t *>(vectors[*vector].iov_base) + *position, bytes + copied, step);
      copied += step;
      *position += step;
    }
    if (*position >= vectors[*vector].iov_len) {
      ++*vector;
      *position = 0;
    }
  }
  return copied;
}

}  // namespace

int chunkingCompressor(FileHandle *handle, int32_t maxChunks, uint32_t chunkSize, uint32_t maxChunkBytes,
                       int32_t prefixBytes, int32_t suffixBytes, void *state, EmitBytesFn emitBytes,
                       SupplyChunkFn supplyChunk, int32_t level) {
  if (!isPowerOfTwo(chunkSize)) return -1;
  int64_t size = handle->size(handle);
  if (size == -1) {
    PLZC_ERR("%s:%d: fileSize: %s\n", strerror(errno));
    return -1;
  }
  int64_t chunkCount = (size + chunkSize - 1) / chunkSize;
  if (maxChunks != 0 && chunkCount > maxChunks) return -1;

  uint32_t outputLimit = maxChunkBytes ? maxChunkBytes : chunkSize;
  uint32_t storedLimit = maxChunkBytes ? maxChunkBytes : chunkSize + 1;
  Buffer output = allocate(static_cast<size_t>(prefixBytes) + outputLimit + suffixBytes);
  Buffer input = allocate(static_cast<size_t>(prefixBytes) + 1 + chunkSize + suffixBytes);
  if (!output || !input) {
    PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
    return -1;
  }
  // The chunk is read behind one free byte, where the stored-chunk marker goes.
  uint8_t *data = input.get() + prefixBytes + 1;

  ChunkEncoderLease encoder(currentChunkEngine(), level);
  int result = 0;
  bool failed = false;
  ConsumedInput consumed = {0, 0, 0, data};
  for (int64_t index = 0; index < chunkCount && !failed; index++) {
    int64_t offset = index * chunkSize;
    int64_t count = handle->pread(handle, data, chunkSize, offset);
    consumed.lastOffset = offset;
    consumed.lastCount = 0;
    if (count < 0) {
      PLZC_ERR("%s:%d: Error: fh_pread %lld\n", static_cast<long long>(count));
      result = -1;
      failed = true;
      break;
    }
    consumed.lastCount = count;
    consumed.totalRead += count;

    uint32_t n = static_cast<uint32_t>(count);
    uint32_t space = std::min(n, outputLimit);
    uint32_t produced = 0;
    int deflated = Z_OK;
    ChunkEncoder::Result encoded = encoder->encode(data, n, output.get() + prefixBytes, space, &produced, &deflated);
    uint8_t *chunk;
    uint32_t length;
    if (encoded == ChunkEncoder::Result::Fit) {
      chunk = output.get();
      length = produced;
    } else if (encoded == ChunkEncoder::Result::Failed) {
      PLZC_ERR("%s:%d: Error: failed to deflate in one pass: %d\n", deflated);
      result = -1;
      failed = true;
      break;
    } else {
      // The stream did not fit in the chunk's own size: store the chunk as it is, from the
      // input buffer, behind its marker.
      data[-1] = kStoredChunkMarker;
      chunk = input.get();
      length = n + 1;
      if (length > storedLimit) {
        result = -1;
        failed = true;
        break;
      }
    }
    int emitted = emitBytes(state, static_cast<uint64_t>(chunkCount), static_cast<uint64_t>(index), chunk, length);
    if (emitted != 0) {
      result = emitted;
      failed = true;
    }
  }
  if (!failed && consumed.totalRead != size) {
    PLZC_ERR("%s:%d: Error: file read error: got %lld instead of %lld\n", static_cast<long long>(consumed.totalRead),
             static_cast<long long>(size));
    result = -1;
    failed = true;
  }
  if (failed && consumed.totalRead != 0 && handle->canUnread)
    giveBack(handle, consumed, chunkSize, prefixBytes, suffixBytes, state, supplyChunk);
  return result;
}

void chunkingGiveBackAll(FileHandle *handle, int64_t size, uint32_t chunkSize, int32_t prefixBytes,
                         int32_t suffixBytes, void *state, SupplyChunkFn supplyChunk) {
  if (!handle->canUnread || size <= 0) return;
  giveBack(handle, ConsumedInput{size, size, 0, nullptr}, chunkSize, prefixBytes, suffixBytes, state, supplyChunk);
}

int64_t chunkingDecompressor(int64_t offset, uint64_t size, uint32_t vectorCount, const struct iovec *vectors,
                             uint32_t chunkSize, int32_t prefixBytes, int32_t suffixBytes, void *state,
                             SupplyChunkFn supplyChunk) {
  if (offset < 0) {
    fputs("invalid read position/size", stdout);
    fflush(stdout);
    return -1;
  }
  if (size == 0) return 0;
  if (!isPowerOfTwo(chunkSize)) return -1;

  uint64_t chunkIndex = static_cast<uint64_t>(offset) / chunkSize;
  uint32_t skip = static_cast<uint32_t>(static_cast<uint64_t>(offset) % chunkSize);
  Buffer scratch;
  if (skip > 0) {
    scratch = allocate(skip);
    if (!scratch) {
      PLZC_ERR("%s:%d: malloc failed: %s\n", strerror(errno));
      return -1;
    }
  }
  KeptBuffer chunkBuffer(KeptBuffer::kChunkInput, static_cast<size_t>(chunkSize) + prefixBytes + 1 + suffixBytes);
  if (!chunkBuffer.get()) {
    PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
    return -1;
  }

  ChunkDecoderLease decoder(currentChunkEngine(), chunkSize);
  uint32_t vector = 0;
  uint64_t position = 0;
  uint64_t remaining = size;
  uint64_t total = 0;
  while (total < size) {
    uint32_t n = supplyChunk(state, chunkIndex, chunkBuffer.get(), chunkSize + 1);
    if (n == kChunkError) {
      PLZC_ERR("%s:%d: supplyChunk: %s\n", strerror(errno));
      return -1;
    }
    if (n == 0) break;
    const uint8_t *chunk = chunkBuffer.get() + prefixBytes;
    uint64_t written = 0;
    if (chunk[0] == kStoredChunkMarker) {
      int64_t usable = static_cast<int64_t>(n) - 1 - skip;
      if (usable > 0)
        written = copyIntoVectors(chunk + 1 + skip, std::min<uint64_t>(remaining, static_cast<uint64_t>(usable)),
                                  vectorCount, vectors, &vector, &position);
    } else {
      decoder->begin(chunk, n);
      int inflated = Z_OK;
      uint32_t produced = 0;
      bool ok = skip == 0 || decoder->decodeInto(scratch.get(), skip, &produced, &inflated);
      while (ok && vector < vectorCount) {
        if (position > vectors[vector].iov_len) {
          PLZC_ERR("%s:%d: Error: overwrote end of vector\n");
          vector++;
          position = 0;
          continue;
        }
        uint64_t space = vectors[vector].iov_len - position;
        produced = 0;
        if (space > 0)
          ok = decoder->decodeInto(static_cast<uint8_t *>(vectors[vector].iov_base) + position,
                                    static_cast<uint32_t>(space), &produced, &inflated);
        written += produced;
        position += produced;
        if (!ok) break;
        if (decoder->chunkDone()) break;  // the next chunk continues in this vector
        vector++;                         // this vector is full
        position = 0;
      }
      if (!ok) {
        printf("failed to inflate in one pass: %d\n", inflated);
        fflush(stdout);
        decoder->dump(chunk, n);
        PLZC_ERR("%s:%d: decompressChunk %llu: %s\n", static_cast<unsigned long long>(chunkIndex), strerror(errno));
        return -1;
      }
    }
    total += written;
    remaining -= std::min(remaining, written);
    chunkIndex++;
    skip = 0;
  }
  return static_cast<int64_t>(total);
}

int64_t decodeWholeChunk(const uint8_t *chunk, uint32_t length, uint8_t *out, uint32_t capacity) {
  if (length == 0) return -1;
  if (chunk[0] == kStoredChunkMarker) {
    if (length - 1 > capacity) return -1;
    memcpy(out, chunk + 1, length - 1);
    return length - 1;
  }
  // zlib itself, whatever the engine: the check must not depend on the decoder in use.
  z_stream stream{};
  if (inflateInit(&stream) != Z_OK) return -1;
  stream.next_in = const_cast<Bytef *>(chunk);
  stream.avail_in = length;
  stream.next_out = out;
  stream.avail_out = capacity;
  int result = inflate(&stream, Z_FINISH);
  int64_t produced = result == Z_STREAM_END && stream.avail_in == 0 ? capacity - stream.avail_out : -1;
  inflateEnd(&stream);
  return produced;
}
