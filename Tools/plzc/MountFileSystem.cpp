#include "MountFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/xattr.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include "Libraries/CompressData/CompressedReader.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/SystemLog.h"
#include "Plenzo.h"

namespace plzc {
namespace {

MountFileSystem &self() { return *static_cast<MountFileSystem *>(fuse_get_context()->private_data); }

// The path FUSE gives ("/a/b") relative to the source directory ("a/b", "." for the root).
const char *relative(const char *path) {
  if (!path) return ".";
  while (*path == '/') path++;
  return *path ? path : ".";
}

// Anything that changes when the file's data or attributes change.
uint64_t versionOf(const struct stat &st) {
  uint64_t changed = static_cast<uint64_t>(st.st_ctim.tv_sec) * 1000000000ULL + static_cast<uint64_t>(st.st_ctim.tv_nsec);
  return changed * 0x9E3779B97F4A7C15ULL ^ static_cast<uint64_t>(st.st_size);
}

// One version of an open compressed file, ready to decode: replaced whole when the file
// changes, kept alive by every read that uses it.
struct Decoding {
  uint64_t version = 0;
  bool plain = false;  // the file is not (or no longer) compressed: reads go to its data
  FileHandle *fh = nullptr;
  std::unique_ptr<CompressedReader> reader;
  CompressedReader::Status status = CompressedReader::Status::Ok;
  CompressedReader::Found found;
  int openErrno = 0;
  mutable std::atomic<bool> reported{false};  // one message in the log per version, not one per read
  ~Decoding() {
    reader.reset();
    if (fh) fh->close(fh);
  }
};

// What fi->fh points at: an open file or an open directory.
struct Node {
  int fd = -1;
  bool directory = false;
};

struct OpenFile : Node {
  std::string name;  // relative to the source, for messages
  uint64_t device = 0, inode = 0;
  std::mutex mutex;  // guards decoding (the pointer, not what it points at)
  std::shared_ptr<Decoding> decoding;
};

struct OpenDirectory : Node {
  DIR *stream = nullptr;
};

Node *nodeOf(const fuse_file_info *fi) { return fi ? reinterpret_cast<Node *>(fi->fh) : nullptr; }
OpenFile *fileOf(const fuse_file_info *fi) { return static_cast<OpenFile *>(nodeOf(fi)); }

void report(const std::string &name, const std::string &cause) {
  systemLog(LOG_ERR, "plzc mount: %s/%s: %s", self().settings().source.c_str(), name.c_str(), cause.c_str());
}

std::string describe(const Decoding &decoding) {
  char text[160];
  switch (decoding.status) {
    case CompressedReader::Status::Ok:
      return "readable";
    case CompressedReader::Status::Unreadable:
      snprintf(text, sizeof text, "its compression header cannot be read: %s", strerror(decoding.openErrno));
      return text;
    case CompressedReader::Status::Oversized:
      snprintf(text, sizeof text, "its compression header claims %lld bytes: damaged",
               static_cast<long long>(decoding.found.attributeSize));
      return text;
    case CompressedReader::Status::ShortHeader:
      return "its compression header is shorter than 16 bytes";
    case CompressedReader::Status::WrongMagic:
      return "its compression header has a wrong magic";
    case CompressedReader::Status::UnsupportedType:
      snprintf(text, sizeof text, "it is compressed with type %u, which this build cannot decode",
               decoding.found.header.compressionType);
      return text;
    case CompressedReader::Status::NoMemory:
      return "no memory to read its compression header";
  }
  return "unknown state";
}

// Reads the flags and, for a compressed file, its header, through the open descriptor.
std::shared_ptr<Decoding> makeDecoding(const OpenFile &file, uint64_t version) {
  auto decoding = std::make_shared<Decoding>();
  decoding->version = version;
  platform::Stat st;
  if (platform::fstat(file.fd, &st) != 0 || !(st.st_flags & kCompressedFlag)) {
    decoding->plain = true;
    return decoding;
  }
  std::string path = "/proc/self/fd/" + std::to_string(file.fd);
  decoding->fh = openFile(file.name.c_str(), path.c_str(), O_RDONLY);
  if (!decoding->fh) {
    decoding->status = CompressedReader::Status::Unreadable;
    decoding->openErrno = errno;
    return decoding;
  }
  decoding->status = CompressedReader::open(decoding->fh, &decoding->reader, &decoding->found);
  decoding->openErrno = errno;
  return decoding;
}

// The file's current decoding, made anew when the file changed since the last one.
int currentDecoding(OpenFile *file, std::shared_ptr<Decoding> *out) {
  struct stat st;
  if (fstat(file->fd, &st) != 0) return -errno;
  uint64_t version = versionOf(st);
  std::lock_guard<std::mutex> lock(file->mutex);
  if (!file->decoding || file->decoding->version != version) file->decoding = makeDecoding(*file, version);
  *out = file->decoding;
  return 0;
}

void reportChunk(const OpenFile *file, const Decoding &decoding, uint64_t index, int error) {
  if (decoding.reported.exchange(true)) return;
  char cause[128];
  snprintf(cause, sizeof cause, "chunk %llu of %llu cannot be decoded: %s", static_cast<unsigned long long>(index),
           static_cast<unsigned long long>(decoding.reader->chunkCount()), strerror(error));
  report(file->name, cause);
}

int readCompressed(OpenFile *file, const Decoding &decoding, char *buffer, size_t size, off_t offset) {
  if (decoding.status != CompressedReader::Status::Ok) {
    if (!decoding.reported.exchange(true)) report(file->name, "cannot be read: " + describe(decoding));
    return -EIO;
  }
  const CompressedReader &reader = *decoding.reader;
  uint64_t logical = reader.logicalSize();
  if (offset < 0) return -EINVAL;
  if (static_cast<uint64_t>(offset) >= logical) return 0;
  size_t want = static_cast<size_t>(std::min<uint64_t>(size, logical - static_cast<uint64_t>(offset)));
  size_t done = 0;
  ChunkCache &cache = self().cache();
  // The chunks of one request share their table and fork segments: read each segment once.
  platform::XattrReadCache segments;
  while (done < want) {
    uint64_t position = static_cast<uint64_t>(offset) + done;
    uint64_t index = position / reader.chunkSize();
    size_t within = static_cast<size_t>(position % reader.chunkSize());
    ChunkKey key{file->device, file->inode, decoding.version, index};
    int error = 0;
    uint32_t length = reader.chunkLength(index);
    if (within == 0 && want - done >= length) {
      // The request takes the whole chunk: the kernel keeps its pages, nobody asks for it
      // again soon. Decode it straight into the reply unless it is cached already; keeping
      // it would only cost fresh memory.
      if (ChunkCache::Chunk kept = cache.find(key)) {
        memcpy(buffer + done, kept->data(), length);
      } else if (reader.readChunk(index, reinterpret_cast<uint8_t *>(buffer) + done) < 0) {
        reportChunk(file, decoding, index, EIO);
        return -EIO;
      } else {
        self().directDecodes++;
      }
      done += length;
      continue;
    }
    // Part of a chunk: the next request most likely wants the rest, so the chunk is kept.
    ChunkCache::Chunk chunk = cache.get(
        key,
        [&](std::vector<uint8_t> *bytes) {
          bytes->resize(length);
          return reader.readChunk(index, bytes->data()) < 0 ? EIO : 0;
        },
        &error);
    if (!chunk || chunk->size() <= within) {
      reportChunk(file, decoding, index, error ? error : EIO);
      return -EIO;
    }
    size_t step = std::min(chunk->size() - within, want - done);
    memcpy(buffer + done, chunk->data() + within, step);
    done += step;
  }
  return static_cast<int>(done);
}

// Turns a compressed file plain before it is written or truncated; 0 or -errno.
int makePlain(const char *rel) {
  MountFileSystem &fs = self();
  // Two writers opening the same compressed file must not both expand it.
  static std::mutex expanding;
  std::lock_guard<std::mutex> lock(expanding);
  std::string path = fs.sourcePath(rel);
  platform::Stat st;
  if (platform::lstat(path.c_str(), &st) != 0) return errno == ENOENT ? 0 : -errno;
  if (!S_ISREG(st.st.st_mode) || !(st.st_flags & kCompressedFlag)) return 0;
  if (decompressFile(path.c_str(), false, 0) != 0) {
    report(rel, "cannot be made plain for writing");
    return -EIO;
  }
  fs.cache().dropFile(st.st.st_dev, st.st.st_ino);
  fs.forgetVersion(st.st.st_dev, st.st.st_ino);
  return 0;
}

// New nodes belong to the caller, as on any file system, when the mount runs as root.
void giveToCaller(const char *rel) {
  if (geteuid() != 0) return;
  const fuse_context *context = fuse_get_context();
  if (context->uid == 0 && context->gid == 0) return;
  // A set-group-ID directory hands its own group down; keep what the kernel chose then.
  std::string parent(rel);
  size_t slash = parent.rfind('/');
  parent = slash == std::string::npos ? "." : parent.substr(0, slash);
  struct stat dir;
  bool inheritGroup = fstatat(self().sourceFd(), parent.c_str(), &dir, 0) == 0 && (dir.st_mode & S_ISGID);
  if (fchownat(self().sourceFd(), rel, context->uid, inheritGroup ? static_cast<gid_t>(-1) : context->gid,
               AT_SYMLINK_NOFOLLOW) != 0) {
    // The node exists and works; only its owner is not the caller's.
    report(rel, std::string("cannot give the new node to its creator: ") + strerror(errno));
  }
}

int fail(int result) { return result == -1 ? -errno : result; }

// ---- the operations ----------------------------------------------------------------------

void *fsInit(fuse_conn_info *conn, fuse_config *cfg) {
  MountFileSystem &fs = self();
  cfg->use_ino = 1;
  cfg->readdir_ino = 1;
  cfg->nullpath_ok = 1;
  cfg->hard_remove = 1;
  cfg->entry_timeout = fs.settings().attributeTimeout;
  cfg->attr_timeout = fs.settings().attributeTimeout;
  cfg->negative_timeout = 0;
  // Large requests: fewer round trips per byte (the kernel lowers what it cannot do).
  conn->max_write = 1u << 20;
  conn->max_readahead = 1u << 20;
  // FUSE refuses to start unless this repeats the mount option.
  if (fs.settings().maxRead) conn->max_read = fs.settings().maxRead;
  return &fs;
}

int fsGetattr(const char *path, struct stat *st, fuse_file_info *fi) {
  MountFileSystem &fs = self();
  Node *node = nodeOf(fi);
  // The flag word comes with the stat: only a compressed file costs more than that.
  platform::Stat found;
  std::string sourcePath;
  if (node) {
    if (platform::fstat(node->fd, &found) != 0) return -errno;
    sourcePath = "/proc/self/fd/" + std::to_string(node->fd);
  } else {
    sourcePath = fs.sourcePath(relative(path));
    if (platform::lstat(sourcePath.c_str(), &found) != 0) return -errno;
  }
  *st = found.st;
  if (!S_ISREG(st->st_mode) || !(found.st_flags & kCompressedFlag)) return 0;
  CompressionInfo info;
  if (queryCompressionInfo(sourcePath.c_str(), &info) != 0 || info.compressionType == 0) return 0;
  st->st_size = static_cast<off_t>(info.uncompressedSize);
  if (info.compressedSize != UINT64_MAX) {
    uint64_t block = st->st_blksize > 0 ? static_cast<uint64_t>(st->st_blksize) : 4096;
    uint64_t stored = (info.compressedSize + block - 1) / block * block;
    st->st_blocks += static_cast<blkcnt_t>(stored / 512);
  }
  return 0;
}

int fsReadlink(const char *path, char *buffer, size_t size) {
  if (size == 0) return -EINVAL;
  ssize_t length = readlinkat(self().sourceFd(), relative(path), buffer, size - 1);
  if (length < 0) return -errno;
  buffer[length] = '\0';
  return 0;
}

int fsMknod(const char *path, mode_t mode, dev_t rdev) {
  const char *rel = relative(path);
  int result = S_ISFIFO(mode) ? mkfifoat(self().sourceFd(), rel, mode) : mknodat(self().sourceFd(), rel, mode, rdev);
  if (result != 0) return -errno;
  giveToCaller(rel);
  return 0;
}

int fsMkdir(const char *path, mode_t mode) {
  const char *rel = relative(path);
  if (mkdirat(self().sourceFd(), rel, mode) != 0) return -errno;
  giveToCaller(rel);
  return 0;
}

int fsUnlink(const char *path) { return fail(unlinkat(self().sourceFd(), relative(path), 0)); }
int fsRmdir(const char *path) { return fail(unlinkat(self().sourceFd(), relative(path), AT_REMOVEDIR)); }

int fsSymlink(const char *target, const char *path) {
  const char *rel = relative(path);
  if (symlinkat(target, self().sourceFd(), rel) != 0) return -errno;
  giveToCaller(rel);
  return 0;
}

int fsRename(const char *from, const char *to, unsigned int flags) {
  int fd = self().sourceFd();
  return fail(renameat2(fd, relative(from), fd, relative(to), flags));
}

int fsLink(const char *from, const char *to) {
  int fd = self().sourceFd();
  return fail(linkat(fd, relative(from), fd, relative(to), 0));
}

int fsChmod(const char *path, mode_t mode, fuse_file_info *fi) {
  if (Node *node = nodeOf(fi)) return fail(fchmod(node->fd, mode));
  return fail(fchmodat(self().sourceFd(), relative(path), mode, 0));
}

int fsChown(const char *path, uid_t uid, gid_t gid, fuse_file_info *fi) {
  if (Node *node = nodeOf(fi)) return fail(fchown(node->fd, uid, gid));
  return fail(fchownat(self().sourceFd(), relative(path), uid, gid, AT_SYMLINK_NOFOLLOW));
}

int fsTruncate(const char *path, off_t size, fuse_file_info *fi) {
  // A descriptor that may truncate was opened for writing, so its file is plain already.
  if (Node *node = nodeOf(fi)) return fail(ftruncate(node->fd, size));
  const char *rel = relative(path);
  if (int result = makePlain(rel)) return result;
  return fail(truncate(self().sourcePath(rel).c_str(), size));
}

OpenFile *newOpenFile(int fd, const char *rel) {
  auto *file = new OpenFile;
  file->fd = fd;
  file->name = rel;
  struct stat st;
  if (fstat(fd, &st) == 0) {
    file->device = st.st_dev;
    file->inode = st.st_ino;
    if (S_ISREG(st.st_mode)) file->decoding = makeDecoding(*file, versionOf(st));
  }
  return file;
}

int fsOpen(const char *path, fuse_file_info *fi) {
  MountFileSystem &fs = self();
  const char *rel = relative(path);
  bool writing = (fi->flags & O_ACCMODE) != O_RDONLY || (fi->flags & O_TRUNC);
  if (writing) {
    if (int result = makePlain(rel)) return result;
  }
  // O_DIRECT is the kernel's business with the mount: the server's own reads may be buffered.
  int fd = openat(fs.sourceFd(), rel, (fi->flags & ~(O_CREAT | O_EXCL | O_NOCTTY | O_DIRECT)) | O_NOFOLLOW);
  if (fd < 0) return -errno;
  OpenFile *file = newOpenFile(fd, rel);
  const Decoding *decoding = file->decoding.get();
  // The kernel's pages of a file it read before stay valid while the file is the same version.
  if (decoding && !writing && fs.settings().keepCache)
    fi->keep_cache = fs.sameVersionAsLastOpen(file->device, file->inode, decoding->version);
  fi->fh = reinterpret_cast<uint64_t>(static_cast<Node *>(file));
  return 0;
}

int fsCreate(const char *path, mode_t mode, fuse_file_info *fi) {
  const char *rel = relative(path);
  // The kernel may believe a name absent that exists by now: a compressed file opened this way
  // is made plain first, as by open.
  if (!(fi->flags & O_EXCL)) {
    if (int result = makePlain(rel)) return result;
  }
  int fd = openat(self().sourceFd(), rel, (fi->flags & ~O_DIRECT) | O_CREAT | O_NOFOLLOW, mode);
  if (fd < 0) return -errno;
  giveToCaller(rel);
  OpenFile *file = newOpenFile(fd, rel);
  fi->fh = reinterpret_cast<uint64_t>(static_cast<Node *>(file));
  return 0;
}

int fsRead(const char *path, char *buffer, size_t size, off_t offset, fuse_file_info *fi) {
  OpenFile *file = fileOf(fi);
  std::shared_ptr<Decoding> decoding;
  if (int result = currentDecoding(file, &decoding)) return result;
  if (!decoding->plain) return readCompressed(file, *decoding, buffer, size, offset);
  ssize_t got = pread(file->fd, buffer, size, offset);
  return got < 0 ? -errno : static_cast<int>(got);
}

int fsWrite(const char *path, const char *buffer, size_t size, off_t offset, fuse_file_info *fi) {
  ssize_t put = pwrite(fileOf(fi)->fd, buffer, size, offset);
  return put < 0 ? -errno : static_cast<int>(put);
}

int fsStatfs(const char *path, struct statvfs *st) {
  return fail(statvfs(self().sourcePath(".").c_str(), st));
}

int fsRelease(const char *path, fuse_file_info *fi) {
  OpenFile *file = fileOf(fi);
  close(file->fd);
  delete file;
  return 0;
}

int fsFsync(const char *path, int dataOnly, fuse_file_info *fi) {
  int fd = nodeOf(fi)->fd;
  return fail(dataOnly ? fdatasync(fd) : fsync(fd));
}

int fsSetxattr(const char *path, const char *name, const char *value, size_t size, int flags) {
  if (!self().settings().showCompressionAttributes && isCompressionAttribute(name)) return -EPERM;
  return fail(lsetxattr(self().sourcePath(relative(path)).c_str(), name, value, size, flags));
}

int fsGetxattr(const char *path, const char *name, char *value, size_t size) {
  if (!self().settings().showCompressionAttributes && isCompressionAttribute(name)) return -ENODATA;
  ssize_t length = lgetxattr(self().sourcePath(relative(path)).c_str(), name, value, size);
  return length < 0 ? -errno : static_cast<int>(length);
}

int fsListxattr(const char *path, char *list, size_t size) {
  std::string source = self().sourcePath(relative(path));
  if (self().settings().showCompressionAttributes) {
    ssize_t length = llistxattr(source.c_str(), list, size);
    return length < 0 ? -errno : static_cast<int>(length);
  }
  // The whole list is read, then filtered: its length with the hidden names left out is what
  // a caller asking for the size must get.
  std::vector<char> names;
  for (;;) {
    ssize_t needed = llistxattr(source.c_str(), nullptr, 0);
    if (needed < 0) return -errno;
    names.resize(static_cast<size_t>(needed));
    ssize_t got = needed == 0 ? 0 : llistxattr(source.c_str(), names.data(), names.size());
    if (got >= 0) {
      names.resize(static_cast<size_t>(got));
      break;
    }
    if (errno != ERANGE) return -errno;  // the list grew meanwhile: ask again
  }
  std::string shown;
  for (size_t at = 0; at < names.size();) {
    const char *name = names.data() + at;
    size_t length = strnlen(name, names.size() - at);
    if (!isCompressionAttribute(name)) shown.append(name, length).push_back('\0');
    at += length + 1;
  }
  if (size == 0) return static_cast<int>(shown.size());
  if (shown.size() > size) return -ERANGE;
  memcpy(list, shown.data(), shown.size());
  return static_cast<int>(shown.size());
}

int fsRemovexattr(const char *path, const char *name) {
  if (!self().settings().showCompressionAttributes && isCompressionAttribute(name)) return -ENODATA;
  return fail(lremovexattr(self().sourcePath(relative(path)).c_str(), name));
}

int fsOpendir(const char *path, fuse_file_info *fi) {
  int fd = openat(self().sourceFd(), relative(path), O_RDONLY | O_DIRECTORY);
  if (fd < 0) return -errno;
  DIR *stream = fdopendir(fd);
  if (!stream) {
    int saved = errno;
    close(fd);
    return -saved;
  }
  auto *directory = new OpenDirectory;
  directory->fd = fd;
  directory->directory = true;
  directory->stream = stream;
  fi->fh = reinterpret_cast<uint64_t>(static_cast<Node *>(directory));
  return 0;
}

int fsReaddir(const char *path, void *buffer, fuse_fill_dir_t fill, off_t offset, fuse_file_info *fi,
              fuse_readdir_flags flags) {
  auto *directory = static_cast<OpenDirectory *>(nodeOf(fi));
  // Every entry goes out in one call (offsets 0): the library keeps the list for later calls.
  rewinddir(directory->stream);
  errno = 0;
  while (dirent *entry = readdir(directory->stream)) {
    struct stat st = {};
    st.st_ino = entry->d_ino;
    st.st_mode = static_cast<mode_t>(DTTOIF(entry->d_type));
    if (fill(buffer, entry->d_name, &st, 0, static_cast<fuse_fill_dir_flags>(0)) != 0) break;
  }
  return errno ? -errno : 0;
}

int fsReleasedir(const char *path, fuse_file_info *fi) {
  auto *directory = static_cast<OpenDirectory *>(nodeOf(fi));
  closedir(directory->stream);
  delete directory;
  return 0;
}

int fsUtimens(const char *path, const struct timespec times[2], fuse_file_info *fi) {
  if (Node *node = nodeOf(fi)) return fail(futimens(node->fd, times));
  return fail(utimensat(self().sourceFd(), relative(path), times, AT_SYMLINK_NOFOLLOW));
}

int fsFallocate(const char *path, int mode, off_t offset, off_t length, fuse_file_info *fi) {
  return fail(fallocate(nodeOf(fi)->fd, mode, offset, length));
}

fuse_operations makeOperations() {
  fuse_operations ops = {};
  ops.init = fsInit;
  ops.getattr = fsGetattr;
  ops.readlink = fsReadlink;
  ops.mknod = fsMknod;
  ops.mkdir = fsMkdir;
  ops.unlink = fsUnlink;
  ops.rmdir = fsRmdir;
  ops.symlink = fsSymlink;
  ops.rename = fsRename;
  ops.link = fsLink;
  ops.chmod = fsChmod;
  ops.chown = fsChown;
  ops.truncate = fsTruncate;
  ops.open = fsOpen;
  ops.create = fsCreate;
  ops.read = fsRead;
  ops.write = fsWrite;
  ops.statfs = fsStatfs;
  ops.release = fsRelease;
  ops.fsync = fsFsync;
  ops.setxattr = fsSetxattr;
  ops.getxattr = fsGetxattr;
  ops.listxattr = fsListxattr;
  ops.removexattr = fsRemovexattr;
  ops.opendir = fsOpendir;
  ops.readdir = fsReaddir;
  ops.releasedir = fsReleasedir;
  ops.utimens = fsUtimens;
  ops.fallocate = fsFallocate;
  return ops;
}

}  // namespace

bool isCompressionAttribute(const char *linuxName) {
  static const std::string header = std::string("user.") + kDecmpfsXattrName;
  static const std::string fork = std::string("user.") + kResourceForkXattrName;
  return header == linuxName || fork == linuxName ||
         strncmp(linuxName, platform::kReservedLinuxPrefix, strlen(platform::kReservedLinuxPrefix)) == 0;
}

MountFileSystem::MountFileSystem(int sourceFd, MountSettings settings)
    : sourceFd_(sourceFd), settings_(std::move(settings)), cache_(settings_.cacheBytes) {}

MountFileSystem::~MountFileSystem() { close(sourceFd_); }

const fuse_operations &MountFileSystem::operations() {
  static const fuse_operations ops = makeOperations();
  return ops;
}

std::string MountFileSystem::sourcePath(const char *rel) const {
  return "/proc/self/fd/" + std::to_string(sourceFd_) + "/" + rel;
}

bool MountFileSystem::sameVersionAsLastOpen(uint64_t device, uint64_t inode, uint64_t version) {
  std::lock_guard<std::mutex> lock(versionsMutex_);
  // Only a bound on memory: forgetting costs one refill of the kernel's pages.
  if (versions_.size() > 100000) versions_.clear();
  auto [where, added] = versions_.try_emplace({device, inode}, version);
  if (added) return false;
  bool same = where->second == version;
  where->second = version;
  return same;
}

void MountFileSystem::forgetVersion(uint64_t device, uint64_t inode) {
  std::lock_guard<std::mutex> lock(versionsMutex_);
  versions_.erase({device, inode});
}

}  // namespace plzc
