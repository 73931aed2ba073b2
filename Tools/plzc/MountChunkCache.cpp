#include "MountChunkCache.h"

#include <cerrno>
#include <new>

namespace plzc {

size_t ChunkCache::KeyHash::operator()(const ChunkKey &key) const {
  uint64_t h = key.device * 0x9E3779B97F4A7C15ULL;
  for (uint64_t part : {key.inode, key.version, key.index}) h = (h ^ part) * 0x100000001B3ULL + (h >> 29);
  return static_cast<size_t>(h);
}

ChunkCache::ChunkCache(size_t limitBytes) : limit_(limitBytes) {}

ChunkCache::Chunk ChunkCache::get(const ChunkKey &key, const Decode &decode, int *error) {
  std::shared_ptr<Pending> pending;
  bool decodeHere = false;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    auto found = entries_.find(key);
    if (found != entries_.end()) {
      recent_.splice(recent_.begin(), recent_, found->second);
      stats_.hits++;
      return found->second->chunk;
    }
    auto running = pending_.find(key);
    if (running != pending_.end()) {
      pending = running->second;
      stats_.waits++;
    } else {
      pending = std::make_shared<Pending>();
      pending_.emplace(key, pending);
      stats_.misses++;
      decodeHere = true;
    }
  }

  if (!decodeHere) {
    std::unique_lock<std::mutex> lock(pending->mutex);
    pending->done.wait(lock, [&] { return pending->finished; });
    if (!pending->chunk) *error = pending->error;
    return pending->chunk;
  }

  auto bytes = std::make_shared<std::vector<uint8_t>>();
  int failure;
  try {
    failure = decode(bytes.get());
  } catch (const std::bad_alloc &) {
    failure = ENOMEM;  // the waiters must still be woken
  }
  Chunk chunk;
  if (failure == 0) chunk = std::move(bytes);
  {
    std::lock_guard<std::mutex> lock(mutex_);
    auto running = pending_.find(key);
    // dropFile ran meanwhile when our record is gone (or replaced): the result is for a file
    // that changed, so it is handed to this call's waiters but not kept.
    bool current = running != pending_.end() && running->second == pending;
    if (current) pending_.erase(running);
    if (current && chunk && chunk->size() <= limit_ && !entries_.count(key)) {
      recent_.push_front({key, chunk});
      entries_.emplace(key, recent_.begin());
      stats_.bytes += chunk->size();
      stats_.entries++;
      evictLocked();
      if (stats_.bytes > stats_.peakBytes) stats_.peakBytes = stats_.bytes;
    }
  }
  {
    std::lock_guard<std::mutex> lock(pending->mutex);
    pending->chunk = chunk;
    pending->error = failure;
    pending->finished = true;
  }
  pending->done.notify_all();
  if (!chunk) *error = failure;
  return chunk;
}

ChunkCache::Chunk ChunkCache::find(const ChunkKey &key) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto found = entries_.find(key);
  if (found == entries_.end()) return nullptr;
  recent_.splice(recent_.begin(), recent_, found->second);
  stats_.hits++;
  return found->second->chunk;
}

void ChunkCache::evictLocked() {
  while (stats_.bytes > limit_ && !recent_.empty()) {
    Entry &last = recent_.back();
    stats_.bytes -= last.chunk->size();
    stats_.entries--;
    stats_.evictions++;
    entries_.erase(last.key);
    recent_.pop_back();
  }
}

void ChunkCache::dropFile(uint64_t device, uint64_t inode) {
  std::lock_guard<std::mutex> lock(mutex_);
  for (auto it = recent_.begin(); it != recent_.end();) {
    if (it->key.device == device && it->key.inode == inode) {
      stats_.bytes -= it->chunk->size();
      stats_.entries--;
      entries_.erase(it->key);
      it = recent_.erase(it);
    } else {
      ++it;
    }
  }
  for (auto it = pending_.begin(); it != pending_.end();) {
    if (it->first.device == device && it->first.inode == inode)
      it = pending_.erase(it);
    else
      ++it;
  }
}

ChunkCache::Stats ChunkCache::stats() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return stats_;
}

}  // namespace plzc
