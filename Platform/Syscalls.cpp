#include "Platform/Syscalls.h"

#include <fcntl.h>
#include <sys/sendfile.h>
#include <sys/statfs.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

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

bool callSucceeds(Call call) { return !injected(call); }

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

// Like PLZC_WRAP, restarting the call (injected failures included) while it fails with EINTR.
#define PLZC_WRAP_RESTARTING(call, expression)          \
  do {                                                   \
    for (;;) {                                           \
      auto result = injected(Call::call) ? -1 : (expression); \
      if (result != -1 || errno != EINTR) return result; \
    }                                                    \
  } while (0)

int open(const char *path, int flags, mode_t mode) { PLZC_WRAP_RESTARTING(Open, ::open(path, flags, mode)); }
int close(int fd) {
  if (injected(Call::Close)) {
    int error = errno;
    ::close(fd);
    errno = error;
    return -1;
  }
  return ::close(fd);
}
ssize_t read(int fd, void *buffer, size_t count) { PLZC_WRAP_RESTARTING(Read, ::read(fd, buffer, count)); }
ssize_t write(int fd, const void *buffer, size_t count) { PLZC_WRAP_RESTARTING(Write, ::write(fd, buffer, count)); }
ssize_t pread(int fd, void *buffer, size_t count, off_t offset) {
  PLZC_WRAP_RESTARTING(Pread, ::pread(fd, buffer, count, offset));
}
ssize_t pwrite(int fd, const void *buffer, size_t count, off_t offset) {
  PLZC_WRAP_RESTARTING(Pwrite, ::pwrite(fd, buffer, count, offset));
}
int ftruncate(int fd, off_t length) { PLZC_WRAP_RESTARTING(Ftruncate, ::ftruncate(fd, length)); }
int truncate(const char *path, off_t length) { PLZC_WRAP_RESTARTING(Truncate, ::truncate(path, length)); }
int fsync(int fd) { PLZC_WRAP_RESTARTING(Fsync, ::fsync(fd)); }
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
int futimens(int fd, const struct timespec times[2]) { PLZC_WRAP(Futimes, -1, ::futimens(fd, times)); }
int rename(const char *from, const char *to) { PLZC_WRAP(Rename, -1, ::rename(from, to)); }
int mkdir(const char *path, mode_t mode) { PLZC_WRAP(Mkdir, -1, ::mkdir(path, mode)); }
char *realpath(const char *path, char *resolved) { PLZC_WRAP(Realpath, nullptr, ::realpath(path, resolved)); }
void *malloc(size_t size) { PLZC_WRAP(Malloc, nullptr, ::malloc(size)); }
void *realloc(void *block, size_t size) { PLZC_WRAP(Malloc, nullptr, ::realloc(block, size)); }
char *strdup(const char *text) { PLZC_WRAP(Malloc, nullptr, ::strdup(text)); }
void *calloc(size_t count, size_t size) { PLZC_WRAP(Calloc, nullptr, ::calloc(count, size)); }
ssize_t sendfile(int out, int in, size_t count) { PLZC_WRAP_RESTARTING(Sendfile, ::sendfile(out, in, nullptr, count)); }
int dup(int fd) { PLZC_WRAP(Dup, -1, ::dup(fd)); }
off_t lseek(int fd, off_t offset, int whence) { PLZC_WRAP(Lseek, -1, ::lseek(fd, offset, whence)); }
int chmod(const char *path, mode_t mode) { PLZC_WRAP(Chmod, -1, ::chmod(path, mode)); }
int fchmod(int fd, mode_t mode) { PLZC_WRAP(Chmod, -1, ::fchmod(fd, mode)); }
int utimes(const char *path, const struct timeval times[2]) { PLZC_WRAP(Utimes, -1, ::utimes(path, times)); }

#undef PLZC_WRAP
#undef PLZC_WRAP_RESTARTING

namespace {

// Writes through one call (write, or pwrite at an offset that moves along) until done.
template <typename WriteCall>
ssize_t writeEvery(const void *buffer, size_t count, WriteCall call) {
  const char *at = static_cast<const char *>(buffer);
  size_t done = 0;
  while (done < count) {
    ssize_t wrote = call(at + done, count - done, done);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote < 0) return -1;
    if (wrote == 0) {
      errno = ENOSPC;
      return -1;
    }
    done += static_cast<size_t>(wrote);
  }
  return static_cast<ssize_t>(count);
}

}  // namespace

ssize_t writeAll(int fd, const void *buffer, size_t count) {
  return writeEvery(buffer, count, [fd](const void *bytes, size_t left, size_t) { return write(fd, bytes, left); });
}

ssize_t pwriteAll(int fd, const void *buffer, size_t count, off_t offset) {
  return writeEvery(buffer, count, [fd, offset](const void *bytes, size_t left, size_t done) {
    return pwrite(fd, bytes, left, offset + static_cast<off_t>(done));
  });
}

}  // namespace sys
