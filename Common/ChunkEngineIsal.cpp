// The ISA-L igzip engine: the fastest compression, for users who want speed over size.
#include <isa-l.h>
#include <isa-l/igzip_lib.h>
#include <zlib.h>

#include <memory>

#include "Common/ChunkEngine.h"

namespace {

// The library's levels 1 to 9 (and -1, zlib's default) in igzip's levels 1 to 3.
int isalLevel(int level) {
  static constexpr int kLevels[10] = {1, 1, 1, 2, 2, 2, 3, 3, 3, 3};
  if (level == -1) return kLevels[6];
  return level >= 0 && level <= 9 ? kLevels[level] : -1;
}

uint32_t levelBufferSize(int isalLevel) {
  static constexpr uint32_t kSizes[4] = {ISAL_DEF_LVL0_DEFAULT, ISAL_DEF_LVL1_DEFAULT, ISAL_DEF_LVL2_DEFAULT,
                                         ISAL_DEF_LVL3_DEFAULT};
  return kSizes[isalLevel];
}

class IsalChunkEncoder final : public ChunkEncoder {
 public:
  explicit IsalChunkEncoder(int level) : level_(isalLevel(level)), storeOnly_(level == 0) {
    if (level_ < 0) return;
    levelBufferSize_ = levelBufferSize(level_);
    // Zeroed: igzip reads its hash tables before it has written all of them, so a buffer of
    // leftover bytes would make the same data compress to different streams from run to run.
    levelBuffer_.reset(new (std::nothrow) uint8_t[levelBufferSize_ ? levelBufferSize_ : 1]());
  }

  Result encode(const uint8_t *input, uint32_t count, uint8_t *output, uint32_t space, uint32_t *produced,
                int *code) override {
    *produced = 0;
    if (level_ < 0 || !levelBuffer_) {
      *code = level_ < 0 ? Z_STREAM_ERROR : Z_MEM_ERROR;
      return Result::Failed;
    }
    // Level 0 means no compression, as in zlib, whose level-0 stream is always larger than
    // its input: the chunk is stored. igzip's level 0 still compresses.
    if (storeOnly_) {
      *code = Z_OK;
      return Result::NoFit;
    }
    // Zeroed first: the stateless init leaves hist_bits unset, and igzip sizes its match window
    // from it, so whatever the stack held could change the stream made from the same bytes.
    isal_zstream stream{};
    isal_deflate_stateless_init(&stream);
    stream.level = static_cast<uint32_t>(level_);
    stream.level_buf = levelBuffer_.get();
    stream.level_buf_size = levelBufferSize_;
    stream.gzip_flag = IGZIP_ZLIB;
    stream.end_of_stream = 1;
    stream.flush = NO_FLUSH;
    stream.next_in = const_cast<uint8_t *>(input);
    stream.avail_in = count;
    stream.next_out = output;
    stream.avail_out = space;
    int result = isal_deflate_stateless(&stream);
    if (result == COMP_OK) {
      *produced = stream.total_out;
      *code = Z_STREAM_END;
      return Result::Fit;
    }
    if (result == STATELESS_OVERFLOW) {
      *code = Z_OK;
      return Result::NoFit;
    }
    *code = Z_STREAM_ERROR;
    return Result::Failed;
  }
  bool ready() const override { return level_ >= 0 && levelBuffer_; }

 private:
  int level_;
  bool storeOnly_;
  uint32_t levelBufferSize_ = 0;
  std::unique_ptr<uint8_t[]> levelBuffer_;
};

}  // namespace

#define PLZC_STRINGIFY2(x) #x
#define PLZC_STRINGIFY(x) PLZC_STRINGIFY2(x)
const char *isalVersion() {
  return PLZC_STRINGIFY(ISAL_MAJOR_VERSION) "." PLZC_STRINGIFY(ISAL_MINOR_VERSION) "." PLZC_STRINGIFY(ISAL_PATCH_VERSION);
}

std::unique_ptr<ChunkEncoder> makeIsalChunkEncoder(int level) { return std::make_unique<IsalChunkEncoder>(level); }
