// compressFile in place with one failing system call at a time: every call index of every kind
// the clean run makes, with every errno that call can return.
#include <fcntl.h>
#include <sys/time.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/CompressorRegistry.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
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
  bool verify = false;
  uint32_t flags = 0;             // the file's flags before
  std::vector<uint8_t> ownFork;   // a resource fork of its own: the file is refused
};

// Text and noise in alternating stripes: deflate halves it, so that a few chunks make a
// resource fork larger than one Linux attribute, stored in segments.
std::vector<uint8_t> halfCompressible(size_t count, uint32_t seed) {
  std::vector<uint8_t> text = compressibleBytes(count, seed), noise = randomBytes(count, seed + 1);
  for (size_t at = 0; at < count; at++)
    if ((at / 512) % 2) text[at] = noise[at];
  return text;
}

struct Outcome {
  int result;
  std::string where;
  uint32_t flags;
};

class CompressFileFaults : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }

  void sweep(const Case &c) {
    std::optional<Outcome> clean;
    SweepStats stats = sweepFaults([&](FaultWindow &window) { runOnce(c, window, &clean); });
    printf("%s: %d faulty runs over %llu calls of the clean run\n", c.name, stats.runs,
           static_cast<unsigned long long>(stats.callsInCleanRun));
  }

  void runOnce(const Case &c, FaultWindow &window, std::optional<Outcome> *clean) {
    std::string path = writeFile(dir.file(c.name), c.bytes);
    if (!c.ownFork.empty()) {
      ASSERT_EQ(platform::setxattr(path.c_str(), kResourceForkXattrName, c.ownFork.data(), c.ownFork.size(), 0, 0), 0);
    }
    ASSERT_EQ(platform::chflags(path.c_str(), c.flags), 0);
    ASSERT_EQ(utimes(path.c_str(), kTimes), 0);
    CompressorContext *ctx = initCompressor(c.types, nullptr, nullptr, nullptr, c.verify, 5, false);
    ASSERT_NE(ctx, nullptr);
    std::string printed;
    int result;
    {
      FdCapture out(1), err(2);  // type 4 reports a file that did not shrink on standard output
      window.open();
      result = compressFile(ctx, path.c_str(), nullptr);
      window.close();
      printed = err.text();
    }
    freeCompressor(ctx);
    FileState state = inspect(path);
    unlink(path.c_str());
    check(c, path, window.fault(), result, printed, state, clean);
  }

  void check(const Case &c, const std::string &path, const Fault *fault, int result, const std::string &printed,
             const FileState &state, std::optional<Outcome> *clean) {
    bool refused = !c.ownFork.empty();
    std::string where = whereDataLives(state, c.bytes);
    EXPECT_NE(where, "") << "the file's data is lost; printed:\n" << printed;
    EXPECT_EQ(malformedDiagnostic(printed), "");
    if (refused) {
      // Whatever fails, a file with its own resource fork keeps it and its data.
      EXPECT_EQ(result, -1);
      EXPECT_EQ(where, "plain");
      EXPECT_TRUE(state.fork == c.ownFork) << "the file's own resource fork was changed";
    } else if (state.hasFork && where == "plain") {
      halfDone.add("plain, with a resource fork left behind by a failed type-4 attempt");
    }
    if (where != "plain" && where != "compressed" && !where.empty()) halfDone.add(where);
    if (!fault) {
      EXPECT_EQ(result, refused ? -1 : 0) << printed;
      EXPECT_EQ(where, refused ? "plain" : "compressed");
      EXPECT_EQ(state.flags, refused ? c.flags : kCompressedFlag);
      EXPECT_TRUE(sameMicroseconds(state.modified, kTimes[1]));
      EXPECT_EQ(printed, "");
      *clean = Outcome{result, where, state.flags};
      return;
    }
    if (!clean->has_value()) return;
    const Outcome &expected = **clean;
    if (fault->error == EINTR && restartedAfterInterrupt(fault->call)) {
      // Restarted: nothing may differ from the clean run.
      EXPECT_EQ(result, expected.result);
      EXPECT_EQ(where, expected.where);
      EXPECT_EQ(state.flags, expected.flags);
      EXPECT_EQ(printed, "");
      return;
    }
    bool deviates = result != expected.result || where != expected.where || state.flags != expected.flags ||
                    !sameMicroseconds(state.modified, kTimes[1]);
    if (deviates) {
      EXPECT_TRUE(namesCause(printed, fault->error) || printed.find("Unable to checksum file") != std::string::npos)
          << "a failure that changed the outcome was not reported with its cause; printed:\n" << printed;
    }
    if (result == 0) {
      // Compressed: the attributes hold the whole file; what the last steps could not finish is
      // reported by them.
      ASSERT_TRUE(state.fromAttributes && *state.fromAttributes == c.bytes) << "compressFile said 0: " << where;
      if (!state.dataFork.empty()) {
        // Kept when the form could not be made durable, the file marked, or the data cut.
        bool explained = false;
        for (const char *step : {"fsync ", "chflags ", "truncate "}) {
          explained = explained || printed.find(step + path + ": " + strerror(fault->error)) != std::string::npos;
        }
        EXPECT_TRUE(explained) << printed;
      }
      if (state.flags != kCompressedFlag) {
        EXPECT_NE(printed.find("chflags " + path + ": " + strerror(fault->error)), std::string::npos) << printed;
      }
      if (!sameMicroseconds(state.modified, kTimes[1])) {
        EXPECT_NE(printed.find("utimes " + path + ": " + strerror(fault->error)), std::string::npos) << printed;
      }
      return;
    }
    EXPECT_EQ(result, -1);
    bool untouched = state.dataFork == c.bytes && state.flags == c.flags && sameMicroseconds(state.modified, kTimes[1]);
    if (untouched) return;
    // Only a verification after the file was compressed leaves it changed with -1.
    EXPECT_TRUE(c.verify) << "compressFile failed and changed the file: " << where << "\n" << printed;
    EXPECT_TRUE(printed.find("Error: Unable to checksum file '" + path + "' after compression.") != std::string::npos ||
                printed.find("Error: File data after compression is different than before for file '" + path + "'.") !=
                    std::string::npos)
        << printed;
  }

  ScratchDir dir;
  HalfDoneStates halfDone;
};

TEST_F(CompressFileFaults, Type3FileWithFlags) {
  sweep({"small", "3", compressibleBytes(3000, 1), false, kFlagHidden, {}});
}

TEST_F(CompressFileFaults, Type4FileOfSeveralChunks) {
  sweep({"chunks", "4", compressibleBytes(140000, 2), false, 0, {}});
}

TEST_F(CompressFileFaults, Type4FileWithASegmentedForkAndVerification) {
  sweep({"segmented", "3,4", halfCompressible(180000, 3), true, kFlagUserImmutable, {}});
}

TEST_F(CompressFileFaults, FileWithItsOwnResourceForkIsNeverTouched) {
  sweep({"forked", "4", compressibleBytes(150000, 4), false, 0, randomBytes(3000, 5)});
}

}  // namespace
