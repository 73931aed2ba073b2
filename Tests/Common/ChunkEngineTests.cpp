// The engines write one on-disk form: whatever one engine compresses, every engine and zlib's
// own inflate read back byte for byte.
#include <sys/stat.h>
#include <zlib.h>

#include <cstring>
#include <map>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Common/ChunkEngine.h"
#include "Common/commonUtils.h"
#include "Common/FileHandle.h"
#include "Compressors/CompressorTestHelpers.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

constexpr uint32_t kChunk = 65536;
constexpr ChunkEngine kEngines[] = {ChunkEngine::Zlib, ChunkEngine::Libdeflate, ChunkEngine::Isal};

// The mixed tree: text, binary-like, zeros, incompressible chunks, sizes on and around chunk
// boundaries, small files that type 3 keeps in the header, and files mixing all of these.
std::map<std::string, Bytes> mixedTree() {
  std::map<std::string, Bytes> files;
  files["text"] = compressibleBytes(300000, 1);
  files["binary"] = repeatedBlock(200000, 2);
  files["zeros"] = Bytes(1 << 20, 0);
  files["small"] = compressibleBytes(2000, 4);
  files["one-chunk"] = compressibleBytes(kChunk, 5);
  files["chunk-plus-one"] = compressibleBytes(kChunk + 1, 6);
  Bytes mixed;
  for (const Bytes &part : {compressibleBytes(kChunk, 7), randomBytes(kChunk, 8), Bytes(kChunk, 0),
                            repeatedBlock(kChunk + 333, 9), randomBytes(5000, 10)})
    mixed.insert(mixed.end(), part.begin(), part.end());
  files["mixed"] = mixed;
  return files;
}

Bytes attributeOf(const std::string &path, const char *name) {
  ssize_t size = platform::getxattr(path.c_str(), name, nullptr, 0, 0, 0);
  if (size < 0) return {};
  Bytes value(static_cast<size_t>(size));
  EXPECT_EQ(platform::getxattr(path.c_str(), name, value.data(), value.size(), 0, 0), size);
  return value;
}

// Decodes one stored chunk with zlib's inflate directly, or takes a stored chunk's raw bytes.
Bytes inflateChunk(const uint8_t *chunk, uint32_t length) {
  if (chunk[0] == kStoredChunkMarker) return Bytes(chunk + 1, chunk + length);
  Bytes out(kChunk);
  uLongf produced = out.size();
  EXPECT_EQ(uncompress(out.data(), &produced, chunk, length), Z_OK);
  out.resize(produced);
  return out;
}

// The file's data decoded from its attributes by zlib alone, without the library's reader.
Bytes inflateWithZlib(const std::string &path) {
  Bytes header = attributeOf(path, kDecmpfsXattrName);
  if (header.size() < kDiskHeaderSize) return {};
  uint32_t type = loadLE32(header.data() + 4);
  if (type == 3) return inflateChunk(header.data() + kDiskHeaderSize, static_cast<uint32_t>(header.size() - kDiskHeaderSize));
  Bytes fork = attributeOf(path, kResourceForkXattrName);
  Bytes out;
  uint32_t count = loadLE32(fork.data() + 260);
  for (uint32_t i = 0; i < count; i++) {
    uint32_t offset = loadLE32(fork.data() + 264 + 8 * i), length = loadLE32(fork.data() + 268 + 8 * i);
    Bytes chunk = inflateChunk(fork.data() + 260 + offset, length);
    out.insert(out.end(), chunk.begin(), chunk.end());
  }
  return out;
}

int collect(int64_t offset, const void *bytes, int64_t count, void *context) {
  auto *out = static_cast<Bytes *>(context);
  if (out->size() < static_cast<size_t>(offset + count)) out->resize(static_cast<size_t>(offset + count));
  memcpy(out->data() + offset, bytes, static_cast<size_t>(count));
  return 0;
}

// The file's logical data through the library's reader, with the process's engine.
Bytes readThroughLibrary(const std::string &path) {
  FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
  EXPECT_NE(fh, nullptr) << path;
  if (!fh) return {};
  Bytes out;
  EXPECT_EQ(decompressData(fh, collect, &out), 0) << path;
  fh->close(fh);
  return out;
}

class ChunkEngines : public ::testing::TestWithParam<ChunkEngine> {
 protected:
  void SetUp() override {
    if (!chunkEngineBuilt(GetParam())) GTEST_SKIP() << chunkEngineName(GetParam()) << " is not built";
  }
  void TearDown() override { setChunkEngine(ChunkEngine::Zlib); }
  ScratchDir dir;
};

TEST_P(ChunkEngines, EveryEngineAndZlibReadWhatThisEngineWrote) {
  ASSERT_TRUE(setChunkEngine(GetParam()));
  std::map<std::string, Bytes> files = mixedTree();
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, false);
  ASSERT_NE(ctx, nullptr);
  for (const auto &[name, data] : files) {
    std::string path = writeFile(dir.file(name), data);
    EXPECT_EQ(compressFile(ctx, path.c_str(), nullptr), 0) << name;
  }
  freeCompressor(ctx);
  EXPECT_EQ(attributeOf(dir.file("small"), kResourceForkXattrName).size(), 0u) << "type 3 keeps small files";
  EXPECT_GT(attributeOf(dir.file("mixed"), kResourceForkXattrName).size(), 0u);

  for (const auto &[name, data] : files) {
    std::string path = dir.file(name);
    struct stat st{};
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_size, 0) << name << " is stored in its attributes";
    EXPECT_EQ(inflateWithZlib(path), data) << name << " through zlib's inflate";
    for (ChunkEngine reader : kEngines) {
      if (!setChunkEngine(reader)) continue;
      EXPECT_EQ(readThroughLibrary(path), data) << name << " read by " << chunkEngineName(reader);
    }
  }
}

// Level 0 stores every chunk; higher levels shrink; a level outside 0..9 (and -1) fails.
TEST_P(ChunkEngines, LevelsMeanTheSameOnEveryEngine) {
  Bytes text = compressibleBytes(kChunk, 11);
  Bytes out(kChunk + 64);
  uint32_t produced = 0;
  int code = 0;
  auto encodeAt = [&](int level) {
    return ChunkEncoder::create(GetParam(), level)
        ->encode(text.data(), kChunk, out.data(), kChunk, &produced, &code);
  };
  EXPECT_EQ(encodeAt(0), ChunkEncoder::Result::NoFit);
  size_t previous = SIZE_MAX;
  for (int level : {1, 5, 9}) {
    ASSERT_EQ(encodeAt(level), ChunkEncoder::Result::Fit) << "level " << level;
    EXPECT_LE(produced, previous) << "level " << level << " is no larger than a lower level";
    EXPECT_LT(produced, kChunk / 2);
    previous = produced;
  }
  EXPECT_EQ(encodeAt(-1), ChunkEncoder::Result::Fit);
  EXPECT_EQ(encodeAt(10), ChunkEncoder::Result::Failed);
  EXPECT_EQ(code, Z_STREAM_ERROR);
}

// A chunk's stream depends on the chunk alone: not on what the encoder compressed before (a
// pool thread's encoder sees files in any order) nor on the bytes after the chunk in its buffer.
TEST_P(ChunkEngines, SameChunkGivesTheSameStreamWhateverCameBefore) {
  if (!chunkEngineBuilt(GetParam())) GTEST_SKIP() << "engine not built";
  Bytes text = compressibleBytes(kChunk, 21);
  Bytes other = compressibleBytes(kChunk, 22);
  Bytes noise = randomBytes(kChunk, 23);
  for (int level : {1, 5, 9}) {
    SCOPED_TRACE("level " + std::to_string(level));
    auto encode = [&](ChunkEncoder &encoder, const Bytes &input, uint32_t count) {
      Bytes out(kChunk + 64);
      uint32_t produced = 0;
      int code = 0;
      EXPECT_EQ(encoder.encode(input.data(), count, out.data(), kChunk, &produced, &code), ChunkEncoder::Result::Fit);
      out.resize(produced);
      return out;
    };
    auto fresh = ChunkEncoder::create(GetParam(), level);
    Bytes alone = encode(*fresh, text, kChunk);
    Bytes shortAlone = encode(*ChunkEncoder::create(GetParam(), level), text, 5000);
    auto used = ChunkEncoder::create(GetParam(), level);
    encode(*used, other, kChunk);
    encode(*used, noise, kChunk / 2);
    EXPECT_EQ(encode(*used, text, kChunk), alone);
    // The same short chunk with different bytes after it in the buffer.
    Bytes padded = text;
    std::copy(noise.begin() + 5000, noise.end(), padded.begin() + 5000);
    EXPECT_EQ(encode(*used, padded, 5000), shortAlone);
  }
}

// A chunk read in pieces gives the same bytes as one read, and a damaged one the code zlib
// gives, whatever the engine does inside.
TEST_P(ChunkEngines, PiecewiseDecodingAndDamageMatchZlib) {
  Bytes data = compressibleBytes(kChunk, 12);
  Bytes stream(kChunk);
  uint32_t length = 0;
  int code = 0;
  ASSERT_EQ(makeZlibChunkEncoder(5)->encode(data.data(), kChunk, stream.data(), kChunk, &length, &code),
            ChunkEncoder::Result::Fit);
  stream.resize(length);

  std::unique_ptr<ChunkDecoder> decoder = ChunkDecoder::create(GetParam(), kChunk);
  decoder->begin(stream.data(), length);
  Bytes pieces;
  for (uint32_t piece : {1u, 999u, 30000u, 40000u}) {
    Bytes out(piece);
    uint32_t produced = 0;
    ASSERT_TRUE(decoder->decodeInto(out.data(), piece, &produced, &code));
    pieces.insert(pieces.end(), out.begin(), out.begin() + produced);
  }
  EXPECT_EQ(pieces, data);
  EXPECT_EQ(code, Z_STREAM_END);
  EXPECT_TRUE(decoder->chunkDone());

  Bytes damaged = stream;
  damaged.back() ^= 0x55;  // the Adler-32 no longer matches
  decoder->begin(damaged.data(), length);
  Bytes out(kChunk);
  uint32_t produced = 0;
  EXPECT_FALSE(decoder->decodeInto(out.data(), kChunk, &produced, &code));
  EXPECT_EQ(code, Z_DATA_ERROR);
}

// A stream that igzip's inflate decodes (to 131,072 zero bytes) but that zlib refuses at its
// first block, whose distance code set is incomplete ("invalid distances set"): every engine
// refuses it as zlib does, with a chunk size that would hold the whole output.
TEST_P(ChunkEngines, StreamZlibRefusesIsRefusedByEveryEngine) {
  Bytes stream = {0x78, 0x5e, 0xed, 0xc1, 0x81, 0x00, 0x00, 0x00, 0x00, 0x80, 0xa0, 0xfd, 0xa9, 0x17, 0xa9, 0x03};
  stream.resize(142, 0);
  stream.insert(stream.end(), {0xa8, 0xaa, 0x06, 0x00, 0x1e, 0x00, 0x01});
  constexpr uint32_t kWhole = 131072;
  std::unique_ptr<ChunkDecoder> decoder = ChunkDecoder::create(GetParam(), kWhole);
  decoder->begin(stream.data(), static_cast<uint32_t>(stream.size()));
  Bytes out(kWhole);
  uint32_t produced = 0;
  int code = Z_OK;
  EXPECT_FALSE(decoder->decodeInto(out.data(), kWhole, &produced, &code));
  EXPECT_EQ(code, Z_DATA_ERROR);
  EXPECT_EQ(produced, 0u);
}

// A space far smaller than the input (the small-file form) is judged as compressing the whole
// input would judge it, also when the start of the input compresses badly and the rest well.
TEST_P(ChunkEngines, SmallSpaceFitsExactlyWhenTheWholeStreamFits) {
  const uint32_t size = 2 * kChunk;
  Bytes zerosThenRandom(size - 6000, 0);
  Bytes tail = randomBytes(6000, 32);
  zerosThenRandom.insert(zerosThenRandom.end(), tail.begin(), tail.end());
  const std::pair<const char *, Bytes> inputs[] = {
      {"text", compressibleBytes(size, 33)},       {"zeros", Bytes(size, 0)},
      {"repeated block", repeatedBlock(size, 34)}, {"random then zeros", randomThenZeros(6000, size, 31)},
      {"zeros then random", zerosThenRandom},      {"random", randomBytes(size, 35)},
  };
  auto encoder = ChunkEncoder::create(GetParam(), 5);
  Bytes out(size + 1024);
  uint32_t produced = 0;
  int code = 0;
  for (const auto &[name, input] : inputs) {
    // The stream's length when space is no object.
    ChunkEncoder::Result free = encoder->encode(input.data(), size, out.data(), size, &produced, &code);
    if (free == ChunkEncoder::Result::NoFit) {
      EXPECT_STREQ(name, "random");
      continue;
    }
    ASSERT_EQ(free, ChunkEncoder::Result::Fit) << name;
    const uint32_t whole = produced;
    EXPECT_EQ(encoder->encode(input.data(), size, out.data(), whole + 16, &produced, &code), ChunkEncoder::Result::Fit)
        << name << ": " << whole << " bytes in " << whole + 16;
    EXPECT_EQ(produced, whole) << name;
    Bytes back(size);
    uLongf backLength = size;
    EXPECT_EQ(uncompress(back.data(), &backLength, out.data(), produced), Z_OK) << name;
    EXPECT_TRUE(backLength == size && back == input) << name;
    if (whole > 64) {
      EXPECT_EQ(encoder->encode(input.data(), size, out.data(), whole / 2, &produced, &code),
                ChunkEncoder::Result::NoFit)
          << name;
    }
  }
}

// A small file is tried for a few KiB of space first and then, in the chunked form, for its
// full size: whatever an encoder remembers of the first call, the second gives the stream a
// fresh encoder gives, and other bytes of the same length are not mistaken for the first.
TEST_P(ChunkEngines, FullSpaceAfterSmallSpaceGivesTheFreshStream) {
  if (!chunkEngineBuilt(GetParam())) GTEST_SKIP() << "engine not built";
  auto stream = [](ChunkEncoder &encoder, const Bytes &input, uint32_t space, ChunkEncoder::Result *result) {
    Bytes out(input.size() + 64);
    uint32_t produced = 0;
    int code = 0;
    *result = encoder.encode(input.data(), static_cast<uint32_t>(input.size()), out.data(), space, &produced, &code);
    out.resize(*result == ChunkEncoder::Result::Fit ? produced : 0);
    return out;
  };
  for (uint32_t size : {3000u, 20000u, kChunk}) {
    Bytes text = compressibleBytes(size, 51);
    Bytes changed = text;
    changed[size / 2] ^= 1;
    for (uint32_t space : {64u, 3802u, size / 3}) {
      SCOPED_TRACE(std::to_string(size) + " bytes, first for " + std::to_string(space));
      ChunkEncoder::Result first, again, fresh;
      auto encoder = ChunkEncoder::create(GetParam(), 5);
      Bytes small = stream(*encoder, text, space, &first);
      EXPECT_EQ(small, stream(*ChunkEncoder::create(GetParam(), 5), text, space, &fresh));
      EXPECT_EQ(first, fresh);
      Bytes whole = stream(*encoder, text, size, &again);
      EXPECT_EQ(whole, stream(*ChunkEncoder::create(GetParam(), 5), text, size, &fresh));
      EXPECT_EQ(again, ChunkEncoder::Result::Fit);
      stream(*encoder, text, space, &first);
      EXPECT_EQ(stream(*encoder, changed, size, &again),
                stream(*ChunkEncoder::create(GetParam(), 5), changed, size, &fresh));
      Bytes back(size);
      uLongf backLength = size;
      EXPECT_EQ(uncompress(back.data(), &backLength, whole.data(), whole.size()), Z_OK);
      EXPECT_EQ(back, text);
    }
  }
}

// A thread's kept encoder serves its next files; a nested lease, or one at another level, gets
// an encoder of its own, and an encoder that could not be set up is not kept.
TEST_P(ChunkEngines, LeasedEncodersAreKeptPerThreadAndLevel) {
  Bytes text = compressibleBytes(kChunk, 41);
  Bytes out(kChunk);
  uint32_t produced = 0;
  int code = 0;
  ChunkEncoder *first = nullptr;
  {
    ChunkEncoderLease lease(GetParam(), 5);
    first = lease.operator->();
    ChunkEncoderLease nested(GetParam(), 5);
    EXPECT_NE(nested.operator->(), first);
    EXPECT_EQ(nested->encode(text.data(), kChunk, out.data(), kChunk, &produced, &code), ChunkEncoder::Result::Fit);
  }
  {
    ChunkEncoderLease again(GetParam(), 5);
    EXPECT_EQ(again.operator->(), first);
  }
  {
    ChunkEncoderLease bad(GetParam(), 10);
    EXPECT_FALSE(bad->ready());
    EXPECT_EQ(bad->encode(text.data(), kChunk, out.data(), kChunk, &produced, &code), ChunkEncoder::Result::Failed);
  }
  ChunkEncoderLease after(GetParam(), 5);
  EXPECT_TRUE(after->ready());
  EXPECT_EQ(after->encode(text.data(), kChunk, out.data(), kChunk, &produced, &code), ChunkEncoder::Result::Fit);
  std::thread([&] {
    ChunkEncoderLease other(GetParam(), 5);
    EXPECT_NE(other.operator->(), after.operator->()) << "each thread keeps its own";
  }).join();
}

// Reading a tree alternates between the chunk sizes of the two types: each keeps its decoder.
TEST_P(ChunkEngines, LeasedDecodersAreKeptForTwoChunkSizes) {
  auto leased = [&](uint32_t chunkSize) {
    ChunkDecoderLease lease(GetParam(), chunkSize);
    return lease.operator->();
  };
  ChunkDecoder *small = leased(kChunk), *large = leased(2 * kChunk);
  EXPECT_NE(small, large);
  for (int round = 0; round < 3; round++) {
    EXPECT_EQ(leased(kChunk), small);
    EXPECT_EQ(leased(2 * kChunk), large);
  }
  ChunkDecoderLease holding(GetParam(), kChunk);
  ChunkDecoderLease nested(GetParam(), kChunk);
  EXPECT_EQ(holding.operator->(), small);
  EXPECT_NE(nested.operator->(), small) << "a nested lease gets a decoder of its own";
}

INSTANTIATE_TEST_SUITE_P(Engines, ChunkEngines, ::testing::ValuesIn(kEngines),
                         [](const auto &info) { return std::string(chunkEngineName(info.param)); });

TEST(ChunkEngineNames, RoundTripAndRejectOthers) {
  for (ChunkEngine engine : kEngines) {
    ChunkEngine parsed = ChunkEngine::Zlib;
    EXPECT_TRUE(chunkEngineFromName(chunkEngineName(engine), &parsed));
    EXPECT_EQ(parsed, engine);
  }
  ChunkEngine unchanged = ChunkEngine::Isal;
  EXPECT_FALSE(chunkEngineFromName("gzip", &unchanged));
  EXPECT_FALSE(chunkEngineFromName("", &unchanged));
  EXPECT_EQ(unchanged, ChunkEngine::Isal);
}

}  // namespace
