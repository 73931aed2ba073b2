// plzc as a user runs it: the real binary in a subprocess, real files, real exit statuses and
// messages. The binary is $PLZC_BINARY, or Tools/plzc/plzc in the build tree that holds this
// test program.
#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <zlib.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <sstream>

#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Support/PlzcProcess.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

namespace {


// Text that deflate shrinks several times over.
std::vector<uint8_t> textBytes(size_t count, uint32_t seed) {
  std::vector<uint8_t> bytes;
  bytes.reserve(count + 80);
  uint32_t state = seed;
  while (bytes.size() < count) {
    state = state * 1103515245 + 12345;
    char line[80];
    int n = snprintf(line, sizeof line, "%u request %u from client-%u took %u ms\n", static_cast<unsigned>(bytes.size()),
                     (state >> 16) % 1000, (state >> 8) % 97, (state >> 4) % 300);
    bytes.insert(bytes.end(), line, line + n);
  }
  bytes.resize(count);
  return bytes;
}

bool isCompressed(const std::string &path) {
  platform::Stat st;
  return platform::stat(path.c_str(), &st) == 0 && (st.st_flags & kFlagCompressed) != 0;
}

ssize_t attributeSize(const std::string &path, const char *name) {
  return platform::getxattr(path.c_str(), name, nullptr, 0, 0, 0);
}

// The part of text from the first `from` up to the next `to`.
std::string between(const std::string &text, const std::string &from, const std::string &to) {
  size_t start = text.find(from);
  if (start == std::string::npos) return "";
  size_t end = text.find(to, start);
  return text.substr(start, end == std::string::npos ? std::string::npos : end - start);
}

std::vector<uint8_t> bytesOf(const std::string &text) { return {text.begin(), text.end()}; }

size_t countOf(const std::string &text, const std::string &piece) {
  size_t count = 0;
  for (size_t at = text.find(piece); at != std::string::npos; at = text.find(piece, at + 1)) count++;
  return count;
}

// A small tree of every kind of file, and a file outside it behind a symbolic link.
struct Tree {
  std::string root;
  std::map<std::string, std::vector<uint8_t>> files;  // relative path -> data
  std::string outside;                                 // the symbolic link's target
  std::vector<uint8_t> outsideBytes;

  std::string path(const std::string &relative) const { return root + "/" + relative; }
};

Tree makeTree(const ScratchDir &dir, const std::string &name) {
  Tree tree;
  tree.root = dir.file(name);
  for (const char *sub : {"", "/docs", "/data", "/logs"}) mkdir((tree.root + sub).c_str(), 0755);
  tree.files = {
      {"docs/guide.txt", textBytes(300 << 10, 1)},  // type 4
      {"docs/small.txt", textBytes(2000, 2)},       // type 3
      {"data/noise.bin", randomBytes(200 << 10, 3)},  // does not shrink
      {"data/empty", {}},
      {"logs/app.log", textBytes(1 << 20, 4)},
  };
  for (const auto &[relative, bytes] : tree.files) writeFile(tree.path(relative), bytes);
  // A second name of app.log, and a link out of the tree.
  EXPECT_EQ(link(tree.path("logs/app.log").c_str(), tree.path("logs/link.log").c_str()), 0);
  tree.files["logs/link.log"] = tree.files["logs/app.log"];
  tree.outside = dir.file(name + "-outside.txt");
  tree.outsideBytes = textBytes(100 << 10, 5);
  writeFile(tree.outside, tree.outsideBytes);
  EXPECT_EQ(symlink(tree.outside.c_str(), tree.path("docs/outside").c_str()), 0);
  return tree;
}

class Plzc : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    ASSERT_EQ(access(plzcBinary().c_str(), X_OK), 0) << plzcBinary() << " is not built; set PLZC_BINARY";
  }
  ScratchDir dir;
};

TEST_F(Plzc, HelpAndVersionGoToStandardOutput) {
  Finished help = plzc({"--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_EQ(help.err, "");
  for (const char *command : {"compress", "decompress", "repair", "cat", "info", "volume", "toc list", "demo"})
    EXPECT_THAT(help.out, HasSubstr(std::string("\n  ") + command)) << command;

  Finished version = plzc({"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_THAT(version.out, StartsWith("plzc (Plenzo) "));
  // The engines line names the zlib the program runs with (a benchmark's record relies on it).
  EXPECT_THAT(version.out, HasSubstr(std::string("\nengines: zlib ") + zlibVersion()));

  for (const char *command : {"compress", "decompress", "repair", "cat", "info", "volume", "toc", "demo"}) {
    Finished run = plzc({command, "--help"});
    EXPECT_EQ(run.status, 0) << command;
    EXPECT_THAT(run.out, AllOf(StartsWith("Usage: plzc " + std::string(command)), HasSubstr("Exit status"))) << command;
    EXPECT_EQ(run.err, "") << command;
  }
}

TEST_F(Plzc, BadCommandLinesExitWithStatusTwoAndAHint) {
  struct Case {
    std::vector<std::string> args;
    std::string message;
  } cases[] = {
      {{}, "plzc: missing COMMAND"},
      {{"squeeze", "x"}, "plzc: unknown command 'squeeze'"},
      {{"--frobnicate"}, "plzc: unknown option '--frobnicate'"},
      {{"compress", "--frobnicate", "x"}, "plzc compress: unknown option '--frobnicate'"},
      {{"compress", "-z", "x"}, "plzc compress: unknown option '-z'"},
      {{"compress", "x", "-j"}, "plzc compress: option '-j' needs an argument"},
      {{"compress", "-j", "0", "x"}, "plzc compress: invalid number of jobs '0'"},
      {{"compress", "-j", "2x", "x"}, "plzc compress: invalid number of jobs '2x'"},
      {{"compress", "-l", "10", "x"}, "plzc compress: invalid level '10'"},
      {{"compress", "-t", "5", "x"}, "plzc compress: invalid type list '5'"},
      {{"compress", "--engine", "gzip", "x"}, "plzc compress: unknown engine 'gzip'"},
      {{"install", "--engine=", "a", "b"}, "plzc install: unknown engine ''"},
      {{"cat", "--engine"}, "plzc cat: option '--engine' needs an argument"},
      {{"compress", "-t", "3,,4", "x"}, "plzc compress: invalid type list '3,,4'"},
      {{"compress", "--verify=yes", "x"}, "plzc compress: option '--verify=yes' takes no argument"},
      {{"compress"}, "plzc compress: missing PATH"},
      {{"decompress", "--kernel", "x"}, "plzc decompress: unknown option '--kernel'"},
      {{"cat"}, "plzc cat: missing PATH"},
      {{"repair"}, "plzc repair: missing PATH"},
      {{"repair", "-j", "0", "x"}, "plzc repair: invalid number of jobs '0'"},
      {{"repair", "--force", "x"}, "plzc repair: unknown option '--force'"},
      {{"info", "-x", "x"}, "plzc info: unknown option '-x'"},
      {{"volume"}, "plzc volume: missing PATH"},
      {{"toc"}, "plzc toc: missing action"},
      {{"toc", "show", "x"}, "plzc toc: unknown action 'show'"},
      {{"toc", "list"}, "plzc toc: missing FILE"},
      {{"toc", "list", "a", "b"}, "plzc toc: list takes one FILE"},
      {{"demo", "a", "b"}, "plzc demo: give at most one DIR"},
      {{"demo", "--size-mb", "0"}, "plzc demo: invalid size '0'"},
  };
  for (const Case &c : cases) {
    Finished run = plzc(c.args);
    std::string command = c.args.empty() ? "" : c.args[0];
    EXPECT_EQ(run.status, 2) << c.message;
    EXPECT_THAT(run.err, AllOf(StartsWith(c.message), HasSubstr("\nTry 'plzc"), HasSubstr("--help' for more information.")))
        << c.message;
    EXPECT_EQ(run.out, "") << c.message;
  }
}

// Every engine reads what another wrote; an engine named in PLZC_ENGINE that does not exist is
// reported when the program starts and the default used.
TEST_F(Plzc, EnginesReadEachOtherAndABadEnvironmentNameIsReported) {
  std::vector<uint8_t> data = textBytes(300000, 3);
  std::string path = writeFile(dir.file("data"), data);
  Finished compressed = plzc({"compress", "--fast", path});
  ASSERT_EQ(compressed.status, 0) << compressed.err;
  EXPECT_TRUE(isCompressed(path));
  for (const char *engine : {"zlib", "libdeflate", "isal"}) {
    Finished read = plzc({"cat", "--engine", engine, path});
    EXPECT_EQ(read.status, 0) << engine << ": " << read.err;
    EXPECT_TRUE(read.out == std::string(data.begin(), data.end())) << engine;
  }
  const char *saved = getenv("PLZC_ENGINE");
  std::string previous = saved ? saved : "";
  setenv("PLZC_ENGINE", "gzip", 1);
  Finished warned = plzc({"cat", path});
  Finished chosen = plzc({"cat", "--engine", "zlib", path});
  if (saved) {
    setenv("PLZC_ENGINE", previous.c_str(), 1);
  } else {
    unsetenv("PLZC_ENGINE");
  }
  EXPECT_EQ(warned.status, 0);
  EXPECT_THAT(warned.err, HasSubstr("PLZC_ENGINE=gzip is not an engine (zlib, libdeflate, isal); using "));
  EXPECT_EQ(warned.out.size(), 300000u);
  EXPECT_EQ(chosen.status, 0) << chosen.err;
  EXPECT_EQ(chosen.out.size(), 300000u);
}

TEST_F(Plzc, CompressIsQuietAndEveryFileReadsBackThroughCat) {
  Tree tree = makeTree(dir, "tree");
  Finished run = plzc({"compress", tree.root});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.out, "");
  EXPECT_EQ(run.err, "");

  EXPECT_TRUE(isCompressed(tree.path("docs/guide.txt")));
  EXPECT_GT(attributeSize(tree.path("docs/guide.txt"), kResourceForkXattrName), 0);
  EXPECT_TRUE(isCompressed(tree.path("docs/small.txt")));
  EXPECT_LT(attributeSize(tree.path("docs/small.txt"), kResourceForkXattrName), 0);  // type 3: no fork
  EXPECT_TRUE(isCompressed(tree.path("logs/link.log")));                            // one inode, two names
  EXPECT_FALSE(isCompressed(tree.path("data/noise.bin")));
  EXPECT_FALSE(isCompressed(tree.path("data/empty")));
  EXPECT_FALSE(isCompressed(tree.outside)) << "the walk followed a symbolic link out of the tree";
  EXPECT_EQ(readFile(tree.outside), tree.outsideBytes);
  EXPECT_EQ(readFile(tree.path("data/noise.bin")), tree.files["data/noise.bin"]);

  for (const auto &[relative, bytes] : tree.files) {
    Finished cat = plzc({"cat", tree.path(relative)});
    EXPECT_EQ(cat.status, 0) << relative << ": " << cat.err;
    EXPECT_EQ(bytesOf(cat.out), bytes) << relative;
  }
  // Several files in one call come out in order.
  Finished both = plzc({"cat", tree.path("docs/small.txt"), tree.path("docs/guide.txt")});
  std::vector<uint8_t> expected = tree.files["docs/small.txt"];
  expected.insert(expected.end(), tree.files["docs/guide.txt"].begin(), tree.files["docs/guide.txt"].end());
  EXPECT_EQ(bytesOf(both.out), expected);

  // A second run finds nothing left to do.
  Finished again = plzc({"compress", "-v", tree.root});
  EXPECT_EQ(again.status, 0) << again.err;
  EXPECT_THAT(again.err, AllOf(HasSubstr(tree.path("docs/guide.txt") + ": already compressed (type 4)"),
                               HasSubstr(tree.path("docs/small.txt") + ": already compressed (type 3)")));
}

TEST_F(Plzc, VerboseCompressionReportsEachFileAndASummary) {
  Tree tree = makeTree(dir, "tree");
  Finished run = plzc({"compress", "-v", "--verify", "-j", "2", tree.root});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.out, "");
  EXPECT_THAT(run.err, HasSubstr(tree.path("docs/guide.txt") + ": type 4, 307200 -> "));
  EXPECT_THAT(run.err, HasSubstr(tree.path("docs/small.txt") + ": type 3, 2000 -> "));
  EXPECT_THAT(run.err, HasSubstr(tree.path("data/noise.bin") + ": left as it is: it did not shrink enough"));
  EXPECT_THAT(run.err, HasSubstr(tree.path("data/empty") + ": empty, left as it is"));
  // The hard link is one file, met once.
  EXPECT_EQ(countOf(run.err, "app.log: type 4") + countOf(run.err, "link.log: type 4"), 1u);

  uint64_t logical = 300 << 10;
  logical += 2000 + (200 << 10) + (1 << 20);
  uint64_t stored = static_cast<uint64_t>(attributeSize(tree.path("docs/guide.txt"), kResourceForkXattrName) +
                                          attributeSize(tree.path("docs/small.txt"), kDecmpfsXattrName) +
                                          attributeSize(tree.path("logs/app.log"), kResourceForkXattrName)) +
                    (200 << 10);
  EXPECT_THAT(run.err, HasSubstr("files       5: 3 compressed (type 3: 1, type 4: 2), 1 not compressed, 1 empty\n"));
  EXPECT_THAT(run.err, HasSubstr("logical     " + std::to_string(logical) + " bytes"));
  EXPECT_THAT(run.err, HasSubstr("stored      " + std::to_string(stored) + " bytes"));
  EXPECT_THAT(run.err, HasSubstr("savings     " + std::to_string(logical - stored) + " bytes"));
}

TEST_F(Plzc, MissingAndSpecialPathsFailWhileTheOthersAreCompressed) {
  std::string good = writeFile(dir.file("good.txt"), textBytes(100000, 1));
  std::string missing = dir.file("missing.txt");
  std::string fifo = dir.file("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0644), 0);
  Finished run = plzc({"compress", missing, good, fifo});
  EXPECT_EQ(run.status, 1);
  EXPECT_THAT(run.err, HasSubstr("plzc: " + missing + ": No such file or directory\n"));
  EXPECT_THAT(run.err, HasSubstr("plzc: " + fifo + ": not a regular file or directory\n"));
  EXPECT_TRUE(isCompressed(good));

  for (const char *command : {"decompress", "cat"}) {
    Finished other = plzc({command, missing});
    EXPECT_EQ(other.status, 1) << command;
    EXPECT_EQ(other.err, "plzc: " + missing + ": No such file or directory\n") << command;
  }
  Finished info = plzc({"info", missing});
  EXPECT_EQ(info.status, 1);
  EXPECT_EQ(info.err, "plzc: " + missing + ": No such file or directory\n");
  Finished volume = plzc({"volume", missing});
  EXPECT_EQ(volume.status, 2);
  EXPECT_THAT(volume.err, HasSubstr(missing + ": No such file or directory"));
}

TEST_F(Plzc, AFileNamedTwiceIsCompressedOnce) {
  Tree tree = makeTree(dir, "tree");
  // The same file twice, and one inode under two names, given to two threads.
  Finished run = plzc({"compress", "-v", "-j", "2", tree.path("logs/app.log"), tree.path("logs/link.log"),
                       tree.path("logs/app.log"), tree.path("docs/guide.txt")});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(countOf(run.err, ": type 4, "), 2u) << run.err;
  EXPECT_THAT(run.err, Not(HasSubstr("already compressed")));
  EXPECT_THAT(run.err, HasSubstr("files       2: 2 compressed (type 4: 2)"));
  Finished cat = plzc({"cat", tree.path("logs/link.log")});
  EXPECT_TRUE(bytesOf(cat.out) == tree.files["logs/app.log"]);
}

// A tmpfs whose room for attributes is small: it passes the volume probe, then fills up.
class SmallAttributeVolume {
 public:
  explicit SmallAttributeVolume(const std::string &mountPoint) : mountPoint_(mountPoint) {
    mkdir(mountPoint.c_str(), 0755);
    mounted_ = mount("tmpfs", mountPoint.c_str(), "tmpfs", 0, "nr_inodes=200") == 0;
  }
  ~SmallAttributeVolume() {
    if (mounted_) umount2(mountPoint_.c_str(), MNT_DETACH);
    rmdir(mountPoint_.c_str());
  }
  bool mounted() const { return mounted_; }

 private:
  std::string mountPoint_;
  bool mounted_ = false;
};

TEST_F(Plzc, AVolumeThatFillsUpFailsEachFileByNameAndKeepsItsData) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  std::string mountPoint = dir.file("small");
  SmallAttributeVolume volume(mountPoint);
  ASSERT_TRUE(volume.mounted()) << strerror(errno);
  ASSERT_EQ(plzc({"volume", mountPoint}).status, 0) << "the volume should pass the probe";
  std::map<std::string, std::vector<uint8_t>> files;
  for (int i = 0; i < 3; i++) {
    std::string path = mountPoint + "/f" + std::to_string(i) + ".log";
    files[path] = textBytes(2 << 20, static_cast<uint32_t>(i));
    writeFile(path, files[path]);
  }
  Finished run = plzc({"compress", "-v", mountPoint});
  EXPECT_EQ(run.status, 1);
  for (const auto &[path, bytes] : files) {
    EXPECT_THAT(run.err, HasSubstr("plzc: " + path + ": No space left on device\n"));
    EXPECT_FALSE(isCompressed(path));
    EXPECT_TRUE(readFile(path) == bytes) << path << " lost data";
  }
  EXPECT_THAT(run.err, HasSubstr("files       3: 0 compressed, 3 failed\n"));
}

TEST_F(Plzc, DecompressRestoresEveryFileAndVerifies) {
  Tree tree = makeTree(dir, "tree");
  ASSERT_EQ(plzc({"compress", tree.root}).status, 0);
  struct stat before;
  ASSERT_EQ(stat(tree.path("docs/guide.txt").c_str(), &before), 0);

  Finished run = plzc({"decompress", "--verify", "-v", tree.root});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_THAT(run.err, HasSubstr(tree.path("docs/guide.txt") + ": decompressed (type 4)"));
  EXPECT_THAT(run.err, HasSubstr(" 3 decompressed "));
  for (const auto &[relative, bytes] : tree.files) {
    EXPECT_FALSE(isCompressed(tree.path(relative))) << relative;
    EXPECT_EQ(readFile(tree.path(relative)), bytes) << relative;
    EXPECT_LT(attributeSize(tree.path(relative), kDecmpfsXattrName), 0) << relative;
  }
  struct stat after;
  ASSERT_EQ(stat(tree.path("docs/guide.txt").c_str(), &after), 0);
  EXPECT_EQ(after.st_mtim.tv_sec, before.st_mtim.tv_sec);

  // A plain file is left alone, and that is no failure.
  Finished plain = plzc({"decompress", tree.path("docs/guide.txt")});
  EXPECT_EQ(plain.status, 0);
  EXPECT_EQ(plain.err, "");
}

TEST_F(Plzc, DamagedCompressedFilesAreReportedByName) {
  std::string file = writeFile(dir.file("file.log"), textBytes(400000, 1));
  ASSERT_EQ(plzc({"compress", file}).status, 0);
  ASSERT_TRUE(isCompressed(file));
  // Unknown compression type in the header.
  std::vector<uint8_t> header(16);
  ASSERT_EQ(platform::getxattr(file.c_str(), kDecmpfsXattrName, header.data(), header.size(), 0, 0), 16);
  header[4] = 9;
  ASSERT_EQ(platform::setxattr(file.c_str(), kDecmpfsXattrName, header.data(), header.size(), 0, 0), 0);

  Finished cat = plzc({"cat", file});
  EXPECT_EQ(cat.status, 1);
  EXPECT_THAT(cat.err, AllOf(HasSubstr("invalid compressor type 9"), HasSubstr("plzc: " + file + ": could not be read whole")));
  Finished decompress = plzc({"decompress", file});
  EXPECT_EQ(decompress.status, 1);
  EXPECT_THAT(decompress.err, HasSubstr("plzc: " + file + ": cannot decompress"));
  EXPECT_TRUE(isCompressed(file));

  // A wrong magic.
  header[0] ^= 0xFF;
  ASSERT_EQ(platform::setxattr(file.c_str(), kDecmpfsXattrName, header.data(), header.size(), 0, 0), 0);
  Finished info = plzc({"info", file});
  EXPECT_EQ(info.status, 1);
  EXPECT_THAT(info.err, AllOf(HasSubstr("incorrect magic"), HasSubstr("plzc: " + file + ": cannot be examined")));
}

TEST_F(Plzc, InfoShowsEachFileAndSumsUpTrees) {
  Tree tree = makeTree(dir, "tree");
  ASSERT_EQ(plzc({"compress", tree.root}).status, 0);
  std::string guide = tree.path("docs/guide.txt"), noise = tree.path("data/noise.bin");
  ssize_t fork = attributeSize(guide, kResourceForkXattrName);

  Finished files = plzc({"info", guide, noise});
  EXPECT_EQ(files.status, 0) << files.err;
  EXPECT_EQ(files.err, "") << "a compressed file's empty data fork is no news";
  std::istringstream lines(files.out);
  std::string headerLine, guideLine, noiseLine;
  std::getline(lines, headerLine);
  std::getline(lines, guideLine);
  std::getline(lines, noiseLine);
  EXPECT_THAT(headerLine, AllOf(HasSubstr("type"), HasSubstr("logical"), HasSubstr("stored"), HasSubstr("ratio")));
  char ratio[16];
  snprintf(ratio, sizeof ratio, "%.3f", static_cast<double>(fork) / (300 << 10));
  std::istringstream guideFields(guideLine);
  std::string type, logical, stored, shownRatio, path;
  guideFields >> type >> logical >> stored >> shownRatio >> path;
  EXPECT_EQ(type, "4");
  EXPECT_EQ(logical, std::to_string(300 << 10));
  EXPECT_EQ(stored, std::to_string(fork));
  EXPECT_EQ(shownRatio, ratio);
  EXPECT_EQ(path, guide);
  std::istringstream noiseFields(noiseLine);
  noiseFields >> type >> logical >> stored >> shownRatio >> path;
  EXPECT_EQ(type, "-");
  EXPECT_EQ(logical, std::to_string(200 << 10));
  EXPECT_EQ(stored, logical);
  EXPECT_EQ(shownRatio, "1.000");

  Finished withoutR = plzc({"info", tree.root});
  EXPECT_EQ(withoutR.status, 1);
  EXPECT_THAT(withoutR.err, HasSubstr(tree.root + ": is a directory (-r sums up a tree)"));

  Finished summary = plzc({"info", "-r", tree.root});
  EXPECT_EQ(summary.status, 0) << summary.err;
  EXPECT_EQ(summary.err, "");
  uint64_t logicalBytes = (300 << 10) + 2000 + (200 << 10) + (1 << 20);
  uint64_t storedBytes = static_cast<uint64_t>(fork + attributeSize(tree.path("docs/small.txt"), kDecmpfsXattrName) +
                                               attributeSize(tree.path("logs/app.log"), kResourceForkXattrName)) +
                         (200 << 10);
  EXPECT_THAT(summary.out, StartsWith("tree        " + tree.root + "\n"
                                      "files       5: 3 compressed (type 3: 1, type 4: 2), 1 not compressed, 1 empty\n"
                                      "logical     " + std::to_string(logicalBytes) + " bytes (1.5 MiB)\n"
                                      "stored      " + std::to_string(storedBytes) + " bytes ("));
  EXPECT_THAT(summary.out, HasSubstr("savings     " + std::to_string(logicalBytes - storedBytes) + " bytes ("));
}

TEST_F(Plzc, VolumeSaysWhetherAndWhyNot) {
  Finished holds = plzc({"volume", dir.path()});
  EXPECT_EQ(holds.status, 0) << holds.err;
  EXPECT_THAT(holds.out, AllOf(StartsWith(dir.path() + ": holds compressed files ("), HasSubstr(" mounted at ")));
  EXPECT_EQ(holds.err, "");
}

// A real volume that cannot hold compressed files: an ext4 image without the ea_inode feature.
TEST_F(Plzc, VolumeThatCannotHoldCompressedFilesIsRefusedWithTheReason) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a file system needs root";
  TemporaryMount ext4 = TemporaryMount::ext4WithoutLargeAttributes(dir.path());
  ASSERT_TRUE(ext4.mounted());
  std::vector<uint8_t> bytes = textBytes(300000, 1);
  std::string file = writeFile(ext4.mountPoint() + "/file.log", bytes);

  Finished volume = plzc({"volume", ext4.mountPoint(), dir.path()});
  EXPECT_EQ(volume.status, 1);
  EXPECT_THAT(volume.out, HasSubstr(ext4.mountPoint() + ": cannot hold compressed files (ext4 mounted at " +
                                    ext4.mountPoint() + "): "));
  EXPECT_THAT(volume.out, HasSubstr("ea_inode"));
  EXPECT_THAT(volume.out, HasSubstr(dir.path() + ": holds compressed files"));

  std::string good = writeFile(dir.file("good.log"), bytes);
  Finished compress = plzc({"compress", file, good});
  EXPECT_EQ(compress.status, 1);
  EXPECT_THAT(compress.err, HasSubstr("plzc: " + file + ": the volume cannot hold compressed files: "));
  EXPECT_EQ(readFile(file), bytes);
  EXPECT_LT(attributeSize(file, kDecmpfsXattrName), 0) << "the refused file was touched";
  EXPECT_TRUE(isCompressed(good)) << "the other volume's file was not compressed";

  Finished demo = plzc({"demo", "--size-mb", "1", ext4.mountPoint()});
  EXPECT_EQ(demo.status, 1);
  EXPECT_THAT(demo.err, HasSubstr("the volume cannot hold compressed files"));
}

// An independent reading of the table of contents, to apply its records to copies of the files.
std::map<std::string, std::map<std::string, std::vector<uint8_t>>> readToc(const std::vector<uint8_t> &bytes) {
  std::map<std::string, std::map<std::string, std::vector<uint8_t>>> records;
  size_t at = 0;
  auto u32 = [&] {
    uint32_t value;
    memcpy(&value, bytes.data() + at, 4);
    at += 4;
    return value;
  };
  while (at < bytes.size()) {
    std::string path(reinterpret_cast<const char *>(bytes.data() + at));
    at += path.size() + 1;
    for (uint32_t count = u32(); count > 0; count--) {
      std::string name(reinterpret_cast<const char *>(bytes.data() + at));
      at += name.size() + 1;
      uint32_t length = u32();
      records[path][name].assign(bytes.begin() + static_cast<long>(at), bytes.begin() + static_cast<long>(at + length));
      at += length;
    }
  }
  return records;
}

TEST_F(Plzc, TableOfContentsLeavesFilesAloneAndHoldsTheirCompressedForm) {
  Tree tree = makeTree(dir, "tree");
  std::string toc = tree.path("contents.toc");  // inside the tree it records
  Finished run = plzc({"compress", "--toc", toc, "-v", tree.root});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_THAT(run.err, HasSubstr("files       5: 3 compressed (type 3: 1, type 4: 2), 1 not compressed, 1 empty"));
  EXPECT_THAT(run.err, Not(HasSubstr("contents.toc:")));
  for (const auto &[relative, bytes] : tree.files) {
    EXPECT_FALSE(isCompressed(tree.path(relative))) << relative;
    EXPECT_EQ(readFile(tree.path(relative)), bytes) << relative;
  }

  Finished list = plzc({"toc", "list", toc});
  EXPECT_EQ(list.status, 0) << list.err;
  EXPECT_THAT(list.out, HasSubstr(tree.path("docs/guide.txt") + "\n  com.tavix."));
  EXPECT_THAT(list.out, HasSubstr("  com.tavix.decmpfs: 16 bytes; type 4, 307200 bytes logical\n"));
  EXPECT_THAT(list.out, HasSubstr("; type 3, 2000 bytes logical\n"));
  EXPECT_THAT(list.out, Not(HasSubstr("noise.bin")));

  // Each record, applied to a copy of its file, makes a compressed file that reads back whole.
  auto records = readToc(readFile(toc));
  ASSERT_EQ(records.size(), 3u);
  for (const auto &[path, attributes] : records) {
    std::string copy = dir.file("copy-" + std::filesystem::path(path).filename().string());
    writeFile(copy, std::vector<uint8_t>{});
    for (const auto &[name, value] : attributes)
      ASSERT_EQ(platform::setxattr(copy.c_str(), name.c_str(), value.data(), value.size(), 0, 0), 0) << name;
    ASSERT_EQ(platform::chflags(copy.c_str(), kFlagCompressed), 0);
    Finished cat = plzc({"cat", copy});
    EXPECT_EQ(cat.status, 0) << cat.err;
    EXPECT_EQ(bytesOf(cat.out), readFile(path)) << path;
  }
}

TEST_F(Plzc, MalformedTableOfContentsIsRejectedWholeWithTheByte) {
  // Two tables of one record each, put one after the other: a valid file of two records.
  std::string a = writeFile(dir.file("a.txt"), textBytes(1000, 1));
  std::string b = writeFile(dir.file("b.txt"), textBytes(1500, 2));
  ASSERT_EQ(plzc({"compress", "--toc", dir.file("a.toc"), a}).status, 0);
  ASSERT_EQ(plzc({"compress", "--toc", dir.file("b.toc"), b}).status, 0);
  std::vector<uint8_t> first = readFile(dir.file("a.toc")), whole = first, second = readFile(dir.file("b.toc"));
  whole.insert(whole.end(), second.begin(), second.end());
  ASSERT_GT(first.size(), 0u);
  ASSERT_GT(second.size(), 0u);

  // Every cut inside the path, count, name and length fields of the first record, a few inside
  // its value and inside the second record; only the cut between the records is a valid end.
  size_t valueStart = a.size() + 1 + 4 + strlen(kDecmpfsXattrName) + 1 + 4;
  std::vector<size_t> cuts;
  for (size_t length = 1; length <= valueStart + 1; length++) cuts.push_back(length);
  for (size_t length : {(valueStart + first.size()) / 2, first.size() - 1, first.size(), first.size() + 1,
                        first.size() + b.size(), first.size() + b.size() + 3, first.size() + valueStart,
                        whole.size() - 1})
    cuts.push_back(length);
  std::string cut = dir.file("cut.toc");
  for (size_t length : cuts) {
    writeFile(cut, std::vector<uint8_t>(whole.begin(), whole.begin() + static_cast<long>(length)));
    Finished run = plzc({"toc", "list", cut});
    if (length == first.size()) {
      EXPECT_EQ(run.status, 0) << "a record boundary is a valid end";
      EXPECT_EQ(run.out, a + "\n  com.tavix.decmpfs: " + std::to_string(first.size() - valueStart) +
                             " bytes; type 3, 1000 bytes logical\n");
      continue;
    }
    EXPECT_EQ(run.status, 1) << "cut at " << length;
    EXPECT_THAT(run.err, StartsWith("plzc: " + cut + ": malformed table of contents at byte ")) << length;
    EXPECT_EQ(run.out, "") << "a malformed file is rejected whole, cut at " << length;
  }

  auto corrupt = [&](const std::function<void(std::vector<uint8_t> &)> &change, const std::string &reason) {
    std::vector<uint8_t> bytes = whole;
    change(bytes);
    writeFile(cut, bytes);
    Finished run = plzc({"toc", "list", cut});
    EXPECT_EQ(run.status, 1) << reason;
    EXPECT_THAT(run.err, HasSubstr(reason));
    EXPECT_EQ(run.out, "");
  };
  size_t countAt = a.size() + 1;
  size_t lengthAt = countAt + 4 + strlen(kDecmpfsXattrName) + 1;
  corrupt([&](auto &bytes) { memset(&bytes[countAt], 0, 4); },
          "at byte " + std::to_string(countAt) + ": entry count of '" + a + "' is 0");
  corrupt([&](auto &bytes) { memset(&bytes[lengthAt], 0, 4); },
          "at byte " + std::to_string(lengthAt) + ": value length of com.tavix.decmpfs is 0");
  corrupt([&](auto &bytes) { bytes[countAt] = 2; }, "malformed table of contents at byte");
  corrupt(
      [&](auto &bytes) {
        std::vector<uint8_t> longName(countAt + 4, 'n');
        std::copy(bytes.begin(), bytes.begin() + static_cast<long>(countAt + 4), longName.begin());
        longName.insert(longName.end(), 500, 'x');
        longName.push_back(0);
        bytes = longName;
      },
      "an attribute name longer than 499 bytes");

  Finished missing = plzc({"toc", "list", dir.file("none.toc")});
  EXPECT_EQ(missing.status, 1);
  EXPECT_EQ(missing.err, "plzc: " + dir.file("none.toc") + ": No such file or directory\n");
  writeFile(cut, std::vector<uint8_t>{});
  Finished empty = plzc({"toc", "list", cut});
  EXPECT_EQ(empty.status, 0);
  EXPECT_EQ(empty.out, "");
}

TEST_F(Plzc, ThreadsShareOneContextAndEndLikeOneThread) {
  // Many files of every kind, compressed by one thread and by four.
  std::vector<std::string> trees = {dir.file("one"), dir.file("four")};
  std::map<std::string, std::vector<uint8_t>> files;
  for (int i = 0; i < 60; i++) {
    std::string name = "f" + std::to_string(i);
    files[name] = i % 3 == 2 ? randomBytes(static_cast<size_t>(20000 + i * 997), static_cast<uint32_t>(i))
                             : textBytes(static_cast<size_t>(i * 9973 % 400000 + 1), static_cast<uint32_t>(i));
  }
  for (const std::string &root : trees) {
    mkdir(root.c_str(), 0755);
    for (const auto &[name, bytes] : files) writeFile(root + "/" + name, bytes);
  }
  Finished one = plzc({"compress", "-v", "-j", "1", trees[0]});
  Finished four = plzc({"compress", "-v", "--verify", "-j", "4", trees[1]});
  ASSERT_EQ(one.status, 0) << one.err;
  ASSERT_EQ(four.status, 0) << four.err;
  EXPECT_EQ(one.err.substr(one.err.find("\n  files")), four.err.substr(four.err.find("\n  files")));
  for (const auto &[name, bytes] : files) {
    std::string a = trees[0] + "/" + name, b = trees[1] + "/" + name;
    EXPECT_EQ(isCompressed(a), isCompressed(b)) << name;
    EXPECT_EQ(attributeSize(a, kResourceForkXattrName), attributeSize(b, kResourceForkXattrName)) << name;
  }
  std::vector<std::string> paths;
  std::vector<uint8_t> expected;
  for (const auto &[name, bytes] : files) {
    paths.push_back(trees[1] + "/" + name);
    expected.insert(expected.end(), bytes.begin(), bytes.end());
  }
  paths.insert(paths.begin(), "cat");
  Finished cat = plzc(paths);
  EXPECT_EQ(cat.status, 0) << cat.err;
  EXPECT_TRUE(bytesOf(cat.out) == expected) << "the files compressed by four threads do not read back";
}

TEST_F(Plzc, InterruptStopsBetweenFilesAndLeavesEveryFileWhole) {
  std::string root = dir.file("tree");
  mkdir(root.c_str(), 0755);
  std::map<std::string, std::vector<uint8_t>> files;
  for (int i = 0; i < 150; i++) {
    std::string path = root + "/f" + std::to_string(i);
    files[path] = textBytes(256 << 10, static_cast<uint32_t>(i));
    writeFile(path, files[path]);
  }
  Process process({"compress", "-v", "-j", "1", root});
  ASSERT_TRUE(process.waitForErr(": type 4", std::chrono::seconds(60)));
  process.signal(SIGINT);
  Finished run = process.wait();
  EXPECT_EQ(run.status, 130) << run.err;
  EXPECT_THAT(run.err, HasSubstr("plzc: interrupted; the files not reached are unchanged\n"));
  size_t compressed = 0;
  for (const auto &[path, bytes] : files) {
    if (isCompressed(path)) {
      compressed++;
      Finished cat = plzc({"cat", path});
      EXPECT_EQ(bytesOf(cat.out), bytes) << path;
    } else {
      EXPECT_EQ(readFile(path), bytes) << path;
    }
  }
  EXPECT_GT(compressed, 0u);
  EXPECT_LT(compressed, files.size());
}

// ---- plzc repair ------------------------------------------------------------------------------

// Lines of standard output that report a file (all but the summary), by path.
std::map<std::string, std::string> reportedFiles(const std::string &out) {
  std::map<std::string, std::string> lines;
  std::istringstream text(out);
  for (std::string line; std::getline(text, line);)
    if (line.compare(0, 13, "plzc repair: ") != 0) lines[line.substr(0, line.find(": "))] = line;
  return lines;
}

TEST_F(Plzc, RepairReportsEachHalfDoneFileAndMakesItWhole) {
  Tree tree = makeTree(dir, "tree");
  ASSERT_EQ(plzc({"compress", tree.root}).status, 0);
  // A compression stopped before the flag, a decompression stopped after 1000 bytes, a file
  // whose data cannot be proven, and the unfinished copy of an interrupted install.
  std::string rolledForward = tree.path("docs/small.txt"), cutShort = tree.path("docs/guide.txt");
  ASSERT_EQ(platform::chflags(rolledForward.c_str(), 0), 0);
  std::vector<uint8_t> guide = tree.files["docs/guide.txt"];
  int fd = open(cutShort.c_str(), O_WRONLY);
  ASSERT_EQ(pwrite(fd, guide.data(), 1000, 0), 1000);
  close(fd);
  std::string unprovable = writeFile(tree.path("data/flagged"), textBytes(5000, 6));
  ASSERT_EQ(platform::chflags(unprovable.c_str(), kFlagCompressed), 0);
  std::string unfinished = writeFile(tree.path("docs/.plzc-install-Ab12Cd"), textBytes(100, 7));

  Finished dry = plzc({"repair", "--dry-run", tree.root});
  EXPECT_EQ(dry.status, 1) << dry.err;
  std::map<std::string, std::string> would = reportedFiles(dry.out);
  EXPECT_EQ(would.size(), 4u) << dry.out;
  EXPECT_THAT(would[rolledForward], HasSubstr(": would mark it compressed"));
  EXPECT_EQ(readFile(cutShort).size(), 1000u);  // nothing changed
  EXPECT_THAT(dry.out, HasSubstr("2 to repair, 1 left alone, 0 failed, 1 unfinished install copies\n"));

  Finished run = plzc({"repair", tree.root});
  EXPECT_EQ(run.status, 1) << run.err;
  std::map<std::string, std::string> lines = reportedFiles(run.out);
  EXPECT_EQ(lines[rolledForward], rolledForward +
                                      ": a whole compressed form beside an empty data fork, not marked compressed: "
                                      "marked compressed");
  EXPECT_EQ(lines[cutShort], cutShort + ": a decompression cut short: 1000 of " + std::to_string(guide.size()) +
                                 " bytes in the data fork: decompression finished: data written, compressed form "
                                 "removed");
  EXPECT_THAT(lines[unprovable], HasSubstr(": left alone: cannot be proven: "));
  EXPECT_THAT(lines[unfinished], HasSubstr(": an unfinished copy of an interrupted plzc install: left alone"));
  // Five files of the tree (one with two names), and the two added.
  EXPECT_THAT(run.out, HasSubstr("plzc repair: 7 files in "));
  EXPECT_THAT(run.out, HasSubstr(": 3 clean, 2 repaired, 1 left alone, 0 failed, 1 unfinished install copies\n"));
  EXPECT_EQ(run.err, "");
  EXPECT_TRUE(isCompressed(rolledForward));
  EXPECT_FALSE(isCompressed(cutShort));
  EXPECT_EQ(readFile(cutShort), guide);
  for (const auto &[relative, bytes] : tree.files) EXPECT_EQ(bytesOf(plzc({"cat", tree.path(relative)}).out), bytes) << relative;

  // What was left alone is all that remains; without it everything is clean.
  unlink(unprovable.c_str());
  unlink(unfinished.c_str());
  Finished again = plzc({"repair", "-v", tree.root});
  EXPECT_EQ(again.status, 0) << again.out;
  EXPECT_THAT(again.out, HasSubstr(tree.path("docs/guide.txt") + ": clean\n"));
  EXPECT_THAT(again.out, HasSubstr(": 5 clean, 0 repaired, 0 left alone, 0 failed\n"));
  // A missing path fails the run by name.
  Finished missing = plzc({"repair", dir.file("absent")});
  EXPECT_EQ(missing.status, 1);
  EXPECT_THAT(missing.err, HasSubstr(dir.file("absent") + ": No such file or directory"));
}

TEST_F(Plzc, RepairAfterAKilledCompressionFindsEveryFileWhole) {
  std::string root = dir.file("tree");
  mkdir(root.c_str(), 0755);
  std::map<std::string, std::vector<uint8_t>> files;
  for (int i = 0; i < 60; i++) {
    std::string path = root + "/f" + std::to_string(i);
    files[path] = textBytes((256 << 10) + static_cast<size_t>(i) * 4099, static_cast<uint32_t>(i));
    writeFile(path, files[path]);
  }
  Process process({"compress", "-v", "-j", "2", root});
  ASSERT_TRUE(process.waitForErr(": type 4", std::chrono::seconds(60)));
  process.signal(SIGKILL);
  EXPECT_EQ(process.wait().status, 128 + SIGKILL);
  Finished repair = plzc({"repair", root});
  EXPECT_EQ(repair.status, 0) << repair.out << repair.err;
  for (const auto &[path, bytes] : files) EXPECT_EQ(bytesOf(plzc({"cat", path}).out), bytes) << path;
  // What repair left, compress finishes.
  EXPECT_EQ(plzc({"compress", root}).status, 0);
  for (const auto &[path, bytes] : files) EXPECT_TRUE(isCompressed(path)) << path;
}

// Runs plzc with a terminal as its standard error (and output) and returns all it wrote there.
std::string runOnTerminal(const std::vector<std::string> &args, int *status) {
  std::string binary = plzcBinary();
  std::vector<char *> argv{binary.data()};
  for (const std::string &arg : args) argv.push_back(const_cast<char *>(arg.c_str()));
  argv.push_back(nullptr);
  int master = -1;
  pid_t pid = forkpty(&master, nullptr, nullptr, nullptr);
  if (pid == 0) {
    execv(argv[0], argv.data());
    _exit(127);
  }
  std::string output;
  char buffer[4096];
  ssize_t got;
  while ((got = read(master, buffer, sizeof buffer)) > 0) output.append(buffer, static_cast<size_t>(got));
  close(master);
  int raw = 0;
  waitpid(pid, &raw, 0);
  *status = WIFEXITED(raw) ? WEXITSTATUS(raw) : 128 + WTERMSIG(raw);
  return output;
}

TEST_F(Plzc, ProgressLineIsDrawnOnATerminalOnlyAndClearedAtTheEnd) {
  std::string root = dir.file("tree");
  mkdir(root.c_str(), 0755);
  for (int i = 0; i < 40; i++) writeFile(root + "/f" + std::to_string(i), textBytes(1 << 20, static_cast<uint32_t>(i)));
  int status = -1;
  // The line first shows after half a second: the slowest engine keeps the run longer than that.
  std::string terminal = runOnTerminal({"compress", "-j", "1", "--engine", "zlib", root}, &status);
  EXPECT_EQ(status, 0) << terminal;
  EXPECT_THAT(terminal, HasSubstr("\rplzc compress: "));
  EXPECT_THAT(terminal, AllOf(HasSubstr(" files, "), HasSubstr(" MB/s, 0:0")));
  EXPECT_THAT(terminal, testing::EndsWith("\r\033[K")) << "the progress line was left on the screen";
  for (int i = 0; i < 40; i++) EXPECT_TRUE(isCompressed(root + "/f" + std::to_string(i)));
}

TEST_F(Plzc, DemoCompressesItsCorpusAndChecksEveryFile) {
  Finished run = plzc({"demo", "--size-mb", "6", "-j", "2", dir.path()});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.err, "");
  EXPECT_THAT(run.out, HasSubstr("plzc demo: corpus of "));
  EXPECT_THAT(run.out, HasSubstr(" compressed (type 3: "));
  EXPECT_THAT(run.out, HasSubstr("savings     "));
  EXPECT_THAT(run.out, HasSubstr(": every file reads back byte for byte\n"));
  EXPECT_TRUE(std::filesystem::is_empty(dir.path())) << "the corpus was not removed";

  // With --keep the corpus stays, compressed, and is the same for the same seed.
  Finished kept = plzc({"demo", "--size-mb", "6", "--keep", dir.path()});
  EXPECT_EQ(kept.status, 0) << kept.err;
  size_t compressed = 0, regular = 0;
  for (const auto &entry : std::filesystem::recursive_directory_iterator(dir.path())) {
    if (!entry.is_regular_file() || entry.is_symlink()) continue;
    regular++;
    compressed += isCompressed(entry.path().string());
  }
  EXPECT_GT(compressed, regular / 2);
  // The same files, taken by the same types. Stored sizes are left out: under load the fast
  // engine has been seen to give a few files streams a few bytes apart from run to run (valid
  // either way; not reproduced in isolation).
  EXPECT_EQ(between(run.out, "files       ", "stored"), between(kept.out, "files       ", "stored"));
}

}  // namespace
