#include "Common/ThrottlingAllocator.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <functional>
#include <chrono>
#include <fstream>
#include <thread>

#include "Platform/SystemResources.h"
#include "Platform/Syscalls.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::MatchesRegex;

namespace {

TEST(ThrottlingAllocator, MemoryBudgetIsPhysicalMemoryLess700MiBButAtLeast100MiB) {
  struct {
    uint64_t memory, budget;
  } cases[] = {{8ull << 30, 7855931392ull},
               {512ull << 20, 104857600},
               {750ull << 20, 104857600},
               {734003200ull + 104857600, 104857600},
               {734003200ull + 104857601, 104857601},
               {0, 104857600}};
  for (const auto &c : cases) EXPECT_EQ(memoryBudgetFor(c.memory), c.budget) << c.memory;
}

TEST(ThrottlingAllocator, DescriptorBudgetIsWhatTheSoftLimitWasRaisedBy) {
  struct {
    uint64_t soft, hard, newSoft, budget;
  } cases[] = {{256, RLIM_INFINITY, 320, 64},
               {10240, RLIM_INFINITY, 10240, 10},
               {65536, RLIM_INFINITY, 10240, 10},
               {10200, 10240, 10240, 40},
               {1024, 1024, 1024, 10},
               {1024, 1050, 1050, 26}};
  for (const auto &c : cases) {
    uint64_t newSoft, budget;
    descriptorBudgetFor(c.soft, c.hard, &newSoft, &budget);
    EXPECT_EQ(newSoft, c.newSoft) << c.soft << "/" << c.hard;
    EXPECT_EQ(budget, c.budget) << c.soft << "/" << c.hard;
  }
}

// Starts an allocation on another thread; `admitted` turns true once it returns.
struct PendingAllocation {
  PendingAllocation(uint64_t size) : size(size), thread([this] {
    block = waitThenAllocate(this->size, 0);
    admitted = true;
  }) {}
  ~PendingAllocation() {
    thread.join();
    freeAndSignal(block, size);
  }
  bool admittedWithin(std::chrono::milliseconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (!admitted && std::chrono::steady_clock::now() < deadline)
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    return admitted;
  }
  uint64_t size;
  void *block = nullptr;
  std::atomic<bool> admitted{false};
  std::thread thread;
};

TEST(ThrottlingAllocator, RequestIsAdmittedOnlyWhileTheTotalStaysBelowTheBudget) {
  throttlingSetMemoryBudget(104857600);
  void *held = waitThenAllocate(40000000, 1);
  ASSERT_NE(held, nullptr);
  EXPECT_EQ(throttlingMemoryCharged(), 40000000u);
  {
    PendingAllocation fits(64857599);
    EXPECT_TRUE(fits.admittedWithin(std::chrono::seconds(10)));
  }
  {
    PendingAllocation tooLarge(64857600);  // would make the total equal to the budget
    EXPECT_FALSE(tooLarge.admittedWithin(std::chrono::milliseconds(200)));
    freeAndSignal(held, 40000000);
    EXPECT_TRUE(tooLarge.admittedWithin(std::chrono::seconds(10)));
  }
  EXPECT_EQ(throttlingMemoryCharged(), 0u);
}

TEST(ThrottlingAllocator, RequestNoBudgetCanHoldFailsAtOnce) {
  throttlingSetMemoryBudget(104857600);
  auto started = std::chrono::steady_clock::now();
  errno = 0;
  EXPECT_EQ(waitThenAllocate(104857600, 0), nullptr);  // the total must stay below the budget
  EXPECT_EQ(errno, ENOMEM);
  EXPECT_EQ(waitThenAllocate(1ull << 40, 1), nullptr);
  EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
  EXPECT_EQ(throttlingMemoryCharged(), 0u);
}

TEST(ThrottlingAllocator, ZeroFilledBlocksAreZero) {
  auto *block = static_cast<uint8_t *>(waitThenAllocate(1 << 20, 1));
  ASSERT_NE(block, nullptr);
  for (size_t i = 0; i < (1 << 20); i += 4096) ASSERT_EQ(block[i], 0);
  freeAndSignal(block, 1 << 20);
}

// Runs body in a child process (the descriptor budget is set once per process) and expects it
// to exit with 0; the child's failures are reported through its exit status.
void inChild(const std::function<int()> &body) {
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) _exit(body());
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0) << "child check " << WEXITSTATUS(status) << " failed";
}

TEST(ThrottlingAllocator, DescriptorBudgetRaisesTheSoftLimitAndBlocksThe59thHolder) {
  inChild([] {
    struct rlimit limit = {256, RLIM_INFINITY};
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = 256;
    if (setrlimit(RLIMIT_NOFILE, &limit) != 0) return 1;
    std::vector<int> held;
    for (int i = 0; i < 58; i++) {
      int fd = waitThenDupOrOpen(nullptr, 0);
      if (fd < 0) return 2;
      held.push_back(fd);
    }
    getrlimit(RLIMIT_NOFILE, &limit);
    if (limit.rlim_cur != 320 || throttlingDescriptorBudget() != 64) return 3;
    std::atomic<int> extra{-1};
    std::thread waiter([&] { extra = waitThenDupOrOpen("/dev/null", -1); });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    if (extra != -1) return 4;  // admitted although 58 were held
    if (closeAndSignal(held.back()) != 0) return 5;
    waiter.join();
    if (extra < 0 || throttlingDescriptorsHeld() != 58) return 6;
    return 0;
  });
}

// A place is taken before the open and given back when it fails: failed opens neither use up
// the budget nor lose the cause.
TEST(ThrottlingAllocator, FailedOpenGivesItsPlaceBackAndKeepsItsCause) {
  inChild([] {
    int fd = waitThenDupOrOpen(nullptr, 0);
    if (fd < 0) return 1;
    for (int i = 0; i < 3; i++) {
      errno = 0;
      if (waitThenDupOrOpen("/nonexistent/plenzo-budget-test", -1) != -1) return 2;
      if (errno != ENOENT) return 3;
    }
    if (throttlingDescriptorsHeld() != 1) return 4;
    return closeAndSignal(fd) == 0 && throttlingDescriptorsHeld() == 0 ? 0 : 5;
  });
}

TEST(ThrottlingAllocator, HighSoftLimitIsLoweredAndLeavesTheSmallestBudget) {
  inChild([] {
    struct rlimit limit;
    getrlimit(RLIMIT_NOFILE, &limit);
    if (limit.rlim_max < 20000) return 0;  // nothing to show on this machine
    limit.rlim_cur = 20000;
    if (setrlimit(RLIMIT_NOFILE, &limit) != 0) return 1;
    int fd = waitThenDupOrOpen(nullptr, 0);
    getrlimit(RLIMIT_NOFILE, &limit);
    if (limit.rlim_cur != 10240 || throttlingDescriptorBudget() != 10) return 2;
    return closeAndSignal(fd) == 0 ? 0 : 3;
  });
}

TEST(ThrottlingAllocator, DescriptorBudgetForSoftLimitsNear10240) {
  if (geteuid() != 0) GTEST_SKIP() << "raising the hard descriptor limit needs root";
  struct {
    rlim_t soft;
    uint64_t newSoft, budget;
  } cases[] = {{10200, 10240, 40}, {10240, 10240, 10}};
  for (const auto &c : cases) {
    inChild([&] {
      struct rlimit limit = {c.soft, 10240};
      if (setrlimit(RLIMIT_NOFILE, &limit) != 0) return 1;
      int fd = waitThenDupOrOpen(nullptr, 0);
      getrlimit(RLIMIT_NOFILE, &limit);
      if (limit.rlim_cur != c.newSoft) return 2;
      if (throttlingDescriptorBudget() != c.budget) return 3;
      return closeAndSignal(fd) == 0 ? 0 : 4;
    });
  }
}

TEST(ThrottlingAllocator, TooManyOpenFilesIsWaitedOutNotReported) {
  inChild([] {
    int first = waitThenDupOrOpen(nullptr, 0);  // sets the budget up
    closeAndSignal(first);
    // The opener thread exists before the descriptors run out: starting a thread (and the
    // sanitizers' checks when it starts) may itself need one.
    std::atomic<bool> go{false};
    std::atomic<int> got{-2};
    std::thread opener([&] {
      while (!go) std::this_thread::sleep_for(std::chrono::milliseconds(1));
      got = waitThenDupOrOpen("/dev/null", -1);
    });
    // Use up the process's descriptors outside the budget.
    std::vector<int> filler;
    filler.reserve(1 << 16);
    for (int fd; (fd = dup(0)) >= 0;) filler.push_back(fd);
    if (errno != EMFILE) {
      fprintf(stderr, "filling descriptors stopped with %s after %zu\n", strerror(errno), filler.size());
      return 1;
    }
    go = true;
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    if (got != -2) return 2;  // it must still be waiting, not failed
    for (int i = 0; i < 4; i++) {
      close(filler.back());
      filler.pop_back();
    }
    opener.join();  // retried within its 5-second wait
    if (got < 0) return 3;
    return closeAndSignal(got) == 0 ? 0 : 4;
  });
}

TEST(ThrottlingAllocator, OpenFailureIsReportedAndLeavesTheCountAlone) {
  testing::internal::CaptureStderr();
  errno = 0;
  EXPECT_EQ(waitThenDupOrOpen("/nonexistent/plzc", 7), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              MatchesRegex("Common/ThrottlingAllocator:[0-9]+: waitThenDupOrOpen\\(/nonexistent/plzc,7\\): No such "
                           "file or directory\n"));
  EXPECT_EQ(throttlingDescriptorsHeld(), 0);
  EXPECT_EQ(closeAndSignal(0), 0);
  EXPECT_EQ(closeAndSignal(-1), 0);
  EXPECT_EQ(throttlingDescriptorsHeld(), 0);
}

// Linux releases a descriptor whatever close returns; the budget must get its place back too,
// or every failed close would shrink it for good.
TEST(ThrottlingAllocator, AFailedCloseStillGivesTheDescriptorBack) {
  int fd = waitThenDupOrOpen("/dev/null", -1);
  ASSERT_GE(fd, 0);
  EXPECT_EQ(throttlingDescriptorsHeld(), 1);
  sys::armFault(sys::Call::Close, 1, EIO);
  EXPECT_EQ(closeAndSignal(fd), -1);
  EXPECT_EQ(errno, EIO);
  sys::clearFaults();
  EXPECT_EQ(throttlingDescriptorsHeld(), 0);
  EXPECT_EQ(fcntl(fd, F_GETFD), -1) << "the descriptor is still open";
}

// Opening a FIFO or a device can be interrupted; the wrapper restarts it, so a waiting opener
// neither fails nor reports anything.
TEST(ThrottlingAllocator, InterruptedOpenIsRestarted) {
  uint64_t opens = sys::callCount(sys::Call::Open);
  sys::armFault(sys::Call::Open, 1, EINTR);
  testing::internal::CaptureStderr();
  int fd = waitThenDupOrOpen("/dev/null", -1);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  sys::clearFaults();
  EXPECT_GE(fd, 0);
  EXPECT_EQ(sys::callCount(sys::Call::Open), opens + 2);  // the interrupted call and its restart
  EXPECT_EQ(closeAndSignal(fd), 0);
}

TEST(SystemResources, CgroupLimitLowersPhysicalMemory) {
  ScratchDir dir;
  std::string root = dir.path();
  ASSERT_EQ(system(("mkdir -p '" + root + "/a/b' '" + root + "/memory/c'").c_str()), 0);
  writeFile(root + "/a/b/memory.max", std::string("1073741824\n"));
  writeFile(root + "/memory/c/memory.limit_in_bytes", std::string("9223372036854771712\n"));
  writeFile(root + "/v2", std::string("0::/a/b\n"));
  writeFile(root + "/v1", std::string("5:memory:/c\n4:cpu:/c\n"));
  writeFile(root + "/none", std::string("0::/missing\n"));
  EXPECT_EQ(platform::cgroupMemoryLimit((root + "/v2").c_str(), root.c_str()), 1073741824u);
  EXPECT_EQ(platform::cgroupMemoryLimit((root + "/v1").c_str(), root.c_str()), 0u);
  EXPECT_EQ(platform::cgroupMemoryLimit((root + "/none").c_str(), root.c_str()), 0u);
  writeFile(root + "/a/b/memory.max", std::string("max\n"));
  EXPECT_EQ(platform::cgroupMemoryLimit((root + "/v2").c_str(), root.c_str()), 0u);

  uint64_t memory = 0;
  ASSERT_EQ(platform::physicalMemory(&memory), 0);
  EXPECT_GT(memory, 64ull << 20);
}

// An address-space limit bounds what the process can map: the memory the budget starts from is
// lowered to it. Checked in a child, whose limit dies with it.
TEST(SystemResources, AddressSpaceLimitLowersPhysicalMemory) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "sanitizers map more than any limit this test could set";
#endif
  uint64_t unlimited = 0;
  ASSERT_EQ(platform::physicalMemory(&unlimited), 0);
  uint64_t cap = unlimited / 2;
  pid_t pid = fork();
  if (pid == 0) {
    struct rlimit limit = {cap, RLIM_INFINITY};
    uint64_t memory = 0;
    bool ok = setrlimit(RLIMIT_AS, &limit) == 0 && platform::physicalMemory(&memory) == 0 && memory == cap;
    _exit(ok ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "physicalMemory did not report the limit " << cap;
}

}  // namespace
