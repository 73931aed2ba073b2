// Background mode for one thread: idle-class disk I/O, the lowest CPU priority, and cache
// pages of what it wrote dropped once written, so that background work disturbs the
// foreground little. Everything changed is saved and restored exactly.
#pragma once

namespace platform {

struct ThreadPriority {
  int ioPriority = -1;  // the thread's I/O priority as ioprio_get gave it; -1 when unknown
  int nice = 0;
  bool niceChanged = false;
};

// Puts the calling thread in background mode and returns what it had before. Its CPU priority
// is lowered only when it can be raised back afterwards (root, or RLIMIT_NICE allows it).
ThreadPriority throttleThread();

// Restores the calling thread's I/O and CPU priority from saved.
void unthrottleThread(const ThreadPriority &saved);

// Writes back and drops from the page cache what the descriptor's file holds.
void ageCachedPages(int fd);

// The calling thread's current I/O priority and nice value (tests).
int threadIoPriority();
int threadNice();

}  // namespace platform
