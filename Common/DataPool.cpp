#include "Common/DataPool.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <thread>
#include <type_traits>

#include "Common/Diagnostics.h"
#include "Common/ThrottlingAllocator.h"
#include "Common/WorkQueue.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/Futex.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Common/DataPool";

namespace {

// Polls of the change counter before a waiting side goes to sleep in the kernel: long enough
// to catch the other side's next step when both are running, short enough (a few
// microseconds) not to matter when it is not.
constexpr int kSpinCount = 100;
// Attempts on a taken spin lock before yielding the processor to its holder.
constexpr int kLockSpinCount = 64;

constexpr int64_t kPoolBlockSize = 4096;
// Bytes read from a file into the ring at once, so that the reader can start on a large file
// before all of it is in.
constexpr uint64_t kFileReadPiece = 1048576;

// Guards a few loads and stores; never held during a copy or a wait.
class SpinLock {
 public:
  void lock() {
    for (int attempts = 0;; attempts++) {
      if (!locked_.exchange(true, std::memory_order_acquire)) return;
      while (locked_.load(std::memory_order_relaxed)) {
        if (attempts++ < kLockSpinCount) {
          platform::spinPause();
        } else {
          std::this_thread::yield();  // the holder may have been preempted
        }
      }
    }
  }
  void unlock() { locked_.store(false, std::memory_order_release); }

 private:
  std::atomic<bool> locked_{false};
};

}  // namespace

// The header of the pool's one block; the ring's capacity bytes follow it directly.
struct DataPool {
  std::atomic<int32_t> refCount;
  int64_t size;
  uint64_t bytesToRead;   // the reader's own
  uint64_t bytesToWrite;  // the writer's own
  uint64_t capacity;
  int32_t aborted;  // under lock; never cleared
  SpinLock lock;
  // Counts the changes a waiting side may be waiting for (every transfer step, abort): the
  // word waiters sleep on. A counter rather than a flag, so that a change is never consumed by
  // anyone but the side that waits for it; it is only compared, never cleared.
  std::atomic<uint32_t> changed;
  std::atomic<uint32_t> sleepers;  // sides asleep, or about to sleep, on changed
  uint64_t filled;                 // under lock
  int32_t readPos;                 // the reader's own
  int32_t writePos;                // the writer's own
};

static_assert(std::is_trivially_destructible_v<DataPool>);

namespace {

uint8_t *ring(DataPool *pool) { return reinterpret_cast<uint8_t *>(pool + 1); }

uint64_t blockBytes(uint64_t capacity) { return sizeof(DataPool) + capacity; }

// With the lock held: records a change and wakes whoever sleeps on it. The increment and the
// test of sleepers are sequentially consistent, like the waiter's increment of sleepers and
// its test of changed: either the waiter sees the new count and does not sleep, or this side
// sees the sleeper and wakes it (the kernel re-checks the count before sleeping).
void signalChange(DataPool *pool) {
  pool->changed.fetch_add(1, std::memory_order_seq_cst);
  if (pool->sleepers.load(std::memory_order_seq_cst) != 0) platform::futexWakeAll(&pool->changed);
}

// Without the lock: returns once changed differs from seen. Spins briefly, then sleeps.
void awaitChange(DataPool *pool, uint32_t seen) {
  for (int i = 0; i < kSpinCount; i++) {
    if (pool->changed.load(std::memory_order_relaxed) != seen) return;
    platform::spinPause();
  }
  // The other side may be queued behind this thread on the same work pool: let the pool know
  // this thread is blocked, so it can start another.
  workQueueBlockingBegin();
  pool->sleepers.fetch_add(1, std::memory_order_seq_cst);
  while (pool->changed.load(std::memory_order_seq_cst) == seen) platform::futexWait(&pool->changed, seen);
  pool->sleepers.fetch_sub(1, std::memory_order_relaxed);
  workQueueBlockingEnd();
}

// With the lock held, and held again on return: waits while mustWait() holds, re-testing it
// under the lock after every change of the pool.
template <typename Condition>
void waitWhile(DataPool *pool, Condition mustWait) {
  while (mustWait()) {
    uint32_t seen = pool->changed.load(std::memory_order_relaxed);
    pool->lock.unlock();
    awaitChange(pool, seen);
    pool->lock.lock();
  }
}

void markAborted(DataPool *pool) {
  pool->lock.lock();
  pool->aborted = 1;
  signalChange(pool);
  pool->lock.unlock();
}

}  // namespace

DataPool *newDataPool(int64_t size) {
  if (size < 0) {
    errno = EINVAL;
    return nullptr;
  }
  uint64_t capacity = std::min(static_cast<uint64_t>(size), kDataPoolMaxCapacity);
  // Only the header needs zeros: the ring's bytes are never read before they are written, and
  // clearing a file's worth of memory costs as much as copying it.
  void *block = waitThenAllocate(blockBytes(capacity), 0);
  if (!block) {
    errno = ENOMEM;
    PLZC_ERR("%s:%d: waitThenAllocate(%llu): %s\n", static_cast<unsigned long long>(blockBytes(capacity)),
             strerror(errno));
    return nullptr;
  }
  auto *pool = new (block) DataPool{};
  pool->refCount.store(1, std::memory_order_relaxed);
  pool->capacity = capacity;
  pool->size = size;
  pool->bytesToRead = static_cast<uint64_t>(size);
  pool->bytesToWrite = static_cast<uint64_t>(size);
  return pool;
}

int64_t dataPoolSize(DataPool *pool) { return pool->size; }

namespace {

// The writer's loop: fills the ring's free bytes in order with fill(destination, n), which puts
// between 1 and n bytes there and returns how many, 0 when its source has no more, or -1 (errno
// set). Returns the bytes added, fewer than count when the source ended; -1 when fill failed
// (what it put in before stays added) or with ENOSPC once the pool is aborted (bytes copied
// stay in the ring but count as not added, as for addDataToPool).
template <typename Fill>
int64_t addToPool(DataPool *pool, uint64_t count, Fill fill) {
  if (count > pool->bytesToWrite) {
    PLZC_ERR("%s:%d: Error: attempted to write past end of pool\n");
    return -1;
  }
  uint64_t added = 0;
  pool->lock.lock();
  while (added < count) {
    waitWhile(pool, [pool] { return pool->filled == pool->capacity && !pool->aborted; });
    if (pool->aborted) {
      pool->lock.unlock();
      errno = ENOSPC;
      return -1;
    }
    uint64_t position = static_cast<uint64_t>(pool->writePos);
    uint64_t n = std::min({pool->capacity - pool->filled, count - added, pool->capacity - position});
    pool->lock.unlock();
    // The ring's bytes from position on are free: only this side fills them, and the reader
    // does not look at them before filled says so.
    int64_t got = fill(ring(pool) + position, n);
    if (got <= 0) {
      pool->bytesToWrite -= added;
      return got < 0 ? -1 : static_cast<int64_t>(added);
    }
    added += static_cast<uint64_t>(got);
    position += static_cast<uint64_t>(got);
    pool->writePos = position == pool->capacity ? 0 : static_cast<int32_t>(position);
    pool->lock.lock();
    pool->filled += static_cast<uint64_t>(got);
    signalChange(pool);
  }
  pool->lock.unlock();
  pool->bytesToWrite -= added;
  return static_cast<int64_t>(added);
}

}  // namespace

int64_t addDataToPool(DataPool *pool, const void *buffer, uint64_t count) {
  auto *source = static_cast<const uint8_t *>(buffer);
  return addToPool(pool, count, [&source](uint8_t *destination, uint64_t n) {
    memcpy(destination, source, n);
    source += n;
    return static_cast<int64_t>(n);
  });
}

int64_t addFileDataToPool(DataPool *pool, int fd, uint64_t count) {
  return addToPool(pool, count, [fd](uint8_t *destination, uint64_t n) {
    return static_cast<int64_t>(sys::read(fd, destination, static_cast<size_t>(std::min(n, kFileReadPiece))));
  });
}

void finishDataPool(DataPool *pool) {
  pool->lock.lock();
  bool aborted = pool->aborted != 0;
  pool->lock.unlock();
  if (aborted || pool->bytesToWrite == 0) return;
  PLZC_ERR("%s:%d: Error: finished pool without filling it\n");
  markAborted(pool);
}

int64_t getDataFromPool(DataPool *pool, void *buffer, uint64_t count) {
  uint64_t total = std::min(count, pool->bytesToRead);
  auto *destination = static_cast<uint8_t *>(buffer);
  uint64_t remaining = total;
  pool->lock.lock();
  while (remaining > 0) {
    waitWhile(pool, [pool] { return pool->filled == 0 && !pool->aborted; });
    if (pool->aborted) {
      pool->lock.unlock();
      errno = EINVAL;
      return -1;
    }
    uint64_t position = static_cast<uint64_t>(pool->readPos);
    uint64_t n = std::min({pool->filled, remaining, pool->capacity - position});
    pool->lock.unlock();
    memcpy(destination, ring(pool) + position, n);
    destination += n;
    remaining -= n;
    pool->readPos = position + n == pool->capacity ? 0 : static_cast<int32_t>(position + n);
    pool->lock.lock();
    pool->filled -= n;
    signalChange(pool);
  }
  pool->lock.unlock();
  pool->bytesToRead -= total;
  return static_cast<int64_t>(total);
}

void abortDataPool(DataPool *pool) { markAborted(pool); }

void retainDataPool(DataPool *pool) { pool->refCount.fetch_add(1, std::memory_order_relaxed); }

int32_t releaseDataPool(DataPool *pool) {
  if (!pool || pool->refCount.fetch_sub(1, std::memory_order_acq_rel) != 1) return 0;
  freeAndSignal(pool, blockBytes(pool->capacity));
  return 1;
}

// ---- The pool file handle ----------------------------------------------------------------

namespace {

// The private state lives right behind the record, in one zero-filled allocation.
struct PoolFile {
  FileHandle handle;
  DataPool *pool;
  int64_t curPos;  // bytes read so far: the only offset a read may ask for
};

PoolFile *poolFileOf(FileHandle *fh) { return static_cast<PoolFile *>(fh->priv); }

int poolClose(FileHandle *fh) {
  if (!fh) return 0;
  PoolFile *file = poolFileOf(fh);
  releaseDataPool(file->pool);
  free(fh->name);  // path is the same copy
  free(file);
  return 0;
}

int64_t poolSize(FileHandle *fh) { return poolFileOf(fh)->pool->size; }

int64_t poolBlockSize(FileHandle *) { return kPoolBlockSize; }

int64_t poolPread(FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
  PoolFile *file = poolFileOf(fh);
  if (offset != file->curPos) {
    plzc::diagnostic(stdout, "can't read from position %lld, curPos %lld\n", static_cast<long long>(offset),
                     static_cast<long long>(file->curPos));
    errno = EINVAL;
    return -1;
  }
  if (count < 0) {
    errno = EINVAL;
    return -1;
  }
  int64_t got = getDataFromPool(file->pool, buffer, static_cast<uint64_t>(count));
  if (got > 0) file->curPos += got;
  return got;
}

int64_t poolGetxattr(FileHandle *, const char *, void *, uint64_t, uint32_t, int) {
  errno = ENOATTR;  // a pool has no attributes
  return -1;
}

const FileHandle kPoolFileTemplate = {
    .name = nullptr,
    .path = nullptr,
    .canUnread = 0,
    .close = poolClose,
    .reopen = nullptr,
    .mode = nullptr,
    .times = nullptr,
    .utimes = nullptr,
    .size = poolSize,
    .blockSize = poolBlockSize,
    .pread = poolPread,
    .pwrite = nullptr,
    .unreadAlloc = nullptr,
    .unreadSetPos = nullptr,
    .unread = nullptr,
    .unreadDone = nullptr,
    .chflags = nullptr,
    .truncate = nullptr,
    .getxattr = poolGetxattr,
    .setxattr = nullptr,
    .removexattr = nullptr,
    .sync = nullptr,  // nothing of it is on disk
    .priv = nullptr,
};

}  // namespace

FileHandle *openDataPoolFile(DataPool *pool, const char *name) {
  if (!name) name = "";
  auto *file = static_cast<PoolFile *>(sys::calloc(1, sizeof(PoolFile)));
  if (!file) {
    errno = ENOMEM;
    return nullptr;
  }
  size_t nameBytes = strlen(name) + 1;
  auto *nameCopy = static_cast<char *>(sys::malloc(nameBytes));
  if (!nameCopy) {
    free(file);
    errno = ENOMEM;
    return nullptr;
  }
  memcpy(nameCopy, name, nameBytes);
  file->handle = kPoolFileTemplate;
  file->handle.name = nameCopy;
  file->handle.path = nameCopy;
  file->handle.priv = file;
  file->pool = pool;
  file->curPos = 0;
  retainDataPool(pool);
  return &file->handle;
}
