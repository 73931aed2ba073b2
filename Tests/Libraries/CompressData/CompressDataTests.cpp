#include "Libraries/CompressData/CompressData.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <thread>

#include "Libraries/CompressData/CompressorRegistry.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

std::vector<uint8_t> attribute(const std::string &path, const char *name) {
  ssize_t size = platform::getxattr(path.c_str(), name, nullptr, 0, 0, 0);
  if (size < 0) return {};
  std::vector<uint8_t> value(static_cast<size_t>(size));
  EXPECT_EQ(platform::getxattr(path.c_str(), name, value.data(), value.size(), 0, 0), size);
  return value;
}

// The logical data of a compressed file, through its type's row, in pieces of 1 MiB.
std::vector<uint8_t> logicalData(const std::string &path) {
  std::vector<uint8_t> header = attribute(path, kDecmpfsXattrName);
  EXPECT_GE(header.size(), 16u);
  if (header.size() < 16) return {};
  std::vector<uint8_t> block(4 + header.size());
  uint32_t size = static_cast<uint32_t>(header.size());
  memcpy(block.data(), &size, 4);
  memcpy(block.data() + 4, header.data(), header.size());
  DiskHeader disk;
  memcpy(&disk, header.data(), sizeof disk);
  const CompressorOps *row = compressorForReading(disk.compressionType);
  EXPECT_NE(row, nullptr);
  if (!row) return {};
  FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
  std::vector<uint8_t> data(disk.uncompressedSize);
  for (uint64_t offset = 0; offset < data.size();) {
    struct iovec vector = {data.data() + offset, std::min<size_t>(1 << 20, data.size() - offset)};
    int64_t got = row->doUncompress(fh, static_cast<int64_t>(offset), vector.iov_len, 1, &vector, block.data());
    EXPECT_GT(got, 0) << path << " at " << offset;
    if (got <= 0) break;
    offset += static_cast<uint64_t>(got);
  }
  fh->close(fh);
  return data;
}

void setTimes(const std::string &path, time_t accessed, time_t modified) {
  struct timeval times[2] = {{accessed, 250000}, {modified, 500000}};
  ASSERT_EQ(utimes(path.c_str(), times), 0);
}

enum class Outcome { Untouched, Type3, Type4, Refused };

struct TreeFile {
  std::string name;
  std::vector<uint8_t> bytes;
  Outcome outcome;
};

std::vector<TreeFile> mixedTree() {
  return {
      {"empty", {}, Outcome::Untouched},
      {"one-byte", {'z'}, Outcome::Type3},
      {"small-text", compressibleBytes(2000, 1), Outcome::Type3},
      {"random-3785", randomBytes(3785, 2), Outcome::Type3},
      {"random-3786", randomBytes(3786, 3), Outcome::Refused},
      {"text-65537", compressibleBytes(65537, 4), Outcome::Type4},
      {"text-150000", compressibleBytes(150000, 5), Outcome::Type4},
      {"random-1MiB", randomBytes(1 << 20, 6), Outcome::Refused},
      {"text-20MiB", compressibleBytes(20 << 20, 7), Outcome::Type4},
      {"text-64MiB-plus-1", compressibleBytes((64 << 20) + 1, 8), Outcome::Refused},
  };
}

class CompressData : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }
  ScratchDir dir;
};

TEST_F(CompressData, MixedTreeEndsAsEachTypeDecides) {
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, false);
  ASSERT_NE(ctx, nullptr);
  std::vector<TreeFile> tree = mixedTree();
  int64_t compressedBytes = 0, refusedBytes = 0;
  for (const TreeFile &file : tree) {
    std::string path = writeFile(dir.file(file.name), file.bytes);
    setTimes(path, 1000000, 2000000);
    CaptureStdout();
    int result = compressFile(ctx, path.c_str(), nullptr);
    GetCapturedStdout();
    EXPECT_EQ(result, file.outcome == Outcome::Refused ? -1 : 0) << file.name;
    if (file.outcome == Outcome::Refused) refusedBytes += static_cast<int64_t>(file.bytes.size());
    if (file.outcome == Outcome::Type3 || file.outcome == Outcome::Type4)
      compressedBytes += static_cast<int64_t>(file.bytes.size());
  }
  for (const TreeFile &file : tree) {
    SCOPED_TRACE(file.name);
    std::string path = dir.file(file.name);
    platform::Stat st;
    ASSERT_EQ(platform::stat(path.c_str(), &st), 0);
    std::vector<uint8_t> header = attribute(path, kDecmpfsXattrName);
    std::vector<uint8_t> fork = attribute(path, kResourceForkXattrName);
    if (file.outcome == Outcome::Untouched || file.outcome == Outcome::Refused) {
      EXPECT_EQ(readFile(path), file.bytes);
      EXPECT_EQ(st.st_flags, 0u);
      EXPECT_TRUE(header.empty());
      EXPECT_TRUE(fork.empty());
      continue;
    }
    EXPECT_EQ(st.st.st_size, 0);
    EXPECT_EQ(st.st_flags, kCompressedFlag);
    EXPECT_EQ(st.st.st_mtim.tv_sec, 2000000);
    EXPECT_EQ(st.st.st_mtim.tv_nsec, 500000000);
    EXPECT_EQ(st.st.st_atim.tv_sec, 1000000);
    ASSERT_GE(header.size(), 16u);
    DiskHeader disk;
    memcpy(&disk, header.data(), sizeof disk);
    EXPECT_EQ(memcmp(header.data(), "fpmc", 4), 0);
    EXPECT_EQ(disk.uncompressedSize, file.bytes.size());
    if (file.outcome == Outcome::Type3) {
      EXPECT_EQ(disk.compressionType, 3u);
      EXPECT_LE(header.size(), 3802u);
      EXPECT_TRUE(fork.empty());
    } else {
      EXPECT_EQ(disk.compressionType, 4u);
      EXPECT_EQ(header.size(), 16u);
      EXPECT_FALSE(fork.empty());
    }
    EXPECT_TRUE(logicalData(path) == file.bytes);
  }
  // The stored forms of the small random files: 3785 bytes fill the attribute exactly.
  std::vector<uint8_t> stored = attribute(dir.file("random-3785"), kDecmpfsXattrName);
  EXPECT_EQ(stored.size(), 3802u);
  EXPECT_EQ(stored[16], 0xFF);
  EXPECT_EQ(attribute(dir.file("one-byte"), kDecmpfsXattrName).size(), 18u);

  EXPECT_EQ(ctx->filesSeen, static_cast<int>(tree.size()));
  EXPECT_EQ(ctx->filesCompressed, 6);
  EXPECT_EQ(ctx->successCounts[0], 3u);
  EXPECT_EQ(ctx->successCounts[1], 3u);
  EXPECT_EQ(ctx->bytesCompressed, compressedBytes);
  EXPECT_EQ(ctx->bytesNotCompressed, refusedBytes);
  freeCompressor(ctx);
}

TEST_F(CompressData, StatisticsRoundToBlocks) {
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, false);
  std::string path = writeFile(dir.file("f"), compressibleBytes(5000, 9));
  ASSERT_EQ(compressFile(ctx, path.c_str(), nullptr), 0);
  EXPECT_EQ(ctx->bytesCompressed, 5000);
  EXPECT_EQ(ctx->bytesCompressedRounded, 8192);
  std::string random = writeFile(dir.file("r"), randomBytes(5000, 10));
  ASSERT_EQ(compressFile(ctx, random.c_str(), nullptr), -1);
  EXPECT_EQ(ctx->bytesNotCompressed, 5000);
  EXPECT_EQ(ctx->bytesNotCompressedRounded, 8192);
  freeCompressor(ctx);
}

TEST_F(CompressData, FilesThatNeedNoWorkOrAreRefusedStayAsTheyAre) {
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, true, 5, false);
  std::vector<uint8_t> text = compressibleBytes(10000, 11);
  // Own resource fork: refused.
  std::string withFork = writeFile(dir.file("fork"), text);
  ASSERT_EQ(platform::setxattr(withFork.c_str(), kResourceForkXattrName, "rsrc", 4, 0, 0), 0);
  EXPECT_EQ(compressFile(ctx, withFork.c_str(), nullptr), -1);
  EXPECT_EQ(readFile(withFork), text);
  // Already has a header (even without the flag): nothing to do.
  std::string done = writeFile(dir.file("done"), text);
  ASSERT_EQ(platform::setxattr(done.c_str(), kDecmpfsXattrName, "fpmc0000", 8, 0, 0), 0);
  EXPECT_EQ(compressFile(ctx, done.c_str(), nullptr), 0);
  EXPECT_EQ(readFile(done), text);
  // Missing file.
  CaptureStderr();
  EXPECT_EQ(compressFile(ctx, dir.file("missing").c_str(), nullptr), -1);
  EXPECT_THAT(GetCapturedStderr(), HasSubstr("open " + dir.file("missing")));
  EXPECT_EQ(ctx->filesSeen, 3);
  EXPECT_EQ(ctx->filesCompressed, 0);
  EXPECT_EQ(ctx->bytesNotCompressed, 0);
  freeCompressor(ctx);

  CompressorContext *none = initCompressor("3", nullptr, nullptr, nullptr, false, 5, false);
  std::vector<uint8_t> large = compressibleBytes(200000, 16);
  std::string path = writeFile(dir.file("large"), large);
  EXPECT_EQ(compressFile(none, path.c_str(), nullptr), -1);  // beyond what type 3 takes
  EXPECT_EQ(readFile(path), large);
  freeCompressor(none);
}

TEST_F(CompressData, VerifiedCompressionReplacesOtherFlagsWithTheCompressedFlag) {
  CompressorContext *ctx = initCompressor("4", nullptr, nullptr, nullptr, true, 5, false);
  std::vector<uint8_t> text = compressibleBytes(300000, 12);
  std::string path = writeFile(dir.file("hidden"), text);
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagHidden), 0);
  ASSERT_EQ(compressFile(ctx, path.c_str(), nullptr), 0);
  platform::Stat st;
  ASSERT_EQ(platform::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_flags, kCompressedFlag);
  uint8_t digest[16], expected[16];
  ASSERT_EQ(checksumFile(path.c_str(), digest), 1);  // the logical data, not the empty fork
  std::string copy = writeFile(dir.file("copy"), text);
  ASSERT_EQ(checksumFile(copy.c_str(), expected), 1);
  EXPECT_EQ(memcmp(digest, expected, 16), 0);
  EXPECT_EQ(checksumFile(dir.file("missing").c_str(), digest), 0);
  freeCompressor(ctx);
}

// Whichever in-place step fails after the compressed form is written, every reader still gets
// the whole data: the form is made durable and the file marked compressed before its data fork
// goes; a failed flush or truncation leaves a compressed file whose data fork is still full, a
// failed flag a plain file beside its compressed form.
TEST_F(CompressData, InPlaceStepThatFailsLeavesAFileThatReadsWhole) {
  struct Case {
    const char *name;
    sys::Call call;
    uint32_t flags;        // after the call
    bool dataForkKept;
    const char *message;
  } cases[] = {
      {"flush", sys::Call::Fsync, kCompressedFlag, true, "fsync "},
      {"truncation", sys::Call::Truncate, kCompressedFlag, true, "truncate "},
      {"flag", sys::Call::Fsetxattr, 0, true, "chflags "},
  };
  std::vector<uint8_t> text = compressibleBytes(300000, 20);
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    CompressorContext *ctx = initCompressor("4", nullptr, nullptr, nullptr, false, 5, false);
    std::string path = writeFile(dir.file(c.name), text);
    // Armed for the step after the compressor: its own calls of that kind come first.
    uint64_t header = sys::callCount(c.call);
    CompressorContext *twin = initCompressor("4", nullptr, nullptr, nullptr, false, 5, false);
    std::string twinPath = writeFile(dir.file(std::string(c.name) + ".twin"), text);
    ASSERT_EQ(compressFile(twin, twinPath.c_str(), nullptr), 0);
    freeCompressor(twin);
    uint64_t perRun = sys::callCount(c.call) - header;
    uint64_t nth = c.call == sys::Call::Fsetxattr ? perRun : 1;  // the flag word is the last fsetxattr
    CaptureStderr();
    sys::armFault(c.call, nth, EIO);
    EXPECT_EQ(compressFile(ctx, path.c_str(), nullptr), 0);  // these failures do not change the result
    sys::clearFaults();
    EXPECT_THAT(GetCapturedStderr(), HasSubstr(std::string(c.message) + path + ": Input/output error"));
    platform::Stat st;
    ASSERT_EQ(platform::stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_flags, c.flags);
    EXPECT_EQ(readFile(path).size(), c.dataForkKept ? text.size() : 0u);
    if (c.flags & kCompressedFlag) {
      EXPECT_EQ(logicalData(path), text);
    } else {
      EXPECT_EQ(readFile(path), text);
    }
    freeCompressor(ctx);
  }
}

// Parses a table-of-contents file into path -> (name -> bytes), failing on any malformed record.
std::map<std::string, std::map<std::string, std::vector<uint8_t>>> parseToc(const std::vector<uint8_t> &toc) {
  std::map<std::string, std::map<std::string, std::vector<uint8_t>>> records;
  size_t at = 0;
  auto text = [&] {
    const uint8_t *end = static_cast<const uint8_t *>(memchr(&toc[at], 0, toc.size() - at));
    EXPECT_NE(end, nullptr);
    std::string s(reinterpret_cast<const char *>(&toc[at]), end ? static_cast<size_t>(end - &toc[at]) : 0);
    at += s.size() + 1;
    return s;
  };
  auto u32 = [&] {
    uint32_t v = 0;
    EXPECT_LE(at + 4, toc.size());
    if (at + 4 <= toc.size()) memcpy(&v, &toc[at], 4);
    at += 4;
    return v;
  };
  while (at < toc.size() && !::testing::Test::HasFailure()) {
    std::string path = text();
    EXPECT_EQ(records.count(path), 0u) << path << " recorded twice";
    uint32_t count = u32();
    EXPECT_GE(count, 1u);
    for (uint32_t i = 0; i < count && at < toc.size(); i++) {
      std::string name = text();
      uint32_t length = u32();
      EXPECT_LE(at + length, toc.size());
      if (at + length > toc.size()) break;
      records[path][name].assign(toc.begin() + static_cast<long>(at), toc.begin() + static_cast<long>(at + length));
      at += length;
    }
  }
  return records;
}

TEST_F(CompressData, TableOfContentsModeLeavesFilesAloneAndRecordsTheirAttributes) {
  std::string toc = dir.file("out/toc");
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, toc.c_str(), true, 5, false);
  ASSERT_NE(ctx, nullptr);
  std::map<std::string, std::vector<uint8_t>> originals = {
      {dir.file("small"), compressibleBytes(3000, 13)},
      {dir.file("large"), compressibleBytes(400000, 14)},
      {dir.file("random"), randomBytes(9000, 15)},
  };
  for (const auto &[path, bytes] : originals) {
    writeFile(path, bytes);
    setTimes(path, 1000, 2000);
    compressFile(ctx, path.c_str(), nullptr);
  }
  EXPECT_EQ(ctx->filesCompressed, 2);
  freeCompressor(ctx);

  auto records = parseToc(readFile(toc));
  ASSERT_EQ(records.size(), 2u);
  for (const auto &[path, bytes] : originals) {
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(readFile(path), bytes) << path;
    EXPECT_EQ(st.st_mtime, 2000);
    EXPECT_TRUE(linuxAttributeNames(path).empty()) << path;
  }
  EXPECT_EQ(records.count(dir.file("random")), 0u);
  EXPECT_EQ(records[dir.file("small")].size(), 1u);
  EXPECT_EQ(records[dir.file("large")].size(), 2u);
  // The recorded attributes make a compressed file with the original data.
  for (auto &[path, attributes] : records) {
    std::string rebuilt = writeFile(path + ".rebuilt", std::string());
    for (auto &[name, value] : attributes)
      ASSERT_EQ(platform::setxattr(rebuilt.c_str(), name.c_str(), value.data(), value.size(), 0, 0), 0);
    EXPECT_TRUE(logicalData(rebuilt) == originals[path]) << path;
  }
}

TEST_F(CompressData, ThreadsSharingOneContextKeepExactStatisticsAndWholeRecords) {
  constexpr int kThreads = 4, kFilesPerThread = 12;
  std::string toc = dir.file("toc");
  CompressorContext *inPlace = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, false);
  CompressorContext *recorded = initCompressor("3,4", nullptr, nullptr, toc.c_str(), false, 5, false);
  int64_t expectedBytes = 0;
  int expectedType3 = 0;
  std::vector<std::vector<std::string>> work(kThreads);
  for (int t = 0; t < kThreads; t++) {
    for (int i = 0; i < kFilesPerThread; i++) {
      size_t size = (i % 3 == 0) ? 1500 + static_cast<size_t>(i) : 70000 + static_cast<size_t>(i * 1000);
      std::string path = writeFile(dir.file("f" + std::to_string(t) + "-" + std::to_string(i)),
                                   compressibleBytes(size, static_cast<uint32_t>(t * 100 + i)));
      work[t].push_back(path);
      expectedBytes += static_cast<int64_t>(size);
      if (size < 4000) expectedType3++;
    }
  }
  auto run = [&](CompressorContext *ctx) {
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; t++)
      threads.emplace_back([&, t] {
        for (const std::string &path : work[t]) EXPECT_EQ(compressFile(ctx, path.c_str(), nullptr), 0) << path;
      });
    for (auto &thread : threads) thread.join();
  };
  run(recorded);  // first, while the files are still plain
  run(inPlace);
  for (CompressorContext *ctx : {inPlace, recorded}) {
    EXPECT_EQ(ctx->filesSeen, kThreads * kFilesPerThread);
    EXPECT_EQ(ctx->filesCompressed, kThreads * kFilesPerThread);
    EXPECT_EQ(ctx->bytesCompressed, expectedBytes);
    EXPECT_EQ(ctx->successCounts[0], static_cast<uint32_t>(expectedType3));
    EXPECT_EQ(ctx->successCounts[1], static_cast<uint32_t>(kThreads * kFilesPerThread - expectedType3));
  }
  freeCompressor(inPlace);
  freeCompressor(recorded);
  EXPECT_EQ(parseToc(readFile(toc)).size(), static_cast<size_t>(kThreads * kFilesPerThread));
}

}  // namespace
