#include "Platform/SystemResources.h"

#include <malloc.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

namespace platform {

namespace {

// A limit file holds a number of bytes, or "max" (version 2) / a huge number (version 1) for none.
uint64_t readLimit(const std::string &path) {
  std::ifstream in(path);
  std::string text;
  if (!(in >> text) || text == "max") return 0;
  char *end = nullptr;
  unsigned long long value = strtoull(text.c_str(), &end, 10);
  if (end == text.c_str() || *end) return 0;
  // Version 1 reports "no limit" as a page-rounded LONG_MAX.
  if (value >= (1ull << 62)) return 0;
  return value;
}

}  // namespace

uint64_t cgroupMemoryLimit(const char *procSelfCgroup, const char *cgroupRoot) {
  std::ifstream in(procSelfCgroup);
  std::string line;
  uint64_t lowest = 0;
  while (std::getline(in, line)) {
    // hierarchy-id:controllers:path
    size_t first = line.find(':'), second = line.find(':', first + 1);
    if (first == std::string::npos || second == std::string::npos) continue;
    std::string controllers = line.substr(first + 1, second - first - 1);
    std::string path = line.substr(second + 1);
    std::string file;
    if (controllers.empty())
      file = std::string(cgroupRoot) + path + "/memory.max";
    else if (("," + controllers + ",").find(",memory,") != std::string::npos)
      file = std::string(cgroupRoot) + "/memory" + path + "/memory.limit_in_bytes";
    else
      continue;
    uint64_t limit = readLimit(file);
    if (limit && (!lowest || limit < lowest)) lowest = limit;
  }
  return lowest;
}

int physicalMemory(uint64_t *bytes) {
  long pages = sysconf(_SC_PHYS_PAGES), pageSize = sysconf(_SC_PAGESIZE);
  if (pages <= 0 || pageSize <= 0) {
    if (errno == 0) errno = EINVAL;
    return -1;
  }
  uint64_t memory = static_cast<uint64_t>(pages) * static_cast<uint64_t>(pageSize);
  uint64_t limit = cgroupMemoryLimit("/proc/self/cgroup", "/sys/fs/cgroup");
  if (limit && limit < memory) memory = limit;
  // An address-space limit bounds what this process can map, whatever the machine has.
  struct rlimit addressSpace;
  if (getrlimit(RLIMIT_AS, &addressSpace) == 0 && addressSpace.rlim_cur != RLIM_INFINITY &&
      addressSpace.rlim_cur < memory)
    memory = addressSpace.rlim_cur;
  *bytes = memory;
  return 0;
}

int getDescriptorLimit(struct rlimit *limit) { return getrlimit(RLIMIT_NOFILE, limit); }
int setDescriptorLimit(const struct rlimit *limit) { return setrlimit(RLIMIT_NOFILE, limit); }

void keepFreedMemory() {
  mallopt(M_MMAP_THRESHOLD, 32 << 20);
  mallopt(M_TRIM_THRESHOLD, 1 << 30);
  // One arena: a block is freed by another thread than the one that allocated it (a file's data
  // pool, filled by the caller's thread, is released by the pipeline's), and with an arena per
  // thread the memory freed never serves the next allocation.
  mallopt(M_ARENA_MAX, 1);
}

}  // namespace platform
