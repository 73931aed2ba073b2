// New files written through a stream of a stream compressor queue, with one failing system call
// at a time: every call index of every kind that creating, writing, closing and finishing make
// in a clean run, with every errno that call can return.
#include <fcntl.h>
#include <sys/time.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

#include "Common/StreamCompressor.h"
#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Support/FaultSweep.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

constexpr struct timeval kTimes[2] = {{1000, 250000}, {2000, 500000}};
constexpr size_t kPiece = 32768;

struct Case {
  const char *name;  // also the file's name, which the rules see
  std::vector<uint8_t> bytes;
  bool ignoreXattrErrors;
  uint32_t flags;                // set by the caller before writing
  std::vector<uint8_t> ownFork;  // a resource fork the caller gave the file
  const char *cleanEnd;          // "compressed" or "plain"
  // The rules shipped with the library, read on the queue's first stream; otherwise no system
  // rules at all, so that the sweep spends its runs on the write-out.
  bool shippedRules = false;
};

bool isPrefix(const std::vector<uint8_t> &part, const std::vector<uint8_t> &whole) {
  return part.size() <= whole.size() && std::equal(part.begin(), part.end(), whole.begin());
}

// Messages of the pipeline that report a failure without naming its errno: each stands for a
// cause that an earlier line of the same run names, or for a step whose Part gives no cause.
bool reportedWithoutCause(const std::string &printed) {
  return contains(printed, "Error: _InitCompressionRules failed (malformed plist?)") ||
         contains(printed, "Error: initCompressor failed") || contains(printed, "Error: decompressData failed for ");
}

struct Pass {
  bool created = false;
  int64_t lastWrite = 0;
  int closed = 0;
  int finished = 0;
  int finishErrno = 0;
  std::string printed;
  FileState state;
};

class StreamWriteOutFaults : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    throttlingSetTooManyFilesWait(10);  // faults make EMFILE on purpose; do not wait 5 s for each
  }

  void sweep(const Case &c) {
    std::optional<Pass> clean;
    SweepStats stats = sweepFaults([&](FaultWindow &window) {
      Pass run = runOnce(c, window);
      check(c, window.fault(), run, &clean);
    });
    printf("%s: %d faulty runs over %llu calls of the clean run\n", c.name, stats.runs,
           static_cast<unsigned long long>(stats.callsInCleanRun));
  }

  Pass runOnce(const Case &c, FaultWindow &window) {
    Pass run;
    PVMutableDictionaryRef options = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    PVDictionarySetValue(options, kPLZCIgnoreXattrErrors, c.ignoreXattrErrors ? kPVBooleanTrue : kPVBooleanFalse);
    if (!c.shippedRules) {
      PVMutableArrayRef none = PVArrayCreateMutable(0);
      PVDictionarySetValue(options, kPLZCCompressionSystemRulesKey, none);
      PVRelease(none);
    }
    StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(options);
    PVRelease(options);
    EXPECT_NE(queue, nullptr);
    if (!queue) return run;
    std::string path = dir.file(c.name);
    int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
    EXPECT_GE(fd, 0);
    if (!c.ownFork.empty()) {
      EXPECT_EQ(platform::fsetxattr(fd, kResourceForkXattrName, c.ownFork.data(), c.ownFork.size(), 0, 0), 0);
    }
    EXPECT_EQ(platform::fchflags(fd, c.flags), 0);
    EXPECT_EQ(futimes(fd, kTimes), 0);
    {
      FdCapture out(1), err(2);
      window.open();
      ::StreamCompressor *stream =
          CreateStreamCompressor(fd, path.c_str(), dir.path().c_str(), queue, static_cast<int64_t>(c.bytes.size()));
      close(fd);  // the stream has its own descriptor
      run.created = stream != nullptr;
      if (stream) {
        for (size_t at = 0; at < c.bytes.size() && run.lastWrite >= 0; at += kPiece) {
          size_t count = std::min(kPiece, c.bytes.size() - at);
          run.lastWrite = WriteToStreamCompressor(stream, c.bytes.data() + at, count);
        }
        run.closed = CloseStreamCompressor(stream);
      }
      run.finished = FinishStreamCompressorQueue(queue);
      run.finishErrno = errno;
      window.close();
      run.printed = err.text();
    }
    run.state = inspect(path);
    unlink(path.c_str());
    return run;
  }

  void check(const Case &c, const Fault *fault, const Pass &run, std::optional<Pass> *clean) {
    const std::string &printed = run.printed;
    const FileState &state = run.state;
    std::string path = dir.file(c.name);
    std::string where = whereDataLives(state, c.bytes);
    uint32_t endFlags = c.flags | (where == "compressed" ? kCompressedFlag : 0);
    EXPECT_EQ(malformedDiagnostic(printed), "");
    if (!c.ownFork.empty()) {
      EXPECT_TRUE(state.fork == c.ownFork) << "the caller's resource fork was changed (" << state.fork.size() << " bytes); printed:\n" << printed;
    }
    // Never marked compressed without a compressed form that gives back the data.
    if (state.flags & kCompressedFlag) {
      EXPECT_EQ(where, "compressed") << printed;
    }
    if (!fault) {
      EXPECT_TRUE(run.created);
      EXPECT_EQ(run.closed, 0);
      EXPECT_EQ(run.finished, 0) << printed;
      EXPECT_EQ(where, c.cleanEnd) << printed;
      EXPECT_EQ(state.flags, endFlags);
      EXPECT_TRUE(sameMicroseconds(state.modified, kTimes[1]));
      EXPECT_FALSE(state.hasHeader && where == "plain");
      *clean = run;
      return;
    }
    if (!clean->has_value()) return;
    const Pass &expected = **clean;
    if (fault->error == EINTR && restartedAfterInterrupt(fault->call)) {
      EXPECT_EQ(run.finished, 0);
      EXPECT_EQ(where, c.cleanEnd);
      EXPECT_EQ(state.flags, expected.state.flags);
      EXPECT_EQ(printed, expected.printed);
      return;
    }
    bool complete = (where == "compressed" || (where == "plain" && !state.hasHeader)) && state.flags == endFlags &&
                    sameMicroseconds(state.modified, kTimes[1]);
    if (!complete && !where.empty() && where != "plain" && where != "compressed") halfDone.add(where);
    // The rules answer "do not compress" to every failure, silently: a file that then ends
    // plain and whole is a normal outcome.
    bool silentlyPlain = fault->call == sys::Call::Malloc && complete && where == "plain" && run.finished == 0;
    bool deviates = !complete || (where != c.cleanEnd && !silentlyPlain) || run.finished != 0 || !run.created;
    if (deviates) {
      EXPECT_TRUE(namesCause(printed, fault->error) || reportedWithoutCause(printed))
          << "a failure that changed the outcome was not reported with its cause (" << where << "); printed:\n"
          << printed;
    }
    if (!run.created) {
      // The pipeline took no part: the file is as the caller left it, and the caller knows.
      EXPECT_TRUE(state.dataFork.empty());
      EXPECT_TRUE(contains(printed, "dup: ") || contains(printed, "Error: cannot create a stream for " + path) ||
                  reportedWithoutCause(printed))
          << printed;
      return;
    }
    if (run.finished == 0) {
      // Nothing recorded: the file must be complete, compressed or plain.
      EXPECT_TRUE(complete) << where << " flags " << state.flags << "; printed:\n" << printed;
      if (where == "plain" && c.cleanEnd == std::string("compressed")) {
        halfDone.add("ended plain instead of compressed, no error recorded");
      }
      return;
    }
    // A recorded error: reported by the finish with its errno. A new file may then be short or
    // empty, but never holds bytes that were not written to it.
    EXPECT_EQ(run.finished, -1);
    EXPECT_TRUE(contains(printed, "Error: returning errno " + std::to_string(run.finishErrno) +
                                      " from FinishStreamCompressorQueue"))
        << printed;
    EXPECT_TRUE(where != "" || isPrefix(state.dataFork, c.bytes)) << "the data fork holds bytes never written";
    if (where == "") halfDone.add("error recorded, data fork holds only the first bytes of the file");
  }

  ScratchDir dir;
  HalfDoneStates halfDone;
};

TEST_F(StreamWriteOutFaults, CompressedFileWithTheCallersFlags) {
  sweep({"text", compressibleBytes(140000, 1), false, kFlagHidden, {}, "compressed"});
}

TEST_F(StreamWriteOutFaults, CompressedFileIgnoringAttributeErrors) {
  sweep({"text-ignoring", compressibleBytes(140000, 2), true, kFlagUserImmutable, {}, "compressed"});
}

TEST_F(StreamWriteOutFaults, SmallFileInTheHeaderAttribute) {
  sweep({"small", compressibleBytes(3000, 3), true, 0, {}, "compressed"});
}

TEST_F(StreamWriteOutFaults, IncompressibleFileWrittenPlainAfterTheAttempt) {
  sweep({"noise", randomBytes(100000, 4), false, 0, {}, "plain"});
}

TEST_F(StreamWriteOutFaults, FileTheRulesExcludeWrittenPlain) {
  sweep({"photo.jpg", compressibleBytes(100000, 5), false, kFlagHidden, {}, "plain", true});
}

TEST_F(StreamWriteOutFaults, FileWithItsOwnResourceForkEndsPlainWithIt) {
  sweep({"forked", compressibleBytes(140000, 6), false, 0, randomBytes(2000, 7), "plain"});
}

}  // namespace
