// Reading a compressed file back: its logical data to a writer, to standard output, or into
// its own data fork in place.
#include <fcntl.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <memory>

#include "Common/Diagnostics.h"
#include "Common/KeptBuffer.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/CompressedReader.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"

static constexpr char kSourcePath[] = "Libraries/CompressData/Decompress";

namespace {

constexpr int64_t kPieceSize = kDecompressPieceSize;
// Bytes asked of one sendfile call: the most Linux copies in one.
constexpr size_t kSendfileLimit = 0x7ffff000;

// -1 until known; every thread stores the same answer.
std::atomic<int> isRoot{-1};

bool runningAsRoot() {
  int known = isRoot.load(std::memory_order_relaxed);
  if (known == -1) {
    known = geteuid() == 0 ? 1 : 0;
    isRoot.store(known, std::memory_order_relaxed);
  }
  return known == 1;
}

int _decompressWriter(int64_t offset, const void *bytes, int64_t count, void *writerCtx) {
  auto *fh = static_cast<FileHandle *>(writerCtx);
  return fh->pwrite(fh, bytes, count, offset) == count ? 0 : -1;
}

int catWriter(int64_t, const void *bytes, int64_t count, void *) {
  ssize_t ignored = sys::write(1, bytes, static_cast<size_t>(count));
  (void)ignored;
  return 0;
}

// Reads fd to its end and writes what it reads to standard output (whose failures, like
// catWriter's, are not the reader's), counting it off *remaining. 0, or -1 after a message.
int copyToOutput(int fd, int64_t *remaining) {
  KeptBuffer blockBuffer(KeptBuffer::kDecompressOutput, kPieceSize);
  uint8_t *block = blockBuffer.get();
  if (!block) {
    PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
    return -1;
  }
  ssize_t got;
  while ((got = sys::read(fd, block, kPieceSize)) > 0) {
    ssize_t ignored = sys::write(1, block, static_cast<size_t>(got));
    (void)ignored;
    *remaining -= got;
  }
  if (got == -1) {
    PLZC_ERR("%s:%d: read: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

struct timeval toTimeval(const struct timespec &time) {
  return {time.tv_sec, time.tv_nsec / 1000};
}

}  // namespace

int decompressData(FileHandle *fh, DecompressWriter writer, void *writerCtx) {
  // The fork is read in small pieces (table entries, chunks): keep the segments they fall in.
  platform::XattrReadCache segmentCache;
  std::unique_ptr<plzc::CompressedReader> reader;
  plzc::CompressedReader::Found found;
  switch (plzc::CompressedReader::open(fh, &reader, &found)) {
    case plzc::CompressedReader::Status::Ok:
      break;
    case plzc::CompressedReader::Status::Unreadable:
      PLZC_ERR("%s:%d: fh_getxattr(%s,%s): %s\n", fh->name, kDecmpfsXattrName, strerror(errno));
      return -1;
    case plzc::CompressedReader::Status::Oversized:
      PLZC_ERR("%s:%d: Error: %s of %s claims %lld bytes: damaged\n", kDecmpfsXattrName, fh->name,
               static_cast<long long>(found.attributeSize));
      return -1;
    case plzc::CompressedReader::Status::NoMemory:
      PLZC_ERR("%s:%d: waitThenAllocate(%llu): %s\n", static_cast<unsigned long long>(found.attributeSize),
               strerror(errno));
      return -1;
    case plzc::CompressedReader::Status::WrongMagic:
      PLZC_ERR("%s:%d: Error: incorrect magic in the header of '%s'\n", fh->name);
      return -1;
    case plzc::CompressedReader::Status::ShortHeader:
    case plzc::CompressedReader::Status::UnsupportedType:
      // A header too short to hold a type is refused like an unknown type.
      PLZC_ERR("%s:%d: Error: invalid compressor type %d\n", static_cast<int>(found.header.compressionType));
      return -1;
  }
  KeptBuffer outputBuffer(KeptBuffer::kDecompressOutput, kPieceSize);
  uint8_t *output = outputBuffer.get();
  if (!output) {
    PLZC_ERR("%s:%d: malloc: %s\n", strerror(errno));
    return -1;
  }
  int result = 0;
  int64_t remaining = static_cast<int64_t>(reader->logicalSize()), offset = 0;
  while (remaining > 0) {
    int64_t produced = reader->read(offset, static_cast<uint64_t>(remaining < kPieceSize ? remaining : kPieceSize),
                                    output);
    // Nothing produced while bytes remain would ask for the same piece for ever.
    if (produced <= 0 || writer(offset, output, produced, writerCtx) == -1) {
      result = -1;
      break;
    }
    remaining -= produced;
    offset += produced;
  }
  return result;
}

int decompressFile(const char *path, bool verify, int forceUserSpace) {
  platform::Stat initial;
  if (platform::stat(path, &initial) != 0) {
    PLZC_ERR("%s:%d: Error: stat failed: %s (%d)\n", strerror(errno), errno);
    return -1;
  }
  if (!(initial.st_flags & kCompressedFlag)) return 0;
  int kernelDecompresses = osSupportsDecmpfs();
  uint8_t before[16], after[16];
  if (verify && !checksumFile(path, before)) {
    PLZC_ERR("%s:%d: Error: Unable to checksum file '%s' before decompression.\n", path);
    return -1;
  }
  bool restoreFlags = false, restoreMode = false;
  // The flag word is an attribute that only a writer may change, while Linux does not enforce
  // the flags themselves: the mode is widened before the flags are touched and restored after.
  mode_t mode = initial.st.st_mode;
  if (!runningAsRoot() && (mode & 0222) != 0222) {
    if (sys::chmod(path, (mode | 0222) & 07777) != 0) {
      PLZC_ERR("%s:%d: Error: Failed to change mode of compressed file at path '%s': %s (%d)\n", path,
               strerror(errno), errno);
      return -1;
    }
    restoreMode = true;
  }
  // In the library, every step after the open goes through the descriptor: flags, attributes,
  // times and mode then always reach the file being decompressed, never another file renamed
  // into its place while it was (which would be left flagged plain with its data elsewhere).
  FileHandle *fh = nullptr;
  int fd = -1;
  auto fail = [&]() {
    if (fh) fh->close(fh);
    return -1;
  };
  if (!kernelDecompresses || forceUserSpace) {
    fh = openFile(path, path, O_RDWR);
    if (!fh) {
      PLZC_ERR("%s:%d: Error: Failed to open compressed file at path '%s' for writing: %s (%d)\n", path,
               strerror(errno), errno);
      return -1;
    }
    fd = *static_cast<int32_t *>(fh->priv);
    struct stat opened;
    if (sys::fstat(fd, &opened) != 0) {
      PLZC_ERR("%s:%d: Error: Failed to stat compressed file at path '%s': %s (%d)\n", path, strerror(errno), errno);
      return fail();
    }
    if (opened.st_dev != initial.st.st_dev || opened.st_ino != initial.st.st_ino) {
      errno = ESTALE;
      PLZC_ERR("%s:%d: Error: File '%s' was replaced while being decompressed: %s (%d)\n", path, strerror(errno),
               errno);
      return fail();
    }
  }
  if (initial.st_flags & ~kCompressedFlag) {
    if ((fh ? fh->chflags(fh, kCompressedFlag) : platform::chflags(path, kCompressedFlag)) != 0) {
      PLZC_ERR("%s:%d: Error: Failed to clear flags of compressed file at path '%s': %s (%d)\n", path,
               strerror(errno), errno);
      return fail();
    }
    restoreFlags = true;
  }
  if (!fh) {
    // Opening a compressed file for writing makes the kernel expand it in place.
    int kernelFd = sys::open(path, O_WRONLY, 0);
    if (kernelFd < 0) {
      PLZC_ERR("%s:%d: Error: Failed to open compressed file at path '%s' for writing: %s (%d)\n", path,
               strerror(errno), errno);
      return -1;
    }
    sys::close(kernelFd);
  } else {
    if (decompressData(fh, _decompressWriter, fh) == -1) {
      PLZC_ERR("%s:%d: Error: Failed to decompress data for file at path '%s': %s (%d)\n", path, strerror(errno),
               errno);
      return fail();
    }
    // Whatever moment the process dies at, a reader must find the whole data: in the
    // compressed form while the file is marked compressed, in the data fork from the moment it
    // is not. So the data is made durable, then the file's own flags (without the compressed
    // flag) are set, and only then the compressed form is removed.
    if (fh->sync(fh) == -1) {
      PLZC_ERR("%s:%d: Error: Failed to flush the data of file at path '%s': %s (%d)\n", path, strerror(errno),
               errno);
      return fail();
    }
    if (fh->chflags(fh, initial.st_flags & ~kCompressedFlag) != 0) {
      PLZC_ERR("%s:%d: Error: Failed to set flags of compressed file at path '%s': %s (%d)\n", path,
               strerror(errno), errno);
      return fail();
    }
    restoreFlags = false;
    for (const char *name : {kDecmpfsXattrName, kResourceForkXattrName}) {
      if (fh->removexattr(fh, name, 0) == -1 && !(name == kResourceForkXattrName && errno == ENOATTR)) {
        PLZC_ERR("%s:%d: Error: Failed to remove %s xattr of file at path '%s': %s (%d)\n", name, path,
                 strerror(errno), errno);
        return fail();
      }
    }
  }
  struct timespec times[2] = {initial.st.st_atim, initial.st.st_mtim};
  struct timeval microTimes[2] = {toTimeval(initial.st.st_atim), toTimeval(initial.st.st_mtim)};
  if ((fh ? sys::futimens(fd, times) : sys::utimes(path, microTimes)) != 0) {
    PLZC_ERR("%s:%d: Error: Failed to restore timestamp of file at path '%s': %s (%d)\n", path, strerror(errno),
             errno);
    return fail();
  }
  uint32_t flags = initial.st_flags & ~kCompressedFlag;
  if (restoreFlags && (fh ? fh->chflags(fh, flags) : platform::chflags(path, flags)) != 0) {
    PLZC_ERR("%s:%d: Error: Failed to set flags of compressed file at path '%s': %s (%d)\n", path, strerror(errno),
             errno);
    return fail();
  }
  if (restoreMode && (fh ? sys::fchmod(fd, mode & 07777) : sys::chmod(path, mode & 07777)) != 0) {
    PLZC_ERR("%s:%d: Error: Failed to restore mode of compressed file at path '%s': %s (%d)\n", path,
             strerror(errno), errno);
    return fail();
  }
  if (fh) fh->close(fh);
  platform::Stat now;
  if (platform::stat(path, &now) != 0) {
    PLZC_ERR("%s:%d: Error: !? Stat failed for path '%s' after file should have decompressed. %s (%d)\n", path,
             strerror(errno), errno);
    return -1;
  }
  if (now.st_flags & kCompressedFlag) {
    PLZC_ERR("%s:%d: Error: File '%s' was still compressed after attempting decompression.\n", path);
    return -1;
  }
  if ((now.st_flags ^ initial.st_flags) != kCompressedFlag) {
    PLZC_ERR("%s:%d: Error: File '%s' changed flags attempting decompression.\n", path);
    return -1;
  }
  if (kernelDecompresses && now.st.st_size != initial.st.st_size) {
    PLZC_ERR("%s:%d: Error: File '%s' size changed after decompressing; went from %lld bytes to %lld bytes\n", path,
             static_cast<long long>(initial.st.st_size), static_cast<long long>(now.st.st_size));
    return -1;
  }
  if (verify) {
    if (!checksumFile(path, after)) {
      PLZC_ERR("%s:%d: Error: Unable to checksum file '%s' after decompression.\n", path);
      return -1;
    }
    if (memcmp(before, after, sizeof before) != 0) {
      PLZC_ERR("%s:%d: Error: File data after decompression is different than before for file '%s'.\n", path);
      return -1;
    }
  }
  return 0;
}

int catFileStatus(const char *path, int forceUserSpace) {
  platform::Stat st;
  if (platform::stat(path, &st) != 0) {
    PLZC_ERR("%s:%d: stat(%s): %s\n", path, strerror(errno));
    return -1;
  }
  return catFileStatusOf(path, st, forceUserSpace);
}

int catFileStatusOf(const char *path, const platform::Stat &st, int forceUserSpace) {
  if ((st.st_flags & kCompressedFlag) && (!osSupportsDecmpfs() || forceUserSpace)) {
    // The data is in the attributes alone: read through the path, the file is never opened.
    FileHandle *fh = openAttributeReader(path, path);
    if (!fh) {
      PLZC_ERR("%s:%d: Error: Failed to open compressed file at path '%s': %s (%d)\n", path, strerror(errno), errno);
      return -1;
    }
    int result = decompressData(fh, catWriter, nullptr);
    if (result == -1)
      PLZC_ERR("%s:%d: Error: Failed to decompress data for file at path '%s': %s (%d)\n", path, strerror(errno),
               errno);
    fh->close(fh);
    return result;
  }
  int fd = sys::open(path, O_RDONLY, 0);
  if (fd < 0) {
    PLZC_ERR("%s:%d: open(%s): %s\n", path, strerror(errno));
    return -1;
  }
  int64_t remaining = st.st.st_size;
  // The kernel copies the data to standard output without bringing it here. Where standard
  // output does not take it that way (a terminal, a file open for appending), or a copy fails
  // halfway, the reads go on from where it stopped and report what failed.
  ssize_t got;
  while ((got = sys::sendfile(1, fd, kSendfileLimit)) > 0) remaining -= got;
  int result = got == 0 ? 0 : copyToOutput(fd, &remaining);
  sys::close(fd);
  if (remaining != 0) {
    PLZC_ERR("%s:%d: Error: didn't read all of '%s'\n", path);
    result = -1;
  }
  return result;
}

void catFile(const char *path, int forceUserSpace) { catFileStatus(path, forceUserSpace); }
