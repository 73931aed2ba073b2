#include "Installer.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#include "Cli.h"
#include "Common/FileHandle.h"
#include "Common/StreamCompressor.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Progress.h"
#include "StderrTap.h"
#include "StoredForm.h"

namespace plzc {

const char kUnfinishedInstallPrefix[] = ".plzc-install-";

namespace {

constexpr size_t kPieceBytes = 1 << 20;  // bytes read from a source and written to its stream at once

using InodeKey = std::pair<dev_t, ino_t>;

struct FileJob {
  std::string source, dest;
  struct stat st;
};

struct DirectoryFix {
  std::string dest;
  struct stat st;
};

std::string joinPath(const std::string &directory, const std::string &name) {
  return !directory.empty() && directory.back() == '/' ? directory + name : directory + "/" + name;
}

// The last component of path, trailing slashes ignored ("" for "/", ".", "..").
std::string lastComponent(const std::string &path) {
  std::string trimmed = path;
  while (trimmed.size() > 1 && trimmed.back() == '/') trimmed.pop_back();
  size_t slash = trimmed.rfind('/');
  std::string name = slash == std::string::npos ? trimmed : trimmed.substr(slash + 1);
  return name == "." || name == ".." || name == "/" ? "" : name;
}

std::string parentOf(const std::string &path) {
  std::string trimmed = path;
  while (trimmed.size() > 1 && trimmed.back() == '/') trimmed.pop_back();
  size_t slash = trimmed.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : trimmed.substr(0, slash);
}

// Owner first: chown clears the set-user-ID and set-group-ID bits that the mode then restores.
// An owner this process may not give is left as it is, as cp -a does without privileges.
bool setOwnerAndMode(int fd, const struct stat &st, std::string *cause) {
  if (fchown(fd, st.st_uid, st.st_gid) != 0 && errno != EPERM) {
    *cause = std::string("cannot set the owner: ") + strerror(errno);
    return false;
  }
  if (fchmod(fd, st.st_mode & 07777) != 0) {
    *cause = std::string("cannot set the mode: ") + strerror(errno);
    return false;
  }
  return true;
}

// The file's own attributes, not the compressed form's: the pipeline writes those itself. A
// plain source's resource fork is its own and is copied.
bool copyAttributes(int in, int out, bool compressed, std::string *cause) {
  ssize_t listSize = platform::flistxattr(in, nullptr, 0, 0);
  if (listSize <= 0) return true;  // none, or the source cannot have any
  std::string names(static_cast<size_t>(listSize), '\0');
  listSize = platform::flistxattr(in, names.data(), names.size(), 0);
  if (listSize < 0) return true;
  names.resize(static_cast<size_t>(listSize));
  std::vector<char> value;
  for (size_t at = 0; at < names.size();) {
    std::string name = names.c_str() + at;
    at += name.size() + 1;
    if (name.empty() || name == kDecmpfsXattrName || (compressed && name == kResourceForkXattrName)) continue;
    ssize_t size = platform::fgetxattr(in, name.c_str(), nullptr, 0, 0, 0);
    if (size < 0) continue;  // gone meanwhile
    value.resize(static_cast<size_t>(size) + 1);
    size = platform::fgetxattr(in, name.c_str(), value.data(), value.size(), 0, 0);
    if (size < 0) continue;
    if (platform::fsetxattr(out, name.c_str(), value.data(), static_cast<size_t>(size), 0, 0) != 0) {
      *cause = "cannot copy the attribute " + name + ": " + strerror(errno);
      return false;
    }
  }
  return true;
}

struct SinkContext {
  const std::function<bool(const void *, size_t)> *sink;
};

int sinkWriter(int64_t, const void *bytes, int64_t count, void *context) {
  auto *sink = static_cast<SinkContext *>(context)->sink;
  return (*sink)(bytes, static_cast<size_t>(count)) ? 0 : -1;
}

// Hands the logical data of the source to sink, at most limit bytes; the count handed, or -1
// with *cause. A compressed source is decompressed by the library.
int64_t feedData(int in, const char *source, bool compressed, uint64_t limit, std::vector<char> &buffer,
                 const std::function<bool(const void *, size_t)> &sink, std::string *cause) {
  if (compressed) {
    FileHandle *fh = openFile(source, source, O_RDONLY);
    if (!fh) {
      *cause = std::string("cannot open the compressed source: ") + strerror(errno);
      return -1;
    }
    uint64_t fed = 0;
    std::function<bool(const void *, size_t)> counted = [&](const void *bytes, size_t count) {
      size_t take = static_cast<size_t>(std::min<uint64_t>(count, limit - fed));
      fed += take;
      return take == 0 || sink(bytes, take);
    };
    SinkContext context{&counted};
    int result = decompressData(fh, sinkWriter, &context);
    fh->close(fh);
    if (result != 0) {
      *cause = "cannot decompress the source";
      return -1;
    }
    return static_cast<int64_t>(fed);
  }
  uint64_t fed = 0;
  while (fed < limit) {
    size_t want = static_cast<size_t>(std::min<uint64_t>(buffer.size(), limit - fed));
    ssize_t got = read(in, buffer.data(), want);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) {
      *cause = std::string("cannot read the source: ") + strerror(errno);
      return -1;
    }
    if (got == 0) break;
    if (!sink(buffer.data(), static_cast<size_t>(got))) {
      *cause = std::string("cannot write: ") + strerror(errno);
      return -1;
    }
    fed += static_cast<uint64_t>(got);
  }
  return static_cast<int64_t>(fed);
}

bool writeAll(int fd, const void *bytes, size_t count) {
  const char *at = static_cast<const char *>(bytes);
  while (count > 0) {
    ssize_t wrote = write(fd, at, count);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote <= 0) return false;
    at += wrote;
    count -= static_cast<size_t>(wrote);
  }
  return true;
}

class Installer {
 public:
  Installer(StreamCompressorQueue *queue, std::string root, int jobs, Console &console, ProgressMeter &progress)
      : queue_(queue), root_(std::move(root)), jobs_(jobs), console_(console), progress_(progress) {}

  void start() {
    for (int i = 0; i < jobs_; i++) workers_.emplace_back([this] { work(); });
  }

  // Copies one source argument (not followed when it is a symbolic link, as cp -a does).
  void copyArgument(const std::string &source, const std::string &dest) {
    struct stat st;
    if (lstat(source.c_str(), &st) != 0) return fail(source, strerror(errno));
    copy(source, dest, st);
  }

  // Every source walked: waits for the feeding threads.
  uint64_t finishWalk() {
    {
      std::lock_guard<std::mutex> guard(lock_);
      walkDone_ = true;
    }
    haveWork_.notify_all();
    for (std::thread &worker : workers_) worker.join();
    return filesQueued_;
  }

  // Once the pipeline has written every file: each takes its destination's name (replacing
  // what was there), then the hard links found are made to them.
  void publish() {
    for (const auto &[temporary, dest] : pendingRenames_) {
      if (rename(temporary.c_str(), dest.c_str()) != 0) {
        fail(dest, std::string("cannot move the new file into place: ") + strerror(errno));
        unlink(temporary.c_str());
      }
    }
    pendingRenames_.clear();
    for (const auto &[dest, first] : pendingLinks_) {
      if (!removeExisting(dest)) continue;
      if (link(first.c_str(), dest.c_str()) != 0) {
        fail(dest, std::string("cannot link to ") + first + ": " + strerror(errno));
        continue;
      }
      hardLinks_++;
    }
  }

  // Once the pipeline has written every file: directory modes and times, deepest first, since
  // creating entries changed the times and a directory without write permission takes none.
  void fixDirectories() {
    for (auto fix = directories_.rbegin(); fix != directories_.rend(); ++fix) {
      const char *path = fix->dest.c_str();
      if (lchown(path, fix->st.st_uid, fix->st.st_gid) != 0 && errno != EPERM) fail(fix->dest, strerror(errno));
      if (chmod(path, fix->st.st_mode & 07777) != 0) fail(fix->dest, strerror(errno));
      timespec times[2] = {fix->st.st_atim, fix->st.st_mtim};
      if (utimensat(AT_FDCWD, path, times, 0) != 0) fail(fix->dest, strerror(errno));
    }
  }

  // With verbose: how every regular file ended up stored; one the pipeline's messages named
  // counts as failed, whatever it holds.
  Totals storedTotals() {
    Totals totals;
    for (const std::string &path : written_) {
      StoredForm form;
      totals.files++;
      if (failedFiles_.count(path) || !readStoredForm(path.c_str(), &form)) {
        totals.failed++;
        continue;
      }
      totals.logicalBytes += form.logicalSize;
      totals.storedBytes += form.storedSize;
      if (form.compressed) {
        totals.compressed++;
        totals.byType[form.type < kTypeSlots ? form.type : kTypeSlots - 1]++;
      } else if (form.logicalSize == 0) {
        totals.empty++;
      } else {
        totals.leftPlain++;
      }
    }
    return totals;
  }

  // Destination files named in lines (the library's messages), in the order written.
  std::vector<std::string> filesNamedIn(const std::vector<std::string> &lines) {
    std::vector<std::string> named;
    for (const std::string &path : streamed_)
      for (const std::string &line : lines)
        if (mentionsPath(line, path)) {
          named.push_back(path);
          break;
        }
    return named;
  }

  void fillResult(InstallResult *result) {
    result->totals.files = filesDone_;
    result->totals.failed = failed_;
    result->totals.logicalBytes = result->bytes = bytes_;
    result->directories = directories_.size();
    result->symlinks = symlinks_;
    result->hardLinks = hardLinks_;
    result->plainCopies = plainCopies_;
    result->specials = specials_;
    result->interrupted = interrupted_;
    result->failedFiles.assign(failedFiles_.begin(), failedFiles_.end());
  }

  void addFailedFile(const std::string &path) { failedFiles_.insert(path); }

 private:
  void copy(const std::string &source, const std::string &dest, const struct stat &st) {
    if (interrupted()) {
      interrupted_ = true;
      return;
    }
    if (S_ISDIR(st.st_mode)) return copyDirectory(source, dest, st);
    if (S_ISREG(st.st_mode)) {
      if (st.st_nlink > 1) {
        auto [first, inserted] = firstLinks_.emplace(InodeKey{st.st_dev, st.st_ino}, dest);
        if (!inserted) {
          pendingLinks_.emplace_back(dest, first->second);
          return;
        }
      }
      return enqueue(FileJob{source, dest, st});
    }
    if (!removeExisting(dest)) return;
    if (S_ISLNK(st.st_mode)) {
      std::vector<char> target(static_cast<size_t>(st.st_size > 0 ? st.st_size : 255) + 1);
      ssize_t length = readlink(source.c_str(), target.data(), target.size());
      if (length < 0 || static_cast<size_t>(length) >= target.size())
        return fail(source, length < 0 ? strerror(errno) : "the link changed while copied");
      target[static_cast<size_t>(length)] = '\0';
      if (symlink(target.data(), dest.c_str()) != 0) return fail(dest, strerror(errno));
      symlinks_++;
    } else {
      // Pipes, sockets and devices (devices need privileges).
      if (mknod(dest.c_str(), st.st_mode & (S_IFMT | 07777), st.st_rdev) != 0) return fail(dest, strerror(errno));
      specials_++;
    }
    if (lchown(dest.c_str(), st.st_uid, st.st_gid) != 0 && errno != EPERM) fail(dest, strerror(errno));
    if (!S_ISLNK(st.st_mode) && chmod(dest.c_str(), st.st_mode & 07777) != 0) fail(dest, strerror(errno));
    timespec times[2] = {st.st_atim, st.st_mtim};
    if (utimensat(AT_FDCWD, dest.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) fail(dest, strerror(errno));
  }

  void copyDirectory(const std::string &source, const std::string &dest, const struct stat &st) {
    if (made_.count({st.st_dev, st.st_ino})) return fail(source, "is a directory this run created; not copied into itself");
    // Owner-writable until fixDirectories gives it its own mode.
    if (mkdir(dest.c_str(), 0700) != 0) {
      struct stat existing;
      if (errno != EEXIST || stat(dest.c_str(), &existing) != 0 || !S_ISDIR(existing.st_mode))
        return fail(dest, errno == EEXIST ? "exists and is not a directory" : strerror(errno));
    }
    struct stat made;
    if (stat(dest.c_str(), &made) == 0) made_.insert({made.st_dev, made.st_ino});
    directories_.push_back({dest, st});

    DIR *directory = opendir(source.c_str());
    if (!directory) return fail(source, strerror(errno));
    std::vector<std::string> names;
    while (dirent *entry = readdir(directory))
      if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) names.emplace_back(entry->d_name);
    closedir(directory);
    std::sort(names.begin(), names.end());
    for (const std::string &name : names) {
      std::string child = joinPath(source, name);
      struct stat childSt;
      if (lstat(child.c_str(), &childSt) != 0) {
        fail(child, strerror(errno));
        continue;
      }
      copy(child, joinPath(dest, name), childSt);
    }
  }

  // Makes room for a new entry at dest; a directory there is kept and is a failure.
  bool removeExisting(const std::string &dest) {
    struct stat existing;
    if (lstat(dest.c_str(), &existing) != 0) return true;
    if (S_ISDIR(existing.st_mode)) {
      fail(dest, "exists and is a directory");
      return false;
    }
    if (unlink(dest.c_str()) != 0) {
      fail(dest, strerror(errno));
      return false;
    }
    return true;
  }

  // The walk (one thread) runs ahead of the copiers by up to kQueuedPerJob files each. A full
  // queue stops it until the copiers have taken half: one wake-up for many files, not one each
  // (every wake-up of a thread on the other processor costs an interrupt).
  static constexpr size_t kQueuedPerJob = 32;
  size_t queueHigh() const { return static_cast<size_t>(jobs_) * kQueuedPerJob; }
  size_t queueLow() const { return queueHigh() / 2; }

  void enqueue(FileJob job) {
    std::unique_lock<std::mutex> guard(lock_);
    if (jobs_queue_.size() >= queueHigh()) hasRoom_.wait(guard, [this] { return jobs_queue_.size() <= queueLow(); });
    jobs_queue_.push_back(std::move(job));
    filesQueued_++;
    haveWork_.notify_one();
  }

  void work() {
    std::vector<char> buffer(kPieceBytes);
    for (;;) {
      FileJob job;
      {
        std::unique_lock<std::mutex> guard(lock_);
        haveWork_.wait(guard, [this] { return walkDone_ || !jobs_queue_.empty(); });
        if (jobs_queue_.empty()) return;
        job = std::move(jobs_queue_.front());
        jobs_queue_.pop_front();
        // The walk waits only on a full queue, for it to come down to queueLow(); the copiers
        // alone take files out, so every such wait sees this size go by.
        if (jobs_queue_.size() == queueLow()) hasRoom_.notify_one();
      }
      if (interrupted()) {
        interrupted_ = true;
        continue;
      }
      installFile(job, buffer);
    }
  }

  // A new file beside dest under a temporary name (*temporary), owner-writable, open for
  // reading and writing. An earlier file at dest is replaced by it later, never rewritten in
  // place: its attributes and flags must not survive.
  int createTemporary(const std::string &dest, std::string *temporary, std::string *cause) {
    struct stat existing;
    if (lstat(dest.c_str(), &existing) == 0 && S_ISDIR(existing.st_mode)) {
      *cause = "exists and is a directory";
      return -1;
    }
    std::string name = joinPath(parentOf(dest), std::string(kUnfinishedInstallPrefix) + "XXXXXX");
    int fd = mkostemp(name.data(), O_CLOEXEC);
    if (fd < 0) {
      *cause = strerror(errno);
      return -1;
    }
    *temporary = name;
    return fd;
  }

  void renameLater(const std::string &temporary, const std::string &dest) {
    std::lock_guard<std::mutex> guard(resultsLock_);
    pendingRenames_.emplace_back(temporary, dest);
  }

  void installFile(const FileJob &job, std::vector<char> &buffer) {
    const char *source = job.source.c_str();
    int in = open(source, O_RDONLY | O_CLOEXEC);
    if (in < 0) return fail(job.source, strerror(errno));
    platform::Stat sourceSt;
    bool compressed = platform::fstat(in, &sourceSt) == 0 && (sourceSt.st_flags & kCompressedFlag);
    uint64_t size = static_cast<uint64_t>(job.st.st_size);
    if (compressed) {
      CompressionInfo info;
      if (queryCompressionInfo(source, &info) != 0) {
        close(in);
        return fail(job.source, "compressed, but its header cannot be read");
      }
      size = info.uncompressedSize;
    }

    std::string temporary, cause;
    int out = createTemporary(job.dest, &temporary, &cause);
    if (out < 0) {
      close(in);
      return fail(job.dest, cause);
    }
    bool ok = setOwnerAndMode(out, job.st, &cause) && copyAttributes(in, out, compressed, &cause);
    // The pipeline's write-out keeps the times the file has when it begins: the source's.
    timespec times[2] = {job.st.st_atim, job.st.st_mtim};
    if (ok && futimens(out, times) != 0) {
      cause = std::string("cannot set the times: ") + strerror(errno);
      ok = false;
    }
    int64_t fed = -1;
    bool streamed = false;
    if (ok && lastComponent(job.dest).compare(0, 2, "._") == 0) {
      // The pipeline takes no part in these files: copied as they are.
      fed = feedData(in, source, compressed, size, buffer,
                     [&](const void *bytes, size_t count) { return writeAll(out, bytes, count); }, &cause);
      if (fed >= 0 && futimens(out, times) != 0) {
        cause = std::string("cannot set the times: ") + strerror(errno);
        fed = -1;
      }
      if (fed >= 0) plainCopies_++;
    } else if (ok) {
      fed = streamFile(job, in, out, compressed, size, buffer, &streamed, &cause);
    }
    close(out);
    close(in);
    // Written by this thread: it takes its name now. Streamed: once the pipeline is done with
    // it. A failed file takes its name too, as it is, like the partial file of any copier.
    if (streamed) {
      renameLater(temporary, job.dest);
    } else if (rename(temporary.c_str(), job.dest.c_str()) != 0) {
      if (fed >= 0) cause = std::string("cannot move the new file into place: ") + strerror(errno);
      fed = -1;
      unlink(temporary.c_str());
    }
    if (fed < 0) return fail(job.dest, cause);
    if (static_cast<uint64_t>(fed) != size) return fail(job.source, "changed size while being copied");
    {
      std::lock_guard<std::mutex> guard(resultsLock_);
      written_.push_back(job.dest);
    }
    filesDone_++;
    bytes_ += size;
    progress_.fileDone(size);
  }

  // Feeds the source to a new stream on out; *streamed tells whether the pipeline took the file
  // (and so writes it later).
  int64_t streamFile(const FileJob &job, int in, int out, bool compressed, uint64_t size, std::vector<char> &buffer,
                     bool *streamed, std::string *cause) {
    StreamCompressor *stream =
        CreateStreamCompressor(out, job.dest.c_str(), root_.c_str(), queue_, static_cast<int64_t>(size));
    if (!stream) {
      *cause = std::string("the pipeline did not take the file") + (errno ? ": " : "") + (errno ? strerror(errno) : "");
      return -1;
    }
    *streamed = true;
    {
      std::lock_guard<std::mutex> guard(resultsLock_);
      streamed_.push_back(job.dest);
    }
    int64_t fed;
    if (compressed) {
      fed = feedData(in, job.source.c_str(), compressed, size, buffer,
                     [&](const void *bytes, size_t count) {
                       return WriteToStreamCompressor(stream, bytes, count) == static_cast<int64_t>(count);
                     },
                     cause);
    } else {
      // Read straight into the stream's pool: no copy through our own buffer.
      fed = WriteFileToStreamCompressor(stream, in, size);
      if (fed < 0) *cause = std::string("cannot copy the source into the pipeline: ") + strerror(errno);
    }
    if (CloseStreamCompressor(stream) != 0 && fed >= 0) {
      *cause = std::string("the pipeline failed: ") + strerror(errno);
      fed = -1;
    }
    return fed;
  }

  void fail(const std::string &path, const std::string &cause) {
    failed_++;
    report("%s: %s\n", path.c_str(), cause.c_str());
    std::lock_guard<std::mutex> guard(resultsLock_);
    failedFiles_.insert(path);
  }

  StreamCompressorQueue *queue_;
  std::string root_;
  int jobs_;
  Console &console_;
  ProgressMeter &progress_;
  std::vector<std::thread> workers_;

  // The walk's own state (walking thread only).
  std::vector<DirectoryFix> directories_;
  std::set<InodeKey> made_;
  std::map<InodeKey, std::string> firstLinks_;
  std::vector<std::pair<std::string, std::string>> pendingLinks_;  // (new link, first path)
  std::vector<std::pair<std::string, std::string>> pendingRenames_;  // (temporary, destination)
  uint64_t filesQueued_ = 0, symlinks_ = 0, hardLinks_ = 0, specials_ = 0;

  std::mutex lock_;
  std::condition_variable haveWork_, hasRoom_;
  std::deque<FileJob> jobs_queue_;
  bool walkDone_ = false;

  std::mutex resultsLock_;
  std::vector<std::string> written_, streamed_;
  std::set<std::string> failedFiles_;
  std::atomic<uint64_t> filesDone_{0}, bytes_{0}, failed_{0}, plainCopies_{0};
  std::atomic<bool> interrupted_{false};
};

}  // namespace

InstallResult runInstall(const std::vector<std::string> &sources, const std::string &dest, PVDictionaryRef queueOptions,
                         int jobs, Console &console) {
  InstallResult result;
  struct stat destSt;
  bool destIsDirectory = stat(dest.c_str(), &destSt) == 0 && S_ISDIR(destSt.st_mode);
  if (!destIsDirectory && sources.size() > 1) {
    report("%s: not a directory, and there are several sources\n", dest.c_str());
    result.setupFailed = true;
    return result;
  }
  struct stat sourceSt;
  bool sourceIsDirectory = !destIsDirectory && lstat(sources[0].c_str(), &sourceSt) == 0 && S_ISDIR(sourceSt.st_mode);
  // The rules see each file's path relative to the root of what is being installed.
  std::string root = destIsDirectory || sourceIsDirectory ? dest : parentOf(dest);

  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(queueOptions);
  if (!queue) {
    report("cannot set up the stream queue with these options\n");
    result.setupFailed = true;
    return result;
  }
  // Set up now, before the copying threads take their memory: the pipeline's threads must be
  // started while the process can still afford them.
  if (!_SQLazyInit(queue)) {
    report("cannot start the stream pipeline: %s\n", strerror(errno ? errno : ENOMEM));
    FinishStreamCompressorQueue(queue);
    result.setupFailed = true;
    return result;
  }

  StderrTap tap;
  ProgressMeter progress(console, "plzc install");
  Installer installer(queue, root, jobs, console, progress);
  installer.start();
  for (const std::string &source : sources) {
    std::string name = lastComponent(source);
    installer.copyArgument(source, destIsDirectory && !name.empty() ? joinPath(dest, name) : dest);
  }
  progress.setTotalFiles(installer.finishWalk());

  errno = 0;
  StreamQueueCounts counts;
  int finished = _SQFinishWithCounts(queue, &counts);
  int error = errno;
  result.itemsQueued = counts.enqueued;
  result.itemsStarted = counts.started;
  result.itemsCompleted = counts.completed;
  installer.publish();
  installer.fixDirectories();
  result.seconds = progress.elapsedSeconds();
  tap.stop();

  if (finished != 0) {
    result.queueFailed = true;
    result.queueError = error ? error : EIO;
    report("the stream queue failed: %s\n", strerror(result.queueError));
    for (const std::string &path : installer.filesNamedIn(tap.lines())) installer.addFailedFile(path);
  }
  installer.fillResult(&result);
  if (console.verbose()) {
    Totals stored = installer.storedTotals();
    stored.failed += result.totals.failed;
    result.totals = stored;
  }
  return result;
}

}  // namespace plzc
