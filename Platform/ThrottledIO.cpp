#include "Platform/ThrottledIO.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

namespace platform {

namespace {

constexpr int kIoprioWhoProcess = 1;  // with id 0: the calling thread
constexpr int kIoprioClassShift = 13;
constexpr int kIoprioClassIdle = 3;
constexpr int kBackgroundNice = 19;

pid_t threadId() { return static_cast<pid_t>(syscall(SYS_gettid)); }

// The lowest nice value this thread may set again after raising it.
int lowestReachableNice() {
  if (geteuid() == 0) return -20;
  struct rlimit limit;
  if (getrlimit(RLIMIT_NICE, &limit) != 0) return 20;
  return 20 - static_cast<int>(limit.rlim_cur);
}

}  // namespace

int threadIoPriority() { return static_cast<int>(syscall(SYS_ioprio_get, kIoprioWhoProcess, 0)); }

int threadNice() {
  errno = 0;
  return getpriority(PRIO_PROCESS, static_cast<id_t>(threadId()));
}

ThreadPriority throttleThread() {
  ThreadPriority saved;
  saved.ioPriority = threadIoPriority();
  errno = 0;
  int nice = getpriority(PRIO_PROCESS, static_cast<id_t>(threadId()));
  if (!(nice == -1 && errno != 0)) {
    saved.nice = nice;
    if (nice < kBackgroundNice && nice >= lowestReachableNice() &&
        setpriority(PRIO_PROCESS, static_cast<id_t>(threadId()), kBackgroundNice) == 0)
      saved.niceChanged = true;
  }
  if (saved.ioPriority >= 0)
    syscall(SYS_ioprio_set, kIoprioWhoProcess, 0, kIoprioClassIdle << kIoprioClassShift);
  return saved;
}

void unthrottleThread(const ThreadPriority &saved) {
  if (saved.ioPriority >= 0) syscall(SYS_ioprio_set, kIoprioWhoProcess, 0, saved.ioPriority);
  if (saved.niceChanged) setpriority(PRIO_PROCESS, static_cast<id_t>(threadId()), saved.nice);
}

void ageCachedPages(int fd) {
  // Dirty pages are not dropped: start their write-back and wait for it first.
  sync_file_range(fd, 0, 0, SYNC_FILE_RANGE_WAIT_BEFORE | SYNC_FILE_RANGE_WRITE | SYNC_FILE_RANGE_WAIT_AFTER);
  posix_fadvise(fd, 0, 0, POSIX_FADV_DONTNEED);
}

}  // namespace platform
