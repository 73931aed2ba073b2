// plzc compress, compress --async, decompress and install when the process runs short of
// descriptors, of address space, or of room on the volume: each run ends (no hang, no crash),
// a failure names the file and the cause with exit status 1, and no file loses data. The
// limits are set in the child (setrlimit before exec), the volumes are real small tmpfs mounts.
#include <sys/resource.h>
#include <sys/stat.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <sstream>

#include "Support/PlzcProcess.h"
#include "Support/TestSupport.h"
#include "Support/TreeSnapshot.h"

using namespace plzctest;
using ::testing::HasSubstr;

namespace {

constexpr uint64_t kMiB = 1 << 20;
constexpr int kTimeoutSeconds = 300;  // far beyond any of these runs; a hang is killed

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;  // sanitizers reserve terabytes of address space at start
#else
constexpr bool kSanitized = false;
#endif

enum class Command { Compress, CompressAsync, Decompress, Install };

const char *nameOf(Command command) {
  switch (command) {
    case Command::Compress: return "compress";
    case Command::CompressAsync: return "compress --async";
    case Command::Decompress: return "decompress";
    case Command::Install: return "install";
  }
  return "?";
}

void copyTree(const std::string &from, const std::string &to) {
  int status = -1;
  std::string output = runCommand("cp -a '" + from + "' '" + to + "' 2>&1", &status);
  ASSERT_EQ(status, 0) << output;
}

// The files named by the tool as failed ("plzc: failed: PATH", "plzc: PATH: cause"), relative to
// root.
std::vector<std::string> namedUnder(const std::string &err, const std::string &root) {
  std::vector<std::string> named;
  std::istringstream lines(err);
  for (std::string line; std::getline(lines, line);) {
    size_t at = line.find(root + "/");
    if (line.rfind("plzc: ", 0) != 0 || at == std::string::npos) continue;
    std::string rest = line.substr(at + root.size() + 1);
    named.push_back(rest.substr(0, rest.find(": ")));
  }
  return named;
}

// What every run must show: it ended by itself with 0 or 1, and a failure says which file and
// why. Returns the files the run named as failed, relative to the root they are under.
std::vector<std::string> expectCleanEnd(const Finished &run, const std::vector<std::string> &roots,
                                        const std::string &cause, const std::string &what) {
  EXPECT_FALSE(run.timedOut) << what << " hung:\n" << run.err;
  EXPECT_THAT(run.status, ::testing::AnyOf(0, 1)) << what << ":\n" << run.err;
  std::vector<std::string> named;
  for (const std::string &root : roots) {
    std::vector<std::string> under = namedUnder(run.err, root);
    named.insert(named.end(), under.begin(), under.end());
  }
  if (run.status == 1) {
    EXPECT_FALSE(named.empty()) << what << " failed without naming a file:\n" << run.err;
    EXPECT_THAT(run.err, HasSubstr(cause)) << what;
  }
  return named;
}

ChildSetup withTimeout(ChildSetup setup) {
  setup.timeoutSeconds = kTimeoutSeconds;
  return setup;
}

// Runs one command under the limits on its own copy of source (for install: from source into a
// new directory under target), then checks that nothing was lost. Returns the finished run.
Finished runUnderLimits(Command command, const std::string &source, const TreeSnapshot &before,
                        const std::string &target, const ChildSetup &limits, const std::string &cause) {
  ChildSetup setup = withTimeout(limits);
  std::string what = std::string("plzc ") + nameOf(command);
  Finished run;
  if (command == Command::Install) {
    run = plzc({"install", "-j", "2", "--no-progress", source, target}, setup);
    std::vector<std::string> named = expectCleanEnd(run, {source, target}, cause, what);
    expectTreeHolds(source, before);
    // What the run did not name as failed (a file, or a directory it could not read) arrived
    // whole.
    expectTreeHolds(target, before, named);
    return run;
  }
  copyTree(source, target);
  if (command == Command::Decompress) {
    Finished compressed = plzc({"compress", "-j", "2", target});
    EXPECT_EQ(compressed.status, 0) << compressed.err;
  }
  std::vector<std::string> args = {"compress", "-j", "2", "--no-progress", target};
  if (command == Command::CompressAsync) args.insert(args.begin() + 1, "--async");
  if (command == Command::Decompress) args[0] = "decompress";
  run = plzc(args, setup);
  expectCleanEnd(run, {target}, cause, what);
  // In place, a file that failed is left as it was: every file keeps its data.
  expectTreeHolds(target, before);
  return run;
}

const Command kCommands[] = {Command::Compress, Command::CompressAsync, Command::Decompress, Command::Install};

class ResourceLimits : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }
  ScratchDir dir;
};

// With a soft limit of 64 the budgets wait for descriptors instead of failing: every command
// succeeds, soft limit raisable or not.
TEST_F(ResourceLimits, DescriptorLimitOf64IsWaitedOn) {
  std::string source = dir.file("src");
  writeMixedTree(source, 400, 2 * kMiB, 1);
  TreeSnapshot before = snapshotTree(source);
  struct {
    rlim_t soft, hard;
  } limits[] = {{64, RLIM_INFINITY}, {64, 64}};
  int round = 0;
  for (auto limit : limits) {
    ChildSetup setup;
    setup.limits = {{RLIMIT_NOFILE, limit.soft, limit.hard}};
    for (Command command : kCommands) {
      SCOPED_TRACE(std::string(nameOf(command)) + " with hard limit " + std::to_string(limit.hard));
      std::string target = dir.file("run" + std::to_string(round++));
      Finished run = runUnderLimits(command, source, before, target, setup, strerror(EMFILE));
      EXPECT_EQ(run.status, 0) << run.err;
    }
  }
}

// With 16 descriptors in all the tool's own files and the pipeline's cannot all be open: runs
// may fail, but only file by file, by name, with the cause.
TEST_F(ResourceLimits, DescriptorsRunningOutFailByName) {
  // UndefinedBehaviorSanitizer opens a pipe to check memory before it trusts a dynamic type;
  // with no descriptor left it reports objects as invalid and stops the sanitized plzc.
  if (kSanitized) GTEST_SKIP() << "a sanitized plzc needs descriptors of its own";
  std::string source = dir.file("src");
  writeMixedTree(source, 300, 512 * 1024, 2);
  TreeSnapshot before = snapshotTree(source);
  ChildSetup setup;
  setup.limits = {{RLIMIT_NOFILE, 16, 16}};
  int round = 0, failed = 0;
  for (Command command : kCommands) {
    SCOPED_TRACE(nameOf(command));
    Finished run = runUnderLimits(command, source, before, dir.file("run" + std::to_string(round++)), setup,
                                  strerror(EMFILE));
    failed += run.status != 0;
  }
  std::cout << failed << " of 4 commands failed for want of descriptors\n";
}

// Under an address-space cap the memory budget shrinks to fit (the cap less what the rest of
// the process needs, at least 100 MiB): files larger than half the budget wait for each other
// instead of failing.
TEST_F(ResourceLimits, AddressSpaceCapIsWaitedOn) {
  if (kSanitized) GTEST_SKIP() << "a sanitized plzc cannot start under an address-space limit";
  std::string source = dir.file("src");
  writeMixedTree(source, 60, 4 * kMiB, 3, 2, 45 * kMiB);
  TreeSnapshot before = snapshotTree(source);
  ChildSetup setup;
  setup.limits = {{RLIMIT_AS, 800 * kMiB, RLIM_INFINITY}};
  int round = 0;
  for (Command command : kCommands) {
    SCOPED_TRACE(nameOf(command));
    Finished run = runUnderLimits(command, source, before, dir.file("run" + std::to_string(round++)), setup,
                                  strerror(ENOMEM));
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_LT(run.maxRssKiB, 800 * 1024);
  }
}

// Below what the budget needs, allocations fail: the files concerned fail by name, the rest is
// done, nothing crashes.
TEST_F(ResourceLimits, AddressSpaceRunningOutFailsByName) {
  if (kSanitized) GTEST_SKIP() << "a sanitized plzc cannot start under an address-space limit";
  std::string source = dir.file("src");
  writeMixedTree(source, 60, 4 * kMiB, 4, 1, 40 * kMiB);
  TreeSnapshot before = snapshotTree(source);
  ChildSetup setup;
  setup.limits = {{RLIMIT_AS, 160 * kMiB, RLIM_INFINITY}};
  int round = 0, failed = 0;
  for (Command command : kCommands) {
    SCOPED_TRACE(nameOf(command));
    Finished run = runUnderLimits(command, source, before, dir.file("run" + std::to_string(round++)), setup,
                                  strerror(ENOMEM));
    failed += run.status != 0;
  }
  std::cout << failed << " of 4 commands failed for want of address space\n";
}

// A volume that fills up part-way. On tmpfs, data counts against size= and extended
// attributes against the inode space (nr_inodes x 1 KiB): compression in place runs out of
// attribute room, decompression and installation out of data room.
struct FullVolumeCase {
  Command command;
  const char *mountOptions;
};

class FullVolume : public ResourceLimits, public ::testing::WithParamInterface<FullVolumeCase> {};

TEST_P(FullVolume, FailsByNameAndLosesNothing) {
  if (!runningAsRoot()) GTEST_SKIP() << "mounting a small tmpfs needs root";
  const FullVolumeCase &c = GetParam();
  std::string source = dir.file("src");
  // About 11 MiB, 2 MiB of it incompressible.
  writeMixedTree(source, 90, 1 * kMiB, 5, 4, 3 * kMiB / 2);
  TreeSnapshot before = snapshotTree(source);
  TemporaryMount volume = TemporaryMount::tmpfsWithOptions(dir.path(), c.mountOptions);
  ASSERT_TRUE(volume.mounted());
  std::string target = volume.mountPoint() + "/tree";
  if (c.command == Command::Decompress) {
    // Compressed elsewhere, then moved in with its attributes: it fits only while compressed.
    std::string staged = dir.file("staged");
    copyTree(source, staged);
    Finished compressed = plzc({"compress", staged});
    ASSERT_EQ(compressed.status, 0) << compressed.err;
    source = staged;
  }
  Finished run;
  if (c.command == Command::Decompress) {
    copyTree(source, target);
    run = plzc({"decompress", "-j", "2", "--no-progress", target}, withTimeout({}));
    expectCleanEnd(run, {target}, strerror(ENOSPC), "plzc decompress");
    // What did not fit is put back compressed, so that it takes no more room than before.
    EXPECT_THAT(run.err, HasSubstr("No space left on device; left compressed as it was"));
    expectTreeHolds(target, before);
  } else {
    run = runUnderLimits(c.command, source, before, target, ChildSetup{}, strerror(ENOSPC));
  }
  // The volume is small enough that the run must meet the full volume.
  EXPECT_EQ(run.status, 1) << run.err;
  EXPECT_THAT(run.err, HasSubstr(strerror(ENOSPC)));
}

INSTANTIATE_TEST_SUITE_P(Commands, FullVolume,
                         ::testing::Values(FullVolumeCase{Command::Compress, "size=64m,nr_inodes=300"},
                                           FullVolumeCase{Command::CompressAsync, "size=64m,nr_inodes=300"},
                                           FullVolumeCase{Command::Decompress, "size=3m"},
                                           FullVolumeCase{Command::Install, "size=1m"}),
                         [](const ::testing::TestParamInfo<FullVolumeCase> &info) {
                           switch (info.param.command) {
                             case Command::Compress: return std::string("Compress");
                             case Command::CompressAsync: return std::string("CompressAsync");
                             case Command::Decompress: return std::string("Decompress");
                             case Command::Install: return std::string("Install");
                           }
                           return std::string("Unknown");
                         });

}  // namespace
