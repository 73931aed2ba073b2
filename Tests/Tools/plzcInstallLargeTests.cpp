// plzc install of a tree of more than 1 GiB, run as a user runs it: text, binary-like and
// incompressible files from 4 KiB to 200 MiB, empty files, "._" files, files that a rules file
// or the shipped rules exclude, thin and universal Mach-O files, and files at the 64 MiB limit
// of type 4. Every file must read back byte for byte through catFile, be compressed exactly
// where the rules, the Mach-O filter and the size limit say, and the pipeline must account for
// every work item. The tree lives under $PLZC_TEST_DIR (or /dev/shm).
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <iostream>
#include <map>

#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Support/PlzcProcess.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

constexpr uint64_t kMiB = 1 << 20;
constexpr uint64_t kBlock = 65536;
constexpr uint64_t kType4Limit = 64 * kMiB;  // type 4 leaves larger files plain without large forks

// Content kinds. Every file is a function of (kind, seed, offset), so it can be written and
// checked again in blocks without being held in memory.
enum class Kind {
  Text,    // log lines; deflate keeps about a fifth
  Binary,  // fixed-size records with counters; deflate keeps about half
  Noise,   // incompressible
};

uint64_t splitMix(uint64_t x) {
  x += 0x9e3779b97f4a7c15ULL;
  x = (x ^ (x >> 30)) * 0xbf58476d1ce4e5b9ULL;
  x = (x ^ (x >> 27)) * 0x94d049bb133111ebULL;
  return x ^ (x >> 31);
}

// 64 KiB of log lines for a seed, made once; each block of a text file is this template with
// the block's number written over its first line.
const std::vector<uint8_t> &textTemplate(uint32_t seed) {
  static std::map<uint32_t, std::vector<uint8_t>> templates;
  std::vector<uint8_t> &text = templates[seed % 8];
  if (!text.empty()) return text;
  static const char *const kWords[] = {"read", "write", "open", "close", "sync", "flush", "lookup", "commit"};
  static const char *const kParts[] = {"io", "net", "db", "fs", "cache", "sched"};
  uint64_t state = seed % 8 + 1, time = 0;
  while (text.size() < kBlock) {
    state = state * 6364136223846793005ULL + 1442695040888963407ULL;
    uint64_t r = state >> 33;
    time += r % 700;
    char line[160];
    int n = snprintf(line, sizeof line, "2026-11-%02u %02u:%02u:%02u.%03u %s [%s] %s block %u took %u ms\n",
                     static_cast<unsigned>(1 + seed % 8), static_cast<unsigned>(time / 3600000 % 24),
                     static_cast<unsigned>(time / 60000 % 60), static_cast<unsigned>(time / 1000 % 60),
                     static_cast<unsigned>(time % 1000), r % 8 ? "INFO" : "WARN", kParts[(r >> 3) % 6],
                     kWords[(r >> 6) % 8], static_cast<unsigned>((r >> 9) % 4096),
                     static_cast<unsigned>((r >> 21) % 50));
    text.insert(text.end(), line, line + n);
  }
  text.resize(kBlock);
  return text;
}

// Block number `block` (kBlock bytes) of a file of this kind and seed.
void fillBlock(Kind kind, uint32_t seed, uint64_t block, uint8_t *out) {
  switch (kind) {
    case Kind::Text: {
      memcpy(out, textTemplate(seed).data(), kBlock);
      char stamp[32];
      int n = snprintf(stamp, sizeof stamp, "block %012" PRIu64 "\n", block);
      memcpy(out, stamp, static_cast<size_t>(n));
      return;
    }
    case Kind::Binary: {
      uint64_t state = (static_cast<uint64_t>(seed) << 32) ^ block;
      for (uint64_t i = 0; i < kBlock / 16; i++) {
        state = state * 6364136223846793005ULL + 1442695040888963407ULL;
        uint32_t record[4] = {static_cast<uint32_t>(block * 4096 + i), static_cast<uint32_t>(0x400000 + i * 24),
                              static_cast<uint32_t>((state >> 40) % 64) | (1u << 16),
                              0x10000000u | static_cast<uint32_t>((state >> 50) % 256)};
        memcpy(out + i * 16, record, sizeof record);
      }
      return;
    }
    case Kind::Noise: {
      uint64_t state = splitMix((static_cast<uint64_t>(seed) << 40) ^ block);
      for (uint64_t i = 0; i < kBlock; i += 8) {
        state ^= state << 13;
        state ^= state >> 7;
        state ^= state << 17;
        memcpy(out + i, &state, 8);
      }
      return;
    }
  }
}

// Mach-O headers laid over the start of a file (the values as they lie on disk).
void put32(std::vector<uint8_t> &bytes, size_t at, uint32_t value, bool bigEndian) {
  if (bytes.size() < at + 4) bytes.resize(at + 4, 0);
  for (int i = 0; i < 4; i++)
    bytes[at + static_cast<size_t>(i)] = static_cast<uint8_t>(value >> (bigEndian ? 24 - 8 * i : 8 * i));
}

// A thin header: 64-bit little-endian (cf fa ed fe) or 32-bit big-endian (fe ed fa ce).
std::vector<uint8_t> thinMachO(uint32_t fileType, bool bigEndian32 = false) {
  std::vector<uint8_t> header;
  put32(header, 0, bigEndian32 ? 0xfeedface : 0xfeedfacf, bigEndian32);
  put32(header, 4, 0x01000007, bigEndian32);
  put32(header, 8, 3, bigEndian32);
  put32(header, 12, fileType, bigEndian32);
  header.resize(32, 0);
  return header;
}

// A universal header (ca fe ba be, big-endian) of archCount records whose first slice, at
// sliceOffset, is a thin file of fileType.
std::vector<uint8_t> fatMachO(uint32_t archCount, uint32_t sliceOffset, uint32_t fileType) {
  std::vector<uint8_t> header;
  put32(header, 0, 0xcafebabe, true);
  put32(header, 4, archCount, true);
  for (uint32_t i = 0; i < std::min(archCount, 4u); i++) {
    size_t record = 8 + 20 * i;
    put32(header, record, 0x01000007, true);
    put32(header, record + 4, 3, true);
    put32(header, record + 8, sliceOffset + i * 65536, true);
    put32(header, record + 12, 65536, true);
    put32(header, record + 16, 12, true);
  }
  header.resize(sliceOffset, 0);
  std::vector<uint8_t> slice = thinMachO(fileType);
  header.insert(header.end(), slice.begin(), slice.end());
  return header;
}

struct TreeFile {
  std::string path;  // relative to the tree's root
  Kind kind = Kind::Text;
  uint64_t size = 0;
  uint32_t seed = 0;
  std::vector<uint8_t> head;  // laid over the first bytes
  // What the run must make of it.
  bool streamed = true;         // handed to the pipeline (not a "._" file)
  bool toCompression = false;   // handed to compression: not empty, and the rules allow it
  bool compressed = false;      // ends compressed
};

// Bytes [offset, offset + count) of the file; count stays within one block.
void fillRange(const TreeFile &file, uint64_t offset, uint8_t *out, size_t count, std::vector<uint8_t> &block) {
  uint64_t index = offset / kBlock, within = offset % kBlock;
  fillBlock(file.kind, file.seed, index, block.data());
  memcpy(out, block.data() + within, count);
  if (offset < file.head.size()) {
    size_t overlap = std::min<size_t>(count, file.head.size() - offset);
    memcpy(out, file.head.data() + offset, overlap);
  }
}

void writeTreeFile(const std::string &root, const TreeFile &file) {
  std::string path = root + "/" + file.path;
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  ASSERT_GE(fd, 0) << path << ": " << strerror(errno);
  std::vector<uint8_t> block(kBlock), piece(kBlock);
  for (uint64_t offset = 0; offset < file.size; offset += kBlock) {
    size_t count = static_cast<size_t>(std::min(kBlock, file.size - offset));
    fillRange(file, offset, piece.data(), count, block);
    ASSERT_EQ(write(fd, piece.data(), count), static_cast<ssize_t>(count)) << path << ": " << strerror(errno);
  }
  close(fd);
}

// Reads the file back through catFile and compares it with what was written; the first
// difference is reported.
void expectReadsBack(const std::string &path, const TreeFile &file) {
  std::vector<uint8_t> block(kBlock), expected(kBlock);
  uint64_t offset = 0;
  bool differs = false;
  uint64_t firstDifference = 0;
  std::string errors = catFileTo(path, [&](const uint8_t *bytes, size_t count) {
    while (count > 0 && !differs) {
      if (offset >= file.size) {
        differs = true;
        firstDifference = offset;
        return;
      }
      size_t take = static_cast<size_t>(std::min<uint64_t>({count, kBlock - offset % kBlock, file.size - offset}));
      fillRange(file, offset, expected.data(), take, block);
      if (memcmp(bytes, expected.data(), take) != 0) {
        differs = true;
        firstDifference = offset;
        return;
      }
      offset += take;
      bytes += take;
      count -= take;
    }
  });
  EXPECT_EQ(errors, "") << file.path;
  EXPECT_FALSE(differs) << file.path << ": differs from byte " << firstDifference;
  EXPECT_EQ(offset, file.size) << file.path << ": read back " << offset << " bytes of " << file.size;
}

// How the file is stored, through the library's query and the flag word.
void expectStoredAsPlanned(const std::string &path, const TreeFile &file) {
  CompressionInfo info{};
  ASSERT_EQ(queryCompressionInfo(path.c_str(), &info), 0) << file.path;
  platform::Stat st;
  ASSERT_EQ(platform::stat(path.c_str(), &st), 0) << file.path;
  bool flagged = (st.st_flags & kFlagCompressed) != 0;
  EXPECT_EQ(info.uncompressedSize, file.size) << file.path;
  if (file.compressed) {
    EXPECT_TRUE(flagged) << file.path << " should be compressed";
    EXPECT_THAT(info.compressionType, ::testing::AnyOf(3u, 4u)) << file.path;
    if (file.size > kMiB) {
      EXPECT_EQ(info.compressionType, 4u) << file.path;
    }
    EXPECT_LT(info.compressedSize, file.size) << file.path;
    EXPECT_EQ(st.st.st_size, 0) << file.path << ": a compressed file keeps an empty data fork";
  } else {
    EXPECT_FALSE(flagged) << file.path << " should be left plain";
    EXPECT_EQ(info.compressionType, 0u) << file.path;
    EXPECT_EQ(static_cast<uint64_t>(st.st.st_size), file.size) << file.path;
  }
}

// The tree: the plan of every file, written under root.
struct Tree {
  std::vector<TreeFile> files;
  uint64_t bytes = 0;
};

// Cheap deterministic sizes, log-uniform between low and high.
uint64_t logUniform(uint64_t &state, uint64_t low, uint64_t high) {
  state = splitMix(state);
  double unit = static_cast<double>(state >> 11) / 9007199254740992.0;
  return static_cast<uint64_t>(static_cast<double>(low) * std::pow(static_cast<double>(high) / static_cast<double>(low), unit));
}

Tree planTree() {
  Tree tree;
  uint32_t seed = 1;
  auto add = [&](const std::string &path, Kind kind, uint64_t size, std::vector<uint8_t> head = {}) -> TreeFile & {
    TreeFile file;
    file.path = path;
    file.kind = kind;
    file.size = size;
    file.seed = seed++;
    file.head = std::move(head);
    tree.files.push_back(std::move(file));
    return tree.files.back();
  };

  // At and around the 64 MiB limit of type 4, and one far beyond it, which streams through its
  // pool's ring.
  add("big/exactly-64MiB.log", Kind::Text, kType4Limit);
  add("big/64MiB-and-1.log", Kind::Text, kType4Limit + 1);
  add("big/200MiB.log", Kind::Text, 200 * kMiB);
  add("big/noise-64MiB.bin", Kind::Noise, kType4Limit);

  // Bulk: text, binary-like and incompressible files of 4 KiB to 24 MiB in nested directories.
  uint64_t state = 42;
  const Kind kinds[] = {Kind::Text, Kind::Text, Kind::Binary, Kind::Noise};
  for (int i = 0; i < 760; i++) {
    Kind kind = kinds[i % 4];
    uint64_t size = logUniform(state, 4096, i % 40 == 0 ? 24 * kMiB : 6 * kMiB);
    // Binary data keeps about half: a file of a few blocks may save no whole block.
    if (kind == Kind::Binary) size = std::clamp<uint64_t>(size, kBlock, 12 * kMiB);
    std::string name = "tree/d" + std::to_string(i % 13) + "/e" + std::to_string(i % 5) + "/file" + std::to_string(i) +
                       (kind == Kind::Text ? ".txt" : kind == Kind::Binary ? ".dat" : ".raw");
    add(name, kind, size);
  }
  // Sizes around the 64 KiB chunk and the 4 KiB block.
  for (uint64_t size : {4096ull, 4097ull, 65535ull, 65536ull, 65537ull, 131072ull + 1})
    add("edges/text-" + std::to_string(size) + ".txt", Kind::Text, size);

  for (int i = 0; i < 6; i++) add("empty/empty" + std::to_string(i), Kind::Text, 0);
  // Copied as they are, whatever their content.
  for (int i = 0; i < 6; i++) add("tree/d" + std::to_string(i) + "/._file" + std::to_string(i), Kind::Text, 20000 + 7000 * i);
  add("._top", Kind::Text, 3 * kMiB);

  // Excluded by the rules file: a suffix anywhere, and everything under /plain/ of the
  // destination root.
  for (int i = 0; i < 8; i++) add("tree/d" + std::to_string(i) + "/kept" + std::to_string(i) + ".keep", Kind::Text, 50000 + 90000 * i);
  for (int i = 0; i < 5; i++) add("plain/file" + std::to_string(i) + ".txt", Kind::Text, 400000 + 100000 * i);
  add("plain/sub/deeper.txt", Kind::Text, 2 * kMiB);
  add("notplain/plain/inner.txt", Kind::Text, 300000);  // /plain/ not at the root: compressed
  // Excluded by the shipped rules (already-compressed formats), though their content shrinks.
  for (const char *name : {"photo.jpg", "archive.zip", "bundle.tar.gz", "image.PNG", "sound.flac"})
    add(std::string("media/") + name, Kind::Text, 700000);

  // Mach-O files, with --skip-macho MH_EXECUTE,MH_DYLIB: skipped are the executable, the
  // dynamic libraries (thin big-endian 32-bit, and the first slice of a universal file);
  // compressed are a bundle, a universal file whose first slice is an object file, and a
  // universal header declaring 25 architectures, which is no Mach-O file.
  add("macho/tool", Kind::Text, 900000, thinMachO(2));
  add("macho/libbig.dylib", Kind::Text, 300000, thinMachO(6, true));
  add("macho/universal.dylib", Kind::Binary, 2 * kMiB, fatMachO(2, 4096, 6));
  add("macho/plugin.bundle", Kind::Text, 500000, thinMachO(8));
  add("macho/universal.o", Kind::Text, 600000, fatMachO(2, 8192, 1));
  add("macho/not-universal", Kind::Text, 400000, fatMachO(25, 4096, 2));

  for (TreeFile &file : tree.files) {
    std::string name = file.path.substr(file.path.rfind('/') + 1);
    bool dotUnderscore = name.compare(0, 2, "._") == 0;
    bool excluded = file.path.size() >= 5 && file.path.compare(file.path.size() - 5, 5, ".keep") == 0;
    excluded = excluded || file.path.compare(0, 6, "plain/") == 0 || file.path.compare(0, 6, "media/") == 0;
    bool skippedMachO = file.path == "macho/tool" || file.path == "macho/libbig.dylib" || file.path == "macho/universal.dylib";
    file.streamed = !dotUnderscore;
    file.toCompression = file.streamed && file.size > 0 && !excluded;
    file.compressed = file.toCompression && !skippedMachO && file.kind != Kind::Noise && file.size <= kType4Limit;
    tree.bytes += file.size;
  }
  return tree;
}

const char kRules[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><array>"
    "<dict><key>RuleType</key><string>Exclude</string><key>PathEndsWithString</key><string>.keep</string></dict>"
    "<dict><key>RuleType</key><string>Exclude</string><key>PathBeginsWithString</key><string>/plain/</string></dict>"
    "<dict><key>RuleType</key><string>Include</string><key>PathEndsWithString</key><string>.jpg</string></dict>"
    "</array></plist>\n";

TEST(PlzcInstallLarge, TreeOverOneGiBIsCopiedAndCompressedAsTheRulesSay) {
  ScratchDir dir;
  ASSERT_FALSE(dir.path().empty());
  Tree tree = planTree();
  ASSERT_GE(tree.bytes, 1ull << 30) << "the tree must hold at least 1 GiB";

  auto generationStart = std::chrono::steady_clock::now();
  std::string source = dir.file("src");
  for (const TreeFile &file : tree.files) {
    std::filesystem::create_directories(std::filesystem::path(source + "/" + file.path).parent_path());
    writeTreeFile(source, file);
    if (::testing::Test::HasFatalFailure()) return;
  }
  double generationSeconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - generationStart).count();
  std::string rules = writeFile(dir.file("rules.plist"), std::string(kRules));

  std::string dest = dir.file("dest");
  Finished run = plzc({"install", "-v", "-j", "2", "--rules", rules, "--skip-macho", "MH_EXECUTE,MH_DYLIB", source, dest});
  std::cout << "plzc install of " << tree.files.size() << " files, " << tree.bytes << " bytes: " << run.seconds
            << " s, peak resident memory " << run.maxRssKiB / 1024 << " MiB (tree written in " << generationSeconds
            << " s)\n";
  ::testing::Test::RecordProperty("installSeconds", std::to_string(run.seconds));
  ::testing::Test::RecordProperty("installPeakRssMiB", std::to_string(run.maxRssKiB / 1024));
  ASSERT_EQ(run.status, 0) << run.err;

  uint64_t compressed = 0, empty = 0, items = 0;
  for (const TreeFile &file : tree.files) {
    compressed += file.compressed;
    empty += file.size == 0;
    items += file.toCompression ? 2 : file.streamed ? 1 : 0;
  }
  // The summary's counts are read from the files; the pipeline line from the queue's finish.
  EXPECT_THAT(run.err, ::testing::HasSubstr("files       " + std::to_string(tree.files.size()) + ": " +
                                           std::to_string(compressed) + " compressed"));
  EXPECT_THAT(run.err, ::testing::HasSubstr(", " + std::to_string(empty) + " empty"));
  size_t line = run.err.find("  pipeline ");
  ASSERT_NE(line, std::string::npos) << run.err;
  unsigned long long queued = 0, started = 0, completed = 0;
  char outcome[32] = "";
  ASSERT_EQ(sscanf(run.err.c_str() + line, " pipeline %llu items queued, %llu started, %llu completed; finish %31s",
                   &queued, &started, &completed, outcome),
            4)
      << run.err.substr(line);
  EXPECT_EQ(queued, items);
  EXPECT_EQ(started, queued);
  EXPECT_EQ(completed, queued);
  EXPECT_STREQ(outcome, "succeeded");

  auto verifyStart = std::chrono::steady_clock::now();
  for (const TreeFile &file : tree.files) {
    std::string path = dest + "/" + file.path;
    expectStoredAsPlanned(path, file);
    expectReadsBack(path, file);
  }
  std::cout << "read back and checked in "
            << std::chrono::duration<double>(std::chrono::steady_clock::now() - verifyStart).count() << " s\n";
}

}  // namespace
