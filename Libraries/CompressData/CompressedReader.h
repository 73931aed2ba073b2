// Random access to the logical bytes of a compressed file: the header attribute is read and
// checked once, then any chunk is decoded on demand through the type's own reader, which
// checks every table entry and chunk it uses. decompressData reads whole files through it.
#pragma once

#include <stdint.h>

#include <memory>

#include "Common/FileHandle.h"
#include "Libraries/CompressData/DiskHeader.h"

struct CompressorOps;

namespace plzc {

class CompressedReader {
 public:
  enum class Status {
    Ok,
    Unreadable,       // the header attribute is missing or cannot be read (errno says why)
    Oversized,        // larger than any header a writer makes: damaged (errno EINVAL)
    ShortHeader,      // shorter than the 16-byte header
    WrongMagic,
    UnsupportedType,  // a type this build cannot decode
    NoMemory,
  };

  // What open found, also when it failed: the header (zeros when shorter) and the attribute's
  // length (-1 when it could not be read).
  struct Found {
    DiskHeader header{};
    int64_t attributeSize = -1;
  };

  // Reads the header attribute of the file behind fh, which must outlive the reader. On any
  // status other than Ok, *reader is left empty.
  static Status open(FileHandle *fh, std::unique_ptr<CompressedReader> *reader, Found *found = nullptr);
  ~CompressedReader();
  CompressedReader(const CompressedReader &) = delete;
  CompressedReader &operator=(const CompressedReader &) = delete;

  uint32_t type() const { return header_.compressionType; }
  uint64_t logicalSize() const { return header_.uncompressedSize; }
  // Logical bytes per chunk, the unit readChunk decodes.
  uint32_t chunkSize() const { return chunkSize_; }
  uint64_t chunkCount() const { return (header_.uncompressedSize + chunkSize_ - 1) / chunkSize_; }
  // Bytes of chunk index: chunkSize(), less for the last chunk, 0 past the end.
  uint32_t chunkLength(uint64_t index) const;

  // Decodes up to count bytes from offset into out. Bytes produced (fewer only when the stored
  // data ends early), or -1 after the type printed why. Safe to call from several threads.
  int64_t read(int64_t offset, uint64_t count, uint8_t *out) const;
  // Decodes chunk index whole into out (chunkLength(index) bytes of room). The chunk's length,
  // or -1 with errno EIO when it is damaged or missing.
  int64_t readChunk(uint64_t index, uint8_t *out) const;

 private:
  CompressedReader() = default;

  FileHandle *fh_ = nullptr;
  const CompressorOps *row_ = nullptr;
  AttrBuffer *attribute_ = nullptr;  // the header attribute as the decoders take it
  uint64_t attributeBlockSize_ = 0;
  DiskHeader header_{};
  uint32_t chunkSize_ = 0;
};

}  // namespace plzc
