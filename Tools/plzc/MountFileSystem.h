// The file system that `plzc mount` serves: every operation passes through to a directory,
// except that compressed files show and read as their logical bytes, decoded chunk by chunk
// into a cache shared by all open files, and their compression attributes are hidden.
#pragma once

#include <fuse.h>

#include <stddef.h>

#include <memory>
#include <mutex>
#include <string>
#include <atomic>
#include <map>
#include <utility>

#include "MountChunkCache.h"

namespace plzc {

struct MountSettings {
  std::string source;                 // the directory served, for messages
  size_t cacheBytes = 64u << 20;      // the decoded-chunk cache's limit
  bool showCompressionAttributes = false;
  double attributeTimeout = 1.0;      // seconds the kernel may keep attributes and names
  bool keepCache = true;              // let the kernel keep the pages of a file unchanged since its last open
  unsigned maxRead = 0;               // the largest read request, when limited (-o max_read)
};

class MountFileSystem {
 public:
  // sourceFd: an O_PATH descriptor of the directory, owned from now on.
  MountFileSystem(int sourceFd, MountSettings settings);
  ~MountFileSystem();
  MountFileSystem(const MountFileSystem &) = delete;
  MountFileSystem &operator=(const MountFileSystem &) = delete;

  // The operations table; each operation finds this object as the mount's private data.
  static const fuse_operations &operations();

  ChunkCache &cache() { return cache_; }
  const MountSettings &settings() const { return settings_; }
  int sourceFd() const { return sourceFd_; }
  // "/proc/self/fd/N/relative": a path to the source's file that never crosses the mount,
  // for the library calls that take paths (the mount may sit on the directory itself).
  std::string sourcePath(const char *relative) const;

  // Whether the kernel may keep the pages of this file version from an earlier open; records
  // the version for the next open.
  bool sameVersionAsLastOpen(uint64_t device, uint64_t inode, uint64_t version);
  void forgetVersion(uint64_t device, uint64_t inode);

  // Whole chunks decoded straight into a reply, without the cache.
  std::atomic<uint64_t> directDecodes{0};

 private:
  int sourceFd_;
  MountSettings settings_;
  ChunkCache cache_;
  std::mutex versionsMutex_;  // guards versions_ only
  std::map<std::pair<uint64_t, uint64_t>, uint64_t> versions_;  // (device, inode) -> version last opened
};

// Whether a Linux attribute name is one of the compression attributes or the attribute
// layer's own reserved names, which the mount hides unless told to show them.
bool isCompressionAttribute(const char *linuxName);

}  // namespace plzc
