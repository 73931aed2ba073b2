#include "Common/CompressionRules.h"

#include <gtest/gtest.h>

#include <initializer_list>
#include <string>

#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::internal::CaptureStderr;
using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStderr;
using ::testing::internal::GetCapturedStdout;

namespace {

PVStringRef str(const char *text) { return PVStringCreateWithCString(text, kPVStringEncodingUTF8); }

// A rule dictionary from key/value pairs; a null value string leaves the key out, a value of
// "#7" becomes the number 7 (a value that is not a string).
PVDictionaryRef rule(std::initializer_list<std::pair<PVStringRef, const char *>> entries) {
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  for (const auto &[key, text] : entries) {
    PVRef value = text[0] == '#' ? static_cast<PVRef>(PVNumberCreateInt32(atoi(text + 1))) : str(text);
    PVDictionarySetValue(dictionary, key, value);
    PVRelease(value);
  }
  return dictionary;
}

PVArrayRef rules(std::initializer_list<PVRef> elements) {
  PVMutableArrayRef array = PVArrayCreateMutable(0);
  for (PVRef element : elements) {
    PVArrayAppendValue(array, element);
    PVRelease(element);
  }
  return array;
}

PVDictionaryRef include(PVStringRef key, const char *value) { return rule({{kPLZCRuleTypeKey, "Include"}, {key, value}}); }
PVDictionaryRef exclude(PVStringRef key, const char *value) { return rule({{kPLZCRuleTypeKey, "Exclude"}, {key, value}}); }

// Decides with the given arrays (either may be null: no user rules / empty system rules).
int decide(PVArrayRef user, PVArrayRef system, const char *path, const char *prefix, std::string *printed = nullptr) {
  PVArrayRef empty = rules({});
  CompressionRules *set = _InitCompressionRules(user, system ? system : empty);
  PVRelease(empty);
  EXPECT_NE(set, nullptr);
  CaptureStderr();
  int decision = _ShouldCompressPath(set, path, prefix);
  std::string text = GetCapturedStderr();
  if (printed) *printed = text;
  _FreeCompressionRules(set);
  return decision;
}

TEST(TrimPrefix, MakesPathsRelativeToTheRoot) {
  struct {
    const char *path, *prefix, *result;
    bool trimmed;
  } cases[] = {
      {"/Volumes/Target//System/x", "/Volumes/Target", "/System/x", true},
      {"/Volumes/Target/./System/x", "/Volumes/Target", "/System/x", true},
      {"/Volumes/Target/././usr", "/Volumes/Target", "/./usr", true},
      {"/Volumes/Target/System", "/Volumes/Target/", "/System", true},
      {"/Volumes/TargetB/x", "/Volumes/Target", "/Volumes/TargetB/x", false},
      {"/Volumes/Target", "/Volumes/Target", "/Volumes/Target", false},
      {"/other/usr/lib", "/Volumes/T", "/other/usr/lib", false},
      {"/a/b", nullptr, "/a/b", false},
      {"/a/b", "", "/a/b", false},
      {"", "/a", "", false},
  };
  for (const auto &c : cases) {
    bool trimmed = !c.trimmed;
    const char *result = _TrimPrefix(c.path, c.prefix, &trimmed);
    EXPECT_STREQ(result, c.result) << c.path << " under " << (c.prefix ? c.prefix : "(none)");
    EXPECT_EQ(trimmed, c.trimmed) << c.path;
    EXPECT_TRUE(result >= c.path && result <= c.path + strlen(c.path));  // a pointer into path
  }
}

TEST(CompressionRules, LastMatchingRuleWinsAcrossUserThenSystemRules) {
  PVArrayRef user = rules({exclude(kPLZCPathEndsWithStringKey, ".log")});
  PVArrayRef system = rules({include(kPLZCPathEndsWithStringKey, "/x.log")});
  EXPECT_EQ(decide(user, system, "/a/x.log", nullptr), 1);
  EXPECT_EQ(decide(user, system, "/a/y.log", nullptr), 0);
  EXPECT_EQ(decide(user, system, "/a/y.txt", nullptr), 1);
  EXPECT_EQ(decide(nullptr, nullptr, "/anything", nullptr), 1);  // empty system rules
  EXPECT_EQ(_ShouldCompressPath(nullptr, "/a", nullptr), 0);
  PVRelease(user);
  PVRelease(system);
}

TEST(CompressionRules, AnchoredMatchesLoosenForPathsOutsideTheRoot) {
  struct {
    PVStringRef key;
    const char *value, *path;
    int decision;
  } cases[] = {
      {kPLZCPathBeginsWithStringKey, "/usr", "/Volumes/T/usr/lib", 0},
      {kPLZCPathExactlyEqualsStringKey, "/usr/lib", "/Volumes/T/usr/lib", 0},
      {kPLZCPathBeginsWithStringKey, "/usr", "/other/usr/lib", 0},       // contained
      {kPLZCPathExactlyEqualsStringKey, "/usr/lib", "/other/usr/lib", 0},  // suffix
      {kPLZCPathBeginsWithStringKey, "/lib", "/Volumes/T/usr/lib", 1},
      {kPLZCPathExactlyEqualsStringKey, "/usr", "/Volumes/T/usr/lib", 1},
      {kPLZCPathContainsStringKey, "sr/li", "/Volumes/T/usr/lib", 0},
      {kPLZCPathEndsWithStringKey, "lib", "/Volumes/Tx/usr/lib", 0},
      {kPLZCPathExactlyEqualsStringKey, "/usr", "/Volumes/T/./usr", 0},
      {kPLZCPathExactlyEqualsStringKey, "/./usr", "/Volumes/T/././usr", 0},
  };
  for (const auto &c : cases) {
    PVArrayRef system = rules({exclude(c.key, c.value)});
    EXPECT_EQ(decide(nullptr, system, c.path, "/Volumes/T"), c.decision) << c.value << " vs " << c.path;
    PVRelease(system);
  }
}

TEST(CompressionRules, FirstPresentMatchKeyIsTheOnlyOneUsed) {
  PVArrayRef system =
      rules({rule({{kPLZCRuleTypeKey, "Exclude"}, {kPLZCPathContainsStringKey, "a"}, {kPLZCPathEndsWithStringKey, ".z"}})});
  EXPECT_EQ(decide(nullptr, system, "/a/b.c", nullptr), 1);  // contains "a" is never tried
  EXPECT_EQ(decide(nullptr, system, "/q/b.z", nullptr), 0);
  PVRelease(system);
}

TEST(CompressionRules, MalformedRulesFailWithTheirMessagesAndDecisionZero) {
  struct {
    PVRef badRule;
    const char *message;
  } cases[] = {
      {str("just a string"), "Rule at index 1 was not a dictionary\n"},
      {rule({{kPLZCPathEndsWithStringKey, "x"}}),
       "Key 'RuleType' was not found or value was not a string while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "#1"}, {kPLZCPathEndsWithStringKey, "x"}}),
       "Key 'RuleType' was not found or value was not a string while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "include"}, {kPLZCPathEndsWithStringKey, "x"}}),
       "Invalid value found for key 'RuleType' while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "Include"}}),
       "String to match against not found while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "Include"}, {kPLZCPathEndsWithStringKey, "#3"}}),
       "Key 'PathEndsWithString' had value that was not a string, while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "Include"}, {kPLZCPathBeginsWithStringKey, "#3"}}),
       "Key 'PathBeginsWithString' had value that was not a string, while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "Include"}, {kPLZCPathContainsStringKey, "#3"}}),
       "Key 'PathContainsString' had value that was not a string, while evaluating compression rule at index 1\n"},
      {rule({{kPLZCRuleTypeKey, "Include"}, {kPLZCPathExactlyEqualsStringKey, "#3"}}),
       "Key 'PathExactlyEqualsString' had value that was not a string, while evaluating compression rule at index 1\n"},
  };
  for (const auto &c : cases) {
    // An Exclude that matches first, so that even an Include must be examined.
    PVArrayRef user = rules({exclude(kPLZCPathEndsWithStringKey, ".c"), PVRetain(c.badRule)});
    std::string printed;
    EXPECT_EQ(decide(user, nullptr, "/a/b.c", nullptr, &printed), 0);
    EXPECT_EQ(printed, std::string(c.message) + "Failed to apply user rules.\n");
    PVArrayRef system = rules({exclude(kPLZCPathEndsWithStringKey, ".c"), PVRetain(c.badRule)});
    EXPECT_EQ(decide(nullptr, system, "/a/b.c", nullptr, &printed), 0);
    EXPECT_EQ(printed, std::string(c.message) + "Failed to apply system rules.\n");
    PVRelease(user);
    PVRelease(system);
    PVRelease(c.badRule);
  }
}

TEST(CompressionRules, RuleThatCannotChangeTheDecisionIsNotExamined) {
  // Still 1: an Include with a bad match value is skipped silently.
  PVArrayRef system = rules({rule({{kPLZCRuleTypeKey, "Include"}, {kPLZCPathEndsWithStringKey, "#3"}})});
  std::string printed;
  EXPECT_EQ(decide(nullptr, system, "/a", nullptr, &printed), 1);
  EXPECT_EQ(printed, "");
  PVRelease(system);
}

TEST(CompressionRules, RuleSetNeedsArrays) {
  PVDictionaryRef notArray = rule({});
  EXPECT_EQ(_InitCompressionRules(notArray, nullptr), nullptr);
  PVArrayRef empty = rules({});
  EXPECT_EQ(_InitCompressionRules(empty, notArray), nullptr);
  CompressionRules *set = _InitCompressionRules(nullptr, empty);
  ASSERT_NE(set, nullptr);
  EXPECT_EQ(set->systemRules, empty);  // the caller's array replaces the bundle's
  EXPECT_EQ(set->userRules, nullptr);
  _FreeCompressionRules(set);
  _FreeCompressionRules(nullptr);
  PVRelease(empty);
  PVRelease(notArray);
}

TEST(CompressionRules, ShippedSystemRulesLeaveCompressedFormatsAlone) {
  PVArrayRef shipped = _CopySystemRulesList();
  ASSERT_NE(shipped, nullptr);
  EXPECT_GT(PVArrayGetCount(shipped), 20);
  CompressionRules *set = _InitCompressionRules(nullptr, nullptr);
  ASSERT_NE(set, nullptr);
  for (const char *path : {"/T/a/photo.jpg", "/T/b.tar.gz", "/T/c/SONG.MP3", "/T/movie.mkv", "/T/x.zip"})
    EXPECT_EQ(_ShouldCompressPath(set, path, "/T"), 0) << path;
  for (const char *path : {"/T/a/notes.txt", "/T/lib/libz.so", "/T/zip", "/T/gz.c"})
    EXPECT_EQ(_ShouldCompressPath(set, path, "/T"), 1) << path;
  _FreeCompressionRules(set);
  PVRelease(shipped);
}

TEST(CompressionLevel, SettingsFileGivesTheLevelAndIsAnnouncedOnce) {
  ScratchDir dir;
  struct {
    std::string content;
    int32_t level;
  } cases[] = {{"7\n", 7}, {"", 0}, {"abc", 0}, {"  -3x", -3}, {std::string(17, '9'), 5}};
  std::string announced;
  for (const auto &c : cases) {
    std::string path = writeFile(dir.file("level"), c.content);
    CaptureStdout();
    int32_t level = getCompressionLevelFrom(path.c_str());
    announced += GetCapturedStdout();
    EXPECT_EQ(level, c.level) << c.content;
  }
  EXPECT_EQ(announced, "Using compression level 7\n");
  EXPECT_EQ(getCompressionLevelFrom(dir.file("missing").c_str()), 5);
  int32_t value = 42;
  EXPECT_FALSE(_GetIntegerFromFile(dir.file("missing").c_str(), &value));
  EXPECT_EQ(value, 42);
  writeFile(dir.file("long"), std::string(17, '1'));
  EXPECT_FALSE(_GetIntegerFromFile(dir.file("long").c_str(), &value));
  writeFile(dir.file("empty"), std::string());
  EXPECT_TRUE(_GetIntegerFromFile(dir.file("empty").c_str(), &value));
  EXPECT_EQ(value, 0);
}

}  // namespace
