// Keeps a copy of every line written on descriptor 2 while letting it through, so that the
// files named in the library's failure messages can be listed at the end of a run.
#pragma once

#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace plzc {

class StderrTap {
 public:
  // Starts copying; if the pipe cannot be made, lines pass untouched and none are kept.
  StderrTap();
  // Stops copying (as stop()).
  ~StderrTap();
  StderrTap(const StderrTap &) = delete;
  StderrTap &operator=(const StderrTap &) = delete;

  // Restores descriptor 2 and waits until every line written so far has passed.
  void stop();
  // The lines seen so far (at most kMaxLines of them), without their newlines.
  std::vector<std::string> lines();

  static constexpr size_t kMaxLines = 10000;

 private:
  void loop();

  int savedFd_ = -1;
  int readFd_ = -1;
  std::thread thread_;
  std::mutex lock_;
  std::vector<std::string> lines_;
};

// The entries of candidates that appear as whole paths in text: followed by the end of the
// text or by a character that cannot continue a path in a message (space, colon, quote...).
bool mentionsPath(const std::string &text, const std::string &path);

}  // namespace plzc
