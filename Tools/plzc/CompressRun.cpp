#include "CompressRun.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <memory>
#include <cstdarg>
#include <mutex>

#include "Cli.h"
#include "FileWalk.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Progress.h"
#include "StoredForm.h"
#include "TocFile.h"
#include "VolumeReport.h"

namespace plzc {

namespace {

constexpr int64_t kType4SizeCap = 64ll << 20;  // type 4 refuses larger files without large forks

// compressFile answers -1 both when no type took the file (an outcome) and when a step failed.
// The errno it leaves behind tells them apart: these come only from a system call that failed
// on the file or its volume, never from a compressor declining.
bool isSystemFailure(int error) {
  switch (error) {
    case EIO: case ENOSPC: case EDQUOT: case E2BIG: case EROFS: case EACCES: case EPERM: case ENOENT:
    case ENOMEM: case EMFILE: case ENFILE: case EFBIG: case ENOTSUP: case ESTALE: case EBADF: case EISDIR:
      return true;
    default:
      return false;
  }
}

// The cause of a failure as the user should read it.
std::string describe(int error) {
  // The library's operations by path refuse to act on another file renamed into its place.
  if (error == ESTALE) return "another file took its place while it was being compressed; left as it was";
  return strerror(error);
}

class Compression {
 public:
  Compression(const CompressOptions &options, CompressorContext *ctx, Console &console, ProgressMeter &progress)
      : options_(options), ctx_(ctx), console_(console), progress_(progress), inPlace_(options.tocPath.empty()) {}

  void compressOne(const WalkedFile &file) {
    totals_.files++;
    examine(file.path.c_str());
    progress_.fileDone(file.size);
  }

  AtomicTotals &totals() { return totals_; }
  uint64_t tocLogicalBytes() const { return tocLogicalBytes_.load(); }

 private:
  void examine(const char *path) {
    platform::Stat before;
    if (platform::stat(path, &before) != 0) return fail(path, strerror(errno));
    uint64_t size = static_cast<uint64_t>(before.st.st_size);
    if (before.st_flags & kCompressedFlag) {
      StoredForm form;
      if (!readStoredForm(path, &form)) return fail(path, std::string("compressed, but unreadable: ") + strerror(errno));
      totals_.alreadyCompressed++;
      totals_.logicalBytes += form.logicalSize;
      totals_.storedBytes += form.storedSize;
      return note("%s: already compressed (type %u)\n", path, form.type);
    }
    // Why a file stays plain is asked only when it does: compressFile leaves a fork of the
    // file's own, and a header of an earlier attempt, as it finds them.
    auto hasOwnFork = [path] { return platform::getxattr(path, kResourceForkXattrName, nullptr, 0, 0, 0) > 0; };

    // A file renamed while the tree is walked can reach two workers under two names: one at a
    // time per file (the one stat above names it), so that the second finds the first's work
    // done instead of compressing the file under it and undoing what the first stored.
    FileLock *lock = inPlace_ ? PLZCLockFileIno(static_cast<int32_t>(before.st.st_dev), before.st.st_ino) : nullptr;
    errno = 0;
    int result = compressFile(ctx_, path, nullptr);
    int error = errno;
    if (lock) PLZCUnlockFile(lock);

    if (size == 0) {
      totals_.empty++;
      return note("%s: empty, left as it is\n", path);
    }
    if (!inPlace_) return recordTocOutcome(path, size, result, error, result != 0 && hasOwnFork());

    StoredForm after;
    if (!readStoredForm(path, &after)) return fail(path, std::string("unreadable after compression: ") + strerror(errno));
    if (!after.compressed && result != 0 && isSystemFailure(error)) {
      countPlain(size);  // the file stays as it was
      return fail(path, describe(error));
    }
    if (after.compressed) {
      if (result != 0) {
        // The compressed form was stored but a later step failed: with --verify, the data read
        // back differs, or could not be read back.
        return fail(path, options_.verify ? "compressed, but the data read back differs from the original"
                                          : "compressed, but a later step failed: " + describe(error));
      }
      totals_.compressed++;
      totals_.countType(after.type);
      totals_.logicalBytes += after.logicalSize;
      totals_.storedBytes += after.storedSize;
      double saved = after.logicalSize ? 100.0 * (1.0 - static_cast<double>(after.storedSize) /
                                                            static_cast<double>(after.logicalSize))
                                       : 0;
      return note("%s: type %u, %llu -> %llu bytes (%.1f%% saved)\n", path, after.type,
                  static_cast<unsigned long long>(after.logicalSize),
                  static_cast<unsigned long long>(after.storedSize), saved);
    }
    bool staleHeader = result == 0 && platform::getxattr(path, kDecmpfsXattrName, nullptr, 0, 0, 0) > 0;
    leftPlain(path, size, staleHeader ? "it carries a compression header of an earlier attempt"
                                      : declineReason(size, result != 0 && hasOwnFork()));
  }

  void recordTocOutcome(const char *path, uint64_t size, int result, int error, bool ownFork) {
    if (result == 0) {
      // Type and stored size come from the table of contents once it is complete.
      tocLogicalBytes_ += size;
      return note("%s: recorded in the table of contents\n", path);
    }
    if (isSystemFailure(error)) {
      countPlain(size);
      return fail(path, describe(error));
    }
    leftPlain(path, size, declineReason(size, ownFork));
  }

  std::string declineReason(uint64_t size, bool ownFork) const {
    if (ownFork) return "it has a resource fork of its own";
    if (static_cast<int64_t>(size) > kType4SizeCap && !options_.largeForks &&
        options_.types.find('4') != std::string::npos)
      return "it is over 64 MiB (--large-forks allows it)";
    return "it did not shrink enough";
  }

  void countPlain(uint64_t size) {
    totals_.logicalBytes += size;
    totals_.storedBytes += size;
  }

  void leftPlain(const char *path, uint64_t size, const std::string &reason) {
    totals_.leftPlain++;
    countPlain(size);
    note("%s: left as it is: %s\n", path, reason.c_str());
  }

  void fail(const char *path, const std::string &cause) {
    totals_.failed++;
    report("%s: %s\n", path, cause.c_str());
  }

  void note(const char *format, ...) __attribute__((format(printf, 2, 3))) {
    if (!console_.verbose()) return;
    va_list args;
    va_start(args, format);
    char line[4096];
    vsnprintf(line, sizeof line, format, args);
    va_end(args);
    console_.err("%s", visibleText(line).c_str());
  }

  const CompressOptions &options_;
  CompressorContext *ctx_;
  Console &console_;
  ProgressMeter &progress_;
  bool inPlace_;
  AtomicTotals totals_;
  std::atomic<uint64_t> tocLogicalBytes_{0};
};

// Adds what the table of contents records to the totals: one compressed file per record, its
// type from the header entry, its stored size as the compression query counts it.
bool addTocTotals(const std::string &tocPath, Totals *totals) {
  std::vector<uint8_t> bytes;
  if (!readWholeFile(tocPath, &bytes)) {
    report("%s: cannot read the table of contents back: %s\n", tocPath.c_str(), strerror(errno));
    return false;
  }
  std::vector<TocRecord> records;
  TocError error;
  if (!parseToc(bytes, &records, &error)) {
    report("%s: the table of contents written is malformed at byte %zu: %s\n", tocPath.c_str(), error.offset,
           error.reason.c_str());
    return false;
  }
  for (const TocRecord &record : records) {
    uint32_t type = 0;
    uint64_t headerSize = 0, forkSize = 0;
    for (const TocEntry &entry : record.entries) {
      if (entry.name == kDecmpfsXattrName && entry.length >= sizeof(DiskHeader)) {
        DiskHeader header;
        memcpy(&header, bytes.data() + entry.valueOffset, sizeof header);
        type = header.compressionType;
        headerSize = entry.length;
      } else if (entry.name == kResourceForkXattrName) {
        forkSize = entry.length;
      }
    }
    totals->compressed++;
    totals->byType[type < kTypeSlots ? type : kTypeSlots - 1]++;
    totals->storedBytes += type == 4 ? forkSize : headerSize;
  }
  return true;
}

}  // namespace

CompressResult runCompress(const CompressOptions &options, const std::vector<std::string> &paths, Console &console,
                           const char *progressLabel) {
  CompressResult result;
  CompressorContext *ctx = initCompressor(options.types.c_str(), nullptr, nullptr,
                                          options.tocPath.empty() ? nullptr : options.tocPath.c_str(), options.verify,
                                          options.level, options.largeForks);
  if (!ctx) {
    if (options.tocPath.empty())
      report("cannot set up the compressors: %s\n", strerror(errno));
    else
      report("%s: cannot create the table of contents: %s\n", options.tocPath.c_str(), strerror(errno));
    result.setupFailed = true;
    return result;
  }

  WalkOptions walk;
  if (options.tocPath.empty()) {
    // Every volume is examined once; files on one that cannot hold the compressed form would
    // only fail one by one.
    auto verdicts = std::make_shared<std::map<dev_t, std::string>>();
    walk.acceptArgument = [verdicts](const std::string &argument) {
      struct stat st;
      if (::stat(argument.c_str(), &st) != 0) return false;
      auto known = verdicts->find(st.st_dev);
      if (known == verdicts->end()) {
        VolumeReport volume;
        std::string reason = !examineVolume(argument, &volume) ? strerror(errno) : volume.holds ? "" : volume.reason;
        known = verdicts->emplace(st.st_dev, reason).first;
      }
      if (known->second.empty()) return true;
      report("%s: the volume cannot hold compressed files: %s\n", argument.c_str(), known->second.c_str());
      return false;
    };
  } else {
    struct stat tocStat;
    if (::stat(options.tocPath.c_str(), &tocStat) == 0) walk.exclude.insert({tocStat.st_dev, tocStat.st_ino});
  }

  ProgressMeter progress(console, progressLabel);
  Compression compression(options, ctx, console, progress);
  WalkResult walked = forEachFile(
      paths, walk, options.jobs, [&](const WalkedFile &file) { compression.compressOne(file); },
      [&](uint64_t files) { progress.setTotalFiles(files); });
  result.seconds = progress.elapsedSeconds();
  result.bytesWalked = progress.bytes();
  freeCompressor(ctx);  // closes the table of contents

  result.totals = compression.totals().snapshot();
  result.totals.failed += static_cast<uint64_t>(walked.failures);
  result.interrupted = walked.interrupted;
  if (!options.tocPath.empty()) {
    result.totals.logicalBytes += compression.tocLogicalBytes();
    if (!addTocTotals(options.tocPath, &result.totals)) result.totals.failed++;
  }
  return result;
}

}  // namespace plzc
