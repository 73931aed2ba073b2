#include <optional>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Common/FileHandle.h"
#include "CompressorTestHelpers.h"
#include "Compressors/Zlib/Type3/compressorType3.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/Syscalls.h"

using namespace plzctest;
using ::testing::ContainsRegex;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

// Cases print as their names.
template <typename Case>
  requires requires(const Case &c) { c.name; }
std::ostream &operator<<(std::ostream &os, const Case &c) {
  return os << c.name;
}

constexpr int kLevel = 5;

class Type3 : public CompressorTest {
 protected:
  int compress(FileHandle *fh, int level = kLevel) {
    void *context = initCompressorType3(nullptr, nullptr, level, 0);
    EXPECT_NE(context, nullptr);
    int result = compressFileType3(fh, fh->path, fh->size(fh), context);
    freeContextType3(context);
    return result;
  }
};

// Reads a range of a type-3 file from its header attribute; *result gets the result.
Bytes readType3(const Bytes &attr, int64_t offset, uint64_t size, const std::vector<size_t> &splits,
                int64_t *result) {
  Bytes block = attrBuffer(attr);
  Bytes out(size);
  std::vector<struct iovec> vectors = splitVectors(out, size, splits);
  *result = doUncompressType3(nullptr, offset, size, static_cast<uint32_t>(vectors.size()), vectors.data(),
                              block.data());
  out.resize(*result > 0 ? static_cast<size_t>(*result) : 0);
  return out;
}

TEST_F(Type3, EmptyFileSucceedsWithoutReadingOrWriting) {
  FileHandle *fh = open({});
  uint64_t reads = sys::callCount(sys::Call::Pread);
  EXPECT_EQ(compress(fh), 0);
  EXPECT_EQ(sys::callCount(sys::Call::Pread), reads);
  EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);
}

struct FileCase {
  const char *name;
  Bytes data;
  int expected;
  bool stored;
};

class Type3Files : public Type3, public ::testing::WithParamInterface<FileCase> {};

TEST_P(Type3Files, TakenWhenTheOneChunkFitsBehindTheHeader) {
  const FileCase &c = GetParam();
  FileHandle *fh = open(c.data);
  CaptureStdout();
  CaptureStderr();
  EXPECT_EQ(compress(fh), c.expected);
  EXPECT_EQ(GetCapturedStderr(), "");
  EXPECT_EQ(GetCapturedStdout(), "") << "a refusal is quiet";
  std::optional<Bytes> attr = attribute(fh, kDecmpfsXattrName);
  if (c.expected != 0) {
    EXPECT_EQ(attr, std::nullopt);
    return;
  }
  ASSERT_TRUE(attr.has_value());
  ASSERT_GT(attr->size(), 16u);
  EXPECT_LE(attr->size(), 3802u);
  EXPECT_EQ(std::string(attr->begin(), attr->begin() + 4), "fpmc");
  EXPECT_EQ(loadLE32(attr->data() + 4), 3u);
  EXPECT_EQ(loadLE64(attr->data() + 8), c.data.size());
  EXPECT_EQ((*attr)[16] == 0xFF, c.stored);
  if (c.stored) {
    EXPECT_EQ(Bytes(attr->begin() + 17, attr->end()), c.data);
  }
  int64_t result = 0;
  EXPECT_EQ(readType3(*attr, 0, c.data.size(), {}, &result), c.data);
}

INSTANTIATE_TEST_SUITE_P(Files, Type3Files,
                         ::testing::Values(FileCase{"OneRandomByteIsStored", randomBytes(1, 1), 0, true},
                                           FileCase{"RandomFillsTheAttributeExactly", randomBytes(3785, 1), 0, true},
                                           FileCase{"RandomOneByteTooMany", randomBytes(3786, 1), -1, false},
                                           FileCase{"CompressibleWholeChunk", repeatedBlock(131072, 1), 0, false},
                                           FileCase{"RandomWholeChunk", randomBytes(131072, 1), -1, false}),
                         kCaseName);

// A stream aimed at each length around the attribute's limit of 16 + 3786 bytes.
class Type3StreamLengths : public Type3, public ::testing::WithParamInterface<size_t> {};

TEST_P(Type3StreamLengths, OnlyStreamsThatFitBehindTheHeaderAreTaken) {
  size_t streamLength = GetParam();
  std::optional<Bytes> data = dataWithStreamLength(streamLength, 8000, kLevel);
  ASSERT_TRUE(data.has_value()) << "no test data with that stream length";
  FileHandle *fh = open(*data);
  EXPECT_EQ(compress(fh), streamLength <= 3786 ? 0 : -1);
  std::optional<Bytes> attr = attribute(fh, kDecmpfsXattrName);
  EXPECT_EQ(attr.has_value() ? attr->size() : 0, streamLength <= 3786 ? 16 + streamLength : 0);
}

INSTANTIATE_TEST_SUITE_P(Limits, Type3StreamLengths, ::testing::Values(3786, 3787, 3802, 3803),
                         [](const auto &info) { return "Stream" + std::to_string(info.param); });

TEST_F(Type3, FileOverOneChunkIsRefusedBeforeAnyRead) {
  FileHandle *fh = open(Bytes(131073, 0));
  uint64_t reads = sys::callCount(sys::Call::Pread);
  EXPECT_EQ(compress(fh), -1);
  EXPECT_EQ(sys::callCount(sys::Call::Pread), reads);
  EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);
}

TEST_F(Type3, LevelComesFromTheContext) {
  FileHandle *fh = open(Bytes(3000, 'x'));
  ASSERT_EQ(compress(fh, 0), 0);  // level 0 never shrinks: stored
  EXPECT_EQ(attribute(fh, kDecmpfsXattrName).value_or(Bytes(17)).at(16), 0xFF);
  ASSERT_EQ(compress(fh), 0);
  EXPECT_LT(attribute(fh, kDecmpfsXattrName).value_or(Bytes(3017)).size(), 100u);
}

TEST_F(Type3, FailedAttributeWriteIsReported) {
  FileHandle *fh = open(Bytes(1000, 'a'));
  sys::armFault(sys::Call::Fsetxattr, 1, ENOSPC, true);
  CaptureStderr();
  EXPECT_EQ(compress(fh), -1);
  std::string printed = GetCapturedStderr();
  sys::clearFaults();
  EXPECT_THAT(printed, ContainsRegex("Compressors/Zlib/Type3/compressorType3Imp:[0-9]+: setxattr " +
                                     std::string(fh->path) + ": No space left on device\n$"));
  EXPECT_EQ(attribute(fh, kDecmpfsXattrName), std::nullopt);
}

class Type3Reads : public Type3, public ::testing::WithParamInterface<std::tuple<ReadRange, bool>> {};

TEST_P(Type3Reads, ReturnTheSameBytesForStoredAndCompressedFiles) {
  const ReadRange &range = std::get<0>(GetParam());
  bool stored = std::get<1>(GetParam());
  Bytes data = stored ? randomBytes(3785, 3) : repeatedBlock(3785, 3);
  FileHandle *fh = open(data);
  ASSERT_EQ(compress(fh), 0);
  std::optional<Bytes> attr = attribute(fh, kDecmpfsXattrName);
  ASSERT_TRUE(attr.has_value());
  ASSERT_EQ((*attr)[16] == 0xFF, stored);
  int64_t result = 0;
  EXPECT_EQ(readType3(*attr, range.offset, range.size, range.splits, &result), slice(data, range.offset, range.size));
  EXPECT_EQ(result, static_cast<int64_t>(range.size));
}

INSTANTIATE_TEST_SUITE_P(
    Ranges, Type3Reads,
    ::testing::Combine(::testing::Values(ReadRange{"Whole", 0, 3785, {}}, ReadRange{"LastByte", 3784, 1, {}},
                                         ReadRange{"MiddleInThreeVectors", 7, 3000, {1, 2000}},
                                         ReadRange{"ToTheEndInVectors", 2500, 1285, {0, 285, 500}}),
                       ::testing::Bool()),
    [](const auto &info) {
      return std::string(std::get<0>(info.param).name) + (std::get<1>(info.param) ? "_stored" : "_compressed");
    });

TEST_F(Type3, ReadsReachingPastTheOneChunkFail) {
  FileHandle *fh = open(repeatedBlock(131072, 4));
  ASSERT_EQ(compress(fh), 0);
  std::optional<Bytes> attr = attribute(fh, kDecmpfsXattrName);
  ASSERT_TRUE(attr.has_value());
  for (auto [offset, size] : {std::pair<int64_t, uint64_t>{131072, 1}, {131000, 100}, {200000, 10}}) {
    CaptureStdout();
    CaptureStderr();
    int64_t result = 0;
    readType3(*attr, offset, size, {}, &result);
    std::string errors = GetCapturedStderr();
    EXPECT_EQ(result, -1) << offset;
    EXPECT_EQ(GetCapturedStdout(), "too many chunks for type 3");
    EXPECT_THAT(errors, MatchesRegex("Common/commonUtils:[0-9]+: supplyChunk: .*\n"));
  }
}

struct MalformedCase {
  const char *name;
  std::optional<Bytes> attribute;  // nullopt: no attribute at all
  const char *message;
};

class Type3Malformed : public Type3, public ::testing::WithParamInterface<MalformedCase> {};

TEST_P(Type3Malformed, AttributeFailsTheReadWithoutReadingPastIt) {
  const MalformedCase &c = GetParam();
  Bytes block = c.attribute ? attrBuffer(*c.attribute) : Bytes{};
  Bytes out(10);
  struct iovec vector = {out.data(), out.size()};
  CaptureStderr();
  EXPECT_EQ(doUncompressType3(nullptr, 0, out.size(), 1, &vector, c.attribute ? block.data() : nullptr), -1);
  std::string errors = GetCapturedStderr();
  EXPECT_THAT(errors, ContainsRegex(std::string("^Compressors/Zlib/Type3/compressorType3Imp:[0-9]+: ") + c.message));
  EXPECT_THAT(errors, ContainsRegex("Common/commonUtils:[0-9]+: supplyChunk: .*\n$"));
}

INSTANTIATE_TEST_SUITE_P(
    Attributes, Type3Malformed,
    ::testing::Values(MalformedCase{"Missing", std::nullopt, "null attr: "},
                      MalformedCase{"ShorterThanTheHeader", Bytes(10, 0),
                                    "sz -6 is greater than cmpSize 131073: Invalid argument\n"},
                      MalformedCase{"LongerThanAChunk", Bytes(16 + 131074, 0xFF), "vnode_fetch_compressed_attr: "}),
    kCaseName);

}  // namespace
