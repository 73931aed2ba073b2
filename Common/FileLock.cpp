// File locks by device and inode. Their messages carry the source path of the stream
// compressor, whose write-out they serve; so does kSourcePath here although the file is
// FileLock.cpp.
#include "Common/FileLock.h"

#include <pthread.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Platform/Syscalls.h"
#include "PropertyValue.h"

static constexpr char kSourcePath[] = "Common/StreamCompressor";

// One per locked file; the handle callers get is its address.
struct FileLock {
  int32_t count;  // threads holding or waiting; under fileLockDictLock
  pthread_mutex_t mutex;
  PVDataRef key;  // one reference
};

namespace {

constexpr PVIndex kKeyBytes = 12;

// Key to record (plain pointers, not retained); created on first use, never destroyed.
PVMutableDictionaryRef fileLockDict = nullptr;
// Held only for table operations. A mutex rather than a spin lock: a thread that finds it
// taken sleeps instead of spinning while the holder allocates a record.
pthread_mutex_t fileLockDictLock = PTHREAD_MUTEX_INITIALIZER;

// The 12 bytes of the key in the machine's byte order: device, then inode.
PVDataRef createKey(int32_t dev, uint64_t ino) {
  uint8_t bytes[kKeyBytes];
  memcpy(bytes, &dev, sizeof dev);
  memcpy(bytes + sizeof dev, &ino, sizeof ino);
  return PVDataCreate(bytes, kKeyBytes);
}

}  // namespace

extern "C" FileLock *PLZCLockFileIno(int32_t dev, uint64_t ino) {
  PVDataRef key = createKey(dev, ino);
  if (!key) {
    PLZC_ERR("%s:%d: Error: PVDataCreate failed\n");
    errno = ENOMEM;
    return nullptr;
  }
  pthread_mutex_lock(&fileLockDictLock);
  if (!fileLockDict) {
    fileLockDict = PVDictionaryCreateMutable(0, kPVDictionaryPlainValues);
    if (!fileLockDict) {
      PLZC_ERR("%s:%d: Error: PVDictionaryCreateMutable failed\n");
      pthread_mutex_unlock(&fileLockDictLock);
      PVRelease(key);
      errno = ENOMEM;
      return nullptr;
    }
  }
  auto *lock = static_cast<FileLock *>(const_cast<void *>(PVDictionaryGetValue(fileLockDict, key)));
  if (lock) {
    lock->count++;
  } else {
    lock = static_cast<FileLock *>(sys::calloc(1, sizeof(FileLock)));
    if (!lock) {
      PLZC_ERR("%s:%d: Error: calloc failed\n");
      pthread_mutex_unlock(&fileLockDictLock);
      PVRelease(key);
      errno = ENOMEM;
      return nullptr;
    }
    if (!PVDictionarySetValue(fileLockDict, key, lock)) {
      // The table could not grow: nothing was added, so there is nothing to take back.
      free(lock);
      PLZC_ERR("%s:%d: Error: PVDictionarySetValue failed\n");
      pthread_mutex_unlock(&fileLockDictLock);
      PVRelease(key);
      errno = ENOMEM;
      return nullptr;
    }
    lock->count = 1;
    lock->key = static_cast<PVDataRef>(PVRetain(key));
    pthread_mutex_init(&lock->mutex, nullptr);
  }
  PVRelease(key);  // the table and the record hold theirs
  pthread_mutex_unlock(&fileLockDictLock);
  // The record cannot go away meanwhile: this thread counts in lock->count.
  pthread_mutex_lock(&lock->mutex);
  return lock;
}

extern "C" FileLock *PLZCLockFileFd(int fd) {
  struct stat st;
  if (sys::fstat(fd, &st) != 0) {
    PLZC_ERR("%s:%d: fstat(%d): %s\n", fd, strerror(errno));
    return nullptr;
  }
  return PLZCLockFileIno(static_cast<int32_t>(st.st_dev), st.st_ino);
}

extern "C" FileLock *PLZCLockFilePath(const char *path) {
  struct stat st;
  if (sys::stat(path, &st) != 0) {
    PLZC_ERR("%s:%d: stat(%s): %s\n", path, strerror(errno));
    return nullptr;
  }
  return PLZCLockFileIno(static_cast<int32_t>(st.st_dev), st.st_ino);
}

extern "C" int PLZCUnlockFile(FileLock *lock) {
  if (!lock) {
    errno = EINVAL;
    return -1;
  }
  pthread_mutex_lock(&fileLockDictLock);
  pthread_mutex_unlock(&lock->mutex);
  if (--lock->count == 0) {
    pthread_mutex_destroy(&lock->mutex);
    PVDictionaryRemoveValue(fileLockDict, lock->key);
    PVRelease(lock->key);
    free(lock);
  }
  pthread_mutex_unlock(&fileLockDictLock);
  return 0;
}

int64_t fileLockTableCount() {
  pthread_mutex_lock(&fileLockDictLock);
  int64_t count = fileLockDict ? PVDictionaryGetCount(fileLockDict) : 0;
  pthread_mutex_unlock(&fileLockDictLock);
  return count;
}

int32_t fileLockHolders(FileLock *lock) {
  pthread_mutex_lock(&fileLockDictLock);
  int32_t count = lock->count;
  pthread_mutex_unlock(&fileLockDictLock);
  return count;
}
