#include <fcntl.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Common/FileHandle.h"
#include "Common/commonUtils.h"
#include "Compressors/CompressorTestHelpers.h"
#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::ContainsRegex;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

// Cases print as their names.
template <typename Case>
  requires requires(const Case &c) { c.name; }
std::ostream &operator<<(std::ostream &os, const Case &c) {
  return os << c.name;
}

constexpr uint32_t kChunk = 4096;  // small chunks keep the cases readable and fast
constexpr int32_t kPrefix = 16;
constexpr int64_t kMixedSize = 4 * kChunk + 1000;

// Chunk 0 compresses, 1 is random (stored), 2 is zeros, 3 compresses, then 1000 random bytes.
Bytes mixedFile() {
  Bytes out;
  for (const Bytes &part : {repeatedBlock(kChunk, 1), randomBytes(kChunk, 2), Bytes(kChunk, 0), repeatedBlock(kChunk, 3),
                            randomBytes(1000, 4)})
    out.insert(out.end(), part.begin(), part.end());
  return out;
}

// A source that can be read once, front to back, like a data pool, behind a handle with the
// unread family, served as the overlay serves it: pushed-back bytes first, then the source
// where it stopped.
struct OnceSource {
  FileHandle handle{};
  Bytes data;
  size_t consumed = 0;              // bytes taken from the source
  size_t failReadAfter = SIZE_MAX;  // a source read that would pass this many bytes fails, once
  int64_t firstReadLimit = -1;      // when set, the first read returns at most this many bytes
  Bytes unreadBuffer;
  bool hasUnread = false;
  int64_t unreadPos = 0;
  std::vector<int64_t> unreadAllocSizes;
  int64_t filledAtDone = -1;  // the fill position at the last unreadDone

  static OnceSource *self(FileHandle *fh) { return static_cast<OnceSource *>(fh->priv); }

  explicit OnceSource(Bytes bytes) : data(std::move(bytes)) {
    handle.name = handle.path = const_cast<char *>("once");
    handle.canUnread = 1;
    handle.priv = this;
    handle.size = [](FileHandle *fh) { return static_cast<int64_t>(self(fh)->data.size()); };
    handle.pread = [](FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
      return self(fh)->read(static_cast<uint8_t *>(buffer), count, offset);
    };
    handle.unreadAlloc = [](FileHandle *fh, int64_t size) -> void * {
      OnceSource *s = self(fh);
      s->unreadAllocSizes.push_back(size);
      if (s->hasUnread) {
        EXPECT_GT(static_cast<int64_t>(s->unreadBuffer.size()), size) << "second buffer while one is held";
        return nullptr;
      }
      s->unreadBuffer.assign(static_cast<size_t>(size), 0xEE);
      s->hasUnread = true;
      s->unreadPos = 0;
      return s->unreadBuffer.data();
    };
    handle.unreadSetPos = [](FileHandle *fh, int64_t position) {
      OnceSource *s = self(fh);
      if (!s->hasUnread) return -1;
      if (position >= 0 && position <= static_cast<int64_t>(s->unreadBuffer.size())) s->unreadPos = position;
      return 0;
    };
    handle.unread = [](FileHandle *fh, const void *bytes, int64_t count) {
      OnceSource *s = self(fh);
      EXPECT_LE(s->unreadPos + count, static_cast<int64_t>(s->unreadBuffer.size()));
      count = std::min<int64_t>(count, static_cast<int64_t>(s->unreadBuffer.size()) - s->unreadPos);
      memcpy(s->unreadBuffer.data() + s->unreadPos, bytes, static_cast<size_t>(count));
      s->unreadPos += count;
      return 0;
    };
    handle.unreadDone = [](FileHandle *fh) {
      OnceSource *s = self(fh);
      s->filledAtDone = s->unreadPos;
      s->unreadBuffer.resize(static_cast<size_t>(s->unreadPos));
      s->unreadPos = 0;
      return 0;
    };
  }

  int64_t read(uint8_t *buffer, int64_t count, int64_t offset) {
    if (firstReadLimit >= 0) count = std::min(count, std::exchange(firstReadLimit, -1));
    int64_t fromBuffer = 0;
    if (hasUnread) {
      if (offset != unreadPos) return -1;  // pushed-back bytes are read first, in order
      fromBuffer = std::min<int64_t>(count, static_cast<int64_t>(unreadBuffer.size()) - unreadPos);
      if (fromBuffer > 0) {
        memcpy(buffer, unreadBuffer.data() + unreadPos, static_cast<size_t>(fromBuffer));
        unreadPos += fromBuffer;
        if (unreadPos == static_cast<int64_t>(unreadBuffer.size())) hasUnread = false;
      }
      if (fromBuffer == count) return fromBuffer;
    }
    if (consumed + static_cast<size_t>(count - fromBuffer) > failReadAfter) {
      failReadAfter = SIZE_MAX;
      return -1;
    }
    int64_t n = std::min<int64_t>(count - fromBuffer, static_cast<int64_t>(data.size() - consumed));
    memcpy(buffer + fromBuffer, data.data() + consumed, static_cast<size_t>(n));
    consumed += static_cast<size_t>(n);
    return fromBuffer + n;
  }

  // What the next reader gets, reading from offset 0 in pieces of `step` until the end.
  Bytes readAll(int64_t step) {
    Bytes out, piece(static_cast<size_t>(step));
    for (int64_t n; (n = read(piece.data(), step, static_cast<int64_t>(out.size()))) > 0;)
      out.insert(out.end(), piece.begin(), piece.begin() + n);
    return out;
  }
};

// The type's side: a store of emitted chunks, which can refuse a chunk or fail to supply.
struct ChunkStore {
  int32_t prefix = kPrefix;
  std::vector<Bytes> chunks;
  std::vector<uint64_t> chunkCounts;  // chunkCount of every emit call
  int64_t stopAt = -1;                // emit returns stopResult at this chunk
  int stopResult = -1;
  bool failSupply = false;
  std::function<void(uint64_t index)> afterEmit;

  static int emit(void *state, uint64_t chunkCount, uint64_t chunkIndex, uint8_t *buffer, uint32_t length) {
    auto *store = static_cast<ChunkStore *>(state);
    EXPECT_EQ(chunkIndex, store->chunks.size()) << "chunks arrive in order, each once";
    store->chunkCounts.push_back(chunkCount);
    if (static_cast<int64_t>(chunkIndex) == store->stopAt) return store->stopResult;
    memset(buffer, 0xAB, static_cast<size_t>(store->prefix));  // the prefix room is the callback's
    store->chunks.emplace_back(buffer + store->prefix, buffer + store->prefix + length);
    if (store->afterEmit) store->afterEmit(chunkIndex);
    return 0;
  }

  static uint32_t supply(void *state, uint64_t chunkIndex, uint8_t *buffer, uint32_t capacity) {
    auto *store = static_cast<ChunkStore *>(state);
    if (store->failSupply) {
      errno = EIO;
      return kChunkError;
    }
    if (chunkIndex >= store->chunks.size()) return 0;
    const Bytes &chunk = store->chunks[chunkIndex];
    EXPECT_LE(chunk.size(), capacity);
    memcpy(buffer + store->prefix, chunk.data(), chunk.size());
    return static_cast<uint32_t>(chunk.size());
  }

  int compress(FileHandle *fh, int32_t maxChunks = 0, uint32_t maxChunkBytes = 0, uint32_t chunkSize = kChunk,
               int32_t level = 5) {
    return chunkingCompressor(fh, maxChunks, chunkSize, maxChunkBytes, prefix, 0, this, emit, supply, level);
  }

  // Reads [offset, offset + size) through vectors of the given lengths; *result gets the result.
  Bytes read(int64_t offset, uint64_t size, const std::vector<size_t> &splits, int64_t *result) {
    Bytes out(size + 1, 0xCD);  // one guard byte behind the vectors
    std::vector<struct iovec> vectors = splitVectors(out, size, splits);
    *result = chunkingDecompressor(offset, size, static_cast<uint32_t>(vectors.size()), vectors.data(), kChunk,
                                   prefix, 0, this, supply);
    EXPECT_EQ(out[size], 0xCD) << "wrote past the vectors";
    out.resize(*result > 0 ? static_cast<size_t>(*result) : 0);
    return out;
  }
  int64_t read(int64_t offset, uint64_t size) {
    int64_t result = 0;
    read(offset, size, {}, &result);
    return result;
  }
};

class commonUtils : public CompressorTest {
 protected:
  void TearDown() override {
    unsetenv("DUMP_BAD_CHUNKS");
    CompressorTest::TearDown();
  }
  FileHandle *plain(const Bytes &bytes) { return open(bytes); }
  // Compresses the mixed file into a store.
  void compressMixed(ChunkStore &store, Bytes &data) {
    data = mixedFile();
    ASSERT_EQ(store.compress(plain(data)), 0);
  }
};

// ---------------------------------------------------------------------------------------------
// Compression.

struct ChunkCountCase {
  const char *name;
  size_t size;
  size_t expectedChunks;
};

class commonUtilsChunkCounts : public commonUtils, public ::testing::WithParamInterface<ChunkCountCase> {};

TEST_P(commonUtilsChunkCounts, RandomChunksAreStoredBehindTheMarker) {
  Bytes data = randomBytes(GetParam().size, 7);
  ChunkStore store;
  ASSERT_EQ(store.compress(plain(data)), 0);
  ASSERT_EQ(store.chunks.size(), GetParam().expectedChunks);
  EXPECT_EQ(store.chunkCounts, std::vector<uint64_t>(store.chunks.size(), GetParam().expectedChunks));
  for (size_t i = 0; i < store.chunks.size(); i++) {
    Bytes expected = slice(data, static_cast<int64_t>(i * kChunk), kChunk);
    ASSERT_EQ(store.chunks[i].size(), expected.size() + 1) << "chunk " << i;
    EXPECT_EQ(store.chunks[i][0], kStoredChunkMarker);
    EXPECT_EQ(Bytes(store.chunks[i].begin() + 1, store.chunks[i].end()), expected);
  }
}

INSTANTIATE_TEST_SUITE_P(Sizes, commonUtilsChunkCounts,
                         ::testing::Values(ChunkCountCase{"Empty", 0, 0}, ChunkCountCase{"OneByte", 1, 1},
                                           ChunkCountCase{"ExactlyOneChunk", kChunk, 1},
                                           ChunkCountCase{"OneChunkAndOneByte", kChunk + 1, 2},
                                           ChunkCountCase{"ThreeAndAHalf", 3 * kChunk + kChunk / 2, 4}),
                         kCaseName);

TEST_F(commonUtils, CompressibleChunksAreZlibStreamsShorterThanTheirData) {
  ChunkStore store;
  Bytes data;
  compressMixed(store, data);
  ASSERT_EQ(store.chunks.size(), 5u);
  for (size_t i : {0u, 2u, 3u}) {
    Bytes out(kChunk + 1);
    uLongf length = out.size();
    ASSERT_LT(store.chunks[i].size(), kChunk);
    ASSERT_EQ(uncompress(out.data(), &length, store.chunks[i].data(), store.chunks[i].size()), Z_OK);
    out.resize(length);
    EXPECT_EQ(out, slice(data, i * kChunk, kChunk)) << "chunk " << i;
  }
  EXPECT_EQ(store.chunks[1][0], kStoredChunkMarker);
}

struct ChunkLimitCase {
  const char *name;
  Bytes data;
  int expectedResult;
  bool stored;
};

class commonUtilsChunkLimits : public commonUtils, public ::testing::WithParamInterface<ChunkLimitCase> {};

TEST_P(commonUtilsChunkLimits, MaxChunkBytesCapsCompressedAndStoredChunks) {
  const ChunkLimitCase &c = GetParam();
  ChunkStore store;
  ASSERT_EQ(store.compress(plain(c.data), 0, 50), c.expectedResult);
  ASSERT_EQ(store.chunks.size(), c.expectedResult == 0 ? 1u : 0u);
  if (c.expectedResult == 0) {
    EXPECT_LE(store.chunks[0].size(), 50u);
    EXPECT_EQ(store.chunks[0][0] == kStoredChunkMarker, c.stored);
  }
}

INSTANTIATE_TEST_SUITE_P(Limits, commonUtilsChunkLimits,
                         ::testing::Values(ChunkLimitCase{"StoredFormAtTheLimit", randomBytes(49, 1), 0, true},
                                           ChunkLimitCase{"StoredFormOverTheLimit", randomBytes(50, 1), -1, false},
                                           ChunkLimitCase{"ZerosFitCompressed", Bytes(kChunk, 0), 0, false},
                                           ChunkLimitCase{"NeitherFormFits", repeatedBlock(kChunk, 1), -1, false}),
                         kCaseName);

TEST_F(commonUtils, RefusedWithoutReadingForTooManyChunksOrABadChunkSize) {
  FileHandle *fh = plain(randomBytes(kChunk + 1, 1));
  ChunkStore store;
  uint64_t reads = sys::callCount(sys::Call::Pread);
  EXPECT_EQ(store.compress(fh, 1), -1);
  EXPECT_EQ(store.compress(fh, 0, 0, 3000), -1);
  EXPECT_EQ(store.compress(fh, 0, 0, 0), -1);
  EXPECT_EQ(sys::callCount(sys::Call::Pread), reads);
  EXPECT_TRUE(store.chunkCounts.empty());
  EXPECT_EQ(store.compress(fh, 2), 0);
}

struct CompressFailureCase {
  const char *name;
  std::function<void(ChunkStore &store)> arrange;
  int32_t level;
  int expectedResult;
  const char *message;  // what the engine prints last, after its source position; null: nothing
};

class commonUtilsCompressFailures : public commonUtils,
                                    public ::testing::WithParamInterface<CompressFailureCase> {};

TEST_P(commonUtilsCompressFailures, AreReported) {
  FileHandle *fh = plain(repeatedBlock(3 * kChunk, 1));
  ChunkStore store;
  GetParam().arrange(store);
  CaptureStderr();
  EXPECT_EQ(store.compress(fh, 0, 0, kChunk, GetParam().level), GetParam().expectedResult);
  std::string printed = GetCapturedStderr();
  sys::clearFaults();
  if (store.stopAt >= 0) {
    EXPECT_EQ(store.chunkCounts.size(), static_cast<size_t>(store.stopAt) + 1) << "nothing after the refused chunk";
  }
  if (!GetParam().message) {
    EXPECT_EQ(printed, "");
    return;
  }
  EXPECT_THAT(printed, ContainsRegex(std::string("Common/commonUtils:[0-9]+: ") + GetParam().message + "\n$"));
}

INSTANTIATE_TEST_SUITE_P(
    Failures, commonUtilsCompressFailures,
    ::testing::Values(
        CompressFailureCase{"SizeQuery", [](ChunkStore &) { sys::armFault(sys::Call::Fstat, 1, EIO); }, 5, -1,
                            "fileSize: Input/output error"},
        CompressFailureCase{"Read", [](ChunkStore &) { sys::armFault(sys::Call::Pread, 2, EIO); }, 5, -1,
                            "Error: fh_pread -1"},
        CompressFailureCase{"InputBuffer", [](ChunkStore &) { sys::armFault(sys::Call::Malloc, 2, ENOMEM); }, 5, -1,
                            "malloc: Cannot allocate memory"},
        CompressFailureCase{"LevelZlibRejects", [](ChunkStore &) {}, 42, -1, "Error: failed to deflate in one pass: -2"},
        CompressFailureCase{"EmitStopsSilentlyWithItsResult",
                            [](ChunkStore &store) {
                              store.stopAt = 1;
                              store.stopResult = 7;
                            },
                            5, 7, nullptr}),
    kCaseName);

TEST_F(commonUtils, FileShrinkingWhileReadIsAnError) {
  FileHandle *fh = plain(randomBytes(3 * kChunk, 1));
  ChunkStore store;
  store.afterEmit = [&](uint64_t index) {
    if (index == 0) {
      ASSERT_EQ(truncate(fh->path, kChunk + 100), 0);
    }
  };
  CaptureStderr();
  EXPECT_EQ(store.compress(fh), -1);
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex("Common/commonUtils:[0-9]+: Error: file read error: got 4196 instead of 12288\n"));
}

// ---------------------------------------------------------------------------------------------
// Give-back after a failed run.

enum class Failure { EmitRefuses, ChunkTooLarge, ReadFails, FileShorterThanSize };

struct GiveBackCase {
  const char *name;
  Failure failure;
  int chunk;                 // where the run fails
  int64_t expectedGiveBack;  // bytes asked of unreadAlloc
};

class commonUtilsGiveBack : public commonUtils, public ::testing::WithParamInterface<GiveBackCase> {};

TEST_P(commonUtilsGiveBack, NextReaderGetsTheWholeFileFromOffsetZero) {
  const GiveBackCase &c = GetParam();
  Bytes data = mixedFile();
  OnceSource source(data);
  ChunkStore store;
  uint32_t maxChunkBytes = 0;
  if (c.failure == Failure::EmitRefuses) store.stopAt = c.chunk;
  if (c.failure == Failure::ChunkTooLarge) maxChunkBytes = kChunk;  // random chunk 1 needs kChunk + 1
  if (c.failure == Failure::ReadFails) source.failReadAfter = static_cast<size_t>(c.chunk) * kChunk;
  if (c.failure == Failure::FileShorterThanSize)
    source.handle.size = [](FileHandle *fh) { return static_cast<int64_t>(OnceSource::self(fh)->data.size()) + 5; };
  CaptureStderr();
  EXPECT_NE(store.compress(&source.handle, 0, maxChunkBytes), 0);
  GetCapturedStderr();
  ASSERT_EQ(source.unreadAllocSizes, std::vector<int64_t>{c.expectedGiveBack});
  EXPECT_EQ(static_cast<int64_t>(source.consumed), c.expectedGiveBack) << "the give-back is what was consumed";
  EXPECT_EQ(source.filledAtDone, c.expectedGiveBack);
  EXPECT_EQ(source.readAll(1000), data);
}

INSTANTIATE_TEST_SUITE_P(
    Failures, commonUtilsGiveBack,
    ::testing::Values(GiveBackCase{"EmitRefusesChunk0", Failure::EmitRefuses, 0, kChunk},
                      GiveBackCase{"EmitRefusesChunk3", Failure::EmitRefuses, 3, 4 * kChunk},
                      GiveBackCase{"EmitRefusesShortLastChunk", Failure::EmitRefuses, 4, kMixedSize},
                      GiveBackCase{"StoredChunk1TooLarge", Failure::ChunkTooLarge, 1, 2 * kChunk},
                      GiveBackCase{"ReadOfChunk2Fails", Failure::ReadFails, 2, 2 * kChunk},
                      GiveBackCase{"FileShorterThanItsSize", Failure::FileShorterThanSize, 4, kMixedSize}),
    kCaseName);

TEST_F(commonUtils, NothingIsGivenBackWhenNothingWasRead) {
  OnceSource source(Bytes(10, 1));
  source.failReadAfter = 0;
  ChunkStore store;
  CaptureStderr();
  EXPECT_EQ(store.compress(&source.handle), -1);
  GetCapturedStderr();
  EXPECT_TRUE(source.unreadAllocSizes.empty());
}

TEST_F(commonUtils, NextCompressorReadsTheGivenBackBytes) {
  Bytes data = mixedFile();
  OnceSource source(data);
  ChunkStore first, second, third;
  first.stopAt = 2;
  ASSERT_EQ(first.compress(&source.handle), -1);  // gives back 3 chunks
  second.stopAt = 0;  // takes chunk 0 of the held buffer and fails: the buffer is rewound
  ASSERT_EQ(second.compress(&source.handle), -1);
  EXPECT_EQ(source.unreadAllocSizes, (std::vector<int64_t>{3 * kChunk, kChunk}));
  ASSERT_EQ(third.compress(&source.handle), 0);
  int64_t result = 0;
  EXPECT_EQ(third.read(0, data.size(), {}, &result), data);
}

TEST_F(commonUtils, ShortReadIsReportedAndTheBytesReadStillComeBack) {
  Bytes data = randomBytes(3 * kChunk, 1);
  OnceSource source(data);
  source.firstReadLimit = 100;  // chunk 0 gets 100 bytes; chunk 1 then holds bytes 100 to 4195
  ChunkStore store;
  store.stopAt = 1;
  CaptureStderr();
  EXPECT_EQ(store.compress(&source.handle), -1);
  std::string printed = GetCapturedStderr();
  EXPECT_THAT(printed, ContainsRegex("Common/commonUtils:[0-9]+: Error: unread count mismatch: 8192 vs 4196\n"));
  EXPECT_THAT(printed, ContainsRegex("Common/commonUtils:[0-9]+: Error: decmpCnt count mismatch: 100 vs 4096\n"));
  EXPECT_EQ(source.filledAtDone, 4196);
  EXPECT_EQ(source.readAll(1000), data);
}

TEST_F(commonUtils, FailedRebuildGivesBackNoBytesInTheWrongPlace) {
  OnceSource source(mixedFile());
  ChunkStore store;
  store.stopAt = 2;
  store.failSupply = true;
  CaptureStderr();
  EXPECT_EQ(store.compress(&source.handle), -1);
  EXPECT_THAT(GetCapturedStderr(),
              ContainsRegex("Common/commonUtils:[0-9]+: Error: decmpCnt count mismatch: -1 vs 8192\n"));
  EXPECT_EQ(source.filledAtDone, 0);  // chunk 2's bytes are not put where chunk 0's belong
}

// ---------------------------------------------------------------------------------------------
// Decompression.

class commonUtilsReads : public commonUtils, public ::testing::WithParamInterface<std::tuple<ReadRange, int32_t>> {};

TEST_P(commonUtilsReads, ReturnExactlyTheBytesOfTheRange) {
  const ReadRange &range = std::get<0>(GetParam());
  ChunkStore store;
  store.prefix = std::get<1>(GetParam());
  Bytes data;
  compressMixed(store, data);
  int64_t result = 0;
  Bytes expected = slice(data, range.offset, range.size);
  EXPECT_EQ(store.read(range.offset, range.size, range.splits, &result), expected);
  EXPECT_EQ(result, static_cast<int64_t>(expected.size()));
}

INSTANTIATE_TEST_SUITE_P(
    Ranges, commonUtilsReads,
    ::testing::Combine(
        ::testing::Values(ReadRange{"WholeFile", 0, kMixedSize, {}}, ReadRange{"LastByte", kMixedSize - 1, 1, {}},
                          ReadRange{"CompressedIntoStored", kChunk - 10, 20, {}},
                          ReadRange{"StoredIntoCompressed", 2 * kChunk - 10, 20, {}},
                          ReadRange{"VectorsSplittingChunks", 0, kMixedSize, {1, kChunk - 2, 3, 5000, 0, 100}},
                          ReadRange{"VectorsFromInsideAChunk", 3000, 10000, {1097, 1, kChunk, 2}},
                          ReadRange{"ManySmallVectors", 4090, 3700, std::vector<size_t>(100, 37)},
                          ReadRange{"PastTheEndReturnsFewer", kMixedSize - 300, 1000, {400, 100}},
                          ReadRange{"StartingPastTheEndReturnsNothing", kMixedSize + 10, 10, {}}),
        ::testing::Values(0, kPrefix)),
    [](const auto &info) {
      return std::string(std::get<0>(info.param).name) + "_prefix" + std::to_string(std::get<1>(info.param));
    });

TEST_F(commonUtils, RandomRangesAndVectorsRoundTrip) {
  ChunkStore store;
  Bytes data;
  compressMixed(store, data);
  std::mt19937 random(1234);
  for (int trial = 0; trial < 400; trial++) {
    int64_t offset = random() % (kMixedSize + 50);
    uint64_t size = 1 + random() % (kMixedSize + 50);
    std::vector<size_t> splits;
    for (int v = random() % 6; v > 0; v--) splits.push_back(random() % (2 * kChunk));
    int64_t result = 0;
    ASSERT_EQ(store.read(offset, size, splits, &result), slice(data, offset, size)) << offset << " " << size;
  }
}

TEST_F(commonUtils, ZeroSizeReadsNothingAndNegativeOffsetIsRefused) {
  ChunkStore store;
  EXPECT_EQ(store.read(5, 0), 0);
  CaptureStdout();
  EXPECT_EQ(store.read(-1, 1), -1);
  EXPECT_EQ(GetCapturedStdout(), "invalid read position/size");
}

struct CorruptionCase {
  const char *name;
  std::function<void(Bytes &chunk)> corrupt;
  int zlibResult;
};

class commonUtilsCorruptChunks : public commonUtils, public ::testing::WithParamInterface<CorruptionCase> {};

TEST_P(commonUtilsCorruptChunks, FailTheReadWithTheInflateResult) {
  ChunkStore store;
  Bytes data;
  compressMixed(store, data);
  GetParam().corrupt(store.chunks[2]);  // the chunk of zeros
  for (int64_t offset : {int64_t{2 * kChunk}, int64_t{2 * kChunk + 1000}}) {
    CaptureStdout();
    CaptureStderr();
    EXPECT_EQ(store.read(offset, kChunk), -1);
    std::string errors = GetCapturedStderr();
    EXPECT_EQ(GetCapturedStdout(), "failed to inflate in one pass: " + std::to_string(GetParam().zlibResult) + "\n");
    EXPECT_THAT(errors, MatchesRegex("Common/commonUtils:[0-9]+: decompressChunk 2: .*\n"));
  }
}

INSTANTIATE_TEST_SUITE_P(
    Corruptions, commonUtilsCorruptChunks,
    ::testing::Values(
        CorruptionCase{"Truncated", [](Bytes &chunk) { chunk.erase(chunk.end() - 6, chunk.end()); }, Z_BUF_ERROR},
        CorruptionCase{"BadChecksum", [](Bytes &chunk) { chunk.back() ^= 0x55; }, Z_DATA_ERROR},
        CorruptionCase{"BadHeader", [](Bytes &chunk) { chunk[1] ^= 0x01; }, Z_DATA_ERROR}),
    kCaseName);

TEST_F(commonUtils, BadChunkIsDumpedByteByByteWhenAsked) {
  const char text[] = "hi\tthere";
  Bytes chunk(64);
  uLongf length = chunk.size();
  ASSERT_EQ(compress2(chunk.data(), &length, reinterpret_cast<const Bytef *>(text), 8, 6), Z_OK);
  chunk.resize(length);
  chunk.back() ^= 0x01;  // every byte inflates, then the checksum fails
  ChunkStore store;
  store.prefix = 0;
  store.chunks = {chunk};
  for (bool dump : {false, true}) {
    if (dump) setenv("DUMP_BAD_CHUNKS", "", 1);
    CaptureStdout();
    CaptureStderr();
    EXPECT_EQ(store.read(0, 8), -1);
    GetCapturedStderr();
    std::string printed = GetCapturedStdout();
    std::string head = "failed to inflate in one pass: -3\n";
    if (!dump) {
      EXPECT_EQ(printed, head);
      continue;
    }
    head += "processing chunk of " + std::to_string(chunk.size()) + " bytes\n";
    ASSERT_EQ(printed.substr(0, head.size()), head);
    EXPECT_THAT(printed.substr(head.size()),
                MatchesRegex("emitted byte      1 68 \\(h\\), zret  0, avail_in +[0-9]+ \\(pos +[0-9]+\\)\n"
                             "emitted byte      2 69 \\(i\\), zret  0, avail_in .*\n"
                             "emitted byte      3 09 \\(\\.\\), zret  0, avail_in .*\n"
                             "(emitted byte .*\n){5}"
                             "got -3, avail_in      0\n\n"));
  }
}

TEST_F(commonUtils, ReaderFailuresAreReported) {
  ChunkStore store;
  store.failSupply = true;
  CaptureStderr();
  EXPECT_EQ(store.read(0, 10), -1);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Common/commonUtils:[0-9]+: supplyChunk: Input/output error\n"));
  sys::armFault(sys::Call::Malloc, 1, ENOMEM);  // the skip buffer of a read inside a chunk
  CaptureStderr();
  EXPECT_EQ(store.read(5, 10), -1);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Common/commonUtils:[0-9]+: malloc failed: Cannot allocate memory\n"));
  sys::armFault(sys::Call::Malloc, 1, ENOMEM);  // the chunk buffer
  CaptureStderr();
  EXPECT_EQ(store.read(0, 10), -1);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Common/commonUtils:[0-9]+: malloc: Cannot allocate memory\n"));
}

}  // namespace
