#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Common/FileHandle.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

class PlainFile : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    path = writeFile(dir.file("file"), std::string("0123456789"));
  }
  void TearDown() override {
    sys::clearFaults();
    if (fh) fh->close(fh);
  }
  FileHandle *open(int flags) {
    fh = openFile(path.c_str(), path.c_str(), flags);
    return fh;
  }
  ScratchDir dir;
  std::string path;
  FileHandle *fh = nullptr;
};

TEST_F(PlainFile, OpenCopiesNamesAndFillsThePlainSlots) {
  ASSERT_NE(open(O_RDONLY), nullptr);
  EXPECT_STREQ(fh->name, path.c_str());
  EXPECT_NE(fh->name, fh->path);
  EXPECT_EQ(fh->canUnread, 0);
  EXPECT_EQ(fh->unreadAlloc, nullptr);
  EXPECT_EQ(fh->unread, nullptr);
  EXPECT_EQ(fh->size(fh), 10);
  EXPECT_EQ(fh->mode(fh) & S_IFMT, S_IFREG);
  EXPECT_GT(fh->blockSize(fh), 0);
}

TEST_F(PlainFile, OpenOfMissingPathPrintsAndKeepsErrno) {
  CaptureStderr();
  FileHandle *missing = openFile("/nonexistent/x", "/nonexistent/x", O_RDONLY);
  std::string printed = GetCapturedStderr();
  EXPECT_EQ(missing, nullptr);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_THAT(printed, MatchesRegex("Common/PlainFile:[0-9]+: open /nonexistent/x: No such file or directory\n"));
}

TEST_F(PlainFile, ReadsAndWritesArePositional) {
  ASSERT_NE(open(O_RDWR), nullptr);
  char buffer[16] = {};
  EXPECT_EQ(fh->pread(fh, buffer, 4, 3), 4);
  EXPECT_STREQ(buffer, "3456");
  EXPECT_EQ(fh->pread(fh, buffer, 16, 8), 2);  // short count as the system gives it
  EXPECT_EQ(fh->pread(fh, buffer, 16, 10), 0);
  EXPECT_EQ(fh->pwrite(fh, "ab", 2, 12), 2);
  EXPECT_EQ(fh->size(fh), 14);
}

TEST_F(PlainFile, TimesRoundTripToTheNanosecond) {
  ASSERT_NE(open(O_RDWR), nullptr);
  struct timespec set[2] = {{1000, 1999999}, {2000, 5}};
  ASSERT_EQ(fh->utimes(fh, set), 0);
  struct timespec got[2];
  ASSERT_EQ(fh->times(fh, got), 0);
  EXPECT_EQ(got[0].tv_sec, 1000);
  EXPECT_EQ(got[0].tv_nsec, 1999999);
  EXPECT_EQ(got[1].tv_sec, 2000);
  EXPECT_EQ(got[1].tv_nsec, 5);
}

TEST_F(PlainFile, PathOperationsWorkOnAReadOnlyHandle) {
  ASSERT_NE(open(O_RDONLY), nullptr);
  ASSERT_EQ(fh->truncate(fh, 0), 0);
  EXPECT_EQ(fh->size(fh), 0);
  ASSERT_EQ(fh->chflags(fh, kFlagCompressed), 0);
  platform::Stat st;
  ASSERT_EQ(platform::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_flags, kFlagCompressed);
  ASSERT_EQ(fh->setxattr(fh, "com.tavix.ResourceFork", "xyz", 3, 100, 0), 0);
  EXPECT_EQ(fh->getxattr(fh, "com.tavix.ResourceFork", nullptr, 0, 0, 0), 103);
  char byte;
  EXPECT_EQ(fh->getxattr(fh, "com.tavix.ResourceFork", &byte, 1, 101, 0), 1);
  EXPECT_EQ(byte, 'y');
  EXPECT_EQ(fh->removexattr(fh, "com.tavix.ResourceFork", 0), 0);
}

TEST_F(PlainFile, MissingAttributeIsSilentEnoattr) {
  ASSERT_NE(open(O_RDONLY), nullptr);
  CaptureStderr();
  EXPECT_EQ(fh->getxattr(fh, "com.tavix.decmpfs", nullptr, 0, 0, 0), -1);
  EXPECT_EQ(errno, ENOATTR);
  EXPECT_EQ(fh->removexattr(fh, "com.tavix.decmpfs", 0), -1);
  EXPECT_EQ(errno, ENOATTR);
  EXPECT_EQ(GetCapturedStderr(), "");
}

// Each operation's message when its system call fails, driven by injected faults.
TEST_F(PlainFile, EveryFailingOperationPrintsItsMessage) {
  ASSERT_NE(open(O_RDWR), nullptr);
  struct timespec times[2] = {};
  char buffer[4];
  struct Case {
    sys::Call call;
    int error;
    std::function<int64_t()> operation;
    int64_t result;
    const char *message;
  } cases[] = {
      {sys::Call::Open, EACCES, [&] { return int64_t(fh->reopen(fh, O_RDONLY)); }, -1, "open: Permission denied"},
      {sys::Call::Fstat, EIO, [&] { return int64_t(fh->mode(fh)); }, 0, "stat: Input/output error"},
      {sys::Call::Fstat, EIO, [&] { return int64_t(fh->times(fh, times)); }, -1, "stat: Input/output error"},
      {sys::Call::Futimes, EPERM, [&] { return int64_t(fh->utimes(fh, times)); }, -1, "futimes: Operation not permitted"},
      {sys::Call::Fstat, EIO, [&] { return fh->size(fh); }, -1, "stat: Input/output error"},
      {sys::Call::Fstat, EIO, [&] { return fh->blockSize(fh); }, 4096, "stat: Input/output error"},
      {sys::Call::Pread, EIO, [&] { return fh->pread(fh, buffer, 4, 0); }, -1, "pread: Input/output error"},
      {sys::Call::Pwrite, ENOSPC, [&] { return fh->pwrite(fh, buffer, 4, 0); }, -1, "pwrite: No space left on device"},
      {sys::Call::Fsetxattr, ENOSPC, [&] { return int64_t(fh->chflags(fh, 2)); }, -1, "chflags: No space left on device"},
      {sys::Call::Ftruncate, EROFS, [&] { return int64_t(fh->truncate(fh, 0)); }, -1, "truncate: Read-only file system"},
      {sys::Call::Fgetxattr, EIO, [&] { return fh->getxattr(fh, "a", nullptr, 0, 0, 0); }, -1, "getxattr: Input/output error"},
      {sys::Call::Fsetxattr, ENOSPC, [&] { return int64_t(fh->setxattr(fh, "a", "b", 1, 0, 0)); }, -1,
       "fsetxattr: No space left on device"},
  };
  for (const Case &c : cases) {
    sys::armFault(c.call, 1, c.error);
    CaptureStderr();
    int64_t result = c.operation();
    int error = errno;
    std::string printed = GetCapturedStderr();
    sys::clearFaults();
    EXPECT_EQ(result, c.result) << c.message;
    if (c.result == -1) {
      EXPECT_EQ(error, c.error) << c.message;
    }
    EXPECT_THAT(printed, MatchesRegex(std::string("Common/PlainFile:[0-9]+: ") + c.message + "\n"));
  }
  // removexattr names the path and the attribute.
  ASSERT_EQ(fh->setxattr(fh, "a", "b", 1, 0, 0), 0);
  sys::armFault(sys::Call::Fremovexattr, 1, EPERM);
  CaptureStderr();
  EXPECT_EQ(fh->removexattr(fh, "a", 0), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex("Common/PlainFile:[0-9]+: removexattr\\(" + path + ",a\\): Operation not permitted\n"));
}

TEST_F(PlainFile, FailedReopenKeepsTheOldDescriptor) {
  ASSERT_NE(open(O_RDONLY), nullptr);
  sys::armFault(sys::Call::Open, 1, EMFILE);
  CaptureStderr();
  EXPECT_EQ(fh->reopen(fh, O_RDWR), -1);
  GetCapturedStderr();
  char buffer[2];
  EXPECT_EQ(fh->pread(fh, buffer, 2, 0), 2);
  ASSERT_EQ(fh->reopen(fh, O_RDWR), 0);
  EXPECT_EQ(fh->pwrite(fh, "x", 1, 0), 1);
}

TEST_F(PlainFile, BlockSizeAfterTheDescriptorWentBadIs4096AndCloseOfNullIsZero) {
  ASSERT_NE(open(O_RDONLY), nullptr);
  CaptureStderr();  // before the close, so that the capture does not reuse the descriptor
  close(*static_cast<int *>(fh->priv));
  EXPECT_EQ(fh->blockSize(fh), 4096);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Common/PlainFile:[0-9]+: stat: Bad file descriptor\n"));
  EXPECT_EQ(fh->close(fh), -1);
  EXPECT_EQ(errno, EBADF);
  fh = nullptr;
  FileHandle *none = nullptr;
  // Any handle's close slot accepts null.
  ASSERT_NE(open(O_RDONLY), nullptr);
  EXPECT_EQ(fh->close(none), 0);
}

// Another file renamed into the handle's place (an editor saving, a tree being reorganised)
// must never take the opened file's flags, attributes or truncation.
TEST_F(PlainFile, AFileRenamedIntoItsPlaceIsNeverChanged) {
  ASSERT_NE(open(O_RDONLY), nullptr);
  std::string other = writeFile(dir.file("other"), std::string("other data"));
  std::string moved = dir.file("moved");
  ASSERT_EQ(rename(path.c_str(), moved.c_str()), 0);
  ASSERT_EQ(rename(other.c_str(), path.c_str()), 0);

  EXPECT_EQ(fh->setxattr(fh, "a", "b", 1, 0, 0), 0);
  EXPECT_EQ(fh->chflags(fh, kFlagCompressed), 0);
  CaptureStderr();
  EXPECT_EQ(fh->truncate(fh, 0), -1);
  EXPECT_EQ(errno, ESTALE);
  EXPECT_THAT(GetCapturedStderr(), HasSubstr(path + " no longer names the file opened"));

  // The newcomer is as it was; what was done went to the file opened, now at its new name.
  EXPECT_EQ(readFile(path), std::vector<uint8_t>({'o', 't', 'h', 'e', 'r', ' ', 'd', 'a', 't', 'a'}));
  EXPECT_TRUE(linuxAttributeNames(path).empty());
  platform::Stat st;
  ASSERT_EQ(platform::stat(moved.c_str(), &st), 0);
  EXPECT_EQ(st.st_flags, kFlagCompressed);
  EXPECT_EQ(st.st.st_size, 10);
}

}  // namespace
