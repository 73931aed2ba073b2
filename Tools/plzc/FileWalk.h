// Turns PATH arguments into the regular files to work on, through the library's directory
// enumerator, and hands them to worker threads through a small bounded queue.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace plzc {

struct WalkedFile {
  std::string path;
  uint64_t size = 0;  // st_size when the walk met the file
};

struct WalkOptions {
  // Walk directory arguments; when false a directory argument is reported with directoryHint.
  bool recurse = true;
  std::string directoryHint = "is a directory";
  // Called for each argument that exists, before it is walked; false skips it as a failure
  // (the callback has reported why).
  std::function<bool(const std::string &argument)> acceptArgument;
  // Files (device, inode) never handed out: the table of contents being written, for one.
  std::set<std::pair<dev_t, ino_t>> exclude;
};

struct WalkResult {
  int failures = 0;        // arguments or files that could not be examined (each reported)
  uint64_t files = 0;      // files handed out
  bool interrupted = false;
};

// Calls work(file) on `jobs` threads for each regular file named by the arguments or found in
// the trees they name: symbolic links inside trees are not followed, other file systems are
// not entered, and each inode is handed out once (a second hard link, or the same file named
// twice, is skipped). walkDone(files) runs once the walk has ended, while work may still run.
// Returns when every call of work has returned.
WalkResult forEachFile(const std::vector<std::string> &arguments, const WalkOptions &options, int jobs,
                       const std::function<void(const WalkedFile &)> &work,
                       const std::function<void(uint64_t files)> &walkDone = {});

class Console;

// forEachFile over the arguments (default options) under a progress meter labelled `label`
// on the console: work(file) does one file and returns the bytes the meter counts for it.
// *seconds gets how long the whole walk took.
WalkResult walkWithProgress(Console &console, const char *label, const std::vector<std::string> &arguments, int jobs,
                            const std::function<uint64_t(const WalkedFile &)> &work, double *seconds);

}  // namespace plzc
