#include "Common/WorkQueue.h"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <mutex>
#include <new>
#include <string>
#include <thread>

#include "Common/Diagnostics.h"

static constexpr char kSourcePath[] = "Common/WorkQueue";

// Misuse that would otherwise hang or corrupt the queues: say what happened and stop.
#define WQ_FATAL(format, ...)                    \
  do {                                           \
    PLZC_ERR(format __VA_OPT__(, ) __VA_ARGS__); \
    abort();                                     \
  } while (0)

struct WorkQueue {
  enum class Kind { concurrent, serial };
  WorkQueue(Kind kind, const char *label) : kind(kind), label(label ? label : "") {}
  virtual ~WorkQueue() = default;
  const Kind kind;
  const std::string label;
};

// Counts items that have been submitted through it and have not finished yet. The creator holds
// one reference and every pending item one, so the group outlives its last item's leave().
struct WorkGroup {
  void enter() {
    refs.fetch_add(1, std::memory_order_relaxed);
    std::lock_guard<std::mutex> lock(mutex);
    pending++;
  }
  void leave() {
    {
      std::lock_guard<std::mutex> lock(mutex);
      if (--pending == 0) allDone.notify_all();
    }
    release();
  }
  void release() {
    if (refs.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
  }

  std::mutex mutex;
  std::condition_variable allDone;
  int64_t pending = 0;
  std::atomic<int32_t> refs{1};
};

namespace {

struct Item {
  WorkFunction fn;
  void *context;
  WorkGroup *group;  // left after fn returns; may be null
};

class Pool;

// The pool whose worker the current thread is, and how deep it is in blocking announcements.
thread_local Pool *tlsPool = nullptr;
thread_local int tlsBlockingDepth = 0;

// The serial queues whose items the current thread is running, innermost first: a thread that
// drains a queue or runs a synchronous item on it holds it until that item returns.
struct HeldQueue {
  const WorkQueue *queue;
  HeldQueue *outer;
};
thread_local HeldQueue *tlsHeld = nullptr;

class HeldScope {
 public:
  explicit HeldScope(const WorkQueue *queue) : link_{queue, tlsHeld} { tlsHeld = &link_; }
  ~HeldScope() { tlsHeld = link_.outer; }
  HeldScope(const HeldScope &) = delete;
  HeldScope &operator=(const HeldScope &) = delete;

 private:
  HeldQueue link_;
};

constexpr int kMaxThreadCap = 4096;
// Items a serial queue runs in one go before it lets other work of its pool have the thread.
constexpr int kDrainBatch = 16;
constexpr uint32_t kGlobalIdleTimeoutMs = 5000;
// Stack of a worker thread. Items need little (64 KiB buffers at most), and the default of
// RLIMIT_STACK (8 MiB) per thread adds up under an address-space limit; sanitizers, which
// enlarge every frame, keep the default (0).
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr size_t kWorkerStackBytes = 0;
#else
constexpr size_t kWorkerStackBytes = 1 << 20;
#endif

std::atomic<int32_t> privatePoolCount{0};

// A set of worker threads sharing one FIFO of items. Threads are started on demand: up to
// width while work comes, and beyond width (up to cap) while blocked threads leave fewer than
// width running. Threads beyond width exit after idleTimeout without work.
class Pool final : public WorkQueue {
 public:
  Pool(const char *label, const char *threadName, int32_t width, int32_t cap,
       uint32_t idleTimeoutMs, bool global)
      : WorkQueue(Kind::concurrent, label),
        threadName_(threadName ? threadName : WorkQueue::label.substr(0, 15)),
        width_(width),
        cap_(cap),
        idleTimeout_(idleTimeoutMs),
        global_(global) {
    if (!global_) privatePoolCount.fetch_add(1, std::memory_order_relaxed);
  }
  ~Pool() override {
    if (!global_) privatePoolCount.fetch_sub(1, std::memory_order_relaxed);
  }

  void submit(const Item &item) {
    std::unique_lock<std::mutex> lock(mutex_);
    try {
      queue_.push_back(item);
    } catch (const std::bad_alloc &) {
      WQ_FATAL("%s:%d: Error: out of memory queuing work on %s\n", label.c_str());
    }
    bool wake = idle_ > 0;
    startThreadIfNeededLocked();
    // Woken after the lock is let go, so that the idle thread does not wake only to wait for
    // it. The submitter holds a reference, so the pool outlives this call.
    lock.unlock();
    if (wake) workAvailable_.notify_one();
  }

  // Starts the first thread before any work comes, while the process can still afford one. A
  // pool that later has no thread and cannot make one (no memory for a stack) could never run
  // what is queued on it; threads within the width never exit, so this one stays.
  void startFirstThread() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (threads_ > 0) return;
    if (int result = startThreadLocked())
      WQ_FATAL("%s:%d: Error: pthread_create failed for %s: %s\n", label.c_str(), strerror(result));
  }

  void blockingBegin() {
    std::lock_guard<std::mutex> lock(mutex_);
    blocked_++;
    startThreadIfNeededLocked();
  }

  void blockingEnd() {
    std::lock_guard<std::mutex> lock(mutex_);
    blocked_--;
  }

  // References held outside the pool's threads (its creator, serial queues targeting it). The
  // global pools ignore them.
  void retain() {
    if (global_) return;
    std::lock_guard<std::mutex> lock(mutex_);
    externalRefs_++;
  }

  void release() {
    if (global_) return;
    bool last;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      if (--externalRefs_ > 0) return;
      closing_ = true;
      workAvailable_.notify_all();
      last = threads_ == 0;
    }
    if (last) delete this;
  }

  WorkQueueStats stats() {
    std::lock_guard<std::mutex> lock(mutex_);
    return WorkQueueStats{
        width_, cap_, threads_, idle_, blocked_, peak_, static_cast<int64_t>(queue_.size())};
  }

 private:
  static void *threadMain(void *pool) {
    static_cast<Pool *>(pool)->run();
    return nullptr;
  }

  void run() {
    tlsPool = this;
    pthread_setname_np(pthread_self(), threadName_.c_str());
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
      if (!queue_.empty()) {
        Item item = queue_.front();
        queue_.pop_front();
        lock.unlock();
        item.fn(item.context);
        if (item.group) item.group->leave();
        if (tlsBlockingDepth != 0)
          WQ_FATAL("%s:%d: Error: a work item on %s returned inside workQueueBlockingBegin\n",
                   label.c_str());
        lock.lock();
        continue;
      }
      if (closing_) break;
      idle_++;
      auto workOrClosing = [this] { return !queue_.empty() || closing_; };
      if (threads_ > width_) {
        bool woken = workAvailable_.wait_for(lock, idleTimeout_, workOrClosing);
        idle_--;
        // Checked and counted down under the same lock, so that only the surplus exits.
        if (!woken && threads_ > width_) break;
      } else {
        workAvailable_.wait(lock, workOrClosing);
        idle_--;
      }
    }
    threads_--;
    bool last = closing_ && threads_ == 0;
    lock.unlock();
    tlsPool = nullptr;
    if (last) delete this;
  }

  // Starts one thread when queued items outnumber the idle threads that will take them and
  // fewer than width threads are running unblocked; never beyond the cap. Each caller (a
  // submission, a thread that starts blocking) adds at most one item or one blocked thread,
  // so one thread per call is enough.
  void startThreadIfNeededLocked() {
    if (static_cast<int64_t>(queue_.size()) <= idle_) return;
    if (threads_ - blocked_ >= width_ || threads_ >= cap_) return;
    int result = startThreadLocked();
    if (result == 0) return;
    // With no thread at all nothing queued would ever run; with some, the work waits for them.
    if (threads_ == 0)
      WQ_FATAL("%s:%d: Error: pthread_create failed for %s: %s\n", label.c_str(), strerror(result));
    if (!reportedStartFailure_) {
      reportedStartFailure_ = true;
      PLZC_ERR("%s:%d: Error: pthread_create failed for %s: %s\n", label.c_str(), strerror(result));
    }
  }

  // Counts and starts one more thread; 0, or the error of pthread_create (nothing counted).
  int startThreadLocked() {
    threads_++;
    peak_ = std::max(peak_, threads_);
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    if (kWorkerStackBytes) pthread_attr_setstacksize(&attributes, kWorkerStackBytes);
    pthread_t thread;
    int result = pthread_create(&thread, &attributes, threadMain, this);
    pthread_attr_destroy(&attributes);
    if (result != 0) threads_--;
    return result;
  }

  const std::string threadName_;
  const int32_t width_;
  const int32_t cap_;
  const std::chrono::milliseconds idleTimeout_;
  const bool global_;

  std::mutex mutex_;
  std::condition_variable workAvailable_;
  std::deque<Item> queue_;
  int32_t threads_ = 0;
  int32_t idle_ = 0;
  int32_t blocked_ = 0;
  int32_t peak_ = 0;
  int32_t externalRefs_ = 1;
  bool closing_ = false;
  bool reportedStartFailure_ = false;
};

// Items run one at a time in submission order. Whoever owns the queue runs its items: a drain
// item on the target pool, or a synchronous caller whose turn has come. The owner holds a
// reference; ownership passes from one to the next and ends when the queue is empty, so at
// most one item of the queue runs at any time.
class SerialQueue final : public WorkQueue {
 public:
  SerialQueue(const char *label, Pool *target) : WorkQueue(Kind::serial, label), target_(target) {}
  ~SerialQueue() override { target_->release(); }

  void release() {
    if (refs_.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
  }

  void async(const Item &item) {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      pushLocked(Entry{item, nullptr});
      if (owned_) return;
      owned_ = true;
      refs_.fetch_add(1, std::memory_order_relaxed);
    }
    target_->submit(Item{drainItem, this, nullptr});
  }

  void sync(void *context, WorkFunction fn) {
    for (const HeldQueue *held = tlsHeld; held; held = held->outer) {
      if (held->queue == this)
        WQ_FATAL(
            "%s:%d: Error: workQueueSync onto serial queue \"%s\" from an item running on "
            "it would deadlock\n",
            label.c_str());
    }
    Waiter waiter;
    std::unique_lock<std::mutex> lock(mutex_);
    if (!owned_) {
      // Idle: run at once on this thread, with no thread switch.
      owned_ = true;
      refs_.fetch_add(1, std::memory_order_relaxed);
      lock.unlock();
    } else {
      pushLocked(Entry{Item{}, &waiter});
      lock.unlock();
      workQueueBlockingBegin();
      waiter.wait();
      workQueueBlockingEnd();
    }
    {
      HeldScope held(this);
      fn(context);
    }
    lock.lock();
    if (entries_.empty()) {
      owned_ = false;
      lock.unlock();
      release();
      return;
    }
    Entry next = entries_.front();
    if (next.waiter) {
      entries_.pop_front();
      lock.unlock();
      next.waiter->wake();
      return;
    }
    lock.unlock();
    target_->submit(Item{drainItem, this, nullptr});
  }

 private:
  // A synchronous caller waiting for its turn; lives on that caller's stack.
  class Waiter {
   public:
    void wait() {
      std::unique_lock<std::mutex> lock(mutex_);
      turn_.wait(lock, [this] { return go_; });
    }
    // The waiter may return and free itself as soon as the mutex is released, so nothing of it
    // is touched after that.
    void wake() {
      std::lock_guard<std::mutex> lock(mutex_);
      go_ = true;
      turn_.notify_one();
    }

   private:
    std::mutex mutex_;
    std::condition_variable turn_;
    bool go_ = false;
  };

  struct Entry {
    Item item;
    Waiter *waiter;  // a synchronous caller instead of an item
  };

  void pushLocked(const Entry &entry) {
    try {
      entries_.push_back(entry);
    } catch (const std::bad_alloc &) {
      WQ_FATAL("%s:%d: Error: out of memory queuing work on %s\n", label.c_str());
    }
  }

  static void drainItem(void *queue) { static_cast<SerialQueue *>(queue)->drain(); }

  void drain() {
    HeldScope held(this);
    for (int ran = 0;; ran++) {
      std::unique_lock<std::mutex> lock(mutex_);
      if (entries_.empty()) {
        owned_ = false;
        lock.unlock();
        release();
        return;
      }
      if (ran == kDrainBatch) {
        // Give the thread back to the pool and continue behind what queued there meanwhile.
        lock.unlock();
        target_->submit(Item{drainItem, this, nullptr});
        return;
      }
      Entry entry = entries_.front();
      entries_.pop_front();
      lock.unlock();
      if (entry.waiter) {
        entry.waiter->wake();  // ownership passes to the synchronous caller
        return;
      }
      entry.item.fn(entry.item.context);
      if (entry.item.group) entry.item.group->leave();
    }
  }

  Pool *const target_;  // one external reference
  std::mutex mutex_;
  std::deque<Entry> entries_;  // never empty while not owned
  bool owned_ = false;
  std::atomic<int32_t> refs_{1};
};

struct GlobalPoolKind {
  WorkQueuePriority priority;
  const char *label;
  const char *threadName;  // at most 15 characters
};

constexpr GlobalPoolKind kGlobalPools[] = {
    {kWorkQueuePriorityHigh, "global-high", "plzc-wq-high"},
    {kWorkQueuePriorityDefault, "global-default", "plzc-wq-default"},
    {kWorkQueuePriorityLow, "global-low", "plzc-wq-low"},
    {kWorkQueuePriorityBackground, "global-background", "plzc-wq-bg"},
};
constexpr size_t kGlobalPoolCount = sizeof kGlobalPools / sizeof kGlobalPools[0];

// Created on first use and never freed: their threads park for the life of the process.
Pool *globalPools[kGlobalPoolCount];
std::once_flag globalPoolOnce[kGlobalPoolCount];

Pool *globalPool(size_t index) {
  std::call_once(globalPoolOnce[index], [index] {
    int32_t cores = static_cast<int32_t>(std::max(1u, std::thread::hardware_concurrency()));
    const GlobalPoolKind &kind = kGlobalPools[index];
    globalPools[index] = new (std::nothrow)
        Pool(kind.label, kind.threadName, cores, 4 * cores + 8, kGlobalIdleTimeoutMs, true);
    if (!globalPools[index]) WQ_FATAL("%s:%d: Error: out of memory creating %s\n", kind.label);
    globalPools[index]->startFirstThread();
  });
  return globalPools[index];
}

Pool *asPool(WorkQueue *queue) {
  return queue && queue->kind == WorkQueue::Kind::concurrent ? static_cast<Pool *>(queue) : nullptr;
}

void checkQueue(const WorkQueue *queue, const char *function) {
  if (!queue) WQ_FATAL("%s:%d: Error: %s called with a NULL work queue\n", function);
}

void submit(WorkQueue *queue, const Item &item) {
  if (Pool *pool = asPool(queue)) {
    pool->submit(item);
  } else {
    static_cast<SerialQueue *>(queue)->async(item);
  }
}

}  // namespace

WorkQueue *workQueueGetGlobal(WorkQueuePriority priority) {
  for (size_t i = 0; i < kGlobalPoolCount; i++) {
    if (kGlobalPools[i].priority == priority) return globalPool(i);
  }
  errno = EINVAL;
  return nullptr;
}

WorkQueue *workQueueCreateSerial(const char *label) {
  return workQueueCreateSerialWithTarget(label, workQueueGetGlobal(kWorkQueuePriorityDefault));
}

WorkQueue *workQueueCreateSerialWithTarget(const char *label, WorkQueue *target) {
  Pool *pool = asPool(target);
  if (!pool) {
    errno = EINVAL;
    return nullptr;
  }
  pool->retain();
  try {
    return new SerialQueue(label, pool);
  } catch (const std::bad_alloc &) {
    pool->release();
    errno = ENOMEM;
    return nullptr;
  }
}

WorkQueue *workQueueCreateConcurrent(const char *label, int32_t width, int32_t threadCap,
                                     uint32_t idleTimeoutMs) {
  if (width < 1 || threadCap < width || threadCap > kMaxThreadCap) {
    errno = EINVAL;
    return nullptr;
  }
  try {
    return new Pool(label, nullptr, width, threadCap, idleTimeoutMs, false);
  } catch (const std::bad_alloc &) {
    errno = ENOMEM;
    return nullptr;
  }
}

void workQueueRelease(WorkQueue *queue) {
  if (!queue) return;
  if (Pool *pool = asPool(queue)) {
    pool->release();
  } else {
    static_cast<SerialQueue *>(queue)->release();
  }
}

const char *workQueueGetLabel(const WorkQueue *queue) {
  checkQueue(queue, "workQueueGetLabel");
  return queue->label.c_str();
}

void workQueueAsync(WorkQueue *queue, void *context, WorkFunction fn) {
  checkQueue(queue, "workQueueAsync");
  submit(queue, Item{fn, context, nullptr});
}

void workQueueSync(WorkQueue *queue, void *context, WorkFunction fn) {
  checkQueue(queue, "workQueueSync");
  if (asPool(queue)) {
    fn(context);
  } else {
    static_cast<SerialQueue *>(queue)->sync(context, fn);
  }
}

WorkGroup *workGroupCreate(void) {
  WorkGroup *group = new (std::nothrow) WorkGroup;
  if (!group) errno = ENOMEM;
  return group;
}

void workGroupAsync(WorkGroup *group, WorkQueue *queue, void *context, WorkFunction fn) {
  if (!group) WQ_FATAL("%s:%d: Error: workGroupAsync called with a NULL group\n");
  checkQueue(queue, "workGroupAsync");
  group->enter();
  submit(queue, Item{fn, context, group});
}

int32_t workGroupWait(WorkGroup *group) {
  if (!group) WQ_FATAL("%s:%d: Error: workGroupWait called with a NULL group\n");
  {
    std::lock_guard<std::mutex> lock(group->mutex);
    if (group->pending == 0) return 0;
  }
  workQueueBlockingBegin();
  {
    std::unique_lock<std::mutex> lock(group->mutex);
    group->allDone.wait(lock, [group] { return group->pending == 0; });
  }
  workQueueBlockingEnd();
  return 0;
}

void workGroupRelease(WorkGroup *group) {
  if (group) group->release();
}

void workQueueBlockingBegin(void) {
  if (!tlsPool) return;
  if (tlsBlockingDepth++ == 0) tlsPool->blockingBegin();
}

void workQueueBlockingEnd(void) {
  if (!tlsPool) return;
  if (tlsBlockingDepth == 0)
    WQ_FATAL("%s:%d: Error: workQueueBlockingEnd without workQueueBlockingBegin\n");
  if (--tlsBlockingDepth == 0) tlsPool->blockingEnd();
}

int32_t workQueueGetStats(WorkQueue *queue, WorkQueueStats *stats) {
  Pool *pool = asPool(queue);
  if (!pool || !stats) {
    errno = EINVAL;
    return -1;
  }
  *stats = pool->stats();
  return 0;
}

int32_t workQueueCountPrivatePools(void) {
  return privatePoolCount.load(std::memory_order_relaxed);
}
