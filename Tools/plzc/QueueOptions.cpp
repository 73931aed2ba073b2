#include "QueueOptions.h"

#include <cerrno>
#include <cstring>
#include <sstream>

#include "Cli.h"
#include "Plenzo.h"

namespace plzc {

namespace {

// Owns one reference.
struct Held {
  PVRef value = nullptr;
  explicit Held(PVRef v) : value(v) {}
  ~Held() { PVRelease(value); }
  Held(const Held &) = delete;
  Held &operator=(const Held &) = delete;
};

// The top-level value of the XML property list in path, or null with *error.
PVRef readPropertyList(const std::string &path, const char *what, std::string *error) {
  PVDataRef data = PVDataCreateWithContentsOfFile(path.c_str());
  if (!data) {
    *error = path + ": cannot read the " + what + " file: " + strerror(errno);
    return nullptr;
  }
  PVRef value = PVPropertyListCreateWithXMLData(data);
  PVRelease(data);
  if (!value) *error = path + ": the " + what + " file is not a well-formed XML property list";
  return value;
}

bool setValue(PVMutableDictionaryRef dictionary, PVStringRef key, PVRef value, std::string *error) {
  Held held(value);
  if (value && PVDictionarySetValue(dictionary, key, value)) return true;
  *error = "out of memory";
  return false;
}

// "MH_EXECUTE,2,*": names and "*" as strings, numbers as numbers; the library checks them.
PVRef skipMachOArray(const std::string &list, std::string *error) {
  PVMutableArrayRef array = PVArrayCreateMutable(4);
  if (!array) return nullptr;
  std::stringstream tokens(list);
  std::string token;
  while (std::getline(tokens, token, ',')) {
    long number;
    if (token.empty()) {
      *error = "empty item in the Mach-O type list '" + list + "'";
      PVRelease(array);
      return nullptr;
    }
    PVRef item = parseNumber(token.c_str(), -1, 255, &number)
                     ? static_cast<PVRef>(PVNumberCreateInt32(static_cast<int32_t>(number)))
                     : static_cast<PVRef>(PVStringCreateWithCString(token.c_str(), kPVStringEncodingUTF8));
    bool added = item && PVArrayAppendValue(array, item);
    PVRelease(item);
    if (!added) {
      *error = "out of memory";
      PVRelease(array);
      return nullptr;
    }
  }
  return array;
}

}  // namespace

PVDictionaryRef buildQueueOptions(const QueueOptionChoices &choices, std::string *error) {
  PVMutableDictionaryRef options = nullptr;
  if (!choices.optionsFile.empty()) {
    PVRef file = readPropertyList(choices.optionsFile, "options", error);
    if (!file) return nullptr;
    if (PVGetType(file) != kPVTypeDictionary) {
      *error = choices.optionsFile + ": the options file must hold a dictionary";
      PVRelease(file);
      return nullptr;
    }
    options = PVDictionaryCreateMutableCopy(static_cast<PVDictionaryRef>(file));
    PVRelease(file);
  } else {
    options = PVDictionaryCreateMutable(8, kPVDictionaryRetainedValues);
  }
  if (!options) {
    *error = "out of memory";
    return nullptr;
  }

  bool ok = true;
  if (!choices.types.empty())
    ok = setValue(options, kPLZCCompressionTypes, PVStringCreateWithCString(choices.types.c_str(), kPVStringEncodingASCII),
                  error);
  if (ok && choices.level)
    ok = setValue(options, kPLZCCompressionLevel, PVNumberCreateInt32(static_cast<int32_t>(choices.level)), error);
  if (ok && !choices.rulesFile.empty()) {
    PVRef rules = readPropertyList(choices.rulesFile, "rules", error);
    if (!rules) {
      ok = false;
    } else if (PVGetType(rules) != kPVTypeArray) {
      *error = choices.rulesFile + ": the rules file must hold an array of rule dictionaries";
      PVRelease(rules);
      ok = false;
    } else {
      ok = setValue(options, kPLZCCompressionRulesKey, rules, error);
    }
  }
  if (ok && !choices.skipMachO.empty()) {
    PVRef types = skipMachOArray(choices.skipMachO, error);
    ok = types && setValue(options, kPLZCSkipMachOFileTypes, types, error);
  }
  // Constants: the dictionary retains them, and releasing a constant does nothing.
  if (ok && choices.ignoreXattrErrors) ok = setValue(options, kPLZCIgnoreXattrErrors, kPVBooleanTrue, error);
  if (ok && choices.throttled) ok = setValue(options, kPLZCThrottledIO, kPVBooleanTrue, error);
  if (ok && choices.largeForks) ok = setValue(options, kPLZCAllowLargeResourceForks, kPVBooleanTrue, error);
  if (!ok) {
    PVRelease(options);
    return nullptr;
  }
  return options;
}

}  // namespace plzc
