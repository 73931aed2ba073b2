// Volume capabilities and file-system statistics.
#pragma once

#include <stdint.h>

namespace platform {

// Format capability: the volume can hold files in the compressed form.
constexpr uint32_t kVolumeCapabilityCompression = 0x00010000;

// Asks the volume mounted at root for its capability words (format capabilities first). The
// volume is probed: an unnamed temporary file gets a multi-segment attribute that is read
// back. 0 with the words filled; -1 with EINVAL when the volume cannot be probed (read-only,
// no permission, no unnamed temporary files), other errno for other failures.
int getVolumeCapabilities(const char *root, uint32_t capabilities[4]);

// statfs with the mount point of the file system: 0, or -1 with errno.
struct FileSystemInfo {
  long type;                  // Linux file-system magic number
  char mountPoint[1024];      // where it is mounted
};
int statfs(const char *path, FileSystemInfo *out);

// True for file-system types that hold large attributes wherever they are mounted.
bool fileSystemHoldsLargeAttributes(long type);

}  // namespace platform
