#include "Platform/Bundle.h"

#include <dlfcn.h>
#include <sys/stat.h>

#include <climits>
#include <cstdlib>
#include <string>

#include "Platform/Syscalls.h"

namespace platform {

namespace {

bool isDirectory(const std::string &path) {
  struct stat st;
  return sys::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The directory of the object this code was loaded from (the shared library, or the program
// it is linked into).
std::string loadedObjectDirectory() {
  Dl_info info;
  if (!dladdr(reinterpret_cast<void *>(&bundleDirectory), &info) || !info.dli_fname) return "";
  char resolved[PATH_MAX];
  if (!sys::realpath(info.dli_fname, resolved)) return "";
  std::string path = resolved;
  return path.substr(0, path.rfind('/'));
}

}  // namespace

std::string bundleDirectory(const char *bundleIdentifier) {
  std::string installed = loadedObjectDirectory() + "/" + PLZC_LIBDIR_TO_DATADIR + "/" + bundleIdentifier;
  if (isDirectory(installed)) return installed;
  if (isDirectory(PLZC_SOURCE_RESOURCES_DIR)) return PLZC_SOURCE_RESOURCES_DIR;
  return "";
}

bool bundleResourcePath(const char *bundleIdentifier, const char *name, const char *type, std::string *path) {
  std::string directory = bundleDirectory(bundleIdentifier);
  if (directory.empty()) return false;
  std::string candidate = directory + "/" + name + "." + type;
  struct stat st;
  if (sys::stat(candidate.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
  *path = candidate;
  return true;
}

}  // namespace platform
