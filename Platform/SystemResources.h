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

// Tells the C library to keep memory that is freed for later allocations, by any thread,
// instead of giving it back to the system at once, and to serve blocks of up to 32 MiB from
// that memory: a program that moves file data through blocks of every size otherwise pays a
// page fault (and the kernel's clearing of the page) for every 4 KiB of each new block, about
// as much as filling it. For programs, not for the library: it changes the whole process's
// allocator.
void keepFreedMemory();

}  // namespace platform
