// Fuzz target: the header attribute "com.tavix.decmpfs" with the type-3 data inside it, read
// as the library reads a compressed file: decompressData over a file holding the attribute,
// then a ranged read through the type's own decompressor.
//
// Input: u32 offset and u32 length of the ranged read, then the attribute's bytes.
#include <algorithm>
#include <cstring>

#include "CompressedForm.h"
#include "Libraries/CompressData/DiskHeader.h"

using namespace plzcfuzz;

namespace {

constexpr uint32_t kRangeLimit = 262144;

Bytes input(uint32_t offset, uint32_t length, const Bytes &header) {
  return InputWriter().u32(offset).u32(length).bytes(header).data();
}

// Header attributes the library writes: type 3 compressed and stored, of several sizes, and the
// header of a type-4 file.
void writeSeeds(SeedSink &seeds) {
  const struct {
    const char *name;
    Bytes contents;
  } kFiles[] = {{"one-byte", compressibleBytes(1, 1)},         {"text-100", compressibleBytes(100, 2)},
                {"text-3000", compressibleBytes(3000, 3)},     {"zeros-131072", Bytes(131072, 0)},
                {"stored-3000", randomBytes(3000, 5)},         {"stored-3785", randomBytes(3785, 6)},
                {"type4-header", compressibleBytes(300000, 7)}};
  for (const auto &file : kFiles) {
    for (const auto &[name, value] :
         compressedAttributes(file.name == std::string("type4-header") ? "4" : "3", file.contents)) {
      if (name != kDecmpfsXattrName) continue;
      auto size = static_cast<uint32_t>(file.contents.size());
      seeds.add(std::string(file.name) + "-whole", input(0, size, value));
      seeds.add(std::string(file.name) + "-part", input(size / 3, size / 2 + 1, value));
    }
  }
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  InputReader input(data, size);
  uint64_t offset = input.u32();
  uint64_t length = input.u32() % (kRangeLimit + 1);
  Bytes header = input.rest();

  MemoryAttributes file;
  file.set(kDecmpfsXattrName, header);
  Decoded whole = decodeAndCheck(file.handle(), &header);
  if (header.size() < sizeof(DiskHeader)) {
    FUZZ_CHECK(whole.result == -1, "a header of %zu bytes was decoded", header.size());
    return 0;
  }

  DiskHeader fields;
  memcpy(&fields, header.data(), sizeof fields);
  Bytes part;
  int64_t got = readRange(file.handle(), fields.compressionType, header, offset, length, &part);
  // Type 3 is one chunk: a range inside a file that decodes whole decodes to the same bytes. (A
  // range reaching past the chunk's bytes asks for a second chunk, and fails.)
  if (fields.compressionType == 3 && whole.result == 0 && offset + length <= whole.data.size()) {
    FUZZ_CHECK(got == static_cast<int64_t>(length) &&
                   std::equal(part.begin(), part.end(), whole.data.begin() + static_cast<ptrdiff_t>(offset)),
               "ranged read of %llu at %llu gave %lld bytes unlike the whole decode",
               static_cast<unsigned long long>(length), static_cast<unsigned long long>(offset),
               static_cast<long long>(got));
  }
  return 0;
}
