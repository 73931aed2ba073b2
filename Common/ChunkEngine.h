// The deflate engines behind the chunking engine.
//
// Every engine writes the same on-disk form: each chunk is one complete zlib-format stream
// (header, deflate data, Adler-32), and every engine reads what any other wrote. They differ
// only in speed and, slightly, in how small they make a chunk at a given level. zlib is the
// reference engine and is always built; libdeflate (the default) and ISA-L igzip (the fast
// engine) are built unless the build turns the optional engines off. The ISA-L engine decodes
// through libdeflate: igzip's inflate accepts some damaged streams that zlib refuses.
//
// The engine of a process is PLZC_ENGINE ("zlib", "libdeflate" or "isal") when set and built,
// else the build's default; setChunkEngine() overrides both (the tool's --engine, tests).
#pragma once

#include <stdint.h>

#include <memory>

enum class ChunkEngine : int { Zlib, Libdeflate, Isal };

// The engine that encoders and decoders are made for by default.
ChunkEngine currentChunkEngine();
// Makes engine the process's engine from now on. Returns false (and changes nothing) when the
// engine is not built into this library.
bool setChunkEngine(ChunkEngine engine);
bool chunkEngineBuilt(ChunkEngine engine);
// "zlib", "libdeflate", "isal".
const char *chunkEngineName(ChunkEngine engine);
// The version of the library behind the engine ("1.23"), as built in; "" when not built.
const char *chunkEngineVersion(ChunkEngine engine);
// Parses an engine name; false for a name that is not one of the three.
bool chunkEngineFromName(const char *name, ChunkEngine *engine);

// Compresses chunks into zlib-format streams, one call per chunk.
class ChunkEncoder {
 public:
  enum class Result { Fit, NoFit, Failed };
  // An encoder of the engine at the library's level (0 to 9, -1 for zlib's default); each engine
  // maps the level to its own (see the README for the mapping and its measurements).
  static std::unique_ptr<ChunkEncoder> create(ChunkEngine engine, int level);
  virtual ~ChunkEncoder() = default;

  // Compresses count bytes into one complete stream of at most space bytes. Fit: the stream is
  // in output, *produced bytes long. NoFit: it would not fit (the caller stores the chunk raw).
  // Failed: the engine could not run (bad level, no memory); *code gets zlib's result code for
  // that case (Z_STREAM_ERROR, Z_MEM_ERROR).
  virtual Result encode(const uint8_t *input, uint32_t count, uint8_t *output, uint32_t space, uint32_t *produced,
                        int *code) = 0;
  // False when the encoder could not be set up: every encode() then fails.
  virtual bool ready() const = 0;
};

// An encoder of the engine and level kept by the calling thread for its later files, so that
// compressing many small files does not build and free an encoder (libdeflate's and igzip's
// hold hundreds of KiB of tables) for every file. An encoder's streams do not depend on what
// it compressed before. One that is not ready is never kept; a thread that leases again while
// holding a lease gets an encoder of its own for that lease.
class ChunkEncoderLease {
 public:
  ChunkEncoderLease(ChunkEngine engine, int level);
  ~ChunkEncoderLease();
  ChunkEncoderLease(const ChunkEncoderLease &) = delete;
  ChunkEncoderLease &operator=(const ChunkEncoderLease &) = delete;
  ChunkEncoder *operator->() const { return encoder_; }

 private:
  ChunkEncoder *encoder_;
  std::unique_ptr<ChunkEncoder> own_;  // nested, or not ready
  bool *leased_ = nullptr;  // the kept coder's flag, while this lease holds it
};

class ChunkDecoder;

// A decoder of the engine kept by the calling thread for its later reads, so that reading a
// file in many small pieces does not build and free a decoder (and its buffers) for every
// piece. Released when the lease ends; a thread that leases again while holding a lease (a
// nested read) gets a decoder of its own for that lease.
class ChunkDecoderLease {
 public:
  ChunkDecoderLease(ChunkEngine engine, uint32_t chunkSize);
  ~ChunkDecoderLease();
  ChunkDecoderLease(const ChunkDecoderLease &) = delete;
  ChunkDecoderLease &operator=(const ChunkDecoderLease &) = delete;
  ChunkDecoder *operator->() const { return decoder_; }

 private:
  ChunkDecoder *decoder_;
  std::unique_ptr<ChunkDecoder> own_;  // the nested case
  bool *leased_ = nullptr;  // the kept coder's flag, while this lease holds it
};

// Decodes one chunk at a time, in pieces: begin() starts a chunk, decodeInto() fills the next
// bytes. Engines that cannot stop part-way decode the chunk whole into a buffer of their own
// and copy out; a chunk they cannot decode whole is handed to zlib, so a damaged chunk has
// exactly the outcome it has with zlib (zlib decodes as far as it is read).
class ChunkDecoder {
 public:
  // chunkSize bounds what one chunk decodes to.
  static std::unique_ptr<ChunkDecoder> create(ChunkEngine engine, uint32_t chunkSize);
  virtual ~ChunkDecoder() = default;

  // Starts a chunk; its bytes must stay in place until the chunk is done.
  virtual void begin(const uint8_t *chunk, uint32_t length) = 0;
  // Decodes the chunk's next bytes into space bytes at output. Returns false when the chunk is
  // bad (*code gets zlib's result code: Z_DATA_ERROR and so on); true when output filled up or
  // the chunk ended (then *code is Z_STREAM_END). *produced gets the bytes written.
  virtual bool decodeInto(uint8_t *output, uint32_t space, uint32_t *produced, int *code) = 0;
  // True once the chunk has given all its bytes (or all its input was consumed).
  virtual bool chunkDone() const = 0;
  // Prints zlib's decode of a bad chunk byte by byte when DUMP_BAD_CHUNKS is set.
  virtual void dump(const uint8_t *chunk, uint32_t length) = 0;
};

// The base of the engines that can only decode a chunk whole: the first decodeInto() of a
// chunk decodes it straight into the caller's space when it fits there, else into a buffer of
// chunkSize bytes that later calls copy from; a chunk that does not decode whole (damaged, or
// larger than chunkSize) goes to a zlib decoder instead.
class WholeChunkDecoder : public ChunkDecoder {
 public:
  explicit WholeChunkDecoder(uint32_t chunkSize);
  ~WholeChunkDecoder() override;
  void begin(const uint8_t *chunk, uint32_t length) final;
  bool decodeInto(uint8_t *output, uint32_t space, uint32_t *produced, int *code) final;
  bool chunkDone() const final;
  void dump(const uint8_t *chunk, uint32_t length) final;

 protected:
  // Decodes one whole zlib stream into at most capacity bytes; false when it cannot.
  virtual bool decodeWhole(const uint8_t *chunk, uint32_t length, uint8_t *output, uint32_t capacity,
                           uint32_t *decoded) = 0;

 private:
  std::unique_ptr<uint8_t[]> buffer_;
  uint32_t capacity_;
  const uint8_t *chunk_ = nullptr;  // the chunk begun, decoded on the first decodeInto()
  uint32_t length_ = 0;
  bool started_ = false;
  uint32_t decoded_ = 0, delivered_ = 0;
  std::unique_ptr<ChunkDecoder> zlib_;
  bool useZlib_ = false;
};

// The zlib implementations, also the fallback of the others.
std::unique_ptr<ChunkEncoder> makeZlibChunkEncoder(int level);
std::unique_ptr<ChunkDecoder> makeZlibChunkDecoder();
#if PLZC_HAVE_LIBDEFLATE
std::unique_ptr<ChunkEncoder> makeLibdeflateChunkEncoder(int level);
std::unique_ptr<ChunkDecoder> makeLibdeflateChunkDecoder(uint32_t chunkSize);
const char *libdeflateVersion();
#endif
#if PLZC_HAVE_ISAL
std::unique_ptr<ChunkEncoder> makeIsalChunkEncoder(int level);
const char *isalVersion();
#endif
