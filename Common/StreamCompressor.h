// The stream pipeline inside the library: the queue and stream records, and the calls that the
// compression queue uses. The exported calls are declared in Plenzo.h.
//
// A queue holds the policy (rules, Mach-O filter, types and level, switches), one compressor
// context shared by its streams, and its work queues: compression items run on the global
// high-priority pool inside the queue's group; write-outs run one at a time on the queue's
// serial I/O queue, most of them handed over in order by its serial manager queue. Three
// counters (enqueued, started, completed) let the finish prove that every item ran to its end,
// and the last error any stage recorded fails every later write, close and the finish.
#pragma once

#include <stdint.h>

#include <atomic>
#include <mutex>

#include "Common/CompressionRules.h"
#include "Common/DataPool.h"
#include "Common/FileHandle.h"
#include "Common/WorkQueue.h"
#include "Libraries/CompressData/CompressorRegistry.h"
#include "Plenzo.h"
#include "PropertyValue.h"

struct StreamCompressorQueue {
  std::atomic<int32_t> refCount{1};  // the creator's, plus one per live stream
  int32_t initialized = 0;
  int32_t finished = 0;
  int32_t inPlace = 0;
  int32_t ignoreXattrErrors = 0;
  int32_t throttledIO = 0;
  std::atomic<int32_t> error{0};  // the last errno recorded by any stage; never cleared
  uint32_t skipMachOTypeMask = 0;
  PVDictionaryRef skipMachOOverridePaths = nullptr;
  CompressorContext *compressor = nullptr;
  WorkGroup *group = nullptr;
  std::atomic<int32_t> enqueued{0};
  std::atomic<int32_t> started{0};
  std::atomic<int32_t> completed{0};
  PVDictionaryRef options = nullptr;
  CompressionRules *rules = nullptr;
  WorkQueue *ioQueue = nullptr;
  WorkQueue *managerQueue = nullptr;
  // Lazy initialisation may be reached by the first streams of several callers at once.
  std::mutex initLock;
};

struct StreamCompressor {
  std::atomic<int32_t> refCount{1};  // the caller's (dropped by close) and the pipeline's
  char *path = nullptr;
  char *prefix = nullptr;
  int32_t fd = -1;  // own duplicate of the caller's descriptor, charged to the budget
  int64_t expectedSize = 0;  // the size announced at creation
  StreamCompressorQueue *queue = nullptr;
  DataPool *pool = nullptr;
  FileHandle *poolHandle = nullptr;  // kept by a failed compression for the plain write-out
  FileHandle *handle = nullptr;      // what the write-out reads
  PVMutableDictionaryRef tocDict = nullptr;  // the compressed form's attributes
};

// In-place mode: existing files are compressed, and left alone when they are not. Set before
// the first stream.
void StreamCompressorQueueSetInPlace(StreamCompressorQueue *queue, int inPlace);

// The queue's serial I/O queue (NULL before the first stream): work run on it synchronously
// never overlaps the queue's write-outs.
WorkQueue *StreamCompressorQueueGetIOQueue(StreamCompressorQueue *queue);

// What the finish compared once every item had run: items submitted, begun and ended, and the
// errno recorded by any stage (0 for none).
struct StreamQueueCounts {
  int32_t enqueued = 0;
  int32_t started = 0;
  int32_t completed = 0;
  int32_t error = 0;
};

// FinishStreamCompressorQueue that also hands back, in *counts (unless NULL), the counters it
// compared, so that callers can report what the pipeline did.
int _SQFinishWithCounts(StreamCompressorQueue *queue, StreamQueueCounts *counts);

// WriteToStreamCompressor with the bytes read from fd (at its offset) straight into the
// stream's pool, saving a copy through a buffer of the caller's: up to count bytes, fewer only
// when the file ends first; -1 with read's errno, or as WriteToStreamCompressor fails.
int64_t WriteFileToStreamCompressor(StreamCompressor *stream, int fd, uint64_t count);

// Builds rules, compressor context, group and serial queues on the first stream; true when the
// queue is (or already was) initialised.
bool _SQLazyInit(StreamCompressorQueue *queue);
void _SQRelease(StreamCompressorQueue *queue);
void _SCRelease(StreamCompressor *stream);
// A new pool file handle on the stream's pool, named "data pool for <path>".
FileHandle *_SCHandleForPool(StreamCompressor *stream);
