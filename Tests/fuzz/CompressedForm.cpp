#include "CompressedForm.h"

#include <sys/uio.h>

#include <algorithm>
#include <cstring>

#include "Common/ChunkEngine.h"
#include "Common/DataPool.h"
#include "Common/OverlayFile.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/CompressorRegistry.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Plenzo.h"
#include "Tools/plzc/TocFile.h"

namespace plzcfuzz {

namespace {

struct WriterState {
  Decoded *decoded;
  uint64_t limit;
  uint64_t offset = 0;
};

int checkingWriter(int64_t offset, const void *bytes, int64_t count, void *context) {
  auto *state = static_cast<WriterState *>(context);
  FUZZ_CHECK(offset >= 0 && static_cast<uint64_t>(offset) == state->offset, "piece at offset %lld, expected %llu",
             static_cast<long long>(offset), static_cast<unsigned long long>(state->offset));
  FUZZ_CHECK(count >= 1 && count <= kDecompressPieceSize, "piece of %lld bytes", static_cast<long long>(count));
  state->offset += static_cast<uint64_t>(count);
  if (state->offset > state->limit) {
    state->decoded->stopped = true;
    return -1;
  }
  const auto *first = static_cast<const uint8_t *>(bytes);
  state->decoded->data.insert(state->decoded->data.end(), first, first + count);
  return 0;
}

// The handle every in-memory file lays its overlay on: no data, no attributes.
FileHandle *emptyBase() {
  static FileHandle *base = [] {
    DataPool *pool = newDataPool(0);
    FUZZ_CHECK(pool, "newDataPool(0) failed");
    finishDataPool(pool);
    FileHandle *handle = openDataPoolFile(pool, "in-memory file");
    FUZZ_CHECK(handle, "openDataPoolFile failed");
    releaseDataPool(pool);  // the handle holds its own reference
    return handle;
  }();
  return base;
}

}  // namespace

namespace {

Decoded decodeOnce(FileHandle *handle, const Bytes *header, uint64_t limit) {
  Decoded decoded;
  WriterState state{&decoded, limit};
  decoded.result = decompressData(handle, checkingWriter, &state);
  FUZZ_CHECK(decoded.result == 0 || decoded.result == -1, "decompressData returned %d", decoded.result);
  FUZZ_CHECK(!decoded.stopped || decoded.result == -1, "decompressData went on after its writer failed");
  if (decoded.result == 0 && header && header->size() >= sizeof(DiskHeader)) {
    DiskHeader fields;
    memcpy(&fields, header->data(), sizeof fields);
    auto logical = static_cast<int64_t>(fields.uncompressedSize);
    uint64_t expected = logical > 0 ? static_cast<uint64_t>(logical) : 0;
    FUZZ_CHECK(decoded.data.size() == expected, "decoded %zu bytes of a file of %llu", decoded.data.size(),
               static_cast<unsigned long long>(expected));
  }
  return decoded;
}

int64_t readRangeOnce(FileHandle *handle, const CompressorOps *row, const Bytes &header, uint64_t offset,
                      uint64_t length, Bytes *out) {
  // The block decompressData hands over: the attribute's length, then the attribute.
  Bytes block(sizeof(uint32_t) + header.size());
  auto size = static_cast<uint32_t>(header.size());
  memcpy(block.data(), &size, sizeof size);
  std::copy(header.begin(), header.end(), block.begin() + sizeof size);
  out->assign(length, 0);
  struct iovec vector = {out->data(), static_cast<size_t>(length)};
  int64_t got = row->doUncompress(handle, static_cast<int64_t>(offset), length, 1, &vector, block.data());
  FUZZ_CHECK(got >= -1 && got <= static_cast<int64_t>(length), "ranged read of %llu bytes returned %lld",
             static_cast<unsigned long long>(length), static_cast<long long>(got));
  out->resize(got > 0 ? static_cast<size_t>(got) : 0);
  return got;
}

// The engines this build has besides zlib, each of which must read every input exactly as zlib
// does: the same result, the same bytes.
std::vector<ChunkEngine> otherEngines() {
  std::vector<ChunkEngine> engines;
  for (ChunkEngine engine : {ChunkEngine::Libdeflate, ChunkEngine::Isal}) {
    if (chunkEngineBuilt(engine)) engines.push_back(engine);
  }
  return engines;
}

// Runs read once with zlib, then with every other engine, failing the run when one differs;
// the engine in force before is put back.
template <typename Read>
auto onEveryEngine(const char *what, Read read) {
  ChunkEngine before = currentChunkEngine();
  setChunkEngine(ChunkEngine::Zlib);
  auto reference = read();
  for (ChunkEngine engine : otherEngines()) {
    setChunkEngine(engine);
    auto other = read();
    FUZZ_CHECK(other == reference, "%s with %s differs from zlib's", what, chunkEngineName(engine));
  }
  setChunkEngine(before);
  return reference;
}

}  // namespace

Decoded decodeAndCheck(FileHandle *handle, const Bytes *header, uint64_t limit) {
  return onEveryEngine("decompressData", [&] { return decodeOnce(handle, header, limit); });
}

int64_t readRange(FileHandle *handle, uint32_t type, const Bytes &header, uint64_t offset, uint64_t length,
                  Bytes *out) {
  const CompressorOps *row = compressorForReading(type);
  if (!row) return -1;
  auto result = onEveryEngine("the ranged read", [&] {
    Bytes bytes;
    int64_t got = readRangeOnce(handle, row, header, offset, length, &bytes);
    return std::make_pair(got, bytes);
  });
  *out = result.second;
  return result.first;
}

MemoryAttributes::MemoryAttributes() {
  dictionary_ = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  FUZZ_CHECK(dictionary_, "PVDictionaryCreateMutable failed");
  overlay_ = openTocFile(emptyBase(), dictionary_, 0);
  FUZZ_CHECK(overlay_, "openTocFile failed");
}

MemoryAttributes::~MemoryAttributes() {
  overlay_->close(overlay_);
  PVRelease(dictionary_);
}

void MemoryAttributes::set(const char *name, const Bytes &value) {
  // Straight into the dictionary: the overlay's own setxattr refuses header attributes of more
  // than 3802 bytes, and a reader must cope with any length found on disk.
  PVStringRef key = PVStringCreateWithCString(name, kPVStringEncodingUTF8);
  PVMutableDataRef data = PVDataCreateMutable(static_cast<PVIndex>(value.size()));
  FUZZ_CHECK(key && data && PVDataAppendBytes(data, value.data(), static_cast<PVIndex>(value.size())) &&
                 PVDictionarySetValue(dictionary_, key, data),
             "cannot store attribute %s", name);
  PVRelease(key);
  PVRelease(data);
}

Bytes tableOfContents(const char *types, const std::vector<Bytes> &contents) {
  static int calls = 0;
  std::string dir = scratchDir() + "/toc-" + std::to_string(calls++);
  std::string tocPath = dir + "/toc";
  CompressorContext *context = initCompressor(types, nullptr, nullptr, tocPath.c_str(), false, 5, false);
  FUZZ_CHECK(context, "initCompressor(%s) failed", types);
  for (size_t i = 0; i < contents.size(); i++) {
    std::string path = dir + "/file-" + std::to_string(i);
    FUZZ_CHECK(writeWholeFile(path, contents[i]), "cannot write %s", path.c_str());
    compressFile(context, path.c_str(), nullptr);
  }
  freeCompressor(context);
  Bytes toc;
  FUZZ_CHECK(plzc::readWholeFile(tocPath, &toc), "cannot read %s", tocPath.c_str());
  return toc;
}

std::vector<std::pair<std::string, Bytes>> compressedAttributes(const char *types, const Bytes &contents) {
  Bytes toc = tableOfContents(types, {contents});
  std::vector<plzc::TocRecord> records;
  plzc::TocError error;
  FUZZ_CHECK(plzc::parseToc(toc, &records, &error), "the library wrote a bad table of contents: %s",
             error.reason.c_str());
  std::vector<std::pair<std::string, Bytes>> attributes;
  if (records.empty()) return attributes;
  for (const plzc::TocEntry &entry : records[0].entries)
    attributes.emplace_back(entry.name, Bytes(toc.begin() + static_cast<ptrdiff_t>(entry.valueOffset),
                                              toc.begin() + static_cast<ptrdiff_t>(entry.valueOffset + entry.length)));
  return attributes;
}

}  // namespace plzcfuzz
