// Type 4: chunks of 64 KiB in the resource fork, laid out as a fork holding one 'cmpf'
// resource (ID 1) whose data is the chunk count, the chunk table and the chunks; the header
// attribute holds only the 16-byte header. A file whose one chunk is small enough goes into
// the header attribute instead, in the type-3 form.
//
// Fork layout (D = length of the resource's data, N = chunk count):
//   0    four big-endian words: 256, 260 + D, D + 4, 50
//   16   240 zero bytes
//   256  D, big-endian
//   260  N, little-endian
//   264  N table entries: chunk offset (counted from 260) and length, little-endian u32 each
//   ...  the chunks, back to back
//   260 + D  the 50-byte resource map
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <vector>

#include "Common/Diagnostics.h"
#include "Common/KeptBuffer.h"
#include "Common/commonUtils.h"
#include "Compressors/Zlib/ByteOrder.h"
#include "Compressors/Zlib/Type4/compressorType4.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Compressors/Zlib/Type4/compressorType4Imp";

namespace {

constexpr uint32_t kResourceDataOffset = 256;
constexpr uint32_t kDataStart = 260;  // the chunk count; chunk-table offsets count from here
constexpr uint32_t kMapLength = 50;
constexpr int64_t kForkOverhead = kDataStart + kMapLength;  // the fork is D + 310 bytes
constexpr int64_t kMaxFileSize = 67108864;                  // 64 MiB, unless large forks are allowed
constexpr int64_t kMaxDataLength = 16777216 - kForkOverhead;  // a 16 MiB fork, likewise
// Fork positions and table fields are 32-bit: the whole fork must stay below 4 GiB.
constexpr int64_t kMaxDataLength32 = 0xFFFFFFFFLL - kForkOverhead;
constexpr uint64_t kMaxChunkCount = 0xFFFFFFFFULL;
constexpr uint32_t kTableEntrySize = 8;

// The resource map: one type 'cmpf' with one resource, ID 1, no name, whose data starts at
// the beginning of the resource data. Written unchanged.
constexpr uint8_t kDataSuffix[kMapLength] = {
    0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,  // reserved copy of the fork header
    0, 0, 0, 0,                                      // handle to the next map
    0, 0,                                            // file reference number
    0, 0,                                            // fork attributes
    0x00, 0x1C,                                      // offset to the type list
    0x00, 0x32,                                      // offset to the name list (none)
    0x00, 0x00,                                      // number of types - 1
    'c', 'm', 'p', 'f',                              // the type
    0x00, 0x00,                                      // resources of this type - 1
    0x00, 0x0A,                                      // offset to its reference list
    0x00, 0x01,                                      // resource ID
    0xFF, 0xFF,                                      // no name
    0x00,                                            // resource attributes
    0x00, 0x00, 0x00,                                // offset of its data in the resource data
    0, 0, 0, 0,                                      // handle
};

struct Type4Context {
  uint32_t compressionLevel;
  uint8_t allowLargeResourceForks;
};

struct Type4State {
  FileHandle *handle;
  uint64_t dataStart;
  int64_t dataLimit;
  uint64_t fileSize;
  uint32_t dataLength;
  uint32_t chunkCount;
  uint32_t inlineLength;  // length of the header attribute when the type-3 form was written
  uint32_t supplyOffset;  // the engine's prefix for this call
  bool consumedAll;       // the engine read the whole file and emitted every chunk
  // Writing: every write at a position of a large fork rewrites whole segments of it, so the
  // table is kept here and written whole after the last chunk, and chunks go out in pieces of
  // up to kPendingLimit bytes. A fork that fits those bytes is built there whole (wholeFork) and
  // written in one piece. Chunks are read back (to give input back) from here or the fork.
  uint8_t *table;         // chunkCount entries (sys::calloc), null until the first chunk
  uint8_t *pending;       // fork bytes not yet written, kPendingLimit bytes of room
  uint32_t pendingLength;
  uint64_t pendingStart;  // fork position of pending[0]
  bool wholeFork;         // pending holds the fork from position 0; only the count written yet
  // Reading: a window of table entries read ahead in one call, so that a run of chunks costs
  // one read each instead of two. Null while writing, when the table is still being filled.
  uint8_t *tableWindow;
  uint32_t windowFirst;   // chunk index of the window's first entry
  uint32_t windowCount;   // entries held
  uint32_t wantedLast;    // last chunk the current request needs
  // Reading from the start of the file: the fork as far as one read of kReadAhead bytes from
  // its start goes (count, table, first chunks; all of a small fork), from the chunk count on.
  // Entries and chunks found there are not read again.
  const uint8_t *ahead;
  uint32_t aheadLength;
};

// Entries read ahead at most: 4 KiB of table, 32 MiB of logical data.
constexpr uint32_t kTableWindowEntries = 512;
// Chunk bytes held back before they are written to the fork in one piece.
constexpr uint32_t kPendingLimit = 1048576;
// Bytes of the fork read ahead from its start when a file is read from its start.
constexpr uint32_t kReadAhead = 131072;

// Copies [position, position + length) of the fork from the bytes read ahead, when they hold it.
bool copyFromAhead(const Type4State *state, uint64_t position, uint64_t length, uint8_t *out) {
  if (!state->ahead || position < kDataStart || position - kDataStart + length > state->aheadLength) return false;
  memcpy(out, state->ahead + (position - kDataStart), length);
  return true;
}

int forkReadOptions() { return osSupportsDecmpfs() ? kShowCompressionOption : 0; }

int writeFork(Type4State *state, const void *bytes, uint32_t length, uint64_t position) {
  FileHandle *handle = state->handle;
  if (handle->setxattr(handle, kResourceForkXattrName, bytes, length, static_cast<uint32_t>(position), 0) != 0) {
    PLZC_ERR("%s:%d: fh_setxattr: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

// Writes the bytes held back; they stay held when the write fails. A whole fork written this
// way is an unfinished one (zero head, table to come), as when the count is written first.
int flushPending(Type4State *state) {
  if (state->pendingLength == 0) return 0;
  if (writeFork(state, state->pending, state->pendingLength, state->pendingStart) != 0) return -1;
  state->pendingStart += state->pendingLength;
  state->pendingLength = 0;
  state->wholeFork = false;
  return 0;
}

// Puts the chunks and the table in the fork: after the last chunk, and before chunks are read
// back from it by anything other than supplyChunkType4. A whole fork only takes its table: it
// is written when head and map are in place.
int flushChunksAndTable(Type4State *state) {
  if (state->wholeFork) {
    if (state->table) memcpy(state->pending + kDataStart + 4, state->table, kTableEntrySize * state->chunkCount);
    return 0;
  }
  if (flushPending(state) != 0) return -1;
  if (!state->table) return 0;
  return writeFork(state, state->table, kTableEntrySize * state->chunkCount, state->dataStart + 4);
}

int emitBytesType4(void *opaque, uint64_t chunkCount, uint64_t chunkIndex, uint8_t *buffer, uint32_t length) {
  auto *state = static_cast<Type4State *>(opaque);
  FileHandle *handle = state->handle;
  if (chunkIndex == 0) {
    if (chunkCount > kMaxChunkCount) return -1;
    if (chunkCount == 1 && length + kDiskHeaderSize <= kMaxType3AttributeSize) {
      plzc::storeDiskHeader(buffer, 3, state->fileSize);
      if (handle->setxattr(handle, kDecmpfsXattrName, buffer, length + kDiskHeaderSize, 0, 0) != 0) {
        PLZC_ERR("%s:%d: setxattr %s: %s\n", handle->path, strerror(errno));
        return -1;
      }
      state->inlineLength = length + kDiskHeaderSize;
      return 0;
    }
    // The table alone must fit the budget; checked in 64 bits so that a huge count cannot wrap.
    uint64_t tableEnd = kTableEntrySize * chunkCount + 4;
    if (static_cast<int64_t>(tableEnd) > state->dataLimit) return -1;
    state->table = static_cast<uint8_t *>(sys::calloc(static_cast<size_t>(chunkCount), kTableEntrySize));
    if (!state->table) {
      PLZC_ERR("%s:%d: calloc: %s\n", strerror(errno));
      return -1;
    }
    state->chunkCount = static_cast<uint32_t>(chunkCount);
    state->dataLength = static_cast<uint32_t>(tableEnd);
    // The count goes out at once, whatever follows: a file whose fork exists is one that
    // something is compressing (or has compressed), and is left alone by anyone else who
    // reaches it under another name meanwhile.
    uint8_t count[4];
    plzc::storeLE32(count, static_cast<uint32_t>(chunkCount));
    if (writeFork(state, count, sizeof count, state->dataStart) != 0) return -1;
    if (kDataStart + tableEnd <= kPendingLimit / 2) {
      // Head, count and room for the table first; the chunks follow in the same buffer.
      state->wholeFork = true;
      state->pendingStart = 0;
      state->pendingLength = static_cast<uint32_t>(kDataStart + tableEnd);
      memset(state->pending, 0, state->pendingLength);
      plzc::storeLE32(state->pending + kDataStart, static_cast<uint32_t>(chunkCount));
    } else {
      state->pendingStart = state->dataStart + tableEnd;
    }
  }
  if (static_cast<int64_t>(state->dataLength) + length > state->dataLimit) return -1;
  // A whole fork keeps room for its map.
  uint32_t room = state->wholeFork ? kPendingLimit - kMapLength : kPendingLimit;
  if (state->pendingLength + length > room && flushPending(state) != 0) return -1;
  memcpy(state->pending + state->pendingLength, buffer + kDiskHeaderSize, length);
  state->pendingLength += length;
  // The entry only once its chunk is held: an entry always names bytes that can be read back.
  uint8_t *entry = state->table + kTableEntrySize * chunkIndex;
  plzc::storeLE32(entry, state->dataLength);
  plzc::storeLE32(entry + 4, length);
  state->dataLength += length;
  if (chunkIndex + 1 == state->chunkCount && flushChunksAndTable(state) != 0) return -1;
  return 0;
}

bool inWindow(const Type4State *state, uint64_t chunkIndex) {
  return state->tableWindow && chunkIndex >= state->windowFirst &&
         chunkIndex < uint64_t{state->windowFirst} + state->windowCount;
}

// The table entry of chunkIndex, from wherever it is at hand: the table being written, the
// bytes read ahead, the window (read now when it does not hold the entry), or a read of its
// own. False after a message.
bool tableEntry(Type4State *state, uint64_t chunkIndex, uint8_t *entry) {
  if (state->table) {
    memcpy(entry, state->table + kTableEntrySize * chunkIndex, kTableEntrySize);
    return true;
  }
  FileHandle *handle = state->handle;
  // A corrupt count or table can point past what 32-bit fork positions reach.
  uint64_t entryPosition = kDataStart + 4 + kTableEntrySize * chunkIndex;
  if (copyFromAhead(state, entryPosition, kTableEntrySize, entry)) return true;
  if (state->tableWindow && !inWindow(state, chunkIndex)) {
    // Read the entries of this chunk and of the next ones the request needs in one call.
    uint64_t count = std::min<uint64_t>({kTableWindowEntries, state->chunkCount - chunkIndex,
                                         state->wantedLast >= chunkIndex ? state->wantedLast - chunkIndex + 1 : 1});
    int64_t got = -1;
    if (entryPosition <= 0xFFFFFFFFULL - kTableEntrySize * count)
      got = handle->getxattr(handle, kResourceForkXattrName, state->tableWindow, kTableEntrySize * count,
                             static_cast<uint32_t>(entryPosition), forkReadOptions());
    // A short or failed read leaves the window empty; the single read below then reports why.
    state->windowFirst = static_cast<uint32_t>(chunkIndex);
    state->windowCount = got > 0 ? static_cast<uint32_t>(got / kTableEntrySize) : 0;
  }
  if (inWindow(state, chunkIndex)) {
    memcpy(entry, state->tableWindow + kTableEntrySize * (chunkIndex - state->windowFirst), kTableEntrySize);
    return true;
  }
  int64_t got = -1;
  if (entryPosition <= 0xFFFFFFFFULL - kTableEntrySize)
    got = handle->getxattr(handle, kResourceForkXattrName, entry, kTableEntrySize,
                           static_cast<uint32_t>(entryPosition), forkReadOptions());
  else
    errno = EINVAL;
  if (got != static_cast<int64_t>(kTableEntrySize)) {
    PLZC_ERR("%s:%d: fh_getxattr %s: %s\n", handle->path, strerror(errno));
    return false;
  }
  return true;
}

uint32_t supplyChunkType4(void *opaque, uint64_t chunkIndex, uint8_t *buffer, uint32_t capacity) {
  auto *state = static_cast<Type4State *>(opaque);
  FileHandle *handle = state->handle;
  if (chunkIndex >= state->chunkCount) {
    PLZC_ERR("%s:%d: Error: %d is greater than max chunk %d\n", static_cast<int>(chunkIndex),
             static_cast<int>(state->chunkCount));
    return 0;
  }
  uint8_t entry[kTableEntrySize];
  if (!tableEntry(state, chunkIndex, entry)) return kChunkError;
  uint32_t chunkOffset = plzc::loadLE32(entry);
  uint32_t chunkLength = plzc::loadLE32(entry + 4);
  if (state->table && chunkOffset == 0) {
    PLZC_ERR("%s:%d: Error: %s: chunk %d was never written\n", handle->path, static_cast<int>(chunkIndex));
    return kChunkError;
  }
  if (chunkLength > capacity) {
    PLZC_ERR("%s:%d: Error: %s: %d is less than needed size %d\n", handle->path, static_cast<int>(capacity),
             static_cast<int>(chunkLength));
    return kChunkError;
  }
  uint64_t chunkPosition = static_cast<uint64_t>(kDataStart) + chunkOffset;
  uint8_t *out = buffer + state->supplyOffset;
  // Being written, the newest chunks are still held back in memory.
  if (state->table && chunkPosition >= state->pendingStart) {
    memcpy(out, state->pending + (chunkPosition - state->pendingStart), chunkLength);
    return chunkLength;
  }
  if (copyFromAhead(state, chunkPosition, chunkLength, out)) return chunkLength;
  int64_t got = -1;
  if (chunkPosition <= 0xFFFFFFFFULL)
    got = handle->getxattr(handle, kResourceForkXattrName, out, chunkLength, static_cast<uint32_t>(chunkPosition),
                           forkReadOptions());
  else
    errno = EINVAL;
  if (got != static_cast<int64_t>(chunkLength)) {
    PLZC_ERR("%s:%d: fh_getxattr %s: %s\n", handle->path, strerror(errno));
    return kChunkError;
  }
  return chunkLength;
}

int64_t roundUpBlocks(int64_t bytes, int64_t blockSize) { return (bytes + blockSize - 1) / blockSize; }

int64_t usableBlockSize(FileHandle *handle) {
  int64_t blockSize = handle->blockSize(handle);
  return blockSize > 0 ? blockSize : 4096;
}

// Compresses the file into the fork and the header attribute; *inlineForm tells whether the
// type-3 form was written instead. 0, or the engine's result, or -1. The run's state stays in
// *state: after the engine consumed the whole file (state->consumedAll) its chunks can be
// read back through it.
int doCompressType4(FileHandle *handle, int32_t level, bool allowLargeResourceForks, uint8_t *pending,
                    Type4State *out, bool *inlineForm) {
  *inlineForm = false;
  int64_t size = handle->size(handle);
  if (size < 0) return -1;
  int64_t blockSize = usableBlockSize(handle);
  // The whole fork, D + 310, must save at least a fifth of the file's blocks.
  int64_t budgetBlocks = std::max<int64_t>(roundUpBlocks(size, blockSize) * 4 / 5, 1);
  int64_t dataLimit = budgetBlocks * blockSize - kForkOverhead;
  if (!allowLargeResourceForks && dataLimit > kMaxDataLength) dataLimit = kMaxDataLength;
  dataLimit = std::min(dataLimit, kMaxDataLength32);

  Type4State &state = *out;
  state = {};
  state.handle = handle;
  state.dataStart = kDataStart;
  state.dataLimit = dataLimit;
  state.fileSize = static_cast<uint64_t>(size);
  state.supplyOffset = kDiskHeaderSize;
  state.pending = pending;
  int result = chunkingCompressor(handle, 0, kType4ChunkSize, 0, static_cast<int32_t>(kDiskHeaderSize), 0, &state,
                                  emitBytesType4, supplyChunkType4, level);
  if (result != 0) return result;
  state.consumedAll = true;
  if (state.inlineLength != 0) {
    *inlineForm = true;
    return 0;
  }

  uint32_t dataLength = state.dataLength;
  uint8_t head[kDataStart] = {};
  plzc::storeBE32(head, kResourceDataOffset);
  plzc::storeBE32(head + 4, kDataStart + dataLength);
  plzc::storeBE32(head + 8, dataLength + 4);
  plzc::storeBE32(head + 12, kMapLength);
  plzc::storeBE32(head + kResourceDataOffset, dataLength);
  if (state.wholeFork) {
    memcpy(state.pending, head, sizeof head);
    memcpy(state.pending + state.pendingLength, kDataSuffix, sizeof kDataSuffix);
    if (writeFork(&state, state.pending, state.pendingLength + kMapLength, 0) != 0) return -1;
  } else {
    if (writeFork(&state, head, sizeof head, 0) != 0) return -1;
    if (writeFork(&state, kDataSuffix, sizeof kDataSuffix, kDataStart + static_cast<uint64_t>(dataLength)) != 0)
      return -1;
  }

  // Last of all, so that a reader never finds a type-4 header before the fork is complete.
  auto *header = static_cast<uint8_t *>(sys::malloc(kDiskHeaderSize));
  if (!header) {
    PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
    return -1;
  }
  plzc::storeDiskHeader(header, 4, static_cast<uint64_t>(size));
  result = handle->setxattr(handle, kDecmpfsXattrName, header, kDiskHeaderSize, 0, 0);
  if (result != 0) PLZC_ERR("%s:%d: fh_setxattr %s: %s\n", handle->path, strerror(errno));
  free(header);
  return result;
}

void removeFork(FileHandle *handle) {
  int savedErrno = errno;
  handle->removexattr(handle, kResourceForkXattrName, 0);
  errno = savedErrno;
}

// Gives up the file. When the engine had consumed all of it from a read-once source (a data
// pool behind an overlay), the file is first rebuilt from the fork and given back, so that the
// plain write-out that follows still gets every byte.
int refuse(FileHandle *handle, Type4State *state) {
  if (state->consumedAll)
    chunkingGiveBackAll(handle, static_cast<int64_t>(state->fileSize), kType4ChunkSize,
                        static_cast<int32_t>(kDiskHeaderSize), 0, state, supplyChunkType4);
  removeFork(handle);
  return -1;
}

}  // namespace

void *initCompressorType4(void *initArg1, void *initArg2, int32_t compressionLevel, int32_t allowLargeResourceForks) {
  auto *context = static_cast<Type4Context *>(sys::calloc(1, sizeof(Type4Context)));
  if (context) {
    context->compressionLevel = static_cast<uint32_t>(compressionLevel);
    context->allowLargeResourceForks = allowLargeResourceForks != 0;
  }
  return context;
}

void freeContextType4(void *context) { free(context); }

int compressFileType4(FileHandle *handle, const char *path, int64_t size, void *opaqueContext) {
  auto *context = static_cast<Type4Context *>(opaqueContext);
  if (!context->allowLargeResourceForks && size > kMaxFileSize) return -1;
  bool inlineForm = false;
  KeptBuffer pending(KeptBuffer::kForkPending, kPendingLimit);
  if (!pending.get()) {
    PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
    return -1;
  }
  Type4State state = {};
  struct TableOwner {
    Type4State *state;
    ~TableOwner() { free(state->table); }
  } tableOwner{&state};
  if (doCompressType4(handle, static_cast<int32_t>(context->compressionLevel), context->allowLargeResourceForks != 0,
                      pending.get(), &state, &inlineForm) != 0)
    return refuse(handle, &state);
  if (inlineForm) return 0;

  int64_t forkSize = handle->getxattr(handle, kResourceForkXattrName, nullptr, 0, 0, 0);
  if (forkSize < 0) return refuse(handle, &state);
  int64_t blockSize = usableBlockSize(handle);
  int64_t forkBlocks = roundUpBlocks(forkSize, blockSize);
  int64_t fileBlocks = roundUpBlocks(size, blockSize);
  if (forkBlocks * 5 <= fileBlocks * 4) return 0;
  printf("  Type4 file did not shrink: %s (%lld/%lld blocks -> %lld/%lld %.1lf%%)\n", path,
         static_cast<long long>(size), static_cast<long long>(fileBlocks), static_cast<long long>(forkSize),
         static_cast<long long>(forkBlocks), forkBlocks * 100.0 / static_cast<double>(fileBlocks));
  fflush(stdout);
  return refuse(handle, &state);
}

int64_t doUncompressType4(FileHandle *handle, int64_t offset, uint64_t size, uint32_t vectorCount,
                          const struct iovec *vectors, const void *attribute) {
  if (!handle) {
    PLZC_ERR("%s:%d: null inputFile: %s\n", strerror(errno));
    return -1;
  }
  Type4State state = {};
  state.handle = handle;
  state.dataStart = kDataStart;
  uint8_t count[4];
  uint8_t *countAt = count;
  // From the start of the file, one read takes the fork from its start (whole segments, copied
  // once), the count and as much after it as kReadAhead allows; a read that does not even hold
  // the count fails as the count's own read would.
  std::optional<KeptBuffer> aheadBuffer;
  int64_t got;
  if (offset == 0) {
    aheadBuffer.emplace(KeptBuffer::kForkAhead, kReadAhead);
    if (!aheadBuffer->get()) {
      PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
      return -1;
    }
    got = handle->getxattr(handle, kResourceForkXattrName, aheadBuffer->get(), kReadAhead, 0, forkReadOptions());
    if (got >= static_cast<int64_t>(kDataStart + sizeof count)) {
      countAt = aheadBuffer->get() + kDataStart;
      state.ahead = countAt;
      state.aheadLength = static_cast<uint32_t>(got - kDataStart);
    } else if (got >= 0) {
      got = std::max<int64_t>(got - kDataStart, 0);
    }
  } else {
    got = handle->getxattr(handle, kResourceForkXattrName, count, sizeof count, kDataStart, forkReadOptions());
  }
  if (got < static_cast<int64_t>(sizeof count) || (countAt == count && got != static_cast<int64_t>(sizeof count))) {
    PLZC_ERR("%s:%d: readBytes %s: %lld: %s\n", handle->path, static_cast<long long>(got), strerror(errno));
    return -1;
  }
  state.chunkCount = plzc::loadLE32(countAt);
  uint8_t window[kTableWindowEntries * kTableEntrySize];
  state.tableWindow = window;
  state.wantedLast = size == 0 ? 0 : static_cast<uint32_t>(std::min<uint64_t>(
                                         (static_cast<uint64_t>(offset) + size - 1) / kType4ChunkSize, 0xFFFFFFFFULL));
  int64_t result = chunkingDecompressor(offset, size, vectorCount, vectors, kType4ChunkSize, 0, 0, &state,
                                        supplyChunkType4);
  if (result == -1) PLZC_ERR("%s:%d: chunkingDecompressor %s: %s\n", handle->path, strerror(errno));
  return result;
}

int readForkShapeType4(FileHandle *handle, Type4ForkShape *shape) {
  int options = forkReadOptions();
  int64_t forkSize = handle->getxattr(handle, kResourceForkXattrName, nullptr, 0, 0, options);
  uint8_t head[kDataStart + 4];
  if (forkSize < static_cast<int64_t>(sizeof head) ||
      handle->getxattr(handle, kResourceForkXattrName, head, sizeof head, 0, options) != static_cast<int64_t>(sizeof head))
    return -1;
  shape->chunkCount = plzc::loadLE32(head + kDataStart);
  if (shape->chunkCount == 0) return -1;
  if (std::all_of(head, head + kDataStart, [](uint8_t byte) { return byte == 0; })) {
    shape->finished = false;
    return 0;
  }
  uint32_t dataLength = plzc::loadBE32(head + kResourceDataOffset);
  uint8_t expected[kResourceDataOffset] = {};
  plzc::storeBE32(expected, kResourceDataOffset);
  plzc::storeBE32(expected + 4, kDataStart + dataLength);
  plzc::storeBE32(expected + 8, dataLength + 4);
  plzc::storeBE32(expected + 12, kMapLength);
  if (memcmp(head, expected, sizeof expected) != 0) return -1;
  // The head is written just before the map: a fork that ends where the map goes is unfinished.
  if (forkSize == kDataStart + static_cast<int64_t>(dataLength)) {
    shape->finished = false;
    return 0;
  }
  uint8_t map[kMapLength];
  if (forkSize != kForkOverhead + dataLength ||
      handle->getxattr(handle, kResourceForkXattrName, map, sizeof map, kDataStart + dataLength, options) !=
          static_cast<int64_t>(sizeof map) ||
      memcmp(map, kDataSuffix, sizeof map) != 0)
    return -1;
  shape->finished = true;
  return 0;
}

int64_t decodeChunkType4(FileHandle *handle, uint32_t index, uint8_t *out) {
  int options = forkReadOptions();
  uint64_t entryPosition = kDataStart + 4 + static_cast<uint64_t>(kTableEntrySize) * index;
  if (entryPosition > 0xFFFFFFFFULL - kTableEntrySize) return -1;
  uint8_t entry[kTableEntrySize];
  int64_t got = handle->getxattr(handle, kResourceForkXattrName, entry, sizeof entry,
                                 static_cast<uint32_t>(entryPosition), options);
  if (got == 0) return 0;
  if (got != static_cast<int64_t>(sizeof entry)) return -1;
  uint32_t chunkOffset = plzc::loadLE32(entry), chunkLength = plzc::loadLE32(entry + 4);
  if (chunkOffset == 0 && chunkLength == 0) return 0;
  uint64_t chunkPosition = static_cast<uint64_t>(kDataStart) + chunkOffset;
  if (chunkLength == 0 || chunkLength > kType4ChunkSize + 1 || chunkPosition > 0xFFFFFFFFULL) return -1;
  std::vector<uint8_t> chunk(chunkLength);
  got = handle->getxattr(handle, kResourceForkXattrName, chunk.data(), chunkLength,
                         static_cast<uint32_t>(chunkPosition), options);
  if (got != static_cast<int64_t>(chunkLength)) return -1;
  return decodeWholeChunk(chunk.data(), chunkLength, out, kType4ChunkSize);
}
