#include "Common/OverlayFile.h"

#include "Common/DataPool.h"
#include "Compressors/Zlib/Type4/compressorType4.h"

#include <fcntl.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <thread>

#include "Platform/ExtendedAttributes.h"
#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

constexpr const char *kFork = "com.tavix.ResourceFork";
constexpr const char *kHeader = "com.tavix.decmpfs";
const std::string kPrefix = "Common/OverlayFile:[0-9]+: ";

// A read-once source: each pread must continue where the previous one stopped, like a pool.
struct Sequential {
  FileHandle handle{};
  std::vector<uint8_t> bytes;
  int64_t position = 0;
};

int64_t sequentialPread(FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
  auto *source = static_cast<Sequential *>(fh->priv);
  if (offset != source->position) return -1;
  int64_t n = std::min<int64_t>(count, static_cast<int64_t>(source->bytes.size()) - offset);
  memcpy(buffer, source->bytes.data() + offset, static_cast<size_t>(n));
  source->position += n;
  return n;
}
int64_t sequentialSize(FileHandle *fh) { return static_cast<int64_t>(static_cast<Sequential *>(fh->priv)->bytes.size()); }
int64_t sequentialBlockSize(FileHandle *) { return 4096; }
int64_t sequentialGetxattr(FileHandle *, const char *, void *, uint64_t, uint32_t, int) {
  errno = ENOATTR;
  return -1;
}

class OverlayFile : public ::testing::Test {
 protected:
  void SetUp() override {
    source.bytes = randomBytes(1000, 1);
    source.handle.name = source.handle.path = const_cast<char *>("pool");
    source.handle.pread = sequentialPread;
    source.handle.size = sequentialSize;
    source.handle.blockSize = sequentialBlockSize;
    source.handle.getxattr = sequentialGetxattr;
    source.handle.priv = &source;
    dict = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    overlay = openTocFile(&source.handle, dict, 1);
    ASSERT_NE(overlay, nullptr);
  }
  void TearDown() override {
    if (overlay) overlay->close(overlay);
    PVRelease(dict);
    sys::clearFaults();
  }
  std::vector<uint8_t> entry(const char *name) {
    PVMutableDataRef data = getDataForAttr(overlay, name, 0);
    if (!data) return {};
    return std::vector<uint8_t>(PVDataGetBytePtr(data), PVDataGetBytePtr(data) + PVDataGetLength(data));
  }

  Sequential source;
  PVMutableDictionaryRef dict = nullptr;
  FileHandle *overlay = nullptr;
};

TEST_F(OverlayFile, ResourceForkGrowsWithZerosAndNeverShrinks) {
  std::vector<uint8_t> ten(10, 7), five(5, 9);
  ASSERT_EQ(overlay->setxattr(overlay, kFork, ten.data(), 10, 100, 0), 0);
  std::vector<uint8_t> expected(110, 0);
  std::fill(expected.begin() + 100, expected.end(), 7);
  EXPECT_EQ(entry(kFork), expected);
  ASSERT_EQ(overlay->setxattr(overlay, kFork, five.data(), 5, 0, 0), 0);
  std::fill(expected.begin(), expected.begin() + 5, 9);
  EXPECT_EQ(entry(kFork), expected);
  // Reads at a position, short at the end, nothing past it.
  uint8_t buffer[20];
  EXPECT_EQ(overlay->getxattr(overlay, kFork, nullptr, 0, 0, 0), 110);
  EXPECT_EQ(overlay->getxattr(overlay, kFork, buffer, 20, 95, 0), 15);
  EXPECT_EQ(buffer[4], 0);
  EXPECT_EQ(buffer[5], 7);
  EXPECT_EQ(overlay->getxattr(overlay, kFork, buffer, 20, 110, 0), 0);
}

TEST_F(OverlayFile, OrdinaryAttributesAreWholeAndLimited) {
  std::vector<uint8_t> header(3802, 1), tooLong(3803, 2);
  ASSERT_EQ(overlay->setxattr(overlay, kHeader, header.data(), header.size(), 0, 0), 0);
  EXPECT_EQ(overlay->setxattr(overlay, kHeader, tooLong.data(), tooLong.size(), 0, 0), -1);
  EXPECT_EQ(errno, ERANGE);
  EXPECT_EQ(overlay->setxattr(overlay, kHeader, header.data(), 4, 1, 0), -1);
  EXPECT_EQ(errno, ERANGE);
  std::vector<uint8_t> buffer(3803);
  EXPECT_EQ(overlay->getxattr(overlay, kHeader, nullptr, 0, 0, 0), 3802);
  EXPECT_EQ(overlay->getxattr(overlay, kHeader, buffer.data(), 3803, 0, 0), -1);
  EXPECT_EQ(errno, ERANGE);
  EXPECT_EQ(overlay->getxattr(overlay, kHeader, buffer.data(), 3802, 0, 0), 3802);
  EXPECT_EQ(overlay->getxattr(overlay, kHeader, buffer.data(), 3802, 7, 0), -1);
  EXPECT_EQ(errno, ERANGE);
}

TEST_F(OverlayFile, NamesNeverSetAreAskedOfTheBase) {
  char buffer[8];
  EXPECT_EQ(overlay->getxattr(overlay, "other", buffer, sizeof buffer, 0, 0), -1);
  EXPECT_EQ(errno, ENOATTR);

  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("x"));
  ASSERT_EQ(platform::setxattr(path.c_str(), "own", "abc", 3, 0, 0), 0);
  FileHandle *plain = openFile(path.c_str(), path.c_str(), O_RDONLY);
  ASSERT_NE(plain, nullptr);
  FileHandle *over = openTocFile(plain, dict, 0);
  EXPECT_EQ(over->getxattr(over, "own", buffer, sizeof buffer, 0, 0), 3);
  EXPECT_EQ(over->mode(over) & 0777, plain->mode(plain) & 0777);
  // Writes stay in the dictionary: the file keeps only its own attribute.
  ASSERT_EQ(over->setxattr(over, "own", "zz", 2, 0, 0), 0);
  EXPECT_EQ(over->getxattr(over, "own", buffer, 2, 0, 0), 2);
  EXPECT_EQ(platform::getxattr(path.c_str(), "own", buffer, sizeof buffer, 0, 0), 3);
  over->close(over);
  plain->close(plain);
}

TEST_F(OverlayFile, RemovedAttributeReadsAsMissingAndIsNeverAppliedOrWritten) {
  ASSERT_EQ(overlay->setxattr(overlay, kHeader, "abcd", 4, 0, 0), 0);
  ASSERT_EQ(overlay->removexattr(overlay, kHeader, 0), 0);
  EXPECT_EQ(overlay->getxattr(overlay, kHeader, nullptr, 0, 0, 0), -1);
  EXPECT_EQ(errno, ENOATTR);

  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("x"));
  int fd = open(path.c_str(), O_RDWR);
  EXPECT_EQ(applyTocDictToFd(fd, dict), 0);
  EXPECT_TRUE(linuxAttributeNames(path).empty());
  off_t before = lseek(fd, 0, SEEK_END);
  writeTocDictToFile(fd, "/a/b", dict);
  EXPECT_EQ(lseek(fd, 0, SEEK_END), before);
  EXPECT_EQ(readFile(path), std::vector<uint8_t>{'x'});
  close(fd);
}

TEST_F(OverlayFile, RefusedAndIgnoredOperations) {
  CaptureStdout();
  EXPECT_EQ(overlay->reopen(overlay, O_RDWR), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(GetCapturedStdout(), "_reopen not allowed\n");
  CaptureStderr();
  EXPECT_EQ(overlay->pwrite(overlay, "x", 1, 0), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(overlay->truncate(overlay, 1), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(overlay->truncate(overlay, 0), 0);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex(kPrefix + "Error: _pwrite not allowed\n" + kPrefix +
                                                "Error: _truncate not allowed\n"));
  struct timespec times[2] = {{1, 2}, {3, 4}};
  EXPECT_EQ(overlay->times(overlay, times), 0);
  EXPECT_EQ(times[0].tv_sec, 1);  // the caller's array is not written
  EXPECT_EQ(overlay->utimes(overlay, times), 0);
  EXPECT_EQ(overlay->chflags(overlay, 0x20), 0);
  EXPECT_EQ(overlay->size(overlay), 1000);
  EXPECT_EQ(overlay->blockSize(overlay), 4096);
}

TEST_F(OverlayFile, UnreadCycleReplaysPushedBackBytesThenContinuesOnTheBase) {
  std::vector<uint8_t> first(100);
  ASSERT_EQ(overlay->pread(overlay, first.data(), 100, 0), 100);
  void *room = overlay->unreadAlloc(overlay, 100);
  ASSERT_NE(room, nullptr);
  ASSERT_EQ(overlay->unread(overlay, first.data(), 100), 0);
  ASSERT_EQ(overlay->unreadDone(overlay), 0);

  CaptureStderr();
  uint8_t byte;
  EXPECT_EQ(overlay->pread(overlay, &byte, 1, 10), -1);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex(kPrefix + "Error: should read the unread buffer first\n"));

  std::vector<uint8_t> again(150);
  ASSERT_EQ(overlay->pread(overlay, again.data(), 150, 0), 150);
  EXPECT_TRUE(std::equal(again.begin(), again.end(), source.bytes.begin()));
  // The buffer is gone: the next read goes straight to the base where it stopped.
  ASSERT_EQ(overlay->pread(overlay, again.data(), 10, 150), 10);
  EXPECT_TRUE(std::equal(again.begin(), again.begin() + 10, source.bytes.begin() + 150));
}

TEST_F(OverlayFile, UnreadBufferMisuseIsReported) {
  CaptureStderr();
  EXPECT_EQ(overlay->unreadSetPos(overlay, 0), -1);
  ASSERT_NE(overlay->unreadAlloc(overlay, 100), nullptr);
  EXPECT_EQ(overlay->unreadAlloc(overlay, 100), nullptr);  // already have one
  EXPECT_EQ(overlay->unreadSetPos(overlay, 101), 0);       // beyond: unchanged
  std::vector<uint8_t> bytes(70, 3);
  EXPECT_EQ(overlay->unread(overlay, bytes.data(), 60), 0);
  EXPECT_EQ(overlay->unreadDone(overlay), 0);  // only 60 of 100
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex(kPrefix + "Error: _unreadSetPos with no unread buffer\n" + kPrefix +
                           "Error: already have an unread buffer\n" + kPrefix + "Error: exceeded unread buffer\n" +
                           kPrefix + "Error: only unread 60 of 100\n"));
  // A smaller request while the buffer is still being read is refused silently: rewind it.
  std::vector<uint8_t> some(10);
  ASSERT_EQ(overlay->pread(overlay, some.data(), 10, 0), 10);
  CaptureStderr();
  EXPECT_EQ(overlay->unreadAlloc(overlay, 20), nullptr);
  EXPECT_EQ(GetCapturedStderr(), "");
  ASSERT_EQ(overlay->unreadSetPos(overlay, 0), 0);
  std::vector<uint8_t> all(60);
  EXPECT_EQ(overlay->pread(overlay, all.data(), 60, 0), 60);
  EXPECT_EQ(all, std::vector<uint8_t>(60, 3));

  ASSERT_NE(overlay->unreadAlloc(overlay, 4), nullptr);
  CaptureStderr();
  EXPECT_EQ(overlay->unread(overlay, bytes.data(), 6), 0);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex(kPrefix + "Error: exceeded unread buffer, pos 0 count 6 size 4\n"));
}

TEST_F(OverlayFile, TableOfContentsRecordLayout) {
  ScratchDir dir;
  std::string path = dir.file("toc");
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(overlay->setxattr(overlay, "x", "abc", 3, 0, 0), 0);
  writeTocDictToFile(fd, "/a/b", dict);
  std::vector<uint8_t> expected = {'/', 'a', '/', 'b', 0, 1, 0, 0, 0, 'x', 0, 3, 0, 0, 0, 'a', 'b', 'c'};
  EXPECT_EQ(readFile(path), expected);

  // A second record follows directly; entries keep the dictionary's order, empty ones are left out.
  PVMutableDictionaryRef second = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  FileHandle *over = openTocFile(&source.handle, second, 0);
  std::vector<uint8_t> fork(300, 0xEE);
  ASSERT_EQ(over->setxattr(over, kHeader, "0123456789abcdef", 16, 0, 0), 0);
  ASSERT_EQ(over->setxattr(over, "gone", "q", 1, 0, 0), 0);
  ASSERT_EQ(over->removexattr(over, "gone", 0), 0);
  ASSERT_EQ(over->setxattr(over, kFork, fork.data(), fork.size(), 0, 0), 0);
  writeTocDictToFile(fd, "/c", second);
  over->close(over);
  PVRelease(second);
  close(fd);

  std::vector<uint8_t> all = readFile(path);
  std::vector<uint8_t> record(all.begin() + 18, all.end());
  size_t at = 0;
  auto text = [&] {
    std::string s(reinterpret_cast<const char *>(&record[at]));
    at += s.size() + 1;
    return s;
  };
  auto u32 = [&] {
    uint32_t v;
    memcpy(&v, &record[at], 4);
    at += 4;
    return v;
  };
  EXPECT_EQ(text(), "/c");
  EXPECT_EQ(u32(), 2u);
  EXPECT_EQ(text(), kHeader);
  EXPECT_EQ(u32(), 16u);
  EXPECT_EQ(std::string(reinterpret_cast<const char *>(&record[at]), 16), "0123456789abcdef");
  at += 16;
  EXPECT_EQ(text(), kFork);
  EXPECT_EQ(u32(), 300u);
  EXPECT_TRUE(std::equal(fork.begin(), fork.end(), record.begin() + at));
  EXPECT_EQ(at + 300, record.size());
}

TEST_F(OverlayFile, ApplyingIsAllOrNothing) {
  ScratchDir dir;
  std::string path = writeFile(dir.file("f"), std::string("x"));
  int fd = open(path.c_str(), O_RDWR);
  ASSERT_EQ(overlay->setxattr(overlay, "one", "1", 1, 0, 0), 0);
  ASSERT_EQ(overlay->setxattr(overlay, "two", "2", 1, 0, 0), 0);
  ASSERT_EQ(overlay->setxattr(overlay, "three", "3", 1, 0, 0), 0);
  sys::armFault(sys::Call::Fsetxattr, 2, ENOSPC);
  CaptureStderr();
  EXPECT_EQ(applyTocDictToFd(fd, dict), -1);
  EXPECT_EQ(errno, ENOSPC);
  EXPECT_THAT(GetCapturedStderr(),
              MatchesRegex(kPrefix + "applyDictFunc fsetxattr\\([0-9]+,two,0x[0-9a-f]+,1\\): No space left on device\n"));
  sys::clearFaults();
  EXPECT_TRUE(linuxAttributeNames(path).empty());

  EXPECT_EQ(applyTocDictToFd(fd, dict), 0);
  char value;
  EXPECT_EQ(platform::getxattr(path.c_str(), "three", &value, 1, 0, 0), 1);
  EXPECT_EQ(value, '3');
  close(fd);
}

// A type-4 attempt that fails part-way through a read-once pool gives back what it consumed,
// so that the plain write-out still reads the whole file from the start.
TEST_F(OverlayFile, DetachedOverlayOutlivesItsBase) {
  ASSERT_EQ(overlay->setxattr(overlay, kHeader, "fpmc", 4, 0, 0), 0);
  ASSERT_EQ(overlayDetachBase(overlay), 0);
  EXPECT_STREQ(overlay->name, "pool");
  EXPECT_NE(overlay->name, source.handle.name) << "the name must be the overlay's own copy";
  EXPECT_EQ(overlay->path, overlay->name);
  char header[4];
  EXPECT_EQ(overlay->getxattr(overlay, kHeader, header, sizeof header, 0, 0), 4);
  EXPECT_EQ(overlay->getxattr(overlay, kFork, nullptr, 0, 0, 0), -1);
  EXPECT_EQ(errno, ENOATTR);
  uint8_t byte;
  EXPECT_EQ(overlay->pread(overlay, &byte, 1, 0), -1);
  EXPECT_EQ(errno, EBADF);
  EXPECT_EQ(overlay->size(overlay), -1);
  EXPECT_EQ(source.position, 0);  // the base was never asked
}

// A type-4 attempt that fails in its last step, after it had read the whole file from a
// read-once base, still gives every byte back: here the size query of the finished fork cannot
// allocate.
TEST(OverlayGiveBack, LateFailureAfterTheWholeFileWasReadGivesEveryByteBack) {
  std::vector<uint8_t> file = compressibleBytes(5 * 65536 + 99, 3);
  // Returns the allocations the attempt made; a non-zero `fail` makes that one fail.
  auto attempt = [&](uint64_t fail) {
    DataPool *pool = newDataPool(static_cast<int64_t>(file.size()));
    EXPECT_EQ(addDataToPool(pool, file.data(), file.size()), static_cast<int64_t>(file.size()));
    finishDataPool(pool);
    FileHandle *poolFile = openDataPoolFile(pool, "pool");
    PVMutableDictionaryRef dict = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    FileHandle *overlay = openTocFile(poolFile, dict, 1);
    void *context = initCompressorType4(nullptr, nullptr, 5, 0);
    uint64_t before = sys::callCount(sys::Call::Malloc);
    if (fail) sys::armFault(sys::Call::Malloc, fail, ENOMEM);
    EXPECT_EQ(compressFileType4(overlay, "pool", static_cast<int64_t>(file.size()), context), fail ? -1 : 0);
    sys::clearFaults();
    uint64_t made = sys::callCount(sys::Call::Malloc) - before;
    freeContextType4(context);
    if (fail) {
      std::vector<uint8_t> back(file.size());
      int64_t got = 0;
      for (int64_t n; got < static_cast<int64_t>(back.size()) &&
                      (n = overlay->pread(overlay, back.data() + got, 100000, got)) > 0;)
        got += n;
      EXPECT_EQ(got, static_cast<int64_t>(file.size()));
      EXPECT_TRUE(back == file);
    }
    overlay->close(overlay);
    poolFile->close(poolFile);
    PVRelease(dict);
    releaseDataPool(pool);
    return made;
  };
  uint64_t allocations = attempt(0);
  ASSERT_GT(allocations, 0u);
  attempt(allocations);  // the last one: the key of the fork's size query
}

TEST(OverlayGiveBack, FailedAttemptOnAPoolLeavesEveryByteForTheNextReader) {
  // Compressible chunks first (if any), then random ones that blow the fork's budget: at
  // chunk 0 for the small file, at a later chunk for the others.
  struct Shape {
    size_t compressibleChunks, randomBytes;
  } shapes[] = {{0, 10000}, {0, 40 * 65536 + 123}, {5, 40 * 65536 + 123}};
  for (const Shape &shape : shapes) {
    SCOPED_TRACE(shape.compressibleChunks * 65536 + shape.randomBytes);
    std::vector<uint8_t> file(shape.compressibleChunks * 65536, 'a');
    std::vector<uint8_t> random = randomBytes(shape.randomBytes, 9);
    file.insert(file.end(), random.begin(), random.end());
    DataPool *pool = newDataPool(static_cast<int64_t>(file.size()));
    ASSERT_NE(pool, nullptr);
    std::thread writer([&] {
      for (size_t at = 0; at < file.size(); at += 10000)
        ASSERT_GT(addDataToPool(pool, file.data() + at, std::min<size_t>(10000, file.size() - at)), 0);
      finishDataPool(pool);
    });
    FileHandle *poolFile = openDataPoolFile(pool, "pool");
    PVMutableDictionaryRef dict = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    FileHandle *overlay = openTocFile(poolFile, dict, 1);
    void *context = initCompressorType4(nullptr, nullptr, 5, 0);
    EXPECT_EQ(compressFileType4(overlay, "pool", static_cast<int64_t>(file.size()), context), -1);
    freeContextType4(context);

    std::vector<uint8_t> back(file.size());
    int64_t got = 0;
    for (int64_t n; got < static_cast<int64_t>(back.size()) &&
                    (n = overlay->pread(overlay, back.data() + got, 100000, got)) > 0;)
      got += n;
    EXPECT_EQ(got, static_cast<int64_t>(file.size()));
    EXPECT_TRUE(back == file);
    writer.join();
    overlay->close(overlay);
    poolFile->close(poolFile);
    PVRelease(dict);
    releaseDataPool(pool);
  }
}

}  // namespace
