#include "Platform/Syscalls.h"

#include <fcntl.h>
#include <sys/statfs.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace sys {
namespace {

constexpr int kCallCount = static_cast<int>(Call::Count);

struct FaultSlot {
  std::atomic<uint64_t> calls{0};
  // The call number (counted in `calls`) that fails first; 0 when nothing is armed.
  std::atomic<uint64_t> failAt{0};
  std::atomic<int> error{0};
  std::atomic<bool> sticky{false};
};

FaultSlot gSlots[kCallCount];

// Counts the call and returns true when it must fail (errno is then set).
bool injected(Call call) {
  FaultSlot &slot = gSlots[static_cast<int>(call)];
  uint64_t number = slot.calls.fetch_add(1, std::memory_order_relaxed) + 1;
  uint64_t failAt = slot.failAt.load(std::memory_order_acquire);
  if (failAt == 0 || number < failAt) return false;
  if (number != failAt && !slot.sticky.load(std::memory_order_relaxed)) return false;
  errno = slot.error.load(std::memory_order_relaxed);
  return true;
}

}  // namespace

void armFault(Call call, uint64_t nth, int error, bool sticky) {
  FaultSlot &slot = gSlots[static_cast<int>(call)];
  slot.error.store(error, std::memory_order_relaxed);
  slot.sticky.store(sticky, std::memory_order_relaxed);
  slot.failAt.store(slot.calls.load(std::memory_order_relaxed) + nth, std::memory_order_release);
}

void clearFaults() {
  for (FaultSlot &slot : gSlots) slot.failAt.store(0, std::memory_order_release);
}

uint64_t callCount(Call call) {
  return gSlots[static_cast<int>(call)].calls.load(std::memory_order_relaxed);
}

#define PLZC_WRAP(call, failResult, expression) \
  do {                                          \
    if (injected(Call::call)) return failResult; \
    return expression;                          \
  } while (0)

int open(const char *path, int flags, mode_t mode) { PLZC_WRAP(Open, -1, ::open(path, flags, mode)); }
int close(int fd) { PLZC_WRAP(Close, -1, ::close(fd)); }
ssize_t read(int fd, void *buffer, size_t count) { PLZC_WRAP(Read, -1, ::read(fd, buffer, count)); }
ssize_t write(int fd, const void *buffer, size_t count) { PLZC_WRAP(Write, -1, ::write(fd, buffer, count)); }
ssize_t pread(int fd, void *buffer, size_t count, off_t offset) {
  PLZC_WRAP(Pread, -1, ::pread(fd, buffer, count, offset));
}
ssize_t pwrite(int fd, const void *buffer, size_t count, off_t offset) {
  PLZC_WRAP(Pwrite, -1, ::pwrite(fd, buffer, count, offset));
}
int ftruncate(int fd, off_t length) { PLZC_WRAP(Ftruncate, -1, ::ftruncate(fd, length)); }
int truncate(const char *path, off_t length) { PLZC_WRAP(Truncate, -1, ::truncate(path, length)); }
int fsync(int fd) { PLZC_WRAP(Fsync, -1, ::fsync(fd)); }
int stat(const char *path, struct ::stat *st) { PLZC_WRAP(Stat, -1, ::stat(path, st)); }
int lstat(const char *path, struct ::stat *st) { PLZC_WRAP(Lstat, -1, ::lstat(path, st)); }
int fstat(int fd, struct ::stat *st) { PLZC_WRAP(Fstat, -1, ::fstat(fd, st)); }
int statfs(const char *path, struct ::statfs *st) { PLZC_WRAP(Statfs, -1, ::statfs(path, st)); }
int fstatfs(int fd, struct ::statfs *st) { PLZC_WRAP(Fstatfs, -1, ::fstatfs(fd, st)); }

ssize_t getxattr(const char *path, const char *name, void *value, size_t size) {
  PLZC_WRAP(Getxattr, -1, ::getxattr(path, name, value, size));
}
ssize_t lgetxattr(const char *path, const char *name, void *value, size_t size) {
  PLZC_WRAP(Lgetxattr, -1, ::lgetxattr(path, name, value, size));
}
ssize_t fgetxattr(int fd, const char *name, void *value, size_t size) {
  PLZC_WRAP(Fgetxattr, -1, ::fgetxattr(fd, name, value, size));
}
int setxattr(const char *path, const char *name, const void *value, size_t size, int flags) {
  PLZC_WRAP(Setxattr, -1, ::setxattr(path, name, value, size, flags));
}
int lsetxattr(const char *path, const char *name, const void *value, size_t size, int flags) {
  PLZC_WRAP(Lsetxattr, -1, ::lsetxattr(path, name, value, size, flags));
}
int fsetxattr(int fd, const char *name, const void *value, size_t size, int flags) {
  PLZC_WRAP(Fsetxattr, -1, ::fsetxattr(fd, name, value, size, flags));
}
int removexattr(const char *path, const char *name) { PLZC_WRAP(Removexattr, -1, ::removexattr(path, name)); }
int lremovexattr(const char *path, const char *name) { PLZC_WRAP(Lremovexattr, -1, ::lremovexattr(path, name)); }
int fremovexattr(int fd, const char *name) { PLZC_WRAP(Fremovexattr, -1, ::fremovexattr(fd, name)); }
ssize_t listxattr(const char *path, char *list, size_t size) {
  PLZC_WRAP(Listxattr, -1, ::listxattr(path, list, size));
}
ssize_t llistxattr(const char *path, char *list, size_t size) {
  PLZC_WRAP(Llistxattr, -1, ::llistxattr(path, list, size));
}
ssize_t flistxattr(int fd, char *list, size_t size) { PLZC_WRAP(Flistxattr, -1, ::flistxattr(fd, list, size)); }

int futimes(int fd, const struct timeval times[2]) { PLZC_WRAP(Futimes, -1, ::futimes(fd, times)); }
int rename(const char *from, const char *to) { PLZC_WRAP(Rename, -1, ::rename(from, to)); }
int mkdir(const char *path, mode_t mode) { PLZC_WRAP(Mkdir, -1, ::mkdir(path, mode)); }
char *realpath(const char *path, char *resolved) { PLZC_WRAP(Realpath, nullptr, ::realpath(path, resolved)); }
void *malloc(size_t size) { PLZC_WRAP(Malloc, nullptr, ::malloc(size)); }
void *calloc(size_t count, size_t size) { PLZC_WRAP(Calloc, nullptr, ::calloc(count, size)); }
int dup(int fd) { PLZC_WRAP(Dup, -1, ::dup(fd)); }
off_t lseek(int fd, off_t offset, int whence) { PLZC_WRAP(Lseek, -1, ::lseek(fd, offset, whence)); }
int chmod(const char *path, mode_t mode) { PLZC_WRAP(Chmod, -1, ::chmod(path, mode)); }
int utimes(const char *path, const struct timeval times[2]) { PLZC_WRAP(Utimes, -1, ::utimes(path, times)); }

#undef PLZC_WRAP

}  // namespace sys
