// Policy for the stream pipeline: the default compression level and the path rules.
//
// A rule is a dictionary: "RuleType" ("Include" or "Exclude") and one match key
// ("PathEndsWithString", "PathBeginsWithString", "PathContainsString" or
// "PathExactlyEqualsString", the first present in that order). A rule set joins the caller's
// rules and the system rules (the caller's, or the bundle's "SystemCompressionRules.plist");
// the last matching rule wins, and a path that no rule matches is compressed. Paths are first
// made relative to the destination root; a path that is not under it is matched loosely
// (begins-with becomes contains, equals becomes ends-with). Messages are plain lines on
// standard error.
#pragma once

#include <stdint.h>

#include "PropertyValue.h"

struct CompressionRules {
  PVArrayRef userRules;    // one reference, may be NULL
  PVArrayRef systemRules;  // one reference, never NULL
};

// Reads one integer (atoi rules) from a file of at most 16 bytes; false leaves *value alone.
bool _GetIntegerFromFile(const char *path, int32_t *value);

// The level in "/Volumes/PlenzoSettings/CompressionLevel", announced once per process on
// standard output, or 5.
int32_t _GetCompressionLevel(void);
// The same with the settings file at settingsPath (tests).
int32_t getCompressionLevelFrom(const char *settingsPath);

// A rule set from the user rules and the system rules (each an array, or NULL; NULL system
// rules load the bundle's list). NULL when a value given is not an array or the bundle's list
// cannot be loaded. Free with _FreeCompressionRules.
CompressionRules *_InitCompressionRules(PVRef userRules, PVRef systemRules);
void _FreeCompressionRules(CompressionRules *rules);

// The bundle's system rules array (caller releases), or NULL.
PVArrayRef _CopySystemRulesList(void);

// path made relative to prefix, a pointer into path beginning with one slash; *trimmed says
// whether the prefix was removed. Allocates nothing.
const char *_TrimPrefix(const char *path, const char *prefix, bool *trimmed);

// Applies one rules array to *decision; false (after the rule's message) at the first
// malformed rule that had to be examined.
bool _ApplyCompressionRulesArray(PVStringRef path, PVArrayRef rules, bool trimmed, uint8_t *decision);

// 1 to compress the file at path (destination root prefix, may be NULL), 0 to leave it
// uncompressed, 0 also on every failure.
uint8_t _ShouldCompressPath(const CompressionRules *rules, const char *path, const char *prefix);
