// Finding and finishing what an interrupted compression or decompression left half-done.
#include "Libraries/CompressData/Repair.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <functional>
#include <new>
#include <vector>

#include "Common/FileHandle.h"
#include "Compressors/Zlib/Type3/compressorType3.h"
#include "Compressors/Zlib/Type4/compressorType4.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"

namespace {

// Receives decoded bytes in order; false stops the decoding.
using Sink = std::function<bool(uint64_t offset, const uint8_t *bytes, size_t count)>;

std::string cause(const char *what, int error) { return std::string(what) + ": " + strerror(error); }

std::string number(uint64_t value) { return std::to_string(value); }

uint64_t chunksFor(uint64_t size) { return (size + kType4ChunkSize - 1) / kType4ChunkSize; }

// The header attribute as found on the file.
struct Header {
  bool present = false;
  bool wellFormed = false;  // long enough, with the magic
  std::vector<uint8_t> bytes;
  uint32_t type = 0;
  uint64_t size = 0;
};

// Widens the mode for the life of the object when this process may not write the file: Linux
// lets only a writer change attributes, and the flag word is one.
class WriteAccess {
 public:
  WriteAccess(const char *path, mode_t mode) : path_(path), mode_(mode) {
    if (geteuid() == 0 || access(path, W_OK) == 0) return;
    if (sys::chmod(path, (mode | S_IWUSR) & 07777) != 0) {
      error_ = errno;
      return;
    }
    widened_ = true;
  }
  ~WriteAccess() {
    if (widened_) sys::chmod(path_, mode_ & 07777);
  }
  WriteAccess(const WriteAccess &) = delete;
  WriteAccess &operator=(const WriteAccess &) = delete;
  int error() const { return error_; }

 private:
  const char *path_;
  mode_t mode_;
  bool widened_ = false;
  int error_ = 0;
};

class FileRepair {
 public:
  FileRepair(const char *path, bool dryRun) : path_(path), dryRun_(dryRun) {}
  ~FileRepair() {
    if (fh_) fh_->close(fh_);
    if (fd_ >= 0) sys::close(fd_);
  }
  FileRepair(const FileRepair &) = delete;
  FileRepair &operator=(const FileRepair &) = delete;

  RepairReport run() {
    struct stat entry;
    if (sys::lstat(path_, &entry) != 0) return failed("", cause("cannot examine it", errno));
    if (!S_ISREG(entry.st_mode)) return {};
    fd_ = sys::open(path_, O_RDONLY | O_NOFOLLOW | O_CLOEXEC, 0);
    if (fd_ < 0) return failed("", cause("cannot open it", errno));
    if (platform::fstat(fd_, &st_) != 0) return failed("", cause("cannot examine it", errno));

    // Leftovers of the attribute layer first: no reader ever sees them, so removing them changes
    // nothing a reader gets, and the rest is then judged on what readers see.
    std::vector<std::string> unowned;
    if (platform::flistunownedsegments(fd_, &unowned) < 0) return failed("", cause("cannot list its attributes", errno));
    std::string segmentsFound, segmentsDone;
    if (!unowned.empty()) {
      segmentsFound = number(unowned.size()) + " attribute segments that no value owns";
      segmentsDone = dryRun_ ? "would remove them" : "removed them";
      if (!dryRun_) {
        WriteAccess access(path_, st_.st.st_mode);
        if (access.error()) return failed(segmentsFound, cause("cannot make it writable", access.error()));
        if (platform::fremoveunownedsegments(fd_, unowned) != 0)
          return failed(segmentsFound, cause("cannot remove them", errno));
      }
    }

    RepairReport report = examine();
    if (segmentsFound.empty()) return report;
    if (report.verdict == RepairVerdict::Clean) return {RepairVerdict::Repaired, segmentsFound, segmentsDone};
    report.state = segmentsFound + "; " + report.state;
    report.action = segmentsDone + "; " + report.action;
    return report;
  }

 private:
  RepairReport examine() {
    Header header;
    if (!readHeader(&header)) return failed("", cause("cannot read its compression header", errno));
    ssize_t forkSize = platform::fgetxattr(fd_, kResourceForkXattrName, nullptr, 0, 0, 0);
    if (forkSize < 0 && errno != ENOATTR) return failed("", cause("cannot read its resource fork", errno));
    forkSize_ = std::max<ssize_t>(forkSize, 0);
    dataSize_ = static_cast<uint64_t>(st_.st.st_size);
    flagged_ = (st_.st_flags & kCompressedFlag) != 0;
    fh_ = openFile(path_, path_, O_RDONLY);
    if (!fh_) return failed("", cause("cannot open it", errno));

    if (header.present) return examineHeader(header);
    if (forkSize_ > 0) return examineForkWithoutHeader();
    if (flagged_)
      return leftAlone("marked compressed, without compression header or resource fork",
                       "its data fork cannot be checked against anything");
    return {};
  }

  bool readHeader(Header *header) {
    ssize_t size = platform::fgetxattr(fd_, kDecmpfsXattrName, nullptr, 0, 0, 0);
    if (size < 0) return errno == ENOATTR;
    if (size == 0) return true;
    header->bytes.resize(static_cast<size_t>(size));
    ssize_t got = platform::fgetxattr(fd_, kDecmpfsXattrName, header->bytes.data(), header->bytes.size(), 0, 0);
    if (got < 0) return false;
    header->bytes.resize(static_cast<size_t>(got));
    header->present = got > 0;
    DiskHeader fields{};
    if (header->bytes.size() >= sizeof fields) {
      memcpy(&fields, header->bytes.data(), sizeof fields);
      header->wellFormed = fields.magic == kDecmpfsMagic;
      header->type = fields.compressionType;
      header->size = fields.uncompressedSize;
    }
    return true;
  }

  RepairReport examineHeader(const Header &header) {
    if (!header.wellFormed) return leftAlone("a compression header this library cannot read", "not a header it writes");
    if (header.type != 3 && header.type != 4) {
      // Type 5 and the like: data served from elsewhere, not this library's to check.
      if (flagged_) return {};
      return leftAlone("a type-" + number(header.type) + " compression header, not marked compressed",
                       "not a compressed form this library writes");
    }
    if (!flagged_) {
      if (dataSize_ > 0) return rollBack(header);
      if (header.size == 0) return leftAlone("a compression header for no data, beside an empty data fork", "nothing to prove it by");
      std::string why;
      if (!decodeForm(header, nullptr, &why))
        return leftAlone("an incomplete compressed form beside an empty data fork, not marked compressed",
                         "the data is in neither fork: " + why);
      return rollForward();
    }

    bool differs = false;
    std::vector<uint8_t> data(kType3ChunkSize);
    Sink compare = [&](uint64_t offset, const uint8_t *bytes, size_t count) {
      if (offset >= dataSize_) return true;
      size_t inData = static_cast<size_t>(std::min<uint64_t>(count, dataSize_ - offset));
      if (sys::pread(fd_, data.data(), inData, static_cast<off_t>(offset)) != static_cast<ssize_t>(inData) ||
          memcmp(data.data(), bytes, inData) != 0)
        differs = true;
      return !differs;
    };
    std::string why;
    if (!decodeForm(header, dataSize_ > 0 ? &compare : nullptr, &why)) {
      if (differs)
        return leftAlone("marked compressed, with other data in its data fork", "which of the two is the data is unknown");
      return leftAlone("marked compressed, but its compressed form does not decode", why);
    }
    if (dataSize_ == 0) return {};
    if (dataSize_ > header.size)
      return leftAlone("marked compressed, with a data fork longer than its data", "which of the two is the data is unknown");
    return finishDecompression(header);
  }

  // Decodes the compressed form named by the header whole, handing its bytes in order to sink
  // (if any); true when every chunk decoded completely and they came to exactly the header's
  // size. *why says what was wrong.
  bool decodeForm(const Header &header, const Sink *sink, std::string *why) {
    std::vector<uint8_t> out(kType3ChunkSize);
    if (header.type == 3) {
      int64_t produced =
          decodeAttributeType3(header.bytes.data(), static_cast<uint32_t>(header.bytes.size()), out.data());
      if (produced < 0) return (*why = "its one chunk does not decode"), false;
      if (static_cast<uint64_t>(produced) != header.size)
        return (*why = "it decodes to " + number(produced) + " bytes, not the " + number(header.size) +
                       " of its header"),
               false;
      if (sink && !(*sink)(0, out.data(), static_cast<size_t>(produced))) return (*why = "stopped"), false;
      return true;
    }
    if (header.bytes.size() != kDiskHeaderSize)
      return (*why = "a type-4 header of " + number(header.bytes.size()) + " bytes"), false;
    Type4ForkShape shape;
    if (forkSize_ == 0) return (*why = "its resource fork is missing"), false;
    if (readForkShapeType4(fh_, &shape) != 0) return (*why = "its resource fork is not a compressed form"), false;
    if (!shape.finished) return (*why = "its resource fork was never finished"), false;
    uint64_t chunks = chunksFor(header.size);
    if (shape.chunkCount != chunks)
      return (*why = "its resource fork holds " + number(shape.chunkCount) + " chunks where its size needs " +
                     number(chunks)),
             false;
    for (uint64_t index = 0; index < chunks; index++) {
      uint64_t offset = index * kType4ChunkSize;
      uint64_t expected = std::min<uint64_t>(kType4ChunkSize, header.size - offset);
      int64_t produced = decodeChunkType4(fh_, static_cast<uint32_t>(index), out.data());
      if (produced < 0 || static_cast<uint64_t>(produced) != expected)
        return (*why = "chunk " + number(index) + " does not decode to its " + number(expected) + " bytes"), false;
      if (sink && !(*sink)(offset, out.data(), static_cast<size_t>(produced))) return (*why = "stopped"), false;
    }
    return true;
  }

  // A compressor's resource fork without a header: the data fork is what readers get; the fork
  // is removed when it is proven to hold the data fork's bytes, finished or not.
  RepairReport examineForkWithoutHeader() {
    Type4ForkShape shape;
    bool compressorFork = readForkShapeType4(fh_, &shape) == 0;
    if (!compressorFork) {
      if (flagged_)
        return leftAlone("marked compressed, with a resource fork but no compression header",
                         "the fork is not a compressed form");
      return {};  // the file's own resource fork
    }
    std::string state = shape.finished ? "a compressed form's resource fork without its header"
                                       : "an unfinished compressed form's resource fork without a header";
    if (flagged_) state = "marked compressed, with " + state;
    if (dataSize_ == 0) return leftAlone(state + ", beside an empty data fork", "the data is in neither fork");
    if (shape.chunkCount != chunksFor(dataSize_))
      return leftAlone(state, "its " + number(shape.chunkCount) + " chunks are not the data fork's " +
                                  number(chunksFor(dataSize_)));
    if (flagged_ && !shape.finished) return leftAlone(state, "a decompression never leaves an unfinished fork");
    std::string why;
    if (!forkHoldsData(shape, &why)) return leftAlone(state, why);
    if (dryRun_) return repaired(state, flagged_ ? "would remove the fork and clear the compressed flag" : "would remove the fork");
    WriteAccess access(path_, st_.st.st_mode);
    if (access.error()) return failed(state, cause("cannot make it writable", access.error()));
    if (flagged_) {
      // The data fork must be durable before the flag that points readers at the fork goes.
      if (sys::fsync(fd_) != 0) return failed(state, cause("cannot flush the data fork", errno));
      if (platform::fchflags(fd_, st_.st_flags & ~kCompressedFlag) != 0)
        return failed(state, cause("cannot clear the compressed flag", errno));
    }
    if (platform::fremovexattr(fd_, kResourceForkXattrName, 0) != 0 && errno != ENOATTR)
      return failed(state, cause("cannot remove the fork", errno));
    return repaired(state, flagged_ ? "fork removed, compressed flag cleared; the data fork holds the data"
                                    : "fork removed; the data fork holds the data");
  }

  // Every chunk written must decode to the data fork's bytes at its place. A finished fork must
  // hold them all; an unfinished one may end with one chunk cut short, and nothing after it.
  bool forkHoldsData(const Type4ForkShape &shape, std::string *why) {
    std::vector<uint8_t> out(kType4ChunkSize), data(kType4ChunkSize);
    for (uint32_t index = 0; index < shape.chunkCount; index++) {
      uint64_t offset = static_cast<uint64_t>(index) * kType4ChunkSize;
      uint64_t expected = std::min<uint64_t>(kType4ChunkSize, dataSize_ - offset);
      int64_t produced = decodeChunkType4(fh_, index, out.data());
      if (produced > 0 && static_cast<uint64_t>(produced) == expected) {
        if (sys::pread(fd_, data.data(), expected, static_cast<off_t>(offset)) != static_cast<ssize_t>(expected) ||
            memcmp(data.data(), out.data(), expected) != 0)
          return (*why = "chunk " + number(index) + " holds other data than the data fork"), false;
        continue;
      }
      if (shape.finished || produced > 0)
        return (*why = "chunk " + number(index) + " does not decode to the data fork's bytes"), false;
      for (uint32_t later = index + 1; later < shape.chunkCount; later++)
        if (decodeChunkType4(fh_, later, out.data()) != 0)
          return (*why = "chunk " + number(later) + " was written after a chunk that is missing"), false;
      return true;
    }
    return true;
  }

  // No compressed flag: readers get the data fork, whatever the attributes hold. Removing the
  // compressed form changes no byte they get.
  RepairReport rollBack(const Header &header) {
    std::string state = dataSize_ == header.size
                            ? "a compressed form beside the whole data fork, not marked compressed"
                            : "a compression header for " + number(header.size) + " bytes beside a data fork of " +
                                  number(dataSize_) + ", not marked compressed";
    // A resource fork goes with a type-4 header only when it is a compressed form's fork.
    Type4ForkShape shape;
    bool removeFork = header.type == 4 && forkSize_ > 0 && readForkShapeType4(fh_, &shape) == 0;
    if (dryRun_) return repaired(state, "would remove the compressed form");
    WriteAccess access(path_, st_.st.st_mode);
    if (access.error()) return failed(state, cause("cannot make it writable", access.error()));
    // The header first: a fork left alone by a second interruption is recognised on its own.
    if (platform::fremovexattr(fd_, kDecmpfsXattrName, 0) != 0 && errno != ENOATTR)
      return failed(state, cause("cannot remove the compression header", errno));
    if (removeFork && platform::fremovexattr(fd_, kResourceForkXattrName, 0) != 0 && errno != ENOATTR)
      return failed(state, cause("cannot remove the resource fork", errno));
    return repaired(state, "compressed form removed; the data fork holds the data");
  }

  // The compressed form is whole and the data fork empty: the compression got as far as the
  // truncation; what it had left to do is to mark the file compressed.
  RepairReport rollForward() {
    std::string state = "a whole compressed form beside an empty data fork, not marked compressed";
    if (dryRun_) return repaired(state, "would mark it compressed");
    WriteAccess access(path_, st_.st.st_mode);
    if (access.error()) return failed(state, cause("cannot make it writable", access.error()));
    // As compressFile leaves a compressed file: the flag word is the compressed flag alone.
    if (platform::fchflags(fd_, kCompressedFlag) != 0) return failed(state, cause("cannot mark it compressed", errno));
    return repaired(state, "marked compressed");
  }

  // Marked compressed, the compressed form whole, and the data fork holding its first bytes (or
  // all of them): a decompression was cut short, or a compression could not truncate. The rest
  // of the data is written, made durable, and the file becomes plain.
  RepairReport finishDecompression(const Header &header) {
    bool whole = dataSize_ == header.size;
    std::string state = whole ? "marked compressed, with its whole data also in the data fork"
                              : "a decompression cut short: " + number(dataSize_) + " of " + number(header.size) +
                                    " bytes in the data fork";
    if (dryRun_) return repaired(state, whole ? "would remove the compressed form" : "would finish the decompression");
    WriteAccess access(path_, st_.st.st_mode);
    if (access.error()) return failed(state, cause("cannot make it writable", access.error()));
    int out = sys::open(path_, O_WRONLY | O_NOFOLLOW | O_CLOEXEC, 0);
    if (out < 0) return failed(state, cause("cannot open it for writing", errno));
    int error = 0;
    if (!whole) {
      Sink write = [&](uint64_t offset, const uint8_t *bytes, size_t count) {
        if (offset + count <= dataSize_) return true;
        size_t skip = offset < dataSize_ ? static_cast<size_t>(dataSize_ - offset) : 0;
        off_t at = static_cast<off_t>(offset + skip);
        if (sys::pwrite(out, bytes + skip, count - skip, at) != static_cast<ssize_t>(count - skip)) {
          error = errno ? errno : EIO;
          return false;
        }
        return true;
      };
      std::string why;
      if (!decodeForm(header, &write, &why)) {
        sys::close(out);
        return failed(state, error ? cause("cannot write the data", error) : "the compressed form changed: " + why);
      }
    }
    // The data must be durable before the flag that points readers at the compressed form goes.
    if (sys::fsync(out) != 0) error = errno;
    sys::close(out);
    if (error) return failed(state, cause("cannot flush the data fork", error));
    if (platform::fchflags(fd_, st_.st_flags & ~kCompressedFlag) != 0)
      return failed(state, cause("cannot clear the compressed flag", errno));
    if (platform::fremovexattr(fd_, kDecmpfsXattrName, 0) != 0 && errno != ENOATTR)
      return failed(state, cause("cannot remove the compression header", errno));
    if (header.type == 4 && platform::fremovexattr(fd_, kResourceForkXattrName, 0) != 0 && errno != ENOATTR)
      return failed(state, cause("cannot remove the resource fork", errno));
    return repaired(state, whole ? "compressed form removed, compressed flag cleared"
                                 : "decompression finished: data written, compressed form removed");
  }

  RepairReport repaired(const std::string &state, const std::string &action) {
    return {RepairVerdict::Repaired, state, action};
  }
  RepairReport leftAlone(const std::string &state, const std::string &why) {
    return {RepairVerdict::LeftAlone, state, "left alone: cannot be proven: " + why};
  }
  RepairReport failed(const std::string &state, const std::string &why) {
    return {RepairVerdict::Failed, state.empty() ? "unknown" : state, "failed: " + why};
  }

  const char *path_;
  bool dryRun_;
  int fd_ = -1;
  FileHandle *fh_ = nullptr;
  platform::Stat st_{};
  uint64_t dataSize_ = 0;
  int64_t forkSize_ = 0;
  bool flagged_ = false;
};

}  // namespace

RepairReport repairFile(const char *path, bool dryRun) {
  try {
    return FileRepair(path, dryRun).run();
  } catch (const std::bad_alloc &) {
    return {RepairVerdict::Failed, "unknown", "failed: " + cause("out of memory", ENOMEM)};
  }
}
