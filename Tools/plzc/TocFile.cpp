#include "TocFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace plzc {

namespace {

constexpr size_t kMaxNameBytes = 499;

class TocParser {
 public:
  explicit TocParser(const std::vector<uint8_t> &bytes) : bytes_(bytes) {}

  bool parse(std::vector<TocRecord> *records, TocError *error) {
    while (at_ < bytes_.size()) {
      TocRecord record;
      if (!parseRecord(&record)) {
        *error = error_;
        records->clear();
        return false;
      }
      records->push_back(std::move(record));
    }
    return true;
  }

 private:
  bool fail(size_t offset, std::string reason) {
    error_ = TocError{offset, std::move(reason)};
    return false;
  }

  // A string ended by a 0 byte, of at most maxBytes bytes before it.
  bool readString(std::string *out, size_t maxBytes, const char *what) {
    size_t start = at_;
    const void *zero = memchr(bytes_.data() + at_, 0, bytes_.size() - at_);
    if (!zero) {
      if (bytes_.size() - at_ > maxBytes) return fail(start, std::string(what) + " longer than " + std::to_string(maxBytes) + " bytes");
      return fail(start, std::string("the file ends inside ") + what + " (no terminating 0 byte)");
    }
    size_t length = static_cast<size_t>(static_cast<const uint8_t *>(zero) - (bytes_.data() + at_));
    if (length > maxBytes) return fail(start, std::string(what) + " longer than " + std::to_string(maxBytes) + " bytes");
    if (length == 0) return fail(start, std::string("empty ") + what);
    out->assign(reinterpret_cast<const char *>(bytes_.data() + at_), length);
    at_ += length + 1;
    return true;
  }

  bool readU32(uint32_t *out, const char *what) {
    if (bytes_.size() - at_ < 4) return fail(at_, std::string("the file ends inside ") + what);
    *out = static_cast<uint32_t>(bytes_[at_]) | static_cast<uint32_t>(bytes_[at_ + 1]) << 8 |
           static_cast<uint32_t>(bytes_[at_ + 2]) << 16 | static_cast<uint32_t>(bytes_[at_ + 3]) << 24;
    at_ += 4;
    return true;
  }

  bool parseRecord(TocRecord *record) {
    record->offset = at_;
    if (!readString(&record->path, bytes_.size(), "a path")) return false;
    size_t countAt = at_;
    uint32_t count;
    if (!readU32(&count, "an entry count")) return false;
    if (count == 0) return fail(countAt, "entry count of '" + record->path + "' is 0");
    for (uint32_t i = 0; i < count; i++) {
      TocEntry entry;
      if (at_ == bytes_.size())
        return fail(at_, "the file ends after " + std::to_string(i) + " of the " + std::to_string(count) +
                             " entries of '" + record->path + "'");
      if (!readString(&entry.name, kMaxNameBytes, "an attribute name")) return false;
      size_t lengthAt = at_;
      if (!readU32(&entry.length, "a value length")) return false;
      if (entry.length == 0) return fail(lengthAt, "value length of " + entry.name + " is 0");
      if (bytes_.size() - at_ < entry.length)
        return fail(lengthAt, "value of " + entry.name + " needs " + std::to_string(entry.length) + " bytes, only " +
                                  std::to_string(bytes_.size() - at_) + " remain");
      entry.valueOffset = at_;
      at_ += entry.length;
      record->entries.push_back(std::move(entry));
    }
    return true;
  }

  const std::vector<uint8_t> &bytes_;
  size_t at_ = 0;
  TocError error_;
};

}  // namespace

bool parseToc(const std::vector<uint8_t> &bytes, std::vector<TocRecord> *records, TocError *error) {
  records->clear();
  return TocParser(bytes).parse(records, error);
}

bool readWholeFile(const std::string &path, std::vector<uint8_t> *bytes) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  bytes->clear();
  uint8_t block[65536];
  for (;;) {
    ssize_t got = read(fd, block, sizeof block);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) {
      int error = errno;
      close(fd);
      errno = error;
      return false;
    }
    if (got == 0) break;
    bytes->insert(bytes->end(), block, block + got);
  }
  close(fd);
  return true;
}

}  // namespace plzc
