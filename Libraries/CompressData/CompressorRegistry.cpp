// The table of compression types and the compressor context built from a list of them.
#include "Libraries/CompressData/CompressorRegistry.h"

#include <fcntl.h>
#include <libgen.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/pathUtils.h"
#include "Compressors/Zlib/Type3/compressorType3.h"
#include "Compressors/Zlib/Type4/compressorType4.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"

static constexpr char kSourcePath[] = "Libraries/CompressData/CompressData";

const CompressorOps allCompressors[kRegisteredCompressors] = {
    {nullptr, nullptr, nullptr, nullptr, 0},
    {nullptr, nullptr, nullptr, nullptr, 0},
    {nullptr, nullptr, nullptr, nullptr, 0},
    {initCompressorType3, freeContextType3, compressFileType3, doUncompressType3, kType3ChunkSize},
    {initCompressorType4, freeContextType4, compressFileType4, doUncompressType4, kType4ChunkSize},
};

const CompressorOps *compressorForReading(uint32_t compressionType) {
  if (compressionType >= kRegisteredCompressors || !allCompressors[compressionType].doUncompress) return nullptr;
  return &allCompressors[compressionType];
}

// The first missing operation of a row (slot 0 to 3), or -1 when the row is complete.
static int firstMissingOperation(const CompressorOps &row) {
  const void *slots[] = {reinterpret_cast<const void *>(row.init), reinterpret_cast<const void *>(row.freeContext),
                         reinterpret_cast<const void *>(row.compressFile),
                         reinterpret_cast<const void *>(row.doUncompress)};
  for (int slot = 0; slot < 4; slot++)
    if (!slots[slot]) return slot;
  return -1;
}

// Parses the comma-separated list into the context's entries; false when any token is bad
// (every token is examined and each bad one reported).
static bool parseCompressorList(CompressorContext *ctx, const char *compressorList) {
  char *copy = sys::strdup(compressorList);
  if (!copy) return true;  // no compressors: every file counts as not compressed
  bool ok = true;
  char *cursor = copy;
  for (char *token = strsep(&cursor, ","); token; token = strsep(&cursor, ",")) {
    int type = atoi(token);
    if (type >= kRegisteredCompressors || type < 0) {
      printf("compressor %d is out of bounds, only %d compressors registered\n", type, kRegisteredCompressors);
      ok = false;
      continue;
    }
    int missing = firstMissingOperation(allCompressors[type]);
    if (missing >= 0) {
      printf("function %d of compressor %d is NULL\n", missing, type);
      ok = false;
      continue;
    }
    if (ctx->compressorCount == kMaxCompressorEntries) {
      printf("compressor list has more than %d entries\n", kMaxCompressorEntries);
      ok = false;
      continue;
    }
    ctx->compressors[ctx->compressorCount] = &allCompressors[type];
    ctx->compressorTypes[ctx->compressorCount] = static_cast<uint32_t>(type);
    ctx->compressorCount++;
  }
  fflush(stdout);
  free(copy);
  return ok;
}

CompressorContext *initCompressor(const char *compressorList, void *initArg1, void *initArg2, const char *tocPath,
                                  bool verifyChecksums, int32_t compressionLevel, bool allowLargeResourceForks) {
  auto *ctx = static_cast<CompressorContext *>(sys::calloc(1, sizeof(CompressorContext)));
  if (!ctx) return nullptr;
  pthread_mutex_init(&ctx->tocLock, nullptr);
  ctx->verifyChecksums = verifyChecksums;
  ctx->tocFd = -1;
  if (tocPath) {
    char *copy = sys::strdup(tocPath);
    if (!copy || mkdirRecursive(dirname(copy)) != 0) {
      PLZC_ERR("%s:%d: mkdirRecursive %s: %s\n", tocPath, strerror(errno));
      free(copy);
      freeCompressor(ctx);
      return nullptr;
    }
    free(copy);
    ctx->tocFd = sys::open(tocPath, O_RDWR | O_CREAT | O_TRUNC, 0666);
    if (ctx->tocFd < 0) {
      int savedErrno = errno;
      freeCompressor(ctx);
      errno = savedErrno;
      return nullptr;
    }
  } else {
    ctx->inPlace = ctx->truncateAndRestoreTimes = ctx->setCompressedFlag = 1;
  }
  ctx->compressionLevel = compressionLevel;
  ctx->allowLargeResourceForks = allowLargeResourceForks;

  if (!parseCompressorList(ctx, compressorList)) {
    fprintf(stderr, "error setting up compressor list\n");
    ctx->compressorCount = 0;  // no per-type contexts exist yet
    freeCompressor(ctx);
    return nullptr;
  }
  ctx->compressorContexts = static_cast<void **>(sys::calloc(ctx->compressorCount ? ctx->compressorCount : 1, sizeof(void *)));
  ctx->successCounts = static_cast<uint32_t *>(sys::calloc(ctx->compressorCount ? ctx->compressorCount : 1, sizeof(uint32_t)));
  if (!ctx->compressorContexts || !ctx->successCounts) {
    ctx->compressorCount = 0;
    freeCompressor(ctx);
    errno = ENOMEM;
    return nullptr;
  }
  for (int i = 0; i < ctx->compressorCount; i++) {
    ctx->compressorContexts[i] =
        ctx->compressors[i]->init(initArg1, initArg2, compressionLevel, allowLargeResourceForks ? 1 : 0);
    if (!ctx->compressorContexts[i]) {  // a type that cannot set up fails the whole context
      ctx->compressorCount = i;
      freeCompressor(ctx);
      errno = ENOMEM;
      return nullptr;
    }
  }
  return ctx;
}

void freeCompressor(CompressorContext *ctx) {
  if (!ctx) return;
  pthread_mutex_destroy(&ctx->tocLock);
  if (ctx->compressorContexts)
    for (int i = 0; i < ctx->compressorCount; i++) ctx->compressors[i]->freeContext(ctx->compressorContexts[i]);
  if (ctx->tocFd != -1) sys::close(ctx->tocFd);
  free(ctx->compressorContexts);
  free(ctx->successCounts);
  free(ctx);
}
