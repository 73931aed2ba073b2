#include <functional>
#include <optional>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Common/FileHandle.h"
#include "CompressorTestHelpers.h"
#include "Compressors/Zlib/Type3/compressorType3.h"
#include "Compressors/Zlib/Type4/compressorType4.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/Syscalls.h"

using namespace plzctest;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
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

constexpr int kLevel = 5;
constexpr size_t kChunk = 65536;

// The resource map every type-4 fork ends with.
const Bytes kExpectedMap = {
    0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,  // reserved header copy
    0, 0, 0, 0, 0, 0, 0, 0,                          // next map, file reference, attributes
    0x00, 0x1C, 0x00, 0x32,                          // type list at 28, name list at 50
    0x00, 0x00, 'c', 'm', 'p', 'f', 0x00, 0x00,      // one type 'cmpf' with one resource
    0x00, 0x0A,                                      // its reference list at 28 + 10
    0x00, 0x01, 0xFF, 0xFF, 0x00, 0x00, 0x00, 0x00,  // ID 1, no name, attributes 0, data at 0
    0, 0, 0, 0,                                      // handle
};

// The block size a handle reports, as on a volume with such blocks.
template <int64_t kBytes>
int64_t fixedBlockSize(FileHandle *) {
  return kBytes;
}

int compress(FileHandle *fh, int64_t size, int level = kLevel, bool allowLargeForks = false) {
  void *context = initCompressorType4(nullptr, nullptr, level, allowLargeForks);
  EXPECT_NE(context, nullptr);
  int result = compressFileType4(fh, fh->path, size, context);
  freeContextType4(context);
  return result;
}
int compress(FileHandle *fh) { return compress(fh, fh->size(fh)); }

using Type4 = CompressorTest;

Bytes readType4(FileHandle *fh, int64_t offset, uint64_t size, const std::vector<size_t> &splits, int64_t *result) {
  Bytes out(size);
  std::vector<struct iovec> vectors = splitVectors(out, size, splits);
  *result = doUncompressType4(fh, offset, size, static_cast<uint32_t>(vectors.size()), vectors.data(), nullptr);
  out.resize(*result > 0 ? static_cast<size_t>(*result) : 0);
  return out;
}

void expectHeader(FileHandle *fh, uint32_t type, uint64_t size) {
  std::optional<Bytes> header = attribute(fh, kDecmpfsXattrName);
  ASSERT_TRUE(header.has_value());
  ASSERT_GE(header->size(), 16u);
  EXPECT_EQ(header->size() == 16, type == 4) << "a type-4 header attribute is the header alone";
  EXPECT_EQ(std::string(header->begin(), header->begin() + 4), "fpmc");
  EXPECT_EQ(loadLE32(header->data() + 4), type);
  EXPECT_EQ(loadLE64(header->data() + 8), size);
}

// One chunk as stored, decoded without the engine.
Bytes decodeChunk(const Bytes &fork, uint32_t at, uint32_t length) {
  if (fork[at] == 0xFF) return Bytes(fork.begin() + at + 1, fork.begin() + at + length);
  Bytes out(kChunk);
  uLongf produced = out.size();
  EXPECT_EQ(uncompress(out.data(), &produced, fork.data() + at, length), Z_OK);
  out.resize(produced);
  return out;
}

// Checks every field the fork layout fixes, and that its chunks decode to the data.
void expectForkLayout(FileHandle *fh, const Bytes &data) {
  std::optional<Bytes> found = attribute(fh, kResourceForkXattrName);
  ASSERT_TRUE(found.has_value());
  const Bytes &fork = *found;
  uint32_t n = static_cast<uint32_t>((data.size() + kChunk - 1) / kChunk);
  ASSERT_GE(fork.size(), 314u + 8 * n);
  uint32_t d = loadBE32(fork.data() + 256);
  EXPECT_EQ(fork.size(), 310u + d);
  EXPECT_EQ(loadBE32(fork.data()), 256u);
  EXPECT_EQ(loadBE32(fork.data() + 4), 260u + d);
  EXPECT_EQ(loadBE32(fork.data() + 8), d + 4);
  EXPECT_EQ(loadBE32(fork.data() + 12), 50u);
  EXPECT_EQ(Bytes(fork.begin() + 16, fork.begin() + 256), Bytes(240, 0));
  ASSERT_EQ(loadLE32(fork.data() + 260), n);
  uint32_t expectedOffset = 4 + 8 * n;
  for (uint32_t i = 0; i < n; i++) {
    uint32_t offset = loadLE32(fork.data() + 264 + 8 * i), length = loadLE32(fork.data() + 268 + 8 * i);
    ASSERT_EQ(offset, expectedOffset) << "chunk " << i << " follows its predecessor";
    ASSERT_LE(offset + length, d);
    EXPECT_EQ(decodeChunk(fork, 260 + offset, length), slice(data, i * kChunk, kChunk)) << "chunk " << i;
    expectedOffset = offset + length;
  }
  EXPECT_EQ(expectedOffset, d) << "the chunks end where the resource data ends";
  EXPECT_EQ(Bytes(fork.begin() + 260 + d, fork.end()), kExpectedMap);
}

TEST_F(Type4, FileOf150000BytesHasThreeChunksBehindTheTable) {
  Bytes data = repeatedBlock(150000, 5);
  FileHandle *fh = open(data);
  ASSERT_EQ(compress(fh), 0);
  expectHeader(fh, 4, 150000);
  expectForkLayout(fh, data);
  Bytes fork = attribute(fh, kResourceForkXattrName).value_or(Bytes(400));
  uint32_t a = loadLE32(fork.data() + 268), b = loadLE32(fork.data() + 276), c = loadLE32(fork.data() + 284);
  EXPECT_EQ(loadLE32(fork.data() + 264), 28u);
  EXPECT_EQ(loadLE32(fork.data() + 272), 28 + a);
  EXPECT_EQ(loadLE32(fork.data() + 280), 28 + a + b);
  EXPECT_EQ(loadBE32(fork.data() + 256), 28 + a + b + c);
  EXPECT_EQ(decodeChunk(fork, 288, a), slice(data, 0, kChunk));
  EXPECT_EQ(decodeChunk(fork, 288 + a + b, c).size(), 18928u);
}

TEST_F(Type4, OneByteSecondChunkIsStoredBehindTheMarker) {
  Bytes data = repeatedBlock(65537, 6);
  FileHandle *fh = open(data);
  ASSERT_EQ(compress(fh), 0);
  expectForkLayout(fh, data);
  Bytes fork = attribute(fh, kResourceForkXattrName).value_or(Bytes(400));
  uint32_t offset = loadLE32(fork.data() + 272);
  EXPECT_EQ(loadLE32(fork.data() + 276), 2u);
  EXPECT_EQ(Bytes(fork.begin() + 260 + offset, fork.begin() + 262 + offset), (Bytes{0xFF, data[65536]}));
}

struct SingleChunkCase {
  const char *name;
  Bytes data;
  bool type3Form;
};

class Type4SingleChunk : public Type4, public ::testing::WithParamInterface<SingleChunkCase> {};

TEST_P(Type4SingleChunk, SmallStreamGoesToTheHeaderAttributeWithoutFork) {
  const SingleChunkCase &c = GetParam();
  FileHandle *fh = open(c.data);
  ASSERT_EQ(compress(fh), 0);
  if (!c.type3Form) {
    expectHeader(fh, 4, c.data.size());
    expectForkLayout(fh, c.data);
    return;
  }
  expectHeader(fh, 3, c.data.size());
  EXPECT_EQ(attribute(fh, kResourceForkXattrName), std::nullopt);
  Bytes block = attrBuffer(attribute(fh, kDecmpfsXattrName).value_or(Bytes(16)));
  Bytes out(c.data.size());
  struct iovec vector = {out.data(), out.size()};
  EXPECT_EQ(doUncompressType3(fh, 0, out.size(), 1, &vector, block.data()), static_cast<int64_t>(out.size()));
  EXPECT_EQ(out, c.data);
}

INSTANTIATE_TEST_SUITE_P(Files, Type4SingleChunk,
                         ::testing::Values(SingleChunkCase{"RepeatedBlock", repeatedBlock(20000, 7), true},
                                           SingleChunkCase{"Zeros", Bytes(65536, 0), true},
                                           SingleChunkCase{"FifteenKRandom", randomThenZeros(15000, 65536, 7), false}),
                         kCaseName);

// The fork may take 4/5 of the file's blocks: 8 of a 10-block file, so D + 310 <= 32768.
class Type4Budget : public Type4, public ::testing::WithParamInterface<size_t> {};

TEST_P(Type4Budget, TenBlockFileGetsEightBlocks) {
  std::optional<Bytes> data = dataWithStreamLength(GetParam(), 40960, kLevel);
  ASSERT_TRUE(data.has_value()) << "no test data with that stream length";
  FileHandle *fh = open(*data);
  fh->blockSize = fixedBlockSize<4096>;
  bool fits = 12 + GetParam() <= 32458;
  CaptureStdout();
  EXPECT_EQ(compress(fh), fits ? 0 : -1);
  EXPECT_EQ(GetCapturedStdout(), "") << "a refusal by the budget is silent";
  if (fits) {
    expectForkLayout(fh, *data);
    EXPECT_EQ(attribute(fh, kResourceForkXattrName).value_or(Bytes()).size(), 32768u);
  } else {
    EXPECT_EQ(attribute(fh, kResourceForkXattrName), std::nullopt);
    EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);
  }
}

INSTANTIATE_TEST_SUITE_P(Limits, Type4Budget, ::testing::Values(32446, 32447),
                         [](const auto &info) { return "Stream" + std::to_string(info.param); });

TEST_F(Type4, ForkOfAOneBlockFileDoesNotShrink) {
  // With 64 KiB blocks a 64 KiB file is one block: the fork fits its budget but saves nothing.
  FileHandle *fh = open(randomThenZeros(10000, 65536, 9));
  fh->blockSize = fixedBlockSize<65536>;
  CaptureStdout();
  EXPECT_EQ(compress(fh), -1);
  EXPECT_THAT(GetCapturedStdout(), MatchesRegex("  Type4 file did not shrink: " + std::string(fh->path) +
                                                " \\(65536/1 blocks -> 10[0-9]{3}/1 100\\.0%\\)\n"));
  EXPECT_EQ(attribute(fh, kResourceForkXattrName), std::nullopt);
  expectHeader(fh, 4, 65536);  // the header stays
}

TEST_F(Type4, FilesOver64MiBAreRefusedAtOnceUnlessLargeForksAreAllowed) {
  FileHandle *fh = open(repeatedBlock(150000, 10));
  uint64_t reads = sys::callCount(sys::Call::Pread);
  EXPECT_EQ(compress(fh, 67108865), -1);
  EXPECT_EQ(sys::callCount(sys::Call::Pread), reads) << "nothing is read";
  EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);
  EXPECT_EQ(compress(fh, 67108864), 0) << "64 MiB itself is attempted";
  expectHeader(fh, 4, 150000);
  ASSERT_EQ(fh->removexattr(fh, kResourceForkXattrName, 0), 0);
  ASSERT_EQ(fh->removexattr(fh, kDecmpfsXattrName, 0), 0);
  EXPECT_EQ(compress(fh, 67108865, kLevel, true), 0);
  expectHeader(fh, 4, 150000);
}

TEST_F(Type4, ForkOver16MiBIsRefusedDuringEmissionUnlessLargeForksAreAllowed) {
  // 36 MiB of half-random chunks: the fork needs some 18 MiB, well inside its budget.
  constexpr size_t kChunks = 576;
  Bytes data;
  for (uint32_t i = 0; i < kChunks; i++) {
    Bytes chunk = randomThenZeros(kChunk / 2, kChunk, i);
    data.insert(data.end(), chunk.begin(), chunk.end());
  }
  FileHandle *fh = open(data);
  uint64_t reads = sys::callCount(sys::Call::Pread);
  EXPECT_EQ(compress(fh, static_cast<int64_t>(data.size()), 1), -1);
  uint64_t chunksRead = sys::callCount(sys::Call::Pread) - reads;
  EXPECT_GT(chunksRead, 400u);  // some 33 KiB of fork per chunk: 16 MiB after about 500 chunks
  EXPECT_LT(chunksRead, kChunks) << "refused when the fork reached 16 MiB, not at the end";
  EXPECT_EQ(attribute(fh, kResourceForkXattrName), std::nullopt);
  EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);

  ASSERT_EQ(compress(fh, static_cast<int64_t>(data.size()), 1, true), 0);
  EXPECT_GT(attribute(fh, kResourceForkXattrName).value_or(Bytes()).size(), 16777216u);
  expectForkLayout(fh, data);
}

class Type4Reads : public Type4, public ::testing::WithParamInterface<ReadRange> {};

TEST_P(Type4Reads, ReturnExactlyTheBytesOfTheRange) {
  // Chunk 0 compresses, chunk 1 is stored, chunk 2 is short.
  Bytes data = repeatedBlock(kChunk, 12), random = randomBytes(kChunk, 13), tail = repeatedBlock(40000, 14);
  data.insert(data.end(), random.begin(), random.end());
  data.insert(data.end(), tail.begin(), tail.end());
  FileHandle *fh = open(data);
  ASSERT_EQ(compress(fh), 0);
  int64_t result = 0;
  CaptureStderr();  // a read past the end prints the max-chunk message
  Bytes got = readType4(fh, GetParam().offset, GetParam().size, GetParam().splits, &result);
  GetCapturedStderr();
  Bytes expected = slice(data, GetParam().offset, GetParam().size);
  EXPECT_EQ(got, expected);
  EXPECT_EQ(result, static_cast<int64_t>(expected.size()));
}

INSTANTIATE_TEST_SUITE_P(
    Ranges, Type4Reads,
    ::testing::Values(ReadRange{"Whole", 0, 2 * kChunk + 40000, {}}, ReadRange{"LastByte", 2 * kChunk + 39999, 1, {}},
                      ReadRange{"CompressedIntoStored", kChunk - 100, 200, {}},
                      ReadRange{"StoredIntoShort", 2 * kChunk - 5, 10, {3}},
                      ReadRange{"VectorsSplittingChunks", 10, 2 * kChunk + 30000, {kChunk, 7, kChunk, 1}},
                      ReadRange{"PastTheEnd", 2 * kChunk + 39000, 5000, {}}),
    kCaseName);

TEST_F(Type4, ReadingPastTheLastChunkEndsTheDataWithAMessage) {
  Bytes data = repeatedBlock(150000, 11);
  FileHandle *fh = open(data);
  ASSERT_EQ(compress(fh), 0);
  CaptureStderr();
  int64_t result = 0;
  EXPECT_EQ(readType4(fh, 149000, 2000, {}, &result), slice(data, 149000, 1000));
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex("Compressors/Zlib/Type4/compressorType4Imp:[0-9]+: Error: 3 is greater than max chunk 3\n"));
  EXPECT_EQ(result, 1000);
}

struct BrokenForkCase {
  const char *name;
  std::function<Bytes(Bytes fork)> breakFork;  // the fork written instead; empty: none
  const char *message;                         // the type's first message, after its position
};

class Type4BrokenFork : public Type4, public ::testing::WithParamInterface<BrokenForkCase> {};

TEST_P(Type4BrokenFork, FailsTheRead) {
  Bytes data = repeatedBlock(150000, 15);
  FileHandle *fh = open(data);
  ASSERT_EQ(compress(fh), 0);
  Bytes broken = GetParam().breakFork(attribute(fh, kResourceForkXattrName).value_or(Bytes()));
  ASSERT_EQ(fh->removexattr(fh, kResourceForkXattrName, 0), 0);
  if (!broken.empty()) {
    ASSERT_EQ(fh->setxattr(fh, kResourceForkXattrName, broken.data(), broken.size(), 0, 0), 0);
  }
  CaptureStderr();
  int64_t result = 0;
  readType4(fh, 0, data.size(), {}, &result);
  std::string errors = GetCapturedStderr();
  EXPECT_EQ(result, -1);
  std::string source = "Compressors/Zlib/Type4/compressorType4Imp:[0-9]+: ";
  EXPECT_THAT(errors, ContainsRegex(source + GetParam().message));
  if (!broken.empty()) {
    EXPECT_THAT(errors, ContainsRegex(source + "chunkingDecompressor " + fh->path + ": .*\n$"));
  }
}

INSTANTIATE_TEST_SUITE_P(
    Forks, Type4BrokenFork,
    ::testing::Values(BrokenForkCase{"Missing", [](Bytes) { return Bytes(); }, "readBytes .*: -1: No data available\n"},
                      BrokenForkCase{"ChunkLongerThanTheBuffer",
                                     [](Bytes fork) {
                                       fork[278] = 0x01;  // chunk 1's length passes 65537
                                       return fork;
                                     },
                                     "Error: .*: 65537 is less than needed size [0-9]+\n"},
                      BrokenForkCase{"TruncatedInsideAChunk", [](Bytes fork) { return Bytes(fork.begin(), fork.begin() + 300); },
                                     "fh_getxattr .*: "},
                      BrokenForkCase{"TruncatedInsideTheTable", [](Bytes fork) { return Bytes(fork.begin(), fork.begin() + 270); },
                                     "fh_getxattr .*: "}),
    kCaseName);

TEST_F(Type4, ReadWithoutHandleIsRefused) {
  CaptureStderr();
  EXPECT_EQ(doUncompressType4(nullptr, 0, 0, 0, nullptr, nullptr), -1);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Compressors/Zlib/Type4/compressorType4Imp:[0-9]+: null inputFile: .*\n"));
}

// Attribute writes of compressing data (on fh), checked for the right form; *segments gets the
// number of 64 KiB segments of the fork written.
uint64_t attributeWritesToCompress(FileHandle *fh, const Bytes &data, uint64_t *segments) {
  uint64_t before = sys::callCount(sys::Call::Fsetxattr);
  EXPECT_EQ(compress(fh), 0);
  uint64_t writes = sys::callCount(sys::Call::Fsetxattr) - before;
  expectHeader(fh, 4, data.size());
  expectForkLayout(fh, data);
  size_t forkSize = attribute(fh, kResourceForkXattrName).value_or(Bytes()).size();
  *segments = (forkSize + 65535) / 65536;
  return writes;
}

// A write at a position of a fork larger than one Linux attribute rewrites whole 64 KiB
// segments, so writing entry and chunk one by one took four segment writes per chunk.
TEST_F(Type4, ForksAreWrittenInFewPieces) {
  uint64_t segments = 0;
  // A few hundred KiB of fork: the count first (the mark that the file is being compressed),
  // then the fork built whole and written in one piece: the count, each segment once, the
  // segmented fork's own header and the 16-byte header attribute.
  Bytes small = compressibleBytes(20 * kChunk + 999, 7);
  uint64_t writes = attributeWritesToCompress(open(small), small, &segments);
  ASSERT_GT(segments, 1u);
  EXPECT_EQ(writes, segments + 3) << segments << " segments of fork";
  // More than 1 MiB of fork: the table goes out once and the chunks in pieces of up to 1 MiB:
  // each segment about once, plus the start (count, table, head) and the pieces' boundaries.
  Bytes large = compressibleBytes(96 * kChunk + 777, 41);
  writes = attributeWritesToCompress(open(large), large, &segments);
  ASSERT_GT(segments, 16u);
  EXPECT_LE(writes, segments + 24) << segments << " segments of fork";
}

TEST_F(Type4, FailedWritesRemoveTheFork) {
  Bytes data = repeatedBlock(150000, 18);
  FileHandle *fh = open(data);
  // Count a clean run's attribute writes: the header is the last one.
  uint64_t before = sys::callCount(sys::Call::Fsetxattr);
  ASSERT_EQ(compress(fh), 0);
  uint64_t writes = sys::callCount(sys::Call::Fsetxattr) - before;
  std::string path = fh->path;
  for (auto [failing, message] : {std::pair<uint64_t, std::string>{1, "fh_setxattr: "},
                                  {writes, "fh_setxattr " + path + ": "}}) {
    ASSERT_EQ(fh->removexattr(fh, kResourceForkXattrName, 0), 0);
    fh->removexattr(fh, kDecmpfsXattrName, 0);
    sys::armFault(sys::Call::Fsetxattr, failing, ENOSPC);
    CaptureStderr();
    EXPECT_EQ(compress(fh), -1);
    std::string errors = GetCapturedStderr();
    sys::clearFaults();
    EXPECT_THAT(errors, ContainsRegex("Compressors/Zlib/Type4/compressorType4Imp:[0-9]+: " + message +
                                      "No space left on device\n"));
    EXPECT_EQ(attribute(fh, kResourceForkXattrName), std::nullopt);
    EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);
    ASSERT_EQ(compress(fh), 0);  // leaves both attributes for the next round
  }
}

// A plain handle that also takes pushed-back bytes, to watch the give-back of a refused file.
struct UnreadRecorder {
  FileHandle handle;  // a copy of a plain handle: its own operations still work on it
  Bytes buffer;
  int64_t filled = 0;
  std::vector<int64_t> allocSizes;
  static inline UnreadRecorder *current = nullptr;

  explicit UnreadRecorder(FileHandle *plain) : handle(*plain) {
    current = this;
    handle.canUnread = 1;
    handle.blockSize = fixedBlockSize<4096>;
    handle.unreadAlloc = [](FileHandle *, int64_t size) -> void * {
      current->allocSizes.push_back(size);
      current->buffer.assign(static_cast<size_t>(size), 0xEE);
      return current->buffer.data();
    };
    handle.unreadSetPos = [](FileHandle *, int64_t position) {
      current->filled = position;
      return 0;
    };
    handle.unread = [](FileHandle *, const void *bytes, int64_t count) {
      EXPECT_LE(current->filled + count, static_cast<int64_t>(current->buffer.size()));
      memcpy(current->buffer.data() + current->filled, bytes, static_cast<size_t>(count));
      current->filled += count;
      return 0;
    };
    handle.unreadDone = [](FileHandle *) {
      current->buffer.resize(static_cast<size_t>(current->filled));
      return 0;
    };
  }
};

TEST_F(Type4, RefusalGivesBackChunksRebuiltFromTheFork) {
  // A compressible chunk, then random ones until the budget runs out at the last chunk.
  Bytes data = repeatedBlock(kChunk, 19);
  for (uint32_t i = 0; i < 4; i++) {
    Bytes random = randomBytes(kChunk, 20 + i);
    data.insert(data.end(), random.begin(), random.end());
  }
  FileHandle *fh = open(data);
  UnreadRecorder recorder(fh);
  EXPECT_EQ(compress(&recorder.handle), -1);
  ASSERT_EQ(recorder.allocSizes, std::vector<int64_t>{static_cast<int64_t>(data.size())});
  EXPECT_EQ(recorder.buffer, data);
  EXPECT_EQ(attribute(fh, kResourceForkXattrName), std::nullopt);
}

// A file that exists only as a size: reads return zeros, fork writes are recorded and fail.
struct HugeFile {
  FileHandle handle{};
  int64_t size;
  std::vector<uint32_t> forkWrites;
  static HugeFile *self(FileHandle *fh) { return static_cast<HugeFile *>(fh->priv); }

  explicit HugeFile(int64_t bytes) : size(bytes) {
    handle.name = handle.path = const_cast<char *>("huge");
    handle.priv = this;
    handle.size = [](FileHandle *fh) { return self(fh)->size; };
    handle.blockSize = fixedBlockSize<4096>;
    handle.pread = [](FileHandle *, void *buffer, int64_t count, int64_t) {
      memset(buffer, 0, static_cast<size_t>(count));
      return count;
    };
    handle.setxattr = [](FileHandle *fh, const char *, const void *, uint64_t, uint32_t position, int) {
      self(fh)->forkWrites.push_back(position);
      errno = ENOSPC;
      return -1;
    };
    handle.removexattr = [](FileHandle *, const char *, int) { return 0; };
  }
};

TEST_F(Type4, ForksThatCannotHave32BitPositionsAreRefused) {
  // 2^28 chunks: the table ends at 2 GiB; the count is written at 260 (and the run stops there).
  HugeFile large(int64_t{1} << 44);
  CaptureStderr();
  EXPECT_EQ(compress(&large.handle, large.size, kLevel, true), -1);
  EXPECT_THAT(GetCapturedStderr(), HasSubstr("fh_setxattr: No space left on device\n"));
  EXPECT_EQ(large.forkWrites, std::vector<uint32_t>{260});
  // 2^29 chunks: the table alone would reach 4 GiB; 2^32 + 1 chunks: the count has no room.
  for (int64_t size : {int64_t{1} << 45, (int64_t{1} << 48) + 1}) {
    HugeFile huge(size);
    EXPECT_EQ(compress(&huge.handle, huge.size, kLevel, true), -1);
    EXPECT_TRUE(huge.forkWrites.empty()) << "refused before anything is written";
  }
}

}  // namespace
