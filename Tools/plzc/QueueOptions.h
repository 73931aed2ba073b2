// The options dictionary of a stream or compression queue, built from an XML property list
// file and command-line shortcuts that override its keys.
#pragma once

#include <string>

#include "PropertyValue.h"

namespace plzc {

struct QueueOptionChoices {
  std::string optionsFile;  // XML property list holding a dictionary; empty for none
  std::string types;        // "CompressionTypes"; empty to leave as the file or library says
  long level = 0;           // "CompressionLevel"; 0 to leave
  std::string rulesFile;    // XML property list holding an array of rules: "CompressionRules"
  std::string skipMachO;    // "MH_EXECUTE,2,*" style list: "SkipMachOFileTypes"
  bool ignoreXattrErrors = false;
  bool throttled = false;
  bool largeForks = false;
};

// A new dictionary (the caller releases it with PVRelease), or null with *error saying what
// was wrong with a file or a value.
PVDictionaryRef buildQueueOptions(const QueueOptionChoices &choices, std::string *error);

}  // namespace plzc
