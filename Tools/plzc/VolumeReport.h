// Whether a volume can hold compressed files, and why not when it cannot.
#pragma once

#include <string>

namespace plzc {

struct VolumeReport {
  bool holds = false;      // the library's answer (VolumeSupportsCompression)
  std::string fileSystem;  // "tmpfs", "ext4", ... or "" when unknown
  std::string mountPoint;  // where that file system is mounted
  std::string reason;      // why it cannot hold them; empty when it can
};

// Asks the library about the volume holding path, then, when the answer is no, probes the
// volume the same way step by step to name the cause. False with errno when path does not
// exist.
bool examineVolume(const std::string &path, VolumeReport *report);

}  // namespace plzc
