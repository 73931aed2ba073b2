// Fuzz target: list files of the enumerator (Libraries/CompressData/FileEnumerator), read as a
// caller reads them: every line is examined under a prefix, in a small tree holding regular
// files, hard links, a directory, a symbolic link and a FIFO. Whatever the list holds, every
// path yielded must be one of its lines, in order, naming a regular file, each inode with
// several links at most once.
//
// Input: the list file's bytes. An odd length puts a '/' at the end of the prefix.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <set>
#include <string>
#include <vector>

#include "FuzzSupport.h"
#include "Plenzo.h"

using namespace plzcfuzz;

namespace {

constexpr size_t kLineSize = 1028;

// The tree the lines are examined in, made once per process.
const std::string &tree() {
  static const std::string root = [] {
    std::string dir = scratchDir() + "/tree";
    bool made = mkdir(dir.c_str(), 0755) == 0 && mkdir((dir + "/dir").c_str(), 0755) == 0 &&
                writeWholeFile(dir + "/a", {'a'}) && writeWholeFile(dir + "/c", {'c'}) &&
                writeWholeFile(dir + "/dir/d", {'d'}) && link((dir + "/a").c_str(), (dir + "/b").c_str()) == 0 &&
                link((dir + "/c").c_str(), (dir + "/dir/e").c_str()) == 0 &&
                symlink("a", (dir + "/link").c_str()) == 0 && mkfifo((dir + "/fifo").c_str(), 0644) == 0;
    FUZZ_CHECK(made, "cannot make the tree under %s: %s", dir.c_str(), strerror(errno));
    return dir;
  }();
  return root;
}

// The lines as the enumerator reads them: split at newlines, each cut at its first 0 byte;
// lines too long to hold are left out.
std::vector<std::string> linesOf(const Bytes &list) {
  std::vector<std::string> lines;
  size_t start = 0;
  while (start < list.size()) {
    size_t end = start;
    while (end < list.size() && list[end] != '\n') end++;
    if (end - start < kLineSize) {
      std::string line(list.begin() + static_cast<ptrdiff_t>(start), list.begin() + static_cast<ptrdiff_t>(end));
      lines.push_back(line.substr(0, line.find('\0')));
    }
    start = end + 1;
  }
  return lines;
}

// Lists naming every kind of entry of the tree, each hard-linked file twice, and long lines.
void writeSeeds(SeedSink &seeds) {
  seeds.add("every-entry", "a\nb\nc\ndir/d\ndir/e\nlink\nfifo\ndir\nmissing\n\n/a\n");
  seeds.add("absolute-odd", "/c\n/dir/e\n/b\nno-newline");
  seeds.add("long-line", std::string(1027, 'x') + "\na\n" + std::string(1028, 'y') + "\nb");
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  Bytes list(data, data + size);
  std::string listPath = scratchDir() + "/list";
  FUZZ_CHECK(writeWholeFile(listPath, list), "cannot write %s", listPath.c_str());
  std::string prefix = tree() + (size % 2 ? "/" : "");

  FileEnumerator *enumerator = initFileEnumeratorFromFileList(listPath.c_str(), prefix.c_str());
  FUZZ_CHECK(enumerator, "cannot enumerate %s", listPath.c_str());
  std::vector<std::string> lines = linesOf(list);
  size_t next = 0;
  std::set<ino_t> linkedInodes;
  const char *path = nullptr;
  while (enumFilesFromFileList(enumerator, &path) == 1) {
    FUZZ_CHECK(path, "a yield without a path");
    while (next < lines.size() && lines[next] != path) next++;
    FUZZ_CHECK(next < lines.size(), "yielded '%s', which is no later line of the list", path);
    next++;
    std::string examined = tree() + (path[0] == '/' ? "" : "/") + path;
    struct stat st;
    FUZZ_CHECK(stat(examined.c_str(), &st) == 0 && S_ISREG(st.st_mode), "yielded '%s', not a regular file", path);
    if (st.st_nlink >= 2)
      FUZZ_CHECK(linkedInodes.insert(st.st_ino).second, "yielded inode %llu twice ('%s')",
                 static_cast<unsigned long long>(st.st_ino), path);
  }
  freeFileEnumeratorFromFileList(enumerator);
  return 0;
}
