// decompressFile with one failing system call at a time: every call index of every kind the
// clean run makes, with every errno that call can return.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/CompressorRegistry.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Support/FaultSweep.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

constexpr struct timeval kTimes[2] = {{1000, 250000}, {2000, 500000}};

struct Case {
  const char *name;
  const char *types;
  std::vector<uint8_t> bytes;
  bool verify;
  int forceUserSpace;
  uint32_t flags;  // besides the compressed flag
  mode_t mode;
};

class DecompressFileFaults : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }

  // The compressed file every run starts from, made once.
  std::string makeTemplate(const Case &c) {
    std::string path = writeFile(dir.file(std::string(c.name) + ".template"), c.bytes);
    CompressorContext *ctx = initCompressor(c.types, nullptr, nullptr, nullptr, false, 5, false);
    EXPECT_EQ(compressFile(ctx, path.c_str(), nullptr), 0);
    freeCompressor(ctx);
    EXPECT_EQ(platform::chflags(path.c_str(), kCompressedFlag | c.flags), 0);
    EXPECT_EQ(utimes(path.c_str(), kTimes), 0);
    EXPECT_EQ(chmod(path.c_str(), c.mode), 0);
    return path;
  }

  void sweep(const Case &c) {
    std::string model = makeTemplate(c);
    ASSERT_FALSE(HasFailure());
    SweepStats stats = sweepFaults([&](FaultWindow &window) { runOnce(c, model, window); });
    printf("%s: %d faulty runs over %llu calls of the clean run\n", c.name, stats.runs,
           static_cast<unsigned long long>(stats.callsInCleanRun));
  }

  void runOnce(const Case &c, const std::string &model, FaultWindow &window) {
    std::string path = dir.file(c.name);
    copyFileWithAttributes(model, path);
    std::string printed;
    int result;
    {
      FdCapture out(1), err(2);
      window.open();
      result = decompressFile(path.c_str(), c.verify, c.forceUserSpace);
      window.close();
      printed = err.text();
    }
    FileState state = inspect(path);
    chmod(path.c_str(), 0644);
    unlink(path.c_str());
    check(c, path, window.fault(), result, printed, state);
  }

  void check(const Case &c, const std::string &path, const Fault *fault, int result, const std::string &printed,
             const FileState &state) {
    std::string where = whereDataLives(state, c.bytes);
    EXPECT_NE(where, "") << "the file's data is lost; printed:\n" << printed;
    EXPECT_EQ(malformedDiagnostic(printed), "");
    // Verification reads the file after its times were restored, which moves the access time.
    bool decompressed = where == "plain" && !state.hasHeader && !state.hasFork && state.flags == c.flags &&
                        (state.mode & 07777) == c.mode && sameMicroseconds(state.modified, kTimes[1]) &&
                        (c.verify || sameMicroseconds(state.accessed, kTimes[0]));
    if (where != "plain" && where != "compressed" && !where.empty()) halfDone.add(where);
    if (where == "plain" && state.hasFork) halfDone.add("plain, with the resource fork left behind");
    if ((state.mode & 07777) != c.mode) halfDone.add("mode left widened for the work");
    if (where == "compressed" && state.flags != (kCompressedFlag | c.flags))
      halfDone.add("compressed, with the other flags cleared for the work");
    if (!fault || (fault->error == EINTR && restartedAfterInterrupt(fault->call))) {
      EXPECT_EQ(result, 0) << printed;
      EXPECT_TRUE(decompressed) << where << ", flags " << state.flags << ", mode " << std::oct << state.mode << std::dec
                                << ", times " << state.accessed.tv_sec << "." << state.accessed.tv_nsec << " "
                                << state.modified.tv_sec << "." << state.modified.tv_nsec << " attrs " << state.hasHeader << state.hasFork;
      EXPECT_EQ(printed, "");
      return;
    }
    if (result == 0) {
      // The failure was absorbed: the file must be exactly as a clean run leaves it.
      EXPECT_TRUE(decompressed) << where << ", flags " << state.flags << "\n" << printed;
      return;
    }
    EXPECT_EQ(result, -1);
    // Reported with the path (the first stat's message has none) and, where the step's message
    // carries one, the cause.
    bool firstStat = contains(printed, "Error: stat failed: ");
    EXPECT_TRUE(firstStat || contains(printed, "'" + path + "'")) << printed;
    bool causeless = contains(printed, "' was still compressed after attempting decompression.") ||
                     contains(printed, "' changed flags attempting decompression.") ||
                     contains(printed, "Error: Unable to checksum file '") ||
                     contains(printed, "Error: File data after decompression is different");
    EXPECT_TRUE(causeless || namesCause(printed, fault->error)) << printed;
    if (firstStat) {
      EXPECT_EQ(where, "compressed");  // nothing was done yet
    }
  }

  ScratchDir dir;
  HalfDoneStates halfDone;
};

TEST_F(DecompressFileFaults, Type3FileThroughTheLibrary) {
  sweep({"small", "3", compressibleBytes(3000, 1), false, 0, kFlagHidden, 0644});
}

TEST_F(DecompressFileFaults, Type4FileForcedIntoUserSpaceWithVerification) {
  sweep({"chunks", "4", compressibleBytes(140000, 2), true, 1, 0, 0644});
}

TEST_F(DecompressFileFaults, ReadOnlyFileWithFlagsAsRoot) {
  sweep({"readonly-root", "4", compressibleBytes(140000, 3), false, 1, kFlagUserImmutable | kFlagHidden, 0444});
}

// The same file decompressed by an ordinary user, who must widen the mode to change the flag
// word and restore it afterwards. As root, the test runs itself again in a fresh process that
// gives up root first (the library notes once per process whether it runs as root).
TEST_F(DecompressFileFaults, ReadOnlyFileWithFlagsAsAnOrdinaryUser) {
  if (!runningAsRoot()) {
    sweep({"readonly-user", "4", compressibleBytes(140000, 4), true, 0, kFlagUserImmutable | kFlagHidden, 0444});
    return;
  }
  fflush(nullptr);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (setgid(65534) != 0 || setuid(65534) != 0) _exit(2);
    const char *test = ::testing::UnitTest::GetInstance()->current_test_info()->name();
    std::string filter = std::string("--gtest_filter=DecompressFileFaults.") + test;
    execl("/proc/self/exe", "DecompressFileFaultTests", filter.c_str(), static_cast<char *>(nullptr));
    _exit(3);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "the sweep as an ordinary user failed (see above)";
}

}  // namespace
