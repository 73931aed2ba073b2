// plzc install and plzc compress --async as a user runs them: the real binary in a subprocess,
// real files, real exit statuses and messages. The binary is $PLZC_BINARY, or Tools/plzc/plzc in
// the build tree that holds this test program.
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

#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <set>
#include <sstream>
#include <thread>

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


bool isCompressed(const std::string &path) {
  platform::Stat st;
  return platform::stat(path.c_str(), &st) == 0 && (st.st_flags & kFlagCompressed) != 0;
}

// The file's data as every reader sees it, read back through plzc cat.
std::vector<uint8_t> catBytes(const std::string &path) {
  Finished run = plzc({"cat", path});
  EXPECT_EQ(run.status, 0) << path << ": " << run.err;
  return {run.out.begin(), run.out.end()};
}

struct stat lstatOf(const std::string &path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  return st;
}

// The first bytes of a thin 64-bit Mach-O file of filetype 2 (MH_EXECUTE), followed by text
// that would compress well.
std::vector<uint8_t> machOExecutable() {
  std::vector<uint8_t> bytes = {0xcf, 0xfa, 0xed, 0xfe, 0x07, 0x00, 0x00, 0x01, 0x03, 0x00, 0x00, 0x00,
                                0x02, 0x00, 0x00, 0x00};
  bytes.resize(32, 0);
  std::vector<uint8_t> text = compressibleBytes(100 << 10, 9);
  bytes.insert(bytes.end(), text.begin(), text.end());
  return bytes;
}

constexpr time_t kOldTime = 981173106;  // 2001-02-03

// A source tree of every kind the install copies, with what each file should become.
struct Source {
  std::string root;
  std::map<std::string, std::vector<uint8_t>> files;  // relative path -> data
  std::set<std::string> compressed;                   // relative paths expected compressed
};

Source makeSource(const ScratchDir &dir) {
  Source source;
  source.root = dir.file("src");
  mkdir(source.root.c_str(), 0755);
  mkdir((source.root + "/private").c_str(), 0755);
  source.files = {
      {"text.txt", compressibleBytes(300 << 10, 1)},
      {"small.txt", compressibleBytes(3000, 2)},
      {"noise.bin", randomBytes(200 << 10, 3)},
      {"empty", {}},
      {"._resource", compressibleBytes(50 << 10, 4)},
      {"photo.jpg", compressibleBytes(80 << 10, 5)},
      {"tool", machOExecutable()},
      {"private/notes.txt", compressibleBytes(40 << 10, 6)},
  };
  source.compressed = {"text.txt", "small.txt", "private/notes.txt"};
  for (const auto &[relative, bytes] : source.files) writeFile(source.root + "/" + relative, bytes);
  EXPECT_EQ(chmod((source.root + "/tool").c_str(), 0755), 0);
  EXPECT_EQ(chmod((source.root + "/private").c_str(), 0700), 0);
  EXPECT_EQ(symlink("text.txt", (source.root + "/link").c_str()), 0);
  timespec times[2] = {{kOldTime, 0}, {kOldTime, 0}};
  for (const char *relative : {"text.txt", "noise.bin", "._resource", "private"})
    EXPECT_EQ(utimensat(AT_FDCWD, (source.root + "/" + relative).c_str(), times, 0), 0);
  return source;
}

TEST(PlzcInstall, CopiesATreeCompressedByTheRules) {
  ScratchDir dir;
  Source source = makeSource(dir);
  std::string dest = dir.file("dest");
  Finished run = plzc({"install", "-v", "--skip-macho", "MH_EXECUTE", "-j", "2", source.root, dest});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_THAT(run.err, HasSubstr("files       8: 3 compressed"));

  for (const auto &[relative, bytes] : source.files) {
    std::string path = dest + "/" + relative;
    EXPECT_EQ(catBytes(path), bytes) << relative;
    EXPECT_EQ(isCompressed(path), source.compressed.count(relative) == 1) << relative;
    EXPECT_EQ(lstatOf(path).st_mode & 07777, lstatOf(source.root + "/" + relative).st_mode & 07777) << relative;
  }
  // Every new file took its name: no unfinished copy is left behind.
  for (const auto &entry : std::filesystem::recursive_directory_iterator(dest))
    EXPECT_THAT(entry.path().filename().string(), Not(StartsWith(".plzc-install-"))) << entry.path();
}

TEST(PlzcInstall, APlainSourceKeepsItsOwnResourceFork) {
  ScratchDir dir;
  std::vector<uint8_t> text = compressibleBytes(300 << 10, 20), fork = randomBytes(100 << 10, 21);
  std::string source = writeFile(dir.file("forked.txt"), text);
  ASSERT_EQ(platform::setxattr(source.c_str(), kResourceForkXattrName, fork.data(), fork.size(), 0, 0), 0);
  std::string dest = dir.file("copy.txt");
  Finished run = plzc({"install", source, dest});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_FALSE(isCompressed(dest));  // a file with a fork of its own never ends compressed
  EXPECT_EQ(readFile(dest), text);
  std::vector<uint8_t> back(fork.size());
  EXPECT_EQ(platform::getxattr(dest.c_str(), kResourceForkXattrName, back.data(), back.size(), 0, 0),
            static_cast<ssize_t>(fork.size()));
  EXPECT_EQ(back, fork);
}

// Killed at any moment, an install leaves under each destination name the old file or the
// whole new one, never a part; its unfinished copies are reported by plzc repair.
TEST(PlzcInstall, KilledInstallLeavesWholeFilesUnderDestinationNames) {
  ScratchDir dir;
  std::string source = dir.file("src"), dest = dir.file("dest");
  mkdir(source.c_str(), 0755);
  mkdir(dest.c_str(), 0755);
  std::map<std::string, std::vector<uint8_t>> fresh, old;
  for (int i = 0; i < 40; i++) {
    std::string name = "f" + std::to_string(i);
    fresh[name] = compressibleBytes((200 << 10) + static_cast<size_t>(i) * 1000, static_cast<uint32_t>(i));
    old[name] = compressibleBytes(5000, static_cast<uint32_t>(100 + i));
    writeFile(source + "/" + name, fresh[name]);
    writeFile(dest + "/" + name, old[name]);
  }
  auto start = std::chrono::steady_clock::now();
  ASSERT_EQ(plzc({"install", source + "/.", dir.file("timed")}).status, 0);
  auto whole = std::chrono::steady_clock::now() - start;
  int replaced = 0;
  for (int round = 0; round < 3; round++) {
    Process process({"install", "-j", "2", source + "/.", dest});
    std::this_thread::sleep_for(whole * (round + 1) / 4);
    process.signal(SIGKILL);
    process.wait();
    for (const auto &[name, bytes] : fresh) {
      std::vector<uint8_t> now = catBytes(dest + "/" + name);
      EXPECT_TRUE(now == bytes || now == old[name]) << name << " holds " << now.size() << " bytes";
      replaced += now == bytes;
    }
    Finished repair = plzc({"repair", dest});
    for (const auto &entry : std::filesystem::directory_iterator(dest)) {
      std::string name = entry.path().filename().string();
      if (name.compare(0, 14, ".plzc-install-") == 0) {
        EXPECT_THAT(repair.out, HasSubstr(entry.path().string() + ": an unfinished copy of an interrupted plzc install"));
        std::filesystem::remove(entry.path());
      }
    }
  }
  RecordProperty("files_replaced", replaced);
}

TEST(PlzcInstall, KeepsLinksModesAndTimes) {
  ScratchDir dir;
  Source source = makeSource(dir);
  ASSERT_EQ(link((source.root + "/text.txt").c_str(), (source.root + "/second.txt").c_str()), 0);
  std::string dest = dir.file("dest");
  Finished run = plzc({"install", source.root, dest});
  ASSERT_EQ(run.status, 0) << run.err;

  struct stat link = lstatOf(dest + "/link");
  EXPECT_TRUE(S_ISLNK(link.st_mode));
  EXPECT_EQ(std::filesystem::read_symlink(dest + "/link"), "text.txt");
  EXPECT_EQ(lstatOf(dest + "/second.txt").st_ino, lstatOf(dest + "/text.txt").st_ino);
  EXPECT_EQ(lstatOf(dest + "/private").st_mode & 07777, 0700u);
  EXPECT_TRUE(S_ISDIR(lstatOf(dest + "/private").st_mode));
  for (const char *relative : {"text.txt", "noise.bin", "._resource", "private"})
    EXPECT_EQ(lstatOf(dest + "/" + relative).st_mtime, kOldTime) << relative;
}

TEST(PlzcInstall, MachOExecutableIsCompressedWithoutSkipOption) {
  ScratchDir dir;
  std::string source = writeFile(dir.file("tool"), machOExecutable());
  Finished run = plzc({"install", source, dir.file("copied")});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_TRUE(isCompressed(dir.file("copied")));
  EXPECT_EQ(catBytes(dir.file("copied")), machOExecutable());
}

TEST(PlzcInstall, RulesFileExcludesFiles) {
  ScratchDir dir;
  mkdir(dir.file("src").c_str(), 0755);
  std::vector<uint8_t> text = compressibleBytes(60 << 10, 7);
  writeFile(dir.file("src/keep.log"), text);
  writeFile(dir.file("src/plain.dat"), text);
  writeFile(dir.file("rules.plist"),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><array><dict>"
            "<key>RuleType</key><string>Exclude</string><key>PathEndsWithString</key><string>.dat</string>"
            "</dict></array></plist>\n");
  mkdir(dir.file("dest").c_str(), 0755);
  Finished run = plzc({"install", "--rules", dir.file("rules.plist"), dir.file("src/keep.log"),
                       dir.file("src/plain.dat"), dir.file("dest")});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_TRUE(isCompressed(dir.file("dest/keep.log")));
  EXPECT_FALSE(isCompressed(dir.file("dest/plain.dat")));
  EXPECT_EQ(catBytes(dir.file("dest/plain.dat")), text);
}

TEST(PlzcInstall, OptionsFileRulesApply) {
  ScratchDir dir;
  mkdir(dir.file("src").c_str(), 0755);
  std::vector<uint8_t> text = compressibleBytes(60 << 10, 8);
  writeFile(dir.file("src/kept.txt"), text);
  writeFile(dir.file("src/packed.log"), text);
  writeFile(dir.file("options.plist"),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
            "<key>CompressionLevel</key><integer>9</integer><key>CompressionRules</key><array><dict>"
            "<key>RuleType</key><string>Exclude</string><key>PathEndsWithString</key><string>.txt</string>"
            "</dict></array></dict></plist>\n");
  Finished run = plzc({"install", "--options", dir.file("options.plist"), dir.file("src"), dir.file("dest")});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_FALSE(isCompressed(dir.file("dest/kept.txt")));
  EXPECT_TRUE(isCompressed(dir.file("dest/packed.log")));
  EXPECT_EQ(catBytes(dir.file("dest/kept.txt")), text);
  EXPECT_EQ(catBytes(dir.file("dest/packed.log")), text);
}

TEST(PlzcInstall, QueueFailureNamesTheFile) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a small volume needs root";
  ScratchDir dir;
  TemporaryMount volume = TemporaryMount::ext4WithoutLargeAttributes(dir.path());
  if (!volume.mounted()) GTEST_SKIP() << "no ext4 volume could be mounted";
  std::string source = writeFile(dir.file("big.txt"), compressibleBytes(300 << 10, 10));
  std::string dest = volume.mountPoint() + "/big.txt";
  Finished run = plzc({"install", source, dest});
  EXPECT_EQ(run.status, 1);
  EXPECT_THAT(run.err, HasSubstr("the stream queue failed"));
  EXPECT_THAT(run.err, HasSubstr("failed: " + dest));
}

TEST(PlzcInstall, MissingSourceFails) {
  ScratchDir dir;
  Finished run = plzc({"install", dir.file("absent"), dir.file("dest")});
  EXPECT_EQ(run.status, 1);
  EXPECT_THAT(run.err, HasSubstr(dir.file("absent") + ": No such file or directory"));
}

TEST(PlzcInstall, UsageErrors) {
  ScratchDir dir;
  writeFile(dir.file("bad.plist"), "<plist version=\"1.0\"><dict><key>x</key></plist>");
  writeFile(dir.file("array.plist"), "<plist version=\"1.0\"><array/></plist>");
  writeFile(dir.file("file"), "x");
  struct Case {
    std::vector<std::string> args;
    const char *message;
  } cases[] = {
      {{"install", "--bogus", dir.file("file"), dir.file("d")}, "unknown option '--bogus'"},
      {{"install", "--options", dir.file("bad.plist"), dir.file("file"), dir.file("d")}, "not a well-formed"},
      {{"install", "--options", dir.file("array.plist"), dir.file("file"), dir.file("d")}, "must hold a dictionary"},
      {{"install", "--options", dir.file("none.plist"), dir.file("file"), dir.file("d")}, "cannot read"},
      {{"install", "--rules", dir.file("bad.plist"), dir.file("file"), dir.file("d")}, "not a well-formed"},
      {{"install", "-t", "5", dir.file("file"), dir.file("d")}, "invalid type list"},
      {{"install", dir.file("file")}, "missing DEST"},
  };
  for (const Case &c : cases) {
    Finished run = plzc(c.args);
    EXPECT_EQ(run.status, 2) << c.args[1];
    EXPECT_THAT(run.err, HasSubstr(c.message)) << c.args[1];
  }
  EXPECT_FALSE(std::filesystem::exists(dir.file("d")));
}

TEST(PlzcInstall, InvalidMachOTypeFailsSetUp) {
  ScratchDir dir;
  writeFile(dir.file("file"), "x");
  Finished run = plzc({"install", "--skip-macho", "MH_NOTHING", dir.file("file"), dir.file("d")});
  EXPECT_EQ(run.status, 1);
  EXPECT_FALSE(std::filesystem::exists(dir.file("d")));
}

TEST(PlzcCompressAsync, SameEndStateAsCompress) {
  ScratchDir dir;
  for (const char *name : {"sync", "async"}) {
    std::string root = dir.file(name);
    mkdir(root.c_str(), 0755);
    mkdir((root + "/sub").c_str(), 0755);
    writeFile(root + "/large.txt", compressibleBytes(300 << 10, 1));
    writeFile(root + "/small.txt", compressibleBytes(3000, 2));
    writeFile(root + "/noise.bin", randomBytes(100 << 10, 3));
    writeFile(root + "/empty", std::string());
    writeFile(root + "/sub/more.txt", compressibleBytes(70 << 10, 4));
  }
  Finished sync = plzc({"compress", "-v", dir.file("sync")});
  Finished async = plzc({"compress", "-v", "--async", dir.file("async")});
  ASSERT_EQ(sync.status, 0) << sync.err;
  ASSERT_EQ(async.status, 0) << async.err;
  EXPECT_THAT(async.err, HasSubstr("through the compression queue"));
  for (const char *relative : {"large.txt", "small.txt", "noise.bin", "empty", "sub/more.txt"}) {
    std::string a = dir.file(std::string("sync/") + relative), b = dir.file(std::string("async/") + relative);
    EXPECT_EQ(isCompressed(a), isCompressed(b)) << relative;
    EXPECT_EQ(catBytes(a), catBytes(b)) << relative;
    Finished infoA = plzc({"info", a}), infoB = plzc({"info", b});
    EXPECT_EQ(infoA.out.substr(0, infoA.out.rfind(a)), infoB.out.substr(0, infoB.out.rfind(b))) << relative;
  }
  EXPECT_TRUE(isCompressed(dir.file("async/large.txt")));
}

TEST(PlzcCompressAsync, RejectsVerify) {
  ScratchDir dir;
  writeFile(dir.file("f"), "x");
  Finished run = plzc({"compress", "--async", "--verify", dir.file("f")});
  EXPECT_EQ(run.status, 2);
  EXPECT_THAT(run.err, HasSubstr("--async does not go with --verify"));
}

}  // namespace
