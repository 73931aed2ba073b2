#include "Common/FileLock.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <random>
#include <thread>
#include <vector>

#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using namespace std::chrono_literals;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

// Runs body on its own thread (locks are unlocked by the thread that took them).
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
  bool finishesWithin(std::chrono::milliseconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (!done_ && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(1ms);
    return done_;
  }

 private:
  std::atomic<bool> done_{false};
  std::thread thread_;
};

// Waits until n threads hold or wait for the lock (a waiter counts as soon as it is queued).
bool holdersReach(FileLock *lock, int32_t n) {
  auto deadline = std::chrono::steady_clock::now() + 10s;
  while (fileLockHolders(lock) < n && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(1ms);
  return fileLockHolders(lock) >= n;
}

// A deadlock cannot be failed and continued from: say so and end the process.
void exitOnDeadlock(Background &side, std::chrono::seconds limit, const char *what) {
  if (side.finishesWithin(limit)) return;
  fprintf(stderr, "deadlock: %s did not finish within %lld s\n", what, static_cast<long long>(limit.count()));
  std::abort();
}

class FileLockTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    file = writeFile(dir.file("file"), "contents");
    ASSERT_EQ(link(file.c_str(), dir.file("hardlink").c_str()), 0);
    ASSERT_EQ(symlink(file.c_str(), dir.file("symlink").c_str()), 0);
    fd = open(file.c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(fileLockTableCount(), 0);
  }
  void TearDown() override {
    if (fd >= 0) close(fd);
    EXPECT_EQ(fileLockTableCount(), 0) << "every record must be gone after its last unlock";
  }
  ScratchDir dir;
  std::string file;
  int fd = -1;
};

// ---- One file, many names ---------------------------------------------------------------------

TEST_F(FileLockTest, EveryNameOfAFileTakesTheSameLockAndWaitsForItsHolder) {
  struct stat st;
  ASSERT_EQ(stat(file.c_str(), &st), 0);
  std::string hardlink = dir.file("hardlink"), symlink = dir.file("symlink");
  const struct {
    const char *name;
    std::function<FileLock *()> lock;
  } ways[] = {
      {"path", [&] { return PLZCLockFilePath(file.c_str()); }},
      {"hard link", [&] { return PLZCLockFilePath(hardlink.c_str()); }},
      {"symbolic link", [&] { return PLZCLockFilePath(symlink.c_str()); }},
      {"descriptor", [&] { return PLZCLockFileFd(fd); }},
      {"device and inode", [&] { return PLZCLockFileIno(static_cast<int32_t>(st.st_dev), st.st_ino); }},
  };
  for (const auto &holderWay : ways) {
    for (const auto &waiterWay : ways) {
      SCOPED_TRACE(std::string("held through the ") + holderWay.name + ", wanted through the " + waiterWay.name);
      FileLock *held = holderWay.lock();
      ASSERT_NE(held, nullptr);
      FileLock *got = nullptr;
      Background waiter([&] {
        got = waiterWay.lock();
        PLZCUnlockFile(got);
      });
      ASSERT_TRUE(holdersReach(held, 2));
      std::this_thread::sleep_for(20ms);
      EXPECT_FALSE(waiter.done()) << "took the lock while another thread held it";
      EXPECT_EQ(PLZCUnlockFile(held), 0);
      exitOnDeadlock(waiter, 30s, "the waiter");
      EXPECT_EQ(got, held) << "the waiter kept the record alive, so it gets the same one";
      EXPECT_EQ(fileLockTableCount(), 0);
    }
  }
}

// ---- Different files ------------------------------------------------------------------------

TEST_F(FileLockTest, OtherFilesAreNotHeldUpByALockOrItsWaiters) {
  FileLock *held = PLZCLockFileIno(1, 42);
  ASSERT_NE(held, nullptr);
  Background waiter([&] { PLZCUnlockFile(PLZCLockFileIno(1, 42)); });
  ASSERT_TRUE(holdersReach(held, 2));
  // Same inode on another device, another inode on the same device: separate records, taken
  // at once, while a waiter sleeps on the held one.
  std::vector<FileLock *> others;
  Background other([&] {
    for (int i = 0; i < 1000; i++) {
      FileLock *a = PLZCLockFileIno(2, 42);
      FileLock *b = PLZCLockFileIno(1, 43);
      if (i == 0) others = {a, b};
      PLZCUnlockFile(b);
      PLZCUnlockFile(a);
    }
  });
  EXPECT_TRUE(other.finishesWithin(30s)) << "a lock on one file held up another";
  EXPECT_FALSE(waiter.done());
  ASSERT_EQ(others.size(), 2u);
  EXPECT_NE(others[0], held);
  EXPECT_NE(others[1], held);
  EXPECT_NE(others[0], others[1]);
  EXPECT_EQ(PLZCUnlockFile(held), 0);
  exitOnDeadlock(waiter, 30s, "the waiter");
  exitOnDeadlock(other, 30s, "the other files' locker");
}

TEST_F(FileLockTest, RecordLivesExactlyWhileSomeoneHoldsOrWaits) {
  FileLock *a = PLZCLockFileIno(5, 100);
  ASSERT_NE(a, nullptr);
  EXPECT_EQ(fileLockTableCount(), 1);
  EXPECT_EQ(fileLockHolders(a), 1);
  FileLock *b = PLZCLockFileIno(5, 101);
  ASSERT_NE(b, nullptr);
  EXPECT_EQ(fileLockTableCount(), 2);
  EXPECT_EQ(PLZCUnlockFile(a), 0);
  EXPECT_EQ(fileLockTableCount(), 1);
  EXPECT_EQ(PLZCUnlockFile(b), 0);
  EXPECT_EQ(fileLockTableCount(), 0);
  FileLock *again = PLZCLockFileIno(5, 100);  // a fresh record
  ASSERT_NE(again, nullptr);
  EXPECT_EQ(fileLockHolders(again), 1);
  EXPECT_EQ(fileLockTableCount(), 1);
  EXPECT_EQ(PLZCUnlockFile(again), 0);
}

// ---- Failures ---------------------------------------------------------------------------------

TEST_F(FileLockTest, FailuresReturnNullWithTheirErrnoAndLeaveTheTableAsItWas) {
  FileLock *other = PLZCLockFilePath(file.c_str());
  ASSERT_NE(other, nullptr);
  std::string missing = dir.file("missing");
  // Far above the descriptors that capturing standard error takes, so it stays closed.
  int closedFd = fcntl(fd, F_DUPFD, 900);
  ASSERT_GE(closedFd, 0);
  close(closedFd);
  const struct {
    const char *name;
    std::function<FileLock *()> lock;
    int error;
    std::string message;
  } cases[] = {
      {"missing path", [&] { return PLZCLockFilePath(missing.c_str()); }, ENOENT,
       "stat\\(" + missing + "\\): No such file or directory"},
      {"closed descriptor", [&] { return PLZCLockFileFd(closedFd); }, EBADF,
       "fstat\\(" + std::to_string(closedFd) + "\\): Bad file descriptor"},
      {"no memory for the record",
       [&] {
         sys::armFault(sys::Call::Calloc, 1, ENOMEM);
         FileLock *lock = PLZCLockFileIno(9, 9);
         int error = errno;
         sys::clearFaults();
         errno = error;
         return lock;
       },
       ENOMEM, "Error: calloc failed"},
  };
  for (const auto &c : cases) {
    SCOPED_TRACE(c.name);
    CaptureStderr();
    errno = 0;
    FileLock *lock = c.lock();
    int error = errno;
    std::string printed = GetCapturedStderr();
    EXPECT_EQ(lock, nullptr);
    EXPECT_EQ(error, c.error);
    EXPECT_THAT(printed, MatchesRegex("Common/StreamCompressor:[0-9]+: " + c.message + "\n"));
    EXPECT_EQ(fileLockTableCount(), 1);
    EXPECT_EQ(fileLockHolders(other), 1);
  }
  EXPECT_EQ(PLZCUnlockFile(other), 0);
  FileLock *after = PLZCLockFileIno(9, 9);  // the failed key left nothing behind
  ASSERT_NE(after, nullptr);
  EXPECT_EQ(fileLockHolders(after), 1);
  EXPECT_EQ(PLZCUnlockFile(after), 0);
}

TEST_F(FileLockTest, UnlockingNullFailsSilentlyWithEINVAL) {
  CaptureStderr();
  errno = 0;
  EXPECT_EQ(PLZCUnlockFile(nullptr), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(GetCapturedStderr(), "");
}

// ---- Many threads -----------------------------------------------------------------------------

// Threads lock a few files through every kind of name and a file of their own; inside a lock
// each checks that it is alone and bumps the file's plain counter in two steps, which loses
// counts (and is a data race for the thread sanitizer) if two threads ever hold one file.
TEST_F(FileLockTest, ManyThreadsOnSharedAndPrivateFilesExcludeEachOtherWithoutDeadlock) {
  constexpr int kThreads = 8;
  constexpr int kIterations = 3000;
  constexpr int kShared = 3;
  struct SharedFile {
    std::string path;
    int fd;
    dev_t dev;
    ino_t ino;
    std::atomic<int> inside{0};
    long count = 0;  // guarded by the file's lock only
  } shared[kShared];
  for (int i = 0; i < kShared; i++) {
    shared[i].path = writeFile(dir.file("shared" + std::to_string(i)), "x");
    shared[i].fd = open(shared[i].path.c_str(), O_RDONLY);
    ASSERT_GE(shared[i].fd, 0);
    struct stat st;
    ASSERT_EQ(fstat(shared[i].fd, &st), 0);
    shared[i].dev = st.st_dev;
    shared[i].ino = st.st_ino;
  }
  std::atomic<int> overlaps{0}, failures{0};
  std::atomic<long> sharedPicks{0};
  std::atomic<bool> go{false};
  std::vector<std::unique_ptr<Background>> threads;
  for (int t = 0; t < kThreads; t++) {
    threads.push_back(std::make_unique<Background>([&, t] {
      std::mt19937 random(static_cast<unsigned>(t + 1));
      while (!go) std::this_thread::yield();
      for (int i = 0; i < kIterations; i++) {
        unsigned pick = random() % (kShared + 1);
        if (pick == kShared) {  // a file nobody else locks
          FileLock *lock = PLZCLockFileIno(77, 1000000 + static_cast<uint64_t>(t));
          if (!lock) {
            failures++;
            continue;
          }
          PLZCUnlockFile(lock);
          continue;
        }
        SharedFile &f = shared[pick];
        FileLock *lock = nullptr;
        switch (random() % 3) {
          case 0: lock = PLZCLockFilePath(f.path.c_str()); break;
          case 1: lock = PLZCLockFileFd(f.fd); break;
          default: lock = PLZCLockFileIno(static_cast<int32_t>(f.dev), f.ino); break;
        }
        if (!lock) {
          failures++;
          continue;
        }
        sharedPicks++;
        if (f.inside.fetch_add(1) != 0) overlaps++;
        long value = f.count;
        if (random() % 4 == 0) std::this_thread::yield();
        f.count = value + 1;
        f.inside.fetch_sub(1);
        if (PLZCUnlockFile(lock) != 0) failures++;
      }
    }));
  }
  go = true;
  for (auto &thread : threads) exitOnDeadlock(*thread, 300s, "a locking thread");
  threads.clear();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_EQ(overlaps.load(), 0);
  long total = 0;
  for (auto &f : shared) {
    total += f.count;
    close(f.fd);
  }
  EXPECT_GT(total, 0);
  EXPECT_EQ(total, sharedPicks.load()) << "two threads held one file at once";
}

}  // namespace
