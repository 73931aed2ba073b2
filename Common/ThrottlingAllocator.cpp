#include "Common/ThrottlingAllocator.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/WorkQueue.h"
#include "Platform/SystemResources.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Common/ThrottlingAllocator";

namespace {

constexpr uint64_t kReservedMemory = 734003200;  // 700 MiB left to the rest of the system
constexpr uint64_t kSmallestMemoryBudget = 104857600;
constexpr uint64_t kDescriptorRaise = 64;
constexpr uint64_t kHighestSoftLimit = 10240;
constexpr uint64_t kSmallestDescriptorBudget = 10;


uint64_t totalPoolAllocs = 0;
uint64_t maxPoolAllocs = 0;
pthread_mutex_t totalPoolAllocsLock = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t totalPoolAllocsCond = PTHREAD_COND_INITIALIZER;

int32_t compressorFdsCount = 0;
uint64_t max_fds = 0;
pthread_mutex_t compressorFdsLock = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t compressorFdsCond = PTHREAD_COND_INITIALIZER;      // the count came down
pthread_cond_t compressorFdsClosedCond = PTHREAD_COND_INITIALIZER;  // a descriptor was closed
pthread_once_t once_rlimit = PTHREAD_ONCE_INIT;
std::atomic<uint32_t> tooManyFilesWaitMs{5000};

void computeMemoryBudget() {
  uint64_t memory;
  if (platform::physicalMemory(&memory) != 0) {
    PLZC_ERR("%s:%d: sysctl: %s\n", strerror(errno));
    memory = 0;
  }
  maxPoolAllocs = memoryBudgetFor(memory);
}

void _RaiseRlimit() {
  max_fds = kDescriptorRaise;
  struct rlimit limit;
  if (platform::getDescriptorLimit(&limit) != 0) {
    PLZC_ERR("%s:%d: getrlimit: %s\n", strerror(errno));
    return;
  }
  uint64_t newSoft;
  descriptorBudgetFor(limit.rlim_cur, limit.rlim_max, &newSoft, &max_fds);
  limit.rlim_cur = newSoft;
  if (platform::setDescriptorLimit(&limit) != 0) {
    PLZC_ERR("%s:%d: setrlimit(RLIMIT_NOFILE.rlim_cur = %lld): %s\n", static_cast<long long>(newSoft),
             strerror(errno));
    return;
  }
  if (platform::getDescriptorLimit(&limit) != 0) PLZC_ERR("%s:%d: getrlimit(RLIMIT_NOFILE): %s\n", strerror(errno));
}

}  // namespace

uint64_t memoryBudgetFor(uint64_t physicalMemory) {
  if (physicalMemory >= kReservedMemory && physicalMemory - kReservedMemory >= kSmallestMemoryBudget)
    return physicalMemory - kReservedMemory;
  return kSmallestMemoryBudget;
}

void descriptorBudgetFor(uint64_t soft, uint64_t hard, uint64_t *newSoft, uint64_t *budget) {
  uint64_t highest = hard < kHighestSoftLimit ? hard : kHighestSoftLimit;
  uint64_t current = soft < highest ? soft : highest;
  *newSoft = current + kDescriptorRaise < highest ? current + kDescriptorRaise : highest;
  uint64_t raised = *newSoft > current ? *newSoft - current : 0;
  *budget = raised > kSmallestDescriptorBudget ? raised : kSmallestDescriptorBudget;
}

void *waitThenAllocate(uint64_t size, int32_t zeroFill) {
  pthread_mutex_lock(&totalPoolAllocsLock);
  if (maxPoolAllocs == 0) computeMemoryBudget();
  if (size >= maxPoolAllocs) {
    // No amount of memory given back would admit it: waiting would never end.
    pthread_mutex_unlock(&totalPoolAllocsLock);
    errno = ENOMEM;
    return nullptr;
  }
  if (totalPoolAllocs + size >= maxPoolAllocs) {
    // Memory comes back from other work, perhaps queued on this thread's own pool.
    workQueueBlockingBegin();
    while (totalPoolAllocs + size >= maxPoolAllocs) pthread_cond_wait(&totalPoolAllocsCond, &totalPoolAllocsLock);
    workQueueBlockingEnd();
  }
  // calloc gets large zeroed blocks straight from the system, without clearing them again.
  void *block = zeroFill ? sys::calloc(1, size) : sys::malloc(size);
  // Only blocks that were obtained are charged, so the total stays exact.
  if (block) totalPoolAllocs += size;
  pthread_mutex_unlock(&totalPoolAllocsLock);
  return block;
}

void freeAndSignal(void *block, uint64_t size) {
  pthread_mutex_lock(&totalPoolAllocsLock);
  totalPoolAllocs -= size;
  free(block);
  // Waiters want different sizes: wake them all, each re-tests its own request.
  pthread_cond_broadcast(&totalPoolAllocsCond);
  pthread_mutex_unlock(&totalPoolAllocsLock);
}

int32_t waitThenDupOrOpen(const char *path, int32_t fd) {
  pthread_once(&once_rlimit, _RaiseRlimit);
  pthread_mutex_lock(&compressorFdsLock);
  for (;;) {
    if (static_cast<uint64_t>(compressorFdsCount) * 10 >= max_fds * 9) {
      workQueueBlockingBegin();
      while (static_cast<uint64_t>(compressorFdsCount) * 10 >= max_fds * 9)
        pthread_cond_wait(&compressorFdsCond, &compressorFdsLock);
      workQueueBlockingEnd();
    }
    // The place is taken before the descriptor exists and the lock is not held across the
    // system call: the other threads' opens and closes do not queue up behind this one.
    compressorFdsCount++;
    pthread_mutex_unlock(&compressorFdsLock);
    int result = path ? sys::open(path, O_RDONLY, 0) : sys::dup(fd);
    if (result >= 0) return result;
    int savedErrno = errno;
    pthread_mutex_lock(&compressorFdsLock);
    // The place goes back; a thread that found the count full because of it may go on. Threads
    // waiting for a close (below) are not woken: no descriptor was freed.
    compressorFdsCount--;
    pthread_cond_signal(&compressorFdsCond);
    if (savedErrno != EMFILE && savedErrno != ENFILE) {
      PLZC_ERR("%s:%d: waitThenDupOrOpen(%s,%d): %s\n", path ? path : "(null)", fd, strerror(savedErrno));
      pthread_mutex_unlock(&compressorFdsLock);
      errno = savedErrno;
      return -1;
    }
    struct timeval now;
    if (gettimeofday(&now, nullptr) != 0) {
      PLZC_ERR("%s:%d: gettimeofday: %s\n", strerror(errno));
      continue;
    }
    uint64_t deadlineUs = static_cast<uint64_t>(now.tv_usec) + tooManyFilesWaitMs.load(std::memory_order_relaxed) * 1000ull;
    struct timespec deadline = {now.tv_sec + static_cast<time_t>(deadlineUs / 1000000),
                                static_cast<long>(deadlineUs % 1000000) * 1000};
    // The process is out of descriptors: wait for one of ours to be closed, or a while.
    pthread_cond_timedwait(&compressorFdsClosedCond, &compressorFdsLock, &deadline);
  }
}

int32_t closeAndSignal(int32_t fd) {
  if (fd < 1) return 0;
  // Closed outside the lock; the place is given back after (the count is never below the
  // descriptors that exist).
  int result = sys::close(fd);
  int savedErrno = errno;
  pthread_mutex_lock(&compressorFdsLock);
  // Linux releases the descriptor even when close reports an error (EIO, EINTR): keeping the
  // charge would lose a place in the budget for good, and with it, one day, every opener.
  compressorFdsCount--;
  pthread_cond_signal(&compressorFdsCond);
  pthread_cond_signal(&compressorFdsClosedCond);
  pthread_mutex_unlock(&compressorFdsLock);
  errno = savedErrno;
  return result;
}

uint64_t throttlingMemoryBudget() {
  pthread_mutex_lock(&totalPoolAllocsLock);
  if (maxPoolAllocs == 0) computeMemoryBudget();
  uint64_t budget = maxPoolAllocs;
  pthread_mutex_unlock(&totalPoolAllocsLock);
  return budget;
}

uint64_t throttlingMemoryCharged() {
  pthread_mutex_lock(&totalPoolAllocsLock);
  uint64_t charged = totalPoolAllocs;
  pthread_mutex_unlock(&totalPoolAllocsLock);
  return charged;
}

uint64_t throttlingDescriptorBudget() {
  pthread_once(&once_rlimit, _RaiseRlimit);
  return max_fds;
}

int32_t throttlingDescriptorsHeld() {
  pthread_mutex_lock(&compressorFdsLock);
  int32_t held = compressorFdsCount;
  pthread_mutex_unlock(&compressorFdsLock);
  return held;
}

void throttlingSetMemoryBudget(uint64_t budget) {
  pthread_mutex_lock(&totalPoolAllocsLock);
  maxPoolAllocs = budget;
  pthread_mutex_unlock(&totalPoolAllocsLock);
  pthread_cond_broadcast(&totalPoolAllocsCond);
}

void throttlingSetTooManyFilesWait(uint32_t waitMs) { tooManyFilesWaitMs.store(waitMs, std::memory_order_relaxed); }
