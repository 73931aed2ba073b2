// Compressing one file in place, or into a table-of-contents file, with the types of a
// compressor context.
#include "Libraries/CompressData/CompressData.h"

#include <fcntl.h>
#include <md5.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/OverlayFile.h"
#include "Libraries/CompressData/CompressorRegistry.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"

static constexpr char kSourcePath[] = "Libraries/CompressData/CompressData";

namespace {

template <typename T>
void atomicAdd(T *counter, T amount) {
  std::atomic_ref<T>(*counter).fetch_add(amount, std::memory_order_relaxed);
}

int64_t roundedSize(int64_t size) { return (size + 4095) & ~int64_t(4095); }

int md5Writer(int64_t, const void *bytes, int64_t count, void *context) {
  MD5Update(static_cast<MD5_CTX *>(context), static_cast<const uint8_t *>(bytes), static_cast<size_t>(count));
  return 0;
}

// One attempt with one compressor entry; 0 when it compressed the file.
int tryCompressor(CompressorContext *ctx, int entry, FileHandle *fh, const char *path, int64_t size,
                  PVMutableDictionaryRef dictionary) {
  const CompressorOps *row = ctx->compressors[entry];
  void *typeContext = ctx->compressorContexts[entry];
  if (ctx->inPlace) return row->compressFile(fh, path, size, typeContext);
  FileHandle *overlay = openTocFile(fh, dictionary, 0);
  if (!overlay) return -1;
  int result = row->compressFile(overlay, path, size, typeContext);
  overlay->close(overlay);
  if (result == 0) {
    pthread_mutex_lock(&ctx->tocLock);
    writeTocDictToFile(ctx->tocFd, path, dictionary);
    pthread_mutex_unlock(&ctx->tocLock);
  }
  return result;
}

// Everything after the handle is open; the caller closes it.
int compressOpenFile(CompressorContext *ctx, const char *path, FileHandle *fh, PVMutableDictionaryRef dictionary) {
  // A file with a resource fork of its own keeps it; so does one whose fork cannot be sized,
  // since the compressors would write over it.
  int64_t forkSize = fh->getxattr(fh, kResourceForkXattrName, nullptr, 0, 0, 0);
  if (forkSize > 0 || (forkSize < 0 && errno != ENOATTR)) return -1;
  struct timespec times[2] = {};
  if (fh->times(fh, times) == -1) return -1;
  int64_t size = fh->size(fh);
  if (fh->getxattr(fh, kDecmpfsXattrName, nullptr, 0, 0, 0) > 0) return 0;  // already compressed
  if (size == 0) return 0;
  if (size < 0) return -1;

  uint8_t before[16], after[16];
  if (ctx->verifyChecksums && !checksumFile(path, before)) {
    PLZC_ERR("%s:%d: Error: Unable to checksum file '%s' before compression.\n", path);
    return -1;
  }
  int compressedBy = -1;
  for (int entry = 0; entry < ctx->compressorCount && compressedBy < 0; entry++)
    if (tryCompressor(ctx, entry, fh, path, size, dictionary) == 0) compressedBy = entry;
  if (compressedBy < 0) {
    atomicAdd(&ctx->bytesNotCompressed, size);
    atomicAdd(&ctx->bytesNotCompressedRounded, roundedSize(size));
    return -1;
  }
  atomicAdd(&ctx->successCounts[compressedBy], 1u);

  // Whatever moment the process dies at, readers must find the whole data: the compressed form
  // is made durable, then the file is marked compressed (readers decompress it from then on),
  // and only then does the data fork go. If the form cannot be made durable, or the file cannot
  // be marked, it keeps its data fork, as after a failed truncation.
  bool flagSet = false;
  if (ctx->truncateAndRestoreTimes) {
    bool keepData = fh->sync && fh->sync(fh) == -1;
    if (keepData) PLZC_ERR("%s:%d: fsync %s: %s\n", fh->path, strerror(errno));
    if (ctx->setCompressedFlag) {
      if (fh->chflags(fh, kCompressedFlag) == -1) {
        PLZC_ERR("%s:%d: chflags %s: %s\n", fh->path, strerror(errno));
        keepData = true;
      }
      flagSet = true;
    }
    if (!keepData && fh->truncate(fh, 0) == -1) PLZC_ERR("%s:%d: truncate %s: %s\n", fh->path, strerror(errno));
    if (fh->utimes(fh, times) == -1) PLZC_ERR("%s:%d: utimes %s: %s\n", fh->path, strerror(errno));
  }
  if (ctx->setCompressedFlag && !flagSet && fh->chflags(fh, kCompressedFlag) == -1)
    PLZC_ERR("%s:%d: chflags %s: %s\n", fh->path, strerror(errno));
  if (ctx->verifyChecksums) {
    if (!checksumFile(path, after)) {
      PLZC_ERR("%s:%d: Error: Unable to checksum file '%s' after compression.\n", path);
      return -1;
    }
    if (memcmp(before, after, sizeof before) != 0) {
      PLZC_ERR("%s:%d: Error: File data after compression is different than before for file '%s'.", path);
      return -1;
    }
  }
  atomicAdd(&ctx->bytesCompressed, size);
  atomicAdd(&ctx->bytesCompressedRounded, roundedSize(size));
  atomicAdd(&ctx->filesCompressed, 1);
  return 0;
}

}  // namespace

int compressFile(CompressorContext *ctx, const char *path, FileHandle *fh) {
  PVMutableDictionaryRef dictionary = nullptr;
  if (!ctx->inPlace) dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  atomicAdd(&ctx->filesSeen, 1);
  if (!ctx->inPlace && !dictionary) return -1;
  bool ownsHandle = false;
  if (!fh) {
    fh = openFile(path, path, O_RDONLY);
    if (!fh) {
      PVRelease(dictionary);
      return -1;
    }
    ownsHandle = true;
  }
  int result = compressOpenFile(ctx, path, fh, dictionary);
  if (ownsHandle) fh->close(fh);
  PVRelease(dictionary);
  return result;
}

int checksumFile(const char *path, uint8_t digest[16]) {
  MD5_CTX md5;
  MD5Init(&md5);
  int fd = sys::open(path, O_RDONLY, 0);
  if (fd < 0) return 0;
  platform::Stat st;
  if (platform::fstat(fd, &st) != 0) {
    // Without the flags it is unknown where the data lives.
    PLZC_ERR("%s:%d: fstat %s: %s\n", path, strerror(errno));
    sys::close(fd);
    return 0;
  }
  if ((st.st_flags & kCompressedFlag) && !osSupportsDecmpfs()) {
    // The data fork of a compressed file is empty here: digest what every reader is given.
    sys::close(fd);
    FileHandle *fh = openFile(path, path, O_RDONLY);
    if (!fh) return 0;
    // Data that cannot be decompressed has no digest (decompressData said why).
    int decompressed = decompressData(fh, md5Writer, &md5);
    fh->close(fh);
    if (decompressed != 0) return 0;
  } else {
    uint8_t block[4096];
    ssize_t got;
    while ((got = sys::read(fd, block, sizeof block)) > 0) MD5Update(&md5, block, static_cast<size_t>(got));
    // The digest covers what was read; say why it ends early, as it will not match.
    if (got < 0) PLZC_ERR("%s:%d: read %s: %s\n", path, strerror(errno));
    sys::close(fd);
  }
  MD5Final(digest, &md5);
  return 1;
}
