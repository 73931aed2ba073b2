#include "Platform/VolumeCapabilities.h"

#include <linux/magic.h>
#include <sys/mount.h>

#include <gtest/gtest.h>

#include "Platform/KernelDecompression.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

TEST(KernelDecompression, ReleaseNumberRule) {
  struct {
    const char *release;
    int decompresses;
  } cases[] = {{"10.0.0", 1}, {"10.8.0", 1}, {"23.1.0", 1}, {"9.8.0", 0}, {"8.0", 0}, {"", 0}};
  for (const auto &c : cases) EXPECT_EQ(platform::releaseDecompressesFiles(c.release), c.decompresses) << c.release;
  EXPECT_EQ(platform::kernelDecompressesFiles(), 0);
}

TEST(VolumeCapabilities, ProbeFindsTheCapabilityOnACapableVolume) {
  ScratchDir dir;
  uint32_t capabilities[4] = {1, 2, 3, 4};
  ASSERT_EQ(platform::getVolumeCapabilities(dir.path().c_str(), capabilities), 0);
  EXPECT_EQ(capabilities[0], platform::kVolumeCapabilityCompression);
  EXPECT_TRUE(linuxAttributeNames(dir.path()).empty());
}

TEST(VolumeCapabilities, ProbeAnswersOnVolumesThatCannotHoldTheFormOrCannotBeProbed) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  ScratchDir dir;
  TemporaryMount ext4 = TemporaryMount::ext4WithoutLargeAttributes(dir.path());
  ASSERT_TRUE(ext4.mounted());
  uint32_t capabilities[4];
  ASSERT_EQ(platform::getVolumeCapabilities(ext4.mountPoint().c_str(), capabilities), 0);
  EXPECT_EQ(capabilities[0], 0u);

  TemporaryMount readOnly = TemporaryMount::tmpfs(dir.path(), "1M");
  ASSERT_TRUE(readOnly.mounted());
  ASSERT_EQ(mount(nullptr, readOnly.mountPoint().c_str(), nullptr, MS_REMOUNT | MS_RDONLY, nullptr), 0);
  EXPECT_EQ(platform::getVolumeCapabilities(readOnly.mountPoint().c_str(), capabilities), -1);
  EXPECT_EQ(errno, EINVAL);
}

TEST(VolumeCapabilities, StatfsNamesTheMountPointAndType) {
  platform::FileSystemInfo info;
  ASSERT_EQ(platform::statfs("/dev/shm", &info), 0);
  EXPECT_STREQ(info.mountPoint, "/dev/shm");
  EXPECT_EQ(info.type, static_cast<long>(TMPFS_MAGIC));
  EXPECT_TRUE(platform::fileSystemHoldsLargeAttributes(info.type));
  EXPECT_FALSE(platform::fileSystemHoldsLargeAttributes(EXT4_SUPER_MAGIC));
  EXPECT_EQ(platform::statfs("/nonexistent/plzc", &info), -1);
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace
