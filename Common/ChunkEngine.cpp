// Engine choice and the zlib engine, the reference the others are measured against.
#include "Common/ChunkEngine.h"

#include <zlib.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

namespace {

// The zlib version the chunk streams are set up with; zlib only checks its major number.
constexpr char kZlibVersion[] = "1.2.5";

constexpr const char *kEngineNames[] = {"zlib", "libdeflate", "isal"};

#if PLZC_HAVE_LIBDEFLATE
constexpr ChunkEngine kBuildDefault = ChunkEngine::Libdeflate;
#else
constexpr ChunkEngine kBuildDefault = ChunkEngine::Zlib;
#endif

std::atomic<int> gEngine{-1};  // -1: not chosen yet
std::once_flag gEnvironmentRead;

// PLZC_ENGINE is read once; a name that is unknown or not built is reported and
// the build's default used, so a typo never stops a program that links the library.
void readEnvironment() {
  ChunkEngine engine = kBuildDefault;
  const char *name = getenv("PLZC_ENGINE");
  if (name && *name) {
    ChunkEngine named;
    if (!chunkEngineFromName(name, &named)) {
      fprintf(stderr, "plenzo: PLZC_ENGINE=%s is not an engine (zlib, libdeflate, isal); using %s\n", name,
              chunkEngineName(engine));
    } else if (!chunkEngineBuilt(named)) {
      fprintf(stderr, "plenzo: PLZC_ENGINE=%s is not built into this library; using %s\n", name,
              chunkEngineName(engine));
    } else {
      engine = named;
    }
  }
  int unset = -1;
  gEngine.compare_exchange_strong(unset, static_cast<int>(engine));
}

// Prints the inflate of a bad chunk byte by byte on standard output, when DUMP_BAD_CHUNKS is
// set, so that one can see how far the chunk decodes before it goes wrong.
void dumpBadChunk(z_stream *stream, const uint8_t *data, uint32_t length) {
  if (!getenv("DUMP_BAD_CHUNKS")) return;
  inflateReset(stream);
  stream->next_in = const_cast<Bytef *>(data);
  stream->avail_in = length;
  printf("processing chunk of %d bytes\n", static_cast<int>(length));
  int emitted = 0;
  while (stream->avail_in > 0) {
    uint8_t byte = 0;
    uInt inputBefore = stream->avail_in;
    stream->next_out = &byte;
    stream->avail_out = 1;
    int result = inflate(stream, Z_SYNC_FLUSH);
    bool gotByte = stream->avail_out == 0;
    if (gotByte) {
      emitted++;
      printf("emitted byte %6d %02x (%c), zret % d, avail_in %6llu (pos %6llu)\n", emitted, byte,
             byte >= 0x20 && byte <= 0x7E ? byte : '.', result, static_cast<unsigned long long>(stream->avail_in),
             static_cast<unsigned long long>(length - stream->avail_in));
    }
    // A call that neither consumed input nor produced a byte would repeat forever.
    bool stalled = !gotByte && stream->avail_in == inputBefore;
    if ((result != Z_OK && result != Z_BUF_ERROR) || stalled) {
      printf("got % d, avail_in %6llu\n", result, static_cast<unsigned long long>(stream->avail_in));
      break;
    }
  }
  printf("\n");
  fflush(stdout);
}

// One deflate stream for a whole run, reset for every chunk.
class ZlibChunkEncoder final : public ChunkEncoder {
 public:
  // A level zlib rejects leaves the stream unusable; every chunk then fails with its code.
  explicit ZlibChunkEncoder(int level)
      : ready_(deflateInit_(&stream_, level, kZlibVersion, static_cast<int>(sizeof stream_)) == Z_OK) {}
  ~ZlibChunkEncoder() override { deflateEnd(&stream_); }

  Result encode(const uint8_t *input, uint32_t count, uint8_t *output, uint32_t space, uint32_t *produced,
                int *code) override {
    deflateReset(&stream_);
    stream_.next_in = const_cast<Bytef *>(input);
    stream_.avail_in = count;
    stream_.next_out = output;
    stream_.avail_out = space;
    *code = ready_ ? deflate(&stream_, Z_FINISH) : Z_STREAM_ERROR;
    *produced = ready_ ? space - stream_.avail_out : 0;
    if (*code == Z_STREAM_END) return Result::Fit;
    // A single Z_FINISH call that filled its whole output did not fit; stopping short of it
    // means deflate itself failed.
    if (ready_ && *produced == space && (*code == Z_OK || *code == Z_BUF_ERROR)) return Result::NoFit;
    return Result::Failed;
  }
  bool ready() const override { return ready_; }

 private:
  z_stream stream_{};
  bool ready_;
};

// One inflate stream for a whole run; begin() starts each chunk.
class ZlibChunkDecoder final : public ChunkDecoder {
 public:
  ZlibChunkDecoder() { inflateInit_(&stream_, kZlibVersion, static_cast<int>(sizeof stream_)); }
  ~ZlibChunkDecoder() override { inflateEnd(&stream_); }

  void begin(const uint8_t *chunk, uint32_t length) override {
    inflateReset(&stream_);
    stream_.next_in = const_cast<Bytef *>(chunk);
    stream_.avail_in = length;
    ended_ = false;
  }
  bool decodeInto(uint8_t *output, uint32_t space, uint32_t *produced, int *code) override {
    stream_.next_out = output;
    stream_.avail_out = space;
    *code = inflate(&stream_, Z_FINISH);
    *produced = space - stream_.avail_out;
    if (*code == Z_STREAM_END) ended_ = true;
    // Running out of room is expected; stopping with room left, or any zlib error (a bad
    // checksum is found even when the output has just filled), means the chunk is bad.
    if (*code == Z_STREAM_END) return true;
    return (*code == Z_OK || *code == Z_BUF_ERROR) && stream_.avail_out == 0;
  }
  bool chunkDone() const override { return ended_ || stream_.avail_in == 0; }
  void dump(const uint8_t *chunk, uint32_t length) override { dumpBadChunk(&stream_, chunk, length); }

 private:
  z_stream stream_{};
  bool ended_ = false;
};

}  // namespace

ChunkEngine currentChunkEngine() {
  std::call_once(gEnvironmentRead, readEnvironment);
  int engine = gEngine.load(std::memory_order_relaxed);
  return engine < 0 ? kBuildDefault : static_cast<ChunkEngine>(engine);
}

// The variable is read when the library is loaded, so that a bad name is reported at once, not
// in the middle of the first file's messages.
[[maybe_unused]] static const ChunkEngine gEngineAtLoad = currentChunkEngine();

bool setChunkEngine(ChunkEngine engine) {
  if (!chunkEngineBuilt(engine)) return false;
  gEngine.store(static_cast<int>(engine), std::memory_order_relaxed);
  return true;
}

bool chunkEngineBuilt(ChunkEngine engine) {
  switch (engine) {
    case ChunkEngine::Zlib:
      return true;
    case ChunkEngine::Libdeflate:
      return PLZC_HAVE_LIBDEFLATE != 0;
    case ChunkEngine::Isal:
      return PLZC_HAVE_ISAL != 0;
  }
  return false;
}

const char *chunkEngineVersion(ChunkEngine engine) {
  switch (engine) {
    case ChunkEngine::Zlib:
      return zlibVersion();
    case ChunkEngine::Libdeflate:
#if PLZC_HAVE_LIBDEFLATE
      return libdeflateVersion();
#else
      return "";
#endif
    case ChunkEngine::Isal:
#if PLZC_HAVE_ISAL
      return isalVersion();
#else
      return "";
#endif
  }
  return "";
}

const char *chunkEngineName(ChunkEngine engine) {
  int index = static_cast<int>(engine);
  return index >= 0 && index < 3 ? kEngineNames[index] : "unknown";
}

bool chunkEngineFromName(const char *name, ChunkEngine *engine) {
  for (int i = 0; i < 3; i++) {
    if (strcmp(name, kEngineNames[i]) == 0) {
      *engine = static_cast<ChunkEngine>(i);
      return true;
    }
  }
  return false;
}

WholeChunkDecoder::WholeChunkDecoder(uint32_t chunkSize)
    : buffer_(new uint8_t[chunkSize]), capacity_(chunkSize), zlib_(makeZlibChunkDecoder()) {}

WholeChunkDecoder::~WholeChunkDecoder() = default;

void WholeChunkDecoder::begin(const uint8_t *chunk, uint32_t length) {
  chunk_ = chunk;
  length_ = length;
  decoded_ = delivered_ = 0;
  started_ = useZlib_ = false;
}

bool WholeChunkDecoder::decodeInto(uint8_t *output, uint32_t space, uint32_t *produced, int *code) {
  if (!started_) {
    started_ = true;
    // Straight into the caller's space when the whole chunk fits there (a whole-chunk read):
    // no copy. When it does not fit, the engine stops once the space is full, so the failed
    // try costs no more than the bytes asked for.
    uint32_t direct = 0;
    if (decodeWhole(chunk_, length_, output, std::min(space, capacity_), &direct)) {
      decoded_ = delivered_ = direct;
      *produced = direct;
      *code = Z_STREAM_END;
      return true;
    }
    useZlib_ = !decodeWhole(chunk_, length_, buffer_.get(), capacity_, &decoded_);
    if (useZlib_) zlib_->begin(chunk_, length_);
  }
  if (useZlib_) return zlib_->decodeInto(output, space, produced, code);
  uint32_t step = std::min(space, decoded_ - delivered_);
  memcpy(output, buffer_.get() + delivered_, step);
  delivered_ += step;
  *produced = step;
  *code = delivered_ == decoded_ ? Z_STREAM_END : Z_OK;
  return true;
}

bool WholeChunkDecoder::chunkDone() const {
  if (!started_) return false;
  return useZlib_ ? zlib_->chunkDone() : delivered_ == decoded_;
}

void WholeChunkDecoder::dump(const uint8_t *chunk, uint32_t length) { zlib_->dump(chunk, length); }

namespace {

// A thread's kept coders: one for each of the last two engine and setting (chunk size or
// level) pairs asked for, since reading a tree alternates between type 3's and type 4's chunk
// sizes.
template <typename Coder>
struct KeptCoders {
  struct Kept {
    std::unique_ptr<Coder> coder;
    ChunkEngine engine = ChunkEngine::Zlib;
    int64_t setting = -1;
    bool leased = false;
  };
  Kept kept[2];
  int replaceNext = 0;

  // Leases the kept coder made for engine and setting when there is one and it is free, else
  // makes one with make() and keeps it when its slot is free and keepIt(it) says so. Sets
  // *leased to the slot's flag when a kept coder was leased; *own holds a coder not kept.
  template <typename Make, typename KeepIt>
  Coder *lease(ChunkEngine engine, int64_t setting, Make make, KeepIt keepIt, std::unique_ptr<Coder> *own,
               bool **leased) {
    Kept *slot = nullptr;
    for (Kept &each : kept)
      if (each.coder && each.engine == engine && each.setting == setting) slot = &each;
    if (slot && !slot->leased) {
      slot->leased = true;
      *leased = &slot->leased;
      return slot->coder.get();
    }
    *own = make();
    if (!slot) {
      slot = &kept[replaceNext];
      replaceNext = (replaceNext + 1) % 2;
    }
    if (slot->leased || !keepIt(**own)) return own->get();
    slot->coder = std::move(*own);
    slot->engine = engine;
    slot->setting = setting;
    slot->leased = true;
    *leased = &slot->leased;
    return slot->coder.get();
  }
};
thread_local KeptCoders<ChunkDecoder> tKeptDecoders;
thread_local KeptCoders<ChunkEncoder> tKeptEncoders;

}  // namespace

ChunkDecoderLease::ChunkDecoderLease(ChunkEngine engine, uint32_t chunkSize) {
  decoder_ = tKeptDecoders.lease(
      engine, chunkSize, [&] { return ChunkDecoder::create(engine, chunkSize); },
      [](const ChunkDecoder &) { return true; }, &own_, &leased_);
}

ChunkDecoderLease::~ChunkDecoderLease() {
  if (leased_) *leased_ = false;
}

ChunkEncoderLease::ChunkEncoderLease(ChunkEngine engine, int level) {
  encoder_ = tKeptEncoders.lease(
      engine, level, [&] { return ChunkEncoder::create(engine, level); },
      [](const ChunkEncoder &made) { return made.ready(); }, &own_, &leased_);
}

ChunkEncoderLease::~ChunkEncoderLease() {
  if (leased_) *leased_ = false;
}

std::unique_ptr<ChunkEncoder> makeZlibChunkEncoder(int level) { return std::make_unique<ZlibChunkEncoder>(level); }
std::unique_ptr<ChunkDecoder> makeZlibChunkDecoder() { return std::make_unique<ZlibChunkDecoder>(); }

std::unique_ptr<ChunkEncoder> ChunkEncoder::create(ChunkEngine engine, int level) {
  switch (engine) {
#if PLZC_HAVE_LIBDEFLATE
    case ChunkEngine::Libdeflate:
      return makeLibdeflateChunkEncoder(level);
#endif
#if PLZC_HAVE_ISAL
    case ChunkEngine::Isal:
      return makeIsalChunkEncoder(level);
#endif
    default:
      return makeZlibChunkEncoder(level);
  }
}

#if PLZC_HAVE_ISAL && !PLZC_HAVE_LIBDEFLATE
#error "the isal engine decodes through libdeflate"
#endif

std::unique_ptr<ChunkDecoder> ChunkDecoder::create(ChunkEngine engine, uint32_t chunkSize) {
  switch (engine) {
#if PLZC_HAVE_LIBDEFLATE
    // igzip's inflate accepts streams that zlib refuses: a dynamic block whose distance code set
    // is incomplete decodes under igzip and fails under zlib ("invalid distances set"), so a
    // damaged chunk would read back under the isal engine where zlib reports it. That engine
    // therefore decodes through libdeflate, whose outcomes are zlib's; igzip only compresses.
    case ChunkEngine::Isal:
    case ChunkEngine::Libdeflate:
      return makeLibdeflateChunkDecoder(chunkSize);
#endif
    default:
      return makeZlibChunkDecoder();
  }
}
