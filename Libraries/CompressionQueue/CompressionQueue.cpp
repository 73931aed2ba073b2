// Compressing existing files in place, asynchronously, through the stream pipeline: each file
// is opened, read into a stream of a queue in in-place mode, and left to the pipeline.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/StreamCompressor.h"
#include "Common/ThrottlingAllocator.h"
#include "Common/WorkQueue.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"

static constexpr char kSourcePath[] = "Libraries/CompressionQueue/CompressionQueue";

namespace {

constexpr size_t kReadBufferSize = 65536;

// What the reading job needs; lives on the caller's stack, the job runs synchronously.
struct FileReader {
  int32_t fd;
  const char *path;
  StreamCompressor *stream;
  uint8_t success;
};

void fileReader(void *context) {
  auto *reader = static_cast<FileReader *>(context);
  uint8_t buffer[kReadBufferSize];
  ssize_t got;
  while ((got = sys::read(reader->fd, buffer, sizeof buffer)) > 0) {
    if (WriteToStreamCompressor(reader->stream, buffer, static_cast<uint64_t>(got)) != got) {
      // ENOSPC: the pipeline stopped taking this file (not compressed), which is no failure.
      if (errno != ENOSPC) {
        PLZC_ERR("%s:%d: WriteToStreamCompressor(%s): %s\n", reader->path, strerror(errno));
        reader->success = 0;
      }
      return;
    }
  }
  if (got == -1) {
    PLZC_ERR("%s:%d: read(%s): %s\n", reader->path, strerror(errno));
    reader->success = 0;
  }
}

}  // namespace

StreamCompressorQueue *CreateCompressionQueue(void *, void *, void *, void *, PVDictionaryRef options) {
  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(options);
  if (queue) StreamCompressorQueueSetInPlace(queue, 1);
  return queue;
}

int CompressFile(StreamCompressorQueue *queue, const char *path, const char *prefix) {
  int fd = waitThenDupOrOpen(path, -1);
  if (fd < 0) {
    PLZC_ERR("%s:%d: waitThenDupOrOpen '%s': %s\n", path, strerror(errno));
    return 0;
  }
  struct stat st;
  if (sys::fstat(fd, &st) != 0) {
    PLZC_ERR("%s:%d: open '%s': %s\n", path, strerror(errno));
    closeAndSignal(fd);
    return 0;
  }
  StreamCompressor *stream = CreateStreamCompressor(fd, path, prefix, queue, st.st_size);
  if (!stream) {
    closeAndSignal(fd);
    return 1;
  }
  FileReader reader = {fd, path, stream, 1};
  workQueueSync(StreamCompressorQueueGetIOQueue(queue), &reader, fileReader);
  int result = reader.success;
  if (CloseStreamCompressor(stream) != 0) {
    PLZC_ERR("%s:%d: CloseStreamCompressor: %s\n", strerror(errno));
    result = 0;
  }
  closeAndSignal(fd);
  return result;
}

void FinishCompressionAndCleanUp(StreamCompressorQueue *queue) {
  if (FinishStreamCompressorQueue(queue) != 0) PLZC_ERR("%s:%d: FinishStreamCompressorQueue: %s\n", strerror(errno));
}
