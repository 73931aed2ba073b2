#include "Common/MachOFilter.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>

#include "Common/OverlayFile.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::MatchesRegex;
using ::testing::internal::CaptureStderr;
using ::testing::internal::GetCapturedStderr;

namespace {

const std::string kPrefix = "Common/StreamCompressor:[0-9]+: ";

PVArrayRef array(std::initializer_list<PVRef> elements) {
  PVMutableArrayRef result = PVArrayCreateMutable(0);
  for (PVRef element : elements) {
    PVArrayAppendValue(result, element);
    PVRelease(element);
  }
  return result;
}
PVRef str(const char *text) { return PVStringCreateWithCString(text, kPVStringEncodingUTF8); }
PVRef num(int32_t value) { return PVNumberCreateInt32(value); }

PVDictionaryRef options(PVArrayRef types, PVArrayRef overrides = nullptr) {
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  if (types) PVDictionarySetValue(dictionary, kPLZCSkipMachOFileTypes, types);
  if (overrides) PVDictionarySetValue(dictionary, kPLZCSkipMachOOverridePaths, overrides);
  PVRelease(types);
  PVRelease(overrides);
  return dictionary;
}

struct MaskCase {
  std::vector<PVRef> items;
  uint32_t mask;
  int result;
  std::string printed;
};

TEST(MachOTypeMask, NamesNumbersAndStars) {
  MaskCase cases[] = {
      {{str("MH_EXECUTE"), str("MH_DYLIB")}, 0x44, 0, ""},
      {{num(31)}, 0x80000000, 0, ""},
      {{num(32)}, 0, -1, kPrefix + "Error: invalid item '32' at index 0 in SkipMachOFileTypes dictionary\n"},
      {{num(0)}, 0, -1, kPrefix + "Error: invalid item '0' at index 0 in SkipMachOFileTypes dictionary\n"},
      {{str("MH_SOMETHING")}, 0, -1,
       kPrefix + "Error: invalid item 'MH_SOMETHING' at index 0 in SkipMachOFileTypes dictionary\n"},
      {{str("mh_execute")}, 0, -1,
       kPrefix + "Error: invalid item 'mh_execute' at index 0 in SkipMachOFileTypes dictionary\n"},
      {{str("bogus"), str("*")}, 0xFFFFFFFF, 0,
       kPrefix + "Error: invalid item 'bogus' at index 0 in SkipMachOFileTypes dictionary\n"},
      {{str("*"), str("bogus")}, 0xFFFFFFFF, 0, ""},
      {{num(-1)}, 0xFFFFFFFF, 0, ""},
      {{kPVBooleanTrue, num(2)}, 0x4, -1,
       kPrefix + "Error: invalid item 'true' at index 0 in SkipMachOFileTypes dictionary\n"},
      {{}, 0, 0, ""},
  };
  for (MaskCase &c : cases) {
    PVMutableArrayRef items = PVArrayCreateMutable(0);
    for (PVRef item : c.items) {
      PVArrayAppendValue(items, item);
      PVRelease(item);
    }
    PVDictionaryRef dictionary = options(items);
    uint32_t mask = 12345;
    CaptureStderr();
    int result = _ComputeMachOTypeMask(&mask, dictionary);
    std::string printed = GetCapturedStderr();
    EXPECT_EQ(mask, c.mask) << c.printed;
    EXPECT_EQ(result, c.result) << c.printed;
    EXPECT_THAT(printed, MatchesRegex(c.printed));
    PVRelease(dictionary);
  }
  // A value that is not an array leaves the filter off.
  PVMutableDictionaryRef notArray = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  PVRef text = str("MH_EXECUTE");
  PVDictionarySetValue(notArray, kPLZCSkipMachOFileTypes, text);
  PVRelease(text);
  uint32_t mask = 1;
  EXPECT_EQ(_ComputeMachOTypeMask(&mask, notArray), 0);
  EXPECT_EQ(mask, 0u);
  PVRelease(notArray);
}

TEST(MachOTypeMask, OverridePathsOnlyWithAMask) {
  PVDictionaryRef dictionary = options(array({str("*")}), array({str("/usr/lib/a"), str("/usr/lib/a"), num(3)}));
  PVDictionaryRef set = createMachOOverridePaths(0xFFFFFFFF, dictionary);
  ASSERT_NE(set, nullptr);
  EXPECT_EQ(PVDictionaryGetCount(set), 2);  // duplicates collapse
  PVRelease(set);
  EXPECT_EQ(createMachOOverridePaths(0, dictionary), nullptr);
  PVRelease(dictionary);
  PVDictionaryRef empty = options(array({str("*")}), array({}));
  EXPECT_EQ(createMachOOverridePaths(0xFFFFFFFF, empty), nullptr);
  PVRelease(empty);
}

// File bytes behind an overlay that reads them once, as from a pool.
class HeaderTest : public ::testing::Test {
 protected:
  static int64_t readOnce(FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
    auto *self = static_cast<HeaderTest *>(fh->priv);
    if (offset != self->position) return -1;
    int64_t n = std::min<int64_t>(count, static_cast<int64_t>(self->bytes.size()) - offset);
    if (n > 0) memcpy(buffer, self->bytes.data() + offset, static_cast<size_t>(n));
    self->position += n;
    return n;
  }
  static int64_t size(FileHandle *fh) { return static_cast<int64_t>(static_cast<HeaderTest *>(fh->priv)->bytes.size()); }

  // Runs the test on bytes and checks that a reader then gets every byte from offset 0.
  bool skipped(std::vector<uint8_t> file, uint32_t mask, PVDictionaryRef overrides = nullptr,
               const char *path = "/Volumes/T/usr/bin/tool", int32_t canUnread = 1) {
    bytes = std::move(file);
    position = 0;
    base = FileHandle{};
    base.name = base.path = const_cast<char *>("pool");
    base.pread = readOnce;
    base.size = size;
    base.priv = this;
    PVMutableDictionaryRef dict = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    FileHandle *overlay = openTocFile(&base, dict, canUnread);
    bool result = _ShouldSkipMachOFile(path, "/Volumes/T", mask, overrides, overlay);
    std::vector<uint8_t> again(bytes.size());
    EXPECT_EQ(overlay->pread(overlay, again.data(), static_cast<int64_t>(again.size()), 0),
              static_cast<int64_t>(bytes.size()));
    EXPECT_EQ(again, bytes);
    overlay->close(overlay);
    PVRelease(dict);
    return result;
  }

  static std::vector<uint8_t> thin(uint32_t magic, uint32_t type, bool swapped, size_t size = 4096) {
    std::vector<uint8_t> file = randomBytes(size, type);
    uint32_t typeField = swapped ? __builtin_bswap32(type) : type;
    memcpy(file.data(), &magic, 4);
    memcpy(file.data() + 12, &typeField, 4);
    return file;
  }

  static std::vector<uint8_t> fat(uint32_t architectures, uint32_t sliceOffset, uint32_t type) {
    std::vector<uint8_t> file = randomBytes(sliceOffset + 8192, 5);
    const uint8_t magic[4] = {0xca, 0xfe, 0xba, 0xbe};
    memcpy(file.data(), magic, 4);
    uint32_t count = __builtin_bswap32(architectures), offset = __builtin_bswap32(sliceOffset);
    memcpy(file.data() + 4, &count, 4);
    memcpy(file.data() + 16, &offset, 4);
    std::vector<uint8_t> slice = thin(0xfeedfacf, type, false, 16);
    std::copy(slice.begin(), slice.end(), file.begin() + sliceOffset);
    return file;
  }

  std::vector<uint8_t> bytes;
  int64_t position = 0;
  FileHandle base{};
};

TEST_F(HeaderTest, ThinFilesOfMaskedTypesAreSkipped) {
  EXPECT_TRUE(skipped(thin(0xfeedfacf, 2, false), 1u << 2));
  EXPECT_TRUE(skipped(thin(0xcffaedfe, 2, true), 1u << 2));  // the bytes fe ed fa cf
  EXPECT_TRUE(skipped(thin(0xfeedface, 6, false), 1u << 6));
  EXPECT_TRUE(skipped(thin(0xcefaedfe, 6, true), 1u << 6));
  EXPECT_FALSE(skipped(thin(0xfeedfacf, 2, false), 1u << 6));
  EXPECT_FALSE(skipped(thin(0xfeedfacf, 0, false), 0xFFFFFFFF));
  EXPECT_TRUE(skipped(thin(0xfeedfacf, 9, false), 0xFFFFFFFF));
  EXPECT_FALSE(skipped(randomBytes(5000, 1), 0xFFFFFFFF));  // not Mach-O
  EXPECT_FALSE(skipped({0xcf, 0xfa, 0xed, 0xfe, 2}, 0xFFFFFFFF));  // shorter than a header
  EXPECT_FALSE(skipped({}, 0xFFFFFFFF));
}

TEST_F(HeaderTest, OverridePathsAreCompressedWhateverTheirType) {
  PVMutableDictionaryRef overrides = PVDictionaryCreateMutable(0, kPVDictionaryPlainValues);
  PVRef path = str("/usr/bin/tool");
  PVDictionarySetValue(overrides, path, reinterpret_cast<const void *>(intptr_t{1}));
  PVRelease(path);
  EXPECT_FALSE(skipped(thin(0xfeedfacf, 2, false), 1u << 2, overrides));
  EXPECT_TRUE(skipped(thin(0xfeedfacf, 2, false), 1u << 2, overrides, "/Volumes/T/usr/bin/other"));
  // A path outside the root is matched whole.
  EXPECT_TRUE(skipped(thin(0xfeedfacf, 2, false), 1u << 2, overrides, "/elsewhere/usr/bin/tool"));
  PVRelease(overrides);
}

TEST_F(HeaderTest, UniversalFilesAreJudgedByTheirFirstSlice) {
  EXPECT_TRUE(skipped(fat(2, 4096, 6), 1u << 6));  // 4124 bytes held and pushed back
  EXPECT_FALSE(skipped(fat(2, 4096, 6), 1u << 2));
  EXPECT_FALSE(skipped(fat(20, 4096, 6), 0xFFFFFFFF));  // too many architectures: not Mach-O
  EXPECT_FALSE(skipped(fat(1, 64, 0), 0xFFFFFFFF));
  // A slice offset beyond the file: the short read is reported, the bytes still pushed back.
  std::vector<uint8_t> truncated = fat(1, 4096, 6);
  truncated.resize(1000);
  CaptureStderr();
  EXPECT_FALSE(skipped(truncated, 0xFFFFFFFF));
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex(kPrefix + "read header of '/Volumes/T/usr/bin/tool': .*\n"));
}

TEST_F(HeaderTest, HandleThatCannotUnreadIsNotTested) {
  CaptureStderr();
  bytes = thin(0xfeedfacf, 2, false);
  base = FileHandle{};
  base.pread = readOnce;
  base.priv = this;
  PVMutableDictionaryRef dict = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  FileHandle *overlay = openTocFile(&base, dict, 0);
  EXPECT_FALSE(_ShouldSkipMachOFile("/p", nullptr, 0xFFFFFFFF, nullptr, overlay));
  EXPECT_EQ(position, 0);  // nothing was read
  EXPECT_THAT(GetCapturedStderr(), MatchesRegex(kPrefix + "Error: fh doesn't support unreading\n"));
  overlay->close(overlay);
  PVRelease(dict);
}

}  // namespace
