// The system calls the library makes, behind one table of wrappers.
//
// Every open, read, write, attribute call and so on of the library goes through the functions
// of namespace `sys`, never straight to the C library. Each wrapper counts its calls and can be
// told to fail: tests arm a fault ("the 3rd pwrite fails with ENOSPC") and every error path of
// the library can then be driven on a real file system, without mocks of whole components.
//
// Two Linux rules are kept here, once for the whole library:
// - open, read, write, pread, pwrite, sendfile, truncate and ftruncate are restarted when a signal
//   interrupts them (EINTR) before they transferred anything. Regular files on local file
//   systems never do that, but the paths the library is given may name FIFOs or devices, and
//   standard output may be a pipe. An injected EINTR is restarted the same way (the restart is
//   a call of its own), so it must never be armed sticky.
// - close is never restarted: Linux releases the descriptor whatever close returns. An
//   injected close failure releases it too, as the kernel would.
#pragma once

#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/types.h>
#include <sys/time.h>

#include <cstddef>
#include <cstdint>

namespace sys {

// One entry per wrapped call; used to arm faults and to read call counts.
enum class Call : int {
  Open, Close, Read, Write, Pread, Pwrite, Ftruncate, Truncate, Fsync,
  Stat, Lstat, Fstat, Statfs, Fstatfs,
  Getxattr, Lgetxattr, Fgetxattr, Setxattr, Lsetxattr, Fsetxattr,
  Removexattr, Lremovexattr, Fremovexattr, Listxattr, Llistxattr, Flistxattr,
  Futimes, Rename, Mkdir, Realpath, Malloc, Calloc, Dup, Lseek, Chmod, Utimes, Sendfile,
  Count
};

int open(const char *path, int flags, mode_t mode);
int close(int fd);
ssize_t read(int fd, void *buffer, size_t count);
ssize_t write(int fd, const void *buffer, size_t count);
ssize_t pread(int fd, void *buffer, size_t count, off_t offset);
ssize_t pwrite(int fd, const void *buffer, size_t count, off_t offset);
int ftruncate(int fd, off_t length);
int truncate(const char *path, off_t length);
// Makes the file's data and metadata (attributes included) durable.
int fsync(int fd);
int stat(const char *path, struct ::stat *st);
int lstat(const char *path, struct ::stat *st);
int fstat(int fd, struct ::stat *st);
int statfs(const char *path, struct ::statfs *st);
int fstatfs(int fd, struct ::statfs *st);

// Linux extended-attribute calls (no position, no options: see Platform/ExtendedAttributes.h).
ssize_t getxattr(const char *path, const char *name, void *value, size_t size);
ssize_t lgetxattr(const char *path, const char *name, void *value, size_t size);
ssize_t fgetxattr(int fd, const char *name, void *value, size_t size);
int setxattr(const char *path, const char *name, const void *value, size_t size, int flags);
int lsetxattr(const char *path, const char *name, const void *value, size_t size, int flags);
int fsetxattr(int fd, const char *name, const void *value, size_t size, int flags);
int removexattr(const char *path, const char *name);
int lremovexattr(const char *path, const char *name);
int fremovexattr(int fd, const char *name);
ssize_t listxattr(const char *path, char *list, size_t size);
ssize_t llistxattr(const char *path, char *list, size_t size);
ssize_t flistxattr(int fd, char *list, size_t size);

int futimes(int fd, const struct timeval times[2]);
// futimes to the nanosecond, so that restoring a file's times leaves them exactly as they were;
// counted and failed as a futimes call.
int futimens(int fd, const struct timespec times[2]);
int rename(const char *from, const char *to);
int mkdir(const char *path, mode_t mode);
char *realpath(const char *path, char *resolved);
// The allocations whose failure the library reports. realloc and strdup count as Malloc calls;
// a failed realloc leaves the old block as it was.
void *malloc(size_t size);
void *realloc(void *block, size_t size);
char *strdup(const char *text);
void *calloc(size_t count, size_t size);
int dup(int fd);
off_t lseek(int fd, off_t offset, int whence);
int chmod(const char *path, mode_t mode);
// chmod of an open file; counted and failed as a chmod call.
int fchmod(int fd, mode_t mode);
int utimes(const char *path, const struct timeval times[2]);
// Copies up to count bytes from the current position of in (a regular file) to out inside the
// kernel, advancing in's position: bytes copied, 0 at the end of in, or -1 with errno (EINVAL
// when out cannot take data this way: a terminal, a file open for appending). Restarted on
// EINTR before anything was copied.
ssize_t sendfile(int out, int in, size_t count);

// write and pwrite of every byte, through the wrappers above: a short write (a volume filling
// up) or EINTR is continued until all count bytes are written or a call fails, so that the
// failure carries its own errno rather than a stale one. Returns count, or -1 with the errno of
// the call that failed (bytes written before it stay written); a call that writes nothing
// without an error counts as ENOSPC.
ssize_t writeAll(int fd, const void *buffer, size_t count);
ssize_t pwriteAll(int fd, const void *buffer, size_t count, off_t offset);

// Fault injection. `armFault(call, nth, error)` makes the nth call of that kind from now on
// (1 = the next one) fail with `error`; with `sticky`, that call and every later one fail.
// Counting and faults are process-wide and thread-safe.
void armFault(Call call, uint64_t nth, int error, bool sticky = false);
void clearFaults();
// Number of calls of this kind made since the process started.
uint64_t callCount(Call call);
// For a call that the caller serves itself this time (a buffer kept from an earlier
// allocation): counts it like a real call, and returns false with errno set when a fault armed
// for it fires. Counts and faults then do not depend on what a thread happens to keep.
bool callSucceeds(Call call);

}  // namespace sys
