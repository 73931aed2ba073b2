// Reading compressed forms the way the library's readers do, with every piece checked.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "Common/FileHandle.h"
#include "FuzzSupport.h"
#include "PropertyValue.h"

namespace plzcfuzz {

// The most logical bytes a target lets one decode produce; the writer stops it beyond.
constexpr uint64_t kDecodeLimit = 4 << 20;

// What decompressData handed out.
struct Decoded {
  int result = -1;
  Bytes data;            // every piece, in order
  bool stopped = false;  // the writer refused a piece past the limit
  bool operator==(const Decoded &) const = default;
};

// Both readers below run once with each engine this build has (zlib first) and fail the run
// when an engine's result or bytes differ from zlib's.
//
// Runs decompressData on handle with a writer that checks every piece (each follows the last
// without a gap and holds 1 to kDecompressPieceSize bytes) and keeps at most limit bytes. When header (the
// "com.tavix.decmpfs" value, or NULL when unknown) holds a whole header, a success must have
// produced exactly its logical size; a size that is negative as a signed 64-bit number
// produces nothing.
Decoded decodeAndCheck(FileHandle *handle, const Bytes *header, uint64_t limit = kDecodeLimit);

// Reads length bytes at offset with the type's doUncompress, the ranged read that a reader of
// part of a file makes, handing it header as decompressData does. Fails the run when the result
// is more than length. Returns the result; out gets the bytes produced.
int64_t readRange(FileHandle *handle, uint32_t type, const Bytes &header, uint64_t offset, uint64_t length, Bytes *out);

// A file with the given attributes and no data of its own: an overlay whose dictionary holds
// them, over a handle on an empty data pool, as the stream write-out holds a compressed form.
class MemoryAttributes {
 public:
  MemoryAttributes();
  ~MemoryAttributes();
  MemoryAttributes(const MemoryAttributes &) = delete;
  MemoryAttributes &operator=(const MemoryAttributes &) = delete;
  void set(const char *name, const Bytes &value);
  FileHandle *handle() const { return overlay_; }

 private:
  PVMutableDictionaryRef dictionary_;
  FileHandle *overlay_;
};

// ---- Compressed forms made by the library, for seeds -------------------------------------------

// The table of contents the library writes when it compresses files of these contents with
// these types (a list for initCompressor, such as "3" or "4"): a record for each file taken.
Bytes tableOfContents(const char *types, const std::vector<Bytes> &contents);

// The attributes the library gives a file of these contents with these types, name and bytes
// in the order written; empty when no type took the file.
std::vector<std::pair<std::string, Bytes>> compressedAttributes(const char *types, const Bytes &contents);

}  // namespace plzcfuzz
