// Resources of the library's bundle.
//
// The bundle "com.tavix.Plenzo" is the directory <datadir>/com.tavix.Plenzo of the
// installation prefix, found relative to the loaded library; a library used from its build
// tree finds the source tree's Resources/ instead.
#pragma once

#include <string>

namespace platform {

// Sets *path to the resource "name.type" of the bundle and returns true when it exists.
bool bundleResourcePath(const char *bundleIdentifier, const char *name, const char *type, std::string *path);

// The bundle's directory, or "" when no bundle directory exists (for messages and tools).
std::string bundleDirectory(const char *bundleIdentifier);

}  // namespace platform
