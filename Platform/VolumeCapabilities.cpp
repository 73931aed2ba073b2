#include "Platform/VolumeCapabilities.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "Platform/ExtendedAttributes.h"
#include "Platform/Syscalls.h"

namespace platform {

namespace {

// Large enough to need two segments everywhere.
constexpr size_t kProbeSize = 65536 + 4096;
constexpr char kProbeName[] = PLZC_RESOURCE_FORK_NAME;

// Decodes the octal escapes of /proc/self/mountinfo (\040 for a space).
std::string unescape(const char *field) {
  std::string out;
  for (const char *c = field; *c; c++) {
    if (c[0] == '\\' && c[1] >= '0' && c[1] <= '7' && c[2] && c[3]) {
      out.push_back(static_cast<char>((c[1] - '0') * 64 + (c[2] - '0') * 8 + (c[3] - '0')));
      c += 3;
    } else {
      out.push_back(*c);
    }
  }
  return out;
}

}  // namespace

int getVolumeCapabilities(const char *root, uint32_t capabilities[4]) {
  int fd = sys::open(root, O_TMPFILE | O_RDWR, 0600);
  if (fd < 0) {
    if (errno == ENOENT || errno == ENOTDIR || errno == ENAMETOOLONG || errno == ELOOP) return -1;
    errno = EINVAL;  // the volume exists but cannot be probed
    return -1;
  }
  std::vector<uint8_t> written(kProbeSize), read(kProbeSize);
  for (size_t i = 0; i < kProbeSize; i++) written[i] = static_cast<uint8_t>(i * 7 + i / 251);
  bool holds = fsetxattr(fd, kProbeName, written.data(), written.size(), 0, 0) == 0 &&
               fgetxattr(fd, kProbeName, read.data(), read.size(), 0, 0) == static_cast<ssize_t>(kProbeSize) &&
               read == written;
  sys::close(fd);  // the unnamed file and its attributes vanish with it
  capabilities[0] = holds ? kVolumeCapabilityCompression : 0;
  capabilities[1] = capabilities[2] = capabilities[3] = 0;
  return 0;
}

int statfs(const char *path, FileSystemInfo *out) {
  struct ::statfs fs;
  struct ::stat st;
  if (sys::statfs(path, &fs) != 0 || sys::stat(path, &st) != 0) return -1;
  out->type = static_cast<long>(fs.f_type);
  out->mountPoint[0] = '\0';
  // The last mount of the device is the one that is visible.
  FILE *mounts = fopen("/proc/self/mountinfo", "re");
  if (!mounts) return -1;
  char line[4096];
  while (fgets(line, sizeof line, mounts)) {
    unsigned major, minor;
    char mountPoint[4096];
    if (sscanf(line, "%*u %*u %u:%u %*s %4095s", &major, &minor, mountPoint) != 3) continue;
    if (makedev(major, minor) != st.st_dev) continue;
    std::string decoded = unescape(mountPoint);
    snprintf(out->mountPoint, sizeof out->mountPoint, "%s", decoded.c_str());
  }
  fclose(mounts);
  if (!out->mountPoint[0]) {
    errno = ENOENT;
    return -1;
  }
  return 0;
}

bool fileSystemHoldsLargeAttributes(long type) {
  switch (type) {
    case XFS_SUPER_MAGIC:
    case BTRFS_SUPER_MAGIC:
    case TMPFS_MAGIC:
      return true;
    default:
      return false;
  }
}

}  // namespace platform
