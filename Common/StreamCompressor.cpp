// The stream pipeline: queues, streams, the compression step and the write-out.
#include "Common/StreamCompressor.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/time.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "Common/Diagnostics.h"
#include "Common/MachOFilter.h"
#include "Common/OverlayFile.h"
#include "Common/PropertyValueObjects.h"
#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/FileIdentity.h"
#include "Platform/Syscalls.h"
#include "Platform/ThrottledIO.h"

static constexpr char kSourcePath[] = "Common/StreamCompressor";

namespace {
constinit PVString ignoreXattrErrors = PVString::constant("IgnoreXattrErrors");
constinit PVString compressionRules = PVString::constant("CompressionRules");
constinit PVString systemCompressionRules = PVString::constant("SystemCompressionRules");
constinit PVString compressionTypes = PVString::constant("CompressionTypes");
constinit PVString compressionLevel = PVString::constant("CompressionLevel");
constinit PVString allowLargeResourceForks = PVString::constant("AllowLargeResourceForks");
constinit PVString throttledIO = PVString::constant("PLZCThrottledIO");
}  // namespace

const PVStringRef kPLZCIgnoreXattrErrors = &ignoreXattrErrors;
const PVStringRef kPLZCCompressionRulesKey = &compressionRules;
const PVStringRef kPLZCCompressionSystemRulesKey = &systemCompressionRules;
const PVStringRef kPLZCCompressionTypes = &compressionTypes;
const PVStringRef kPLZCCompressionLevel = &compressionLevel;
const PVStringRef kPLZCAllowLargeResourceForks = &allowLargeResourceForks;
const PVStringRef kPLZCThrottledIO = &throttledIO;

namespace {

constexpr int64_t kDirectRouteThreshold = 67108864;  // the largest ring a pool has
constexpr size_t kCopyBufferSize = 65536;

WorkQueue *concurrentQueue = nullptr;
int32_t defaultCompressionLevel = 5;
pthread_once_t initStreamCompressionOnce = PTHREAD_ONCE_INIT;

void _InitStreamCompression() {
  concurrentQueue = workQueueGetGlobal(kWorkQueuePriorityHigh);
  defaultCompressionLevel = _GetCompressionLevel();
}

void _EmptyFunction(void *) {}

// Queue and stream records come from sys::malloc, so that tests can make their allocation fail.
template <typename Record>
Record *newRecord() {
  void *block = sys::malloc(sizeof(Record));
  return block ? new (block) Record : nullptr;
}

template <typename Record>
void deleteRecord(Record *record) {
  if (!record) return;
  record->~Record();
  free(record);
}

void recordError(StreamCompressorQueue *queue, int error) { queue->error.store(error, std::memory_order_relaxed); }

// The value under key when it is of the given kind, else NULL.
PVRef optionOfType(PVDictionaryRef options, PVStringRef key, PVType type) {
  PVRef value = options ? PVDictionaryGetValue(options, key) : nullptr;
  return PVGetType(value) == type ? value : nullptr;
}

bool booleanOption(PVDictionaryRef options, PVStringRef key) {
  PVRef value = optionOfType(options, key, kPVTypeBoolean);
  return value && PVBooleanGetValue(static_cast<PVBooleanRef>(value));
}

// Background mode for an item's thread when the queue asks for it.
struct Throttle {
  explicit Throttle(StreamCompressorQueue *queue) : active(queue->throttledIO != 0) {
    if (active) saved = platform::throttleThread();
  }
  void restore() {
    if (active) platform::unthrottleThread(saved);
    active = false;
  }
  bool active;
  platform::ThreadPriority saved;
};

void dropPoolReference(StreamCompressor *stream) {
  if (stream->pool && releaseDataPool(stream->pool)) stream->pool = nullptr;
}

void closeHandle(FileHandle **handle) {
  if (*handle) (*handle)->close(*handle);
  *handle = nullptr;
}

void _SCWriteFile(void *context);

void _SCEnqueueIO(void *context) {
  auto *stream = static_cast<StreamCompressor *>(context);
  workQueueSync(stream->queue->ioQueue, stream, _SCWriteFile);
}

void _SCEnqueueWriter(StreamCompressor *stream, int direct) {
  StreamCompressorQueue *queue = stream->queue;
  queue->enqueued.fetch_add(1);
  if (direct)
    workQueueAsync(queue->ioQueue, stream, _SCWriteFile);
  else
    workQueueAsync(queue->managerQueue, stream, _SCEnqueueIO);
}

int _SCWriteFailed(int64_t offset, const void *bytes, int64_t count, void *context) {
  auto *stream = static_cast<StreamCompressor *>(context);
  return sys::pwriteAll(stream->fd, bytes, static_cast<size_t>(count), offset) == count ? 0 : -1;
}

void _SCCompressFile(void *context) {
  auto *stream = static_cast<StreamCompressor *>(context);
  StreamCompressorQueue *queue = stream->queue;
  Throttle throttle(queue);
  queue->started.fetch_add(1);

  FileHandle *poolHandle = _SCHandleForPool(stream);
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  FileHandle *overlay = poolHandle && dictionary ? openTocFile(poolHandle, dictionary, 1) : nullptr;
  bool compressed = false;
  if (overlay) {
    int64_t size = overlay->size(overlay);
    if (size != 0) {
      bool skip = queue->skipMachOTypeMask != 0 &&
                  _ShouldSkipMachOFile(stream->path, stream->prefix, queue->skipMachOTypeMask,
                                       queue->skipMachOOverridePaths, overlay);
      errno = 0;
      compressed = !skip && compressFile(queue->compressor, overlay->name, overlay) == 0;
      // Compression writes only into memory: a shortage of it is the one failure here that is
      // not the file's own outcome. In place the file stays as it was; say which one.
      if (!compressed && !skip && queue->inPlace && errno == ENOMEM)
        PLZC_ERR("%s:%d: Error: no memory to compress %s: %s\n", stream->path, strerror(ENOMEM));
    }
  } else {
    PLZC_ERR("%s:%d: Error: cannot read the data of %s: %s\n", stream->path, strerror(ENOMEM));
  }

  if (compressed) {
    // The overlay holds the compressed form and outlives the pool handle it was laid over.
    stream->handle = overlay;
    if (overlayDetachBase(overlay) == 0)
      closeHandle(&poolHandle);
    else
      stream->poolHandle = poolHandle;  // no memory to detach: the write-out closes it
    stream->tocDict = dictionary;
    dropPoolReference(stream);
    queue->completed.fetch_add(1);
    throttle.restore();
    _SCEnqueueWriter(stream, 0);
    return;
  }
  if (queue->inPlace || !overlay) {
    // An in-place file that is not compressed is left alone; the caller's writes now fail with
    // ENOSPC, which tells it to stop reading the file.
    closeHandle(&overlay);
    closeHandle(&poolHandle);
    queue->completed.fetch_add(1);
    if (stream->pool) abortDataPool(stream->pool);
    dropPoolReference(stream);
    if (!queue->inPlace) recordError(queue, ENOMEM);
    throttle.restore();
    PVRelease(dictionary);
    _SCRelease(stream);
    return;
  }
  // The overlay gives back the bytes already consumed, then the rest of the pool.
  stream->handle = overlay;
  stream->poolHandle = poolHandle;
  PVRelease(dictionary);
  queue->completed.fetch_add(1);
  throttle.restore();
  _SCEnqueueWriter(stream, 0);
}

// Stores the compressed form held in the stream's dictionary on its descriptor; true when the
// file ends compressed.
bool storeCompressedForm(StreamCompressor *stream) {
  StreamCompressorQueue *queue = stream->queue;
  bool success = false;
  // An in-place file whose data fork cannot go keeps its data and loses the compressed form
  // just stored.
  auto keepData = [&](const char *step, int error) {
    recordError(queue, error);
    PLZC_ERR("%s:%d: Error: %s failed for %s: %s\n", step, stream->path, strerror(error));
    platform::fremovexattr(stream->fd, kDecmpfsXattrName, 0);
    platform::fremovexattr(stream->fd, kResourceForkXattrName, 0);
    errno = error;
  };
  ssize_t forkSize = platform::fgetxattr(stream->fd, kResourceForkXattrName, nullptr, 0, 0, 0);
  if (forkSize < 0 && errno != ENOATTR) {
    // A fork that cannot be sized may be the caller's own: the compressed form would replace it.
    recordError(queue, errno);
    PLZC_ERR("%s:%d: Error: fgetxattr failed for %s: %s\n", stream->path, strerror(errno));
  } else if (forkSize > 0) {
    // The caller gave the file a resource fork of its own, so it never ends compressed: it ends
    // with its data in the data fork and that fork as it is. Linux expands no file by itself,
    // so the write-out reaches that state directly, without ever taking the fork off the file
    // (a process that dies must not take the fork with it): a new file gets the data
    // decompressed into its data fork; an existing file's data fork still holds its data.
    if (!queue->inPlace && decompressData(stream->handle, _SCWriteFailed, stream) == -1) {
      recordError(queue, errno ? errno : EIO);
      PLZC_ERR("%s:%d: Error: decompressData failed for %s\n", stream->path);
    }
  } else if (applyTocDictToFd(stream->fd, stream->tocDict) == 0) {
    if (!queue->inPlace) {
      success = true;
    } else if (sys::fsync(stream->fd) != 0) {
      // The data fork may go only once the compressed form would survive a power loss.
      keepData("fsync", errno);
    } else if (!platform::pathNamesOpenFile(stream->path, stream->fd)) {
      // The descriptor may be read-only, so the data is cut by path; never that of a file
      // renamed into its place meanwhile, whose data would be lost.
      keepData("ftruncate", errno);
    } else {
      // Marked compressed before the data fork goes, so that readers find the whole data at
      // every instant; the final flags are set at the end of the write-out.
      platform::fchflags(stream->fd, kCompressedFlag);
      if (sys::truncate(stream->path, 0) != 0) {
        int error = errno;
        platform::fchflags(stream->fd, 0);
        keepData("ftruncate", error);
      } else {
        success = true;
      }
    }
  } else {
    int error = errno;
    if (queue->ignoreXattrErrors && !queue->inPlace) {
      PLZC_ERR("%s:%d: Compressed data for %s could not be written; writing decompressed data: %s\n", stream->path,
               strerror(error));
      if (decompressData(stream->handle, _SCWriteFailed, stream) == -1) {
        PLZC_ERR("%s:%d: Error: decompressData failed for %s\n", stream->path);
        recordError(queue, error);
      }
    } else if (queue->ignoreXattrErrors) {
      PLZC_ERR("%s:%d: Compressed data for %s could not be written: %s\n", stream->path, strerror(error));
    } else {
      recordError(queue, error);
      PLZC_ERR("%s:%d: Error: applyTocDictToFd failed for %s: %s\n", stream->path, strerror(error));
    }
  }
  PVRelease(stream->tocDict);
  stream->tocDict = nullptr;
  closeHandle(&stream->handle);
  closeHandle(&stream->poolHandle);
  return success;
}

// Copies the stream's data to the descriptor at its current offset.
void writePlainData(StreamCompressor *stream) {
  StreamCompressorQueue *queue = stream->queue;
  uint8_t buffer[kCopyBufferSize];
  int64_t offset = 0, got;
  while ((got = stream->handle->pread(stream->handle, buffer, kCopyBufferSize, offset)) > 0) {
    if (sys::writeAll(stream->fd, buffer, static_cast<size_t>(got)) != got) {
      recordError(queue, errno);
      PLZC_ERR("%s:%d: Error: write failed for %s: %s\n", stream->path, strerror(errno));
      break;
    }
    offset += got;
  }
  if (got == -1) {
    recordError(queue, errno);
    PLZC_ERR("%s:%d: Error: pread failed for %s: %s\n", stream->path, strerror(errno));
  }
  closeHandle(&stream->handle);
  closeHandle(&stream->poolHandle);
  dropPoolReference(stream);
}

// A write-out that stops before reading the data gives it up: a caller still writing a file
// larger than its ring must not wait for a reader that will never come.
void discardData(StreamCompressor *stream) {
  if (stream->pool) abortDataPool(stream->pool);
  closeHandle(&stream->handle);
  closeHandle(&stream->poolHandle);
  PVRelease(stream->tocDict);
  stream->tocDict = nullptr;
  dropPoolReference(stream);
}

void _SCWriteFile(void *context) {
  auto *stream = static_cast<StreamCompressor *>(context);
  StreamCompressorQueue *queue = stream->queue;
  platform::Stat status{};
  bool success = false;
  Throttle throttle(queue);
  queue->started.fetch_add(1);

  FileLock *lock = PLZCLockFileFd(stream->fd);
  if (!lock) {
    recordError(queue, errno);
    PLZC_ERR("%s:%d: Error: PLZCLockFile failed for %s: %s\n", stream->path, strerror(errno));
    discardData(stream);
  } else if (platform::fstat(stream->fd, &status) != 0) {
    recordError(queue, errno);
    PLZC_ERR("%s:%d: Error: stat failed for %s: %s\n", stream->path, strerror(errno));
    status = {};
    discardData(stream);
  } else if (queue->inPlace && stream->tocDict &&
             ((status.st_flags & kCompressedFlag) || status.st.st_size != stream->expectedSize)) {
    // The file changed since its data was read (written to, or compressed meanwhile by a stream
    // that reached the same file under another name): the compressed form in hand is stale and
    // would replace what the file holds now.
    PLZC_ERR("%s:%d: %s changed while it was being compressed; left as it is\n", stream->path);
    status = {};
    discardData(stream);
  } else {
    // Flags such as immutability must not stop the writing; the saved status keeps them.
    if (status.st_flags & ~kCompressedFlag) platform::fchflags(stream->fd, status.st_flags & kCompressedFlag);
    bool wrote = true;
    if (stream->tocDict) {
      success = storeCompressedForm(stream);
    } else if (queue->inPlace) {
      recordError(queue, EINVAL);
      PLZC_ERR("%s:%d: Error: inPlaceCompressor without tocDict\n");
      discardData(stream);
      wrote = false;
    } else {
      writePlainData(stream);
    }
    if (wrote) {
      // To the nanosecond: a file left as it was keeps its times exactly.
      struct timespec times[2] = {status.st.st_atim, status.st.st_mtim};
      if (sys::futimens(stream->fd, times) != 0) {
        recordError(queue, errno);
        PLZC_ERR("%s:%d: Error: futimes failed for %s: %s\n", stream->path, strerror(errno));
      }
      if (success) status.st_flags |= kCompressedFlag;
    }
  }
  if (status.st_flags != 0 && platform::fchflags(stream->fd, status.st_flags) != 0) {
    recordError(queue, errno);
    PLZC_ERR("%s:%d: Error: fchflags failed for %s: %s\n", stream->path, strerror(errno));
  }
  if (lock) PLZCUnlockFile(lock);
  queue->completed.fetch_add(1);
  if (throttle.active) platform::ageCachedPages(stream->fd);
  throttle.restore();
  _SCRelease(stream);
}

}  // namespace

StreamCompressorQueue *CreateStreamCompressorQueueWithOptions(PVDictionaryRef options) {
  pthread_once(&initStreamCompressionOnce, _InitStreamCompression);
  auto *queue = newRecord<StreamCompressorQueue>();
  if (!queue) return nullptr;
  if (!options) return queue;
  queue->options = static_cast<PVDictionaryRef>(PVRetain(options));
  if (_ComputeMachOTypeMask(&queue->skipMachOTypeMask, options) == -1) {
    PVRelease(queue->options);
    deleteRecord(queue);
    return nullptr;
  }
  queue->skipMachOOverridePaths = createMachOOverridePaths(queue->skipMachOTypeMask, options);
  if (optionOfType(options, kPLZCIgnoreXattrErrors, kPVTypeBoolean))
    queue->ignoreXattrErrors = booleanOption(options, kPLZCIgnoreXattrErrors);
  return queue;
}

StreamCompressorQueue *CreateStreamCompressorQueue(void) { return CreateStreamCompressorQueueWithOptions(nullptr); }

void StreamCompressorQueueSetInPlace(StreamCompressorQueue *queue, int inPlace) { queue->inPlace = inPlace; }

WorkQueue *StreamCompressorQueueGetIOQueue(StreamCompressorQueue *queue) { return queue->ioQueue; }

bool _SQLazyInit(StreamCompressorQueue *queue) {
  std::lock_guard<std::mutex> guard(queue->initLock);
  if (queue->initialized) return true;
  int32_t level = defaultCompressionLevel;
  const char *types = "4";
  char typesBuffer[256];
  char *typesText = nullptr;
  bool largeForks = false;
  PVRef userRules = nullptr, systemRules = nullptr;
  PVDictionaryRef options = queue->options;
  bool ok = true;
  if (options) {
    userRules = PVDictionaryGetValue(options, kPLZCCompressionRulesKey);
    systemRules = PVDictionaryGetValue(options, kPLZCCompressionSystemRulesKey);
    if (PVRef value = optionOfType(options, kPLZCCompressionTypes, kPVTypeString)) {
      auto string = static_cast<PVStringRef>(value);
      PVIndex size = PVStringGetMaximumSizeForEncoding(PVStringGetLength(string), kPVStringEncodingASCII) + 10;
      typesText = size <= static_cast<PVIndex>(sizeof typesBuffer) ? typesBuffer
                                                                    : static_cast<char *>(sys::malloc(static_cast<size_t>(size)));
      if (!typesText || !PVStringGetCString(string, typesText, size, kPVStringEncodingASCII)) {
        if (typesText != typesBuffer) free(typesText);
        return false;  // not even recorded: the caller's types cannot be used
      }
      types = typesText;
    }
    if (PVRef value = optionOfType(options, kPLZCCompressionLevel, kPVTypeNumber)) {
      if (!PVNumberGetInt32(static_cast<PVNumberRef>(value), &level)) {
        PLZC_ERR("%s:%d: Error: invalid value for compression level (malformed plist?)\n");
        ok = false;
      }
    }
    largeForks = booleanOption(options, kPLZCAllowLargeResourceForks);
    if (booleanOption(options, kPLZCThrottledIO)) queue->throttledIO = 1;
  }
  if (ok && !(queue->rules = _InitCompressionRules(userRules, systemRules))) {
    PLZC_ERR("%s:%d: Error: _InitCompressionRules failed (malformed plist?)\n");
    ok = false;
  }
  if (ok && !(queue->compressor = initCompressor(types, nullptr, nullptr, nullptr, false, level, largeForks))) {
    PLZC_ERR("%s:%d: Error: initCompressor failed\n");
    ok = false;
  }
  if (ok && !(queue->group = workGroupCreate())) {
    PLZC_ERR("%s:%d: Error: workq_group_create failed\n");
    ok = false;
  }
  if (ok && !(queue->managerQueue = workQueueCreateSerial("com.tavix.Plenzo.managerQueue"))) {
    PLZC_ERR("%s:%d: Error: workq_queue_create managerQueue failed\n");
    ok = false;
  }
  if (ok && !(queue->ioQueue = workQueueCreateSerial("com.tavix.Plenzo.ioQueue"))) {
    PLZC_ERR("%s:%d: Error: workq_queue_create ioQueue failed\n");
    ok = false;
  }
  if (typesText && typesText != typesBuffer) free(typesText);
  if (ok) {
    queue->initialized = 1;
    return true;
  }
  // The next stream tries again from scratch.
  _FreeCompressionRules(queue->rules);
  queue->rules = nullptr;
  freeCompressor(queue->compressor);
  queue->compressor = nullptr;
  if (queue->group) workGroupRelease(queue->group);
  queue->group = nullptr;
  workQueueRelease(queue->managerQueue);
  queue->managerQueue = nullptr;
  queue->initialized = 0;
  errno = EINVAL;
  recordError(queue, EINVAL);
  return false;
}

void _SQRelease(StreamCompressorQueue *queue) {
  if (queue->refCount.fetch_sub(1) != 1) return;
  if (!queue->finished) {
    PLZC_ERR("%s:%d: Error: freeing an unfinished StreamCompressorQueue\n");
    abort();
  }
  if (queue->group) workGroupRelease(queue->group);
  freeCompressor(queue->compressor);
  _FreeCompressionRules(queue->rules);
  PVRelease(queue->options);
  PVRelease(queue->skipMachOOverridePaths);
  workQueueRelease(queue->managerQueue);
  workQueueRelease(queue->ioQueue);
  deleteRecord(queue);
}

int FinishStreamCompressorQueue(StreamCompressorQueue *queue) { return _SQFinishWithCounts(queue, nullptr); }

int _SQFinishWithCounts(StreamCompressorQueue *queue, StreamQueueCounts *counts) {
  if (!queue) {
    errno = EINVAL;
    return -1;
  }
  int result = 0, error = 0;
  if (queue->group && workGroupWait(queue->group) != 0) {
    PLZC_ERR("%s:%d: Error: %d items were enqueued but only %d were started\n", queue->enqueued.load(),
             queue->started.load());
    error = EINVAL;
    result = -1;
  }
  // The manager first: its items hand write-outs to the I/O queue.
  if (queue->managerQueue) workQueueSync(queue->managerQueue, nullptr, _EmptyFunction);
  if (queue->ioQueue) workQueueSync(queue->ioQueue, nullptr, _EmptyFunction);
  int32_t enqueued = queue->enqueued.load(), started = queue->started.load(), completed = queue->completed.load();
  if (enqueued != started) {
    PLZC_ERR("%s:%d: Error: %d items were enqueued but only %d were started\n", enqueued, started);
    error = EINVAL;
    result = -1;
  }
  if (started != completed) {
    PLZC_ERR("%s:%d: Error: %d items were started but only %d were completed\n", started, completed);
    error = EINVAL;
    result = -1;
  }
  int32_t recorded = queue->error.load(std::memory_order_relaxed);
  if (recorded) {
    PLZC_ERR("%s:%d: Error: returning errno %d from FinishStreamCompressorQueue\n", recorded);
    error = recorded;
    result = -1;
  }
  if (counts) *counts = StreamQueueCounts{enqueued, started, completed, recorded};
  queue->finished = 1;
  _SQRelease(queue);
  if (result == -1) errno = error;
  return result;
}

FileHandle *_SCHandleForPool(StreamCompressor *stream) {
  static constexpr char kFormat[] = "data pool for %s";
  size_t size = sizeof kFormat + strlen(stream->path);
  auto *name = static_cast<char *>(sys::malloc(size));
  if (!name) return nullptr;
  snprintf(name, size, kFormat, stream->path);
  FileHandle *handle = openDataPoolFile(stream->pool, name);
  free(name);
  return handle;
}

StreamCompressor *CreateStreamCompressor(int fd, const char *path, const char *prefix, StreamCompressorQueue *queue,
                                         int64_t expectedSize) {
  if (!queue || !_SQLazyInit(queue)) return nullptr;
  const char *slash = strrchr(path, '/');
  const char *name = slash ? slash + 1 : path;
  if (strncmp(name, "._", 2) == 0) return nullptr;
  bool compress = expectedSize != 0 && _ShouldCompressPath(queue->rules, path, prefix) == 1;
  if (queue->inPlace && !compress) return nullptr;

  int duplicate = waitThenDupOrOpen(nullptr, fd);
  if (duplicate < 0) {
    PLZC_ERR("%s:%d: dup: %s\n", strerror(errno));
    return nullptr;
  }
  auto *stream = newRecord<StreamCompressor>();
  char *pathCopy = sys::strdup(path);
  char *prefixCopy = prefix ? sys::strdup(prefix) : nullptr;
  DataPool *pool = stream && pathCopy && (!prefix || prefixCopy) ? newDataPool(expectedSize) : nullptr;
  if (!pool) {
    // Out of memory: nothing was submitted, give everything back.
    PLZC_ERR("%s:%d: Error: no memory to carry the data of %s: %s\n", path, strerror(ENOMEM));
    deleteRecord(stream);
    free(pathCopy);
    free(prefixCopy);
    closeAndSignal(duplicate);
    errno = ENOMEM;
    PLZC_ERR("%s:%d: Error: cannot create a stream for %s: %s\n", path, strerror(errno));
    return nullptr;
  }
  stream->fd = duplicate;
  stream->expectedSize = expectedSize;
  stream->path = pathCopy;
  stream->prefix = prefixCopy;
  stream->pool = pool;
  if (!compress && !(stream->handle = _SCHandleForPool(stream))) {
    PLZC_ERR("%s:%d: Error: no memory to carry the data of %s: %s\n", path, strerror(ENOMEM));
    releaseDataPool(pool);
    free(pathCopy);
    free(prefixCopy);
    deleteRecord(stream);
    closeAndSignal(duplicate);
    errno = ENOMEM;
    PLZC_ERR("%s:%d: Error: cannot create a stream for %s: %s\n", path, strerror(errno));
    return nullptr;
  }
  stream->queue = queue;
  queue->refCount.fetch_add(1);
  retainDataPool(pool);
  stream->refCount.fetch_add(1);  // the pipeline's reference

  if (compress) {
    queue->enqueued.fetch_add(1);
    workGroupAsync(queue->group, concurrentQueue, stream, _SCCompressFile);
  } else {
    _SCEnqueueWriter(stream, expectedSize > kDirectRouteThreshold);
  }
  return stream;
}

namespace {

// Whether data may go into the stream now; a message and errno when not.
bool acceptsData(StreamCompressor *stream) {
  if (!stream) {
    PLZC_ERR("%s:%d: Error: WriteToStreamCompressor passed NULL stream param\n");
    errno = EINVAL;
    return false;
  }
  if (int error = stream->queue->error.load(std::memory_order_relaxed)) {
    PLZC_ERR("%s:%d: Error: returning errno %d from WriteToStreamCompressor\n", error);
    errno = error;
    return false;
  }
  if (!stream->pool) {
    PLZC_ERR("%s:%d: Error: SetStreamCompressorParams not called yet\n");
    errno = EINVAL;
    return false;
  }
  return true;
}

}  // namespace

int64_t WriteToStreamCompressor(StreamCompressor *stream, const void *buffer, uint64_t count) {
  return acceptsData(stream) ? addDataToPool(stream->pool, buffer, count) : -1;
}

int64_t WriteFileToStreamCompressor(StreamCompressor *stream, int fd, uint64_t count) {
  return acceptsData(stream) ? addFileDataToPool(stream->pool, fd, count) : -1;
}

int CloseStreamCompressor(StreamCompressor *stream) {
  if (!stream) {
    PLZC_ERR("%s:%d: Error: CloseStreamCompressor stream param was NULL\n");
    errno = EINVAL;
    return -1;
  }
  int result = 0;
  if (stream->pool) {
    finishDataPool(stream->pool);
    if (int error = stream->queue->error.load(std::memory_order_relaxed)) {
      PLZC_ERR("%s:%d: Error: returning errno %d from CloseStreamCompressor\n", error);
      errno = error;
      result = -1;
    }
    // The caller's side of the pool; whoever frees it clears the field.
    if (releaseDataPool(stream->pool)) stream->pool = nullptr;
  } else if (stream->path) {
    PLZC_ERR("%s:%d: Error: stream->pool is unexpectedly NULL\n");
  }
  _SCRelease(stream);
  return result;
}

void _SCRelease(StreamCompressor *stream) {
  if (stream->refCount.fetch_sub(1) != 1) return;
  closeAndSignal(stream->fd);
  _SQRelease(stream->queue);
  if (stream->pool) PLZC_ERR("%s:%d: Error: pool %p was not drained for %s\n", static_cast<void *>(stream->pool), stream->path);
  free(stream->path);
  free(stream->prefix);
  deleteRecord(stream);
}
