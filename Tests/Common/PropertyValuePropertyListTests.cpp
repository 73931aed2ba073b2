#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "PropertyValue.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

PVRef parse(const std::string &xml) {
  PVDataRef data = PVDataCreate(xml.data(), static_cast<PVIndex>(xml.size()));
  PVRef value = PVPropertyListCreateWithXMLData(data);
  PVRelease(data);
  return value;
}

std::string describe(PVRef value) {
  char *text = PVCopyDescriptionCString(value);
  std::string result = text ? text : "(null)";
  free(text);
  return result;
}

const std::string kHead = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<!-- a comment -->\n<plist version=\"1.0\">";

TEST(PropertyList, EveryKindBecomesItsValue) {
  PVRef value = parse(kHead +
                      "<dict><key>s</key><string>caf\xC3\xA9</string><key>i</key><integer>-5</integer>"
                      "<key>big</key><integer>9000000000</integer><key>r</key><real>5.5</real>"
                      "<key>t</key><true/><key>f</key><false/><key>d</key><data>AAEC/w==</data>"
                      "<key>a</key><array><string>x</string><array/></array></dict></plist>");
  ASSERT_EQ(PVGetType(value), kPVTypeDictionary);
  auto dictionary = static_cast<PVDictionaryRef>(value);
  auto get = [&](const char *name) {
    PVStringRef key = PVStringCreateWithCString(name, kPVStringEncodingUTF8);
    PVRef found = PVDictionaryGetValue(dictionary, key);
    PVRelease(key);
    return found;
  };
  int64_t integer = 0;
  EXPECT_TRUE(PVNumberGetInt64(static_cast<PVNumberRef>(get("i")), &integer));
  EXPECT_EQ(integer, -5);
  EXPECT_TRUE(PVNumberGetInt64(static_cast<PVNumberRef>(get("big")), &integer));
  EXPECT_EQ(integer, 9000000000);
  int32_t level;
  EXPECT_FALSE(PVNumberGetInt32(static_cast<PVNumberRef>(get("r")), &level));  // 5.5 is not a level
  EXPECT_TRUE(PVBooleanGetValue(static_cast<PVBooleanRef>(get("t"))));
  EXPECT_FALSE(PVBooleanGetValue(static_cast<PVBooleanRef>(get("f"))));
  auto data = static_cast<PVDataRef>(get("d"));
  ASSERT_EQ(PVDataGetLength(data), 4);
  EXPECT_EQ(memcmp(PVDataGetBytePtr(data), "\x00\x01\x02\xff", 4), 0);
  char text[16];
  ASSERT_TRUE(PVStringGetCString(static_cast<PVStringRef>(get("s")), text, sizeof text, kPVStringEncodingUTF8));
  EXPECT_STREQ(text, "caf\xC3\xA9");
  EXPECT_EQ(describe(get("a")), "[\"x\", []]");
  PVRelease(value);
}

TEST(PropertyList, MalformedOrForeignInputGivesNothing) {
  const std::string cases[] = {
      "",
      "not a property list",
      kHead + "<array><string>unterminated</array>",
      kHead + "<dict><key>k</key><string>v</string>",
      kHead + "<date>2020-01-01T00:00:00Z</date></plist>",
      std::string("bplist00\x00\x01", 10),
  };
  for (const std::string &input : cases) {
    PVRef value = parse(input);
    EXPECT_EQ(value, nullptr) << input << " gave " << describe(value);
    PVRelease(value);
  }
  EXPECT_EQ(PVPropertyListCreateWithXMLData(nullptr), nullptr);
}

TEST(PropertyList, FileContentsAreReadWhole) {
  ScratchDir dir;
  std::vector<uint8_t> bytes = randomBytes(200000, 3);
  std::string path = writeFile(dir.file("f"), bytes);
  PVDataRef data = PVDataCreateWithContentsOfFile(path.c_str());
  ASSERT_NE(data, nullptr);
  ASSERT_EQ(PVDataGetLength(data), 200000);
  EXPECT_EQ(memcmp(PVDataGetBytePtr(data), bytes.data(), bytes.size()), 0);
  PVRelease(data);
  EXPECT_EQ(PVDataCreateWithContentsOfFile(dir.file("missing").c_str()), nullptr);
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace
