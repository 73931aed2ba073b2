// Machine resources: physical memory and the open-descriptor limits.
#pragma once

#include <stdint.h>
#include <sys/resource.h>

namespace platform {

// Bytes of physical memory this process may use: the machine's memory, lowered to the memory
// limit of the process's cgroup and to its address-space limit (RLIMIT_AS) when they are set.
// 0, or -1 with errno.
int physicalMemory(uint64_t *bytes);

// The cgroup memory limit in bytes found under cgroupRoot for the cgroup named in
// procSelfCgroup ("0::/path" lines, version 2; "N:memory:/path", version 1); 0 when no limit
// is set. Separate from physicalMemory so tests can point it at their own files.
uint64_t cgroupMemoryLimit(const char *procSelfCgroup, const char *cgroupRoot);

// RLIMIT_NOFILE, read and set.
int getDescriptorLimit(struct rlimit *limit);
int setDescriptorLimit(const struct rlimit *limit);

}  // namespace platform
