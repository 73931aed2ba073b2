#include "Common/pathUtils.h"

#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

bool isDirectory(const std::string &path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

TEST(MkdirRecursive, CreatesEveryMissingLevelAndSucceedsAgain) {
  ScratchDir dir;
  std::string deep = dir.file("a/b/c");
  ASSERT_EQ(mkdirRecursive(deep.c_str()), 0);
  EXPECT_TRUE(isDirectory(dir.file("a")));
  EXPECT_TRUE(isDirectory(dir.file("a/b")));
  EXPECT_TRUE(isDirectory(deep));
  EXPECT_EQ(mkdirRecursive(deep.c_str()), 0);
  std::string trailing = dir.file("t/u/");
  EXPECT_EQ(mkdirRecursive(trailing.c_str()), 0);
  EXPECT_TRUE(isDirectory(dir.file("t/u")));
}

TEST(MkdirRecursive, RelativePathsStartAtTheWorkingDirectory) {
  ScratchDir dir;
  char previous[4096];
  ASSERT_NE(getcwd(previous, sizeof previous), nullptr);
  ASSERT_EQ(chdir(dir.path().c_str()), 0);
  int result = mkdirRecursive("x/y");
  ASSERT_EQ(chdir(previous), 0);
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(isDirectory(dir.file("x/y")));
}

TEST(MkdirRecursive, AFileInTheWayFailsAtTheLevelBelowIt) {
  ScratchDir dir;
  writeFile(dir.file("file"), std::string("x"));
  std::string below = dir.file("file/sub/deeper");
  CaptureStderr();
  EXPECT_EQ(mkdirRecursive(below.c_str()), -1);
  EXPECT_EQ(errno, ENOTDIR);
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex("Common/pathUtils:[0-9]+: mkdir " + dir.file("file/sub") + ": Not a directory\n"));
}

TEST(VolRoot, FindsTheMountPointOfTheVolume) {
  char out[1024];
  EXPECT_STREQ(volRoot("/", out), "/");
  EXPECT_STREQ(volRoot("/etc/hostname", out), "/");
  EXPECT_STREQ(volRoot("/dev/shm", out), "/dev/shm");
  ScratchDir dir;
  std::string file = writeFile(dir.file("f"), std::string("x"));
  EXPECT_STREQ(volRoot(file.c_str(), out), "/dev/shm");
}

TEST(VolRoot, FileInsideAVolumeMountedOnADirectory) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  ScratchDir dir;
  TemporaryMount tmpfs = TemporaryMount::tmpfs(dir.path(), "1M");
  ASSERT_TRUE(tmpfs.mounted());
  ASSERT_EQ(mkdir((tmpfs.mountPoint() + "/sub").c_str(), 0755), 0);
  std::string file = writeFile(tmpfs.mountPoint() + "/sub/f", std::string("x"));
  char out[1024];
  EXPECT_EQ(std::string(volRoot(file.c_str(), out)), tmpfs.mountPoint());
  EXPECT_EQ(std::string(volRoot(tmpfs.mountPoint().c_str(), out)), tmpfs.mountPoint());
}

TEST(VolRoot, MissingPathFailsAfterTheStatfsMessage) {
  char out[1024];
  CaptureStderr();
  EXPECT_EQ(volRoot("/nonexistent/plzc", out), nullptr);
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex("Common/pathUtils:[0-9]+: statfs /nonexistent/plzc: No such file or directory\n"));
}

}  // namespace
