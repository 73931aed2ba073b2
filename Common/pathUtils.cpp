#include "Common/pathUtils.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Platform/Syscalls.h"
#include "Platform/VolumeCapabilities.h"

static constexpr char kSourcePath[] = "Common/pathUtils";

int mkdirRecursive(const char *path) {
  char *copy = sys::strdup(path);
  if (!copy) return -1;
  // A leading '/' is never a cut point.
  for (char *slash = strchr(copy + (copy[0] ? 1 : 0), '/'); slash; slash = strchr(slash + 1, '/')) {
    *slash = '\0';
    if (sys::mkdir(copy, 0755) != 0 && errno != EEXIST) {
      PLZC_ERR("%s:%d: mkdir %s: %s\n", copy, strerror(errno));
      free(copy);
      return -1;
    }
    *slash = '/';
  }
  int result = 0;
  if (sys::mkdir(copy, 0755) != 0 && errno != EEXIST) {
    PLZC_ERR("%s:%d: mkdir %s: %s\n", copy, strerror(errno));
    result = -1;
  }
  int savedErrno = errno;
  free(copy);
  errno = savedErrno;
  return result;
}

char *volRoot(const char *path, char *out) {
  if (!sys::realpath(path, out)) {
    platform::FileSystemInfo fs;
    if (platform::statfs(path, &fs) != 0) {
      PLZC_ERR("%s:%d: statfs %s: %s\n", path, strerror(errno));
      return nullptr;
    }
    snprintf(out, 1024, "%s", fs.mountPoint);
    return out;
  }
  struct stat st;
  if (sys::stat(out, &st) != 0) {
    PLZC_ERR("%s:%d: stat %s: %s\n", out, strerror(errno));
    return nullptr;
  }
  dev_t device = st.st_dev;
  // Cut the path at each '/' from the end; the first prefix on another device ends the walk,
  // and the previous cut names the mount point.
  for (char *at = out + strlen(out) - 1; at > out; at--) {
    if (*at != '/') continue;
    *at = '\0';
    if (sys::stat(out, &st) != 0) {
      PLZC_ERR("%s:%d: stat %s: %s\n", out, strerror(errno));
      return nullptr;
    }
    if (st.st_dev != device) {
      *at = '/';
      return out;
    }
  }
  strcpy(out, "/");
  return out;
}
