// Decoded chunks of compressed files, shared by every open file of a mount and kept within a
// byte limit, least recently used first out.
//
// A chunk is keyed by its file (device, inode), the file's version (anything that changes when
// the file does: its change time and size) and its index, so a file changed under the mount
// is simply never served its old chunks; they age out, or dropFile removes them at once.
// Decoding happens outside the lock, and only one of several threads asking for the same
// missing chunk decodes it: the others wait for that result.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <condition_variable>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

namespace plzc {

struct ChunkKey {
  uint64_t device = 0, inode = 0;
  uint64_t version = 0;
  uint64_t index = 0;
  bool operator==(const ChunkKey &other) const = default;
};

class ChunkCache {
 public:
  using Chunk = std::shared_ptr<const std::vector<uint8_t>>;
  // Fills *bytes with the decoded chunk; 0, or an errno value.
  using Decode = std::function<int(std::vector<uint8_t> *bytes)>;

  explicit ChunkCache(size_t limitBytes);
  ChunkCache(const ChunkCache &) = delete;
  ChunkCache &operator=(const ChunkCache &) = delete;

  // The chunk under key: cached, or decoded now by decode() (in the calling thread, without
  // the cache's lock). Null with *error set when the decode failed; failures are not kept, so
  // a later call tries again. A chunk larger than the whole limit is returned but not kept.
  Chunk get(const ChunkKey &key, const Decode &decode, int *error);
  // The chunk under key when it is kept (a hit), else null; decodes nothing.
  Chunk find(const ChunkKey &key);
  // Forgets every chunk of the file, of any version, including decodes still running.
  void dropFile(uint64_t device, uint64_t inode);

  struct Stats {
    uint64_t hits = 0, misses = 0, waits = 0, evictions = 0;
    size_t bytes = 0, peakBytes = 0, entries = 0;
  };
  Stats stats() const;
  size_t limit() const { return limit_; }

 private:
  struct KeyHash {
    size_t operator()(const ChunkKey &key) const;
  };
  struct Entry {
    ChunkKey key;
    Chunk chunk;
  };
  // A decode in progress: the threads that want the same chunk wait here, not on the cache.
  struct Pending {
    std::mutex mutex;
    std::condition_variable done;
    bool finished = false;
    Chunk chunk;
    int error = 0;
  };

  void evictLocked();

  const size_t limit_;
  mutable std::mutex mutex_;  // guards everything below; never held while decoding or waiting
  std::list<Entry> recent_;   // most recently used first
  std::unordered_map<ChunkKey, std::list<Entry>::iterator, KeyHash> entries_;
  std::unordered_map<ChunkKey, std::shared_ptr<Pending>, KeyHash> pending_;
  Stats stats_;
};

}  // namespace plzc
