// The random-access reader: every chunk of a type-3 or type-4 file, in any order and from any
// thread, is what decompressData gives for the same bytes; damaged headers and chunk tables
// are refused chunk by chunk, never read past.
#include "Libraries/CompressData/CompressedReader.h"

#include <fcntl.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <random>
#include <thread>

#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using plzc::CompressedReader;

namespace {

constexpr uint32_t kForkTable = 264;  // first chunk-table entry in a type-4 fork

// Text that deflate shrinks, with some incompressible stretches so that stored chunks occur.
std::vector<uint8_t> mixedBytes(size_t size, uint32_t seed) {
  std::vector<uint8_t> bytes = compressibleBytes(size, seed);
  std::vector<uint8_t> noise = randomBytes(70000, seed + 1);
  if (size > 200000) memcpy(bytes.data() + 131072, noise.data(), noise.size());
  return bytes;
}

uint32_t compressInPlace(const std::string &path) {
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, false);
  EXPECT_NE(ctx, nullptr);
  if (!ctx) return 0;
  EXPECT_EQ(compressFile(ctx, path.c_str(), nullptr), 0) << path;
  freeCompressor(ctx);
  CompressionInfo info{};
  EXPECT_EQ(queryCompressionInfo(path.c_str(), &info), 0);
  return info.compressionType;
}

int appendWriter(int64_t offset, const void *bytes, int64_t count, void *ctx) {
  auto *out = static_cast<std::vector<uint8_t> *>(ctx);
  if (offset != static_cast<int64_t>(out->size())) return -1;
  out->insert(out->end(), static_cast<const uint8_t *>(bytes), static_cast<const uint8_t *>(bytes) + count);
  return 0;
}

class Reader : public ::testing::Test {
 protected:
  // A compressed file of these bytes, with its handle open; the expected type is checked.
  std::string compressed(const std::string &name, const std::vector<uint8_t> &bytes, uint32_t type) {
    std::string path = writeFile(dir.file(name), bytes);
    EXPECT_EQ(compressInPlace(path), type) << name;
    return path;
  }
  FileHandle *open(const std::string &path) {
    if (fh) fh->close(fh);
    fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
    EXPECT_NE(fh, nullptr);
    return fh;
  }
  std::vector<uint8_t> decompressAll() {
    std::vector<uint8_t> out;
    EXPECT_EQ(decompressData(fh, appendWriter, &out), 0);
    return out;
  }
  void TearDown() override {
    if (fh) fh->close(fh);
  }
  void writeFork(const std::string &path, uint32_t position, const void *bytes, size_t count) {
    ASSERT_EQ(platform::setxattr(path.c_str(), kResourceForkXattrName, bytes, count, position, 0), 0);
  }

  ScratchDir dir;
  FileHandle *fh = nullptr;
};

TEST_F(Reader, EveryChunkInAnyOrderMatchesDecompressData) {
  struct Case {
    const char *name;
    size_t size;
    uint32_t type;
  } cases[] = {{"tiny", 1000, 3}, {"one-chunk", 65536, 4}, {"exact", 65536 * 4, 4}, {"ragged", 65536 * 9 + 777, 4},
               {"mixed", 900000, 4}};
  for (const Case &c : cases) {
    std::vector<uint8_t> original = mixedBytes(c.size, static_cast<uint32_t>(c.size));
    std::string path = compressed(c.name, original, c.type);
    ASSERT_NE(open(path), nullptr);
    std::vector<uint8_t> whole = decompressAll();
    ASSERT_EQ(whole, original) << c.name;

    std::unique_ptr<CompressedReader> reader;
    ASSERT_EQ(CompressedReader::open(fh, &reader), CompressedReader::Status::Ok) << c.name;
    EXPECT_EQ(reader->type(), c.type);
    EXPECT_EQ(reader->logicalSize(), c.size);
    EXPECT_EQ(reader->chunkSize(), c.type == 3 ? 131072u : 65536u);
    // Backwards, so that no chunk is read right after the one before it.
    std::vector<uint8_t> chunk(reader->chunkSize());
    for (uint64_t i = reader->chunkCount(); i-- > 0;) {
      uint32_t length = reader->chunkLength(i);
      ASSERT_EQ(reader->readChunk(i, chunk.data()), static_cast<int64_t>(length)) << c.name << " chunk " << i;
      EXPECT_EQ(0, memcmp(chunk.data(), whole.data() + i * reader->chunkSize(), length)) << c.name << " chunk " << i;
    }
    EXPECT_EQ(reader->readChunk(reader->chunkCount(), chunk.data()), -1) << "a chunk past the end";
    EXPECT_EQ(errno, EIO);

    std::mt19937 random(7);
    for (int n = 0; n < 40; n++) {
      uint64_t offset = random() % c.size;
      uint64_t count = std::min<uint64_t>(1 + random() % 200000, c.size - offset);
      std::vector<uint8_t> piece(count);
      ASSERT_EQ(reader->read(static_cast<int64_t>(offset), count, piece.data()), static_cast<int64_t>(count));
      EXPECT_EQ(0, memcmp(piece.data(), whole.data() + offset, count)) << c.name << " at " << offset;
    }
  }
}

TEST_F(Reader, ThreadsShareOneReader) {
  std::vector<uint8_t> original = mixedBytes(65536 * 24 + 5, 3);
  ASSERT_NE(open(compressed("shared", original, 4)), nullptr);
  std::unique_ptr<CompressedReader> reader;
  ASSERT_EQ(CompressedReader::open(fh, &reader), CompressedReader::Status::Ok);
  std::vector<std::thread> threads;
  std::atomic<int> wrong{0};
  for (int t = 0; t < 4; t++) {
    threads.emplace_back([&, t] {
      std::vector<uint8_t> chunk(reader->chunkSize());
      for (int round = 0; round < 3; round++) {
        for (uint64_t k = 0; k < reader->chunkCount(); k++) {
          uint64_t i = (k * 7 + static_cast<uint64_t>(t)) % reader->chunkCount();
          int64_t got = reader->readChunk(i, chunk.data());
          if (got != reader->chunkLength(i) ||
              memcmp(chunk.data(), original.data() + i * reader->chunkSize(), static_cast<size_t>(got)) != 0)
            wrong++;
        }
      }
    });
  }
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(wrong.load(), 0);
}

TEST_F(Reader, HeadersThatCannotBeUsedAreNamed) {
  std::string plain = writeFile(dir.file("plain"), "plain bytes");
  ASSERT_NE(open(plain), nullptr);
  std::unique_ptr<CompressedReader> reader;
  CompressedReader::Found found;
  EXPECT_EQ(CompressedReader::open(fh, &reader, &found), CompressedReader::Status::Unreadable);
  EXPECT_EQ(found.attributeSize, -1);

  struct Case {
    uint32_t magic, type;
    size_t length;
    CompressedReader::Status status;
  } cases[] = {
      {kDecmpfsMagic, 4, 8, CompressedReader::Status::ShortHeader},
      {0x12345678, 4, 16, CompressedReader::Status::WrongMagic},
      {kDecmpfsMagic, 5, 16, CompressedReader::Status::UnsupportedType},
      {kDecmpfsMagic, 9, 16, CompressedReader::Status::UnsupportedType},
      {kDecmpfsMagic, 0, 16, CompressedReader::Status::UnsupportedType},
  };
  std::string path = compressed("header", compressibleBytes(300000, 1), 4);
  uint64_t charged = throttlingMemoryCharged();
  for (const Case &c : cases) {
    uint8_t header[16];
    uint64_t size = 300000;
    memcpy(header, &c.magic, 4);
    memcpy(header + 4, &c.type, 4);
    memcpy(header + 8, &size, 8);
    ASSERT_EQ(platform::setxattr(path.c_str(), kDecmpfsXattrName, header, c.length, 0, 0), 0);
    ASSERT_NE(open(path), nullptr);
    EXPECT_EQ(CompressedReader::open(fh, &reader, &found), c.status) << "type " << c.type << " length " << c.length;
    EXPECT_EQ(reader, nullptr);
    EXPECT_EQ(found.attributeSize, static_cast<int64_t>(c.length));
    if (c.length == 16) {
      EXPECT_EQ(found.header.compressionType, c.type);
    }
    EXPECT_EQ(throttlingMemoryCharged(), charged) << "the header's buffer was not given back";
  }
}

TEST_F(Reader, DamagedTableEntriesFailTheirChunkOnly) {
  std::vector<uint8_t> original = compressibleBytes(65536 * 6, 11);
  struct Case {
    const char *name;
    uint32_t entry;          // which table entry is overwritten
    uint32_t offset, length; // its new contents
  } cases[] = {
      {"offset-past-4GiB", 2, 0xFFFFFF00u, 100},
      {"length-past-capacity", 2, 60, 0x7FFFFFFFu},
      {"offset-past-fork", 2, 0x00F00000u, 1000},
      {"garbage-bytes", 2, 40, 500},  // the table itself: not a zlib stream
  };
  for (const Case &c : cases) {
    std::string path = compressed(c.name, original, 4);
    uint8_t entry[8];
    memcpy(entry, &c.offset, 4);
    memcpy(entry + 4, &c.length, 4);
    writeFork(path, kForkTable + 8 * c.entry, entry, sizeof entry);
    ASSERT_NE(open(path), nullptr);
    std::unique_ptr<CompressedReader> reader;
    ASSERT_EQ(CompressedReader::open(fh, &reader), CompressedReader::Status::Ok);
    std::vector<uint8_t> chunk(reader->chunkSize());
    FdCapture err(2);  // the type's own messages
    for (uint64_t i = 0; i < reader->chunkCount(); i++) {
      int64_t got = reader->readChunk(i, chunk.data());
      if (i == c.entry) {
        EXPECT_EQ(got, -1) << c.name;
        EXPECT_EQ(errno, EIO) << c.name;
      } else {
        ASSERT_EQ(got, 65536) << c.name << " chunk " << i;
        EXPECT_EQ(0, memcmp(chunk.data(), original.data() + i * 65536, 65536)) << c.name << " chunk " << i;
      }
    }
    std::vector<uint8_t> out;
    EXPECT_EQ(decompressData(fh, appendWriter, &out), -1) << c.name << ": decompressData agrees";
    EXPECT_EQ(out.size(), 65536u * c.entry) << c.name;
    err.text();
  }
}

TEST_F(Reader, ChunkCountShorterThanTheHeaderSays) {
  std::vector<uint8_t> original = compressibleBytes(65536 * 5, 4);
  std::string path = compressed("short-count", original, 4);
  uint32_t count = 3;
  writeFork(path, 260, &count, sizeof count);
  ASSERT_NE(open(path), nullptr);
  std::unique_ptr<CompressedReader> reader;
  ASSERT_EQ(CompressedReader::open(fh, &reader), CompressedReader::Status::Ok);
  EXPECT_EQ(reader->chunkCount(), 5u) << "the header's size decides the count";
  std::vector<uint8_t> chunk(65536);
  FdCapture err(2);
  EXPECT_EQ(reader->readChunk(2, chunk.data()), 65536);
  EXPECT_EQ(reader->readChunk(3, chunk.data()), -1);
  EXPECT_EQ(reader->readChunk(4, chunk.data()), -1);
  EXPECT_NE(err.text().find("is greater than max chunk"), std::string::npos);
}

TEST_F(Reader, WrongMagicIsRefusedByDecompressDataToo) {
  std::string path = compressed("magic", compressibleBytes(200000, 2), 4);
  uint8_t header[16];
  ASSERT_EQ(platform::getxattr(path.c_str(), kDecmpfsXattrName, header, sizeof header, 0, 0), 16);
  header[0] ^= 0xFF;
  ASSERT_EQ(platform::setxattr(path.c_str(), kDecmpfsXattrName, header, sizeof header, 0, 0), 0);
  ASSERT_NE(open(path), nullptr);
  std::vector<uint8_t> out;
  FdCapture err(2);
  EXPECT_EQ(decompressData(fh, appendWriter, &out), -1);
  EXPECT_NE(err.text().find("incorrect magic in the header of '" + path + "'"), std::string::npos);
  EXPECT_TRUE(out.empty());
}

}  // namespace
