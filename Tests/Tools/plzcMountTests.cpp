// plzc mount as a user meets it: a real FUSE mount served by the plzc binary over a tree that
// plzc compress compressed, checked with ordinary programs (cmp, sha256sum, tar, cp, rsync,
// stat, ls) and with direct reads, writes and attribute calls.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <map>
#include <memory>
#include <random>
#include <sstream>
#include <thread>

#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Support/PlzcProcess.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::Not;

namespace {

using Clock = std::chrono::steady_clock;

std::string q(const std::string &text) { return "'" + text + "'"; }

std::string shell(const std::string &command, int *status = nullptr) {
  int ignored = 0;
  return runCommand(command + " 2>&1", status ? status : &ignored);
}

bool isMounted(const std::string &point) {
  std::ifstream table("/proc/self/mountinfo");
  std::string line;
  while (std::getline(table, line)) {
    std::istringstream fields(line);
    std::string id, parent, device, root, where;
    fields >> id >> parent >> device >> root >> where;
    if (where == point && line.find(" fuse.plzc ") != std::string::npos) return true;
  }
  return false;
}

// A value from /proc/PID/status ("VmHWM" and so on) in KiB; -1 when absent.
long statusKiB(pid_t pid, const std::string &field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line))
    if (line.rfind(field + ":", 0) == 0) return std::stol(line.substr(field.size() + 1));
  return -1;
}

bool alive(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
  size_t close = text.rfind(')');
  return close != std::string::npos && close + 2 < text.size() && text[close + 2] != 'Z';
}

// A foreground plzc mount for the life of the object: unmounted (and its process reaped, or
// killed) on destruction, whatever the test did.
class Mount {
 public:
  Mount(const std::string &source, const std::string &point, const std::vector<std::string> &options = {})
      : point_(point) {
    std::vector<std::string> args{"mount", "-f"};
    for (const std::string &option : options) {
      args.push_back("-o");
      args.push_back(option);
    }
    args.push_back(source);
    args.push_back(point);
    process_ = std::make_unique<Process>(args);
    auto end = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < end && alive(process_->pid()) && !isMounted(point_))
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    up_ = isMounted(point_);
  }
  ~Mount() { stop(); }

  bool up() const { return up_; }
  pid_t pid() const { return process_->pid(); }

  // Unmounts and returns how the server ended, with everything it printed.
  Finished stop() {
    if (stopped_) return finished_;
    stopped_ = true;
    if (isMounted(point_)) {
      int status = 0;
      shell("fusermount3 -u " + q(point_), &status);
      if (status != 0) shell("umount -l " + q(point_));
    }
    auto end = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < end && alive(process_->pid())) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    if (alive(process_->pid())) process_->signal(SIGKILL);
    finished_ = process_->wait();
    return finished_;
  }
  void signal(int number) { process_->signal(number); }

 private:
  std::string point_;
  std::unique_ptr<Process> process_;
  bool up_ = false, stopped_ = false;
  Finished finished_;
};

// Every node's type, size, mode, owner, links, modification time and link target, one line
// each, sorted: what stat shows of a tree.
std::string listing(const std::string &dir) {
  return shell("cd " + q(dir) + " && find . -printf '%p %y %s %m %U %G %n %T@ %l\\n' | sort");
}

std::string checksums(const std::string &dir) {
  return shell("cd " + q(dir) + " && find . -type f -print0 | sort -z | xargs -0 sha256sum");
}

std::string longListing(const std::string &dir) {
  return shell("cd " + q(dir) + " && ls -lR --time-style=+%s.%N . | grep -v '^total '");
}

std::vector<uint8_t> text(size_t size, uint32_t seed) { return compressibleBytes(size, seed); }

// Text with incompressible stretches, so that some chunks are stored rather than deflated.
std::vector<uint8_t> mixed(size_t size, uint32_t seed) {
  std::vector<uint8_t> bytes = compressibleBytes(size, seed);
  for (size_t at = 100000; at + 50000 < size; at += 400000) {
    std::vector<uint8_t> noise = randomBytes(50000, static_cast<uint32_t>(seed + at));
    memcpy(bytes.data() + at, noise.data(), noise.size());
  }
  return bytes;
}

// Reads the file through read(2) in pieces of the given size; *error gets errno of a failure.
// With extraFlags O_DIRECT every read reaches the server as asked, past the kernel's pages.
std::vector<uint8_t> readAll(const std::string &path, size_t piece, int *error, int extraFlags = 0) {
  *error = 0;
  std::vector<uint8_t> bytes;
  int fd = open(path.c_str(), O_RDONLY | extraFlags);
  if (fd < 0) {
    *error = errno;
    return bytes;
  }
  // Page-aligned, as direct reads want.
  void *memory = nullptr;
  if (posix_memalign(&memory, 4096, piece) != 0) {
    close(fd);
    *error = ENOMEM;
    return bytes;
  }
  std::unique_ptr<uint8_t, decltype(&free)> buffer(static_cast<uint8_t *>(memory), &free);
  for (;;) {
    ssize_t got = read(fd, buffer.get(), piece);
    if (got < 0) {
      *error = errno;
      break;
    }
    if (got == 0) break;
    bytes.insert(bytes.end(), buffer.get(), buffer.get() + got);
  }
  close(fd);
  return bytes;
}

class PlzcMount : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    if (access("/dev/fuse", F_OK) != 0 || !runningAsRoot()) return;
    scratch_ = new ScratchDir;
    const std::string orig = scratch_->file("orig");
    shell("mkdir -p " + q(orig + "/sub/deeper"));
    struct File {
      const char *name;
      std::vector<uint8_t> bytes;
    } files[] = {
        {"empty", {}},
        {"tiny.txt", text(300, 1)},
        {"page.txt", text(4096, 2)},
        {"exact64k.log", text(65536, 3)},
        {"medium.log", text(1048576 + 17, 4)},
        {"big.log", text(4 * 1048576 + 12345, 5)},
        {"mixed.bin", mixed(1300000, 6)},
        {"random.bin", randomBytes(300000, 7)},
        {"sub/deeper/note.txt", text(20000, 8)},
        {"sub/private.txt", text(9000, 9)},
        {"sub/owned.log", text(200000, 10)},
    };
    for (const File &file : files) writeFile(orig + "/" + file.name, file.bytes);
    shell("cd " + q(orig) +
          " && chmod 600 sub/private.txt && chown 1234:5678 sub/owned.log && ln -s big.log link &&"
          " ln medium.log sub/hard.log && mkfifo sub/pipe && setfattr -n user.note -v hello tiny.txt &&"
          " setfattr -n user.note -v world medium.log && find . -exec touch -h -d '2021-03-04 05:06:07.123456' {} +");
    original_ = new std::string(orig);
  }
  static void TearDownTestSuite() {
    delete scratch_;
    scratch_ = nullptr;
    delete original_;
    original_ = nullptr;
  }

  void SetUp() override {
    if (access("/dev/fuse", F_OK) != 0) GTEST_SKIP() << "/dev/fuse is absent: this machine cannot mount FUSE";
    if (!runningAsRoot()) GTEST_SKIP() << "mounting needs root";
    ASSERT_NE(original_, nullptr);
  }

  // A fresh compressed copy of the original tree, and an empty mount point beside it.
  std::string compressedTree(const std::string &name) {
    std::string tree = dir.file(name);
    shell("cp -a " + q(*original_) + " " + q(tree));
    Finished run = plzc({"compress", "-t", "3,4", tree});
    EXPECT_EQ(run.status, 0) << run.err;
    mkdir(mountPoint().c_str(), 0755);
    return tree;
  }
  std::string mountPoint() const { return dir.file("mnt"); }
  std::string orig(const std::string &name = "") const { return *original_ + (name.empty() ? "" : "/" + name); }

  static ScratchDir *scratch_;
  static std::string *original_;
  ScratchDir dir;
};

ScratchDir *PlzcMount::scratch_ = nullptr;
std::string *PlzcMount::original_ = nullptr;

TEST_F(PlzcMount, TheTreeReadsAndListsAsTheOriginal) {
  std::string tree = compressedTree("tree");
  // The tree really is compressed, so the mount has something to do.
  ASSERT_EQ(shell("cd " + q(tree) + " && stat -c %s big.log medium.log tiny.txt random.bin"),
            "0\n0\n0\n300000\n");
  Mount mount(tree, mountPoint());
  ASSERT_TRUE(mount.up());
  std::string mnt = mountPoint();

  EXPECT_EQ(checksums(mnt), checksums(orig()));
  EXPECT_EQ(listing(mnt), listing(orig()));
  EXPECT_EQ(longListing(mnt), longListing(orig()));
  for (const char *name : {"tiny.txt", "big.log", "mixed.bin", "random.bin", "sub/owned.log", "empty"}) {
    int status = -1;
    EXPECT_EQ(shell("cmp " + q(orig(name)) + " " + q(mnt + "/" + name), &status), "") << name;
    EXPECT_EQ(status, 0) << name;
  }
  // The stored size shows in the blocks: far fewer than the logical size needs.
  struct stat big, plain;
  ASSERT_EQ(stat((mnt + "/big.log").c_str(), &big), 0);
  ASSERT_EQ(stat((mnt + "/random.bin").c_str(), &plain), 0);
  EXPECT_GT(big.st_blocks, 0);
  EXPECT_LT(big.st_blocks * 512, big.st_size / 2);
  EXPECT_GE(plain.st_blocks * 512, plain.st_size);
  // Hard links and inode numbers come through as they are.
  struct stat hard, medium;
  ASSERT_EQ(stat((mnt + "/sub/hard.log").c_str(), &hard), 0);
  ASSERT_EQ(stat((mnt + "/medium.log").c_str(), &medium), 0);
  EXPECT_EQ(hard.st_ino, medium.st_ino);
  EXPECT_EQ(hard.st_nlink, 2u);
  // statfs is the source volume's.
  EXPECT_EQ(shell("stat -f -c '%b %S %c' " + q(mnt)), shell("stat -f -c '%b %S %c' " + q(tree)));

  Finished end = mount.stop();
  EXPECT_EQ(end.status, 0) << end.err;
}

TEST_F(PlzcMount, CopiesOutOfTheMountArePlainAndWhole) {
  std::string tree = compressedTree("tree");
  Mount mount(tree, mountPoint());
  ASSERT_TRUE(mount.up());
  std::string mnt = mountPoint();
  std::string viaTar = dir.file("tar"), viaCp = dir.file("cp"), viaRsync = dir.file("rsync");
  int status = -1;
  shell("mkdir " + q(viaTar) + " && tar -C " + q(mnt) + " --xattrs -cf - . | tar -C " + q(viaTar) +
            " --xattrs --xattrs-include='user.*' -xf -",
        &status);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(shell("cp -a " + q(mnt) + " " + q(viaCp), &status), "");
  EXPECT_EQ(status, 0);
  EXPECT_EQ(shell("rsync -aHX " + q(mnt + "/") + " " + q(viaRsync + "/"), &status), "");
  EXPECT_EQ(status, 0);
  for (const std::string &copy : {viaTar, viaCp, viaRsync}) {
    EXPECT_EQ(checksums(copy), checksums(orig())) << copy;
    EXPECT_EQ(listing(copy), listing(orig())) << copy;
    // The user's own attributes travel, the compressed form does not.
    std::string attributes = shell("getfattr -R -d -m - --absolute-names " + q(copy));
    EXPECT_THAT(attributes, HasSubstr("user.note=\"hello\"")) << copy;
    EXPECT_THAT(attributes, Not(HasSubstr("com.tavix"))) << copy;
    EXPECT_THAT(attributes, Not(HasSubstr("plzc#"))) << copy;
  }
}

TEST_F(PlzcMount, ReadsAtRandomOffsetsAndSizes) {
  std::string tree = compressedTree("tree");
  Mount mount(tree, mountPoint());
  ASSERT_TRUE(mount.up());
  std::mt19937 random(42);
  for (const char *name : {"big.log", "mixed.bin", "exact64k.log", "tiny.txt"}) {
    std::vector<uint8_t> expected = readFile(orig(name));
    int fd = open((mountPoint() + "/" + name).c_str(), O_RDONLY);
    ASSERT_GE(fd, 0) << name;
    std::vector<uint8_t> buffer(600000);
    for (int n = 0; n < 150; n++) {
      size_t offset = random() % (expected.size() + 100);
      size_t count = 1 + random() % (n % 3 == 0 ? 600000 : 5000);
      ssize_t got = pread(fd, buffer.data(), count, static_cast<off_t>(offset));
      size_t want = offset >= expected.size() ? 0 : std::min(count, expected.size() - offset);
      ASSERT_EQ(got, static_cast<ssize_t>(want)) << name << " at " << offset << " for " << count;
      ASSERT_EQ(0, memcmp(buffer.data(), expected.data() + std::min(offset, expected.size()), want))
          << name << " at " << offset << " for " << count;
    }
    close(fd);
  }
}

// The counts the server prints at exit: chunks decoded into the cache, hits, whole chunks
// decoded straight into replies.
struct CacheCounts {
  uint64_t hits = 0, decodes = 0, direct = 0;
};
CacheCounts cacheCounts(const std::string &err) {
  CacheCounts counts;
  unsigned long long hits = 0, decodes = 0, direct = 0;
  size_t line = err.find("plzc mount: chunk cache: ");
  if (line != std::string::npos &&
      sscanf(err.c_str() + line, "plzc mount: chunk cache: %llu hits, %llu decodes, %llu whole chunks", &hits,
             &decodes, &direct) == 3) {
    counts = {hits, decodes, direct};
  } else {
    ADD_FAILURE() << "no cache counts in: " << err;
  }
  return counts;
}

TEST_F(PlzcMount, EachChunkIsDecodedAboutOnce) {
  std::string tree = compressedTree("tree");
  const uint64_t chunks = (4 * 1048576 + 12345 + 65535) / 65536;
  std::vector<uint8_t> expected = readFile(orig("big.log"));
  {
    // Sequential reads in small pieces: the kernel asks for whole chunks.
    Mount mount(tree, mountPoint(), {"no_keep_cache"});
    ASSERT_TRUE(mount.up());
    int error = 0;
    EXPECT_EQ(readAll(mountPoint() + "/big.log", 4096, &error), expected);
    EXPECT_EQ(error, 0);
    CacheCounts counts = cacheCounts(mount.stop().err);
    EXPECT_GE(counts.decodes + counts.direct, chunks);
    EXPECT_LE(counts.decodes + counts.direct, chunks + 2);
  }
  {
    // Direct reads of 4 KiB at random: each asks for a piece of a chunk, the cache serves the rest.
    Mount mount(tree, mountPoint());
    ASSERT_TRUE(mount.up());
    int fd = open((mountPoint() + "/big.log").c_str(), O_RDONLY | O_DIRECT);
    ASSERT_GE(fd, 0) << strerror(errno);
    void *page = nullptr;
    ASSERT_EQ(posix_memalign(&page, 4096, 4096), 0);
    std::mt19937 random(5);
    int wrong = 0;
    for (int n = 0; n < 3000; n++) {
      size_t offset = (random() % (expected.size() / 4096)) * 4096;
      ssize_t got = pread(fd, page, 4096, static_cast<off_t>(offset));
      if (got != 4096 || memcmp(page, expected.data() + offset, 4096) != 0) wrong++;
    }
    free(page);
    close(fd);
    EXPECT_EQ(wrong, 0);
    CacheCounts counts = cacheCounts(mount.stop().err);
    EXPECT_EQ(counts.decodes, chunks) << "every chunk decoded once, then served from the cache";
    EXPECT_EQ(counts.hits, 3000u - chunks);
  }
}

TEST_F(PlzcMount, EightProcessesReadAtOnceWithinTheCacheLimit) {
  std::string tree = compressedTree("tree");
  // A file much larger than the cache, so that a cache without a bound would show.
  std::vector<uint8_t> large = mixed(32 * 1048576, 12);
  writeFile(tree + "/large.log", large);
  ASSERT_EQ(plzc({"compress", tree + "/large.log"}).status, 0);
  Mount mount(tree, mountPoint(), {"cache_size=4"});
  ASSERT_TRUE(mount.up());
  long before = statusKiB(mount.pid(), "VmRSS");
  ASSERT_GT(before, 0);

  std::map<std::string, std::vector<uint8_t>> expected;
  for (const char *name : {"big.log", "mixed.bin", "medium.log", "sub/owned.log", "tiny.txt"})
    expected[name] = readFile(orig(name));
  expected["large.log"] = large;
  std::vector<pid_t> children;
  for (int p = 0; p < 8; p++) {
    pid_t child = fork();
    if (child == 0) {
      // Half read the files in the same order through the kernel's pages, half go their own
      // way with direct reads that end mid-chunk, so that the cache fills and must evict.
      std::mt19937 random(static_cast<uint32_t>(p));
      int bad = 0;
      std::vector<std::string> names;
      for (const auto &[name, bytes] : expected) names.push_back(name);
      if (p % 2) std::shuffle(names.begin(), names.end(), random);
      for (const std::string &name : names) {
        int error = 0;
        if (readAll(mountPoint() + "/" + name, p % 2 ? 100000 + 4096 * p : 131072, &error, p % 2 ? O_DIRECT : 0) !=
                expected[name] ||
            error)
          bad++;
      }
      _exit(bad == 0 ? 0 : 1);
    }
    children.push_back(child);
  }
  for (pid_t child : children) {
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "a reader got wrong bytes";
  }
  long peak = statusKiB(mount.pid(), "VmHWM");
#if !defined(__SANITIZE_ADDRESS__)
  // 4 MiB of chunks, plus the FUSE threads' buffers and decoders: far below the 32 MiB read.
  EXPECT_LT(peak - before, 20 * 1024) << "peak " << peak << " KiB, " << before << " KiB after mounting";
#else
  (void)peak;  // freed memory stays quarantined under ASan: the bound is checked in the stats
#endif
  Finished end = mount.stop();
  EXPECT_EQ(end.status, 0);
  unsigned long long evictions = 0, peakBytes = 0, limit = 0;
  size_t at = end.err.find(" shared decodes, ");
  ASSERT_NE(at, std::string::npos) << end.err;
  ASSERT_EQ(sscanf(end.err.c_str() + at, " shared decodes, %llu evictions, peak %llu of %llu bytes", &evictions,
                   &peakBytes, &limit),
            3)
      << end.err;
  EXPECT_GT(evictions, 0u) << "the cache was never full: " << end.err;
  EXPECT_LE(peakBytes, limit);
  EXPECT_EQ(limit, 4u << 20);
}

TEST_F(PlzcMount, WritingOrTruncatingMakesTheFilePlainFirst) {
  std::string tree = compressedTree("tree");
  Mount mount(tree, mountPoint());
  ASSERT_TRUE(mount.up());
  std::string mnt = mountPoint();

  int fd = open((mnt + "/medium.log").c_str(), O_RDWR);
  ASSERT_GE(fd, 0) << strerror(errno);
  ASSERT_EQ(pwrite(fd, "PATCH", 5, 100000), 5);
  close(fd);
  std::vector<uint8_t> patched = readFile(orig("medium.log"));
  memcpy(patched.data() + 100000, "PATCH", 5);
  shell("truncate -s 1000 " + q(mnt + "/big.log") + " && echo new > " + q(mnt + "/exact64k.log") +
        " && echo more >> " + q(mnt + "/tiny.txt"));
  std::vector<uint8_t> truncated = readFile(orig("big.log"));
  truncated.resize(1000);
  std::vector<uint8_t> appended = readFile(orig("tiny.txt"));
  for (char c : std::string("more\n")) appended.push_back(static_cast<uint8_t>(c));

  struct Expected {
    const char *name;
    std::vector<uint8_t> bytes;
  } cases[] = {{"medium.log", patched},
               {"sub/hard.log", patched},
               {"big.log", truncated},
               {"exact64k.log", {'n', 'e', 'w', '\n'}},
               {"tiny.txt", appended}};
  for (const Expected &c : cases) {
    std::string inSource = tree + "/" + c.name;
    platform::Stat st;
    ASSERT_EQ(platform::stat(inSource.c_str(), &st), 0);
    EXPECT_EQ(st.st_flags & kFlagCompressed, 0u) << c.name;
    EXPECT_EQ(readFile(inSource), c.bytes) << c.name << " in the source";
    EXPECT_EQ(readFile(mnt + "/" + c.name), c.bytes) << c.name << " through the mount";
    for (const std::string &name : linuxAttributeNames(inSource))
      EXPECT_EQ(name.find("com.tavix"), std::string::npos) << c.name << ": " << name;
  }
  EXPECT_EQ(shell("getfattr --absolute-names --only-values -n user.note " + q(tree + "/medium.log")), "world")
      << "the user's attribute survives";
  // An untouched compressed file stays compressed.
  platform::Stat other;
  ASSERT_EQ(platform::stat((tree + "/mixed.bin").c_str(), &other), 0);
  EXPECT_EQ(other.st_flags & kFlagCompressed, kFlagCompressed);
}

TEST_F(PlzcMount, EverythingElsePassesThrough) {
  std::string tree = compressedTree("tree");
  Mount mount(tree, mountPoint());
  ASSERT_TRUE(mount.up());
  std::string mnt = mountPoint();
  int status = -1;
  std::string out = shell("set -e; cd " + q(mnt) +
                              "; mkdir -m 750 made; echo data > made/file; mv made/file made/moved;"
                              " ln made/moved made/linked; ln -s moved made/sym; mkfifo made/fifo;"
                              " chmod 640 made/moved; chown 42:43 made/moved; touch -d '2020-01-02 03:04:05' made/moved;"
                              " mkdir gone; rmdir gone; echo x > doomed; rm doomed; mv sub/private.txt private.txt;"
                              " setfattr -n user.added -v yes made/moved; setfattr -x user.note tiny.txt",
                          &status);
  ASSERT_EQ(status, 0) << out;
  auto statOf = [&](const std::string &name) {
    return shell("stat -c '%F %a %u %g %h %s %Y' " + q(tree + "/" + name));
  };
  auto statThrough = [&](const std::string &name) {
    return shell("stat -c '%F %a %u %g %h %s %Y' " + q(mnt + "/" + name));
  };
  EXPECT_EQ(statOf("made").substr(0, 20), "directory 750 0 0 2 ");
  EXPECT_EQ(statOf("made/moved"), "regular file 640 42 43 2 5 1577934245\n");
  EXPECT_EQ(statOf("made/linked"), statOf("made/moved"));
  EXPECT_EQ(statOf("made/sym").substr(0, 26), "symbolic link 777 0 0 1 5 ");
  EXPECT_EQ(statOf("made/fifo").substr(0, 17), "fifo 644 0 0 1 0 ");
  EXPECT_EQ(statThrough("private.txt"), "regular file 600 0 0 1 9000 1614834367\n");
  EXPECT_EQ(statOf("private.txt"), "regular empty file 600 0 0 1 0 1614834367\n") << "still compressed";
  EXPECT_EQ(shell("readlink " + q(tree + "/made/sym")), "moved\n");
  EXPECT_EQ(shell("getfattr --absolute-names --only-values -n user.added " + q(tree + "/made/moved")), "yes");
  EXPECT_THAT(shell("getfattr --absolute-names -d " + q(tree + "/tiny.txt")), Not(HasSubstr("user.note")));
  EXPECT_FALSE(std::filesystem::exists(tree + "/doomed"));
  EXPECT_FALSE(std::filesystem::exists(tree + "/gone"));
}

TEST_F(PlzcMount, CompressionAttributesAreHiddenUnlessAsked) {
  std::string tree = compressedTree("tree");
  std::string file = mountPoint() + "/medium.log";
  {
    Mount mount(tree, mountPoint());
    ASSERT_TRUE(mount.up());
    std::vector<std::string> names = linuxAttributeNames(file);
    EXPECT_EQ(names, std::vector<std::string>{"user.note"});
    char value[64];
    EXPECT_EQ(getxattr(file.c_str(), "user.com.tavix.decmpfs", value, sizeof value), -1);
    EXPECT_EQ(errno, ENODATA);
    EXPECT_EQ(getxattr(file.c_str(), "user.plzc#flags", value, sizeof value), -1);
    EXPECT_EQ(setxattr(file.c_str(), "user.com.tavix.ResourceFork", "x", 1, 0), -1);
    EXPECT_EQ(errno, EPERM);
    EXPECT_EQ(removexattr(file.c_str(), "user.com.tavix.decmpfs"), -1);
    // The size a caller is told fits exactly what it then gets.
    ssize_t size = listxattr(file.c_str(), nullptr, 0);
    EXPECT_EQ(size, static_cast<ssize_t>(strlen("user.note") + 1));
    EXPECT_EQ(getxattr(file.c_str(), "user.note", value, sizeof value), 5);
  }
  {
    Mount mount(tree, mountPoint(), {"show_compression_xattrs"});
    ASSERT_TRUE(mount.up());
    std::vector<std::string> names = linuxAttributeNames(file);
    EXPECT_THAT(names, ::testing::Contains("user.com.tavix.decmpfs"));
    EXPECT_THAT(names, ::testing::Contains("user.plzc#flags"));
    uint8_t shown[16], stored[16];
    EXPECT_EQ(getxattr(file.c_str(), "user.com.tavix.decmpfs", shown, sizeof shown), 16);
    EXPECT_EQ(lgetxattr((tree + "/medium.log").c_str(), "user.com.tavix.decmpfs", stored, sizeof stored), 16);
    EXPECT_EQ(0, memcmp(shown, stored, 16));
  }
}

TEST_F(PlzcMount, DamagedOrUndecodableFilesFailWithEioAndTheMountGoesOn) {
  std::string tree = compressedTree("tree");
  Mount mount(tree, mountPoint());
  ASSERT_TRUE(mount.up());
  std::string mnt = mountPoint();
  int error = 0;
  ASSERT_EQ(readAll(mnt + "/medium.log", 65536, &error), readFile(orig("medium.log")));

  // A chunk-table entry pointing far past the fork.
  uint8_t entry[8] = {0, 0, 0, 0x7F, 0x10, 0, 0, 0};
  ASSERT_EQ(platform::setxattr((tree + "/medium.log").c_str(), kResourceForkXattrName, entry, 8, 264 + 8 * 3, 0), 0);
  auto setHeader = [&](const char *name, uint32_t type) {
    std::string path = tree + "/" + name;
    uint8_t header[16];
    ASSERT_EQ(platform::getxattr(path.c_str(), kDecmpfsXattrName, header, 16, 0, 0), 16);
    memcpy(header + 4, &type, 4);
    std::vector<uint8_t> whole(4000);
    ssize_t size = platform::getxattr(path.c_str(), kDecmpfsXattrName, whole.data(), whole.size(), 0, 0);
    ASSERT_GE(size, 16);
    memcpy(whole.data(), header, 16);
    ASSERT_EQ(platform::setxattr(path.c_str(), kDecmpfsXattrName, whole.data(), static_cast<size_t>(size), 0, 0), 0);
  };
  setHeader("exact64k.log", 5);
  setHeader("sub/owned.log", 9);
  // Type 3 data that is not a deflate stream.
  std::vector<uint8_t> type3(4000);
  ssize_t size = platform::getxattr((tree + "/tiny.txt").c_str(), kDecmpfsXattrName, type3.data(), type3.size(), 0, 0);
  ASSERT_GT(size, 20);
  memset(type3.data() + 16, 0x33, static_cast<size_t>(size) - 16);
  ASSERT_EQ(platform::setxattr((tree + "/tiny.txt").c_str(), kDecmpfsXattrName, type3.data(),
                               static_cast<size_t>(size), 0, 0),
            0);

  for (const char *name : {"medium.log", "exact64k.log", "sub/owned.log", "tiny.txt"}) {
    std::vector<uint8_t> got = readAll(mnt + "/" + name, 1 << 20, &error);
    EXPECT_EQ(error, EIO) << name;
    std::vector<uint8_t> expected = readFile(orig(name));
    EXPECT_LE(got.size(), 3u * 65536) << name;
    EXPECT_TRUE(std::equal(got.begin(), got.end(), expected.begin())) << name << ": what came before is right";
  }
  EXPECT_TRUE(alive(mount.pid()));
  EXPECT_EQ(readAll(mnt + "/big.log", 1 << 20, &error), readFile(orig("big.log")));
  EXPECT_EQ(error, 0);
  EXPECT_EQ(checksums(mnt + "/sub/deeper"), checksums(orig("sub/deeper")));

  Finished end = mount.stop();
  EXPECT_EQ(end.status, 0);
  EXPECT_THAT(end.err, HasSubstr("/medium.log: chunk 3 of 17 cannot be decoded"));
  EXPECT_THAT(end.err, HasSubstr("/exact64k.log: cannot be read: it is compressed with type 5, which this build cannot decode"));
  EXPECT_THAT(end.err, HasSubstr("/sub/owned.log: cannot be read: it is compressed with type 9"));
  EXPECT_THAT(end.err, HasSubstr("/tiny.txt: chunk 0 of 1 cannot be decoded"));
}

TEST_F(PlzcMount, ReadOnlyMountRefusesWritesAndLeavesTheTreeCompressed) {
  std::string tree = compressedTree("tree");
  Mount mount(tree, mountPoint(), {"ro"});
  ASSERT_TRUE(mount.up());
  int fd = open((mountPoint() + "/medium.log").c_str(), O_RDWR);
  EXPECT_EQ(fd, -1);
  EXPECT_EQ(errno, EROFS);
  EXPECT_EQ(mkdir((mountPoint() + "/new").c_str(), 0755), -1);
  platform::Stat st;
  ASSERT_EQ(platform::stat((tree + "/medium.log").c_str(), &st), 0);
  EXPECT_EQ(st.st_flags & kFlagCompressed, kFlagCompressed);
  int error = 0;
  EXPECT_EQ(readAll(mountPoint() + "/medium.log", 65536, &error), readFile(orig("medium.log")));
}

TEST_F(PlzcMount, InTheBackgroundItReturnsOnceTheMountIsUp) {
  std::string tree = compressedTree("tree");
  Finished started = plzc({"mount", tree, mountPoint()});
  ASSERT_EQ(started.status, 0) << started.err;
  bool up = isMounted(mountPoint());
  EXPECT_TRUE(up) << "plzc returned before the mount was usable";
  int error = 0;
  if (up) {
    EXPECT_EQ(readAll(mountPoint() + "/big.log", 1 << 20, &error), readFile(orig("big.log")));
  }
  int status = -1;
  shell("fusermount3 -u " + q(mountPoint()), &status);
  EXPECT_EQ(status, 0);
  // The server leaves with its mount.
  auto end = Clock::now() + std::chrono::seconds(10);
  std::string left;
  do {
    left = shell("pgrep -f -x '.*plzc mount " + tree + " " + mountPoint() + "'");
    if (left.empty()) break;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  } while (Clock::now() < end);
  EXPECT_EQ(left, "") << "the server outlived its mount";
  if (!left.empty()) kill(std::stoi(left), SIGKILL);
}

TEST_F(PlzcMount, TermAndInterruptUnmountCleanly) {
  std::string tree = compressedTree("tree");
  for (int number : {SIGTERM, SIGINT}) {
    Mount mount(tree, mountPoint());
    ASSERT_TRUE(mount.up());
    mount.signal(number);
    auto end = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < end && alive(mount.pid())) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_FALSE(isMounted(mountPoint())) << strsignal(number);
    Finished finished = mount.stop();
    EXPECT_EQ(finished.status, 0) << strsignal(number) << ": " << finished.err;
  }
}

TEST_F(PlzcMount, FailuresAreExplained) {
  std::string tree = compressedTree("tree");
  Finished notDir = plzc({"mount", tree + "/big.log", mountPoint()});
  EXPECT_EQ(notDir.status, 1);
  EXPECT_THAT(notDir.err, HasSubstr("big.log: not a directory"));
  Finished missing = plzc({"mount", tree});
  EXPECT_EQ(missing.status, 2);
  EXPECT_THAT(missing.err, HasSubstr("missing DIR or MOUNTPOINT"));
  Finished badOption = plzc({"mount", "-o", "cache_size=lots", tree, mountPoint()});
  EXPECT_EQ(badOption.status, 2);
  EXPECT_THAT(badOption.err, HasSubstr("cache_size"));

  // No FUSE device: a private mount namespace with an empty /dev, the scratch volume put back.
  int status = -1;
  std::string keep = "/tmp/plzc-mount-test-" + std::to_string(getpid());
  std::string out = shell("mkdir -p " + keep + " && unshare -m sh -c 'mount --make-rprivate / && mount --bind /dev/shm " +
                              keep + " && mount -t tmpfs none /dev && mkdir /dev/shm && mount --bind " + keep +
                              " /dev/shm && exec " + plzcBinary() + " mount " + q(tree) + " " + q(mountPoint()) + "'",
                          &status);
  rmdir(keep.c_str());
  EXPECT_EQ(status, 1) << out;
  EXPECT_THAT(out, HasSubstr("/dev/fuse: No such file or directory"));

  // A user who may not mount there (but may read the tree).
  chmod(dir.path().c_str(), 0755);
  out = shell("setpriv --reuid=65534 --regid=65534 --clear-groups " + plzcBinary() + " mount -f " + q(tree) +
                  " " + q(mountPoint()),
              &status);
  EXPECT_EQ(status, 1) << out;
  EXPECT_THAT(out, HasSubstr("cannot mount"));
  EXPECT_FALSE(isMounted(mountPoint()));

  Finished help = plzc({"--help"});
  EXPECT_THAT(help.out, HasSubstr("mount [-f] [-o OPTION[,...]] DIR MOUNTPOINT"));
}

}  // namespace
