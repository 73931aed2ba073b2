// Shared ground for the tests: scratch directories on a volume that holds large attributes,
// capture of the diagnostics, and real volumes (loop-mounted ext4, small tmpfs) for tests that
// need a file system that fails.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "SampleData.h"

namespace plzctest {

// A fresh directory under $PLZC_TEST_DIR (or /dev/shm), removed with its contents on
// destruction. Fails the test (ADD_FAILURE and an empty path) when that volume cannot hold
// large attributes, with a message that says how to fix it.
class ScratchDir {
 public:
  ScratchDir();
  ~ScratchDir();
  ScratchDir(const ScratchDir &) = delete;
  ScratchDir &operator=(const ScratchDir &) = delete;
  const std::string &path() const { return path_; }
  // path() + "/" + name
  std::string file(const std::string &name) const;

 private:
  std::string path_;
};

// Creates (or replaces) a file holding exactly these bytes; returns its path.
std::string writeFile(const std::string &path, const std::vector<uint8_t> &bytes);
std::string writeFile(const std::string &path, const std::string &text);
std::vector<uint8_t> readFile(const std::string &path);

// Runs the library's catFile on path with its standard output handed, piece by piece, to sink
// (on the calling thread); returns what catFile printed on standard error, empty when it read
// the file whole. Files of any size pass without being held in memory.
std::string catFileTo(const std::string &path, const std::function<void(const uint8_t *bytes, size_t count)> &sink);

// Names of every Linux extended attribute of the file (all namespaces the caller may see).
std::vector<std::string> linuxAttributeNames(const std::string &path);

// Runs a shell command and returns its standard output; *status gets the exit status.
std::string runCommand(const std::string &command, int *status = nullptr);

bool runningAsRoot();

// Sends a descriptor (1 or 2) into an anonymous memory file until text() is called, so that
// what the library writes to it directly (not through stdio) can be checked.
class FdCapture {
 public:
  explicit FdCapture(int fd);
  ~FdCapture();
  FdCapture(const FdCapture &) = delete;
  FdCapture &operator=(const FdCapture &) = delete;
  // Restores the descriptor and returns everything written meanwhile.
  std::string text();

 private:
  int fd_, saved_ = -1, sink_ = -1;
};

// A file system mounted on a fresh directory for the life of the object (root only):
// an ext4 image without large-attribute support, or a tmpfs of the given size.
class TemporaryMount {
 public:
  static TemporaryMount ext4WithoutLargeAttributes(const std::string &parentDir);
  static TemporaryMount tmpfs(const std::string &parentDir, const std::string &size);
  // A tmpfs with these mount options ("size=4m,nr_inodes=100": on tmpfs the extended
  // attributes are charged to the inode space, nr_inodes x 1 KiB, not to size).
  static TemporaryMount tmpfsWithOptions(const std::string &parentDir, const std::string &options);
  TemporaryMount(TemporaryMount &&other) noexcept;
  ~TemporaryMount();
  const std::string &mountPoint() const { return mountPoint_; }
  bool mounted() const { return mounted_; }

 private:
  TemporaryMount() = default;
  std::string mountPoint_;
  std::string image_;
  bool mounted_ = false;
};

}  // namespace plzctest
