// The plain-file handle: a descriptor on a file on disk.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/time.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/FileHandle.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/FileIdentity.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Common/PlainFile";

namespace {

// The descriptor lives in the same allocation, right behind the record.
struct PlainFile {
  FileHandle handle;
  int32_t fd;
};

int &descriptor(FileHandle *fh) { return *static_cast<int32_t *>(fh->priv); }

int plainClose(FileHandle *fh) {
  if (!fh) return 0;
  int result = sys::close(descriptor(fh));
  int savedErrno = errno;
  free(fh->name);
  free(fh->path);
  free(reinterpret_cast<PlainFile *>(fh));
  errno = savedErrno;
  return result;
}

int plainReopen(FileHandle *fh, int openFlags) {
  int fd = sys::open(fh->path, openFlags, 0666);
  if (fd < 0) {
    PLZC_ERR("%s:%d: open: %s\n", strerror(errno));
    return -1;
  }
  sys::close(descriptor(fh));
  descriptor(fh) = fd;
  return 0;
}

uint16_t plainMode(FileHandle *fh) {
  struct stat st;
  if (sys::fstat(descriptor(fh), &st) != 0) {
    PLZC_ERR("%s:%d: stat: %s\n", strerror(errno));
    return 0;
  }
  return static_cast<uint16_t>(st.st_mode);
}

int plainTimes(FileHandle *fh, struct timespec times[2]) {
  struct stat st;
  if (sys::fstat(descriptor(fh), &st) != 0) {
    PLZC_ERR("%s:%d: stat: %s\n", strerror(errno));
    return -1;
  }
  times[0] = st.st_atim;
  times[1] = st.st_mtim;
  return 0;
}

int plainUtimes(FileHandle *fh, const struct timespec times[2]) {
  if (sys::futimens(descriptor(fh), times) != 0) {
    PLZC_ERR("%s:%d: futimes: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

int64_t plainSize(FileHandle *fh) {
  struct stat st;
  if (sys::fstat(descriptor(fh), &st) != 0) {
    PLZC_ERR("%s:%d: stat: %s\n", strerror(errno));
    return -1;
  }
  return st.st_size;
}

int64_t plainBlockSize(FileHandle *fh) {
  struct stat st;
  if (sys::fstat(descriptor(fh), &st) != 0) {
    PLZC_ERR("%s:%d: stat: %s\n", strerror(errno));
    return 4096;
  }
  return st.st_blksize;
}

int64_t plainPread(FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
  ssize_t got = sys::pread(descriptor(fh), buffer, static_cast<size_t>(count), offset);
  if (got < 0) PLZC_ERR("%s:%d: pread: %s\n", strerror(errno));
  return got;
}

int64_t plainPwrite(FileHandle *fh, const void *buffer, int64_t count, int64_t offset) {
  ssize_t put = sys::pwriteAll(descriptor(fh), buffer, static_cast<size_t>(count), offset);
  if (put < 0) PLZC_ERR("%s:%d: pwrite: %s\n", strerror(errno));
  return put;
}

// The flag word and the attributes are reached through the descriptor: on Linux that works
// whatever its open mode (both are attributes, checked against the file's permissions), and it
// always reaches the file that was opened, never one that another process renamed into its
// place meanwhile.
int plainChflags(FileHandle *fh, uint32_t flags) {
  if (platform::fchflags(descriptor(fh), flags) != 0) {
    PLZC_ERR("%s:%d: chflags: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

// Truncation through the descriptor when it is open for writing; a read-only one leaves only
// the path, which is used once it is seen to still name the opened file (the check and the
// truncation are two calls: a rename can only slip in between them, not during a compression).
int plainTruncate(FileHandle *fh, int64_t length) {
  if (sys::ftruncate(descriptor(fh), length) == 0) return 0;
  if (errno == EINVAL || errno == EBADF) {
    if (!platform::pathNamesOpenFile(fh->path, descriptor(fh))) {
      if (errno == ESTALE) PLZC_ERR("%s:%d: Error: %s no longer names the file opened\n", fh->path);
      PLZC_ERR("%s:%d: truncate: %s\n", strerror(errno));
      return -1;
    }
    if (sys::truncate(fh->path, length) == 0) return 0;
  }
  PLZC_ERR("%s:%d: truncate: %s\n", strerror(errno));
  return -1;
}

int64_t plainGetxattr(FileHandle *fh, const char *name, void *buffer, uint64_t size, uint32_t position,
                      int options) {
  ssize_t got = platform::fgetxattr(descriptor(fh), name, buffer, size, position, options);
  if (got < 0 && errno != ENOATTR) PLZC_ERR("%s:%d: getxattr: %s\n", strerror(errno));
  return got;
}

int plainSetxattr(FileHandle *fh, const char *name, const void *buffer, uint64_t size, uint32_t position,
                  int options) {
  if (platform::fsetxattr(descriptor(fh), name, buffer, size, position, options) != 0) {
    PLZC_ERR("%s:%d: fsetxattr: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

int plainRemovexattr(FileHandle *fh, const char *name, int options) {
  if (platform::fremovexattr(descriptor(fh), name, options) != 0) {
    if (errno != ENOATTR) PLZC_ERR("%s:%d: removexattr(%s,%s): %s\n", fh->path, name, strerror(errno));
    return -1;
  }
  return 0;
}

int plainSync(FileHandle *fh) {
  if (sys::fsync(descriptor(fh)) != 0) {
    PLZC_ERR("%s:%d: fsync: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

const FileHandle kPlainFileTemplate = {
    .name = nullptr,
    .path = nullptr,
    .canUnread = 0,
    .close = plainClose,
    .reopen = plainReopen,
    .mode = plainMode,
    .times = plainTimes,
    .utimes = plainUtimes,
    .size = plainSize,
    .blockSize = plainBlockSize,
    .pread = plainPread,
    .pwrite = plainPwrite,
    .unreadAlloc = nullptr,
    .unreadSetPos = nullptr,
    .unread = nullptr,
    .unreadDone = nullptr,
    .chflags = plainChflags,
    .truncate = plainTruncate,
    .getxattr = plainGetxattr,
    .setxattr = plainSetxattr,
    .removexattr = plainRemovexattr,
    .sync = plainSync,
    .priv = nullptr,
};

}  // namespace

FileHandle *openFile(const char *name, const char *path, int oflag) {
  int fd = sys::open(path, oflag, 0666);
  if (fd < 0) {
    PLZC_ERR("%s:%d: open %s: %s\n", path, strerror(errno));
    return nullptr;
  }
  auto *file = static_cast<PlainFile *>(sys::malloc(sizeof(PlainFile)));
  char *nameCopy = sys::strdup(name);
  char *pathCopy = sys::strdup(path);
  if (!file || !nameCopy || !pathCopy) {
    sys::close(fd);
    free(file);
    free(nameCopy);
    free(pathCopy);
    errno = ENOMEM;
    PLZC_ERR("%s:%d: open %s: %s\n", path, strerror(errno));
    return nullptr;
  }
  *file = PlainFile{kPlainFileTemplate, fd};
  file->handle.name = nameCopy;
  file->handle.path = pathCopy;
  file->handle.priv = &file->fd;
  return &file->handle;
}
