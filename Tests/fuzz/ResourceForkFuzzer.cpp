// Fuzz target: the type-4 resource fork "com.tavix.ResourceFork" (fork header, chunk count,
// chunk table, chunks, map), read as the library reads a compressed file: decompressData over
// a file whose header attribute says type 4, then a ranged read through the type's own
// decompressor.
//
// Input: u64 logical size for the header, u32 offset and u32 length of the ranged read, then
// the fork's bytes.
#include "CompressedForm.h"
#include "Compressors/Zlib/ByteOrder.h"
#include "Libraries/CompressData/DiskHeader.h"

using namespace plzcfuzz;

namespace {

constexpr uint32_t kRangeLimit = 262144;

// Forks the library writes: two chunks, three chunks, and stored chunks between compressed ones.
void writeSeeds(SeedSink &seeds) {
  Bytes mixed = randomBytes(70000, 3);
  Bytes text = compressibleBytes(230000, 4);
  mixed.insert(mixed.end(), text.begin(), text.end());
  const struct {
    const char *name;
    Bytes contents;
  } kFiles[] = {{"two-chunks", compressibleBytes(65537, 1)},
                {"three-chunks", compressibleBytes(150000, 2)},
                {"stored-chunks", mixed}};
  for (const auto &file : kFiles) {
    for (const auto &[name, value] : compressedAttributes("4", file.contents)) {
      if (name != kResourceForkXattrName) continue;
      uint64_t size = file.contents.size();
      seeds.add(std::string(file.name) + "-whole", InputWriter().u64(size).u32(0).u32(65536).bytes(value).data());
      seeds.add(std::string(file.name) + "-part",
                InputWriter().u64(size).u32(65536 + 1000).u32(70000).bytes(value).data());
    }
  }
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  InputReader input(data, size);
  uint64_t logicalSize = input.u64();
  uint64_t offset = input.u32();
  uint64_t length = input.u32() % (kRangeLimit + 1);
  Bytes fork = input.rest();

  Bytes header(kDiskHeaderSize);
  plzc::storeDiskHeader(header.data(), 4, logicalSize);
  MemoryAttributes file;
  file.set(kDecmpfsXattrName, header);
  file.set(kResourceForkXattrName, fork);
  decodeAndCheck(file.handle(), &header);
  Bytes part;
  readRange(file.handle(), 4, header, offset, length, &part);
  return 0;
}
