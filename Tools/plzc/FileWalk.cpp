#include "FileWalk.h"

#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <mutex>
#include <thread>

#include "Cli.h"
#include "Console.h"
#include "Libraries/CompressData/FileEnumerator.h"
#include "Plenzo.h"
#include "Progress.h"

namespace plzc {

namespace {

// A first-in first-out queue that blocks the producer while full and the consumers while
// empty. close() lets the consumers drain what is left and then stop.
class FileQueue {
 public:
  // A signal cannot wake a condition variable: waits look at the interruption flag this often.
  static constexpr std::chrono::milliseconds kSignalPoll{100};

  explicit FileQueue(size_t capacity) : capacity_(capacity) {}

  // Waits for room; gives up (false) after an interruption. A full queue stops the producer (one
  // thread) until the consumers have taken half: one wake-up for many files, not one each.
  bool push(WalkedFile file) {
    std::unique_lock<std::mutex> guard(lock_);
    if (items_.size() >= capacity_) {
      while (items_.size() > low()) {
        if (interrupted()) return false;
        notFull_.wait_for(guard, kSignalPoll);
      }
    }
    items_.push_back(std::move(file));
    notEmpty_.notify_one();
    return true;
  }

  // False once the queue is closed and empty, or after an interruption.
  bool pop(WalkedFile *file) {
    std::unique_lock<std::mutex> guard(lock_);
    while (items_.empty() && !closed_ && !interrupted()) notEmpty_.wait_for(guard, kSignalPoll);
    if (items_.empty() || interrupted()) return false;
    *file = std::move(items_.front());
    items_.pop_front();
    // Only consumers take items, so a producer waiting on a full queue sees this size go by.
    if (items_.size() == low()) notFull_.notify_one();
    return true;
  }

  void close() {
    std::lock_guard<std::mutex> guard(lock_);
    closed_ = true;
    notEmpty_.notify_all();
  }

 private:
  size_t low() const { return capacity_ / 2; }

  size_t capacity_;
  std::deque<WalkedFile> items_;
  bool closed_ = false;
  std::mutex lock_;
  std::condition_variable notEmpty_, notFull_;
};

class Walker {
 public:
  Walker(const WalkOptions &options, FileQueue &queue) : options_(options), queue_(queue) {}

  void walkArgument(const std::string &argument, WalkResult &result) {
    struct stat st;
    if (::stat(argument.c_str(), &st) != 0) {
      report("%s: %s\n", argument.c_str(), strerror(errno));
      result.failures++;
      return;
    }
    if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) {
      report("%s: not a regular file or directory\n", argument.c_str());
      result.failures++;
      return;
    }
    if (S_ISDIR(st.st_mode) && !options_.recurse) {
      report("%s: %s\n", argument.c_str(), options_.directoryHint.c_str());
      result.failures++;
      return;
    }
    if (options_.acceptArgument && !options_.acceptArgument(argument)) {
      result.failures++;
      return;
    }
    if (S_ISREG(st.st_mode)) {
      offer(argument, st, result);
      return;
    }
    FileEnumerator *enumerator = initFileEnumeratorFromDir(argument.c_str());
    if (!enumerator) {
      report("%s: cannot walk the tree: %s\n", argument.c_str(), strerror(errno));
      result.failures++;
      return;
    }
    const char *path = nullptr;
    // Entries the walk cannot read (a directory without permission, a path beyond PATH_MAX)
    // are failures the user must hear of, not files that silently do not exist.
    auto problem = [](const char *where, int error, void *context) {
      report("%s: %s\n", where, strerror(error));
      static_cast<WalkResult *>(context)->failures++;
    };
    while (!interrupted() && enumFilesFromDirReporting(enumerator, &path, problem, &result) == 1) {
      struct stat fileStat;
      if (::lstat(path, &fileStat) != 0) {
        report("%s: %s\n", path, strerror(errno));
        result.failures++;
        continue;
      }
      offer(path, fileStat, result);
    }
    freeFileEnumeratorFromDir(enumerator);
  }

 private:
  void offer(const std::string &path, const struct stat &st, WalkResult &result) {
    auto id = std::make_pair(st.st_dev, st.st_ino);
    if (options_.exclude.count(id) || !seen_.insert(id).second) return;
    if (queue_.push(WalkedFile{path, static_cast<uint64_t>(st.st_size)})) result.files++;
  }

  const WalkOptions &options_;
  FileQueue &queue_;
  std::set<std::pair<dev_t, ino_t>> seen_;
};

}  // namespace

WalkResult forEachFile(const std::vector<std::string> &arguments, const WalkOptions &options, int jobs,
                       const std::function<void(const WalkedFile &)> &work,
                       const std::function<void(uint64_t files)> &walkDone) {
  if (jobs < 1) jobs = 1;
  FileQueue queue(static_cast<size_t>(jobs) * 64);
  std::vector<std::thread> workers;
  for (int i = 0; i < jobs; i++)
    workers.emplace_back([&] {
      WalkedFile file;
      while (queue.pop(&file)) work(file);
    });

  WalkResult result;
  Walker walker(options, queue);
  for (const std::string &argument : arguments) {
    if (interrupted()) break;
    walker.walkArgument(argument, result);
  }
  queue.close();
  if (walkDone) walkDone(result.files);
  for (std::thread &worker : workers) worker.join();
  result.interrupted = interrupted();
  return result;
}

WalkResult walkWithProgress(Console &console, const char *label, const std::vector<std::string> &arguments, int jobs,
                            const std::function<uint64_t(const WalkedFile &)> &work, double *seconds) {
  ProgressMeter progress(console, label);
  WalkResult walked = forEachFile(
      arguments, WalkOptions{}, jobs, [&](const WalkedFile &file) { progress.fileDone(work(file)); },
      [&](uint64_t files) { progress.setTotalFiles(files); });
  *seconds = progress.elapsedSeconds();
  return walked;
}

}  // namespace plzc
