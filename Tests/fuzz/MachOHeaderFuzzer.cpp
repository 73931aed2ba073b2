// Fuzz target: Mach-O headers, thin and universal, as the header test of the stream pipeline
// meets them (Common/MachOFilter): the file's bytes come from a data pool through an overlay
// that can push bytes back; after the test the whole file must still read from its first byte.
//
// Input: u32 skip mask, u8 switches (bit 0: an override set holding the file's path, bit 1:
// the file lies outside the destination root), then the file's bytes.
#include <algorithm>
#include <cstring>

#include "Common/DataPool.h"
#include "Common/MachOFilter.h"
#include "Common/OverlayFile.h"
#include "FuzzSupport.h"
#include "Plenzo.h"

using namespace plzcfuzz;

namespace {

constexpr char kPrefix[] = "/Volumes/T";
constexpr uint32_t kMachOMagics[] = {0xfeedface, 0xfeedfacf, 0xcefaedfe, 0xcffaedfe, 0xcafebabe, 0xbebafeca};

// The override set as the queue builds it from its options.
PVDictionaryRef overridePaths(uint32_t mask) {
  PVStringRef path = PVStringCreateWithCString("/usr/bin/tool", kPVStringEncodingUTF8);
  PVArrayRef array = PVArrayCreate(reinterpret_cast<const PVRef *>(&path), 1);
  PVRef key = kPLZCSkipMachOOverridePaths, value = array;
  PVDictionaryRef options =
      PVDictionaryCreate(&key, reinterpret_cast<const void *const *>(&value), 1, kPVDictionaryRetainedValues);
  PVDictionaryRef set = createMachOOverridePaths(mask, options);
  PVRelease(options);
  PVRelease(array);
  PVRelease(path);
  return set;
}

// Reads the file through the handle from offset 0 to its end, as a compressor does.
Bytes readAll(FileHandle *handle) {
  Bytes out;
  uint8_t block[4096];
  for (;;) {
    int64_t got = handle->pread(handle, block, sizeof block, static_cast<int64_t>(out.size()));
    FUZZ_CHECK(got >= 0, "read at %zu failed after the header test", out.size());
    if (got == 0) return out;
    out.insert(out.end(), block, block + got);
  }
}

Bytes be32(uint32_t value) {
  return {static_cast<uint8_t>(value >> 24), static_cast<uint8_t>(value >> 16), static_cast<uint8_t>(value >> 8),
          static_cast<uint8_t>(value)};
}

// A thin header: magic, CPU type and subtype, file type, and zeros up to 28 bytes, in the
// byte order the magic says.
Bytes thin(uint32_t magic, uint32_t fileType, bool bigEndian) {
  Bytes header;
  for (uint32_t word : {magic, 7u, 3u, fileType, 0u, 0u, 0u}) {
    Bytes bytes = bigEndian ? be32(word) : InputWriter().u32(word).data();
    header.insert(header.end(), bytes.begin(), bytes.end());
  }
  return header;
}

// A universal file as tools write it (big-endian header): count, then the first architecture
// record (CPU type, subtype, offset, size, alignment); its slice at sliceOffset holds a thin
// 64-bit header of the given file type.
Bytes universal(uint32_t architectures, uint32_t sliceOffset, uint32_t fileType) {
  Bytes file;
  for (uint32_t word : {0xcafebabeu, architectures, 7u, 3u, sliceOffset, 4096u, 12u}) {
    Bytes bytes = be32(word);
    file.insert(file.end(), bytes.begin(), bytes.end());
  }
  file.resize(std::max<size_t>(file.size(), sliceOffset), 0);
  Bytes slice = thin(0xfeedfacf, fileType, false);
  file.insert(file.end(), slice.begin(), slice.end());
  file.resize(file.size() + 100, 0x5a);
  return file;
}

Bytes input(uint32_t mask, uint8_t switches, const Bytes &file) {
  return InputWriter().u32(mask).u8(switches).bytes(file).data();
}

void writeSeeds(SeedSink &seeds) {
  constexpr uint32_t kExecutable = 1u << 2, kLibrary = 1u << 6;
  seeds.add("thin64-executable", input(kExecutable, 0, thin(0xfeedfacf, 2, false)));
  seeds.add("thin64-executable-overridden", input(kExecutable, 1, thin(0xfeedfacf, 2, false)));
  seeds.add("thin64-executable-outside-root", input(kExecutable, 3, thin(0xfeedfacf, 2, false)));
  seeds.add("thin32-swapped-library", input(kLibrary, 0, thin(0xfeedface, 6, true)));
  seeds.add("universal-library-at-4096", input(kLibrary, 0, universal(1, 4096, 6)));
  seeds.add("universal-slice-right-behind", input(0xFFFFFFFF, 0, universal(2, 28, 8)));
  seeds.add("universal-20-architectures", input(0xFFFFFFFF, 0, universal(20, 64, 2)));
  seeds.add("short-file", input(0xFFFFFFFF, 0, compressibleBytes(10, 1)));
  seeds.add("text-file", input(0xFFFFFFFF, 0, compressibleBytes(200, 2)));
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  InputReader input(data, size);
  uint32_t mask = input.u32();
  uint8_t switches = input.u8();
  Bytes contents = input.rest();
  const char *path = switches & 2 ? "/elsewhere/usr/bin/tool" : "/Volumes/T/usr/bin/tool";

  DataPool *pool = newDataPool(static_cast<int64_t>(contents.size()));
  FUZZ_CHECK(pool, "newDataPool failed");
  FUZZ_CHECK(addDataToPool(pool, contents.data(), contents.size()) == static_cast<int64_t>(contents.size()),
             "addDataToPool failed");
  finishDataPool(pool);
  FileHandle *poolHandle = openDataPoolFile(pool, path);
  releaseDataPool(pool);
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  FileHandle *overlay = openTocFile(poolHandle, dictionary, 1);
  FUZZ_CHECK(poolHandle && dictionary && overlay, "cannot open the file");
  PVDictionaryRef overrides = switches & 1 ? overridePaths(mask) : nullptr;

  bool skip = _ShouldSkipMachOFile(path, kPrefix, mask, overrides, overlay);
  if (skip) {
    uint32_t magic = 0;
    if (contents.size() >= 4) memcpy(&magic, contents.data(), 4);
    FUZZ_CHECK(
        mask != 0 && contents.size() >= 28 && std::count(std::begin(kMachOMagics), std::end(kMachOMagics), magic),
        "a file of %zu bytes without a Mach-O magic was skipped", contents.size());
  }
  FUZZ_CHECK(readAll(overlay) == contents, "the header test lost bytes of the file");

  PVRelease(overrides);
  overlay->close(overlay);
  poolHandle->close(poolHandle);
  PVRelease(dictionary);
  return 0;
}
