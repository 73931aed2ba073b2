#include "Libraries/CompressData/FileEnumerator.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <climits>
#include <cstdio>
#include <set>
#include <string>
#include <vector>

#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::ElementsAre;
using ::testing::MatchesRegex;

namespace {

const std::string kPrefix = "Libraries/CompressData/FileEnumerator:[0-9]+: ";

// What one enumeration yielded and printed.
struct Walk {
  std::vector<std::string> paths;
  std::string out, err;
};

Walk walkDir(const std::string &root) {
  Walk walk;
  FdCapture out(1), err(2);
  FileEnumerator *enumerator = initFileEnumeratorFromDir(root.c_str());
  const char *path = nullptr;
  while (enumerator && enumFilesFromDir(enumerator, &path)) walk.paths.emplace_back(path);
  freeFileEnumeratorFromDir(enumerator);
  walk.out = out.text();
  walk.err = err.text();
  return walk;
}

Walk walkList(const std::string &list, const char *prefix) {
  Walk walk;
  FdCapture out(1), err(2);
  FileEnumerator *enumerator = initFileEnumeratorFromFileList(list.c_str(), prefix);
  EXPECT_NE(enumerator, nullptr) << err.text();
  const char *path = nullptr;
  while (enumerator && enumFilesFromFileList(enumerator, &path)) walk.paths.emplace_back(path);
  freeFileEnumeratorFromFileList(enumerator);
  walk.out = out.text();
  walk.err = err.text();
  return walk;
}

ino_t inodeOf(const std::string &path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  return st.st_ino;
}

class FileEnumerators : public ::testing::Test {
 protected:
  std::string makeDir(const std::string &name) {
    std::string path = dir.file(name);
    EXPECT_EQ(mkdir(path.c_str(), 0755), 0) << path;
    return path;
  }
  std::string makeFile(const std::string &name) { return writeFile(dir.file(name), name); }
  void link(const std::string &from, const std::string &to) { ASSERT_EQ(::link(from.c_str(), to.c_str()), 0); }
  void symlink(const std::string &target, const std::string &at) {
    ASSERT_EQ(::symlink(target.c_str(), at.c_str()), 0);
  }

  ScratchDir dir;
};

// ---- directory walks ------------------------------------------------------------------------

TEST_F(FileEnumerators, DirectoryWalkYieldsEachRegularInodeOnceUnderItsFirstPath) {
  makeDir("tree");
  makeDir("tree/sub");
  makeDir("tree/sub/deeper");
  makeDir("tree/empty");
  makeDir("outside");
  std::string single = makeFile("tree/single");
  std::string deep = makeFile("tree/sub/deeper/deep");
  std::string firstLink = makeFile("tree/linked");
  std::string secondLink = dir.file("tree/sub/linked-too");
  link(firstLink, secondLink);
  std::string outside = makeFile("outside/only-through-a-link");
  symlink(single, dir.file("tree/symlink-to-file"));
  symlink(dir.file("outside"), dir.file("tree/symlink-to-dir"));
  ASSERT_EQ(mkfifo(dir.file("tree/fifo").c_str(), 0644), 0);
  symlink(dir.file("tree"), dir.file("root-link"));

  // The root is resolved: a root given through a symbolic link is walked under its real path.
  Walk walk = walkDir(dir.file("root-link"));
  EXPECT_EQ(walk.err, "");
  std::set<std::string> yielded(walk.paths.begin(), walk.paths.end());
  ASSERT_EQ(walk.paths.size(), 3u) << walk.out;
  EXPECT_EQ(yielded.size(), 3u);
  EXPECT_TRUE(yielded.count(single));
  EXPECT_TRUE(yielded.count(deep));
  // fts reads directories in their own order: either link may come first.
  bool firstWon = yielded.count(firstLink) == 1;
  EXPECT_TRUE(firstWon || yielded.count(secondLink)) << "the linked file was not yielded";
  const std::string &winner = firstWon ? firstLink : secondLink;
  const std::string &loser = firstWon ? secondLink : firstLink;
  EXPECT_EQ(walk.out, "already visited " + loser + " as " + winner + "\n");
}

TEST_F(FileEnumerators, OnlyFilesWithSeveralLinksAreRemembered) {
  makeDir("tree");
  std::string single = makeFile("tree/single");
  std::string linked = makeFile("tree/linked");
  link(linked, dir.file("tree/linked-too"));
  FdCapture out(1);
  FileEnumerator *enumerator = initFileEnumeratorFromDir(dir.file("tree").c_str());
  ASSERT_NE(enumerator, nullptr);
  const char *path;
  std::string winner;
  while (enumFilesFromDir(enumerator, &path))
    if (std::string(path) != single) winner = path;
  std::string walked = out.text();
  ASSERT_FALSE(winner.empty());

  FdCapture after(1);
  // The single-link file was yielded but not remembered: offered now, it is new.
  EXPECT_EQ(compressorVisitFile(enumerator, inodeOf(single), "offered"), 1);
  // The linked file was remembered under the path it was yielded as.
  EXPECT_EQ(compressorVisitFile(enumerator, inodeOf(linked), "again"), 0);
  freeFileEnumeratorFromDir(enumerator);
  EXPECT_EQ(after.text(), "already visited again as " + winner + "\n");
}

TEST_F(FileEnumerators, DirectoryWalkStaysOnTheRootFileSystem) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a tmpfs below the root needs root";
  std::string root = makeDir("tree");
  std::string outer = makeFile("tree/outer");
  TemporaryMount mount = TemporaryMount::tmpfs(root, "1M");
  ASSERT_TRUE(mount.mounted());
  std::string inner = writeFile(mount.mountPoint() + "/inner", "inner");
  ASSERT_EQ(readFile(inner).size(), 5u);

  Walk walk = walkDir(root);
  EXPECT_THAT(walk.paths, ElementsAre(outer));
  EXPECT_EQ(walk.out, "");
  EXPECT_EQ(walk.err, "");
}

TEST_F(FileEnumerators, MissingRootOrListIsReported) {
  std::string missing = dir.file("missing");
  FdCapture err(2);
  EXPECT_EQ(initFileEnumeratorFromDir(missing.c_str()), nullptr);
  EXPECT_EQ(initFileEnumeratorFromFileList(missing.c_str(), nullptr), nullptr);
  EXPECT_EQ(initFileEnumeratorFromFileList(missing.c_str(), "/prefix"), nullptr);
  std::string line = kPrefix + "open " + missing + ": No such file or directory\n";
  EXPECT_THAT(err.text(),
              MatchesRegex(kPrefix + "realpath " + missing + ": No such file or directory\n" + line + line));
}

// ---- list files -----------------------------------------------------------------------------

TEST_F(FileEnumerators, ListWithoutPrefixYieldsRegularFilesOnceEach) {
  std::string a = makeFile("a");
  std::string sub = makeDir("sub");
  std::string h1 = makeFile("h1");
  std::string h2 = dir.file("h2");
  link(h1, h2);
  std::string last = makeFile("last");
  std::string missing = dir.file("missing");
  std::string list = writeFile(dir.file("list"), a + "\n" + sub + "\n" + missing + "\n\n" + h1 + "\n" + h2 + "\n" +
                                                      h1 + "\n" + last);  // no newline at the end

  Walk walk = walkList(list, nullptr);
  EXPECT_THAT(walk.paths, ElementsAre(a, h1, last));
  EXPECT_EQ(walk.out, sub + " is not a file\nalready visited " + h2 + " as " + h1 + "\nalready visited " + h1 +
                          " as " + h1 + "\n");
  // The missing path and the empty line.
  std::string statLine = kPrefix + "stat: No such file or directory\n";
  EXPECT_THAT(walk.err, MatchesRegex(statLine + statLine));
}

TEST_F(FileEnumerators, PrefixIsJoinedWithOneSlashAndTheCallerGetsTheLine) {
  makeDir("data");
  makeDir("data/a");
  makeFile("data/a/b");
  std::string list = writeFile(dir.file("list"), "a/b\n/a/b\na\n/a\n");
  std::string data = dir.file("data");
  // "<dir>/data/" is stored as "<dir>/data": every line is examined under it with one slash.
  for (const std::string &prefix : {data + "/", data}) {
    Walk walk = walkList(list, prefix.c_str());
    EXPECT_THAT(walk.paths, ElementsAre("a/b", "/a/b")) << prefix;
    EXPECT_EQ(walk.out, data + "/a is not a file\n" + data + "/a is not a file\n") << prefix;
    EXPECT_EQ(walk.err, "") << prefix;
  }
}

TEST_F(FileEnumerators, EmptyListYieldsNothing) {
  std::string list = writeFile(dir.file("list"), "");
  FileEnumerator *enumerator = initFileEnumeratorFromFileList(list.c_str(), nullptr);
  ASSERT_NE(enumerator, nullptr);
  const char *path = "untouched";
  EXPECT_EQ(enumFilesFromFileList(enumerator, &path), 0);
  EXPECT_EQ(enumFilesFromFileList(enumerator, &path), 0);
  EXPECT_STREQ(path, "untouched");
  freeFileEnumeratorFromFileList(enumerator);
}

// A regular file whose path is exactly `length` bytes long, under directories made for it.
std::string fileWithPathLength(const std::string &base, size_t length) {
  std::string path = base;
  while (length - path.size() > 201) {
    path += "/" + std::string(200, 'd');
    EXPECT_EQ(mkdir(path.c_str(), 0755), 0) << path;
  }
  path += "/" + std::string(length - path.size() - 1, 'f');
  writeFile(path, "x");
  EXPECT_EQ(path.size(), length);
  return path;
}

TEST_F(FileEnumerators, OverlongLinesAreRefusedAndTheRestIsRead) {
  // The line buffer holds 1027 characters and the terminating zero.
  std::string longest = fileWithPathLength(dir.path(), 1027);
  std::string tooLong = longest + "g";  // 1028 bytes
  std::string after = makeFile("after");
  std::string list = writeFile(dir.file("list"), longest + "\n" + tooLong + "\n" + std::string(5000, 'x') + "\n" +
                                                      after + "\n" + std::string(3000, 'y'));
  Walk walk = walkList(list, nullptr);
  EXPECT_THAT(walk.paths, ElementsAre(longest, after));
  EXPECT_EQ(walk.out, "");
  EXPECT_THAT(walk.err, MatchesRegex(kPrefix + "line too long \\(1028 bytes\\), skipped: [^\n]*\n" + kPrefix +
                                     "line too long \\(5000 bytes\\), skipped: x+\\.\\.\\.\n" + kPrefix +
                                     "line too long \\(3000 bytes\\), skipped: y+\\.\\.\\.\n"));

  // Under a prefix the joined path may be longer than any line; the caller still gets the line.
  std::string prefix = makeDir(std::string(200, 'p')) + "/" + std::string(200, 'q');
  ASSERT_EQ(mkdir(prefix.c_str(), 0755), 0);
  std::string line = fileWithPathLength(prefix, 1300).substr(prefix.size());
  std::string prefixedList = writeFile(dir.file("prefixed-list"), line + "\n");
  walk = walkList(prefixedList, prefix.c_str());
  EXPECT_THAT(walk.paths, ElementsAre(line));
  EXPECT_EQ(walk.err, "");
}

// A directory whose path is longer than PATH_MAX cannot be read by the walk: the directory
// enumerator skips it silently, its reporting form names it with the cause.
TEST_F(FileEnumerators, UnreachableDirectoriesAreReportedToWhoAsks) {
  std::string root = dir.file("deep");
  ASSERT_EQ(mkdir(root.c_str(), 0755), 0);
  writeFile(root + "/top.txt", std::string("top"));
  int fd = open(root.c_str(), O_RDONLY | O_DIRECTORY);
  ASSERT_GE(fd, 0);
  std::string relative;
  for (int level = 0; level < 20; level++) {
    std::string name(250, static_cast<char>('a' + level));
    ASSERT_EQ(mkdirat(fd, name.c_str(), 0755), 0);
    int next = openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY);
    close(fd);
    fd = next;
    ASSERT_GE(fd, 0);
    relative += "/" + name;
  }
  close(fd);

  struct Problem {
    std::string path;
    int error;
  };
  for (bool reporting : {false, true}) {
    std::vector<Problem> problems;
    std::vector<std::string> files;
    FileEnumerator *enumerator = initFileEnumeratorFromDir(root.c_str());
    ASSERT_NE(enumerator, nullptr);
    const char *path = nullptr;
    auto handler = [](const char *where, int error, void *context) {
      static_cast<std::vector<Problem> *>(context)->push_back({where, error});
    };
    while ((reporting ? enumFilesFromDirReporting(enumerator, &path, handler, &problems)
                      : enumFilesFromDir(enumerator, &path)) == 1)
      files.emplace_back(path);
    freeFileEnumeratorFromDir(enumerator);
    EXPECT_THAT(files, ElementsAre(root + "/top.txt"));
    if (!reporting) continue;
    ASSERT_EQ(problems.size(), 1u);
    EXPECT_EQ(problems[0].error, ENAMETOOLONG);
    EXPECT_GT(problems[0].path.size(), static_cast<size_t>(PATH_MAX));
    EXPECT_EQ(problems[0].path.compare(0, root.size(), root), 0);
  }
}

}  // namespace
