// Data-pool transfer throughput between a writer thread and a reader thread, against a plain
// memcpy of the same bytes in the same run.
//
//   poolBench [total-MiB] [repetitions]
//
// For each piece size (64 KiB and 1 MiB), times, best of the repetitions (3 by default):
//   - the baseline: one thread copying total-MiB (2048 by default) in pieces of that size with
//     memcpy into a ring-sized buffer (64 MiB, already touched), wrapping at its end as the
//     pool does;
//   - a fresh pool: one pool for a file of total-MiB, so its ring is the largest a pool has
//     (64 MiB); a writer thread adds the data in pieces while a reader thread takes it in
//     pieces of the same size. The time runs from the pool's creation to the end of both
//     threads, so it includes the first touch of the ring's pages, which every stream pays;
//   - a warm pool: the same, but the ring was filled and drained once before the clock starts,
//     so only the transfer itself is timed.
// Each piece carries its sequence number, which the reader checks, so a run that loses or
// reorders data fails. Prints the throughputs in MB/s (10^6 bytes of data per second) and each
// pool's as a ratio of the baseline's, with the sizes and the core count.
#include <algorithm>
#include <chrono>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <thread>
#include <vector>

#include "Common/DataPool.h"

namespace {

constexpr uint64_t kMiB = 1 << 20;

double secondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

[[noreturn]] void fail(const char *what) {
  fprintf(stderr, "poolBench: %s\n", what);
  exit(1);
}

// Seconds for total bytes through one pool, piece bytes per add and per get. A warm pool's
// ring has been filled and drained once, untimed, before the clock starts.
double timePool(uint64_t total, size_t piece, bool warm) {
  std::vector<uint8_t> source(piece, 0x5A), destination(piece);
  bool readerFailed = false;
  auto start = std::chrono::steady_clock::now();
  uint64_t warmBytes = warm ? std::min<uint64_t>(total, kDataPoolMaxCapacity) : 0;
  DataPool *pool = newDataPool(static_cast<int64_t>(total + warmBytes));
  if (!pool) fail("newDataPool failed");
  if (warm) {
    // One writer and one reader, one after the other on this thread: the ring holds it all.
    for (uint64_t at = 0; at < warmBytes; at += piece) {
      size_t n = static_cast<size_t>(std::min<uint64_t>(piece, warmBytes - at));
      if (addDataToPool(pool, source.data(), n) != static_cast<int64_t>(n)) fail("warming the pool failed");
    }
    for (uint64_t at = 0; at < warmBytes; at += piece) {
      size_t n = static_cast<size_t>(std::min<uint64_t>(piece, warmBytes - at));
      if (getDataFromPool(pool, destination.data(), n) != static_cast<int64_t>(n)) fail("warming the pool failed");
    }
    start = std::chrono::steady_clock::now();
  }
  std::thread reader([&] {
    for (uint64_t at = 0, index = 0; at < total; index++) {
      size_t n = static_cast<size_t>(std::min<uint64_t>(piece, total - at));
      if (getDataFromPool(pool, destination.data(), n) != static_cast<int64_t>(n)) {
        readerFailed = true;
        break;
      }
      uint64_t stamp;
      memcpy(&stamp, destination.data(), sizeof stamp);
      if (n >= sizeof stamp && stamp != index) {
        readerFailed = true;
        break;
      }
      at += n;
    }
  });
  bool writerFailed = false;
  for (uint64_t at = 0, index = 0; at < total; index++) {
    size_t n = static_cast<size_t>(std::min<uint64_t>(piece, total - at));
    memcpy(source.data(), &index, sizeof index);
    if (addDataToPool(pool, source.data(), n) != static_cast<int64_t>(n)) {
      writerFailed = true;
      abortDataPool(pool);
      break;
    }
    at += n;
  }
  finishDataPool(pool);
  reader.join();
  releaseDataPool(pool);
  double seconds = secondsSince(start);
  if (writerFailed || readerFailed) fail("the pool lost or reordered data");
  return seconds;
}

// Seconds for one thread to memcpy total bytes, piece bytes at a time, into a ring of
// ringBytes that wraps as the pool's does.
double timeMemcpy(uint64_t total, size_t piece, std::vector<uint8_t> &ring) {
  std::vector<uint8_t> source(piece, 0x5A);
  uint64_t position = 0;
  auto start = std::chrono::steady_clock::now();
  for (uint64_t at = 0, index = 0; at < total; index++) {
    size_t n = static_cast<size_t>(std::min<uint64_t>(piece, total - at));
    memcpy(source.data(), &index, sizeof index);
    for (size_t done = 0; done < n;) {
      size_t step = static_cast<size_t>(std::min<uint64_t>(n - done, ring.size() - position));
      memcpy(ring.data() + position, source.data() + done, step);
      done += step;
      position = position + step == ring.size() ? 0 : position + step;
    }
    at += n;
  }
  double seconds = secondsSince(start);
  // The copies must not be optimised away: the last piece's stamp is in the ring.
  uint64_t stamp;
  size_t last = static_cast<size_t>(((total - 1) / piece * piece) % ring.size());
  memcpy(&stamp, ring.data() + last, sizeof stamp);
  if (stamp != (total - 1) / piece) fail("the baseline did not copy the data");
  return seconds;
}

}  // namespace

int main(int argc, char **argv) {
  uint64_t totalMiB = argc > 1 ? strtoull(argv[1], nullptr, 10) : 2048;
  int repetitions = argc > 2 ? atoi(argv[2]) : 3;
  if (totalMiB == 0 || repetitions < 1) {
    fprintf(stderr, "usage: %s [total-MiB] [repetitions]\n", argv[0]);
    return 2;
  }
  const uint64_t total = totalMiB * kMiB;
  const uint64_t ringBytes = std::min<uint64_t>(total, kDataPoolMaxCapacity);
  std::vector<uint8_t> ring(ringBytes, 0);  // touched once here, as a warm buffer

  printf("poolBench: %u cores, %" PRIu64 " MiB through one pool with a %" PRIu64 " MiB ring, best of %d\n",
         std::thread::hardware_concurrency(), totalMiB, ringBytes / kMiB, repetitions);
  printf("  %-8s %12s %12s %7s %12s %7s\n", "piece", "memcpy MB/s", "fresh MB/s", "ratio", "warm MB/s", "ratio");
  for (size_t piece : {static_cast<size_t>(64 * 1024), static_cast<size_t>(kMiB)}) {
    double bestMemcpy = 1e30, bestFresh = 1e30, bestWarm = 1e30;
    for (int run = 0; run < repetitions; run++) {
      bestMemcpy = std::min(bestMemcpy, timeMemcpy(total, piece, ring));
      bestFresh = std::min(bestFresh, timePool(total, piece, false));
      bestWarm = std::min(bestWarm, timePool(total, piece, true));
    }
    double memcpyRate = static_cast<double>(total) / 1e6 / bestMemcpy;
    double freshRate = static_cast<double>(total) / 1e6 / bestFresh;
    double warmRate = static_cast<double>(total) / 1e6 / bestWarm;
    char label[16];
    snprintf(label, sizeof label, piece >= kMiB ? "%zu MiB" : "%zu KiB", piece >= kMiB ? piece / kMiB : piece / 1024);
    printf("  %-8s %12.1f %12.1f %7.2f %12.1f %7.2f\n", label, memcpyRate, freshRate, freshRate / memcpyRate, warmRate,
           warmRate / memcpyRate);
  }
  return 0;
}
