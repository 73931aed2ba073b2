// The chunking engine shared by the compression types.
//
// A file is stored as independently compressed chunks of `chunkSize` uncompressed bytes. Each
// chunk is one zlib-format stream made in a single call of the engine, or, when it cannot make it
// smaller, the marker byte 0xFF followed by the raw bytes (a zlib stream never starts with
// 0xFF). The engine knows nothing about where chunks are stored: a type hands it two callbacks.
#pragma once

#include <stdint.h>
#include <stdio.h>
#include <sys/uio.h>

#include "Common/FileHandle.h"

constexpr uint8_t kStoredChunkMarker = 0xFF;
constexpr uint32_t kChunkError = 0xFFFFFFFF;

// Stores one chunk. buffer holds prefixBytes free bytes, then the chunk's length bytes.
// Chunks arrive in order, each once; chunkCount is the same on every call. 0 goes on; any
// other value stops compression and becomes the engine's result.
typedef int (*EmitBytesFn)(void *state, uint64_t chunkCount, uint64_t chunkIndex, uint8_t *buffer, uint32_t length);

// Places the stored bytes of chunk chunkIndex at buffer + the type's prefix and returns their
// count; 0 when there is no such chunk (end of data), kChunkError on error. capacity is always
// chunkSize + 1.
typedef uint32_t (*SupplyChunkFn)(void *state, uint64_t chunkIndex, uint8_t *buffer, uint32_t capacity);

// Reads the handle's data chunk by chunk and emits every chunk. maxChunks (0 = no limit) is the
// most chunks accepted; maxChunkBytes (0 = none) caps every emitted chunk. Returns 0 when every
// chunk was emitted and the whole file read, emitBytes's non-zero result when it stopped the
// run, -1 for any other failure. After a failure on a handle with canUnread, the consumed bytes
// are given back to it (chunks already emitted are rebuilt through supplyChunk), so the next
// reader gets the whole file from offset 0.
int chunkingCompressor(FileHandle *handle, int32_t maxChunks, uint32_t chunkSize, uint32_t maxChunkBytes,
                       int32_t prefixBytes, int32_t suffixBytes, void *state, EmitBytesFn emitBytes,
                       SupplyChunkFn supplyChunk, int32_t level);

// For a type that fails in its own last steps after chunkingCompressor consumed the whole file
// (size bytes) and emitted every chunk: gives the file back to a handle with canUnread, rebuilt
// from the emitted chunks through supplyChunk, so that the next reader still gets every byte.
// Does nothing on other handles. A rebuild that falls short is reported and gives back less.
void chunkingGiveBackAll(FileHandle *handle, int64_t size, uint32_t chunkSize, int32_t prefixBytes,
                         int32_t suffixBytes, void *state, SupplyChunkFn supplyChunk);

// Decompresses size bytes from offset into the vectors (which together hold exactly size
// bytes), fetching chunks through supplyChunk. Returns the bytes written (fewer than size when
// the chunks end first), or -1.
int64_t chunkingDecompressor(int64_t offset, uint64_t size, uint32_t vectorCount, const struct iovec *vectors,
                             uint32_t chunkSize, int32_t prefixBytes, int32_t suffixBytes, void *state,
                             SupplyChunkFn supplyChunk);

// Decodes one whole chunk into out: a zlib stream that must end, with its Adler-32 checked,
// exactly at the chunk's last byte, or a stored chunk. Returns the bytes produced, or -1 when
// the chunk is anything else or holds more than capacity bytes. For checking a compressed form
// as a whole (the readers above accept the first bytes of a chunk without its trailer).
int64_t decodeWholeChunk(const uint8_t *chunk, uint32_t length, uint8_t *out, uint32_t capacity);
