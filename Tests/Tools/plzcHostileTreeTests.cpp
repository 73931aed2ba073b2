// plzc compress, compress --async, info -r, decompress and install on trees that fight back:
// names with newlines and bytes that are not UTF-8, paths of 4096 bytes and deeper than
// PATH_MAX, symbolic-link loops and links out of the tree, files renamed, swapped and replaced
// by directories while the tree is walked, and read-only or unreadable files and directories
// (as root and as an unprivileged user). Every run ends with a clear message per failure and
// touches no file it was not asked to.
#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <thread>

#include "Platform/FileFlags.h"
#include "Support/PlzcProcess.h"
#include "Support/TestSupport.h"
#include "Support/TreeSnapshot.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::Not;

namespace fs = std::filesystem;

namespace {

constexpr int kTimeoutSeconds = 300;

ChildSetup withTimeout(ChildSetup setup = {}) {
  setup.timeoutSeconds = kTimeoutSeconds;
  return setup;
}

bool isCompressed(const std::string &path) {
  platform::Stat st;
  return platform::stat(path.c_str(), &st) == 0 && (st.st_flags & kFlagCompressed) != 0;
}

// What "untouched" means for a file: same data, mode, modification time and attributes.
struct FileState {
  std::vector<uint8_t> data;
  mode_t mode = 0;
  timespec mtime{};
  std::vector<std::string> attributes;
  bool operator==(const FileState &other) const {
    return data == other.data && mode == other.mode && mtime.tv_sec == other.mtime.tv_sec &&
           mtime.tv_nsec == other.mtime.tv_nsec && attributes == other.attributes;
  }
};

FileState stateOf(const std::string &path) {
  FileState state;
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  state.mode = st.st_mode;
  state.mtime = st.st_mtim;
  state.data = readFile(path);
  state.attributes = linuxAttributeNames(path);
  return state;
}

// Lines of standard error that are plzc's own messages ("plzc: ...").
std::vector<std::string> ownMessages(const std::string &err) {
  std::vector<std::string> lines;
  size_t start = 0;
  for (size_t end; (end = err.find('\n', start)) != std::string::npos; start = end + 1)
    if (err.compare(start, 6, "plzc: ") == 0) lines.push_back(err.substr(start, end - start));
  return lines;
}

std::vector<uint8_t> text(size_t bytes, uint32_t seed) { return compressibleBytes(bytes, seed); }

// The data every reader sees, through catFile.
std::vector<uint8_t> catBytesOf(const std::string &path) {
  std::vector<uint8_t> data;
  std::string problems = catFileTo(path, [&](const uint8_t *bytes, size_t count) { data.insert(data.end(), bytes, bytes + count); });
  EXPECT_EQ(problems, "") << path;
  return data;
}

class HostileTree : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }
  ScratchDir dir;
};

// Newlines, tabs, bytes that are not UTF-8 and the escape character in names: every command
// handles them, keeps each name byte for byte, and shows it on one line.
TEST_F(HostileTree, NamesWithControlCharactersAndInvalidUtf8) {
  std::string root = dir.file("tree");
  const std::vector<std::string> names = {"new\nline.txt", "tab\tand\x1b[31mescape.txt", "bad\xff\xfe.txt",
                                          "caf\xc3\xa9.txt", "sub\ndir/inner\n.txt", "lone\xc0/x.txt"};
  for (size_t i = 0; i < names.size(); i++) {
    fs::create_directories(fs::path(root + "/" + names[i]).parent_path());
    writeFile(root + "/" + names[i], text(200000, static_cast<uint32_t>(i)));
  }
  TreeSnapshot before = snapshotTree(root);
  ASSERT_EQ(before.size(), names.size());

  Finished compressed = plzc({"compress", "-v", root}, withTimeout());
  ASSERT_EQ(compressed.status, 0) << compressed.err;
  for (const std::string &name : names) EXPECT_TRUE(isCompressed(root + "/" + name)) << name;
  // A name's newline is shown as \n: every report stays one line.
  EXPECT_THAT(compressed.err, HasSubstr("/new\\nline.txt: type 4"));
  EXPECT_THAT(compressed.err, HasSubstr("/tab\\tand\\x1b[31mescape.txt: type 4"));
  EXPECT_THAT(compressed.err, Not(HasSubstr("\x1b")));

  Finished info = plzc({"info", "-r", "-v", root}, withTimeout());
  EXPECT_EQ(info.status, 0) << info.err;
  EXPECT_THAT(info.out, HasSubstr("files       6: 6 compressed"));
  EXPECT_THAT(info.out, HasSubstr("/sub\\ndir/inner\\n.txt\n"));

  // Installed: the names arrive byte for byte; the rules cannot judge a name that is not
  // UTF-8, so such files are copied plain, the others compressed.
  std::string dest = dir.file("dest");
  Finished installed = plzc({"install", root, dest}, withTimeout());
  EXPECT_EQ(installed.status, 0) << installed.err;
  expectTreeHolds(dest, before);
  for (const std::string &name : names) {
    bool validUtf8 = name.find('\xff') == std::string::npos && name.find('\xc0') == std::string::npos;
    EXPECT_EQ(isCompressed(dest + "/" + name), validUtf8) << name;
  }

  Finished decompressed = plzc({"decompress", root}, withTimeout());
  EXPECT_EQ(decompressed.status, 0) << decompressed.err;
  for (const std::string &name : names) EXPECT_FALSE(isCompressed(root + "/" + name)) << name;
  expectTreeHolds(root, before);

  // A missing path with a newline is reported on one line.
  Finished missing = plzc({"info", root + "/no\nsuch"}, withTimeout());
  EXPECT_EQ(missing.status, 1);
  EXPECT_THAT(missing.err, HasSubstr("/no\\nsuch: No such file or directory\n"));
}

// A file whose path is 4095 bytes (the longest a call takes) is handled like any other; a
// directory whose path goes beyond PATH_MAX cannot be reached by path: it is reported by name
// with the cause, and the files above it are still done.
TEST_F(HostileTree, PathsAtAndBeyondPathMax) {
  std::string root = dir.file("tree");
  fs::create_directories(root);
  // Build by descriptor, one level at a time, so that no call here needs a long path.
  int fd = open(root.c_str(), O_RDONLY | O_DIRECTORY);
  ASSERT_GE(fd, 0);
  std::string relative;
  std::string longest, beyond;
  const std::string filler(200, 'x');
  for (int level = 0; level < 24; level++) {
    std::string name = "d" + std::to_string(level) + "_" + filler;
    ASSERT_EQ(mkdirat(fd, name.c_str(), 0755), 0);
    int next = openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY);
    close(fd);
    fd = next;
    ASSERT_GE(fd, 0);
    relative += "/" + name;
    size_t pathLength = root.size() + relative.size() + 1;
    // One file whose whole path is exactly 4095 bytes, the rest of the name padded.
    if (longest.empty() && pathLength + 240 > 4095) {
      std::string fileName(4095 - pathLength, 'f');
      ASSERT_LE(fileName.size(), 255u);
      int file = openat(fd, fileName.c_str(), O_WRONLY | O_CREAT, 0644);
      std::vector<uint8_t> bytes = text(300000, 1);
      ASSERT_EQ(write(file, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
      close(file);
      longest = relative.substr(1) + "/" + fileName;
      ASSERT_EQ(root.size() + 1 + longest.size(), 4095u);
    }
    if (level == 23) {
      int file = openat(fd, "beyond.txt", O_WRONLY | O_CREAT, 0644);
      std::vector<uint8_t> bytes = text(100000, 2);
      ASSERT_EQ(write(file, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
      close(file);
      beyond = relative.substr(1) + "/beyond.txt";
    }
  }
  close(fd);
  ASSERT_GT(root.size() + beyond.size(), 4096u);
  writeFile(root + "/top.txt", text(100000, 3));

  // The first directory too deep to reach, as the walk names it.
  auto expectDeepDirectoryReported = [&](const Finished &run, const std::string &what) {
    EXPECT_EQ(run.status, 1) << what << ": " << run.err.substr(0, 2000);
    bool named = false;
    for (const std::string &line : ownMessages(run.err))
      named = named || (line.find(root + "/d0_") != std::string::npos &&
                        line.size() > 20 && line.compare(line.size() - 20, 20, ": File name too long") == 0);
    EXPECT_TRUE(named) << what << " did not name the directory beyond PATH_MAX";
  };

  Finished compressed = plzc({"compress", root}, withTimeout());
  expectDeepDirectoryReported(compressed, "compress");
  EXPECT_TRUE(isCompressed(root + "/top.txt"));
  EXPECT_TRUE(isCompressed(root + "/" + longest));

  Finished info = plzc({"info", "-r", root}, withTimeout());
  expectDeepDirectoryReported(info, "info -r");
  EXPECT_THAT(info.out, HasSubstr("files       2: 2 compressed (type 4: 2), 1 failed"));

  std::string dest = dir.file("dest");
  Finished installed = plzc({"install", root, dest}, withTimeout());
  EXPECT_EQ(installed.status, 1);
  EXPECT_THAT(installed.err, HasSubstr(": File name too long"));
  EXPECT_EQ(catBytesOf(dest + "/" + longest), text(300000, 1));

  Finished decompressed = plzc({"decompress", root}, withTimeout());
  expectDeepDirectoryReported(decompressed, "decompress");
  EXPECT_FALSE(isCompressed(root + "/" + longest));
  EXPECT_EQ(readFile(root + "/" + longest), text(300000, 1));
}

// Links are never followed inside a tree: loops are harmless and a file outside the tree that
// a link points at is not touched. Named on the command line, a loop is an error; install
// copies links as links.
TEST_F(HostileTree, SymbolicLinkLoopsAndLinksOutOfTheTree) {
  std::string root = dir.file("tree");
  fs::create_directories(root + "/sub");
  writeFile(root + "/sub/inside.txt", text(100000, 1));
  std::string outside = writeFile(dir.file("outside.txt"), text(100000, 2));
  ASSERT_EQ(symlink("loop2", (root + "/loop1").c_str()), 0);
  ASSERT_EQ(symlink("loop1", (root + "/loop2").c_str()), 0);
  ASSERT_EQ(symlink("..", (root + "/sub/up").c_str()), 0);
  ASSERT_EQ(symlink(".", (root + "/self").c_str()), 0);
  ASSERT_EQ(symlink(outside.c_str(), (root + "/out").c_str()), 0);
  FileState outsideBefore = stateOf(outside);

  for (const char *command : {"compress", "compress --async", "info", "decompress"}) {
    std::vector<std::string> args = {command};
    if (args[0] == "compress --async") args = {"compress", "--async"};
    if (args[0] == "info") args.push_back("-r");
    args.push_back(root);
    Finished run = plzc(args, withTimeout());
    EXPECT_EQ(run.status, 0) << command << ": " << run.err;
    EXPECT_EQ(stateOf(outside), outsideBefore) << command << " touched the file a link points at";
  }

  for (const char *command : {"compress", "info", "decompress"}) {
    Finished run = plzc({command, root + "/loop1"}, withTimeout());
    EXPECT_EQ(run.status, 1) << command;
    EXPECT_THAT(run.err, HasSubstr("plzc: " + root + "/loop1: Too many levels of symbolic links")) << command;
  }

  std::string dest = dir.file("dest");
  Finished installed = plzc({"install", root, dest}, withTimeout());
  EXPECT_EQ(installed.status, 0) << installed.err;
  EXPECT_EQ(fs::read_symlink(dest + "/loop1"), "loop2");
  EXPECT_EQ(fs::read_symlink(dest + "/sub/up"), "..");
  EXPECT_EQ(fs::read_symlink(dest + "/out"), outside);
  EXPECT_EQ(catBytesOf(dest + "/sub/inside.txt"), text(100000, 1));
  EXPECT_EQ(stateOf(outside), outsideBefore);
}

// While a command walks the tree, another thread renames files away and back, puts
// directories in their place for a moment, swaps pairs of files and moves whole directories.
// Nothing crashes or hangs, every failure names its file, and when the churn is over every
// file holds exactly its own data: no file was compressed or truncated under another's name.
TEST_F(HostileTree, TreeChangingWhileWalked) {
  std::string root = dir.file("tree");
  constexpr int kDirectories = 4, kFiles = 8;
  auto fileName = [&](int d, int f) { return root + "/d" + std::to_string(d) + "/f" + std::to_string(f) + ".txt"; };
  for (int d = 0; d < kDirectories; d++) {
    fs::create_directories(root + "/d" + std::to_string(d));
    // Large enough that compressing one takes a while, so that renames fall inside it.
    for (int f = 0; f < kFiles; f++) writeFile(fileName(d, f), text(4 << 20, static_cast<uint32_t>(d * 100 + f)));
  }
  std::string outside = writeFile(dir.file("outside.txt"), text(100000, 7));
  FileState outsideBefore = stateOf(outside);
  TreeSnapshot before = snapshotTree(root);

  auto rename2 = [](const std::string &from, const std::string &to) { return rename(from.c_str(), to.c_str()) == 0; };
  auto churn = [&](std::atomic<bool> &stop) {
    uint32_t state = 1;
    while (!stop.load()) {
      state = state * 1103515245 + 12345;
      int d = static_cast<int>(state >> 8) % kDirectories, f = static_cast<int>(state >> 16) % kFiles;
      int g = (f + 1 + static_cast<int>(state >> 24) % (kFiles - 1)) % kFiles;
      std::string a = fileName(d, f), b = fileName(d, g), aside = a + ".aside";
      switch (state % 3) {
        case 0:  // a file replaced by a directory for a moment
          if (rename2(a, aside)) {
            mkdir(a.c_str(), 0755);
            std::this_thread::sleep_for(std::chrono::milliseconds(2));
            rmdir(a.c_str());
            rename2(aside, a);
          }
          break;
        case 1:  // two files swap names for a moment
          if (rename2(a, aside) && rename2(b, a) && rename2(aside, b)) {
            std::this_thread::sleep_for(std::chrono::milliseconds(3));
            rename2(b, aside);
            rename2(a, b);
            rename2(aside, a);
          }
          break;
        default: {  // a whole directory moved away and back
          std::string directory = root + "/d" + std::to_string(d);
          if (rename2(directory, directory + ".moved")) {
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
            rename2(directory + ".moved", directory);
          }
        }
      }
    }
  };

  std::vector<std::vector<std::string>> commands = {
      {"compress", "-j", "2", root}, {"info", "-r", root}, {"decompress", "-j", "2", root},
      {"compress", "--async", "-j", "2", root}, {"install", "-j", "2", root, dir.file("dest")}};
  for (const auto &args : commands) {
    std::atomic<bool> stop{false};
    std::thread churner(churn, std::ref(stop));
    Finished run = plzc(args, withTimeout());
    stop = true;
    churner.join();
    std::string what = "plzc " + args[0] + (args[1] == "--async" ? " --async" : "");
    SCOPED_TRACE(what);
    EXPECT_FALSE(run.timedOut) << what;
    EXPECT_THAT(run.status, ::testing::AnyOf(0, 1)) << what << ": " << run.err;
    for (const std::string &line : ownMessages(run.err)) {
      bool namesPath = line.find(root) != std::string::npos || line.find(dir.file("dest")) != std::string::npos ||
                       line.find("the stream queue failed") != std::string::npos ||
                       line.find("the compression queue reported") != std::string::npos;
      EXPECT_TRUE(namesPath) << what << ": " << line;
    }
    // Every name back in place: each file holds its own data.
    expectTreeHolds(root, before);
    EXPECT_EQ(stateOf(outside), outsideBefore) << what;
  }
}

// Read-only and unreadable files and directories. As an unprivileged owner: a read-only file
// cannot take attributes and is left exactly as it was; files in a read-only directory can be
// compressed; an unreadable file or directory is reported by name; nothing is installed into a
// read-only directory. As root every file is reachable and keeps its mode.
class ReadOnlyTree : public HostileTree {
 protected:
  void makeTree() {
    root = dir.file("tree");
    fs::create_directories(root + "/rodir");
    fs::create_directories(root + "/closed");
    for (const char *name : {"ro.txt", "rw.txt", "rodir/in.txt", "closed/hidden.txt", "unreadable.txt"})
      writeFile(root + "/" + name, text(150000, static_cast<uint32_t>(strlen(name))));
    chmod((root + "/ro.txt").c_str(), 0444);
    chmod((root + "/unreadable.txt").c_str(), 0);
    chmod((root + "/rodir").c_str(), 0555);
    chmod((root + "/closed").c_str(), 0);
    roDest = dir.file("rodest");
    fs::create_directories(roDest);
    chmod(roDest.c_str(), 0555);
    // The scratch directory itself must be reachable by the user.
    chmod(dir.path().c_str(), 0755);
  }
  void chownTree(uid_t uid, gid_t gid) {
    for (const char *name : {"", "/ro.txt", "/rw.txt", "/rodir", "/rodir/in.txt", "/closed", "/closed/hidden.txt",
                             "/unreadable.txt"})
      ASSERT_EQ(lchown((root + name).c_str(), uid, gid), 0) << name;
    ASSERT_EQ(lchown(roDest.c_str(), uid, gid), 0);
  }
  std::string root, roDest;
};

TEST_F(ReadOnlyTree, AsAnUnprivilegedOwner) {
  if (!runningAsRoot()) GTEST_SKIP() << "switching to another user needs root";
  struct passwd *nobody = getpwnam("nobody");
  if (!nobody) GTEST_SKIP() << "no user nobody";
  makeTree();
  chownTree(nobody->pw_uid, nobody->pw_gid);
  ChildSetup asNobody = withTimeout();
  asNobody.uid = nobody->pw_uid;
  asNobody.gid = nobody->pw_gid;
  FileState readOnly = stateOf(root + "/ro.txt"), unreadable = stateOf(root + "/unreadable.txt");
  std::vector<uint8_t> hidden = readFile(root + "/closed/hidden.txt");

  Finished compressed = plzc({"compress", root}, asNobody);
  EXPECT_EQ(compressed.status, 1) << compressed.err;
  EXPECT_THAT(compressed.err, HasSubstr("plzc: " + root + "/ro.txt: Permission denied"));
  EXPECT_THAT(compressed.err, HasSubstr("plzc: " + root + "/unreadable.txt: Permission denied"));
  EXPECT_THAT(compressed.err, HasSubstr("plzc: " + root + "/closed: Permission denied"));
  EXPECT_TRUE(isCompressed(root + "/rw.txt"));
  EXPECT_TRUE(isCompressed(root + "/rodir/in.txt"));
  EXPECT_EQ(stateOf(root + "/ro.txt"), readOnly);
  EXPECT_EQ(stateOf(root + "/unreadable.txt"), unreadable);

  Finished async = plzc({"compress", "--async", root}, asNobody);
  EXPECT_EQ(async.status, 1) << async.err;
  EXPECT_THAT(async.err, HasSubstr(root + "/closed: Permission denied"));
  EXPECT_EQ(stateOf(root + "/ro.txt"), readOnly);

  Finished info = plzc({"info", "-r", root}, asNobody);
  EXPECT_EQ(info.status, 1);
  EXPECT_THAT(info.err, HasSubstr("plzc: " + root + "/closed: Permission denied"));

  Finished installed = plzc({"install", root, roDest + "/copy"}, asNobody);
  EXPECT_EQ(installed.status, 1);
  EXPECT_THAT(installed.err, HasSubstr("plzc: " + roDest + "/copy: Permission denied"));
  EXPECT_TRUE(fs::is_empty(roDest));

  Finished decompressed = plzc({"decompress", root}, asNobody);
  EXPECT_EQ(decompressed.status, 1) << decompressed.err;
  EXPECT_FALSE(isCompressed(root + "/rw.txt"));
  EXPECT_FALSE(isCompressed(root + "/rodir/in.txt"));
  EXPECT_EQ(readFile(root + "/rw.txt"), text(150000, strlen("rw.txt")));
  EXPECT_EQ(readFile(root + "/rodir/in.txt"), text(150000, strlen("rodir/in.txt")));
  EXPECT_EQ(stateOf(root + "/ro.txt"), readOnly);
  EXPECT_EQ(stateOf(root + "/unreadable.txt"), unreadable);
  EXPECT_EQ(readFile(root + "/closed/hidden.txt"), hidden);
}

TEST_F(ReadOnlyTree, AsRoot) {
  if (!runningAsRoot()) GTEST_SKIP() << "these modes do not stop root only";
  makeTree();
  TreeSnapshot before = snapshotTree(root);
  mode_t readOnlyMode = stateOf(root + "/ro.txt").mode;

  Finished compressed = plzc({"compress", root}, withTimeout());
  EXPECT_EQ(compressed.status, 0) << compressed.err;
  for (const char *name : {"ro.txt", "rw.txt", "rodir/in.txt", "closed/hidden.txt", "unreadable.txt"})
    EXPECT_TRUE(isCompressed(root + "/" + name)) << name;
  EXPECT_EQ(stateOf(root + "/ro.txt").mode, readOnlyMode);

  std::string dest = roDest + "/copy";
  Finished installed = plzc({"install", root, dest}, withTimeout());
  EXPECT_EQ(installed.status, 0) << installed.err;
  expectTreeHolds(dest, before);
  struct stat st {};
  ASSERT_EQ(stat((dest + "/closed").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0u);

  Finished decompressed = plzc({"decompress", root}, withTimeout());
  EXPECT_EQ(decompressed.status, 0) << decompressed.err;
  EXPECT_EQ(stateOf(root + "/ro.txt").mode, readOnlyMode);
  expectTreeHolds(root, before);
}

}  // namespace
