#include "Common/OverlayFile.h"

#include <pthread.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Common/OverlayFile";

namespace {

constexpr uint64_t kMaxOrdinaryAttribute = 3802;
constexpr size_t kNameBufferSize = 500;

// The private state lives right behind the record, in one zero-filled allocation.
struct Overlay {
  FileHandle handle;
  pthread_mutex_t dictLock;
  FileHandle *base;  // borrowed; null once detached
  char *ownName;     // the name and path after detaching
  PVMutableDictionaryRef tocDict;
  uint8_t *unreadBuffer;
  int64_t unreadPos;
  int64_t unreadSize;
  int unreadError;  // set when bytes to push back could not be kept: the data has a hole
};

Overlay *overlayOf(FileHandle *fh) { return static_cast<Overlay *>(fh->priv); }

bool isResourceFork(const char *name) { return strcmp(name, PLZC_RESOURCE_FORK_NAME) == 0; }

// The key's UTF-8 name in a 500-byte buffer, byte 499 forced to 0; false when it cannot convert.
bool nameOf(PVRef key, char name[kNameBufferSize]) {
  memset(name, 0, kNameBufferSize);
  if (PVGetType(key) != kPVTypeString) return false;
  bool converted = PVStringGetCString(static_cast<PVStringRef>(key), name, kNameBufferSize, kPVStringEncodingUTF8);
  name[kNameBufferSize - 1] = '\0';
  return converted;
}

int overlayClose(FileHandle *fh) {
  if (!fh) return 0;
  Overlay *overlay = overlayOf(fh);
  pthread_mutex_destroy(&overlay->dictLock);
  free(overlay->unreadBuffer);
  free(overlay->ownName);
  PVRelease(overlay->tocDict);
  free(overlay);
  return 0;
}

int overlayReopen(FileHandle *, int) {
  printf("_reopen not allowed\n");
  fflush(stdout);
  errno = EPERM;
  return -1;
}

// What a detached overlay answers in place of its base.
int64_t noBase() {
  errno = EBADF;
  return -1;
}

uint16_t overlayMode(FileHandle *fh) {
  FileHandle *base = overlayOf(fh)->base;
  if (!base || !base->mode) {
    errno = EPERM;
    return 0;
  }
  return static_cast<uint16_t>(base->mode(base) & 0xFFFF);
}

int overlayTimes(FileHandle *, struct timespec *) { return 0; }
int overlayUtimes(FileHandle *, const struct timespec *) { return 0; }
int overlayChflags(FileHandle *, uint32_t) { return 0; }

int64_t overlaySize(FileHandle *fh) {
  FileHandle *base = overlayOf(fh)->base;
  return base ? base->size(base) : noBase();
}

int64_t overlayBlockSize(FileHandle *fh) {
  FileHandle *base = overlayOf(fh)->base;
  return base ? base->blockSize(base) : 4096;
}

int64_t overlayPwrite(FileHandle *, const void *, int64_t, int64_t) {
  PLZC_ERR("%s:%d: Error: _pwrite not allowed\n");
  errno = EPERM;
  return -1;
}

int overlayTruncate(FileHandle *, int64_t length) {
  if (length == 0) return 0;
  PLZC_ERR("%s:%d: Error: _truncate not allowed\n");
  errno = EPERM;
  return -1;
}

// Reads the pushed-back bytes first, then the base at the offsets that follow them.
int64_t overlayPread(FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
  Overlay *overlay = overlayOf(fh);
  FileHandle *base = overlay->base;
  if (overlay->unreadError) {
    errno = overlay->unreadError;
    return -1;
  }
  if (!base) return noBase();
  if (!overlay->unreadBuffer) return base->pread(base, buffer, count, offset);
  if (offset != overlay->unreadPos) {
    PLZC_ERR("%s:%d: Error: should read the unread buffer first\n");
    return -1;
  }
  int64_t n = overlay->unreadPos + count <= overlay->unreadSize ? count : overlay->unreadSize - overlay->unreadPos;
  if (n > 0) {
    memcpy(buffer, overlay->unreadBuffer + overlay->unreadPos, static_cast<size_t>(n));
    overlay->unreadPos += n;
    if (overlay->unreadPos >= overlay->unreadSize) {
      free(overlay->unreadBuffer);
      overlay->unreadBuffer = nullptr;
    }
  }
  if (n == count) return n;
  int64_t got = base->pread(base, static_cast<uint8_t *>(buffer) + n, count - n, offset + n);
  if (got == -1) {
    PLZC_ERR("%s:%d: Error: exhausted the unread buffer then got an error\n");
    return -1;
  }
  return n + got;
}

void *overlayUnreadAlloc(FileHandle *fh, int64_t size) {
  Overlay *overlay = overlayOf(fh);
  if (overlay->unreadBuffer) {
    // A buffer only partly read back still holds the bytes: the caller rewinds it.
    if (overlay->unreadSize <= size) PLZC_ERR("%s:%d: Error: already have an unread buffer\n");
    return nullptr;
  }
  overlay->unreadBuffer = static_cast<uint8_t *>(sys::malloc(size > 0 ? static_cast<size_t>(size) : 1));
  if (!overlay->unreadBuffer) {
    overlay->unreadError = ENOMEM;
    return nullptr;
  }
  overlay->unreadPos = 0;
  overlay->unreadSize = size;
  return overlay->unreadBuffer;
}

int overlayUnreadSetPos(FileHandle *fh, int64_t position) {
  Overlay *overlay = overlayOf(fh);
  if (!overlay->unreadBuffer) {
    PLZC_ERR("%s:%d: Error: _unreadSetPos with no unread buffer\n");
    return -1;
  }
  if (position > overlay->unreadSize) {
    PLZC_ERR("%s:%d: Error: exceeded unread buffer\n");
    return 0;
  }
  overlay->unreadPos = position;
  return 0;
}

int overlayUnread(FileHandle *fh, const void *data, int64_t count) {
  Overlay *overlay = overlayOf(fh);
  if (!overlay->unreadBuffer) {
    PLZC_ERR("%s:%d: Error: _unreadSetPos with no unread buffer\n");
    return -1;
  }
  if (overlay->unreadPos + count > overlay->unreadSize) {
    PLZC_ERR("%s:%d: Error: exceeded unread buffer, pos %lld count %lld size %lld\n",
             static_cast<long long>(overlay->unreadPos), static_cast<long long>(count),
             static_cast<long long>(overlay->unreadSize));
    count = overlay->unreadSize - overlay->unreadPos;
  }
  memcpy(overlay->unreadBuffer + overlay->unreadPos, data, static_cast<size_t>(count));
  overlay->unreadPos += count;
  return 0;
}

int overlayUnreadDone(FileHandle *fh) {
  Overlay *overlay = overlayOf(fh);
  if (!overlay->unreadBuffer) {
    PLZC_ERR("%s:%d: Error: _unreadSetPos with no unread buffer\n");
    return -1;
  }
  if (overlay->unreadPos != overlay->unreadSize) {
    PLZC_ERR("%s:%d: Error: only unread %lld of %lld\n", static_cast<long long>(overlay->unreadPos),
             static_cast<long long>(overlay->unreadSize));
    overlay->unreadSize = overlay->unreadPos;
  }
  overlay->unreadPos = 0;
  if (overlay->unreadSize == 0) {  // nothing to read back
    free(overlay->unreadBuffer);
    overlay->unreadBuffer = nullptr;
  }
  return 0;
}

int64_t overlayGetxattr(FileHandle *fh, const char *name, void *buffer, uint64_t size, uint32_t position,
                        int options) {
  bool fork = isResourceFork(name);
  if (position != 0 && !fork) {
    errno = ERANGE;
    return -1;
  }
  PVMutableDataRef entry = getDataForAttr(fh, name, 0);
  if (!entry) {
    if (errno != ENOATTR) return -1;  // not to be taken for a missing entry
    FileHandle *base = overlayOf(fh)->base;
    return base ? base->getxattr(base, name, buffer, size, position, options) : -1;
  }
  uint64_t length = static_cast<uint64_t>(PVDataGetLength(entry));
  if (!buffer || size == 0) {
    if (length) return static_cast<int64_t>(length);
    errno = ENOATTR;
    return -1;
  }
  if (!fork && size != length) {
    errno = ERANGE;
    return -1;
  }
  uint64_t n = position >= length ? 0 : (position + size <= length ? size : length - position);
  if (n) memcpy(buffer, PVDataGetBytePtr(entry) + position, n);
  return static_cast<int64_t>(n);
}

int overlaySetxattr(FileHandle *fh, const char *name, const void *value, uint64_t size, uint32_t position,
                    int) {
  bool fork = isResourceFork(name);
  if (position != 0 && !fork) {
    errno = ERANGE;
    return -1;
  }
  PVMutableDataRef entry = getDataForAttr(fh, name, 1);
  if (!entry) {
    errno = ENOMEM;
    return -1;
  }
  if (!fork) {
    if (size > kMaxOrdinaryAttribute) {
      errno = ERANGE;
      return -1;
    }
    if (!PVDataSetLength(entry, 0) || !PVDataAppendBytes(entry, value, static_cast<PVIndex>(size))) {
      errno = ENOMEM;
      return -1;
    }
    return 0;
  }
  uint64_t end = position + size;
  if (static_cast<uint64_t>(PVDataGetLength(entry)) < end && !PVDataSetLength(entry, static_cast<PVIndex>(end))) {
    errno = ENOMEM;
    return -1;
  }
  if (size) memcpy(PVDataGetMutableBytePtr(entry) + position, value, size);
  return 0;
}

int overlayRemovexattr(FileHandle *fh, const char *name, int) {
  PVMutableDataRef entry = getDataForAttr(fh, name, 1);
  if (!entry) {
    errno = ENOMEM;
    return -1;
  }
  PVDataSetLength(entry, 0);
  return 0;
}

const FileHandle kOverlayTemplate = {
    .name = nullptr,
    .path = nullptr,
    .canUnread = 0,
    .close = overlayClose,
    .reopen = overlayReopen,
    .mode = overlayMode,
    .times = overlayTimes,
    .utimes = overlayUtimes,
    .size = overlaySize,
    .blockSize = overlayBlockSize,
    .pread = overlayPread,
    .pwrite = overlayPwrite,
    .unreadAlloc = overlayUnreadAlloc,
    .unreadSetPos = overlayUnreadSetPos,
    .unread = overlayUnread,
    .unreadDone = overlayUnreadDone,
    .chflags = overlayChflags,
    .truncate = overlayTruncate,
    .getxattr = overlayGetxattr,
    .setxattr = overlaySetxattr,
    .removexattr = overlayRemovexattr,
    .sync = nullptr,  // nothing of it is on disk
    .priv = nullptr,
};

}  // namespace

FileHandle *openTocFile(FileHandle *base, PVMutableDictionaryRef tocDict, int32_t canUnread) {
  auto *overlay = static_cast<Overlay *>(sys::calloc(1, sizeof(Overlay)));
  if (!overlay) return nullptr;
  overlay->handle = kOverlayTemplate;
  overlay->handle.name = base->name;
  overlay->handle.path = base->path;
  overlay->handle.canUnread = canUnread;
  overlay->handle.priv = overlay;
  overlay->base = base;
  pthread_mutex_init(&overlay->dictLock, nullptr);
  overlay->tocDict = static_cast<PVMutableDictionaryRef>(const_cast<void *>(PVRetain(tocDict)));
  return &overlay->handle;
}

int overlayDetachBase(FileHandle *fh) {
  Overlay *overlay = overlayOf(fh);
  if (!overlay->base) return 0;
  char *name = sys::strdup(fh->name ? fh->name : "");
  if (!name) {
    errno = ENOMEM;
    return -1;
  }
  overlay->ownName = name;
  fh->name = fh->path = name;
  overlay->base = nullptr;
  return 0;
}

PVMutableDataRef getDataForAttr(FileHandle *fh, const char *name, int32_t create) {
  Overlay *overlay = overlayOf(fh);
  PVStringRef key = PVStringCreateWithCString(name, kPVStringEncodingUTF8);
  if (!key) {
    errno = ENOMEM;
    return nullptr;
  }
  pthread_mutex_lock(&overlay->dictLock);
  auto *entry = static_cast<PVMutableDataRef>(const_cast<void *>(PVDictionaryGetValue(overlay->tocDict, key)));
  int error = ENOATTR;
  if (!entry && create) {
    error = ENOMEM;
    entry = PVDataCreateMutable(0);
    if (entry) {
      if (PVDictionarySetValue(overlay->tocDict, key, entry)) {
        PVRelease(entry);  // the dictionary holds it
      } else {
        PVRelease(entry);
        entry = nullptr;
      }
    }
  }
  pthread_mutex_unlock(&overlay->dictLock);
  PVRelease(key);
  if (!entry) errno = error;
  return entry;
}

namespace {

struct ApplyState {
  int fd;
  int error;
};

void applyEntry(PVRef key, const void *value, void *context) {
  auto *state = static_cast<ApplyState *>(context);
  char name[kNameBufferSize];
  if (!nameOf(key, name)) {
    state->error = EINVAL;
    return;
  }
  auto data = static_cast<PVDataRef>(value);
  PVIndex length = PVDataGetLength(data);
  if (length == 0) return;
  const uint8_t *bytes = PVDataGetBytePtr(data);
  if (platform::fsetxattr(state->fd, name, bytes, static_cast<size_t>(length), 0, 0) != 0) {
    state->error = errno;
    PLZC_ERR("%s:%d: applyDictFunc fsetxattr(%d,%s,%p,%u): %s\n", state->fd, name, static_cast<const void *>(bytes),
             static_cast<unsigned>(length), strerror(errno));
  }
}

void removeEntry(PVRef key, const void *, void *context) {
  char name[kNameBufferSize];
  nameOf(key, name);
  platform::fremovexattr(static_cast<ApplyState *>(context)->fd, name, 0);
}

}  // namespace

int32_t applyTocDictToFd(int32_t fd, PVDictionaryRef tocDict) {
  ApplyState state{fd, 0};
  PVDictionaryApply(tocDict, applyEntry, &state);
  if (state.error == 0) return 0;
  PVDictionaryApply(tocDict, removeEntry, &state);
  errno = state.error;
  return -1;
}

namespace {

struct TocWriteState {
  int fd;
  uint32_t count;
};

void writeEntry(PVRef key, const void *value, void *context) {
  auto *state = static_cast<TocWriteState *>(context);
  auto data = static_cast<PVDataRef>(value);
  PVIndex length = PVDataGetLength(data);
  if (length == 0) return;
  char name[kNameBufferSize];
  nameOf(key, name);
  uint8_t lengthBytes[4];
  for (int i = 0; i < 4; i++) lengthBytes[i] = static_cast<uint8_t>(static_cast<uint32_t>(length) >> (8 * i));
  sys::write(state->fd, name, strlen(name) + 1);
  sys::write(state->fd, lengthBytes, 4);
  sys::write(state->fd, PVDataGetBytePtr(data), static_cast<size_t>(length));
  state->count++;
}

}  // namespace

void writeTocDictToFile(int32_t fd, const char *path, PVDictionaryRef tocDict) {
  off_t start = sys::lseek(fd, 0, SEEK_CUR);
  size_t pathBytes = strlen(path) + 1;
  sys::write(fd, path, pathBytes);
  sys::lseek(fd, 4, SEEK_CUR);  // room for the count
  TocWriteState state{fd, 0};
  PVDictionaryApply(tocDict, writeEntry, &state);
  if (state.count) {
    uint8_t countBytes[4];
    for (int i = 0; i < 4; i++) countBytes[i] = static_cast<uint8_t>(state.count >> (8 * i));
    sys::pwrite(fd, countBytes, 4, start + static_cast<off_t>(pathBytes));
  } else {
    sys::ftruncate(fd, start);
  }
  sys::lseek(fd, 0, SEEK_END);
}
