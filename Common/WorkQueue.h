// Work queues: where the pipeline's work runs.
//
// A concurrent queue is a pool of worker threads that runs its items in any order, many at
// once. There is one global pool per priority, one thread per core, created on first use and
// never torn down; private pools exist for tests. A serial queue runs its items one at a time,
// in submission order, on the threads of its target pool: one pool item at a time drains it.
// A group counts items submitted through it and can be waited on until all have run.
//
// Pool threads that block do not starve the pool. Code that is about to wait for a long time
// on a pool thread (a data-pool wait, say) announces it with workQueueBlockingBegin and
// workQueueBlockingEnd; workQueueSync and workGroupWait announce their own waits. While fewer
// of a pool's threads than its width are running (not blocked) and work is queued with no idle
// thread to take it, the pool starts another thread, up to a hard cap (4 x cores + 8 for the
// global pools). Threads beyond the width exit after being idle for a while.
//
// Every function is thread-safe. Passing NULL where a queue or group is required, or
// submitting to a queue after its last reference was released, is a programming error.
#pragma once

#include <stdint.h>

typedef struct WorkQueue WorkQueue;
typedef struct WorkGroup WorkGroup;

// A work item: called once with the context it was submitted with.
typedef void (*WorkFunction)(void *context);

typedef enum WorkQueuePriority {
  kWorkQueuePriorityHigh = 2,
  kWorkQueuePriorityDefault = 0,
  kWorkQueuePriorityLow = -2,
  kWorkQueuePriorityBackground = -32768,
} WorkQueuePriority;

// The process's global concurrent queue for the priority, created on first use. NULL with
// errno EINVAL for a value that is not one of WorkQueuePriority. Not owned by the caller;
// workQueueRelease on it does nothing.
WorkQueue *workQueueGetGlobal(WorkQueuePriority priority);

// A new serial queue whose items run on the global pool of default priority. label (copied;
// NULL gives "") names it in diagnostics. The caller owns one reference. NULL with errno
// ENOMEM when out of memory.
WorkQueue *workQueueCreateSerial(const char *label);

// The same, with items running on target, a concurrent queue (global or private), which the
// serial queue keeps a reference on. NULL with errno EINVAL when target is not concurrent.
WorkQueue *workQueueCreateSerialWithTarget(const char *label, WorkQueue *target);

// A private concurrent pool of width threads that may grow to threadCap threads while some
// are blocked; threads beyond width exit after idleTimeoutMs without work. threadCap equal to
// width turns the extra threads off. The caller owns one reference; once every reference is
// gone, the pool runs what is queued, then its threads exit and it is freed. NULL with errno
// EINVAL when width < 1, threadCap < width or threadCap > 4096; ENOMEM when out of memory.
WorkQueue *workQueueCreateConcurrent(const char *label, int32_t width, int32_t threadCap,
                                     uint32_t idleTimeoutMs);

// Gives back the caller's reference; items already submitted still run. NULL and the global
// queues are ignored.
void workQueueRelease(WorkQueue *queue);

// The label given at creation ("global-high" and so on for the global queues). Valid as long
// as the queue.
const char *workQueueGetLabel(const WorkQueue *queue);

// Submits fn(context) to run later on the queue; returns at once.
void workQueueAsync(WorkQueue *queue, void *context, WorkFunction fn);

// Runs fn(context) on the queue and returns when it has run. On a serial queue it runs after
// every item submitted before it and before any submitted after it (on the calling thread,
// once the queue reaches it). On a concurrent queue it runs at once on the calling thread.
// Calling it, directly or through a chain of synchronous calls, from an item running on the
// same serial queue would deadlock: the process is aborted with a message naming the queue.
void workQueueSync(WorkQueue *queue, void *context, WorkFunction fn);

// A new group with nothing in it. The caller owns one reference. NULL with errno ENOMEM.
WorkGroup *workGroupCreate(void);

// Like workQueueAsync, with the item counted in the group until it has run.
void workGroupAsync(WorkGroup *group, WorkQueue *queue, void *context, WorkFunction fn);

// Waits, without a time limit, until every item submitted through the group has run; the
// items' effects are then visible to the caller. Returns 0. The group can be used again.
int32_t workGroupWait(WorkGroup *group);

// Gives back the caller's reference; items still in the group keep it alive. NULL is ignored.
void workGroupRelease(WorkGroup *group);

// Bracket a wait that may last long on a pool thread, so that the pool can start a thread to
// keep its work moving. Pairs nest; only the outermost counts. On other threads they do
// nothing. workQueueBlockingEnd without a matching begin aborts the process.
void workQueueBlockingBegin(void);
void workQueueBlockingEnd(void);

// The state of a concurrent queue's pool, for tests and diagnostics.
typedef struct WorkQueueStats {
  int32_t width;        // threads kept while work comes (cores for the global pools)
  int32_t threadCap;    // threads never exceed this
  int32_t threads;      // live threads, including those starting up
  int32_t idle;         // threads waiting for work
  int32_t blocked;      // threads inside a blocking announcement
  int32_t peakThreads;  // the most live threads so far
  int64_t queued;       // items waiting for a thread
} WorkQueueStats;

// Fills stats for a concurrent queue: 0, or -1 with errno EINVAL for a serial queue or NULL.
int32_t workQueueGetStats(WorkQueue *queue, WorkQueueStats *stats);

// Private pools not freed yet, for tests: a released pool is freed once its last thread exits.
int32_t workQueueCountPrivatePools(void);
