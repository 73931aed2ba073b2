#include "Platform/FileIdentity.h"

#include <sys/stat.h>

#include <cerrno>

namespace platform {

bool pathNamesOpenFile(const char *path, int fd) {
  // Straight to the system, not through the counted wrappers: the check is no operation of its
  // own that a fault test would aim at.
  struct stat byPath, byDescriptor;
  if (::fstat(fd, &byDescriptor) != 0 || ::stat(path, &byPath) != 0) return false;
  if (byPath.st_dev == byDescriptor.st_dev && byPath.st_ino == byDescriptor.st_ino) return true;
  errno = ESTALE;
  return false;
}

}  // namespace platform
