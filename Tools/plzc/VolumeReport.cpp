#include "VolumeReport.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include "Common/pathUtils.h"
#include "Platform/ExtendedAttributes.h"
#include "Plenzo.h"

namespace plzc {

namespace {

// A resource fork larger than one Linux attribute can hold, as the library's own probe writes.
constexpr size_t kLargeProbeSize = 65536 + 4096;

// The file-system type of the last mount of the device holding path, from the kernel's table.
std::string fileSystemType(dev_t device) {
  FILE *mounts = fopen("/proc/self/mountinfo", "re");
  if (!mounts) return "";
  std::string type;
  char line[8192];
  while (fgets(line, sizeof line, mounts)) {
    unsigned major, minor;
    if (sscanf(line, "%*u %*u %u:%u", &major, &minor) != 2 || makedev(major, minor) != device) continue;
    const char *separator = strstr(line, " - ");
    char name[256];
    if (separator && sscanf(separator + 3, "%255s", name) == 1) type = name;
  }
  fclose(mounts);
  return type;
}

std::string hintFor(const std::string &type) {
  if (type == "ext4" || type == "ext3" || type == "ext2")
    return "; an ext4 volume holds them only when made with the ea_inode feature (mkfs.ext4 -O ea_inode)";
  if (type == "tmpfs") return "; tmpfs holds them from Linux 6.6 on";
  return "; tmpfs (Linux 6.6 or later), XFS, btrfs and ext4 with ea_inode hold them";
}

// Repeats the volume probe one step at a time and names the step that fails.
std::string probeFailure(const std::string &root, const std::string &type) {
  std::string name = type.empty() ? "the file system" : type;
  struct statvfs vfs;
  if (statvfs(root.c_str(), &vfs) == 0 && (vfs.f_flag & ST_RDONLY))
    return "the volume is mounted read-only, and " + name + " is not a type known to hold large attributes";
  int fd = open(root.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
  if (fd < 0)
    return "a probe file cannot be made at " + root + " (" + strerror(errno) + "), and " + name +
           " is not a type known to hold large attributes";
  std::string reason;
  const char small[16] = "plzc volume";
  std::vector<uint8_t> large(kLargeProbeSize, 0x5A);
  if (::fsetxattr(fd, "user.plzc-volume-probe", small, sizeof small, 0) != 0) {
    int error = errno;
    reason = error == ENOTSUP ? name + " does not support user extended attributes"
                              : name + " cannot store an extended attribute (" + strerror(error) + ")";
  } else if (platform::fsetxattr(fd, PLZC_RESOURCE_FORK_NAME, large.data(), large.size(), 0, 0) != 0) {
    int error = errno;
    reason = name + " cannot store the " + std::to_string(kLargeProbeSize) +
             "-byte extended attributes of a compressed file (" + strerror(error) + ")" + hintFor(type);
  } else {
    reason = "the library's probe of the volume failed (see the message above)";
  }
  close(fd);  // the unnamed probe file vanishes with its attributes
  return reason;
}

}  // namespace

bool examineVolume(const std::string &path, VolumeReport *report) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return false;
  *report = VolumeReport{};
  report->fileSystem = fileSystemType(st.st_dev);
  char root[1024];
  if (volRoot(path.c_str(), root)) report->mountPoint = root;
  report->holds = VolumeSupportsCompression(path.c_str()) == 1;
  if (!report->holds)
    report->reason = report->mountPoint.empty() ? "its mount point cannot be found"
                                                : probeFailure(report->mountPoint, report->fileSystem);
  return true;
}

}  // namespace plzc
