#include <sys/mount.h>
#include <sys/xattr.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>

#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

const std::string kPrefix = "Libraries/CompressData/CompressionQuery:[0-9]+: ";

std::vector<uint8_t> header(uint32_t magic, uint32_t type, uint64_t size, size_t payload = 0) {
  std::vector<uint8_t> bytes(16 + payload, 0xAB);
  memcpy(bytes.data(), &magic, 4);
  memcpy(bytes.data() + 4, &type, 4);
  memcpy(bytes.data() + 8, &size, 8);
  return bytes;
}

class CompressionQuery : public ::testing::Test {
 protected:
  // A file whose data fork holds `logical` bytes, made compressed by hand: flag, header
  // attribute and optionally a resource fork.
  std::string compressedFile(const std::string &name, size_t logical, const std::vector<uint8_t> &decmpfs,
                             size_t forkSize = 0) {
    std::string path = writeFile(dir.file(name), std::vector<uint8_t>(logical, 'x'));
    EXPECT_EQ(platform::chflags(path.c_str(), kFlagCompressed), 0);
    if (!decmpfs.empty()) {
      EXPECT_EQ(platform::setxattr(path.c_str(), kDecmpfsXattrName, decmpfs.data(), decmpfs.size(), 0, 0), 0);
    }
    if (forkSize) {
      std::vector<uint8_t> fork = randomBytes(forkSize, 1);
      EXPECT_EQ(platform::setxattr(path.c_str(), kResourceForkXattrName, fork.data(), fork.size(), 0, 0), 0);
    }
    return path;
  }

  // Runs the query, returning its result and what it printed.
  int query(const std::string &path, std::string *printed = nullptr) {
    CaptureStderr();
    int result = queryCompressionInfo(path.c_str(), &info);
    std::string text = GetCapturedStderr();
    if (printed) *printed = text;
    return result;
  }

  ScratchDir dir;
  CompressionInfo info{};
};

TEST_F(CompressionQuery, PlainFileReportsItsSize) {
  std::string path = writeFile(dir.file("plain"), std::string(1234, 'p'));
  std::string printed;
  ASSERT_EQ(query(path, &printed), 0);
  EXPECT_EQ(printed, "");
  EXPECT_EQ(info.compressionType, 0u);
  EXPECT_EQ(info.metadataSize, 0u);
  EXPECT_EQ(info.compressedSize, 0u);
  EXPECT_EQ(info.uncompressedSize, 1234u);
}

TEST_F(CompressionQuery, CompressedTypesReportTheirSizes) {
  // The data fork holds the logical size so that stat agrees with the header.
  std::string type3 = compressedFile("t3", 5000, header(kDecmpfsMagic, 3, 5000, 1200 - 16));
  ASSERT_EQ(query(type3), 0);
  EXPECT_EQ(info.compressionType, 3u);
  EXPECT_EQ(info.metadataSize, 16u);
  EXPECT_EQ(info.compressedSize, 1200u);
  EXPECT_EQ(info.uncompressedSize, 5000u);

  std::string type4 = compressedFile("t4", 200000, header(kDecmpfsMagic, 4, 200000), 70000);
  ASSERT_EQ(query(type4), 0);
  EXPECT_EQ(info.compressionType, 4u);
  EXPECT_EQ(info.metadataSize, 342u);
  EXPECT_EQ(info.compressedSize, 70000u);

  std::string type5 = compressedFile("t5", 10, header(kDecmpfsMagic, 5, 10));
  ASSERT_EQ(query(type5), 0);
  EXPECT_EQ(info.compressionType, 5u);
  EXPECT_EQ(info.metadataSize, 0xFFFFFFFFu);
  EXPECT_EQ(info.compressedSize, 0xFFFFFFFFFFFFFFFFu);
}

TEST_F(CompressionQuery, Type4MetadataSizeFollowsTheChunkTable) {
  struct {
    uint64_t size;
    uint32_t metadata;
  } cases[] = {{0, 326}, {1, 334}, {131072, 334}, {131073, 342}, {200000, 342}, {1ull << 30, 326 + 8 * 8192}};
  for (const auto &c : cases) {
    std::string path = compressedFile("m" + std::to_string(c.size), 0, header(kDecmpfsMagic, 4, c.size), 300);
    ASSERT_EQ(query(path), 0);
    EXPECT_EQ(info.metadataSize, c.metadata) << c.size;
  }
}

TEST_F(CompressionQuery, OdditiesAreReportedButAnswered) {
  std::string printed;
  std::string mismatch = compressedFile("mismatch", 5, header(kDecmpfsMagic, 3, 77, 10));
  ASSERT_EQ(query(mismatch, &printed), 0);
  EXPECT_EQ(info.uncompressedSize, 77u);
  EXPECT_THAT(printed, MatchesRegex(kPrefix + "Error: Uncompressed size for path '" + mismatch +
                                    "' as reported by stat did not match size in disk header!\n"));
  // An empty data fork is what every compressed file shows here: nothing to report.
  std::string emptied = compressedFile("emptied", 0, header(kDecmpfsMagic, 3, 77, 10));
  ASSERT_EQ(query(emptied, &printed), 0);
  EXPECT_EQ(info.uncompressedSize, 77u);
  EXPECT_EQ(printed, "");

  std::string noFork = compressedFile("nofork", 100, header(kDecmpfsMagic, 4, 100));
  ASSERT_EQ(query(noFork, &printed), 0);
  EXPECT_EQ(info.compressionType, 4u);
  EXPECT_EQ(info.compressedSize, 0u);
  EXPECT_EQ(info.metadataSize, 0u);
  EXPECT_THAT(printed, MatchesRegex(kPrefix + "Error: Type4 compressed file at path '" + noFork +
                                    "' did not have a resource fork\n"));

  for (uint32_t type : {0u, 2u, 6u}) {
    std::string unknown = compressedFile("unknown" + std::to_string(type), 8, header(kDecmpfsMagic, type, 8));
    ASSERT_EQ(query(unknown, &printed), 0);
    EXPECT_EQ(info.compressionType, type);
    EXPECT_EQ(info.metadataSize, 0u);
    EXPECT_EQ(info.compressedSize, 0u);
    EXPECT_THAT(printed, MatchesRegex(kPrefix + "Error: Unknown compression type encountered for file '" + unknown +
                                      "'\n"));
  }
}

TEST_F(CompressionQuery, BrokenHeadersFail) {
  std::string printed;
  std::vector<uint8_t> wrongMagic = header(kDecmpfsMagic, 3, 4, 4);
  memcpy(wrongMagic.data(), "cmpf", 4);
  std::string wrong = compressedFile("wrong", 4, wrongMagic);
  EXPECT_EQ(query(wrong, &printed), -1);
  EXPECT_THAT(printed, MatchesRegex(kPrefix + "Error: Compressed file at path '" + wrong +
                                    "' had incorrect magic in disk header\n"));

  std::vector<uint8_t> shortHeader = header(kDecmpfsMagic, 3, 4);
  shortHeader.resize(15);
  std::string shortened = compressedFile("short", 4, shortHeader);
  EXPECT_EQ(query(shortened, &printed), -1);
  EXPECT_THAT(printed, HasSubstr("had incorrect magic in disk header"));

  std::string flagOnly = compressedFile("flagonly", 4, {});
  EXPECT_EQ(query(flagOnly, &printed), -1);
  EXPECT_THAT(printed, MatchesRegex(kPrefix + "Error: Could not get decmpfs xattr for path " + flagOnly +
                                    "; No data available \\(61\\)\n"));
}

TEST_F(CompressionQuery, MissingPathAndNullArgumentsFailSilently) {
  std::string printed;
  EXPECT_EQ(query(dir.file("missing"), &printed), -1);
  EXPECT_EQ(printed, "");
  EXPECT_EQ(queryCompressionInfo(nullptr, &info), -1);
  EXPECT_EQ(queryCompressionInfo(dir.path().c_str(), nullptr), -1);
}

TEST(VolumeSupportsCompression, AnswersPerVolume) {
  ScratchDir dir;
  EXPECT_EQ(VolumeSupportsCompression(dir.path().c_str()), 1);
  EXPECT_EQ(VolumeSupportsCompression("/dev/shm"), 1);

  CaptureStderr();
  EXPECT_EQ(VolumeSupportsCompression("/nonexistent/plzc"), 0);
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex("Common/pathUtils:[0-9]+: statfs /nonexistent/plzc: No such file or directory\n"));
}

TEST(VolumeSupportsCompression, Ext4WithoutLargeAttributesCannotHoldCompressedFiles) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  ScratchDir dir;
  TemporaryMount ext4 = TemporaryMount::ext4WithoutLargeAttributes(dir.path());
  ASSERT_TRUE(ext4.mounted());
  std::string file = writeFile(ext4.mountPoint() + "/f", std::string("x"));
  EXPECT_EQ(VolumeSupportsCompression(file.c_str()), 0);
}

TEST(VolumeSupportsCompression, UnprobeableVolumeIsJudgedByItsType) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  ScratchDir dir;
  TemporaryMount tmpfs = TemporaryMount::tmpfs(dir.path(), "1M");
  ASSERT_TRUE(tmpfs.mounted());
  ASSERT_EQ(mount(nullptr, tmpfs.mountPoint().c_str(), nullptr, MS_REMOUNT | MS_RDONLY, nullptr), 0);
  EXPECT_EQ(VolumeSupportsCompression(tmpfs.mountPoint().c_str()), 1);
}

}  // namespace
