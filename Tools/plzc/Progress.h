// The progress line of long work: files and bytes done, throughput and elapsed time, redrawn a
// few times a second on standard error when it is a terminal, and nowhere otherwise.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>

#include "Console.h"

namespace plzc {

class ProgressMeter {
 public:
  // Starts the clock; draws only when the console shows progress, first after half a second so
  // that short runs stay silent.
  ProgressMeter(Console &console, std::string label);
  // Stops drawing and clears the line.
  ~ProgressMeter();
  ProgressMeter(const ProgressMeter &) = delete;
  ProgressMeter &operator=(const ProgressMeter &) = delete;

  // Thread-safe.
  void fileDone(uint64_t bytes);
  // The walk has ended: the line shows "done/total files" from now on.
  void setTotalFiles(uint64_t files);

  uint64_t files() const { return files_.load(); }
  uint64_t bytes() const { return bytes_.load(); }
  double elapsedSeconds() const;
  // "12.3 MiB, 45.6 MB/s"-style text of the throughput so far.
  std::string line() const;

 private:
  void tick();

  Console &console_;
  std::string label_;
  std::chrono::steady_clock::time_point start_;
  std::atomic<uint64_t> files_{0}, bytes_{0}, totalFiles_{0};
  std::atomic<bool> totalKnown_{false};
  std::mutex lock_;
  std::condition_variable wake_;
  bool stopping_ = false;
  std::thread ticker_;
};

// Megabytes (10^6 bytes) per second.
double megabytesPerSecond(uint64_t bytes, double seconds);

}  // namespace plzc
