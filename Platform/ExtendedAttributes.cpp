#include "Platform/ExtendedAttributes.h"

#include <linux/magic.h>
#include <stdlib.h>
#include <sys/statfs.h>
#include <sys/xattr.h>

#include <algorithm>
#include <atomic>
#include <bit>
#include <climits>
#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/Syscalls.h"

static_assert(std::endian::native == std::endian::little, "the index record is stored in host order");

namespace platform {

const char kReservedLinuxPrefix[] = "user.plzc#";

namespace {

constexpr size_t kMaxNameLength = 127;
constexpr std::string_view kUserPrefix = "user.";
constexpr std::string_view kReservedPrefix = "plzc#";  // as seen from attribute names
constexpr int kKnownOptions = 0x3F;
constexpr uint32_t kLargestSegment = 65536;  // the Linux limit of one attribute value
// btrfs keeps a value inside one tree node (16 KiB by default) with its item headers and name.
constexpr uint32_t kBtrfsSegment = 15360;
constexpr uint32_t kSmallestSegment = kBtrfsSegment;
constexpr uint32_t kIndexMagic = 0x58537A50;  // "PzSX"
constexpr uint32_t kIndexVersion = 1;
constexpr int kReadAttempts = 8;

// The record stored under the index name of a segmented value.
struct Index {
  uint32_t magic;
  uint32_t version;
  uint32_t segmentSize;
  uint32_t generation;
  uint64_t length;
};
static_assert(sizeof(Index) == 24);

XattrSegmentCounters &counters() {
  thread_local XattrSegmentCounters perThread;
  return perThread;
}

// One segment's worth of scratch space per thread.
uint8_t *scratch() {
  thread_local std::unique_ptr<uint8_t[]> buffer(new uint8_t[kLargestSegment]);
  return buffer.get();
}

// Bumped by every attribute write and removal of the process; cached segments read before the
// last bump are stale.
std::atomic<uint64_t> gWriteEpoch{0};

// Where the Linux calls go: a path (following links or not) or a descriptor.
class Target {
 public:
  static Target ofPath(const char *path, int options) { return Target(path, -1, options & kXattrNoFollow); }
  static Target ofFd(int fd) { return Target(nullptr, fd, false); }

  ssize_t get(const std::string &name, void *value, size_t size) const {
    if (!path_) return sys::fgetxattr(fd_, name.c_str(), value, size);
    return noFollow_ ? sys::lgetxattr(path_, name.c_str(), value, size)
                     : sys::getxattr(path_, name.c_str(), value, size);
  }
  int set(const std::string &name, const void *value, size_t size) const {
    gWriteEpoch.fetch_add(1, std::memory_order_relaxed);
    if (!path_) return sys::fsetxattr(fd_, name.c_str(), value, size, 0);
    return noFollow_ ? sys::lsetxattr(path_, name.c_str(), value, size, 0)
                     : sys::setxattr(path_, name.c_str(), value, size, 0);
  }
  int remove(const std::string &name) const {
    gWriteEpoch.fetch_add(1, std::memory_order_relaxed);
    if (!path_) return sys::fremovexattr(fd_, name.c_str());
    return noFollow_ ? sys::lremovexattr(path_, name.c_str()) : sys::removexattr(path_, name.c_str());
  }
  ssize_t list(char *names, size_t size) const {
    if (!path_) return sys::flistxattr(fd_, names, size);
    return noFollow_ ? sys::llistxattr(path_, names, size) : sys::listxattr(path_, names, size);
  }
  int fileSystemType(long *type) const {
    struct ::statfs st;
    // statfs follows links; a link itself cannot carry user attributes anyway.
    int result = path_ ? sys::statfs(path_, &st) : sys::fstatfs(fd_, &st);
    if (result == 0) *type = static_cast<long>(st.f_type);
    return result;
  }

  // Names the file for the read cache: its path, or its descriptor.
  std::string identity() const { return path_ ? std::string(noFollow_ ? "l:" : "p:") + path_ : "f:" + std::to_string(fd_); }

  // Every Linux attribute name of the file, or false with errno.
  bool allNames(std::vector<std::string> *names) const {
    for (;;) {
      ssize_t size = list(nullptr, 0);
      if (size < 0) return false;
      std::vector<char> buffer(static_cast<size_t>(size) + 1);
      ssize_t got = list(buffer.data(), static_cast<size_t>(size));
      if (got < 0 && errno == ERANGE) continue;  // grew meanwhile
      if (got < 0) return false;
      names->clear();
      for (ssize_t at = 0; at < got;) {
        names->emplace_back(&buffer[static_cast<size_t>(at)]);
        at += static_cast<ssize_t>(names->back().size()) + 1;
      }
      return true;
    }
  }

 private:
  Target(const char *path, int fd, bool noFollow) : path_(path), fd_(fd), noFollow_(noFollow) {}
  const char *path_;
  int fd_;
  bool noFollow_;
};

// The Linux names that make up the value of attribute `name`.
class Names {
 public:
  explicit Names(const char *name) : name_(name) {}
  std::string plain() const { return std::string(kUserPrefix) + name_; }
  std::string index() const { return reservedStem() + "i"; }
  std::string segment(uint32_t generation, uint64_t number) const {
    char suffix[40];
    snprintf(suffix, sizeof suffix, "%x.%llx", generation, static_cast<unsigned long long>(number));
    return reservedStem() + suffix;
  }
  // True for any segment name of this value, whatever its generation; `generation` and
  // `number` (when not null) get its parts.
  bool isSegment(const std::string &linuxName, uint32_t *generation, uint64_t *number = nullptr) const {
    std::string stem = reservedStem();
    if (linuxName.compare(0, stem.size(), stem) != 0) return false;
    std::string_view rest(linuxName.c_str() + stem.size());
    size_t dot = rest.find('.');
    if (dot == std::string_view::npos || dot == 0 || dot + 1 == rest.size()) return false;
    auto allHex = [](std::string_view digits) {
      return std::all_of(digits.begin(), digits.end(), [](char c) { return isxdigit(static_cast<unsigned char>(c)); });
    };
    if (!allHex(rest.substr(0, dot)) || !allHex(rest.substr(dot + 1))) return false;
    *generation = static_cast<uint32_t>(strtoul(std::string(rest.substr(0, dot)).c_str(), nullptr, 16));
    if (number) *number = strtoull(std::string(rest.substr(dot + 1)).c_str(), nullptr, 16);
    return true;
  }

 private:
  // Another value's names can never start with this stem followed by a part without '#'.
  std::string reservedStem() const { return std::string(kReservedLinuxPrefix) + name_ + "#"; }
  std::string name_;
};

bool isResourceFork(const char *name) { return strcmp(name, PLZC_RESOURCE_FORK_NAME) == 0; }
bool isReserved(const char *name) { return strncmp(name, kReservedPrefix.data(), kReservedPrefix.size()) == 0; }

// Checks the name and the options common to every call; sets errno and returns false.
bool validName(const char *name) {
  if (!name || !*name) {
    errno = EINVAL;
    return false;
  }
  if (strlen(name) > kMaxNameLength) {
    errno = ENAMETOOLONG;
    return false;
  }
  return true;
}

bool validOptions(int options) {
  if ((options & ~kKnownOptions) || ((options & kXattrCreate) && (options & kXattrReplace))) {
    errno = EINVAL;
    return false;
  }
  return true;
}

constexpr int kDamagedIndex = -2;

// Reads the index of a segmented value: 1 when found, 0 when the value is not segmented, -1
// with errno when the read failed, kDamagedIndex (errno EIO) for a record that is not an
// index. Only a damaged record may be written over: a read that failed, even with EIO, says
// nothing about the value, which may well be intact.
int readIndex(const Target &target, const Names &names, Index *index) {
  ssize_t got = target.get(names.index(), index, sizeof *index);
  // A record longer than ours is damaged, like a short one; it must not pass for a full buffer.
  if (got < 0 && errno == ERANGE) {
    errno = EIO;
    return kDamagedIndex;
  }
  if (got < 0) return errno == ENODATA ? 0 : -1;
  if (got != sizeof *index || index->magic != kIndexMagic || index->version != kIndexVersion ||
      index->segmentSize < 1024 || index->segmentSize > kLargestSegment ||
      index->length > static_cast<uint64_t>(SSIZE_MAX)) {
    errno = EIO;
    return kDamagedIndex;
  }
  return 1;
}

int writeIndex(const Target &target, const Names &names, uint32_t segmentSize, uint32_t generation,
               uint64_t length) {
  Index index{kIndexMagic, kIndexVersion, segmentSize, generation, length};
  return target.set(names.index(), &index, sizeof index);
}

// The segment size for new segmented values on the target's file system.
int segmentSizeFor(const Target &target, uint64_t length, uint32_t *segmentSize) {
  *segmentSize = kLargestSegment;
  if (length <= kSmallestSegment) return 0;
  long type = 0;
  if (target.fileSystemType(&type) != 0) return -1;
  if (type == static_cast<long>(BTRFS_SUPER_MAGIC)) *segmentSize = kBtrfsSegment;
  return 0;
}

uint32_t newGeneration(uint32_t previous) {
  uint32_t generation;
  do generation = arc4random();
  while (generation == 0 || generation == previous);
  return generation;
}

int writeSegment(const Target &target, const Names &names, uint32_t generation, uint64_t number,
                 const void *bytes, size_t size) {
  counters().writes++;
  return target.set(names.segment(generation, number), bytes, size);
}

// Reads one segment into `into` (room for a whole segment); its stored length, 0 when it does
// not exist, or -1 with errno.
ssize_t readSegment(const Target &target, const Names &names, uint32_t generation, uint64_t number, void *into,
                    size_t capacity) {
  counters().reads++;
  ssize_t got = target.get(names.segment(generation, number), into, capacity);
  if (got < 0 && errno == ENODATA) return 0;
  return got;
}

// Removes the segments of `name`, all of them or all but those of `keepGeneration`. Listing
// first also clears segments left behind by an interrupted writer.
void removeSegments(const Target &target, const Names &names, uint32_t keepGeneration) {
  std::vector<std::string> all;
  if (!target.allNames(&all)) return;
  for (const std::string &linuxName : all) {
    uint32_t generation;
    if (names.isSegment(linuxName, &generation) && (keepGeneration == 0 || generation != keepGeneration))
      target.remove(linuxName);
  }
}

// Removes the segments of `generation` numbered from `from` up to `to` (excluded). A long range
// is looked up in the file's names rather than tried number by number: a damaged index may
// place a write gigabytes past the end.
void removeSegmentRange(const Target &target, const Names &names, uint32_t generation, uint64_t from, uint64_t to) {
  constexpr uint64_t kDirectRemovals = 16;
  if (to <= from) return;
  if (to - from <= kDirectRemovals) {
    for (uint64_t number = from; number < to; number++) target.remove(names.segment(generation, number));
    return;
  }
  std::vector<std::string> all;
  if (!target.allNames(&all)) return;
  for (const std::string &linuxName : all) {
    uint32_t found;
    uint64_t number;
    if (names.isSegment(linuxName, &found, &number) && found == generation && number >= from && number < to)
      target.remove(linuxName);
  }
}

// Writes a new generation of segments holding `length` bytes: the pieces of `base` (the old
// plain value, possibly empty) overlaid with `size` bytes of `value` at `position`. Segments
// with nothing in them are skipped: they read as zeros. On failure removes what it wrote.
int writeNewGeneration(const Target &target, const Names &names, uint32_t segmentSize, uint32_t generation,
                       const std::vector<uint8_t> &base, const uint8_t *value, size_t size, uint64_t position,
                       uint64_t length) {
  uint64_t end = position + size;
  uint64_t count = (length + segmentSize - 1) / segmentSize;
  for (uint64_t number = 0; number < count; number++) {
    uint64_t start = number * segmentSize;
    uint64_t limit = std::min<uint64_t>(start + segmentSize, length);
    uint64_t baseEnd = std::min<uint64_t>(limit, base.size());
    bool hasBase = baseEnd > start;
    bool hasWrite = size > 0 && position < limit && end > start;
    if (!hasBase && !hasWrite) continue;
    int result;
    if (!hasBase && position <= start && end >= limit) {
      result = writeSegment(target, names, generation, number, value + (start - position), limit - start);
    } else {
      uint8_t *bytes = scratch();
      size_t stored = hasBase ? baseEnd - start : 0;
      if (hasBase) memcpy(bytes, base.data() + start, stored);
      if (hasWrite) {
        uint64_t from = std::max(position, start), to = std::min(end, limit);
        if (from - start > stored) memset(bytes + stored, 0, from - start - stored);
        memcpy(bytes + (from - start), value + (from - position), to - from);
        stored = std::max<size_t>(stored, to - start);
      }
      result = writeSegment(target, names, generation, number, bytes, stored);
    }
    if (result != 0) {
      int saved = errno;
      for (uint64_t written = 0; written < number; written++) target.remove(names.segment(generation, written));
      errno = saved;
      return -1;
    }
  }
  return 0;
}

// Publishes a new generation of segments in place of whatever the value was. Readers take a
// plain value before an index, so a value that was plain changes only when its plain form is
// gone: if that cannot be removed, the new generation is withdrawn and the old value stays.
int publishSegmented(const Target &target, const Names &names, uint32_t segmentSize, uint32_t generation,
                     uint64_t length, bool hadPlain, bool hadIndex) {
  auto withdraw = [&](bool indexWritten) {
    int saved = errno;
    if (indexWritten) target.remove(names.index());
    for (uint64_t number = 0; number * segmentSize < length; number++)
      target.remove(names.segment(generation, number));
    errno = saved;
    return -1;
  };
  if (writeIndex(target, names, segmentSize, generation, length) != 0) return withdraw(false);
  if (hadPlain && target.remove(names.plain()) != 0 && errno != ENODATA) return withdraw(true);
  if (hadIndex) removeSegments(target, names, generation);
  return 0;
}

// The current plain value; true when it exists, false when not (errno ENODATA) or on error.
bool readPlain(const Target &target, const Names &names, std::vector<uint8_t> *value) {
  for (;;) {
    ssize_t size = target.get(names.plain(), nullptr, 0);
    if (size < 0) return false;
    value->resize(static_cast<size_t>(size));
    ssize_t got = target.get(names.plain(), value->data(), value->size());
    if (got < 0 && errno == ERANGE) continue;
    if (got < 0) return false;
    value->resize(static_cast<size_t>(got));
    return true;
  }
}

// The state behind an XattrReadCache: the three segments used last, and the value last found
// segmented with its index (neither its plain form nor its index is read again). Three, because
// a reader going through a fork in pieces comes back to the first segment (chunk count, table)
// for every piece while its chunks go from one segment to the next.
struct ReadCacheState {
  struct Slot {
    std::string key;
    std::unique_ptr<uint8_t[]> bytes;
    ssize_t length = 0;
    uint64_t epoch = 0;
    uint64_t lastUse = 0;
  };
  Slot slots[3];
  uint64_t uses = 0;
  std::string segmentedValue;
  uint64_t segmentedEpoch = 0;
  Index segmentedIndex{};
};
thread_local ReadCacheState *tReadCache = nullptr;

// Reads one segment for a partial copy: from the thread's read cache when it holds it, else
// into the cache (or the scratch space without one). *bytes points at the segment's bytes.
ssize_t readSegmentForCopy(const Target &target, const Names &names, uint32_t generation, uint64_t number,
                           uint32_t segmentSize, const uint8_t **bytes) {
  ReadCacheState *cache = tReadCache;
  if (!cache) {
    uint8_t *into = scratch();
    *bytes = into;
    return readSegment(target, names, generation, number, into, segmentSize);
  }
  std::string key = target.identity() + '\n' + names.segment(generation, number);
  uint64_t epoch = gWriteEpoch.load(std::memory_order_relaxed);
  ReadCacheState::Slot *leastRecent = &cache->slots[0];
  for (ReadCacheState::Slot &slot : cache->slots) {
    if (slot.bytes && slot.epoch == epoch && slot.key == key) {
      slot.lastUse = ++cache->uses;
      *bytes = slot.bytes.get();
      return slot.length;
    }
    if (slot.lastUse < leastRecent->lastUse) leastRecent = &slot;
  }
  ReadCacheState::Slot &slot = *leastRecent;
  slot.lastUse = ++cache->uses;
  if (!slot.bytes) slot.bytes.reset(new uint8_t[kLargestSegment]);
  slot.key.clear();
  ssize_t got = readSegment(target, names, generation, number, slot.bytes.get(), segmentSize);
  if (got >= 0) {
    slot.key = std::move(key);
    slot.length = got;
    slot.epoch = epoch;
  }
  *bytes = slot.bytes.get();
  return got;
}

// The index of this value when the thread's read cache saw it segmented since the last write
// of this process, else null.
const Index *knownSegmented(const Target &target, const Names &names) {
  ReadCacheState *cache = tReadCache;
  bool known = cache && cache->segmentedEpoch == gWriteEpoch.load(std::memory_order_relaxed) &&
               cache->segmentedValue == target.identity() + '\n' + names.index();
  return known ? &cache->segmentedIndex : nullptr;
}

// Remembers the value as segmented with this index, or (null) as not known to be.
void rememberSegmented(const Target &target, const Names &names, const Index *index) {
  ReadCacheState *cache = tReadCache;
  if (!cache) return;
  cache->segmentedValue = index ? target.identity() + '\n' + names.index() : std::string();
  cache->segmentedEpoch = gWriteEpoch.load(std::memory_order_relaxed);
  if (index) cache->segmentedIndex = *index;
}

// Copies [position, position + count) of a segmented value into `out`. Returns 0, -1 with errno,
// or 1 when the value was replaced meanwhile and the read must start over.
int readSegmented(const Target &target, const Names &names, const Index &index, uint8_t *out, uint64_t position,
                  uint64_t count) {
  const uint64_t segmentSize = index.segmentSize;
  uint64_t end = position + count;
  for (uint64_t number = position / segmentSize; number * segmentSize < end; number++) {
    uint64_t start = number * segmentSize;
    uint64_t from = std::max(position, start), to = std::min(end, start + segmentSize);
    uint8_t *into = out + (from - position);
    ssize_t got;
    if (from == start && to - start == segmentSize) {
      // The whole segment is wanted: read it straight into the caller's buffer.
      got = readSegment(target, names, index.generation, number, into, to - from);
      if (got < 0 && errno == ERANGE) {
        errno = EIO;
        return -1;
      }
      if (got >= 0 && static_cast<uint64_t>(got) < to - from) memset(into + got, 0, to - from - got);
    } else {
      const uint8_t *bytes = nullptr;
      got = readSegmentForCopy(target, names, index.generation, number, static_cast<uint32_t>(segmentSize), &bytes);
      if (got >= 0) {
        uint64_t stored = static_cast<uint64_t>(got);
        uint64_t available = stored > from - start ? std::min(stored, to - start) - (from - start) : 0;
        memcpy(into, bytes + (from - start), available);
        memset(into + available, 0, to - from - available);
      }
    }
    if (got < 0) return -1;
    if (got == 0) {
      // A gap, unless a writer replaced the value under us.
      Index now;
      if (readIndex(target, names, &now) != 1 || now.generation != index.generation) return 1;
    }
  }
  return 0;
}

ssize_t getValue(const Target &target, const char *name, void *value, size_t size, uint32_t position,
                 int options) {
  if (!validName(name) || !validOptions(options)) return -1;
  bool fork = isResourceFork(name);
  if (position != 0 && !fork) {
    errno = EINVAL;
    return -1;
  }
  if (isReserved(name)) {
    errno = ENODATA;
    return -1;
  }
  Names names(name);
  for (int attempt = 0; attempt < kReadAttempts; attempt++) {
    // The plain form first: small values, the common case, cost one call.
    if (!value) {
      ssize_t got = target.get(names.plain(), nullptr, 0);
      if (got >= 0 || errno != ENODATA) return got;
    } else if (!fork || position == 0) {
      ssize_t got = target.get(names.plain(), value, size);
      if (got >= 0 || (errno != ENODATA && !(fork && errno == ERANGE))) return got;
      if (errno == ERANGE) {
        std::vector<uint8_t> whole;
        if (!readPlain(target, names, &whole)) {
          if (errno == ENODATA) continue;
          return -1;
        }
        size_t copied = std::min(size, whole.size());
        memcpy(value, whole.data(), copied);
        return static_cast<ssize_t>(copied);
      }
    } else if (!knownSegmented(target, names)) {
      // A plain value is one Linux attribute, never longer than the largest segment: one read
      // into the scratch space gets it whole, without asking its length first.
      ssize_t got = target.get(names.plain(), scratch(), kLargestSegment);
      if (got >= 0) {
        if (position >= static_cast<uint64_t>(got)) return 0;
        size_t copied = std::min<size_t>(size, static_cast<size_t>(got) - position);
        memcpy(value, scratch() + position, copied);
        return static_cast<ssize_t>(copied);
      }
      if (errno != ENODATA) return -1;
    }

    // A positional read of a value the cache knows goes on with the index it read first: the
    // value as it was then, for as long as its segments are there (see readSegmented).
    Index index;
    const Index *known = fork && position != 0 ? knownSegmented(target, names) : nullptr;
    int found = known ? 1 : readIndex(target, names, &index);
    if (known) index = *known;
    if (found <= 0) {
      if (found == 0) errno = ENODATA;
      return -1;
    }
    if (fork) rememberSegmented(target, names, &index);
    if (!value) return static_cast<ssize_t>(index.length);
    uint64_t count;
    if (!fork) {
      if (size < index.length) {
        errno = ERANGE;
        return -1;
      }
      count = index.length;
    } else {
      if (position >= index.length) return 0;
      count = std::min<uint64_t>(size, index.length - position);
    }
    int result = readSegmented(target, names, index, static_cast<uint8_t *>(value), position, count);
    if (result < 0) return -1;
    if (result == 0) return static_cast<ssize_t>(count);
    // Replaced meanwhile, by a segmented value or a plain one: start over, reading both forms.
    rememberSegmented(target, names, nullptr);
  }
  errno = EAGAIN;
  return -1;
}

// Replaces the whole value.
int replaceValue(const Target &target, const Names &names, const uint8_t *value, size_t size, bool hadPlain,
                 const Index *old) {
  uint32_t segmentSize;
  if (segmentSizeFor(target, size, &segmentSize) != 0) return -1;
  if (size <= segmentSize) {
    if (target.set(names.plain(), value, size) != 0) return -1;
    if (old) {
      target.remove(names.index());
      removeSegments(target, names, 0);
    }
    return 0;
  }
  uint32_t generation = newGeneration(old ? old->generation : 0);
  if (writeNewGeneration(target, names, segmentSize, generation, {}, value, size, 0, size) != 0) return -1;
  return publishSegmented(target, names, segmentSize, generation, size, hadPlain, old != nullptr);
}

// Before a segmented value grows past its end: drops whatever an interrupted writer may have
// left beyond the end in the segments numbered below `upTo`, so that the gap reads as zeros.
// 0, or -1 with errno.
int dropPastEnd(const Target &target, const Names &names, const Index &index, uint64_t upTo) {
  const uint64_t segmentSize = index.segmentSize;
  const uint64_t length = index.length;
  uint64_t tail = length / segmentSize;
  uint64_t kept = length % segmentSize;
  if (kept != 0 && tail < upTo) {
    ssize_t got = readSegment(target, names, index.generation, tail, scratch(), segmentSize);
    if (got < 0) return -1;
    if (static_cast<uint64_t>(got) > kept && writeSegment(target, names, index.generation, tail, scratch(), kept) != 0)
      return -1;
  }
  removeSegmentRange(target, names, index.generation, (length + segmentSize - 1) / segmentSize, upTo);
  return 0;
}

// Writes `size` bytes at `position` of a segmented value, extending it when they end past it.
int writeIntoSegments(const Target &target, const Names &names, const Index &index, const uint8_t *value,
                      size_t size, uint64_t position) {
  const uint64_t segmentSize = index.segmentSize;
  const uint64_t length = index.length;
  const uint64_t end = position + size;
  if (size == 0) {
    // Nothing to write, but a write past the end still extends the value to its position, as
    // it does a plain value: the bytes up to there must read as zeros.
    if (position <= length) return 0;
    if (dropPastEnd(target, names, index, (position + segmentSize - 1) / segmentSize) != 0) return -1;
    return writeIndex(target, names, index.segmentSize, index.generation, position);
  }
  uint64_t first = position / segmentSize, last = (end - 1) / segmentSize;
  // Segment `first` and those after it are rewritten below, gap included.
  if (position > length && dropPastEnd(target, names, index, first) != 0) return -1;

  for (uint64_t number = first; number <= last; number++) {
    uint64_t start = number * segmentSize;
    uint64_t from = std::max(position, start), to = std::min(end, start + segmentSize);
    uint64_t valid = length > start ? std::min(length - start, segmentSize) : 0;
    int result;
    if (from == start && to - start >= valid) {
      result = writeSegment(target, names, index.generation, number, value + (from - position), to - from);
    } else {
      uint8_t *bytes = scratch();
      ssize_t got = valid ? readSegment(target, names, index.generation, number, bytes, segmentSize) : 0;
      if (got < 0) return -1;
      uint64_t stored = std::min<uint64_t>(static_cast<uint64_t>(got), valid);
      if (from - start > stored) memset(bytes + stored, 0, from - start - stored);
      memcpy(bytes + (from - start), value + (from - position), to - from);
      result = writeSegment(target, names, index.generation, number, bytes, std::max(stored, to - start));
    }
    if (result != 0) return -1;
  }
  if (end > length) return writeIndex(target, names, index.segmentSize, index.generation, end);
  return 0;
}

// Writes at a position of the resource fork.
int writeAt(const Target &target, const Names &names, const uint8_t *value, size_t size, uint64_t position,
            const Index *index) {
  if (index) return writeIntoSegments(target, names, *index, value, size, position);
  std::vector<uint8_t> plain;
  bool hadPlain = readPlain(target, names, &plain);
  if (!hadPlain && errno != ENODATA) return -1;
  uint64_t length = std::max<uint64_t>(plain.size(), position + size);
  uint32_t segmentSize;
  if (segmentSizeFor(target, length, &segmentSize) != 0) return -1;
  if (length <= segmentSize) {
    plain.resize(length);
    if (size) memcpy(plain.data() + position, value, size);
    return target.set(names.plain(), plain.data(), plain.size());
  }
  uint32_t generation = newGeneration(0);
  if (writeNewGeneration(target, names, segmentSize, generation, plain, value, size, position, length) != 0)
    return -1;
  return publishSegmented(target, names, segmentSize, generation, length, hadPlain, false);
}

int setValue(const Target &target, const char *name, const void *value, size_t size, uint32_t position,
             int options) {
  if (!validName(name) || !validOptions(options)) return -1;
  bool fork = isResourceFork(name);
  if ((position != 0 && !fork) || isReserved(name) || (!value && size)) {
    errno = EINVAL;
    return -1;
  }
  Names names(name);
  ssize_t plainSize = target.get(names.plain(), nullptr, 0);
  if (plainSize < 0 && errno != ENODATA) return -1;
  Index index;
  int indexed = readIndex(target, names, &index);
  if (indexed == -1) return -1;
  bool exists = plainSize >= 0 || indexed != 0;
  if ((options & kXattrCreate) && exists) {
    errno = EEXIST;
    return -1;
  }
  if ((options & kXattrReplace) && !exists) {
    errno = ENODATA;
    return -1;
  }
  // A damaged index is replaced by whatever is written now.
  const Index *current = indexed == 1 ? &index : nullptr;
  const uint8_t *bytes = static_cast<const uint8_t *>(value);
  if (fork) {
    // A damaged index goes; so does an index beside a plain value (a replacement interrupted
    // between its two steps), because readers see the plain value and writes must change it.
    if (indexed < 0 || (indexed == 1 && plainSize >= 0)) {
      target.remove(names.index());
      removeSegments(target, names, 0);
      current = nullptr;
    }
    return writeAt(target, names, bytes, size, position, current);
  }
  if (indexed < 0) index = Index{};
  return replaceValue(target, names, bytes, size, plainSize >= 0, indexed != 0 ? &index : nullptr);
}

int removeValue(const Target &target, const char *name, int options) {
  if (!validName(name) || !validOptions(options)) return -1;
  if (isReserved(name)) {
    errno = ENODATA;
    return -1;
  }
  Names names(name);
  bool removed = target.remove(names.plain()) == 0;
  if (!removed && errno != ENODATA) return -1;
  // Unpublish first, then drop the segments, with any an interrupted writer left behind.
  if (target.remove(names.index()) == 0) removed = true;
  else if (errno != ENODATA) return -1;
  removeSegments(target, names, 0);
  if (!removed) {
    errno = ENODATA;
    return -1;
  }
  return 0;
}

ssize_t listValues(const Target &target, char *out, size_t size, int options) {
  if (!validOptions(options)) return -1;
  std::vector<std::string> all;
  if (!target.allNames(&all)) return -1;
  std::vector<std::string> visible;
  const std::string reserved = kReservedLinuxPrefix;
  for (const std::string &linuxName : all) {
    if (linuxName.compare(0, kUserPrefix.size(), kUserPrefix) != 0) continue;
    if (linuxName.compare(0, reserved.size(), reserved) == 0) {
      // An index "user.plzc#N#i" stands for the value N.
      if (linuxName.size() > reserved.size() + 2 && linuxName.compare(linuxName.size() - 2, 2, "#i") == 0)
        visible.push_back(linuxName.substr(reserved.size(), linuxName.size() - reserved.size() - 2));
      continue;
    }
    visible.push_back(linuxName.substr(kUserPrefix.size()));
  }
  std::sort(visible.begin(), visible.end());
  visible.erase(std::unique(visible.begin(), visible.end()), visible.end());
  size_t needed = 0;
  for (const std::string &name : visible) needed += name.size() + 1;
  if (!out) return static_cast<ssize_t>(needed);
  if (size < needed) {
    errno = ERANGE;
    return -1;
  }
  for (const std::string &name : visible) {
    memcpy(out, name.c_str(), name.size() + 1);
    out += name.size() + 1;
  }
  return static_cast<ssize_t>(needed);
}

// The reserved names of one value, as found on a file.
struct ReservedParts {
  bool hasIndex = false;
  struct Segment {
    std::string linuxName;
    uint32_t generation;
    uint64_t number;
  };
  std::vector<Segment> segments;
};

// Splits a segment suffix "<generation hex>.<number hex>"; false for anything else.
bool parseSegmentSuffix(std::string_view suffix, uint32_t *generation, uint64_t *number) {
  size_t dot = suffix.find('.');
  if (dot == std::string_view::npos || dot == 0 || dot + 1 == suffix.size() || dot > 8 || suffix.size() - dot > 17)
    return false;
  auto allHex = [](std::string_view digits) {
    return std::all_of(digits.begin(), digits.end(), [](char c) { return isxdigit(static_cast<unsigned char>(c)); });
  };
  if (!allHex(suffix.substr(0, dot)) || !allHex(suffix.substr(dot + 1))) return false;
  *generation = static_cast<uint32_t>(strtoul(std::string(suffix.substr(0, dot)).c_str(), nullptr, 16));
  *number = strtoull(std::string(suffix.substr(dot + 1)).c_str(), nullptr, 16);
  return true;
}

ssize_t listUnowned(const Target &target, std::vector<std::string> *out) {
  std::vector<std::string> all;
  if (!target.allNames(&all)) return -1;
  // Every reserved value name is "user.plzc#" N "#" suffix; N may hold '#', the suffix never.
  std::map<std::string, ReservedParts> values;
  const std::string reserved = kReservedLinuxPrefix;
  for (const std::string &linuxName : all) {
    if (linuxName.compare(0, reserved.size(), reserved) != 0) continue;
    std::string_view rest(linuxName.c_str() + reserved.size());
    size_t hash = rest.rfind('#');
    if (hash == std::string_view::npos || hash == 0) continue;  // the flag word, for one
    std::string valueName(rest.substr(0, hash));
    std::string_view suffix = rest.substr(hash + 1);
    ReservedParts::Segment segment{linuxName, 0, 0};
    if (suffix == "i")
      values[valueName].hasIndex = true;
    else if (parseSegmentSuffix(suffix, &segment.generation, &segment.number))
      values[valueName].segments.push_back(segment);
  }
  out->clear();
  for (const auto &[valueName, parts] : values) {
    Names names(valueName.c_str());
    Index index{};
    int found = parts.hasIndex ? readIndex(target, names, &index) : 0;
    if (found < 0 && errno == EIO) continue;  // damaged: what it owns cannot be known
    if (found < 0) return -1;
    bool hidden = false;
    if (found == 1) {
      if (target.get(names.plain(), nullptr, 0) >= 0) hidden = true;  // readers see the plain value
      else if (errno != ENODATA) return -1;
    }
    if (hidden) out->push_back(names.index());
    uint64_t published = found == 1 ? (index.length + index.segmentSize - 1) / index.segmentSize : 0;
    for (const ReservedParts::Segment &segment : parts.segments)
      if (found != 1 || hidden || segment.generation != index.generation || segment.number >= published)
        out->push_back(segment.linuxName);
  }
  return static_cast<ssize_t>(out->size());
}

}  // namespace

ssize_t flistunownedsegments(int fd, std::vector<std::string> *names) { return listUnowned(Target::ofFd(fd), names); }

int fremoveunownedsegments(int fd, const std::vector<std::string> &names) {
  Target target = Target::ofFd(fd);
  int firstError = 0;
  for (const std::string &linuxName : names)
    if (target.remove(linuxName) != 0 && errno != ENODATA && firstError == 0) firstError = errno;
  if (firstError == 0) return 0;
  errno = firstError;
  return -1;
}

XattrSegmentCounters &xattrSegmentCounters() { return counters(); }

ssize_t getxattr(const char *path, const char *name, void *value, size_t size, uint32_t position, int options) {
  return getValue(Target::ofPath(path, options), name, value, size, position, options);
}
ssize_t fgetxattr(int fd, const char *name, void *value, size_t size, uint32_t position, int options) {
  if (options & kXattrNoFollow) {
    errno = EINVAL;
    return -1;
  }
  return getValue(Target::ofFd(fd), name, value, size, position, options);
}
int setxattr(const char *path, const char *name, const void *value, size_t size, uint32_t position, int options) {
  return setValue(Target::ofPath(path, options), name, value, size, position, options);
}
int fsetxattr(int fd, const char *name, const void *value, size_t size, uint32_t position, int options) {
  if (options & kXattrNoFollow) {
    errno = EINVAL;
    return -1;
  }
  return setValue(Target::ofFd(fd), name, value, size, position, options);
}
int removexattr(const char *path, const char *name, int options) {
  return removeValue(Target::ofPath(path, options), name, options);
}
int fremovexattr(int fd, const char *name, int options) {
  if (options & kXattrNoFollow) {
    errno = EINVAL;
    return -1;
  }
  return removeValue(Target::ofFd(fd), name, options);
}
ssize_t listxattr(const char *path, char *names, size_t size, int options) {
  return listValues(Target::ofPath(path, options), names, size, options);
}
ssize_t flistxattr(int fd, char *names, size_t size, int options) {
  if (options & kXattrNoFollow) {
    errno = EINVAL;
    return -1;
  }
  return listValues(Target::ofFd(fd), names, size, options);
}

// The thread keeps the state, and the segment buffers in it, from one cache to the next: a
// reader going through many files would otherwise allocate and free them for every file.
thread_local ReadCacheState tKeptReadCache;

XattrReadCache::XattrReadCache() : active_(tReadCache == nullptr) {
  if (active_) tReadCache = &tKeptReadCache;
}

XattrReadCache::~XattrReadCache() {
  if (!active_) return;
  // What was read stays valid only while this cache lives: another process may rewrite the
  // file before the next one.
  for (ReadCacheState::Slot &slot : tReadCache->slots) slot.key.clear();
  tReadCache->segmentedValue.clear();
  tReadCache = nullptr;
}

}  // namespace platform
