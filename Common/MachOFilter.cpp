#include "Common/MachOFilter.h"

#include <pthread.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/CompressionRules.h"
#include "Common/Diagnostics.h"
#include "Common/PropertyValueObjects.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"

// The filter belongs to the stream pipeline and reports under its name.
static constexpr char kSourcePath[] = "Common/StreamCompressor";

namespace {
constinit PVString skipMachOFileTypes = PVString::constant("SkipMachOFileTypes");
constinit PVString skipMachOOverridePaths = PVString::constant("SkipMachOOverridePaths");
}  // namespace

const PVStringRef kPLZCSkipMachOFileTypes = &skipMachOFileTypes;
const PVStringRef kPLZCSkipMachOOverridePaths = &skipMachOOverridePaths;

namespace {

constexpr size_t kHeaderBytes = 28;
constexpr uint32_t kMaxArchitectures = 20;
// The most bytes held in front of a universal file's first slice. Real files put it within the
// first pages; a header naming an offset further on is not treated as a Mach-O file, rather
// than holding that much of the file in memory.
constexpr uint64_t kMaxSlicePrefix = 67108864;

constexpr uint32_t kThin32 = 0xfeedface, kThin64 = 0xfeedfacf;
constexpr uint32_t kThin32Swapped = 0xcefaedfe, kThin64Swapped = 0xcffaedfe;
constexpr uint32_t kFat = 0xcafebabe, kFatSwapped = 0xbebafeca;

PVDictionaryRef machOFileTypeDict = nullptr;
pthread_once_t machOFileTypeDictOnce = PTHREAD_ONCE_INIT;

void _CreateMachOFileTypeDict() {
  static const struct {
    const char *name;
    intptr_t value;
  } kTypes[] = {{"*", -1},         {"MH_OBJECT", 1},      {"MH_EXECUTE", 2}, {"MH_FVMLIB", 3},
                {"MH_CORE", 4},    {"MH_PRELOAD", 5},     {"MH_DYLIB", 6},   {"MH_DYLINKER", 7},
                {"MH_BUNDLE", 8},  {"MH_DYLIB_STUB", 9},  {"MH_DSYM", 10},   {"MH_KEXT_BUNDLE", 11}};
  constexpr size_t kCount = sizeof kTypes / sizeof kTypes[0];
  PVRef keys[kCount];
  const void *values[kCount];
  for (size_t i = 0; i < kCount; i++) {
    keys[i] = PVStringCreateWithCString(kTypes[i].name, kPVStringEncodingASCII);
    values[i] = reinterpret_cast<const void *>(kTypes[i].value);
  }
  machOFileTypeDict = PVDictionaryCreate(keys, values, kCount, kPVDictionaryPlainValues);
  for (PVRef key : keys) PVRelease(key);
}

uint32_t read32(const uint8_t *bytes, bool swapped) {
  uint32_t value;
  memcpy(&value, bytes, 4);
  return swapped ? __builtin_bswap32(value) : value;
}

// The file type of a thin header at bytes (at least 16 bytes), or -1 when it is not one.
int64_t thinFileType(const uint8_t *bytes) {
  uint32_t magic = read32(bytes, false);
  if (magic == kThin32 || magic == kThin64) return read32(bytes + 12, false);
  if (magic == kThin32Swapped || magic == kThin64Swapped) return read32(bytes + 12, true);
  return -1;
}

void reportInvalidItem(PVRef item, long index) {
  PVStringRef text = PVGetType(item) == kPVTypeString ? static_cast<PVStringRef>(PVRetain(item)) : PVCopyDescription(item);
  bool converted = false;
  if (text) {
    PVIndex size = PVStringGetMaximumSizeForEncoding(PVStringGetLength(text), kPVStringEncodingASCII) + 10;
    char *buffer = static_cast<char *>(sys::malloc(static_cast<size_t>(size)));
    if (buffer && PVStringGetCString(text, buffer, size, kPVStringEncodingASCII)) {
      PLZC_ERR("%s:%d: Error: invalid item '%s' at index %ld in SkipMachOFileTypes dictionary\n", buffer, index);
      converted = true;
    }
    free(buffer);
    PVRelease(text);
  }
  if (!converted) PLZC_ERR("%s:%d: Error: invalid item at index %ld in SkipMachOFileTypes dictionary\n", index);
}

}  // namespace

int _ComputeMachOTypeMask(uint32_t *skipMachOTypeMask, PVDictionaryRef options) {
  *skipMachOTypeMask = 0;
  PVRef types = options ? PVDictionaryGetValue(options, kPLZCSkipMachOFileTypes) : nullptr;
  if (PVGetType(types) != kPVTypeArray) return 0;
  auto array = static_cast<PVArrayRef>(types);
  int result = 0;
  for (PVIndex i = 0; i < PVArrayGetCount(array); i++) {
    PVRef item = PVArrayGetValueAtIndex(array, i);
    int64_t value = 0;
    if (PVGetType(item) == kPVTypeNumber) {
      int32_t number;
      PVNumberGetInt32(static_cast<PVNumberRef>(item), &number);
      value = number;
    } else if (PVGetType(item) == kPVTypeString) {
      pthread_once(&machOFileTypeDictOnce, _CreateMachOFileTypeDict);
      const void *found = nullptr;
      if (PVDictionaryGetValueIfPresent(machOFileTypeDict, item, &found)) value = reinterpret_cast<intptr_t>(found);
    }
    if (value == -1) {
      *skipMachOTypeMask = 0xFFFFFFFF;
      return 0;
    }
    if (value >= 1 && value <= 31) {
      *skipMachOTypeMask |= 1u << value;
    } else {
      reportInvalidItem(item, static_cast<long>(i));
      result = -1;
    }
  }
  return result;
}

PVDictionaryRef createMachOOverridePaths(uint32_t skipMachOTypeMask, PVDictionaryRef options) {
  if (skipMachOTypeMask == 0 || !options) return nullptr;
  PVRef paths = PVDictionaryGetValue(options, kPLZCSkipMachOOverridePaths);
  if (PVGetType(paths) != kPVTypeArray || PVArrayGetCount(static_cast<PVArrayRef>(paths)) <= 0) return nullptr;
  auto array = static_cast<PVArrayRef>(paths);
  PVMutableDictionaryRef set = PVDictionaryCreateMutable(PVArrayGetCount(array), kPVDictionaryPlainValues);
  for (PVIndex i = 0; set && i < PVArrayGetCount(array); i++)
    PVDictionarySetValue(set, PVArrayGetValueAtIndex(array, i), reinterpret_cast<const void *>(intptr_t{1}));
  return set;
}

bool _ShouldSkipMachOFile(const char *path, const char *prefix, uint32_t skipMachOTypeMask,
                          PVDictionaryRef overridePaths, FileHandle *fh) {
  if (!fh->canUnread) {
    PLZC_ERR("%s:%d: Error: fh doesn't support unreading\n");
    return false;
  }
  bool skip = false;
  uint8_t header[kHeaderBytes];
  uint8_t *held = header;  // the bytes consumed from the handle
  uint8_t *prefixBuffer = nullptr;
  int64_t heldCount = 0;
  int64_t fileType = -1;

  int64_t got = fh->pread(fh, header, kHeaderBytes, 0);
  if (got == -1) {
    PLZC_ERR("%s:%d: read header of '%s': %s\n", path, strerror(errno));
  } else {
    heldCount = got;
  }
  if (got == static_cast<int64_t>(kHeaderBytes)) {
    uint32_t magic = read32(header, false);
    if (magic == kFat || magic == kFatSwapped) {
      bool swapped = magic == kFatSwapped;
      uint32_t architectures = read32(header + 4, swapped), sliceOffset = read32(header + 16, swapped);
      // Only the first slice is examined; its whole prefix is held so it can be pushed back. The
      // buffer stops at the end of the file: a slice placed past it gives a short read, reported
      // below, without an allocation of the size the header claims.
      uint64_t size = static_cast<uint64_t>(sliceOffset) + kHeaderBytes;
      int64_t fileSize = fh->size(fh);
      uint64_t room = fileSize > static_cast<int64_t>(kHeaderBytes)
                          ? std::min<uint64_t>(size, static_cast<uint64_t>(fileSize))
                          : kHeaderBytes;
      if (architectures < kMaxArchitectures && size <= kMaxSlicePrefix &&
          (prefixBuffer = static_cast<uint8_t *>(sys::malloc(room)))) {
        memcpy(prefixBuffer, header, kHeaderBytes);
        held = prefixBuffer;
        int64_t rest =
            fh->pread(fh, prefixBuffer + kHeaderBytes, static_cast<int64_t>(room - kHeaderBytes), kHeaderBytes);
        if (rest != static_cast<int64_t>(size - kHeaderBytes)) {
          PLZC_ERR("%s:%d: read header of '%s': %s\n", path, strerror(errno));
          heldCount = kHeaderBytes + (rest > 0 ? rest : 0);
        } else {
          heldCount = static_cast<int64_t>(size);
          fileType = thinFileType(prefixBuffer + sliceOffset);
        }
      }
    } else {
      fileType = thinFileType(header);
    }
  }

  if (fileType > 0 && (skipMachOTypeMask >> (fileType % 32)) & 1) {
    skip = true;
    if (overridePaths) {
      bool trimmed;
      PVStringRef relative = PVStringCreateWithFileSystemRepresentation(_TrimPrefix(path, prefix, &trimmed));
      if (!relative) {
        PLZC_ERR("%s:%d: Error: failed to create pathPVString\n");
        skip = false;
      } else {
        skip = !PVDictionaryGetValueIfPresent(overridePaths, relative, nullptr);
        PVRelease(relative);
      }
    }
  }

  if (heldCount > 0) {
    if (fh->unreadAlloc(fh, heldCount)) {
      fh->unread(fh, held, heldCount);
      fh->unreadDone(fh);
    } else {
      PLZC_ERR("%s:%d: Error: failed to alloc unread buffer for '%s'\n", path);
    }
  }
  free(prefixBuffer);
  return skip;
}
