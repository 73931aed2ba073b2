#include "Platform/Syscalls.h"

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <vector>

#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

// A volume that fills up part-way through a write takes what fits and then refuses with ENOSPC:
// the first call returns short without any error, and only the write of the rest says why.
// writeAll and pwriteAll go on to that second call, so the failure carries its real cause
// instead of whatever errno happened to hold.
TEST(Syscalls, FullWritesReportTheVolumeFillingUp) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a small tmpfs needs root";
  ScratchDir dir;
  ASSERT_FALSE(dir.path().empty());
  TemporaryMount volume = TemporaryMount::tmpfs(dir.path(), "1m");
  ASSERT_TRUE(volume.mounted());
  std::vector<char> bytes(3 << 20, 'x');
  struct {
    const char *name;
    bool positional;
  } cases[] = {{"write", false}, {"pwrite", true}};
  for (const auto &c : cases) {
    std::string path = volume.mountPoint() + "/" + c.name;
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ASSERT_GE(fd, 0);
    errno = ENODATA;  // stale, as an earlier missing attribute leaves it
    ssize_t wrote = c.positional ? sys::pwriteAll(fd, bytes.data(), bytes.size(), 4096)
                                 : sys::writeAll(fd, bytes.data(), bytes.size());
    EXPECT_EQ(wrote, -1) << c.name;
    EXPECT_EQ(errno, ENOSPC) << c.name;
    EXPECT_GT(lseek(fd, 0, SEEK_END), 0) << c.name << ": what fitted was written";
    close(fd);
    unlink(path.c_str());
  }
}

TEST(Syscalls, FullWritesOfWhatFitsReturnTheCount) {
  ScratchDir dir;
  ASSERT_FALSE(dir.path().empty());
  int fd = open(dir.file("f").c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  ASSERT_GE(fd, 0);
  std::vector<char> bytes(200000, 'y');
  EXPECT_EQ(sys::writeAll(fd, bytes.data(), bytes.size()), 200000);
  EXPECT_EQ(sys::pwriteAll(fd, "ab", 2, 300000), 2);
  EXPECT_EQ(lseek(fd, 0, SEEK_END), 300002);
  // A failing call is reported as it failed.
  sys::armFault(sys::Call::Write, 1, EIO);
  EXPECT_EQ(sys::writeAll(fd, bytes.data(), 10), -1);
  EXPECT_EQ(errno, EIO);
  sys::clearFaults();
  close(fd);
}

}  // namespace
