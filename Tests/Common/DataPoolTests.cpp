#include "Common/DataPool.h"

#include <fcntl.h>
#include <time.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <functional>
#include <random>
#include <thread>
#include <vector>

#include "Common/ThrottlingAllocator.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using namespace std::chrono_literals;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

constexpr uint64_t kMiB = 1048576;
constexpr uint64_t kRing = kDataPoolMaxCapacity;

// The bytes of the file at every position: a random block whose length (a prime) divides
// neither the ring nor any step, so bytes that come out misplaced, doubled or from an earlier
// lap of the ring never match.
class Pattern {
 public:
  static constexpr uint64_t kLength = 1048573;
  static const Pattern &get() {
    static const Pattern pattern;
    return pattern;
  }
  void fill(uint8_t *out, uint64_t offset, uint64_t count) const {
    while (count > 0) {
      uint64_t index = offset % kLength, n = std::min(count, kLength - index);
      memcpy(out, bytes_.data() + index, n);
      out += n, offset += n, count -= n;
    }
  }
  // The position of the first byte of in[0..count) that differs from the file at offset, or -1.
  int64_t firstMismatch(const uint8_t *in, uint64_t offset, uint64_t count) const {
    uint64_t done = 0;
    while (done < count) {
      uint64_t index = (offset + done) % kLength, n = std::min(count - done, kLength - index);
      if (memcmp(in + done, bytes_.data() + index, n) != 0) {
        for (uint64_t i = 0; i < n; i++)
          if (in[done + i] != bytes_[index + i]) return static_cast<int64_t>(offset + done + i);
      }
      done += n;
    }
    return -1;
  }

 private:
  Pattern() : bytes_(randomBytes(kLength, 20240611)) {}
  std::vector<uint8_t> bytes_;
};

std::vector<uint8_t> fileBytes(uint64_t offset, uint64_t count) {
  std::vector<uint8_t> bytes(count);
  Pattern::get().fill(bytes.data(), offset, count);
  return bytes;
}

// Frees the pool at the end of a test unless the test released it itself.
struct PoolRef {
  explicit PoolRef(int64_t size) : pool(newDataPool(size)) {}
  ~PoolRef() {
    if (pool) releaseDataPool(pool);
  }
  DataPool *release() { return std::exchange(pool, nullptr); }
  DataPool *pool;
};

double threadCpuSeconds() {
  struct timespec now;
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// Runs body on a thread and returns a flag that turns true when it is done.
class Background {
 public:
  explicit Background(std::function<void()> body)
      : thread_([this, body = std::move(body)] {
          body();
          done_ = true;
        }) {}
  ~Background() {
    if (thread_.joinable()) thread_.join();
  }
  bool done() const { return done_; }
  // True once the body has finished, false if it is still running after limit.
  bool finishesWithin(std::chrono::milliseconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (!done_ && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(2ms);
    return done_;
  }
  void join() { thread_.join(); }

 private:
  std::atomic<bool> done_{false};
  std::thread thread_;
};

// Waits for every transfer thread; if they are not all done within limit, aborts the pool so
// that they come back (failing) instead of hanging the suite, and fails the test.
void joinOrAbort(DataPool *pool, std::vector<Background *> sides, std::chrono::seconds limit) {
  auto deadline = std::chrono::steady_clock::now() + limit;
  for (Background *side : sides) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (!side->finishesWithin(std::max(left, std::chrono::milliseconds(0)))) {
      ADD_FAILURE() << "transfer still running after " << limit.count() << " s: pool aborted to end it";
      abortDataPool(pool);
      break;
    }
  }
  for (Background *side : sides) side->join();
}

// ---- Sizes, ends and failures --------------------------------------------------------------

TEST(DataPool, RingIsTheSizeUpTo64MiBAndIsChargedWithTheHeaderUntilTheLastRelease) {
  uint64_t before = throttlingMemoryCharged();
  DataPool *empty = newDataPool(0);
  ASSERT_NE(empty, nullptr);
  uint64_t header = throttlingMemoryCharged() - before;
  EXPECT_GT(header, 0u);
  EXPECT_LT(header, 4096u);
  EXPECT_EQ(releaseDataPool(empty), 1);
  EXPECT_EQ(throttlingMemoryCharged(), before);

  for (uint64_t size : {uint64_t{10}, kRing - 1, kRing, kRing + 1, 100 * kMiB}) {
    DataPool *pool = newDataPool(static_cast<int64_t>(size));
    ASSERT_NE(pool, nullptr) << size;
    EXPECT_EQ(dataPoolSize(pool), static_cast<int64_t>(size));
    EXPECT_EQ(throttlingMemoryCharged() - before, header + std::min(size, kRing)) << size;
    EXPECT_EQ(releaseDataPool(pool), 1);
    EXPECT_EQ(throttlingMemoryCharged(), before) << size;
  }
}

TEST(DataPool, CreationFailsForANegativeSizeAndWhenMemoryRunsOut) {
  uint64_t before = throttlingMemoryCharged();
  errno = 0;
  EXPECT_EQ(newDataPool(-1), nullptr);
  EXPECT_EQ(errno, EINVAL);

  sys::armFault(sys::Call::Malloc, 1, ENOMEM);
  CaptureStderr();
  DataPool *pool = newDataPool(1000);
  int error = errno;
  std::string printed = GetCapturedStderr();
  sys::clearFaults();
  EXPECT_EQ(pool, nullptr);
  EXPECT_EQ(error, ENOMEM);
  EXPECT_THAT(printed, MatchesRegex("Common/DataPool:[0-9]+: waitThenAllocate\\([0-9]+\\): .+\n"));
  EXPECT_EQ(throttlingMemoryCharged(), before);
}

TEST(DataPool, EmptyPoolTakesNothingAndReadsAtItsEnd) {
  PoolRef ref(0);
  ASSERT_NE(ref.pool, nullptr);
  uint8_t byte = 7;
  EXPECT_EQ(addDataToPool(ref.pool, &byte, 0), 0);
  CaptureStderr();
  errno = 12345;
  EXPECT_EQ(addDataToPool(ref.pool, &byte, 1), -1);
  EXPECT_EQ(errno, 12345);  // the refusal sets no errno
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Common/DataPool:[0-9]+: Error: attempted to write past end of pool\n"));
  EXPECT_EQ(getDataFromPool(ref.pool, &byte, 1), 0);
  CaptureStderr();
  finishDataPool(ref.pool);
  EXPECT_EQ(GetCapturedStderr(), "");
  EXPECT_EQ(getDataFromPool(ref.pool, &byte, 1), 0);  // not aborted by the finish
}

TEST(DataPool, AddOfWhatRemainsSucceedsAndOneByteMoreChangesNothing) {
  PoolRef ref(100);
  std::vector<uint8_t> bytes = fileBytes(0, 100);
  ASSERT_EQ(addDataToPool(ref.pool, bytes.data(), 60), 60);
  CaptureStderr();
  EXPECT_EQ(addDataToPool(ref.pool, bytes.data() + 60, 41), -1);
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex("Common/DataPool:[0-9]+: Error: attempted to write past end of pool\n"));
  EXPECT_EQ(addDataToPool(ref.pool, bytes.data() + 60, 40), 40);
  std::vector<uint8_t> out(100);
  EXPECT_EQ(getDataFromPool(ref.pool, out.data(), 100), 100);
  EXPECT_EQ(out, bytes);
}

TEST(DataPool, FinishingEarlyReportsAndFailsTheWaitingReader) {
  PoolRef ref(100);
  std::vector<uint8_t> bytes = fileBytes(0, 100);
  ASSERT_EQ(addDataToPool(ref.pool, bytes.data(), 50), 50);
  int64_t got = 0;
  int error = 0;
  std::vector<uint8_t> out(100);
  Background reader([&] {
    got = getDataFromPool(ref.pool, out.data(), 100);
    error = errno;
  });
  EXPECT_FALSE(reader.finishesWithin(100ms)) << "the reader must wait for the missing 50 bytes";
  CaptureStderr();
  finishDataPool(ref.pool);
  std::string printed = GetCapturedStderr();
  ASSERT_TRUE(reader.finishesWithin(10s));
  EXPECT_EQ(got, -1);
  EXPECT_EQ(error, EINVAL);
  EXPECT_THAT(printed, MatchesRegex("Common/DataPool:[0-9]+: Error: finished pool without filling it\n"));
  CaptureStderr();
  finishDataPool(ref.pool);  // already aborted: silent
  EXPECT_EQ(GetCapturedStderr(), "");
}

TEST(DataPool, AbortFailsTheReaderDespiteDataAndWakesTheBlockedWriterWithENOSPC) {
  PoolRef ref(static_cast<int64_t>(kRing + 100));
  std::vector<uint8_t> bytes = fileBytes(0, kRing + 100), out(10);
  ASSERT_EQ(addDataToPool(ref.pool, bytes.data(), kRing), static_cast<int64_t>(kRing));
  int64_t added = 0;
  int error = 0;
  Background writer([&] {
    added = addDataToPool(ref.pool, bytes.data() + kRing, 100);
    error = errno;
  });
  EXPECT_FALSE(writer.finishesWithin(100ms)) << "the writer must wait while the ring is full";
  abortDataPool(ref.pool);
  ASSERT_TRUE(writer.finishesWithin(10s));
  EXPECT_EQ(added, -1);
  EXPECT_EQ(error, ENOSPC);
  errno = 0;
  EXPECT_EQ(getDataFromPool(ref.pool, out.data(), 10), -1);  // the ring is full, yet it fails
  EXPECT_EQ(errno, EINVAL);
  // The 100 bytes still count as not added: the same add fails for the abort, not for passing
  // the end; and finishing an aborted pool is silent.
  CaptureStderr();
  errno = 0;
  EXPECT_EQ(addDataToPool(ref.pool, bytes.data() + kRing, 100), -1);
  EXPECT_EQ(errno, ENOSPC);
  finishDataPool(ref.pool);
  EXPECT_EQ(GetCapturedStderr(), "");
}

// ---- Blocking and order ---------------------------------------------------------------------

TEST(DataPool, WriterBlocksOnceTheRingHoldsItsCapacityAndGoesOnAsTheReaderTakesData) {
  constexpr uint64_t kPiece = kMiB;
  PoolRef ref(static_cast<int64_t>(100 * kMiB));
  std::atomic<uint64_t> piecesAdded{0};
  Background writer([&] {
    std::vector<uint8_t> piece(kPiece);
    for (uint64_t i = 0; i < 100; i++) {
      Pattern::get().fill(piece.data(), i * kPiece, kPiece);
      if (addDataToPool(ref.pool, piece.data(), kPiece) != static_cast<int64_t>(kPiece)) return;
      piecesAdded++;
    }
    finishDataPool(ref.pool);
  });
  auto deadline = std::chrono::steady_clock::now() + 30s;
  while (piecesAdded < 64 && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(2ms);
  std::this_thread::sleep_for(200ms);
  EXPECT_EQ(piecesAdded.load(), 64u) << "the 65th MiB must wait for room in the ring";

  std::vector<uint8_t> out(100 * kMiB);
  ASSERT_EQ(getDataFromPool(ref.pool, out.data(), kPiece), static_cast<int64_t>(kPiece));
  while (piecesAdded < 65 && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(2ms);
  EXPECT_GE(piecesAdded.load(), 65u) << "one MiB read makes room for one more";
  // The rest crosses the end of the ring in odd-sized reads.
  uint64_t done = kPiece;
  for (uint64_t step = 3 * kMiB + 12345; done < 100 * kMiB;) {
    int64_t got = getDataFromPool(ref.pool, out.data() + done, step);
    ASSERT_GT(got, 0);
    done += static_cast<uint64_t>(got);
  }
  writer.join();
  EXPECT_EQ(piecesAdded.load(), 100u);
  EXPECT_EQ(Pattern::get().firstMismatch(out.data(), 0, out.size()), -1);
  EXPECT_EQ(getDataFromPool(ref.pool, out.data(), 1), 0);
}

// One add or one get larger than the whole ring: the side that fills (or empties) the ring in
// one step and then waits itself must not swallow the notice the other side is waiting for.
TEST(DataPool, SingleTransferLargerThanTheRingMeetsAWaitingPeer) {
  constexpr uint64_t kSize = 100 * kMiB;
  std::vector<uint8_t> bytes = fileBytes(0, kSize);
  for (bool writerFirst : {false, true}) {
    SCOPED_TRACE(writerFirst ? "writer waits on a full ring first" : "reader waits on an empty ring first");
    PoolRef ref(static_cast<int64_t>(kSize));
    std::vector<uint8_t> out(kSize);
    int64_t added = 0, got = 0;
    auto write = [&] {
      if (writerFirst) added = addDataToPool(ref.pool, bytes.data(), kRing);
      added += addDataToPool(ref.pool, bytes.data() + (writerFirst ? kRing : 0), kSize - (writerFirst ? kRing : 0));
    };
    auto read = [&] { got = getDataFromPool(ref.pool, out.data(), kSize); };
    Background first(writerFirst ? std::function<void()>(write) : std::function<void()>(read));
    std::this_thread::sleep_for(100ms);  // let it reach its wait
    Background second(writerFirst ? std::function<void()>(read) : std::function<void()>(write));
    joinOrAbort(ref.pool, {&first, &second}, 60s);
    EXPECT_EQ(added, static_cast<int64_t>(kSize));
    EXPECT_EQ(got, static_cast<int64_t>(kSize));
    EXPECT_EQ(out, bytes);
  }
}

// Bytes read from a file go straight into the ring, in order and across its wrap, while a
// reader takes them; the add ends where the file does, and a failing read keeps what came
// before it.
TEST(DataPool, FileDataArrivesWholeAndStopsAtTheFilesEndOrAFailedRead) {
  ScratchDir dir;
  constexpr uint64_t kSize = kRing + 5 * kMiB + 12345;
  std::vector<uint8_t> bytes = fileBytes(0, kSize);
  int fd = open(writeFile(dir.file("large"), bytes).c_str(), O_RDONLY);
  ASSERT_GE(fd, 0);
  {
    PoolRef ref(static_cast<int64_t>(kSize));
    std::vector<uint8_t> out(kSize);
    int64_t added = 0, got = 0;
    Background writer([&] { added = addFileDataToPool(ref.pool, fd, kSize); });
    Background reader([&] { got = getDataFromPool(ref.pool, out.data(), kSize); });
    joinOrAbort(ref.pool, {&writer, &reader}, 60s);
    EXPECT_EQ(added, static_cast<int64_t>(kSize));
    EXPECT_EQ(got, static_cast<int64_t>(kSize));
    EXPECT_EQ(Pattern::get().firstMismatch(out.data(), 0, kSize), -1);
  }
  close(fd);

  // A file shorter than the pool: its bytes, and then the pool still wants the rest.
  fd = open(writeFile(dir.file("short"), fileBytes(0, 3000)).c_str(), O_RDONLY);
  ASSERT_GE(fd, 0);
  {
    PoolRef ref(5000);
    EXPECT_EQ(addFileDataToPool(ref.pool, fd, 5000), 3000);
    std::vector<uint8_t> out(3000);
    EXPECT_EQ(getDataFromPool(ref.pool, out.data(), 3000), 3000);
    EXPECT_EQ(out, fileBytes(0, 3000));
    EXPECT_EQ(addDataToPool(ref.pool, bytes.data(), 2001), -1) << "only 2000 bytes are left to add";
  }
  close(fd);

  // The second read fails: the first piece stays in the pool for the reader.
  fd = open(dir.file("large").c_str(), O_RDONLY);
  ASSERT_GE(fd, 0);
  {
    PoolRef ref(static_cast<int64_t>(3 * kMiB));
    sys::armFault(sys::Call::Read, 2, EIO);
    errno = 0;
    EXPECT_EQ(addFileDataToPool(ref.pool, fd, 3 * kMiB), -1);
    EXPECT_EQ(errno, EIO);
    sys::clearFaults();
    std::vector<uint8_t> out(kMiB);
    EXPECT_EQ(getDataFromPool(ref.pool, out.data(), kMiB), static_cast<int64_t>(kMiB));
    EXPECT_EQ(out, fileBytes(0, kMiB));
  }
  close(fd);
}

// ---- Concurrent transfers -------------------------------------------------------------------

// Piece sizes: mostly small, some up to 1 MiB, a few larger than the ring.
uint64_t randomPiece(std::mt19937_64 &random, uint64_t smallest, uint64_t small) {
  uint64_t kind = random() % 1000;
  if (kind < 750) return smallest + random() % (small - smallest + 1);
  if (kind < 995) return 1 + random() % kMiB;
  return kRing / 2 + random() % kRing;
}

struct TransferResult {
  uint64_t bytes = 0;     // added, or read and checked
  int64_t failure = 0;    // 0, or the -1 of the failing call
  int error = 0;          // its errno
  int64_t mismatch = -1;  // first wrong byte read, or -1
  int64_t lastResult = 0;  // what the last call returned
};

void writeFile(DataPool *pool, uint64_t size, uint64_t seed, uint64_t smallest, uint64_t small, TransferResult *result) {
  std::mt19937_64 random(seed);
  std::vector<uint8_t> piece;
  while (result->bytes < size) {
    uint64_t n = std::min(randomPiece(random, smallest, small), size - result->bytes);
    piece.resize(n);
    Pattern::get().fill(piece.data(), result->bytes, n);
    int64_t added = addDataToPool(pool, piece.data(), n);
    if (added != static_cast<int64_t>(n)) {
      result->failure = added;
      result->error = errno;
      return;
    }
    result->bytes += n;
  }
  finishDataPool(pool);
}

// Reads until the end (a 0) or a failure, checking every byte; through the pool handle when
// fh is given.
void readFile(DataPool *pool, FileHandle *fh, uint64_t seed, uint64_t smallest, uint64_t small, TransferResult *result) {
  std::mt19937_64 random(seed);
  std::vector<uint8_t> buffer;
  for (;;) {
    uint64_t n = randomPiece(random, smallest, small);
    buffer.resize(n);
    int64_t got = fh ? fh->pread(fh, buffer.data(), static_cast<int64_t>(n), static_cast<int64_t>(result->bytes))
                     : getDataFromPool(pool, buffer.data(), n);
    result->lastResult = got;
    if (got < 0) {
      result->failure = got;
      result->error = errno;
      return;
    }
    if (got == 0) return;
    if (result->mismatch < 0)
      result->mismatch = Pattern::get().firstMismatch(buffer.data(), result->bytes, static_cast<uint64_t>(got));
    result->bytes += static_cast<uint64_t>(got);
  }
}

struct StressCase {
  const char *name;
  uint64_t size;
  uint64_t smallest, small;  // range of the small pieces
  bool throughHandle;
};

class DataPoolStress : public ::testing::TestWithParam<StressCase> {};

TEST_P(DataPoolStress, EveryByteArrivesOnceAndInOrder) {
  const StressCase &c = GetParam();
  uint64_t before = throttlingMemoryCharged();
  DataPool *pool = newDataPool(static_cast<int64_t>(c.size));
  ASSERT_NE(pool, nullptr);
  FileHandle *fh = c.throughHandle ? openDataPoolFile(pool, "data pool for stress") : nullptr;
  if (c.throughHandle) {
    ASSERT_NE(fh, nullptr);
  }
  TransferResult written, read;
  CaptureStderr();
  {
    Background writer([&] { writeFile(pool, c.size, 1, c.smallest, c.small, &written); });
    Background reader([&] { readFile(pool, fh, 2, c.smallest, c.small, &read); });
    joinOrAbort(pool, {&writer, &reader}, 300s);
  }
  EXPECT_EQ(GetCapturedStderr(), "");
  EXPECT_EQ(written.failure, 0) << strerror(written.error);
  EXPECT_EQ(written.bytes, c.size);
  EXPECT_EQ(read.failure, 0) << strerror(read.error);
  EXPECT_EQ(read.bytes, c.size);
  EXPECT_EQ(read.mismatch, -1);
  EXPECT_EQ(read.lastResult, 0);
  if (fh) {
    EXPECT_EQ(fh->close(fh), 0);
  }
  EXPECT_EQ(releaseDataPool(pool), 1);
  EXPECT_EQ(throttlingMemoryCharged(), before);
}

INSTANTIATE_TEST_SUITE_P(
    Transfers, DataPoolStress,
    ::testing::Values(StressCase{"Mixed200MiB", 200 * kMiB, 1, 65536, false},
                      StressCase{"Tiny70MiBThroughTheHandle", 70 * kMiB, 1, 4096, true},
                      StressCase{"SmallFileWithinTheRing", 5 * kMiB + 3, 1, 65536, false}),
    [](const ::testing::TestParamInfo<StressCase> &info) { return std::string(info.param.name); });

// An abort from a third thread at any moment ends both sides: each either completed or fails
// with its own errno, and every byte read before it is right.
TEST(DataPool, AbortAtAnyMomentEndsBothSidesCleanly) {
  std::mt19937_64 random(77);
  for (int round = 0; round < 24; round++) {
    SCOPED_TRACE("round " + std::to_string(round));
    uint64_t size = round % 3 == 0 ? 3 * kMiB : kRing + 1 + random() % (16 * kMiB);
    DataPool *pool = newDataPool(static_cast<int64_t>(size));
    ASSERT_NE(pool, nullptr);
    TransferResult written, read;
    auto delay = std::chrono::microseconds(random() % 20000);
    CaptureStderr();
    {
      Background writer([&] { writeFile(pool, size, 10 + round, 1, 65536, &written); });
      Background reader([&] { readFile(pool, nullptr, 100 + round, 1, 65536, &read); });
      Background aborter([&] {
        std::this_thread::sleep_for(delay);
        abortDataPool(pool);
      });
      aborter.join();
      joinOrAbort(pool, {&writer, &reader}, 60s);
    }
    EXPECT_EQ(GetCapturedStderr(), "") << "an abort is silent, and a writer that finished had added everything";
    if (written.failure) {
      EXPECT_EQ(written.failure, -1);
      EXPECT_EQ(written.error, ENOSPC);
    } else {
      EXPECT_EQ(written.bytes, size);
    }
    if (read.failure) {
      EXPECT_EQ(read.failure, -1);
      EXPECT_EQ(read.error, EINVAL);
      EXPECT_LE(read.bytes, written.bytes);
    } else {
      // Read to the end before the abort: everything was written and read.
      EXPECT_EQ(written.failure, 0);
      EXPECT_EQ(read.bytes, size);
    }
    EXPECT_EQ(read.mismatch, -1);
    EXPECT_EQ(releaseDataPool(pool), 1);
  }
}

// ---- Waiting without burning a processor ---------------------------------------------------

// Runs wait on its own thread, lets it wait about a second, then runs wake on this one.
// Returns the waiting thread's processor time and the wall time of its wait, in seconds.
void measureWait(const std::function<void()> &wait, const std::function<void()> &wake, double *cpu, double *wall) {
  std::atomic<bool> started{false};
  Background waiter([&] {
    auto wallStart = std::chrono::steady_clock::now();
    double cpuStart = threadCpuSeconds();
    started = true;
    wait();
    *cpu = threadCpuSeconds() - cpuStart;
    *wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - wallStart).count();
  });
  while (!started) std::this_thread::sleep_for(1ms);
  std::this_thread::sleep_for(1000ms);
  EXPECT_FALSE(waiter.done()) << "it did not wait";
  wake();
  ASSERT_TRUE(waiter.finishesWithin(10s));
}

TEST(DataPool, WaitingSideSleepsInsteadOfSpinning) {
  struct Case {
    const char *name;
    uint64_t size;
    uint64_t prefill;  // added before the wait
    bool readerWaits;  // else the writer, on a full ring
    bool wakeByAbort;
  } cases[] = {{"reader on an empty ring, woken by data", kMiB, 0, true, false},
               {"reader on an empty ring, woken by an abort", kMiB, 0, true, true},
               {"writer on a full ring, woken by a read", kRing + kMiB, kRing, false, false},
               {"writer on a full ring, woken by an abort", kRing + kMiB, kRing, false, true}};
  std::vector<uint8_t> bytes = fileBytes(0, kRing + kMiB);
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    PoolRef ref(static_cast<int64_t>(c.size));
    ASSERT_EQ(addDataToPool(ref.pool, bytes.data(), c.prefill), static_cast<int64_t>(c.prefill));
    std::vector<uint8_t> out(kMiB);
    int64_t result = 0;
    int error = 0;
    auto wait = [&] {
      result = c.readerWaits ? getDataFromPool(ref.pool, out.data(), 4096)
                             : addDataToPool(ref.pool, bytes.data() + c.prefill, kMiB);
      error = errno;
    };
    auto wake = [&] {
      if (c.wakeByAbort)
        abortDataPool(ref.pool);
      else if (c.readerWaits)
        addDataToPool(ref.pool, bytes.data(), 4096);
      else
        getDataFromPool(ref.pool, out.data(), kMiB);
    };
    double cpu = 0, wall = 0;
    measureWait(wait, wake, &cpu, &wall);
    EXPECT_GE(wall, 0.95);
    EXPECT_LT(cpu, wall * 0.05) << "the waiting thread used " << cpu << " s of processor in " << wall << " s";
    if (c.wakeByAbort) {
      EXPECT_EQ(result, -1);
      EXPECT_EQ(error, c.readerWaits ? EINVAL : ENOSPC);
    } else {
      EXPECT_EQ(result, c.readerWaits ? 4096 : static_cast<int64_t>(kMiB));
    }
  }
}

// ---- References -------------------------------------------------------------------------------

TEST(DataPool, WhicheverHolderReleasesLastFreesThePool) {
  uint64_t before = throttlingMemoryCharged();
  DataPool *pool = newDataPool(1000);
  ASSERT_NE(pool, nullptr);
  FileHandle *fh = openDataPoolFile(pool, "data pool for x");
  ASSERT_NE(fh, nullptr);
  retainDataPool(pool);
  EXPECT_EQ(releaseDataPool(pool), 0);
  EXPECT_EQ(releaseDataPool(pool), 0);  // the creator's reference
  std::vector<uint8_t> bytes = fileBytes(0, 1000), out(1000);
  // Still alive through the handle.
  EXPECT_EQ(addDataToPool(pool, bytes.data(), 1000), 1000);
  EXPECT_EQ(fh->pread(fh, out.data(), 1000, 0), 1000);
  EXPECT_EQ(out, bytes);
  EXPECT_GT(throttlingMemoryCharged(), before);
  EXPECT_EQ(fh->close(fh), 0);
  EXPECT_EQ(throttlingMemoryCharged(), before);
  EXPECT_EQ(releaseDataPool(nullptr), 0);
}

TEST(DataPool, ConcurrentReleasesFreeThePoolExactlyOnce) {
  uint64_t before = throttlingMemoryCharged();
  for (int round = 0; round < 50; round++) {
    constexpr int kHolders = 8;
    DataPool *pool = newDataPool(4096);
    ASSERT_NE(pool, nullptr);
    std::atomic<int> freed{0};
    std::atomic<bool> go{false};
    std::vector<std::thread> holders;
    for (int i = 0; i < kHolders; i++) {
      if (i > 0) retainDataPool(pool);
      holders.emplace_back([&] {
        while (!go) std::this_thread::yield();
        freed += releaseDataPool(pool);
      });
    }
    go = true;
    for (auto &holder : holders) holder.join();
    EXPECT_EQ(freed.load(), 1);
  }
  EXPECT_EQ(throttlingMemoryCharged(), before);
}

// ---- The pool file handle ---------------------------------------------------------------------

TEST(DataPoolFile, FillsOnlyItsFiveOperations) {
  PoolRef ref(12345);
  FileHandle *fh = openDataPoolFile(ref.pool, "data pool for /a/b");
  ASSERT_NE(fh, nullptr);
  EXPECT_STREQ(fh->name, "data pool for /a/b");
  EXPECT_EQ(fh->path, fh->name);  // one copy serves as both
  EXPECT_EQ(fh->canUnread, 0);
  EXPECT_EQ(fh->size(fh), 12345);
  EXPECT_EQ(fh->blockSize(fh), 4096);
  char value[16];
  for (void *buffer : {static_cast<void *>(nullptr), static_cast<void *>(value)}) {
    errno = 0;
    EXPECT_EQ(fh->getxattr(fh, "com.tavix.decmpfs", buffer, buffer ? sizeof value : 0, 0, 0), -1);
    EXPECT_EQ(errno, ENOATTR);
  }
  const void *empty[] = {reinterpret_cast<const void *>(fh->reopen),       reinterpret_cast<const void *>(fh->mode),
                         reinterpret_cast<const void *>(fh->times),        reinterpret_cast<const void *>(fh->utimes),
                         reinterpret_cast<const void *>(fh->pwrite),       reinterpret_cast<const void *>(fh->unreadAlloc),
                         reinterpret_cast<const void *>(fh->unreadSetPos), reinterpret_cast<const void *>(fh->unread),
                         reinterpret_cast<const void *>(fh->unreadDone),   reinterpret_cast<const void *>(fh->chflags),
                         reinterpret_cast<const void *>(fh->truncate),     reinterpret_cast<const void *>(fh->setxattr),
                         reinterpret_cast<const void *>(fh->removexattr)};
  for (const void *slot : empty) EXPECT_EQ(slot, nullptr);
  EXPECT_EQ(fh->close(fh), 0);
}

TEST(DataPoolFile, ReadsOnlyAtTheOffsetThatFollowsWhatWasRead) {
  PoolRef ref(100);
  std::vector<uint8_t> bytes = fileBytes(0, 100), out(200);
  ASSERT_EQ(addDataToPool(ref.pool, bytes.data(), 100), 100);
  FileHandle *fh = openDataPoolFile(ref.pool, "data pool for f");
  ASSERT_NE(fh, nullptr);
  EXPECT_EQ(fh->pread(fh, out.data(), 10, 0), 10);
  CaptureStdout();
  CaptureStderr();
  errno = 0;
  EXPECT_EQ(fh->pread(fh, out.data(), 10, 0), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(GetCapturedStderr(), "");
  EXPECT_EQ(GetCapturedStdout(), "can't read from position 0, curPos 10\n");
  EXPECT_EQ(fh->pread(fh, out.data() + 10, 10, 10), 10);  // the position did not move
  EXPECT_EQ(fh->pread(fh, out.data() + 20, 200, 20), 80);
  EXPECT_EQ(fh->pread(fh, out.data(), 10, 100), 0);
  out.resize(100);
  EXPECT_EQ(out, bytes);
  EXPECT_EQ(fh->close(fh), 0);
}

TEST(DataPoolFile, OpeningWithoutMemoryFailsAndTakesNoReference) {
  for (sys::Call call : {sys::Call::Calloc, sys::Call::Malloc}) {
    DataPool *pool = newDataPool(10);
    ASSERT_NE(pool, nullptr);
    sys::armFault(call, 1, ENOMEM);
    errno = 0;
    FileHandle *fh = openDataPoolFile(pool, "data pool for g");
    int error = errno;
    sys::clearFaults();
    EXPECT_EQ(fh, nullptr);
    EXPECT_EQ(error, ENOMEM);
    EXPECT_EQ(releaseDataPool(pool), 1) << "only the creator's reference was left";
  }
}

}  // namespace
