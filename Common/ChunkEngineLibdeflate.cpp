// The libdeflate engine: whole-buffer zlib-format streams, the default engine.
#include <libdeflate.h>
#include <zlib.h>

#include <cstring>
#include <memory>
#include <new>

#include "Common/ChunkEngine.h"
#include "Common/IncompressibleData.h"

namespace {

// The library's levels 0 to 9 (and -1, zlib's default 6) in libdeflate's levels: the lowest
// libdeflate level whose stored/logical ratio on the benchmark corpus is at least as good as
// zlib's at the same level (see the README for the measurements).
int libdeflateLevel(int level) {
  static constexpr int kLevels[10] = {0, 1, 1, 2, 3, 5, 6, 7, 7, 8};
  if (level == -1) return kLevels[6];
  return level >= 0 && level <= 9 ? kLevels[level] : -1;
}

class LibdeflateChunkEncoder final : public ChunkEncoder {
 public:
  explicit LibdeflateChunkEncoder(int level) {
    int mapped = libdeflateLevel(level);
    if (mapped < 0) {
      failure_ = Z_STREAM_ERROR;
      return;
    }
    compressor_ = libdeflate_alloc_compressor(mapped);
    if (!compressor_) failure_ = Z_MEM_ERROR;
  }
  ~LibdeflateChunkEncoder() override { libdeflate_free_compressor(compressor_); }

  Result encode(const uint8_t *input, uint32_t count, uint8_t *output, uint32_t space, uint32_t *produced,
                int *code) override {
    *produced = 0;
    if (!compressor_) {
      *code = failure_;
      return Result::Failed;
    }
    // Bytes that look random come out larger than they went in, whatever the engine: they
    // would be compressed only to be stored raw.
    if (space <= count && incompressible_.looksIncompressible(input, count)) {
      *code = Z_OK;
      return Result::NoFit;
    }
    if (memo_.holds(input, count)) return memo_.answer(output, space, produced, code);
    if (space < count && count <= kMemoLimit && memo_.ready()) {
      size_t whole = libdeflate_zlib_compress(compressor_, input, count, memo_.output.get(), count);
      memo_.record(input, count, static_cast<uint32_t>(whole));
      return memo_.answer(output, space, produced, code);
    }
    // libdeflate learns that a stream does not fit only after compressing all of its input,
    // where zlib stops as soon as its output is full. When the space is a small fraction of the
    // input (the small-file form, a few KiB for up to 128 KiB), a prefix is tried first: if
    // even that does not fit, the whole does not, and most of the work is saved.
    if (count / kProbeFactor > space) {
      if (libdeflate_zlib_compress(compressor_, input, uint64_t{space} * kProbeFactor, output, space) == 0) {
        *code = Z_OK;
        return Result::NoFit;
      }
    }
    size_t written = libdeflate_zlib_compress(compressor_, input, count, output, space);
    if (written == 0) {
      *code = Z_OK;
      return Result::NoFit;
    }
    *produced = static_cast<uint32_t>(written);
    *code = Z_STREAM_END;
    return Result::Fit;
  }
  bool ready() const override { return compressor_ != nullptr; }

 private:
  // The prefix tried first is this many times the space.
  static constexpr uint32_t kProbeFactor = 4;
  // Inputs up to this size are compressed whole when given a smaller space, and remembered.
  static constexpr uint32_t kMemoLimit = 65536;

  // The last input compressed for a space smaller than itself, with its whole stream. A small
  // file is tried in the small-file form first (a few KiB of space); when that fails, the
  // chunked form compresses the same bytes again for their full size. Same bytes, same level,
  // same stream: the second call copies the first's.
  struct Memo {
    std::unique_ptr<uint8_t[]> input, output;
    uint32_t count = 0;
    uint32_t produced = 0;  // 0: the stream is longer than the input
    bool valid = false;

    bool ready() {
      if (!input) input.reset(new (std::nothrow) uint8_t[kMemoLimit]);
      if (!output) output.reset(new (std::nothrow) uint8_t[kMemoLimit]);
      return input && output;
    }
    bool holds(const uint8_t *bytes, uint32_t length) const {
      return valid && length == count && memcmp(input.get(), bytes, length) == 0;
    }
    void record(const uint8_t *bytes, uint32_t length, uint32_t streamLength) {
      memcpy(input.get(), bytes, length);
      count = length;
      produced = streamLength;
      valid = true;
    }
    Result answer(uint8_t *out, uint32_t space, uint32_t *written, int *code) const {
      if (produced == 0 || produced > space) {
        *code = Z_OK;
        return Result::NoFit;
      }
      memcpy(out, output.get(), produced);
      *written = produced;
      *code = Z_STREAM_END;
      return Result::Fit;
    }
  };
  libdeflate_compressor *compressor_ = nullptr;
  int failure_ = Z_OK;
  IncompressibleCheck incompressible_;
  Memo memo_;
};

class LibdeflateChunkDecoder final : public WholeChunkDecoder {
 public:
  explicit LibdeflateChunkDecoder(uint32_t chunkSize)
      : WholeChunkDecoder(chunkSize), decompressor_(libdeflate_alloc_decompressor()) {}
  ~LibdeflateChunkDecoder() override { libdeflate_free_decompressor(decompressor_); }

 protected:
  bool decodeWhole(const uint8_t *chunk, uint32_t length, uint8_t *output, uint32_t capacity,
                   uint32_t *decoded) override {
    size_t got = 0;
    if (!decompressor_ ||
        libdeflate_zlib_decompress(decompressor_, chunk, length, output, capacity, &got) != LIBDEFLATE_SUCCESS)
      return false;
    *decoded = static_cast<uint32_t>(got);
    return true;
  }

 private:
  libdeflate_decompressor *decompressor_;
};

}  // namespace

// Linked statically (see Scripts/setup.sh): the header's version is the code's.
const char *libdeflateVersion() { return LIBDEFLATE_VERSION_STRING; }

std::unique_ptr<ChunkEncoder> makeLibdeflateChunkEncoder(int level) {
  return std::make_unique<LibdeflateChunkEncoder>(level);
}

std::unique_ptr<ChunkDecoder> makeLibdeflateChunkDecoder(uint32_t chunkSize) {
  return std::make_unique<LibdeflateChunkDecoder>(chunkSize);
}
