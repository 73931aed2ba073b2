// Fuzz target: table-of-contents files, read by the tool's parser (Tools/plzc/TocFile), and
// every record parsed written again by the library's writer (writeTocDictToFile) and read back.
//
// Input: the file's bytes.
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>

#include "Common/OverlayFile.h"
#include "CompressedForm.h"
#include "FuzzSupport.h"
#include "Tools/plzc/TocFile.h"

using namespace plzcfuzz;

namespace {

constexpr size_t kMaxNameBytes = 499;

// The records must tile the input: each starts where the last ended, each entry's value lies
// inside it, and the last record ends at the end.
void checkLayout(const Bytes &bytes, const std::vector<plzc::TocRecord> &records) {
  size_t at = 0;
  for (const plzc::TocRecord &record : records) {
    FUZZ_CHECK(record.offset == at, "record at %zu, expected %zu", record.offset, at);
    FUZZ_CHECK(!record.path.empty() && record.path.find('\0') == std::string::npos, "bad path at %zu", at);
    FUZZ_CHECK(!record.entries.empty(), "record at %zu without entries", at);
    at += record.path.size() + 1 + 4;
    for (const plzc::TocEntry &entry : record.entries) {
      FUZZ_CHECK(!entry.name.empty() && entry.name.size() <= kMaxNameBytes, "name of %zu bytes", entry.name.size());
      FUZZ_CHECK(entry.length >= 1 && entry.valueOffset == at + entry.name.size() + 1 + 4, "entry %s at %zu misplaced",
                 entry.name.c_str(), at);
      at = entry.valueOffset + entry.length;
      FUZZ_CHECK(at <= bytes.size(), "value of %s passes the end", entry.name.c_str());
    }
  }
  FUZZ_CHECK(at == bytes.size(), "records end at %zu of %zu", at, bytes.size());
}

// Writes the record again through the library into a memory file and parses the result: the
// same path with the same values, entries in the dictionary's order. Records whose names repeat
// or are not UTF-8 cannot become a dictionary and are left out.
void checkRewrite(const Bytes &bytes, const plzc::TocRecord &record) {
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  bool usable = dictionary != nullptr;
  for (const plzc::TocEntry &entry : record.entries) {
    PVStringRef key = usable ? PVStringCreateWithCString(entry.name.c_str(), kPVStringEncodingUTF8) : nullptr;
    usable = key && !PVDictionaryGetValue(dictionary, key);
    PVDataRef value = usable ? PVDataCreate(bytes.data() + entry.valueOffset, entry.length) : nullptr;
    usable = usable && value && PVDictionarySetValue(dictionary, key, value);
    PVRelease(key);
    PVRelease(value);
  }
  if (usable) {
    int fd = memfd_create("toc", MFD_CLOEXEC);
    FUZZ_CHECK(fd >= 0, "memfd_create: %s", strerror(errno));
    writeTocDictToFile(fd, record.path.c_str(), dictionary);
    Bytes written(static_cast<size_t>(lseek(fd, 0, SEEK_END)));
    FUZZ_CHECK(pread(fd, written.data(), written.size(), 0) == static_cast<ssize_t>(written.size()), "pread");
    close(fd);
    std::vector<plzc::TocRecord> again;
    plzc::TocError error;
    FUZZ_CHECK(plzc::parseToc(written, &again, &error), "rewritten record of %s unreadable at %zu: %s",
               record.path.c_str(), error.offset, error.reason.c_str());
    FUZZ_CHECK(again.size() == 1 && again[0].path == record.path && again[0].entries.size() == record.entries.size(),
               "rewritten record of %s differs", record.path.c_str());
    for (const plzc::TocEntry &entry : again[0].entries) {
      const plzc::TocEntry *original = nullptr;
      for (const plzc::TocEntry &candidate : record.entries)
        if (candidate.name == entry.name) original = &candidate;
      FUZZ_CHECK(
          original && original->length == entry.length &&
              memcmp(bytes.data() + original->valueOffset, written.data() + entry.valueOffset, entry.length) == 0,
          "value of %s changed in the rewrite", entry.name.c_str());
    }
  }
  PVRelease(dictionary);
}

// Tables the library writes: small files taken by type 3, larger ones by type 4.
void writeSeeds(SeedSink &seeds) {
  seeds.add("type3",
            tableOfContents("3", {compressibleBytes(100, 1), randomBytes(2000, 2), compressibleBytes(60000, 3)}));
  seeds.add("type4", tableOfContents("4", {compressibleBytes(1000, 4), compressibleBytes(150000, 5)}));
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  Bytes bytes(data, data + size);
  std::vector<plzc::TocRecord> records;
  plzc::TocError error;
  if (!plzc::parseToc(bytes, &records, &error)) {
    FUZZ_CHECK(records.empty() && error.offset <= size && !error.reason.empty(), "bad failure report");
    return 0;
  }
  checkLayout(bytes, records);
  for (const plzc::TocRecord &record : records) checkRewrite(bytes, record);
  return 0;
}
