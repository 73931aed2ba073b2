#include "Common/StreamCompressor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <thread>

#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Platform/ThrottledIO.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

const std::string kPrefix = "Common/StreamCompressor:[0-9]+: ";

// Options built from key/value pairs; values are retained by the dictionary.
PVDictionaryRef options(std::initializer_list<std::pair<PVStringRef, PVRef>> entries) {
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  for (const auto &[key, value] : entries) {
    PVDictionarySetValue(dictionary, key, value);
    PVRelease(value);
  }
  return dictionary;
}

std::vector<uint8_t> logical(const std::string &path) {
  platform::Stat st;
  EXPECT_EQ(platform::stat(path.c_str(), &st), 0);
  if (!(st.st_flags & kCompressedFlag)) return readFile(path);
  FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
  std::vector<uint8_t> data;
  decompressData(
      fh,
      [](int64_t offset, const void *bytes, int64_t count, void *context) {
        auto *out = static_cast<std::vector<uint8_t> *>(context);
        out->resize(static_cast<size_t>(offset + count));
        memcpy(out->data() + offset, bytes, static_cast<size_t>(count));
        return 0;
      },
      &data);
  fh->close(fh);
  return data;
}

uint32_t flagsOf(const std::string &path) {
  platform::Stat st;
  EXPECT_EQ(platform::stat(path.c_str(), &st), 0);
  return st.st_flags;
}

class StreamCompressor : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }

  // Writes one new file through the queue in pieces of `piece` bytes. Returns the stream's
  // close result, or 1 when no stream was created.
  int writeThrough(StreamCompressorQueue *queue, const std::string &name, const std::vector<uint8_t> &bytes,
                   size_t piece = 100000, const std::function<void(int fd)> &beforeWriting = nullptr) {
    std::string path = dir.file(name);
    int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
    EXPECT_GE(fd, 0);
    if (beforeWriting) beforeWriting(fd);
    ::StreamCompressor *stream = CreateStreamCompressor(fd, path.c_str(), dir.path().c_str(), queue,
                                                        static_cast<int64_t>(bytes.size()));
    close(fd);  // the stream has its own descriptor
    if (!stream) return 1;
    for (size_t at = 0; at < bytes.size(); at += piece) {
      size_t count = std::min(piece, bytes.size() - at);
      if (WriteToStreamCompressor(stream, bytes.data() + at, count) != static_cast<int64_t>(count)) break;
    }
    return CloseStreamCompressor(stream);
  }

  ScratchDir dir;
};

TEST_F(StreamCompressor, QueueWithoutStreamsFinishesAtOnce) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  ASSERT_NE(queue, nullptr);
  EXPECT_EQ(queue->group, nullptr);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  EXPECT_EQ(FinishStreamCompressorQueue(nullptr), -1);
  EXPECT_EQ(errno, EINVAL);
}

TEST_F(StreamCompressor, NewFilesEndCompressedOrPlainWithTheirData) {
  PVRef types = PVStringCreateWithCString("3,4", kPVStringEncodingUTF8);
  PVDictionaryRef opts = options({{kPLZCCompressionTypes, types}});
  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(opts);
  PVRelease(opts);
  struct File {
    std::string name;
    std::vector<uint8_t> bytes;
    bool compressed;
  } files[] = {
      {"small.txt", compressibleBytes(3000, 1), true},   {"large.txt", compressibleBytes(3 << 20, 2), true},
      {"random.bin", randomBytes(500000, 3), false},      {"empty", {}, false},
      {"photo.jpg", compressibleBytes(200000, 4), false},  // the shipped rules leave it alone
  };
  for (const File &file : files) EXPECT_EQ(writeThrough(queue, file.name, file.bytes), 0) << file.name;
  EXPECT_EQ(writeThrough(queue, "._resource", compressibleBytes(100, 5)), 1);  // no stream
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  for (const File &file : files) {
    SCOPED_TRACE(file.name);
    std::string path = dir.file(file.name);
    EXPECT_EQ(flagsOf(path), file.compressed ? kCompressedFlag : 0u);
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_size, file.compressed ? 0 : static_cast<off_t>(file.bytes.size()));
    EXPECT_TRUE(logical(path) == file.bytes);
  }
}

TEST_F(StreamCompressor, FilesLargerThanTheRingStreamThroughWhileTheCallerWrites) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  std::vector<uint8_t> compressible = compressibleBytes(80 << 20, 6);
  std::vector<uint8_t> random = randomBytes(70 << 20, 7);
  std::vector<uint8_t> fitting = compressibleBytes(60 << 20, 8);
  // Over 64 MiB type 4 refuses at once: the plain write-out drains the pool through the overlay.
  EXPECT_EQ(writeThrough(queue, "big.txt", compressible, 1 << 20), 0);
  EXPECT_EQ(writeThrough(queue, "big.bin", random, 1 << 20), 0);  // straight to the I/O queue
  EXPECT_EQ(writeThrough(queue, "fits.txt", fitting, 1 << 20), 0);  // compressed as it arrives
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  EXPECT_TRUE(readFile(dir.file("big.txt")) == compressible);
  EXPECT_TRUE(readFile(dir.file("big.bin")) == random);
  EXPECT_EQ(flagsOf(dir.file("big.bin")), 0u);
  EXPECT_EQ(flagsOf(dir.file("big.txt")), 0u);
  EXPECT_EQ(flagsOf(dir.file("fits.txt")), kCompressedFlag);
  EXPECT_TRUE(logical(dir.file("fits.txt")) == fitting);
}

TEST_F(StreamCompressor, ManyStreamsFromSeveralThreads) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  constexpr int kThreads = 3, kFiles = 40;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++)
    threads.emplace_back([&, t] {
      for (int i = 0; i < kFiles; i++) {
        std::string name = "f" + std::to_string(t) + "-" + std::to_string(i);
        size_t size = static_cast<size_t>((i * 7919 + t * 104729) % 400000);
        EXPECT_EQ(writeThrough(queue, name, compressibleBytes(size, static_cast<uint32_t>(i + t * 1000)), 65536), 0);
      }
    });
  for (auto &thread : threads) thread.join();
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  for (int t = 0; t < kThreads; t++)
    for (int i = 0; i < kFiles; i++) {
      size_t size = static_cast<size_t>((i * 7919 + t * 104729) % 400000);
      std::string path = dir.file("f" + std::to_string(t) + "-" + std::to_string(i));
      EXPECT_TRUE(logical(path) == compressibleBytes(size, static_cast<uint32_t>(i + t * 1000))) << path;
    }
}

TEST_F(StreamCompressor, FlagsAndTimesTheCallerSetAreKept) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  std::vector<uint8_t> text = compressibleBytes(300000, 8);
  auto immutable = [](int fd) {
    ASSERT_EQ(platform::fchflags(fd, kFlagUserImmutable | kFlagHidden), 0);
    struct timeval times[2] = {{1000, 0}, {2000, 0}};
    ASSERT_EQ(futimes(fd, times), 0);
  };
  EXPECT_EQ(writeThrough(queue, "locked.txt", text, 100000, immutable), 0);
  EXPECT_EQ(writeThrough(queue, "locked.bin", randomBytes(10000, 9), 100000, immutable), 0);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  EXPECT_EQ(flagsOf(dir.file("locked.txt")), kFlagUserImmutable | kFlagHidden | kCompressedFlag);
  EXPECT_EQ(flagsOf(dir.file("locked.bin")), kFlagUserImmutable | kFlagHidden);
  struct stat st;
  ASSERT_EQ(stat(dir.file("locked.txt").c_str(), &st), 0);
  EXPECT_EQ(st.st_mtime, 2000);
  EXPECT_EQ(st.st_atime, 1000);
  EXPECT_TRUE(logical(dir.file("locked.txt")) == text);
}

TEST_F(StreamCompressor, FileWithItsOwnResourceForkEndsPlainWithTheFork) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  std::vector<uint8_t> text = compressibleBytes(500000, 10), fork = randomBytes(100000, 11);
  EXPECT_EQ(writeThrough(queue, "forked", text, 100000,
                         [&](int fd) {
                           ASSERT_EQ(platform::fsetxattr(fd, kResourceForkXattrName, fork.data(), fork.size(), 0, 0), 0);
                         }),
            0);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  std::string path = dir.file("forked");
  EXPECT_EQ(flagsOf(path), 0u);
  EXPECT_EQ(readFile(path), text);
  std::vector<uint8_t> back(fork.size() + 1);
  ASSERT_EQ(platform::getxattr(path.c_str(), kResourceForkXattrName, back.data(), back.size(), 0, 0),
            static_cast<ssize_t>(fork.size()));
  back.resize(fork.size());
  EXPECT_EQ(back, fork);
  EXPECT_EQ(platform::getxattr(path.c_str(), kDecmpfsXattrName, nullptr, 0, 0, 0), -1);
}

TEST_F(StreamCompressor, SkippedMachOFileIsWrittenPlainWithEveryByte) {
  PVMutableArrayRef types = PVArrayCreateMutable(0);
  PVRef name = PVStringCreateWithCString("MH_EXECUTE", kPVStringEncodingUTF8);
  PVArrayAppendValue(types, name);
  PVRelease(name);
  PVDictionaryRef opts = options({{kPLZCSkipMachOFileTypes, types}});
  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(opts);
  PVRelease(opts);
  std::vector<uint8_t> executable = compressibleBytes(200000, 12);
  const uint8_t header[16] = {0xcf, 0xfa, 0xed, 0xfe, 7, 0, 0, 1, 3, 0, 0, 0, 2, 0, 0, 0};
  memcpy(executable.data(), header, sizeof header);
  std::vector<uint8_t> library = executable;
  library[12] = 6;
  EXPECT_EQ(writeThrough(queue, "tool", executable, 7), 0);  // tiny pieces: the header arrives late
  EXPECT_EQ(writeThrough(queue, "lib.so", library), 0);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  EXPECT_EQ(flagsOf(dir.file("tool")), 0u);
  EXPECT_EQ(readFile(dir.file("tool")), executable);
  EXPECT_EQ(flagsOf(dir.file("lib.so")), kCompressedFlag);
  EXPECT_TRUE(logical(dir.file("lib.so")) == library);
}

TEST_F(StreamCompressor, InvalidLevelFailsEveryStreamCreationAndTheFinish) {
  for (PVRef level : {static_cast<PVRef>(PVNumberCreateDouble(2.5)), static_cast<PVRef>(PVNumberCreateInt64(1ll << 40))}) {
    PVDictionaryRef opts = options({{kPLZCCompressionLevel, level}});
    StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(opts);
    PVRelease(opts);
    CaptureStderr();
    EXPECT_EQ(writeThrough(queue, "a", compressibleBytes(10, 1)), 1);
    EXPECT_EQ(writeThrough(queue, "b", compressibleBytes(10, 1)), 1);
    EXPECT_EQ(FinishStreamCompressorQueue(queue), -1);
    EXPECT_EQ(errno, EINVAL);
    std::string invalid = kPrefix + "Error: invalid value for compression level \\(malformed plist\\?\\)\n";
    EXPECT_THAT(GetCapturedStderr(),
                MatchesRegex(invalid + invalid + kPrefix + "Error: returning errno 22 from FinishStreamCompressorQueue\n"));
  }
}

TEST_F(StreamCompressor, OptionsOfTheWrongKindAreIgnored) {
  PVDictionaryRef opts = options({{kPLZCCompressionLevel, PVStringCreateWithCString("9", kPVStringEncodingUTF8)},
                                  {kPLZCCompressionTypes, PVNumberCreateInt32(3)},
                                  {kPLZCIgnoreXattrErrors, PVNumberCreateInt32(1)}});
  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(opts);
  PVRelease(opts);
  EXPECT_EQ(queue->ignoreXattrErrors, 0);
  EXPECT_EQ(writeThrough(queue, "a", compressibleBytes(100000, 1)), 0);
  EXPECT_EQ(queue->compressor->compressorCount, 1);
  EXPECT_EQ(queue->compressor->compressorTypes[0], 4u);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  PVDictionaryRef badRules = options({{kPLZCCompressionSystemRulesKey, PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues)}});
  queue = CreateStreamCompressorQueueWithOptions(badRules);
  PVRelease(badRules);
  CaptureStderr();
  EXPECT_EQ(writeThrough(queue, "b", compressibleBytes(10, 1)), 1);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), -1);
  EXPECT_THAT(GetCapturedStderr(), HasSubstr("Error: _InitCompressionRules failed (malformed plist?)"));
}

TEST_F(StreamCompressor, ShortOrLongWritesFailAndAFailureStopsTheWholeQueue) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  std::string path = dir.file("short");
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  ::StreamCompressor *tooMuch = CreateStreamCompressor(fd, path.c_str(), nullptr, queue, 5);
  CaptureStderr();
  EXPECT_EQ(WriteToStreamCompressor(tooMuch, "0123456789", 10), -1);
  EXPECT_EQ(WriteToStreamCompressor(tooMuch, "012", 3), 3);  // 3 of 5: closed unfilled
  EXPECT_EQ(CloseStreamCompressor(tooMuch), 0);
  close(fd);
  // The unfilled file's write-out fails and records its error; later streams see it.
  std::string second = dir.file("second");
  fd = open(second.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  ::StreamCompressor *later = CreateStreamCompressor(fd, second.c_str(), nullptr, queue, 100);
  close(fd);
  int64_t written = 0;
  for (int i = 0; i < 1000 && written != -1; i++) {
    usleep(2000);
    written = WriteToStreamCompressor(later, "x", 1);
  }
  EXPECT_EQ(written, -1);
  int recorded = errno;
  EXPECT_NE(recorded, 0);
  EXPECT_EQ(CloseStreamCompressor(later), -1);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), -1);
  EXPECT_EQ(errno, recorded);
  std::string printed = GetCapturedStderr();
  EXPECT_THAT(printed, HasSubstr("attempted to write past end of pool"));
  EXPECT_THAT(printed, HasSubstr("returning errno " + std::to_string(recorded) + " from WriteToStreamCompressor"));
  EXPECT_EQ(WriteToStreamCompressor(nullptr, "x", 1), -1);
  EXPECT_EQ(CloseStreamCompressor(nullptr), -1);
}

TEST_F(StreamCompressor, AttributesThatCannotBeStoredFailOrFallBackToPlainData) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  TemporaryMount ext4 = TemporaryMount::ext4WithoutLargeAttributes(dir.path());
  ASSERT_TRUE(ext4.mounted());
  std::vector<uint8_t> text = compressibleBytes(2 << 20, 13);
  for (bool ignore : {true, false}) {
    PVDictionaryRef opts = options({{kPLZCIgnoreXattrErrors, PVRetain(ignore ? kPVBooleanTrue : kPVBooleanFalse)}});
    StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(opts);
    PVRelease(opts);
    std::string path = ext4.mountPoint() + (ignore ? "/ignored" : "/failed");
    int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
    ::StreamCompressor *stream = CreateStreamCompressor(fd, path.c_str(), nullptr, queue, static_cast<int64_t>(text.size()));
    close(fd);
    ASSERT_EQ(WriteToStreamCompressor(stream, text.data(), text.size()), static_cast<int64_t>(text.size()));
    EXPECT_EQ(CloseStreamCompressor(stream), 0);
    CaptureStderr();
    int finished = FinishStreamCompressorQueue(queue);
    std::string printed = GetCapturedStderr();
    if (ignore) {
      EXPECT_EQ(finished, 0);
      EXPECT_EQ(readFile(path), text);
      EXPECT_THAT(printed, HasSubstr("could not be written; writing decompressed data: No space left on device"));
    } else {
      EXPECT_EQ(finished, -1);
      EXPECT_EQ(errno, ENOSPC);
      EXPECT_TRUE(readFile(path).empty());
      EXPECT_THAT(printed, HasSubstr("Error: applyTocDictToFd failed for " + path + ": No space left on device"));
    }
    EXPECT_EQ(flagsOf(path), 0u);
    EXPECT_TRUE(linuxAttributeNames(path).empty());
  }
}

TEST_F(StreamCompressor, ThrottledItemsLeaveTheirThreadsAsTheyFoundThem) {
  int ioBefore = platform::threadIoPriority(), niceBefore = platform::threadNice();
  platform::ThreadPriority saved = platform::throttleThread();
  EXPECT_EQ(platform::threadIoPriority() >> 13, 3);  // idle class
  platform::unthrottleThread(saved);
  EXPECT_EQ(platform::threadIoPriority(), ioBefore);
  EXPECT_EQ(platform::threadNice(), niceBefore);

  PVDictionaryRef opts = options({{kPLZCThrottledIO, PVRetain(kPVBooleanTrue)}});
  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(opts);
  PVRelease(opts);
  std::vector<uint8_t> text = compressibleBytes(1 << 20, 14);
  for (int i = 0; i < 8; i++) EXPECT_EQ(writeThrough(queue, "t" + std::to_string(i), text), 0);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  for (int i = 0; i < 8; i++) EXPECT_TRUE(logical(dir.file("t" + std::to_string(i))) == text);
  // Work run after the throttled items on the same pool sees normal priorities.
  struct Seen {
    int io = 0, nice = 0;
  } seen[64];
  WorkGroup *group = workGroupCreate();
  for (Seen &one : seen)
    workGroupAsync(group, workQueueGetGlobal(kWorkQueuePriorityHigh), &one, [](void *context) {
      auto *s = static_cast<Seen *>(context);
      s->io = platform::threadIoPriority();
      s->nice = platform::threadNice();
      usleep(1000);  // spread the items over the pool's threads
    });
  workGroupWait(group);
  workGroupRelease(group);
  for (const Seen &one : seen) {
    EXPECT_NE(one.io >> 13, 3);
    EXPECT_EQ(one.nice, niceBefore);
  }
}

TEST_F(StreamCompressor, InPlaceFailuresLeaveTheFileAsItWas) {
  // Existing files through a queue in in-place mode, one failure at a time.
  std::vector<uint8_t> text = compressibleBytes(400000, 15);
  struct Case {
    const char *name;
    sys::Call call;
    uint64_t nth;
    const char *message;
  } cases[] = {
      {"truncation", sys::Call::Truncate, 1, "Error: ftruncate failed for "},
      {"flush", sys::Call::Fsync, 1, "Error: fsync failed for "},
      {"lock", sys::Call::Fstat, 1, "Error: PLZCLockFile failed for "},
      {"status", sys::Call::Fstat, 2, "Error: stat failed for "},
  };
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    std::string path = writeFile(dir.file(c.name), text);
    StreamCompressorQueue *queue = CreateStreamCompressorQueue();
    StreamCompressorQueueSetInPlace(queue, 1);
    int fd = open(path.c_str(), O_RDONLY);
    ::StreamCompressor *stream = CreateStreamCompressor(fd, path.c_str(), nullptr, queue, static_cast<int64_t>(text.size()));
    ASSERT_NE(stream, nullptr);
    ASSERT_EQ(WriteToStreamCompressor(stream, text.data(), text.size()), static_cast<int64_t>(text.size()));
    // Armed once the data is in: the next calls of that kind are the write-out's.
    sys::armFault(c.call, c.nth, EIO);
    CloseStreamCompressor(stream);
    CaptureStderr();
    EXPECT_EQ(FinishStreamCompressorQueue(queue), -1);
    EXPECT_EQ(errno, EIO);
    EXPECT_THAT(GetCapturedStderr(), HasSubstr(std::string(c.message) + path + ": Input/output error"));
    sys::clearFaults();
    close(fd);
    EXPECT_EQ(readFile(path), text);  // the data fork is intact
    EXPECT_EQ(flagsOf(path), 0u);     // and the file is not marked compressed
  }
}

TEST_F(StreamCompressor, InPlaceFileWithItsOwnResourceForkIsNeverTakenApart) {
  // Its end state is the file as it was: the fork is never taken off it, nor the data fork
  // truncated, at any moment of the write-out.
  std::vector<uint8_t> text = compressibleBytes(400000, 17), fork = randomBytes(100000, 18);
  std::string path = writeFile(dir.file("forked"), text);
  ASSERT_EQ(platform::setxattr(path.c_str(), kResourceForkXattrName, fork.data(), fork.size(), 0, 0), 0);
  std::vector<std::string> namesBefore = linuxAttributeNames(path);
  StreamCompressorQueue *queue = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, nullptr);
  uint64_t removals = sys::callCount(sys::Call::Fremovexattr), truncations = sys::callCount(sys::Call::Truncate);
  EXPECT_EQ(CompressFile(queue, path.c_str(), nullptr), 1);
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  EXPECT_EQ(sys::callCount(sys::Call::Fremovexattr), removals);
  EXPECT_EQ(sys::callCount(sys::Call::Truncate), truncations);
  EXPECT_EQ(readFile(path), text);
  EXPECT_EQ(flagsOf(path), 0u);
  EXPECT_EQ(linuxAttributeNames(path), namesBefore);
  std::vector<uint8_t> back(fork.size());
  EXPECT_EQ(platform::getxattr(path.c_str(), kResourceForkXattrName, back.data(), back.size(), 0, 0),
            static_cast<ssize_t>(fork.size()));
  EXPECT_EQ(back, fork);
}

TEST_F(StreamCompressor, InPlaceAttributesThatCannotBeStoredLeaveTheFileAlone) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  TemporaryMount ext4 = TemporaryMount::ext4WithoutLargeAttributes(dir.path());
  ASSERT_TRUE(ext4.mounted());
  std::vector<uint8_t> text = compressibleBytes(2 << 20, 16);
  for (bool ignore : {true, false}) {
    PVDictionaryRef opts = options({{kPLZCIgnoreXattrErrors, PVRetain(ignore ? kPVBooleanTrue : kPVBooleanFalse)}});
    StreamCompressorQueue *queue = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, opts);
    PVRelease(opts);
    std::string path = writeFile(ext4.mountPoint() + (ignore ? "/ignored" : "/failed"), text);
    CaptureStderr();
    EXPECT_EQ(CompressFile(queue, path.c_str(), nullptr), 1);
    int finished = FinishStreamCompressorQueue(queue);
    std::string printed = GetCapturedStderr();
    EXPECT_EQ(finished, ignore ? 0 : -1);
    EXPECT_THAT(printed, HasSubstr(ignore ? "Compressed data for " + path + " could not be written: No space left on device"
                                          : "Error: applyTocDictToFd failed for " + path));
    EXPECT_EQ(readFile(path), text);
    EXPECT_EQ(flagsOf(path), 0u);
    EXPECT_TRUE(linuxAttributeNames(path).empty());
  }
}

// Without memory for a file's data pool no stream is made, and the message says for which file.
TEST_F(StreamCompressor, StreamWithoutMemoryForItsDataNamesTheFile) {
  // A queue of its own, with nothing else running: the fault is meant for this pool alone.
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  std::string path = dir.file("second.txt");
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  ASSERT_GE(fd, 0);
  ASSERT_TRUE(_SQLazyInit(queue));  // its own allocations are not the ones failed here
  // The stream's record, its copies of path and prefix, then the pool's block.
  sys::armFault(sys::Call::Malloc, 4, ENOMEM);
  CaptureStderr();
  ::StreamCompressor *stream = CreateStreamCompressor(fd, path.c_str(), dir.path().c_str(), queue, 50000);
  int error = errno;
  std::string printed = GetCapturedStderr();
  sys::clearFaults();
  close(fd);
  if (stream) CloseStreamCompressor(stream);  // the fault went elsewhere: still end cleanly
  EXPECT_EQ(stream, nullptr);
  EXPECT_EQ(error, ENOMEM);
  EXPECT_THAT(printed, HasSubstr("Common/StreamCompressor:"));
  EXPECT_THAT(printed, HasSubstr("Error: no memory to carry the data of " + path + ": Cannot allocate memory\n"));
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
}

// In place, a file written to after its data went into the stream keeps what it holds now: the
// compressed form of its old data is not stored over it.
TEST_F(StreamCompressor, InPlaceFileChangedMeanwhileIsLeftAsItIs) {
  std::vector<uint8_t> text = compressibleBytes(300000, 16);
  std::string path = writeFile(dir.file("changing.txt"), text);
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  StreamCompressorQueueSetInPlace(queue, 1);
  int fd = open(path.c_str(), O_RDONLY);
  ::StreamCompressor *stream = CreateStreamCompressor(fd, path.c_str(), nullptr, queue, static_cast<int64_t>(text.size()));
  ASSERT_NE(stream, nullptr);
  // Someone appends while the stream still waits for its data.
  std::vector<uint8_t> now = text;
  now.insert(now.end(), {'m', 'o', 'r', 'e'});
  writeFile(path, now);
  ASSERT_EQ(WriteToStreamCompressor(stream, text.data(), text.size()), static_cast<int64_t>(text.size()));
  CloseStreamCompressor(stream);
  CaptureStderr();
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  EXPECT_THAT(GetCapturedStderr(), HasSubstr(path + " changed while it was being compressed; left as it is"));
  close(fd);
  EXPECT_EQ(flagsOf(path), 0u);
  EXPECT_EQ(readFile(path), now);
}

}  // namespace
