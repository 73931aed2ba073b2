#include "Platform/FileFlags.h"

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "Platform/ExtendedAttributes.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

TEST(FileFlags, NewFileHasNoFlagsAndNoAttribute) {
  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("abc"));
  platform::Stat st;
  ASSERT_EQ(platform::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_flags, 0u);
  EXPECT_EQ(st.st.st_size, 3);
  EXPECT_TRUE(linuxAttributeNames(path).empty());
}

TEST(FileFlags, ChflagsReplacesTheWholeWordAndEveryStatReportsIt) {
  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("abc"));
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagCompressed | kFlagHidden), 0);
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagUserImmutable | kFlagSystemImmutable), 0);

  int fd = open(path.c_str(), O_RDONLY);
  ASSERT_GE(fd, 0);
  platform::Stat byPath, byLink, byFd;
  ASSERT_EQ(platform::stat(path.c_str(), &byPath), 0);
  ASSERT_EQ(platform::lstat(path.c_str(), &byLink), 0);
  ASSERT_EQ(platform::fstat(fd, &byFd), 0);
  for (uint32_t flags : {byPath.st_flags, byLink.st_flags, byFd.st_flags})
    EXPECT_EQ(flags, kFlagUserImmutable | kFlagSystemImmutable);

  ASSERT_EQ(platform::fchflags(fd, kFlagCompressed), 0);
  ASSERT_EQ(platform::stat(path.c_str(), &byPath), 0);
  EXPECT_EQ(byPath.st_flags, kFlagCompressed);
  close(fd);

  // Flags are recorded, not enforced: the immutable file can still be written by Linux.
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagUserImmutable), 0);
  writeFile(path, std::string("changed"));
  EXPECT_EQ(readFile(path).size(), 7u);
}

TEST(FileFlags, ZeroFlagsLeaveNoAttributeAndTheWordIsNotAnOrdinaryAttribute) {
  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("abc"));
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagCompressed), 0);
  EXPECT_EQ(platform::listxattr(path.c_str(), nullptr, 0, 0), 0);  // hidden from the attribute view
  ASSERT_EQ(platform::chflags(path.c_str(), 0), 0);
  EXPECT_TRUE(linuxAttributeNames(path).empty());
  ASSERT_EQ(platform::chflags(path.c_str(), 0), 0);  // already none
}

TEST(FileFlags, FlagsFollowTheFileAcrossRenameAndSymbolicLinksShowNone) {
  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("abc"));
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagCompressed), 0);
  std::string moved = dir.file("g");
  ASSERT_EQ(rename(path.c_str(), moved.c_str()), 0);
  std::string link = dir.file("link");
  ASSERT_EQ(symlink(moved.c_str(), link.c_str()), 0);

  platform::Stat st;
  ASSERT_EQ(platform::stat(link.c_str(), &st), 0);
  EXPECT_EQ(st.st_flags, kFlagCompressed);
  ASSERT_EQ(platform::lstat(link.c_str(), &st), 0);
  EXPECT_TRUE(S_ISLNK(st.st.st_mode));
  EXPECT_EQ(st.st_flags, 0u);
}

TEST(FileFlags, MissingFileFails) {
  platform::Stat st;
  EXPECT_EQ(platform::stat("/nonexistent/plzc", &st), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(platform::chflags("/nonexistent/plzc", kFlagCompressed), -1);
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace
