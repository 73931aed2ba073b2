#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <functional>
#include <mutex>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "Common/DataPool.h"
#include "Common/WorkQueue.h"

namespace {

using namespace std::chrono_literals;
using Function = std::function<void()>;

// Items as lambdas: the closure travels as the context and is freed after it runs.
void runAndDelete(void *context) {
  auto *fn = static_cast<Function *>(context);
  (*fn)();
  delete fn;
}
void asyncFn(WorkQueue *queue, Function fn) {
  workQueueAsync(queue, new Function(std::move(fn)), runAndDelete);
}
void groupAsyncFn(WorkGroup *group, WorkQueue *queue, Function fn) {
  workGroupAsync(group, queue, new Function(std::move(fn)), runAndDelete);
}
void syncFn(WorkQueue *queue, Function fn) {
  workQueueSync(queue, &fn, [](void *context) { (*static_cast<Function *>(context))(); });
}

// Opened once; waits are bounded so that a starved pool fails a test instead of hanging it.
class Gate {
 public:
  void open() {
    std::lock_guard<std::mutex> lock(mutex_);
    open_ = true;
    opened_.notify_all();
  }
  bool waitFor(std::chrono::milliseconds limit) {
    std::unique_lock<std::mutex> lock(mutex_);
    return opened_.wait_for(lock, limit, [this] { return open_; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable opened_;
  bool open_ = false;
};

// What a pool item does when it has to wait long: tell the pool, then wait.
bool blockedWait(Gate &gate, std::chrono::milliseconds limit) {
  workQueueBlockingBegin();
  bool opened = gate.waitFor(limit);
  workQueueBlockingEnd();
  return opened;
}

class Latch {
 public:
  explicit Latch(int count) : count_(count) {}
  void countDown() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (--count_ == 0) zero_.notify_all();
  }
  // Items still running reference the test's stack, so a latch that never reaches zero ends the
  // process (as a failure) rather than letting the test return under them.
  void waitOrDie(std::chrono::seconds limit, const char *what) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (zero_.wait_for(lock, limit, [this] { return count_ == 0; })) return;
    fprintf(stderr, "watchdog: %s did not finish within %lld s; the pool is starved\n", what,
            static_cast<long long>(limit.count()));
    fflush(stderr);
    _exit(1);
  }

 private:
  std::mutex mutex_;
  std::condition_variable zero_;
  int count_;
};

WorkQueueStats statsOf(WorkQueue *queue) {
  WorkQueueStats stats{};
  EXPECT_EQ(workQueueGetStats(queue, &stats), 0);
  return stats;
}

// Polls until the condition holds or the limit passes; returns the last answer.
bool eventually(const std::function<bool()> &condition, std::chrono::milliseconds limit) {
  auto deadline = std::chrono::steady_clock::now() + limit;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(5ms);
  }
  return true;
}

const WorkQueuePriority kPriorities[] = {kWorkQueuePriorityHigh, kWorkQueuePriorityDefault,
                                         kWorkQueuePriorityLow, kWorkQueuePriorityBackground};

TEST(WorkQueue, GlobalQueueIsOnePoolPerPriorityWithOneThreadPerCore) {
  int32_t cores = static_cast<int32_t>(std::max(1u, std::thread::hardware_concurrency()));
  std::set<WorkQueue *> distinct;
  for (WorkQueuePriority priority : kPriorities) {
    WorkQueue *queue = workQueueGetGlobal(priority);
    ASSERT_NE(queue, nullptr);
    workQueueRelease(queue);  // ignored for a global queue
    EXPECT_EQ(workQueueGetGlobal(priority), queue);
    distinct.insert(queue);
    WorkQueueStats stats = statsOf(queue);
    EXPECT_EQ(stats.width, cores);
    EXPECT_EQ(stats.threadCap, 4 * cores + 8);
  }
  EXPECT_EQ(distinct.size(), 4u);
  EXPECT_STREQ(workQueueGetLabel(workQueueGetGlobal(kWorkQueuePriorityHigh)), "global-high");

  errno = 0;
  EXPECT_EQ(workQueueGetGlobal(static_cast<WorkQueuePriority>(1)), nullptr);
  EXPECT_EQ(errno, EINVAL);

  // Work on the high pool runs on its named threads.
  char name[16] = {};
  WorkGroup *group = workGroupCreate();
  groupAsyncFn(group, workQueueGetGlobal(kWorkQueuePriorityHigh),
               [&] { pthread_getname_np(pthread_self(), name, sizeof name); });
  workGroupWait(group);
  workGroupRelease(group);
  EXPECT_STREQ(name, "plzc-wq-high");
}

TEST(WorkQueue, InvalidArgumentsAreRejected) {
  struct {
    int32_t width, cap;
  } bad[] = {{0, 4}, {-1, 4}, {4, 3}, {1, 4097}};
  for (const auto &c : bad) {
    errno = 0;
    EXPECT_EQ(workQueueCreateConcurrent("bad", c.width, c.cap, 10), nullptr)
        << c.width << "/" << c.cap;
    EXPECT_EQ(errno, EINVAL);
  }
  WorkQueue *serial = workQueueCreateSerial("io");
  ASSERT_NE(serial, nullptr);
  EXPECT_STREQ(workQueueGetLabel(serial), "io");
  errno = 0;
  EXPECT_EQ(workQueueCreateSerialWithTarget("nested", serial), nullptr);
  EXPECT_EQ(errno, EINVAL);
  WorkQueueStats stats;
  EXPECT_EQ(workQueueGetStats(serial, &stats), -1);
  workQueueRelease(serial);
  workQueueRelease(nullptr);
  workGroupRelease(nullptr);
}

TEST(WorkQueue, SerialQueueRunsItemsOneAtATimeInSubmissionOrder) {
  constexpr int kProducers = 4, kItemsEach = 2500;
  WorkQueue *queue = workQueueCreateSerial("ordered");
  std::atomic<int> running{0}, overlaps{0};
  // Plain data, touched only by the queue's items: the queue must order them (TSan checks).
  std::vector<int> lastSeen(kProducers, -1);
  int outOfOrder = 0, ran = 0;
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; p++) {
    producers.emplace_back([&, p] {
      for (int seq = 0; seq < kItemsEach; seq++) {
        asyncFn(queue, [&, p, seq] {
          if (running.fetch_add(1) != 0) overlaps++;
          if (lastSeen[p] + 1 != seq) outOfOrder++;
          lastSeen[p] = seq;
          ran++;
          running.fetch_sub(1);
        });
      }
    });
  }
  for (auto &producer : producers) producer.join();
  int ranBeforeSync = -1;
  syncFn(queue, [&] { ranBeforeSync = ran; });
  EXPECT_EQ(ranBeforeSync, kProducers * kItemsEach);
  EXPECT_EQ(overlaps.load(), 0);
  EXPECT_EQ(outOfOrder, 0);
  workQueueRelease(queue);
}

TEST(WorkQueue, SyncRunsAfterEverythingSubmittedBeforeIt) {
  WorkQueue *queue = workQueueCreateSerial("sync-order");
  std::vector<int> log;  // touched only on the queue
  int next = 0;
  for (int round = 0; round < 50; round++) {
    for (int i = 0; i < 20; i++) {
      int value = next++;
      asyncFn(queue, [&log, value, i] {
        if (i == 0) std::this_thread::sleep_for(200us);  // keeps the queue busy for the sync
        log.push_back(value);
      });
    }
    int value = next++;
    size_t seen = 0;
    syncFn(queue, [&] {
      seen = log.size();
      log.push_back(value);
    });
    EXPECT_EQ(seen, static_cast<size_t>(value)) << "round " << round;
  }
  syncFn(queue, [] {});
  std::vector<int> expected(next);
  for (int i = 0; i < next; i++) expected[i] = i;
  EXPECT_EQ(log, expected);
  workQueueRelease(queue);
}

TEST(WorkQueueGroup, WaitCoversItemsSpreadOverSeveralQueues) {
  WorkGroup *group = workGroupCreate();
  ASSERT_NE(group, nullptr);
  EXPECT_EQ(workGroupWait(group), 0);  // empty: returns at once

  WorkQueue *privatePool = workQueueCreateConcurrent("private", 2, 6, 50);
  std::vector<WorkQueue *> queues,
      owned = {workQueueCreateSerial("s1"), workQueueCreateSerial("s2"),
               workQueueCreateSerialWithTarget("s3", privatePool), privatePool};
  for (WorkQueuePriority priority : kPriorities) queues.push_back(workQueueGetGlobal(priority));
  queues.insert(queues.end(), owned.begin(), owned.end());

  constexpr int kItems = 4000;
  std::vector<int> slots(kItems + 100, 0);  // plain ints: the wait must publish them
  for (int i = 0; i < kItems; i++) {
    groupAsyncFn(group, queues[i % queues.size()], [&slots, i] {
      if (i % 200 == 0) std::this_thread::sleep_for(1ms);
      slots[i] = i + 1;
    });
  }
  EXPECT_EQ(workGroupWait(group), 0);
  int missing = 0;
  for (int i = 0; i < kItems; i++) missing += slots[i] != i + 1;
  EXPECT_EQ(missing, 0);

  // The group is used again, and waits only for what is in it.
  for (int i = kItems; i < kItems + 100; i++)
    groupAsyncFn(group, queues[i % queues.size()], [&slots, i] { slots[i] = i + 1; });
  workGroupWait(group);
  EXPECT_EQ(std::count(slots.begin(), slots.end(), 0), 0);
  workGroupRelease(group);
  for (WorkQueue *queue : owned) workQueueRelease(queue);
}

TEST(WorkQueueGroup, WaitFromAPoolItemDoesNotStarveTheItemsItWaitsFor) {
  WorkQueue *pool = workQueueCreateConcurrent("waiter", 1, 4, 50);
  Latch done(1);
  std::atomic<int> ran{0};
  asyncFn(pool, [&] {
    WorkGroup *inner = workGroupCreate();
    for (int i = 0; i < 3; i++) groupAsyncFn(inner, pool, [&] { ran++; });
    workGroupWait(inner);  // the only worker waits for items queued behind it
    workGroupRelease(inner);
    done.countDown();
  });
  done.waitOrDie(30s, "a group wait on a pool thread");
  EXPECT_EQ(ran.load(), 3);
  workQueueRelease(pool);
}

// Fills every worker with items that wait until an item queued behind them on the same pool
// runs. Returns how many gave up after `patience`.
int fillEveryWorkerThenRelease(WorkQueue *pool, int blockers, std::chrono::milliseconds patience) {
  Gate gate;
  Latch done(blockers + 1);
  std::atomic<int> gaveUp{0};
  for (int i = 0; i < blockers; i++) {
    asyncFn(pool, [&] {
      if (!blockedWait(gate, patience)) gaveUp++;
      done.countDown();
    });
  }
  asyncFn(pool, [&] {
    gate.open();
    done.countDown();
  });
  done.waitOrDie(std::chrono::duration_cast<std::chrono::seconds>(patience) + 30s,
                 "the blockers and their releaser");
  return gaveUp.load();
}

TEST(WorkQueue, PoolAddsThreadsWhileEveryWorkerIsBlocked) {
  struct {
    int32_t width, cap, blockers;
  } cases[] = {{1, 2, 1}, {2, 3, 2}, {2, 16, 15}, {3, 8, 7}};
  for (const auto &c : cases) {
    WorkQueue *pool = workQueueCreateConcurrent("starved", c.width, c.cap, 50);
    EXPECT_EQ(fillEveryWorkerThenRelease(pool, c.blockers, 30000ms), 0)
        << "width " << c.width << ", cap " << c.cap << ", blockers " << c.blockers;
    workQueueRelease(pool);
  }
}

TEST(WorkQueue, WithoutExtraThreadsTheSameWorkStarves) {
  // The scenario above really needs the extra threads: with the cap at the width, the releaser
  // gets a thread only once a blocker has waited out its patience.
  WorkQueue *pool = workQueueCreateConcurrent("capped", 2, 2, 50);
  EXPECT_GT(fillEveryWorkerThenRelease(pool, 2, 300ms), 0);
  workQueueRelease(pool);
}

TEST(WorkQueue, SyncFromEveryWorkerOntoABusySerialQueueOfTheSamePoolCompletes) {
  WorkQueue *pool = workQueueCreateConcurrent("sync-pool", 2, 8, 50);
  WorkQueue *serial = workQueueCreateSerialWithTarget("sync-target", pool);
  Gate gate;
  constexpr int kSyncers = 4;
  Latch done(kSyncers + 1);
  std::atomic<bool> gaveUp{false};
  int synced = 0;  // touched only on the serial queue
  // The serial queue is held by an item that waits for the last item of the pool; the pool's
  // workers meanwhile all wait in synchronous calls onto the serial queue.
  asyncFn(serial, [&] {
    if (!blockedWait(gate, 30000ms)) gaveUp = true;
  });
  for (int i = 0; i < kSyncers; i++) {
    asyncFn(pool, [&] {
      syncFn(serial, [&] { synced++; });
      done.countDown();
    });
  }
  asyncFn(pool, [&] {
    gate.open();
    done.countDown();
  });
  done.waitOrDie(60s, "synchronous calls from every worker");
  EXPECT_FALSE(gaveUp.load());
  int total = -1;
  syncFn(serial, [&] { total = synced; });
  EXPECT_EQ(total, kSyncers);
  workQueueRelease(serial);
  workQueueRelease(pool);
}

TEST(WorkQueue, ReadersBlockedInDataPoolsDoNotStarveTheirWriters) {
  WorkQueue *pool = workQueueCreateConcurrent("pools", 2, 8, 50);
  constexpr int kPools = 3;
  constexpr int64_t kSize = 256 * 1024;
  std::vector<DataPool *> pools;
  std::vector<uint8_t> source(kSize);
  for (int64_t i = 0; i < kSize; i++) source[i] = static_cast<uint8_t>(i * 7 + i / 251);
  for (int i = 0; i < kPools; i++) {
    pools.push_back(newDataPool(kSize));
    ASSERT_NE(pools.back(), nullptr);
  }
  Latch done(2 * kPools);
  std::atomic<int> intact{0};
  // The readers go first and take every worker; their writers are queued behind them.
  for (DataPool *dataPool : pools) {
    asyncFn(pool, [&, dataPool] {
      std::vector<uint8_t> read(kSize);
      workQueueBlockingBegin();
      int64_t got = getDataFromPool(dataPool, read.data(), kSize);
      workQueueBlockingEnd();
      if (got == kSize && read == source) intact++;
      done.countDown();
    });
  }
  for (DataPool *dataPool : pools) {
    asyncFn(pool, [&, dataPool] {
      for (int64_t at = 0; at < kSize; at += 10000)
        addDataToPool(dataPool, source.data() + at, std::min<int64_t>(10000, kSize - at));
      finishDataPool(dataPool);
      done.countDown();
    });
  }
  done.waitOrDie(60s, "data-pool readers and writers on one pool");
  EXPECT_EQ(intact.load(), kPools);
  for (DataPool *dataPool : pools) releaseDataPool(dataPool);
  workQueueRelease(pool);
}

TEST(WorkQueue, ThreadCountNeverExceedsTheCap) {
  WorkQueue *pool = workQueueCreateConcurrent("capped", 2, 5, 50);
  constexpr int kBlockers = 12;
  Gate gate;
  Latch done(kBlockers);
  std::atomic<int> running{0}, mostRunning{0};
  for (int i = 0; i < kBlockers; i++) {
    asyncFn(pool, [&] {
      int now = ++running;
      int seen = mostRunning.load();
      while (now > seen && !mostRunning.compare_exchange_weak(seen, now)) {
      }
      blockedWait(gate, 30000ms);
      running--;
      done.countDown();
    });
  }
  EXPECT_TRUE(eventually([&] { return statsOf(pool).blocked == 5; }, 10000ms));
  std::this_thread::sleep_for(100ms);  // room for a sixth thread, if the cap were ignored
  WorkQueueStats stats = statsOf(pool);
  EXPECT_EQ(stats.threads, 5);
  EXPECT_EQ(stats.blocked, 5);
  EXPECT_EQ(stats.queued, kBlockers - 5);
  EXPECT_EQ(mostRunning.load(), 5);
  gate.open();
  done.waitOrDie(30s, "the capped blockers");
  EXPECT_EQ(statsOf(pool).peakThreads, 5);
  EXPECT_EQ(mostRunning.load(), 5);
  workQueueRelease(pool);
}

TEST(WorkQueue, ExtraThreadsExitAfterBeingIdle) {
  WorkQueue *pool = workQueueCreateConcurrent("shrinking", 1, 4, 50);
  EXPECT_EQ(fillEveryWorkerThenRelease(pool, 3, 30000ms), 0);
  EXPECT_EQ(statsOf(pool).peakThreads, 4);
  EXPECT_TRUE(eventually([&] { return statsOf(pool).threads == 1; }, 5000ms));
  std::this_thread::sleep_for(200ms);  // the width's own thread stays
  WorkQueueStats stats = statsOf(pool);
  EXPECT_EQ(stats.threads, 1);
  EXPECT_EQ(stats.idle, 1);
  workQueueRelease(pool);
}

TEST(WorkQueue, NestedSyncChainsFromManyThreadsRunOnTheCallingThread) {
  // Chains always go a -> b -> c -> d, so they cannot wait on each other in a cycle; the queues
  // also take asynchronous items, so that the synchronous calls often have to wait their turn
  // (and then still run on the thread that called).
  WorkQueue *pool = workQueueCreateConcurrent("chains", 2, 32, 50);
  std::vector<WorkQueue *> chain;
  for (const char *label : {"a", "b", "c", "d"})
    chain.push_back(workQueueCreateSerialWithTarget(label, pool));
  std::vector<int> counts(chain.size(), 0);  // counts[i] touched only on chain[i]
  std::atomic<int> ranElsewhere{0};
  std::function<void(size_t, std::thread::id)> enter = [&](size_t depth, std::thread::id caller) {
    syncFn(chain[depth], [&, depth, caller] {
      counts[depth]++;
      if (std::this_thread::get_id() != caller) ranElsewhere++;
      if (depth + 1 < chain.size()) enter(depth + 1, caller);
    });
  };
  constexpr int kRunners = 8, kRounds = 150;
  Latch done(kRunners);
  std::vector<std::thread> threads;
  for (int r = 0; r < kRunners; r++) {
    auto runner = [&] {
      for (int i = 0; i < kRounds; i++) enter(0, std::this_thread::get_id());
      done.countDown();
    };
    if (r % 2) {
      threads.emplace_back(runner);
    } else {
      asyncFn(pool, runner);  // half of them hold pool threads while they wait
    }
  }
  for (int i = 0; i < kRounds; i++) {
    for (size_t q = 1; q < chain.size(); q++) asyncFn(chain[q], [&counts, q] { counts[q]++; });
  }
  done.waitOrDie(120s, "the sync chains");
  for (auto &thread : threads) thread.join();
  for (size_t q = 0; q < chain.size(); q++) {
    int seen = -1;
    syncFn(chain[q], [&] { seen = counts[q]; });
    EXPECT_EQ(seen, kRunners * kRounds + (q ? kRounds : 0)) << "queue " << q;
    workQueueRelease(chain[q]);
  }
  EXPECT_EQ(ranElsewhere.load(), 0);
  workQueueRelease(pool);
}

TEST(WorkQueueDeathTest, SyncOntoTheSerialQueueRunningTheCallerAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  // Each child arms an alarm, so that a deadlock that is no longer detected fails the test (the
  // child dies without the message) instead of hanging it.
  const char *message =
      "workQueueSync onto serial queue \"outer\" from an item running on it would deadlock";
  EXPECT_DEATH(
      {
        alarm(20);
        WorkQueue *outer = workQueueCreateSerial("outer");
        syncFn(outer, [outer] { syncFn(outer, [] {}); });
      },
      message);
  EXPECT_DEATH(
      {
        alarm(20);
        WorkQueue *outer = workQueueCreateSerial("outer");
        WorkQueue *inner = workQueueCreateSerial("inner");
        syncFn(outer, [=] { syncFn(inner, [=] { syncFn(outer, [] {}); }); });
      },
      message);
  EXPECT_DEATH(
      {
        alarm(20);
        WorkQueue *outer = workQueueCreateSerial("outer");
        WorkGroup *group = workGroupCreate();
        groupAsyncFn(group, outer, [outer] { syncFn(outer, [] {}); });
        workGroupWait(group);
      },
      message);
}

TEST(WorkQueue, StressThousandsOfItemsOverPoolsSerialQueuesAndGroups) {
  constexpr int kProducers = 4, kItemsEach = 6000, kSerial = 6;
  std::vector<WorkQueue *> serials;
  for (int q = 0; q < kSerial; q++)
    serials.push_back(workQueueCreateSerial(("stress-" + std::to_string(q)).c_str()));
  // lastSeen[q][p] and perQueue[q]: touched only on serials[q].
  std::vector<std::vector<int>> lastSeen(kSerial, std::vector<int>(kProducers, -1));
  std::vector<int> perQueue(kSerial, 0);
  std::atomic<int> outOfOrder{0}, onPools{0};
  WorkGroup *group = workGroupCreate();
  std::vector<std::thread> producers;
  std::atomic<int> expectedOnSerials{0};
  for (int p = 0; p < kProducers; p++) {
    producers.emplace_back([&, p] {
      std::mt19937 random(p + 1);
      std::vector<int> nextSeq(kSerial, 0);
      for (int i = 0; i < kItemsEach; i++) {
        int q = static_cast<int>(random() % kSerial);
        switch (random() % 4) {
          case 0: {  // pool item
            groupAsyncFn(group, workQueueGetGlobal(kPriorities[random() % 4]), [&] { onPools++; });
            break;
          }
          case 1: {  // pool item that syncs onto a serial queue
            expectedOnSerials++;
            groupAsyncFn(group, workQueueGetGlobal(kWorkQueuePriorityHigh),
                         [&, q] { syncFn(serials[q], [&, q] { perQueue[q]++; }); });
            break;
          }
          default: {  // ordered item on a serial queue
            expectedOnSerials++;
            int seq = nextSeq[q]++;
            groupAsyncFn(group, serials[q], [&, p, q, seq] {
              if (lastSeen[q][p] + 1 != seq) outOfOrder++;
              lastSeen[q][p] = seq;
              perQueue[q]++;
            });
          }
        }
      }
    });
  }
  for (auto &producer : producers) producer.join();
  workGroupWait(group);
  workGroupRelease(group);
  for (WorkQueue *serial : serials) workQueueRelease(serial);
  int onSerials = 0;
  for (int count : perQueue) onSerials += count;
  EXPECT_EQ(onSerials, expectedOnSerials.load());
  EXPECT_EQ(onSerials + onPools.load(), kProducers * kItemsEach);
  EXPECT_EQ(outOfOrder.load(), 0);
}

TEST(WorkQueue, ReleasedPrivatePoolRunsWhatIsQueuedThenGoesAway) {
  int32_t poolsBefore = workQueueCountPrivatePools();
  WorkQueue *pool = workQueueCreateConcurrent("released", 2, 4, 50);
  WorkQueue *serial = workQueueCreateSerialWithTarget("released-serial", pool);
  WorkGroup *group = workGroupCreate();
  std::atomic<int> ran{0};
  for (int i = 0; i < 200; i++) {
    groupAsyncFn(group, i % 2 ? pool : serial, [&] {
      std::this_thread::sleep_for(50us);
      ran++;
    });
  }
  workQueueRelease(serial);
  workQueueRelease(pool);
  EXPECT_EQ(workQueueCountPrivatePools(), poolsBefore + 1);  // still has work
  workGroupWait(group);
  workGroupRelease(group);
  EXPECT_EQ(ran.load(), 200);
  EXPECT_TRUE(eventually([&] { return workQueueCountPrivatePools() == poolsBefore; }, 5000ms));
}

// A global pool starts its first thread when it is created: one that had none later and could not
// make one (no memory left for a stack) could never run what is queued on it.
TEST(WorkQueue, GlobalPoolsHaveAThreadFromTheStart) {
  for (WorkQueuePriority priority : {kWorkQueuePriorityLow, kWorkQueuePriorityBackground}) {
    WorkQueueStats stats{};
    ASSERT_EQ(workQueueGetStats(workQueueGetGlobal(priority), &stats), 0);
    EXPECT_GE(stats.threads, 1) << priority;
  }
}

}  // namespace
