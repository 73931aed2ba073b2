#include "Libraries/CompressData/CompressorRegistry.h"

#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

TEST(CompressorRegistry, RowsAreFixedByTypeNumber) {
  for (uint32_t type : {0u, 1u, 2u}) {
    EXPECT_EQ(allCompressors[type].init, nullptr);
    EXPECT_EQ(compressorForReading(type), nullptr);
  }
  EXPECT_EQ(compressorForReading(3), &allCompressors[3]);
  EXPECT_EQ(compressorForReading(4), &allCompressors[4]);
  EXPECT_EQ(compressorForReading(5), nullptr);
  EXPECT_EQ(compressorForReading(0xFFFFFFFF), nullptr);
}

TEST(CompressorRegistry, ValidListsSelectTheirTypesInOrder) {
  struct {
    const char *list;
    std::vector<uint32_t> types;
  } cases[] = {{"3,4", {3, 4}}, {"4", {4}}, {"4,3", {4, 3}}, {" 3", {3}}, {"4x", {4}}};
  for (const auto &c : cases) {
    CompressorContext *ctx = initCompressor(c.list, nullptr, nullptr, nullptr, false, 5, false);
    ASSERT_NE(ctx, nullptr) << c.list;
    ASSERT_EQ(ctx->compressorCount, static_cast<int>(c.types.size())) << c.list;
    for (size_t i = 0; i < c.types.size(); i++) {
      EXPECT_EQ(ctx->compressorTypes[i], c.types[i]);
      EXPECT_EQ(ctx->compressors[i], &allCompressors[c.types[i]]);
      EXPECT_NE(ctx->compressorContexts[i], nullptr);
      EXPECT_EQ(ctx->successCounts[i], 0u);
    }
    EXPECT_EQ(ctx->inPlace, 1);
    EXPECT_EQ(ctx->truncateAndRestoreTimes, 1);
    EXPECT_EQ(ctx->setCompressedFlag, 1);
    EXPECT_EQ(ctx->tocFd, -1);
    EXPECT_EQ(ctx->compressionLevel, 5);
    freeCompressor(ctx);
  }
}

TEST(CompressorRegistry, BadListsReportEveryBadEntryAndFail) {
  struct {
    const char *list;
    const char *printed;
  } cases[] = {
      {"3,,4", "function 0 of compressor 0 is NULL\n"},
      {"", "function 0 of compressor 0 is NULL\n"},
      {"1,2", "function 0 of compressor 1 is NULL\nfunction 0 of compressor 2 is NULL\n"},
      {"5", "compressor 5 is out of bounds, only 5 compressors registered\n"},
      {"-1,4,9", "compressor -1 is out of bounds, only 5 compressors registered\n"
                 "compressor 9 is out of bounds, only 5 compressors registered\n"},
  };
  for (const auto &c : cases) {
    CaptureStdout();
    CaptureStderr();
    CompressorContext *ctx = initCompressor(c.list, nullptr, nullptr, nullptr, false, 5, false);
    std::string err = GetCapturedStderr();
    std::string out = GetCapturedStdout();
    EXPECT_EQ(ctx, nullptr) << c.list;
    EXPECT_EQ(out, c.printed) << c.list;
    EXPECT_EQ(err, "error setting up compressor list\n") << c.list;
  }
}

TEST(CompressorRegistry, MoreThan255EntriesAreRefused) {
  std::string list = "4";
  for (int i = 0; i < 255; i++) list += ",4";
  CaptureStdout();
  CaptureStderr();
  EXPECT_EQ(initCompressor(list.c_str(), nullptr, nullptr, nullptr, false, 5, false), nullptr);
  GetCapturedStderr();
  EXPECT_EQ(GetCapturedStdout(), "compressor list has more than 255 entries\n");
}

TEST(CompressorRegistry, TableOfContentsFileIsCreatedEmptyWithItsDirectories) {
  ScratchDir dir;
  std::string toc = dir.file("a/b/toc");
  for (int round = 0; round < 2; round++) {
    CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, toc.c_str(), true, 9, true);
    ASSERT_NE(ctx, nullptr);
    EXPECT_EQ(ctx->inPlace, 0);
    EXPECT_EQ(ctx->truncateAndRestoreTimes, 0);
    EXPECT_EQ(ctx->setCompressedFlag, 0);
    EXPECT_GE(ctx->tocFd, 0);
    EXPECT_EQ(ctx->verifyChecksums, 1);
    EXPECT_EQ(ctx->allowLargeResourceForks, 1);
    EXPECT_EQ(readFile(toc).size(), 0u);  // an existing file is emptied
    ASSERT_EQ(write(ctx->tocFd, "old", 3), 3);
    freeCompressor(ctx);
  }
}

TEST(CompressorRegistry, UnusableTableOfContentsPathFails) {
  ScratchDir dir;
  writeFile(dir.file("file"), std::string("x"));
  std::string below = dir.file("file/sub/toc");
  CaptureStderr();
  EXPECT_EQ(initCompressor("4", nullptr, nullptr, below.c_str(), false, 5, false), nullptr);
  std::string printed = GetCapturedStderr();
  EXPECT_THAT(printed, ::testing::HasSubstr("Libraries/CompressData/CompressData:"));
  EXPECT_THAT(printed, ::testing::HasSubstr("mkdirRecursive " + below + ": Not a directory\n"));

  ASSERT_EQ(mkdir(dir.file("ro").c_str(), 0555), 0);
  if (geteuid() != 0) {
    EXPECT_EQ(initCompressor("4", nullptr, nullptr, dir.file("ro/toc").c_str(), false, 5, false), nullptr);
    EXPECT_EQ(errno, EACCES);
  }
  freeCompressor(nullptr);
}

}  // namespace
