#include <fcntl.h>
#include <grp.h>
#include <md5.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <sstream>
#include <string>
#include <vector>

#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::MatchesRegex;

namespace {

const std::string kPrefix = "Libraries/CompressData/Decompress:[0-9]+: ";
constexpr int64_t kPiece = kDecompressPieceSize;
constexpr uid_t kNobody = 65534;
constexpr gid_t kNoGroup = 65534;

// Log-like text: deflate shrinks it several times over, but never to nothing, because every
// line carries different numbers.
std::string logText(size_t size, uint32_t seed) {
  std::string text;
  text.reserve(size + 128);
  uint32_t state = seed * 2654435761u + 12345;
  char line[128];
  for (unsigned long long n = 0; text.size() < size; n++) {
    state = state * 1664525u + 1013904223u;
    int length = snprintf(line, sizeof line, "%010llu host-%02u GET /item/%05u took %u.%03u ms status %u\n", n,
                          state >> 27, (state >> 8) & 0xFFFF, (state >> 20) & 0x3FF, state % 1000,
                          200 + ((state >> 12) & 3) * 100);
    text.append(line, static_cast<size_t>(length));
  }
  text.resize(size);
  return text;
}

std::string readText(const std::string &path) {
  std::vector<uint8_t> bytes = readFile(path);
  return std::string(bytes.begin(), bytes.end());
}

// The compression type in the file's header attribute; 0 when it has none.
uint32_t headerType(const std::string &path) {
  std::vector<uint8_t> attribute(kMaxType3AttributeSize);
  if (platform::getxattr(path.c_str(), kDecmpfsXattrName, attribute.data(), attribute.size(), 0, 0) < 16) return 0;
  DiskHeader header;
  memcpy(&header, attribute.data(), sizeof header);
  return header.compressionType;
}

// Compresses the file in place with types 3 then 4, as callers do, and returns its type.
uint32_t compressInPlace(const std::string &path, bool largeForks = false) {
  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, largeForks);
  EXPECT_NE(ctx, nullptr);
  if (!ctx) return 0;
  EXPECT_EQ(compressFile(ctx, path.c_str(), nullptr), 0) << path;
  freeCompressor(ctx);
  return headerType(path);
}

// Names of the file's Linux attributes that belong to the compressed form (segments included).
std::vector<std::string> compressionAttributes(const std::string &path) {
  std::vector<std::string> found;
  for (const std::string &name : linuxAttributeNames(path))
    if (name.find("com.tavix") != std::string::npos) found.push_back(name);
  return found;
}

uint32_t flagsOf(const std::string &path) {
  platform::Stat st{};
  EXPECT_EQ(platform::stat(path.c_str(), &st), 0) << path;
  return st.st_flags;
}

std::string lastLine(const std::string &text) {
  if (text.empty()) return "";
  size_t end = text.back() == '\n' ? text.size() - 1 : text.size();
  size_t start = text.rfind('\n', end == 0 ? 0 : end - 1);
  return text.substr(start == std::string::npos ? 0 : start + 1);
}

// Regex-escapes a path (scratch paths hold only '/', '-', '.', letters and digits).
std::string escaped(const std::string &path) {
  std::string out;
  for (char c : path) {
    if (c == '.') out += '\\';
    out += c;
  }
  return out;
}

// Times far from now, with whole microseconds, so that a restore is visible exactly.
const struct timespec kTimes[2] = {{1500000000, 123456000}, {1600000000, 654321000}};

void setTimes(const std::string &path) { ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), kTimes, 0), 0); }

// Reading the data afterwards (verify does) moves the access time again: then only the
// modification time is compared.
std::string timesProblem(const struct stat &st, bool readAfterwards = false) {
  if (!readAfterwards && (st.st_atim.tv_sec != kTimes[0].tv_sec || st.st_atim.tv_nsec != kTimes[0].tv_nsec))
    return "access time changed";
  if (st.st_mtim.tv_sec != kTimes[1].tv_sec || st.st_mtim.tv_nsec != kTimes[1].tv_nsec)
    return "modification time changed";
  return "";
}

// Records what decompressData hands to its writer.
struct Recorder {
  std::vector<std::pair<int64_t, int64_t>> pieces;  // offset, count
  std::string bytes;
  size_t failAt = 0;            // the call (1 = first) that returns -1; 0 = none
  uint64_t chargedAtFirst = 0;  // memory charged to the budget during the first call
};

int recordingWriter(int64_t offset, const void *bytes, int64_t count, void *context) {
  auto *recorder = static_cast<Recorder *>(context);
  if (recorder->pieces.empty()) recorder->chargedAtFirst = throttlingMemoryCharged();
  recorder->pieces.emplace_back(offset, count);
  // A loop that stopped making progress would call again and again: stop it here.
  if (recorder->pieces.size() == recorder->failAt || recorder->pieces.size() > 10000) return -1;
  recorder->bytes.append(static_cast<const char *>(bytes), static_cast<size_t>(count));
  return 0;
}

class Decompress : public ::testing::Test {
 protected:
  void TearDown() override { sys::clearFaults(); }

  // A file of `size` bytes of log text, compressed in place, with the known times.
  std::string compressedFile(const std::string &name, size_t size, uint32_t expectedType, uint32_t seed = 1) {
    std::string path = writeFile(dir.file(name), logText(size, seed));
    EXPECT_EQ(compressInPlace(path), expectedType) << "the compressors did not produce type " << expectedType;
    EXPECT_EQ(flagsOf(path), kFlagCompressed);
    EXPECT_EQ(readFile(path).size(), 0u) << "the data fork of a compressed file is empty";
    setTimes(path);
    return path;
  }

  // decompressData on the file through a plain handle; *printed gets standard error.
  int decompressTo(const std::string &path, Recorder *recorder, std::string *printed = nullptr) {
    FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
    EXPECT_NE(fh, nullptr);
    if (!fh) return -2;
    FdCapture err(2);
    int result = decompressData(fh, recordingWriter, recorder);
    std::string text = err.text();
    if (printed) *printed = text;
    fh->close(fh);
    return result;
  }

  void setHeader(const std::string &path, uint32_t type, uint64_t size, size_t length = 16) {
    std::vector<uint8_t> bytes(16, 0);
    uint32_t magic = kDecmpfsMagic;
    memcpy(bytes.data(), &magic, 4);
    memcpy(bytes.data() + 4, &type, 4);
    memcpy(bytes.data() + 8, &size, 8);
    bytes.resize(length);
    ASSERT_EQ(platform::setxattr(path.c_str(), kDecmpfsXattrName, bytes.data(), bytes.size(), 0, 0), 0);
  }

  ScratchDir dir;
};

// ---- decompressFile: the file comes back whole --------------------------------------------

struct RoundTrip {
  const char *name;
  size_t size;
  uint32_t type;
  bool verify;
  uint32_t otherFlags;
  mode_t mode;
};
void PrintTo(const RoundTrip &c, std::ostream *out) { *out << c.name; }

class DecompressFileRoundTrip : public Decompress, public ::testing::WithParamInterface<RoundTrip> {};

TEST_P(DecompressFileRoundTrip, RestoresDataTimesModeAndFlagsAndDropsTheAttributes) {
  const RoundTrip &c = GetParam();
  std::string original = logText(c.size, 7);
  std::string path = compressedFile("file", c.size, c.type, 7);
  ASSERT_EQ(chmod(path.c_str(), c.mode), 0);
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagCompressed | c.otherFlags), 0);
  setTimes(path);

  FdCapture err(2);
  int result = decompressFile(path.c_str(), c.verify, 0);
  EXPECT_EQ(err.text(), "");
  ASSERT_EQ(result, 0);
  platform::Stat st{};
  ASSERT_EQ(platform::stat(path.c_str(), &st), 0);
  EXPECT_EQ(timesProblem(st.st, c.verify), "");
  EXPECT_EQ(st.st_flags, c.otherFlags);
  EXPECT_EQ(st.st.st_mode & 07777, c.mode);
  EXPECT_EQ(readText(path), original);
  EXPECT_THAT(compressionAttributes(path), ::testing::IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(
    Types, DecompressFileRoundTrip,
    ::testing::Values(RoundTrip{"Type3", 6000, 3, false, 0, 0644},
                      RoundTrip{"Type3VerifiedImmutableHiddenReadOnly", 6000, 3, true,
                                kFlagHidden | kFlagUserImmutable | kFlagSystemImmutable, 0444},
                      RoundTrip{"Type4Immutable", 300001, 4, false, kFlagUserImmutable | kFlagSystemImmutable, 0600},
                      RoundTrip{"Type4VerifiedHiddenReadOnly", 300001, 4, true, kFlagHidden, 0444}),
    [](const ::testing::TestParamInfo<RoundTrip> &info) { return std::string(info.param.name); });

TEST_F(Decompress, FileThatIsNotCompressedIsLeftAlone) {
  std::string path = writeFile(dir.file("plain"), logText(5000, 2));
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagHidden), 0);
  setTimes(path);
  for (bool verify : {false, true}) {
    FdCapture err(2);
    EXPECT_EQ(decompressFile(path.c_str(), verify, 1), 0);
    EXPECT_EQ(err.text(), "");
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(timesProblem(st), "") << "the file was read or written";
    EXPECT_EQ(flagsOf(path), kFlagHidden);
  }
  EXPECT_EQ(readText(path), logText(5000, 2));
}

// ---- decompressFile as a user who may not write the file ----------------------------------

// Runs in a freshly started test process (the library remembers per process whether it runs
// as root): prepares read-only compressed files owned by nobody in a directory nobody cannot
// write, then decompresses them in a child that runs as nobody. The mode cannot be watched
// from outside while decompressFile runs, so the child stops it with injected faults at later
// steps: the file is then found widened to 0666 with its data already written. Returns the
// exit status; problems are printed on standard error.
int decompressReadOnlyFilesAsNobody() {
  ScratchDir dir;
  if (dir.path().empty()) return 2;
  bool root = runningAsRoot();
  chmod(dir.path().c_str(), 0755);
  std::string original = logText(300000, 3);
  std::vector<std::string> files;
  for (const char *name : {"whole", "stopped-at-times", "cannot-widen", "cannot-restore", "hidden"}) {
    std::string path = writeFile(dir.file(name), original);
    if (compressInPlace(path) != 4) return 3;
    if (root && chown(path.c_str(), kNobody, kNoGroup) != 0) return 4;
    chmod(path.c_str(), 0444);
    if (utimensat(AT_FDCWD, path.c_str(), kTimes, 0) != 0) return 5;
    files.push_back(path);
  }
  if (platform::chflags(files[4].c_str(), kFlagCompressed | kFlagHidden) != 0) return 5;

  pid_t pid = fork();
  if (pid == 0) {
    if (root && (setgroups(0, nullptr) != 0 || setgid(kNoGroup) != 0 || setuid(kNobody) != 0)) _exit(6);
    std::ostringstream problems;
    auto modeOf = [](const std::string &path) {
      struct stat st{};
      stat(path.c_str(), &st);
      return st.st_mode & 07777;
    };
    auto run = [&](const std::string &path, bool verify, std::string *printed) {
      FdCapture err(2);
      int result = decompressFile(path.c_str(), verify, 0);
      *printed = err.text();
      return result;
    };
    std::string printed;

    // Without faults: decompressed, and the mode is 0444 again; another flag comes back too.
    for (size_t i : {0, 4}) {
      const std::string &path = files[i];
      bool verify = i == 0;
      int result = run(path, verify, &printed);
      if (result != 0) problems << path << ": result " << result << ", printed: " << printed;
      platform::Stat st{};
      platform::stat(path.c_str(), &st);
      if (st.st_flags != (i == 4 ? uint32_t{kFlagHidden} : 0u)) problems << path << ": flags " << st.st_flags << "\n";
      if (!timesProblem(st.st, verify).empty()) problems << path << ": " << timesProblem(st.st, verify) << "\n";
      if (readText(path) != original) problems << path << ": data differs\n";
      if (modeOf(path) != 0444) problems << path << ": mode " << std::oct << modeOf(path) << std::dec << "\n";
      if (!compressionAttributes(path).empty()) problems << path << ": attributes remain\n";
    }

    // Stopped after the data went in: the file was writable while it was written.
    sys::armFault(sys::Call::Futimes, 1, EPERM);
    int result = run(files[1], false, &printed);
    sys::clearFaults();
    if (result != -1) problems << "stopped: result " << result << "\n";
    if (modeOf(files[1]) != 0666) problems << "stopped: mode " << std::oct << modeOf(files[1]) << std::dec << "\n";
    if (readText(files[1]) != original) problems << "stopped: data not written\n";

    struct {
      int nth;
      std::string message;
      mode_t modeAfter;
    } chmodFaults[] = {
        {1, "Error: Failed to change mode of compressed file at path '" + escaped(files[2]) + "'", 0444},
        {2, "Error: Failed to restore mode of compressed file at path '" + escaped(files[3]) + "'", 0666},
    };
    for (size_t i = 0; i < 2; i++) {
      const std::string &path = files[2 + i];
      sys::armFault(sys::Call::Chmod, static_cast<uint64_t>(chmodFaults[i].nth), EPERM);
      result = run(path, false, &printed);
      sys::clearFaults();
      std::string expected = kPrefix + chmodFaults[i].message + ": Operation not permitted \\(1\\)\n";
      if (result != -1 || !::testing::Matches(MatchesRegex(expected))(lastLine(printed)))
        problems << path << ": result " << result << ", printed: " << printed;
      if (modeOf(path) != chmodFaults[i].modeAfter)
        problems << path << ": mode " << std::oct << modeOf(path) << std::dec << "\n";
    }
    std::string text = problems.str();
    fputs(text.c_str(), stderr);
    _exit(text.empty() ? 0 : 1);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 100;
}

TEST(DecompressAsNobody, ReadOnlyFileIsWidenedForTheWorkAndRestoredAfter) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // a fresh process
  EXPECT_EXIT(_exit(decompressReadOnlyFilesAsNobody()), ::testing::ExitedWithCode(0), "");
}

// ---- decompressData: pieces, writer, damaged files ----------------------------------------

struct PieceCase {
  size_t size;
  uint32_t type;
  std::vector<std::pair<int64_t, int64_t>> pieces;
};
void PrintTo(const PieceCase &c, std::ostream *out) { *out << "type " << c.type << ", " << c.size << " bytes"; }

class DecompressDataPieces : public Decompress, public ::testing::WithParamInterface<PieceCase> {};

TEST_P(DecompressDataPieces, HandsTheDataOverInPiecesOfAtMost128KiB) {
  const PieceCase &c = GetParam();
  std::string path = compressedFile("pieces", c.size, c.type, 11);
  int64_t headerSize = platform::getxattr(path.c_str(), kDecmpfsXattrName, nullptr, 0, 0, 0);
  uint64_t chargedBefore = throttlingMemoryCharged();
  Recorder recorder;
  std::string printed;
  EXPECT_EQ(decompressTo(path, &recorder, &printed), 0);
  EXPECT_EQ(printed, "");
  EXPECT_EQ(recorder.pieces, c.pieces);
  EXPECT_TRUE(recorder.bytes == logText(c.size, 11)) << "the pieces do not make the file";
  // The header block is charged to the memory budget while the data flows, and given back.
  EXPECT_EQ(recorder.chargedAtFirst, chargedBefore + static_cast<uint64_t>(headerSize) + 4);
  EXPECT_EQ(throttlingMemoryCharged(), chargedBefore);
}

INSTANTIATE_TEST_SUITE_P(Sizes, DecompressDataPieces,
                         ::testing::Values(PieceCase{262144, 4, {{0, kPiece}, {kPiece, kPiece}}},
                                           PieceCase{131073, 4, {{0, kPiece}, {kPiece, 1}}},
                                           PieceCase{6000, 3, {{0, 6000}}}),
                         [](const ::testing::TestParamInfo<PieceCase> &info) {
                           return "Type" + std::to_string(info.param.type) + "Of" + std::to_string(info.param.size);
                         });

TEST_F(Decompress, FailingWriterStopsTheData) {
  std::string path = compressedFile("writer", 400000, 4);
  Recorder recorder;
  recorder.failAt = 2;
  uint64_t chargedBefore = throttlingMemoryCharged();
  EXPECT_EQ(decompressTo(path, &recorder), -1);
  EXPECT_EQ(recorder.pieces.size(), 2u);  // one accepted piece, then the refusal, then nothing
  EXPECT_EQ(recorder.bytes, logText(400000, 1).substr(0, kPiece));
  EXPECT_EQ(throttlingMemoryCharged(), chargedBefore);
}

// Fork position of the chunk count of a type-4 file.
constexpr uint32_t kChunkCountPosition = 260;

TEST_F(Decompress, ReadingAForkReadsItsIndexOnceAndEachSegmentAboutOnce) {
  // 40 chunks of a segmented fork, in 20 pieces. The first read of the fork looks for it as a
  // plain attribute, then reads its index record; later reads keep that index, and the first
  // segment (count, table), which every piece comes back to, stays among the kept segments.
  const size_t chunks = 40;
  std::string path = compressedFile("many-chunks", chunks * 65536, 4);
  std::string expected = logText(chunks * 65536, 1);
  ssize_t forkSize = platform::getxattr(path.c_str(), kResourceForkXattrName, nullptr, 0, 0, 0);
  ASSERT_GT(forkSize, 4 * 65536);
  uint64_t before = sys::callCount(sys::Call::Fgetxattr);
  Recorder recorder;
  ASSERT_EQ(decompressTo(path, &recorder), 0);
  uint64_t calls = sys::callCount(sys::Call::Fgetxattr) - before;
  EXPECT_TRUE(recorder.bytes == expected);
  // Every segment once, and the first two once more: the read-ahead takes them straight into
  // its buffer, not into the cache.
  const uint64_t segmentReads = static_cast<uint64_t>(forkSize + 65535) / 65536 + 2;
  // The header, the look for a plain fork, the index.
  EXPECT_LE(calls, segmentReads + 3) << "Linux attribute reads for " << chunks << " chunks";
}

TEST_F(Decompress, DataThatEndsEarlyEndsTheLoopWithFailure) {
  // Four chunks, but the table now claims two: the second piece finds nothing.
  std::string shortTable = compressedFile("short-table", 262144, 4);
  uint32_t count = 0;
  ASSERT_EQ(platform::getxattr(shortTable.c_str(), kResourceForkXattrName, &count, 4, kChunkCountPosition, 0), 4);
  ASSERT_EQ(count, 4u);
  count = 2;
  ASSERT_EQ(platform::setxattr(shortTable.c_str(), kResourceForkXattrName, &count, 4, kChunkCountPosition, 0), 0);
  // A header that claims more than the four chunks hold.
  std::string longHeader = compressedFile("long-header", 262144, 4);
  setHeader(longHeader, 4, 300000);
  // Type 3: a header that claims more than its one chunk.
  std::string longType3 = compressedFile("long-type3", 6000, 3);
  std::vector<uint8_t> attribute(4096);
  int64_t length = platform::getxattr(longType3.c_str(), kDecmpfsXattrName, attribute.data(), attribute.size(), 0, 0);
  ASSERT_GT(length, 16);
  attribute.resize(static_cast<size_t>(length));
  uint64_t claimed = 7000;
  memcpy(attribute.data() + 8, &claimed, 8);
  ASSERT_EQ(platform::setxattr(longType3.c_str(), kDecmpfsXattrName, attribute.data(), attribute.size(), 0, 0), 0);

  const std::string type4 = "Compressors/Zlib/Type4/compressorType4Imp:[0-9]+: ";
  struct {
    std::string path, message;
    size_t goodBytes;
  } cases[] = {
      {shortTable, type4 + "Error: 2 is greater than max chunk 2\n", kPiece},
      {longHeader, type4 + "Error: 4 is greater than max chunk 4\n", 262144},
      {longType3, "(.|\n)*too many chunks for type 3(.|\n)*", 0},
  };
  for (const auto &c : cases) {
    Recorder recorder;
    std::string printed;
    FdCapture out(1);  // type 3 complains on standard output
    int result = decompressTo(c.path, &recorder, &printed);
    printed += out.text();
    EXPECT_EQ(result, -1) << c.path;
    EXPECT_THAT(printed, MatchesRegex(c.message)) << c.path;
    EXPECT_EQ(recorder.bytes.size(), c.goodBytes) << c.path;
    EXPECT_LE(recorder.pieces.size(), 2u) << c.path << ": the writer was called for missing data";
  }
}

TEST_F(Decompress, UnknownTypeOrShortHeaderIsRefused) {
  struct {
    uint32_t type;
    size_t length;
    int printedType;
  } cases[] = {{5, 16, 5}, {0, 16, 0}, {2, 16, 2}, {0xFFFFFFFF, 16, -1}, {4, 15, 0}, {3, 8, 0}, {4, 0, 0}};
  for (const auto &c : cases) {
    std::string path = compressedFile("header-" + std::to_string(&c - cases), 262144, 4);
    setHeader(path, c.type, 262144, c.length);
    std::string context = "type " + std::to_string(c.type) + ", length " + std::to_string(c.length);
    Recorder recorder;
    std::string printed;
    uint64_t chargedBefore = throttlingMemoryCharged();
    EXPECT_EQ(decompressTo(path, &recorder, &printed), -1) << context;
    EXPECT_THAT(printed, MatchesRegex(kPrefix + "Error: invalid compressor type " + std::to_string(c.printedType) +
                                      "\n"))
        << context;
    EXPECT_TRUE(recorder.pieces.empty()) << context;
    EXPECT_EQ(throttlingMemoryCharged(), chargedBefore) << context;

    // decompressFile adds its own line and leaves the file compressed.
    FdCapture err(2);
    EXPECT_EQ(decompressFile(path.c_str(), false, 0), -1) << context;
    EXPECT_THAT(err.text(), MatchesRegex(kPrefix + "Error: invalid compressor type " + std::to_string(c.printedType) +
                                         "\n" + kPrefix + "Error: Failed to decompress data for file at path '" +
                                         escaped(path) + "': [^\n]* \\([0-9]+\\)\n"))
        << context;
    EXPECT_EQ(flagsOf(path), kFlagCompressed) << context;
  }
}

TEST_F(Decompress, HeaderThatCannotBeReadIsReported) {
  std::string plain = writeFile(dir.file("no-header"), "plain");
  Recorder recorder;
  std::string printed;
  EXPECT_EQ(decompressTo(plain, &recorder, &printed), -1);
  EXPECT_THAT(printed, MatchesRegex(kPrefix + "fh_getxattr\\(" + escaped(plain) +
                                    ",com\\.tavix\\.decmpfs\\): No data available\n"));

  std::string path = compressedFile("unreadable", 262144, 4);
  // A header longer than the first read takes: type 3 holding 5,000 stored bytes.
  std::string large = writeFile(dir.file("large-header"), "");
  std::vector<uint8_t> stored(16 + 1 + 5000);
  uint32_t magic = kDecmpfsMagic, type = 3;
  uint64_t logical = 5000;
  memcpy(stored.data(), &magic, 4);
  memcpy(stored.data() + 4, &type, 4);
  memcpy(stored.data() + 8, &logical, 8);
  stored[16] = 0xFF;
  for (size_t i = 17; i < stored.size(); i++) stored[i] = static_cast<uint8_t>(i * 7919 >> 3);
  ASSERT_EQ(platform::setxattr(large.c_str(), kDecmpfsXattrName, stored.data(), stored.size(), 0, 0), 0);
  Recorder whole;
  ASSERT_EQ(decompressTo(large, &whole), 0);
  EXPECT_EQ(whole.bytes, std::string(stored.begin() + 17, stored.end()));

  const std::string readFailed = ",com\\.tavix\\.decmpfs\\): Input/output error";
  struct {
    std::string path;
    sys::Call call;
    int nth;
    std::string message;
  } cases[] = {
      // A short header comes whole with the first read (the plain handle reads attributes
      // through its descriptor); a long one needs a size query and a second read.
      {path, sys::Call::Fgetxattr, 1, "fh_getxattr\\(" + escaped(path) + readFailed},
      {large, sys::Call::Fgetxattr, 1, "fh_getxattr\\(" + escaped(large) + readFailed},
      {large, sys::Call::Fgetxattr, 2, "fh_getxattr\\(" + escaped(large) + readFailed},
      {large, sys::Call::Fgetxattr, 3, "fh_getxattr\\(" + escaped(large) + readFailed},
      {path, sys::Call::Malloc, 1, "waitThenAllocate\\(16\\): Cannot allocate memory"},
      {path, sys::Call::Malloc, 2, "malloc: Cannot allocate memory"},
  };
  for (const auto &c : cases) {
    uint64_t chargedBefore = throttlingMemoryCharged();
    FileHandle *fh = openFile(c.path.c_str(), c.path.c_str(), O_RDONLY);
    ASSERT_NE(fh, nullptr);
    Recorder caseRecorder;
    FdCapture err(2);
    sys::armFault(c.call, static_cast<uint64_t>(c.nth), c.call == sys::Call::Malloc ? ENOMEM : EIO);
    int result = decompressData(fh, recordingWriter, &caseRecorder);
    sys::clearFaults();
    EXPECT_EQ(result, -1) << c.message;
    // The handle may print its own line first.
    EXPECT_THAT(lastLine(err.text()), MatchesRegex(kPrefix + c.message + "\n"));
    EXPECT_TRUE(caseRecorder.pieces.empty()) << c.message;
    EXPECT_EQ(throttlingMemoryCharged(), chargedBefore) << c.message;
    fh->close(fh);
  }
}

// ---- decompressFile: every failing step says what failed ----------------------------------

struct StepFault {
  const char *name;
  bool verify;
  uint32_t otherFlags;
  sys::Call call;
  int nth;  // 0: the last call of that kind in a whole run
  int error;
  const char *message;  // after "<prefix>Error: ", with %s for the path
};
void PrintTo(const StepFault &c, std::ostream *out) { *out << c.name; }

class DecompressFileFailure : public Decompress, public ::testing::WithParamInterface<StepFault> {};

TEST_P(DecompressFileFailure, PrintsTheFailedStepLast) {
  const StepFault &c = GetParam();
  std::string path = compressedFile("file", 300000, 4);
  ASSERT_EQ(platform::chflags(path.c_str(), kFlagCompressed | c.otherFlags), 0);
  uint64_t nth = static_cast<uint64_t>(c.nth);
  if (nth == 0) {
    // Count the calls of a successful run on an identical twin.
    std::string twin = compressedFile("twin", 300000, 4);
    ASSERT_EQ(platform::chflags(twin.c_str(), kFlagCompressed | c.otherFlags), 0);
    uint64_t before = sys::callCount(c.call);
    FdCapture quiet(2);
    ASSERT_EQ(decompressFile(twin.c_str(), c.verify, 0), 0) << quiet.text();
    nth = sys::callCount(c.call) - before;
  }
  FdCapture err(2);
  sys::armFault(c.call, nth, c.error);
  int result = decompressFile(path.c_str(), c.verify, 0);
  sys::clearFaults();
  std::string printed = err.text();
  EXPECT_EQ(result, -1);
  std::string message = c.message;
  message.replace(message.find("%s"), 2, escaped(path));
  EXPECT_THAT(lastLine(printed), MatchesRegex(kPrefix + "Error: " + message + "\n")) << printed;
}

// Call counts follow the steps: once the file is open, everything goes through its descriptor:
// a flag word is set with fsetxattr and cleared with fremovexattr; once the data is written
// and flushed, the file's own flags are set (the compressed flag cleared), which is the first
// fremovexattr of a run on a file without other flags; then the header's plain name, its
// index, then the fork's plain name are removed; times are set with futimens (counted as
// futimes); stat is called once before and once after, each followed by a getxattr of the flag
// word; with verify, the last open of a run is the checksum after.
INSTANTIATE_TEST_SUITE_P(
    Steps, DecompressFileFailure,
    ::testing::Values(
        StepFault{"ChecksumBefore", true, 0, sys::Call::Open, 1, EACCES,
                  "Unable to checksum file '%s' before decompression\\."},
        StepFault{"ClearFlags", false, kFlagHidden, sys::Call::Fsetxattr, 1, EPERM,
                  "Failed to clear flags of compressed file at path '%s': Operation not permitted \\(1\\)"},
        StepFault{"OpenForWriting", false, 0, sys::Call::Open, 1, EACCES,
                  "Failed to open compressed file at path '%s' for writing: Permission denied \\(13\\)"},
        StepFault{"WriteData", false, 0, sys::Call::Pwrite, 2, ENOSPC,
                  "Failed to decompress data for file at path '%s': No space left on device \\(28\\)"},
        StepFault{"FlushData", false, 0, sys::Call::Fsync, 1, EIO,
                  "Failed to flush the data of file at path '%s': Input/output error \\(5\\)"},
        StepFault{"SetOtherFlags", false, kFlagHidden, sys::Call::Fsetxattr, 2, EPERM,
                  "Failed to set flags of compressed file at path '%s': Operation not permitted \\(1\\)"},
        StepFault{"ClearCompressedFlag", false, 0, sys::Call::Fremovexattr, 1, EPERM,
                  "Failed to set flags of compressed file at path '%s': Operation not permitted \\(1\\)"},
        StepFault{"RemoveHeader", false, 0, sys::Call::Fremovexattr, 2, EIO,
                  "Failed to remove com\\.tavix\\.decmpfs xattr of file at path '%s': Input/output error \\(5\\)"},
        StepFault{"RemoveFork", false, 0, sys::Call::Fremovexattr, 4, EIO,
                  "Failed to remove com\\.tavix\\.ResourceFork xattr of file at path '%s': Input/output error "
                  "\\(5\\)"},
        StepFault{"RestoreTimes", false, 0, sys::Call::Futimes, 1, EPERM,
                  "Failed to restore timestamp of file at path '%s': Operation not permitted \\(1\\)"},
        StepFault{"StatAfter", false, 0, sys::Call::Stat, 2, EIO,
                  "!\\? Stat failed for path '%s' after file should have decompressed\\. Input/output error "
                  "\\(5\\)"},
        // The flag word reported missing while it is there: chflags believes it cleared it.
        StepFault{"StillCompressed", false, 0, sys::Call::Fremovexattr, 1, ENODATA,
                  "File '%s' was still compressed after attempting decompression\\."},
        // The flag word unreadable at the stat after: it reads as no flags at all.
        StepFault{"ChangedFlags", false, kFlagHidden, sys::Call::Getxattr, 0, EPERM,
                  "File '%s' changed flags attempting decompression\\."},
        StepFault{"ChecksumAfter", true, 0, sys::Call::Open, 0, EACCES,
                  "Unable to checksum file '%s' after decompression\\."}),
    [](const ::testing::TestParamInfo<StepFault> &info) { return std::string(info.param.name); });

// A decompression that stops after writing the data, at any later step, leaves a file every
// reader gets whole: still marked compressed until the data is durable, plain from then on.
TEST_F(Decompress, StopAfterTheDataLeavesAFileThatReadsWhole) {
  struct Case {
    const char *name;
    sys::Call call;
    uint64_t nth;
    bool stillCompressed;
  } cases[] = {
      {"flush", sys::Call::Fsync, 1, true},
      {"flag", sys::Call::Fremovexattr, 1, true},
      {"header", sys::Call::Fremovexattr, 2, false},
      {"fork", sys::Call::Fremovexattr, 4, false},
  };
  std::string original = logText(300000, 9);
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    std::string path = compressedFile(c.name, original.size(), 4, 9);
    FdCapture quiet(2);
    sys::armFault(c.call, c.nth, EIO);
    EXPECT_EQ(decompressFile(path.c_str(), false, 0), -1);
    sys::clearFaults();
    quiet.text();
    EXPECT_EQ((flagsOf(path) & kFlagCompressed) != 0, c.stillCompressed);
    uint8_t digest[16], expected[16];
    ASSERT_EQ(checksumFile(path.c_str(), digest), 1);
    MD5_CTX md5;
    MD5Init(&md5);
    MD5Update(&md5, reinterpret_cast<const uint8_t *>(original.data()), original.size());
    MD5Final(expected, &md5);
    EXPECT_EQ(memcmp(digest, expected, 16), 0);
  }
}

TEST_F(Decompress, MissingFileIsReportedWithoutItsPath) {
  FdCapture err(2);
  EXPECT_EQ(decompressFile(dir.file("missing").c_str(), false, 0), -1);
  EXPECT_THAT(err.text(), MatchesRegex(kPrefix + "Error: stat failed: No such file or directory \\(2\\)\n"));
}

TEST_F(Decompress, VerifyCatchesDataThatDiffersAfterwards) {
  // A damaged compressed file whose data fork still holds stray bytes past the logical end:
  // the logical data is written over their start, the tail stays and the digests differ.
  std::string path = compressedFile("stray", 300000, 4);
  {
    std::string stray(300010, 's');
    int fd = open(path.c_str(), O_WRONLY);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(write(fd, stray.data(), stray.size()), static_cast<ssize_t>(stray.size()));
    close(fd);
  }
  FdCapture err(2);
  EXPECT_EQ(decompressFile(path.c_str(), true, 0), -1);
  EXPECT_THAT(err.text(), MatchesRegex(kPrefix + "Error: File data after decompression is different than before for "
                                                 "file '" +
                                       escaped(path) + "'\\.\n"));
  EXPECT_EQ(readText(path), logText(300000, 1) + "ssssssssss");
}

// ---- catFile -------------------------------------------------------------------------------

// Runs catFile with standard output in a memory file; returns what it wrote.
std::string catOutput(const std::string &path, std::string *printed = nullptr) {
  FdCapture err(2);
  FdCapture out(1);
  catFile(path.c_str(), 0);
  std::string written = out.text();
  std::string errors = err.text();
  if (printed) *printed = errors;
  return written;
}

TEST_F(Decompress, CatFileWritesTheLogicalBytes) {
  std::string plain = writeFile(dir.file("plain"), logText(10001, 4));
  std::string empty = writeFile(dir.file("empty"), "");
  std::string type3 = compressedFile("type3", 6000, 3, 5);
  std::string type4 = compressedFile("type4", 300001, 4, 6);
  struct {
    std::string path, expected;
  } cases[] = {{plain, logText(10001, 4)}, {empty, ""}, {type3, logText(6000, 5)}, {type4, logText(300001, 6)}};
  for (const auto &c : cases) {
    std::string printed;
    uint64_t opens = sys::callCount(sys::Call::Open);
    std::string written = catOutput(c.path, &printed);
    EXPECT_EQ(written.size(), c.expected.size()) << c.path;
    EXPECT_TRUE(written == c.expected) << c.path;
    EXPECT_EQ(printed, "") << c.path;
    if (c.path == type3 || c.path == type4) {
      EXPECT_EQ(sys::callCount(sys::Call::Open), opens) << c.path << ": read through its attributes alone";
    }
  }
  EXPECT_EQ(flagsOf(type4), kFlagCompressed) << "catFile changes nothing";
}

TEST_F(Decompress, CatFileOfAPlainFileLosesNothingWhereTheKernelCopyFails) {
  std::string expected = logText(3 * 1048576 + 5, 7);
  std::string plain = writeFile(dir.file("plain"), expected);
  // Standard output refusing the kernel's copy at once (as a terminal does), failing after the
  // first call, or failing at the end of the file: the reads take over where it stopped.
  for (uint64_t nth : {1, 2, 3}) {
    sys::armFault(sys::Call::Sendfile, nth, nth == 1 ? EINVAL : EIO);
    std::string printed;
    std::string written = catOutput(plain, &printed);
    sys::clearFaults();
    EXPECT_EQ(written.size(), expected.size()) << nth;
    EXPECT_TRUE(written == expected) << nth;
    EXPECT_EQ(printed, "") << nth;
  }
  // Standard output open for appending takes no kernel copy.
  std::string target = dir.file("appended");
  int out = open(target.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
  ASSERT_GE(out, 0);
  fflush(stdout);
  int saved = dup(1);
  dup2(out, 1);
  catFile(plain.c_str(), 0);
  dup2(saved, 1);
  close(saved);
  close(out);
  std::vector<uint8_t> appended = readFile(target);
  EXPECT_TRUE(std::string(appended.begin(), appended.end()) == expected);
}

TEST_F(Decompress, CatFileReportsWhatItCouldNotDo) {
  std::string plain = writeFile(dir.file("plain"), logText(300000, 4));
  std::string compressed = compressedFile("compressed", 300000, 4);
  std::string damaged = compressedFile("damaged", 300000, 4);
  setHeader(damaged, 5, 300000);
  std::string missing = dir.file("missing");
  // A compressed file's attributes are read through its path: the first getxattr of a run
  // reads its flags (stat), the second its header.
  struct {
    std::string path;
    sys::Call call;
    uint64_t nth;
    int error;
    std::string message;
    size_t written;
  } cases[] = {
      {missing, sys::Call::Count, 0, 0, kPrefix + "stat\\(" + escaped(missing) + "\\): No such file or directory\n", 0},
      {plain, sys::Call::Open, 1, EACCES, kPrefix + "open\\(" + escaped(plain) + "\\): Permission denied\n", 0},
      {plain, sys::Call::Read, 2, EIO,
       kPrefix + "read: Input/output error\n" + kPrefix + "Error: didn't read all of '" + escaped(plain) + "'\n", kPiece},
      {compressed, sys::Call::Getxattr, 2, EACCES,
       "(.|\n)*" + kPrefix + "Error: Failed to decompress data for file at path '" + escaped(compressed) +
           "': Permission denied \\(13\\)\n",
       0},
      {compressed, sys::Call::Malloc, 1, ENOMEM,
       "(.|\n)*" + kPrefix + "Error: Failed to open compressed file at path '" + escaped(compressed) +
           "': Cannot allocate memory \\(12\\)\n",
       0},
      {damaged, sys::Call::Count, 0, 0,
       kPrefix + "Error: invalid compressor type 5\n" + kPrefix + "Error: Failed to decompress data for file at path '" +
           escaped(damaged) + "': [^\n]*\n",
       0},
  };
  for (const auto &c : cases) {
    // A plain file is read in blocks when the kernel's copy fails: here at once, and then the
    // second read fails, after one block.
    if (c.call == sys::Call::Read) sys::armFault(sys::Call::Sendfile, 1, EIO);
    if (c.call != sys::Call::Count) sys::armFault(c.call, c.nth, c.error);
    std::string printed;
    std::string written = catOutput(c.path, &printed);
    sys::clearFaults();
    EXPECT_THAT(printed, MatchesRegex(c.message)) << c.path;
    EXPECT_EQ(written.size(), c.written) << c.path;
  }
}

// Streams log text into a file without holding it in memory.
void writeLargeLogFile(const std::string &path, size_t size) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  ASSERT_GE(fd, 0);
  const size_t block = 1 << 20;
  for (size_t written = 0, seed = 100; written < size; written += block, seed++) {
    std::string text = logText(std::min(block, size - written), static_cast<uint32_t>(seed));
    ASSERT_EQ(write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
  }
  close(fd);
}

// Current resident size, from the kernel's status of this process.
long residentKiB() {
  FILE *status = fopen("/proc/self/status", "r");
  long kiB = -1;
  char line[256];
  while (status && fgets(line, sizeof line, status))
    if (sscanf(line, "VmRSS: %ld kB", &kiB) == 1) break;
  if (status) fclose(status);
  return kiB;
}

long maxResidentKiB() {
  struct rusage usage {};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_maxrss;
}

TEST_F(Decompress, CatFileMemoryStaysFlatOnA256MiBFile) {
#if defined(__SANITIZE_ADDRESS__)
  GTEST_SKIP() << "AddressSanitizer keeps freed blocks in quarantine: resident size says nothing here";
#endif
  const size_t size = 256u << 20;
  std::string big = dir.file("big");
  writeLargeLogFile(big, size);
  ASSERT_EQ(compressInPlace(big, true), 4u) << "256 MiB needs large forks allowed";
  std::string small = compressedFile("small", 300000, 4);

  int report[2];
  ASSERT_EQ(pipe(report), 0);
  pid_t pid = fork();
  if (pid == 0) {
    close(report[0]);
    int devNull = open("/dev/null", O_WRONLY);
    dup2(devNull, 1);
    FdCapture err(2);
    catFile(small.c_str(), 0);  // first-use allocations belong to the baseline
    long before = maxResidentKiB(), residentBefore = residentKiB();
    uint64_t writesBefore = sys::callCount(sys::Call::Write);
    catFile(big.c_str(), 0);
    long after = maxResidentKiB();
    uint64_t writes = sys::callCount(sys::Call::Write) - writesBefore;
    size_t printedLength = err.text().size();
    // The measure must be able to see growth: touch 8 MiB and watch the peak rise.
    std::vector<char> control(8u << 20);
    memset(control.data(), 1, control.size());
    long controlled = maxResidentKiB() + control[12345] - 1;
    dprintf(report[1], "%ld %ld %ld %ld %llu %zu\n", before, residentBefore, after, controlled,
            static_cast<unsigned long long>(writes), printedLength);
    _exit(0);
  }
  close(report[1]);
  char text[256] = {};
  ssize_t got = read(report[0], text, sizeof text - 1);
  close(report[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  ASSERT_GT(got, 0);
  long before = 0, residentBefore = 0, after = 0, controlled = 0;
  unsigned long long writes = 0;
  size_t printedLength = 0;
  ASSERT_EQ(sscanf(text, "%ld %ld %ld %ld %llu %zu", &before, &residentBefore, &after, &controlled, &writes,
                   &printedLength),
            6)
      << text;
  RecordProperty("peakResidentGrowthKiB", std::to_string(after - before));
  RecordProperty("residentBeforeKiB", std::to_string(residentBefore));
  EXPECT_EQ(printedLength, 0u) << "catFile complained";
  EXPECT_EQ(writes, size / kPiece) << "catFile did not hand over every piece";
  EXPECT_LT(after - before, 4096 + 128) << "peak resident KiB went from " << before << " to " << after;
  // Growth could hide under a peak left from before: the peak must have been the resident size.
  EXPECT_LT(before - residentBefore, 1024) << "peak " << before << " KiB, resident " << residentBefore << " KiB";
  EXPECT_GE(controlled - after, 7 * 1024) << "the peak did not show an 8 MiB block";
}

}  // namespace
