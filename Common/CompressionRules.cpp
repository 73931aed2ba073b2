#include "Common/CompressionRules.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "Common/PropertyValueObjects.h"
#include "Platform/Bundle.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"

namespace {
constinit PVString ruleTypeKey = PVString::constant("RuleType");
constinit PVString ruleTypeInclude = PVString::constant("Include");
constinit PVString ruleTypeExclude = PVString::constant("Exclude");
constinit PVString pathEndsWithStringKey = PVString::constant("PathEndsWithString");
constinit PVString pathBeginsWithStringKey = PVString::constant("PathBeginsWithString");
constinit PVString pathContainsStringKey = PVString::constant("PathContainsString");
constinit PVString pathExactlyEqualsStringKey = PVString::constant("PathExactlyEqualsString");
}  // namespace

const PVStringRef kPLZCRuleTypeKey = &ruleTypeKey;
const PVStringRef kPLZCRuleTypeInclude = &ruleTypeInclude;
const PVStringRef kPLZCRuleTypeExclude = &ruleTypeExclude;
const PVStringRef kPLZCPathEndsWithStringKey = &pathEndsWithStringKey;
const PVStringRef kPLZCPathBeginsWithStringKey = &pathBeginsWithStringKey;
const PVStringRef kPLZCPathContainsStringKey = &pathContainsStringKey;
const PVStringRef kPLZCPathExactlyEqualsStringKey = &pathExactlyEqualsStringKey;

namespace {

constexpr char kSettingsPath[] = "/Volumes/PlenzoSettings/CompressionLevel";
constexpr int32_t kDefaultLevel = 5;
constexpr off_t kMaxSettingsSize = 16;

bool gLevelAnnounced = false;

enum class Match { EndsWith, BeginsWith, Contains, Equals };

struct MatchKey {
  const PVStringRef *key;
  Match match;
  const char *name;
};

// In the order in which a rule's match key is chosen.
const MatchKey kMatchKeys[] = {
    {&kPLZCPathEndsWithStringKey, Match::EndsWith, "PathEndsWithString"},
    {&kPLZCPathBeginsWithStringKey, Match::BeginsWith, "PathBeginsWithString"},
    {&kPLZCPathContainsStringKey, Match::Contains, "PathContainsString"},
    {&kPLZCPathExactlyEqualsStringKey, Match::Equals, "PathExactlyEqualsString"},
};

bool contains(PVStringRef path, PVStringRef value) {
  PVRange found;
  return PVStringFind(path, value, &found);
}

bool matches(PVStringRef path, PVStringRef value, Match match, bool trimmed) {
  switch (match) {
    case Match::EndsWith:
      return PVStringHasSuffix(path, value);
    case Match::BeginsWith:
      return trimmed ? PVStringHasPrefix(path, value) : contains(path, value);
    case Match::Contains:
      return contains(path, value);
    case Match::Equals:
      return trimmed ? PVEqual(path, value) : PVStringHasSuffix(path, value);
  }
  return false;
}

}  // namespace

bool _GetIntegerFromFile(const char *path, int32_t *value) {
  struct stat st;
  if (sys::stat(path, &st) != 0 || st.st_size > kMaxSettingsSize) return false;
  int fd = sys::open(path, O_RDONLY, 0);
  if (fd < 0) return false;
  char text[kMaxSettingsSize + 1] = {};
  ssize_t got = sys::read(fd, text, static_cast<size_t>(st.st_size));
  sys::close(fd);
  if (got != st.st_size) return false;
  *value = atoi(text);
  return true;
}

int32_t getCompressionLevelFrom(const char *settingsPath) {
  int32_t level = kDefaultLevel;
  if (!_GetIntegerFromFile(settingsPath, &level)) return kDefaultLevel;
  if (!gLevelAnnounced) {
    gLevelAnnounced = true;
    printf("Using compression level %d\n", level);
    fflush(stdout);
  }
  return level;
}

int32_t _GetCompressionLevel(void) { return getCompressionLevelFrom(kSettingsPath); }

PVArrayRef _CopySystemRulesList(void) {
  std::string location;
  if (!platform::bundleResourcePath("com.tavix.Plenzo", "SystemCompressionRules", "plist", &location)) return nullptr;
  PVDataRef data = PVDataCreateWithContentsOfFile(location.c_str());
  if (!data) return nullptr;
  PVRef list = PVPropertyListCreateWithXMLData(data);
  PVRelease(data);
  if (PVGetType(list) != kPVTypeArray) {
    PVRelease(list);
    return nullptr;
  }
  return static_cast<PVArrayRef>(list);
}

CompressionRules *_InitCompressionRules(PVRef userRules, PVRef systemRules) {
  if (userRules && PVGetType(userRules) != kPVTypeArray) return nullptr;
  if (systemRules && PVGetType(systemRules) != kPVTypeArray) return nullptr;
  PVArrayRef system = systemRules ? static_cast<PVArrayRef>(PVRetain(systemRules)) : _CopySystemRulesList();
  if (!system) return nullptr;
  auto *rules = static_cast<CompressionRules *>(sys::malloc(sizeof(CompressionRules)));
  if (!rules) {
    PVRelease(system);
    return nullptr;
  }
  rules->userRules = userRules ? static_cast<PVArrayRef>(PVRetain(userRules)) : nullptr;
  rules->systemRules = system;
  return rules;
}

void _FreeCompressionRules(CompressionRules *rules) {
  if (!rules) return;
  PVRelease(rules->systemRules);
  PVRelease(rules->userRules);
  free(rules);
}

const char *_TrimPrefix(const char *path, const char *prefix, bool *trimmed) {
  *trimmed = false;
  if (!path || !*path || !prefix || !*prefix) return path;
  size_t length = strlen(prefix);
  if (strncmp(path, prefix, length) != 0 || path[length] == '\0') return path;
  const char *p = path + length;
  if (*p == '/') {
    while (*p == '/') p++;
  } else if (p[-1] != '/') {
    return path;  // the prefix ends inside a path component
  }
  const char *result = p - 1;
  if (strncmp(result, "/./", 3) == 0) result += 2;
  *trimmed = true;
  return result;
}

bool _ApplyCompressionRulesArray(PVStringRef path, PVArrayRef rules, bool trimmed, uint8_t *decision) {
  PVIndex count = PVArrayGetCount(rules);
  for (PVIndex i = 0; i < count; i++) {
    PVRef rule = PVArrayGetValueAtIndex(rules, i);
    int index = static_cast<int>(i);
    if (PVGetType(rule) != kPVTypeDictionary) {
      fprintf(stderr, "Rule at index %d was not a dictionary\n", index);
      return false;
    }
    auto dictionary = static_cast<PVDictionaryRef>(rule);
    PVRef type = PVDictionaryGetValue(dictionary, kPLZCRuleTypeKey);
    if (PVGetType(type) != kPVTypeString) {
      fprintf(stderr,
              "Key 'RuleType' was not found or value was not a string while evaluating compression rule at index %d\n",
              index);
      return false;
    }
    uint8_t value;
    if (PVEqual(type, kPLZCRuleTypeExclude)) {
      value = 0;
    } else if (PVEqual(type, kPLZCRuleTypeInclude)) {
      value = 1;
    } else {
      fprintf(stderr, "Invalid value found for key 'RuleType' while evaluating compression rule at index %d\n", index);
      return false;
    }
    if (value == *decision) continue;  // cannot change anything
    const MatchKey *chosen = nullptr;
    PVRef matchValue = nullptr;
    for (const MatchKey &key : kMatchKeys) {
      if (PVDictionaryGetValueIfPresent(dictionary, *key.key, &matchValue)) {
        chosen = &key;
        break;
      }
    }
    if (!chosen) {
      fprintf(stderr, "String to match against not found while evaluating compression rule at index %d\n", index);
      return false;
    }
    if (PVGetType(matchValue) != kPVTypeString) {
      fprintf(stderr, "Key '%s' had value that was not a string, while evaluating compression rule at index %d\n",
              chosen->name, index);
      return false;
    }
    if (matches(path, static_cast<PVStringRef>(matchValue), chosen->match, trimmed)) *decision = value;
  }
  return true;
}

uint8_t _ShouldCompressPath(const CompressionRules *rules, const char *path, const char *prefix) {
  if (!rules) return 0;
  bool trimmed;
  const char *relative = _TrimPrefix(path, prefix, &trimmed);
  // A name that is not a valid string cannot be tested: leave the file as it is.
  PVStringRef string = PVStringCreateWithFileSystemRepresentation(relative);
  if (!string) return 0;
  uint8_t decision = 1;
  if (rules->userRules && !_ApplyCompressionRulesArray(string, rules->userRules, trimmed, &decision)) {
    fprintf(stderr, "Failed to apply user rules.\n");
    PVRelease(string);
    return 0;
  }
  if (!_ApplyCompressionRulesArray(string, rules->systemRules, trimmed, &decision)) {
    fprintf(stderr, "Failed to apply system rules.\n");
    PVRelease(string);
    return 0;
  }
  PVRelease(string);
  return decision;
}
