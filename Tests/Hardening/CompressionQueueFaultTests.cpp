// Existing files compressed in place through a compression queue, with one failing system call
// at a time: every call index of every kind that CompressFile and the finish make in a clean
// run, with every errno that call can return.
#include <fcntl.h>
#include <sys/time.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

#include "Common/StreamCompressor.h"
#include "Common/ThrottlingAllocator.h"
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
  std::vector<uint8_t> bytes;
  bool ignoreXattrErrors;
  uint32_t flags;
  const char *cleanEnd;  // "compressed" or "plain" (left alone)
};

// The messages of the compression queue itself, one of which a failed CompressFile prints.
bool compressFileReported(const std::string &printed, const std::string &path) {
  return contains(printed, "waitThenDupOrOpen '" + path + "': ") || contains(printed, "open '" + path + "': ") ||
         contains(printed, "WriteToStreamCompressor(" + path + "): ") || contains(printed, "read(" + path + "): ") ||
         contains(printed, "CloseStreamCompressor: ");
}

struct Pass {
  int compressed = 0;  // CompressFile's result
  std::string printed;
  FileState state;
};

class CompressionQueueFaults : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    throttlingSetTooManyFilesWait(10);  // faults make EMFILE on purpose; do not wait 5 s for each
  }

  void sweep(const Case &c) {
    std::optional<Pass> clean;
    SweepStats stats = sweepFaults([&](FaultWindow &window) {
      Pass pass = runOnce(c, window);
      check(c, window.fault(), pass, &clean);
    });
    printf("%s: %d faulty runs over %llu calls of the clean run\n", c.name, stats.runs,
           static_cast<unsigned long long>(stats.callsInCleanRun));
  }

  Pass runOnce(const Case &c, FaultWindow &window) {
    Pass pass;
    PVMutableDictionaryRef options = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    PVDictionarySetValue(options, kPLZCIgnoreXattrErrors, c.ignoreXattrErrors ? kPVBooleanTrue : kPVBooleanFalse);
    PVMutableArrayRef none = PVArrayCreateMutable(0);  // no system rules: every file is offered
    PVDictionarySetValue(options, kPLZCCompressionSystemRulesKey, none);
    PVRelease(none);
    StreamCompressorQueue *queue = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, options);
    PVRelease(options);
    EXPECT_NE(queue, nullptr);
    if (!queue) return pass;
    std::string path = writeFile(dir.file(c.name), c.bytes);
    EXPECT_EQ(platform::chflags(path.c_str(), c.flags), 0);
    EXPECT_EQ(utimes(path.c_str(), kTimes), 0);
    {
      FdCapture out(1), err(2);
      window.open();
      pass.compressed = CompressFile(queue, path.c_str(), dir.path().c_str());
      FinishCompressionAndCleanUp(queue);
      window.close();
      pass.printed = err.text();
    }
    pass.state = inspect(path);
    unlink(path.c_str());
    return pass;
  }

  void check(const Case &c, const Fault *fault, const Pass &pass, std::optional<Pass> *clean) {
    const std::string &printed = pass.printed;
    const FileState &state = pass.state;
    std::string path = dir.file(c.name);
    std::string where = whereDataLives(state, c.bytes);
    EXPECT_NE(where, "") << "the file's data is lost; printed:\n" << printed;
    EXPECT_EQ(malformedDiagnostic(printed), "");
    if (state.flags & kCompressedFlag) {
      EXPECT_EQ(where, "compressed") << printed;
    }
    bool finishFailed = contains(printed, "FinishStreamCompressorQueue: ");
    bool compressedWhole = where == "compressed" && state.flags == (c.flags | kCompressedFlag) &&
                           sameMicroseconds(state.modified, kTimes[1]);
    bool untouched = where == "plain" && !state.hasHeader && !state.hasFork && state.flags == c.flags &&
                     sameMicroseconds(state.modified, kTimes[1]);
    if (!fault || (fault->error == EINTR && restartedAfterInterrupt(fault->call))) {
      EXPECT_EQ(pass.compressed, 1);
      EXPECT_FALSE(finishFailed);
      EXPECT_EQ(where, c.cleanEnd);
      EXPECT_TRUE(where == "compressed" ? compressedWhole : untouched) << where << " flags " << state.flags;
      EXPECT_EQ(printed, "");
      return;
    }
    if (!compressedWhole && !untouched) {
      if (where == "compressed" && state.flags != (c.flags | kCompressedFlag)) halfDone.add("compressed, flags not restored");
      else if (where == "compressed") halfDone.add("compressed, times not restored");
      else if (where == "plain" && state.flags != c.flags) halfDone.add("plain, flags not restored");
      else halfDone.add(where);
    }
    bool deviates = !(where == c.cleanEnd && (compressedWhole || untouched)) || pass.compressed != 1 || finishFailed;
    // The rules answer "do not compress" to every failure, silently: the file is then left alone.
    bool silentlyLeftAlone = fault->call == sys::Call::Malloc && untouched && pass.compressed == 1 && !finishFailed;
    if (deviates && !silentlyLeftAlone) {
      EXPECT_TRUE(namesCause(printed, fault->error) || contains(printed, "Error: initCompressor failed") ||
                  contains(printed, "Error: _InitCompressionRules failed (malformed plist?)"))
          << "a failure that changed the outcome was not reported with its cause (" << where << "); printed:\n"
          << printed;
    }
    if (pass.compressed == 0) {
      EXPECT_TRUE(compressFileReported(printed, path)) << printed;
    } else {
      EXPECT_EQ(pass.compressed, 1);
    }
    // An existing file ends compressed, or as it was, or (only with an error the finish
    // reports) with its compressed form stored but one last step missing.
    if (!compressedWhole && !untouched) {
      EXPECT_TRUE(finishFailed) << where << " flags " << state.flags << " with nothing recorded; printed:\n"
                                << printed;
    }
  }

  ScratchDir dir;
  HalfDoneStates halfDone;
};

TEST_F(CompressionQueueFaults, FileOfSeveralChunksWithFlags) {
  sweep({"text", compressibleBytes(140000, 1), false, kFlagHidden, "compressed"});
}

TEST_F(CompressionQueueFaults, FileOfSeveralChunksIgnoringAttributeErrors) {
  sweep({"text-ignoring", compressibleBytes(140000, 2), true, kFlagUserImmutable, "compressed"});
}

TEST_F(CompressionQueueFaults, SmallFileInTheHeaderAttribute) {
  sweep({"small", compressibleBytes(3000, 3), false, 0, "compressed"});
}

TEST_F(CompressionQueueFaults, IncompressibleFileIsLeftAlone) {
  sweep({"noise", randomBytes(100000, 4), false, kFlagHidden, "plain"});
}

}  // namespace
