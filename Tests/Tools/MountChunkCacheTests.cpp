// The mount's cache of decoded chunks: within its limit, least recently used out first, one
// decode per chunk however many threads ask, and nothing kept that was decoded for a file
// that changed meanwhile.
#include "Tools/plzc/MountChunkCache.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <random>
#include <thread>

using plzc::ChunkCache;
using plzc::ChunkKey;

namespace {

// Bytes derived from the key, so that a chunk served for the wrong key shows.
std::vector<uint8_t> bytesFor(const ChunkKey &key, size_t size) {
  std::vector<uint8_t> bytes(size);
  for (size_t i = 0; i < size; i++) bytes[i] = static_cast<uint8_t>(key.inode * 31 + key.version * 7 + key.index + i);
  return bytes;
}

struct Counting {
  std::atomic<int> decodes{0};
  size_t size = 1000;
  ChunkCache::Decode decoder(const ChunkKey &key) {
    return [this, key](std::vector<uint8_t> *out) {
      decodes++;
      *out = bytesFor(key, size);
      return 0;
    };
  }
};

ChunkKey key(uint64_t index, uint64_t inode = 1, uint64_t version = 1) { return {10, inode, version, index}; }

TEST(ChunkCache, KeepsWhatItDecodedAndServesItAgain) {
  ChunkCache cache(1 << 20);
  Counting counting;
  int error = 0;
  ChunkCache::Chunk first = cache.get(key(0), counting.decoder(key(0)), &error);
  ChunkCache::Chunk again = cache.get(key(0), counting.decoder(key(0)), &error);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first, again);
  EXPECT_EQ(*first, bytesFor(key(0), 1000));
  EXPECT_EQ(counting.decodes.load(), 1);
  // Another version or another file is another chunk.
  cache.get(key(0, 1, 2), counting.decoder(key(0, 1, 2)), &error);
  cache.get(key(0, 2, 1), counting.decoder(key(0, 2, 1)), &error);
  EXPECT_EQ(counting.decodes.load(), 3);
  ChunkCache::Stats stats = cache.stats();
  EXPECT_EQ(stats.hits, 1u);
  EXPECT_EQ(stats.misses, 3u);
  EXPECT_EQ(stats.entries, 3u);
  EXPECT_EQ(stats.bytes, 3000u);
}

TEST(ChunkCache, EvictsTheLeastRecentlyUsedToStayWithinItsLimit) {
  ChunkCache cache(3500);
  Counting counting;
  int error = 0;
  for (uint64_t i = 0; i < 3; i++) cache.get(key(i), counting.decoder(key(i)), &error);
  cache.get(key(0), counting.decoder(key(0)), &error);  // 0 becomes the most recent
  cache.get(key(3), counting.decoder(key(3)), &error);  // 1 goes
  EXPECT_EQ(counting.decodes.load(), 4);
  ChunkCache::Stats stats = cache.stats();
  EXPECT_EQ(stats.entries, 3u);
  EXPECT_LE(stats.bytes, 3500u);
  EXPECT_LE(stats.peakBytes, 3500u);
  EXPECT_EQ(stats.evictions, 1u);
  for (uint64_t i : {0, 2, 3}) cache.get(key(i), counting.decoder(key(i)), &error);
  EXPECT_EQ(counting.decodes.load(), 4) << "0, 2 and 3 were still kept";
  cache.get(key(1), counting.decoder(key(1)), &error);
  EXPECT_EQ(counting.decodes.load(), 5) << "1 was evicted";
}

TEST(ChunkCache, AChunkLargerThanTheLimitIsServedButNotKept) {
  ChunkCache cache(500);
  Counting counting;
  int error = 0;
  ChunkCache::Chunk chunk = cache.get(key(0), counting.decoder(key(0)), &error);
  ASSERT_NE(chunk, nullptr);
  EXPECT_EQ(chunk->size(), 1000u);
  EXPECT_EQ(cache.stats().bytes, 0u);
  cache.get(key(0), counting.decoder(key(0)), &error);
  EXPECT_EQ(counting.decodes.load(), 2);
}

TEST(ChunkCache, FailuresAreReportedAndTriedAgain) {
  ChunkCache cache(1 << 20);
  int calls = 0;
  auto failing = [&](std::vector<uint8_t> *) {
    calls++;
    return EIO;
  };
  int error = 0;
  EXPECT_EQ(cache.get(key(0), failing, &error), nullptr);
  EXPECT_EQ(error, EIO);
  error = 0;
  EXPECT_EQ(cache.get(key(0), failing, &error), nullptr);
  EXPECT_EQ(error, EIO);
  EXPECT_EQ(calls, 2);
  EXPECT_EQ(cache.stats().entries, 0u);
  auto throwing = [](std::vector<uint8_t> *) -> int { throw std::bad_alloc(); };
  EXPECT_EQ(cache.get(key(1), throwing, &error), nullptr);
  EXPECT_EQ(error, ENOMEM);
}

TEST(ChunkCache, DropFileForgetsEveryVersionOfThatFileOnly) {
  ChunkCache cache(1 << 20);
  Counting counting;
  int error = 0;
  for (uint64_t version : {1, 2})
    for (uint64_t i = 0; i < 3; i++) cache.get(key(i, 5, version), counting.decoder(key(i, 5, version)), &error);
  cache.get(key(0, 6), counting.decoder(key(0, 6)), &error);
  cache.dropFile(10, 5);
  EXPECT_EQ(cache.stats().entries, 1u);
  EXPECT_EQ(cache.stats().bytes, 1000u);
  cache.get(key(0, 6), counting.decoder(key(0, 6)), &error);
  EXPECT_EQ(counting.decodes.load(), 7) << "the other file's chunk stayed";
}

TEST(ChunkCache, ADecodeOverlappedByDropFileIsNotKept) {
  ChunkCache cache(1 << 20);
  int error = 0;
  ChunkCache::Chunk chunk = cache.get(
      key(0),
      [&](std::vector<uint8_t> *out) {
        cache.dropFile(10, 1);  // the file changes while its chunk is decoded
        *out = bytesFor(key(0), 100);
        return 0;
      },
      &error);
  ASSERT_NE(chunk, nullptr) << "the caller still gets what it decoded";
  EXPECT_EQ(cache.stats().entries, 0u);
}

TEST(ChunkCache, ThreadsAskingForOneMissingChunkShareOneDecode) {
  ChunkCache cache(1 << 20);
  std::atomic<int> decodes{0}, started{0};
  std::atomic<bool> release{false};
  auto slow = [&](std::vector<uint8_t> *out) {
    decodes++;
    while (!release) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    *out = bytesFor(key(0), 4096);
    return 0;
  };
  std::vector<ChunkCache::Chunk> results(8);
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; t++) {
    threads.emplace_back([&, t] {
      int error = 0;
      started++;
      results[static_cast<size_t>(t)] = cache.get(key(0), slow, &error);
    });
  }
  while (started < 8) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  release = true;
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(decodes.load(), 1);
  for (const ChunkCache::Chunk &chunk : results) EXPECT_EQ(chunk, results[0]);
  ASSERT_NE(results[0], nullptr);
  EXPECT_EQ(*results[0], bytesFor(key(0), 4096));
  ChunkCache::Stats stats = cache.stats();
  EXPECT_EQ(stats.misses + stats.waits + stats.hits, 8u);
}

TEST(ChunkCache, ManyThreadsOverManyKeysGetTheRightBytesWithinTheLimit) {
  constexpr size_t kChunk = 2048, kLimit = 40 * kChunk;
  ChunkCache cache(kLimit);
  std::atomic<int> wrong{0}, failures{0};
  std::atomic<size_t> overLimit{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; t++) {
    threads.emplace_back([&, t] {
      std::mt19937 random(static_cast<uint32_t>(t));
      for (int n = 0; n < 3000; n++) {
        ChunkKey k = key(random() % 64, 1 + random() % 3, 1 + random() % 2);
        int error = 0;
        ChunkCache::Chunk chunk = cache.get(
            k,
            [&](std::vector<uint8_t> *out) {
              if (random() % 50 == 0) return EIO;
              *out = bytesFor(k, kChunk);
              return 0;
            },
            &error);
        if (!chunk) {
          failures++;
          if (error != EIO) wrong++;
        } else if (*chunk != bytesFor(k, kChunk)) {
          wrong++;
        }
        if (n % 100 == 0) cache.dropFile(10, 1 + random() % 3);
        size_t bytes = cache.stats().bytes;
        if (bytes > kLimit) overLimit = bytes;
      }
    });
  }
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(wrong.load(), 0);
  EXPECT_EQ(overLimit.load(), 0u);
  EXPECT_GT(failures.load(), 0) << "the failing decodes were exercised";
  ChunkCache::Stats stats = cache.stats();
  EXPECT_LE(stats.peakBytes, kLimit);
  EXPECT_EQ(stats.bytes, stats.entries * kChunk);
  EXPECT_GT(stats.hits, 0u);
  EXPECT_GT(stats.evictions, 0u);
}

}  // namespace
