#include "Progress.h"

#include <cstdio>

#include "Cli.h"

namespace plzc {

namespace {

constexpr std::chrono::milliseconds kFirstDraw{500};
constexpr std::chrono::milliseconds kRedraw{250};

}  // namespace

double megabytesPerSecond(uint64_t bytes, double seconds) {
  return seconds > 0 ? static_cast<double>(bytes) / 1e6 / seconds : 0;
}

ProgressMeter::ProgressMeter(Console &console, std::string label)
    : console_(console), label_(std::move(label)), start_(std::chrono::steady_clock::now()) {
  if (console_.progressEnabled()) ticker_ = std::thread([this] { tick(); });
}

ProgressMeter::~ProgressMeter() {
  {
    std::lock_guard<std::mutex> guard(lock_);
    stopping_ = true;
  }
  wake_.notify_all();
  if (ticker_.joinable()) ticker_.join();
  console_.clearProgress();
}

void ProgressMeter::fileDone(uint64_t bytes) {
  bytes_.fetch_add(bytes);
  files_.fetch_add(1);
}

void ProgressMeter::setTotalFiles(uint64_t files) {
  totalFiles_.store(files);
  totalKnown_.store(true);
}

double ProgressMeter::elapsedSeconds() const {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start_).count();
}

std::string ProgressMeter::line() const {
  double seconds = elapsedSeconds();
  uint64_t files = files_.load(), bytes = bytes_.load();
  char text[160];
  if (totalKnown_.load())
    snprintf(text, sizeof text, "%s: %llu/%llu files, %s, %.1f MB/s, %s", label_.c_str(),
             static_cast<unsigned long long>(files), static_cast<unsigned long long>(totalFiles_.load()),
             humanBytes(bytes).c_str(), megabytesPerSecond(bytes, seconds), humanDuration(seconds).c_str());
  else
    snprintf(text, sizeof text, "%s: %llu files, %s, %.1f MB/s, %s", label_.c_str(),
             static_cast<unsigned long long>(files), humanBytes(bytes).c_str(), megabytesPerSecond(bytes, seconds),
             humanDuration(seconds).c_str());
  return text;
}

void ProgressMeter::tick() {
  std::unique_lock<std::mutex> guard(lock_);
  if (wake_.wait_for(guard, kFirstDraw, [&] { return stopping_; })) return;
  do {
    console_.progress(line());
  } while (!wake_.wait_for(guard, kRedraw, [&] { return stopping_; }));
}

}  // namespace plzc
