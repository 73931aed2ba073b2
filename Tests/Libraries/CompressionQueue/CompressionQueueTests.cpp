#include <fcntl.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <thread>

#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

uint32_t flagsOf(const std::string &path) {
  platform::Stat st;
  EXPECT_EQ(platform::stat(path.c_str(), &st), 0);
  return st.st_flags;
}

bool sameLogicalData(const std::string &path, const std::vector<uint8_t> &expected) {
  uint8_t digest[16], wanted[16];
  EXPECT_EQ(checksumFile(path.c_str(), digest), 1);
  std::string copy = path + ".expected";
  writeFile(copy, expected);
  checksumFile(copy.c_str(), wanted);
  unlink(copy.c_str());
  return memcmp(digest, wanted, 16) == 0;
}

class CompressionQueue : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }
  ScratchDir dir;
};

TEST_F(CompressionQueue, ExistingFilesAreCompressedInPlaceOrLeftExactlyAsTheyWere) {
  StreamCompressorQueue *queue = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, nullptr);
  ASSERT_NE(queue, nullptr);
  struct File {
    std::string name;
    std::vector<uint8_t> bytes;
    bool compressed;
  } files[] = {
      {"text", compressibleBytes(700000, 1), true},
      {"huge-text", compressibleBytes(100 << 20, 2), false},  // over type 4's 64 MiB cap: left alone
      {"random", randomBytes(300000, 3), false},
      {"empty", {}, false},
      {"._sidecar", compressibleBytes(10000, 4), false},
      {"clip.mp4", compressibleBytes(10000, 5), false},  // excluded by the shipped rules
  };
  for (const File &file : files) {
    std::string path = writeFile(dir.file(file.name), file.bytes);
    ASSERT_EQ(platform::chflags(path.c_str(), kFlagHidden), 0);
    struct timeval times[2] = {{1000, 0}, {2000, 0}};
    ASSERT_EQ(utimes(path.c_str(), times), 0);
  }
  for (const File &file : files) EXPECT_EQ(CompressFile(queue, dir.file(file.name).c_str(), dir.path().c_str()), 1);
  CaptureStderr();
  FinishCompressionAndCleanUp(queue);
  EXPECT_EQ(GetCapturedStderr(), "");
  for (const File &file : files) {
    SCOPED_TRACE(file.name);
    std::string path = dir.file(file.name);
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mtime, 2000);
    if (file.compressed) {
      EXPECT_EQ(flagsOf(path), kFlagHidden | kCompressedFlag);
      EXPECT_EQ(st.st_size, 0);
      EXPECT_TRUE(sameLogicalData(path, file.bytes));
    } else {
      EXPECT_EQ(flagsOf(path), kFlagHidden);
      EXPECT_TRUE(readFile(path) == file.bytes);
      EXPECT_TRUE(linuxAttributeNames(path).size() == 1u);  // only the flag word
    }
  }
  EXPECT_EQ(throttlingDescriptorsHeld(), 0);
}

TEST_F(CompressionQueue, SeveralCallersShareOneQueue) {
  StreamCompressorQueue *queue = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, nullptr);
  constexpr int kThreads = 4, kFiles = 25;
  for (int t = 0; t < kThreads; t++)
    for (int i = 0; i < kFiles; i++)
      writeFile(dir.file(std::to_string(t) + "-" + std::to_string(i)),
                compressibleBytes(static_cast<size_t>(20000 + i * 9000), static_cast<uint32_t>(t * 100 + i)));
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++)
    threads.emplace_back([&, t] {
      for (int i = 0; i < kFiles; i++)
        EXPECT_EQ(CompressFile(queue, dir.file(std::to_string(t) + "-" + std::to_string(i)).c_str(), nullptr), 1);
    });
  for (auto &thread : threads) thread.join();
  FinishCompressionAndCleanUp(queue);
  for (int t = 0; t < kThreads; t++)
    for (int i = 0; i < kFiles; i++) {
      std::string path = dir.file(std::to_string(t) + "-" + std::to_string(i));
      EXPECT_EQ(flagsOf(path), kCompressedFlag) << path;
      EXPECT_TRUE(sameLogicalData(path, compressibleBytes(static_cast<size_t>(20000 + i * 9000),
                                                          static_cast<uint32_t>(t * 100 + i))))
          << path;
    }
}

TEST_F(CompressionQueue, MissingFileFailsAndLeavesTheBudgetAlone) {
  StreamCompressorQueue *queue = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, nullptr);
  CaptureStderr();
  EXPECT_EQ(CompressFile(queue, dir.file("missing").c_str(), nullptr), 0);
  std::string printed = GetCapturedStderr();
  EXPECT_THAT(printed, HasSubstr("waitThenDupOrOpen(" + dir.file("missing") + ",-1): No such file or directory"));
  EXPECT_THAT(printed, HasSubstr("Libraries/CompressionQueue/CompressionQueue:"));
  EXPECT_THAT(printed, HasSubstr("waitThenDupOrOpen '" + dir.file("missing") + "': No such file or directory"));
  EXPECT_EQ(throttlingDescriptorsHeld(), 0);
  CaptureStderr();
  FinishCompressionAndCleanUp(queue);
  EXPECT_EQ(GetCapturedStderr(), "");
}

TEST_F(CompressionQueue, InvalidOptionsGiveNoQueue) {
  PVMutableDictionaryRef options = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  PVMutableArrayRef types = PVArrayCreateMutable(0);
  PVRef bogus = PVStringCreateWithCString("bogus", kPVStringEncodingUTF8);
  PVArrayAppendValue(types, bogus);
  PVDictionarySetValue(options, kPLZCSkipMachOFileTypes, types);
  CaptureStderr();
  EXPECT_EQ(CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, options), nullptr);
  EXPECT_THAT(GetCapturedStderr(), HasSubstr("invalid item 'bogus' at index 0"));
  PVRelease(bogus);
  PVRelease(types);
  PVRelease(options);
}

}  // namespace
