// Leaving chosen kinds of Mach-O executables uncompressed.
//
// The option "SkipMachOFileTypes" (names such as "MH_EXECUTE", numbers 1 to 31, or "*" / -1
// for every type) becomes a 32-bit mask; "SkipMachOOverridePaths" lists paths, relative to the
// destination root, that are compressed whatever their type. The header test reads a file's
// first bytes through an overlay and pushes them back, so the compressor still reads the file
// from its first byte. Messages carry the pipeline's source path.
#pragma once

#include <stdint.h>

#include "Common/FileHandle.h"
#include "PropertyValue.h"

// Sets *skipMachOTypeMask from the options: 0 when every item was valid (or "*" / -1 ended the
// scan), -1 when at least one item was invalid (each reported).
int _ComputeMachOTypeMask(uint32_t *skipMachOTypeMask, PVDictionaryRef options);

// The set of override paths (a dictionary whose keys are the array's elements, values the
// plain integer 1), or NULL when the mask is 0 or the option is absent, not an array or empty.
// The caller releases it.
PVDictionaryRef createMachOOverridePaths(uint32_t skipMachOTypeMask, PVDictionaryRef options);

// True when the file behind fh (an overlay that can unread) is a Mach-O file of a type in the
// mask whose path, trimmed of prefix, is not in overridePaths. What was read is pushed back. A
// universal file whose first slice starts more than 64 MiB in is not taken for a Mach-O file;
// one whose slice lies past the file's end is reported as a short read.
bool _ShouldSkipMachOFile(const char *path, const char *prefix, uint32_t skipMachOTypeMask,
                          PVDictionaryRef overridePaths, FileHandle *fh);
