// Counts of files and bytes over a run or a tree, and their printed form.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>

namespace plzc {

constexpr uint32_t kTypeSlots = 16;  // compression types counted one by one; higher ones share the last slot

struct Totals {
  uint64_t files = 0;
  uint64_t compressed = 0;        // compressed by this run (or found compressed, for info)
  uint64_t byType[kTypeSlots] = {};
  uint64_t alreadyCompressed = 0; // found compressed by compress or decompress, left alone
  uint64_t leftPlain = 0;         // not compressed (did not shrink, refused, or a plain file for info)
  uint64_t empty = 0;
  uint64_t failed = 0;
  uint64_t logicalBytes = 0;
  uint64_t storedBytes = 0;
};

// The same counts, for many threads at once.
struct AtomicTotals {
  std::atomic<uint64_t> files{0}, compressed{0}, alreadyCompressed{0}, leftPlain{0}, empty{0}, failed{0};
  std::atomic<uint64_t> byType[kTypeSlots] = {};
  std::atomic<uint64_t> logicalBytes{0}, storedBytes{0};

  void countType(uint32_t type) { byType[type < kTypeSlots ? type : kTypeSlots - 1]++; }
  Totals snapshot() const;
};

// "type 3: 12, type 4: 40"; "none" when there is no compressed file.
std::string typeBreakdown(const Totals &totals);

// The closing lines:
//   files       1520: 1230 compressed (type 3: 400, type 4: 830), 280 not compressed, ...
//   logical     100663296 bytes (96.0 MiB)
//   stored      41234567 bytes (39.3 MiB)
//   savings     59428729 bytes (59.0%)
// Each line begins with prefix.
std::string formatTotals(const Totals &totals, const std::string &prefix = "");

}  // namespace plzc
