// Repair of half-done files: each state an interrupted compression or decompression can leave
// is built directly on a real file, repaired (or left alone), and checked byte for byte.
#include "Libraries/CompressData/Repair.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <map>
#include <optional>
#include <random>

#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;

namespace {

constexpr size_t kChunk = 65536;
constexpr uint32_t kForkTable = 264;  // the first chunk-table entry of a type-4 fork

std::vector<uint8_t> attribute(const std::string &path, const char *name) {
  ssize_t size = platform::getxattr(path.c_str(), name, nullptr, 0, 0, 0);
  if (size < 0) return {};
  std::vector<uint8_t> value(static_cast<size_t>(size));
  EXPECT_EQ(platform::getxattr(path.c_str(), name, value.data(), value.size(), 0, 0), size);
  return value;
}

void setAttribute(const std::string &path, const char *name, const std::vector<uint8_t> &value) {
  ASSERT_EQ(platform::setxattr(path.c_str(), name, value.data(), value.size(), 0, 0), 0) << strerror(errno);
}

uint32_t flagsOf(const std::string &path) {
  platform::Stat st;
  EXPECT_EQ(platform::stat(path.c_str(), &st), 0);
  return st.st_flags;
}

uint32_t le32(const uint8_t *bytes) {
  uint32_t value;
  memcpy(&value, bytes, 4);
  return value;
}

// Everything that repair could change: the data fork, every Linux attribute, the mode.
struct Snapshot {
  std::vector<uint8_t> data;
  std::map<std::string, std::vector<uint8_t>> attributes;
  mode_t mode = 0;
  bool operator==(const Snapshot &other) const {
    return data == other.data && attributes == other.attributes && mode == other.mode;
  }
};

Snapshot snapshot(const std::string &path) {
  Snapshot shot;
  shot.data = readFile(path);
  for (const std::string &name : linuxAttributeNames(path)) {
    std::vector<uint8_t> value(static_cast<size_t>(std::max<ssize_t>(getxattr(path.c_str(), name.c_str(), nullptr, 0), 0)));
    EXPECT_EQ(getxattr(path.c_str(), name.c_str(), value.data(), value.size()), static_cast<ssize_t>(value.size()));
    shot.attributes[name] = value;
  }
  struct stat st;
  EXPECT_EQ(stat(path.c_str(), &st), 0);
  shot.mode = st.st_mode;
  return shot;
}

int collect(int64_t, const void *bytes, int64_t count, void *context) {
  auto *out = static_cast<std::vector<uint8_t> *>(context);
  out->insert(out->end(), static_cast<const uint8_t *>(bytes), static_cast<const uint8_t *>(bytes) + count);
  return 0;
}

// The data every reader gets: decompressed when the file is marked compressed, else the data
// fork; nothing when a compressed file cannot be read.
std::optional<std::vector<uint8_t>> logical(const std::string &path) {
  if (!(flagsOf(path) & kCompressedFlag)) return readFile(path);
  FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
  if (!fh) return std::nullopt;
  std::vector<uint8_t> data;
  FdCapture quiet(2);
  int result = decompressData(fh, collect, &data);
  fh->close(fh);
  if (result != 0) return std::nullopt;
  return data;
}

// A compressed form as the library writes it: header attribute and resource fork.
struct Form {
  std::vector<uint8_t> header, fork;
};

// The form the library gives data with these types, taken from a twin file.
Form formOf(const ScratchDir &dir, const std::vector<uint8_t> &data, const char *types) {
  std::string twin = writeFile(dir.file("twin"), data);
  CompressorContext *ctx = initCompressor(types, nullptr, nullptr, nullptr, false, 5, false);
  EXPECT_NE(ctx, nullptr);
  EXPECT_EQ(compressFile(ctx, twin.c_str(), nullptr), 0);
  freeCompressor(ctx);
  EXPECT_EQ(flagsOf(twin), kCompressedFlag);
  Form form{attribute(twin, kDecmpfsXattrName), attribute(twin, kResourceForkXattrName)};
  unlink(twin.c_str());
  return form;
}

// The fork a type-4 compressor has written when it is killed after `chunks` chunks (and, with
// nextEntry, the table entry of the next one): count and table entries, chunks, no head.
std::vector<uint8_t> unfinishedFork(const std::vector<uint8_t> &fork, uint32_t chunks, bool nextEntry) {
  std::vector<uint8_t> cut(kForkTable, 0);
  memcpy(cut.data() + 260, fork.data() + 260, 4);
  uint32_t count = le32(fork.data() + 260);
  size_t end = kForkTable;
  for (uint32_t i = 0; i < chunks + (nextEntry ? 1 : 0) && i < count; i++) {
    size_t entry = kForkTable + 8 * i;
    cut.resize(std::max(cut.size(), entry + 8), 0);
    memcpy(cut.data() + entry, fork.data() + entry, 8);
    end = std::max(end, entry + 8);
    if (i < chunks) {
      size_t at = 260 + le32(fork.data() + entry), length = le32(fork.data() + entry + 4);
      cut.resize(std::max(cut.size(), at + length), 0);
      memcpy(cut.data() + at, fork.data() + at, length);
    }
  }
  return cut;
}

enum class End {
  Compressed,  // marked compressed, data fork empty, the compressed form on it
  Plain,       // not marked compressed, no header, the data in the data fork
  Unchanged,   // byte for byte, attribute for attribute, as it was
};

// What the states are built from: data of five chunks of text and its first 3000 bytes, with
// the forms the library gives them (type 4 as a fork, type 3 inside the header attribute).
struct Material {
  std::vector<uint8_t> data, small;
  Form type4, type3;
};

struct StateCase {
  const char *name;
  // Builds the state on path; returns the data its user had (what readers must get after).
  std::function<std::vector<uint8_t>(const std::string &path, const Material &m)> build;
  RepairVerdict verdict;
  End end;
  const char *stateText;  // part of the state reported
};
void PrintTo(const StateCase &c, std::ostream *out) { *out << c.name; }

// Puts a data fork, attributes and flags on a fresh file.
void make(const std::string &path, const std::vector<uint8_t> &dataFork, const std::vector<uint8_t> &header,
          const std::vector<uint8_t> &fork, uint32_t flags) {
  writeFile(path, dataFork);
  if (!fork.empty()) setAttribute(path, kResourceForkXattrName, fork);
  if (!header.empty()) setAttribute(path, kDecmpfsXattrName, header);
  ASSERT_EQ(platform::chflags(path.c_str(), flags), 0);
}

std::vector<uint8_t> prefix(const std::vector<uint8_t> &data, size_t count) { return {data.begin(), data.begin() + count}; }

std::vector<uint8_t> withByteFlipped(std::vector<uint8_t> bytes, size_t at) {
  bytes[at] ^= 0x40;
  return bytes;
}

const std::vector<uint8_t> kNone;

using M = const Material &;
using P = const std::string &;

const StateCase kStates[] = {
    // Clean files are never changed.
    {"PlainFile", [](P p, M m) { make(p, m.data, kNone, kNone, 0); return m.data; }, RepairVerdict::Clean,
     End::Unchanged, ""},
    {"CompressedFile", [](P p, M m) { make(p, kNone, m.type4.header, m.type4.fork, kCompressedFlag); return m.data; },
     RepairVerdict::Clean, End::Unchanged, ""},
    {"FileWithItsOwnResourceFork",
     [](P p, M m) { make(p, m.data, kNone, randomBytes(5000, 3), kFlagHidden); return m.data; }, RepairVerdict::Clean,
     End::Unchanged, ""},

    // compressFile (or a write-out) stopped between its steps.
    {"CompressorFinishedTheForkButNotTheHeader",
     [](P p, M m) { make(p, m.data, kNone, m.type4.fork, 0); return m.data; }, RepairVerdict::Repaired, End::Plain,
     "resource fork without its header"},
    {"CompressorKilledWhileWritingTheFork",
     [](P p, M m) { make(p, m.data, kNone, unfinishedFork(m.type4.fork, 2, false), 0); return m.data; },
     RepairVerdict::Repaired, End::Plain, "unfinished"},
    {"CompressorKilledBetweenAnEntryAndItsChunk",
     [](P p, M m) { make(p, m.data, kNone, unfinishedFork(m.type4.fork, 3, true), 0); return m.data; },
     RepairVerdict::Repaired, End::Plain, "unfinished"},
    {"CompressorKilledBetweenTheForkHeadAndItsMap",
     [](P p, M m) { make(p, m.data, kNone, prefix(m.type4.fork, m.type4.fork.size() - 50), 0); return m.data; },
     RepairVerdict::Repaired, End::Plain, "unfinished"},
    {"CompressorKilledAfterTheCount",
     [](P p, M m) { make(p, m.data, kNone, unfinishedFork(m.type4.fork, 0, false), 0); return m.data; },
     RepairVerdict::Repaired, End::Plain, "unfinished"},
    {"CompressionStoppedBeforeTheTruncation",
     [](P p, M m) { make(p, m.data, m.type4.header, m.type4.fork, 0); return m.data; }, RepairVerdict::Repaired,
     End::Plain, "beside the whole data fork"},
    {"CompressionStoppedBeforeTheFlag",
     [](P p, M m) { make(p, kNone, m.type4.header, m.type4.fork, 0); return m.data; }, RepairVerdict::Repaired,
     End::Compressed, "a whole compressed form beside an empty data fork"},
    {"Type3CompressionStoppedBeforeTheFlag",
     [](P p, M m) { make(p, kNone, m.type3.header, kNone, kFlagHidden); return m.small; }, RepairVerdict::Repaired,
     End::Compressed, "a whole compressed form beside an empty data fork"},
    // Not a crash: a type-4 attempt refused after its header was written leaves the header.
    {"HeaderLeftByALateRefusal", [](P p, M m) { make(p, m.data, m.type4.header, kNone, 0); return m.data; },
     RepairVerdict::Repaired, End::Plain, "beside the whole data fork"},
    {"StaleHeaderBesideADataForkOfAnotherSize",
     [](P p, M m) { make(p, prefix(m.data, 1000), m.type4.header, kNone, 0); return prefix(m.data, 1000); },
     RepairVerdict::Repaired, End::Plain, "beside a data fork of 1000"},
    {"StaleType3HeaderBesideTheFilesOwnFork",
     [](P p, M m) { make(p, m.small, m.type3.header, randomBytes(300, 4), 0); return m.small; },
     RepairVerdict::Repaired, End::Plain, "beside the whole data fork"},

    // decompressFile stopped between its steps.
    {"DecompressionCutShort",
     [](P p, M m) { make(p, prefix(m.data, 100000), m.type4.header, m.type4.fork, kCompressedFlag); return m.data; },
     RepairVerdict::Repaired, End::Plain, "cut short: 100000 of"},
    {"Type3DecompressionCutShort",
     [](P p, M m) { make(p, prefix(m.small, 1000), m.type3.header, kNone, kCompressedFlag); return m.small; },
     RepairVerdict::Repaired, End::Plain, "cut short: 1000 of 3000"},
    {"DecompressionWroteTheWholeData",
     [](P p, M m) { make(p, m.data, m.type4.header, m.type4.fork, kCompressedFlag); return m.data; },
     RepairVerdict::Repaired, End::Plain, "whole data also in the data fork"},
    {"EarlierDecompressionOrderStoppedBetweenHeaderAndFork",
     [](P p, M m) { make(p, m.data, kNone, m.type4.fork, kCompressedFlag); return m.data; }, RepairVerdict::Repaired,
     End::Plain, "marked compressed, with a compressed form's resource fork"},

    // States that cannot be proven: left exactly as they are.
    {"MarkedCompressedWithOtherDataInTheDataFork",
     [](P p, M m) {
       make(p, withByteFlipped(prefix(m.data, 70000), 69000), m.type4.header, m.type4.fork, kCompressedFlag);
       return m.data;
     },
     RepairVerdict::LeftAlone, End::Unchanged, "other data in its data fork"},
    {"MarkedCompressedWithADataForkLongerThanItsData",
     [](P p, M m) {
       std::vector<uint8_t> longer = m.data;
       longer.push_back('!');
       make(p, longer, m.type4.header, m.type4.fork, kCompressedFlag);
       return m.data;
     },
     RepairVerdict::LeftAlone, End::Unchanged, "longer than its data"},
    {"MarkedCompressedWithADamagedChunk",
     [](P p, M m) {
       size_t third = 260 + le32(m.type4.fork.data() + kForkTable + 16);
       make(p, kNone, m.type4.header, withByteFlipped(m.type4.fork, third + 100), kCompressedFlag);
       return m.data;
     },
     RepairVerdict::LeftAlone, End::Unchanged, "does not decode"},
    {"IncompleteFormBesideAnEmptyDataFork",
     [](P p, M m) { make(p, kNone, m.type4.header, unfinishedFork(m.type4.fork, 4, false), 0); return kNone; },
     RepairVerdict::LeftAlone, End::Unchanged, "incomplete compressed form"},
    {"HeaderSizeThatTheDataDoesNotHave",
     [](P p, M m) {
       std::vector<uint8_t> header = m.type3.header;
       header[8]++;  // the size field
       make(p, kNone, header, kNone, 0);
       return kNone;
     },
     RepairVerdict::LeftAlone, End::Unchanged, "incomplete compressed form"},
    {"UnfinishedForkOfOtherData",
     [](P p, M m) {
       make(p, withByteFlipped(m.data, 5), kNone, unfinishedFork(m.type4.fork, 2, false), 0);
       return withByteFlipped(m.data, 5);
     },
     RepairVerdict::LeftAlone, End::Unchanged, "unfinished"},
    {"MarkedCompressedWithoutAnyCompressedForm",
     [](P p, M m) { make(p, m.data, kNone, kNone, kCompressedFlag); return m.data; }, RepairVerdict::LeftAlone,
     End::Unchanged, "without compression header or resource fork"},
    {"HeaderWithoutTheMagic", [](P p, M m) { make(p, m.data, randomBytes(16, 5), kNone, 0); return m.data; },
     RepairVerdict::LeftAlone, End::Unchanged, "cannot read"},
};

class RepairState : public ::testing::TestWithParam<StateCase> {
 protected:
  ScratchDir dir;
};

TEST_P(RepairState, KeepsEveryByteReadersGetAndEndsInAProvenState) {
  const StateCase &c = GetParam();
  Material m;
  m.data = compressibleBytes(4 * kChunk + 12345, 1);
  m.small = prefix(m.data, 3000);
  m.type3 = formOf(dir, m.small, "3");
  m.type4 = formOf(dir, m.data, "4");
  ASSERT_EQ(m.type4.header.size(), 16u);
  ASSERT_EQ(le32(m.type4.fork.data() + 260), 5u);
  std::string path = dir.file("file");
  std::vector<uint8_t> truth = c.build(path, m);
  Snapshot before = snapshot(path);
  std::optional<std::vector<uint8_t>> readBefore = logical(path);

  // A dry run reports the same and changes nothing.
  RepairReport dry = repairFile(path.c_str(), true);
  EXPECT_EQ(dry.verdict, c.verdict) << dry.state << ": " << dry.action;
  EXPECT_TRUE(snapshot(path) == before);

  RepairReport report = repairFile(path.c_str(), false);
  EXPECT_EQ(report.verdict, c.verdict) << report.state << ": " << report.action;
  EXPECT_THAT(report.state, HasSubstr(c.stateText));
  if (c.verdict == RepairVerdict::LeftAlone) {
    EXPECT_THAT(report.action, HasSubstr("left alone: cannot be proven"));
  }

  // Repair never takes the user's data from readers who got it (every state the library leaves
  // reads whole, except new files caught before they were marked compressed), and a file not
  // left alone gives it to them.
  if (readBefore == truth) {
    EXPECT_TRUE(logical(path) == truth) << "the data readers got changed";
  }
  if (c.verdict != RepairVerdict::LeftAlone) {
    EXPECT_TRUE(logical(path) == truth) << "the data is not the user's";
  }
  switch (c.end) {
    case End::Unchanged:
      EXPECT_TRUE(snapshot(path) == before) << "the file changed";
      break;
    case End::Compressed:
      EXPECT_EQ(flagsOf(path), kCompressedFlag);
      EXPECT_TRUE(readFile(path).empty());
      break;
    case End::Plain:
      EXPECT_EQ(flagsOf(path) & kCompressedFlag, 0u);
      EXPECT_EQ(platform::getxattr(path.c_str(), kDecmpfsXattrName, nullptr, 0, 0, 0), -1);
      EXPECT_EQ(readFile(path), truth);
      break;
  }
  // Repaired means whole: a second look finds nothing to do.
  if (c.verdict == RepairVerdict::Repaired) {
    RepairReport again = repairFile(path.c_str(), false);
    EXPECT_EQ(again.verdict, RepairVerdict::Clean) << again.state << ": " << again.action;
  }
}

INSTANTIATE_TEST_SUITE_P(States, RepairState, ::testing::ValuesIn(kStates),
                         [](const ::testing::TestParamInfo<StateCase> &info) { return std::string(info.param.name); });

class Repair : public ::testing::Test {
 protected:
  ScratchDir dir;
};

TEST_F(Repair, CompressorForkGoesAndTheFilesOwnForkStays) {
  // A type-4 header beside the data fork comes off with its fork; a type-3 header's does not.
  std::vector<uint8_t> data = compressibleBytes(3 * kChunk, 2), own = randomBytes(2000, 3);
  Form type4 = formOf(dir, data, "4");
  std::string withCompressorFork = dir.file("a"), withOwnFork = dir.file("b");
  make(withCompressorFork, data, type4.header, type4.fork, 0);
  make(withOwnFork, data, type4.header, own, 0);
  EXPECT_EQ(repairFile(withCompressorFork.c_str(), false).verdict, RepairVerdict::Repaired);
  EXPECT_TRUE(attribute(withCompressorFork, kResourceForkXattrName).empty());
  EXPECT_EQ(repairFile(withOwnFork.c_str(), false).verdict, RepairVerdict::Repaired);
  EXPECT_EQ(attribute(withOwnFork, kResourceForkXattrName), own);
  EXPECT_EQ(readFile(withOwnFork), data);
}

TEST_F(Repair, SegmentsNoValueOwnsAreRemovedFromAnOtherwiseCleanFile) {
  std::vector<uint8_t> data = compressibleBytes(40 * kChunk, 4);
  std::string path = writeFile(dir.file("file"), data);
  CompressorContext *ctx = initCompressor("4", nullptr, nullptr, nullptr, false, 1, false);
  ASSERT_EQ(compressFile(ctx, path.c_str(), nullptr), 0);
  freeCompressor(ctx);
  std::string orphan = std::string(platform::kReservedLinuxPrefix) + kResourceForkXattrName + "#abc.0";
  ASSERT_EQ(setxattr(path.c_str(), orphan.c_str(), "left", 4, 0), 0);

  RepairReport report = repairFile(path.c_str(), false);
  EXPECT_EQ(report.verdict, RepairVerdict::Repaired);
  EXPECT_EQ(report.state, "1 attribute segments that no value owns");
  EXPECT_EQ(report.action, "removed them");
  std::vector<std::string> names = linuxAttributeNames(path);
  EXPECT_EQ(std::count(names.begin(), names.end(), orphan), 0);
  EXPECT_TRUE(logical(path) == data);
  EXPECT_EQ(repairFile(path.c_str(), false).verdict, RepairVerdict::Clean);
}

TEST_F(Repair, AFailingStepIsReportedAndTheFileStaysReadable) {
  std::vector<uint8_t> data = compressibleBytes(5 * kChunk, 5);
  Form type4 = formOf(dir, data, "4");
  std::string path = dir.file("file");
  make(path, prefix(data, 70000), type4.header, type4.fork, kCompressedFlag);
  sys::armFault(sys::Call::Fsync, 1, EIO);
  RepairReport report = repairFile(path.c_str(), false);
  sys::clearFaults();
  EXPECT_EQ(report.verdict, RepairVerdict::Failed);
  EXPECT_EQ(report.action, "failed: cannot flush the data fork: Input/output error");
  // Still marked compressed, so readers still get the compressed form; the next repair finishes.
  EXPECT_TRUE(logical(path) == data);
  EXPECT_EQ(repairFile(path.c_str(), false).verdict, RepairVerdict::Repaired);
  EXPECT_EQ(readFile(path), data);
}

TEST_F(Repair, MissingFileAndOtherKindsOfFile) {
  RepairReport missing = repairFile(dir.file("absent").c_str(), false);
  EXPECT_EQ(missing.verdict, RepairVerdict::Failed);
  EXPECT_EQ(missing.action, "failed: cannot examine it: No such file or directory");
  ASSERT_EQ(symlink("absent", dir.file("link").c_str()), 0);
  EXPECT_EQ(repairFile(dir.file("link").c_str(), false).verdict, RepairVerdict::Clean);
  EXPECT_EQ(repairFile(dir.path().c_str(), false).verdict, RepairVerdict::Clean);
}

// A child compresses and decompresses one file over and over and is killed at spread moments:
// whatever step it dies in, repair proves the state and the file gives back its data.
TEST_F(Repair, KilledCompressionsAndDecompressionsLeaveStatesRepairMakesWhole) {
  std::vector<uint8_t> data = compressibleBytes(30 * kChunk + 777, 7);
  std::string path = writeFile(dir.file("file"), data);
  std::mt19937 generator(8);
  std::map<std::string, int> states;
  for (int round = 0; round < 30; round++) {
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 1, false);
      for (;;) {
        compressFile(ctx, path.c_str(), nullptr);
        decompressFile(path.c_str(), false, 0);
      }
    }
    usleep(2000 + generator() % 40000);
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    RepairReport report = repairFile(path.c_str(), false);
    EXPECT_TRUE(report.verdict == RepairVerdict::Clean || report.verdict == RepairVerdict::Repaired)
        << "round " << round << ": " << report.state << ": " << report.action;
    states[report.state]++;
    EXPECT_TRUE(logical(path) == data) << "round " << round << ": " << report.state;
  }
  RecordProperty("distinct_states", static_cast<int>(states.size()));
  EXPECT_GT(states.size(), 1u) << "every kill found the same state: the test proves little";
}

// As a user who may not write the file: the mode is widened for the repair and restored.
int repairReadOnlyFileAsNobody(const std::string &path) {
  if (chown(path.c_str(), 65534, 65534) != 0 || chmod(path.c_str(), 0444) != 0) return 10;
  if (setgid(65534) != 0 || setuid(65534) != 0) return 11;
  RepairReport report = repairFile(path.c_str(), false);
  if (report.verdict != RepairVerdict::Repaired) return 12;
  struct stat st;
  if (stat(path.c_str(), &st) != 0 || (st.st_mode & 07777) != 0444) return 13;
  platform::Stat flags;
  if (platform::stat(path.c_str(), &flags) != 0 || flags.st_flags != kCompressedFlag) return 14;
  return 0;
}

TEST(RepairAsNobody, ReadOnlyFileIsWidenedForTheRepairAndRestoredAfter) {
  if (!runningAsRoot()) GTEST_SKIP() << "changing users needs root";
  ScratchDir dir;
  ASSERT_EQ(chmod(dir.path().c_str(), 0777), 0);
  std::vector<uint8_t> data = compressibleBytes(3 * kChunk, 6);
  Form type4 = formOf(dir, data, "4");
  std::string path = dir.file("file");
  make(path, kNone, type4.header, type4.fork, 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) _exit(repairReadOnlyFileAsNobody(path));
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
