#include "StderrTap.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

namespace plzc {

StderrTap::StderrTap() {
  int pipeFds[2];
  if (pipe2(pipeFds, O_CLOEXEC) != 0) return;
  fflush(stderr);
  savedFd_ = fcntl(2, F_DUPFD_CLOEXEC, 3);
  if (savedFd_ < 0 || dup2(pipeFds[1], 2) < 0) {
    if (savedFd_ >= 0) close(savedFd_);
    savedFd_ = -1;
    close(pipeFds[0]);
    close(pipeFds[1]);
    return;
  }
  close(pipeFds[1]);
  readFd_ = pipeFds[0];
  thread_ = std::thread([this] { loop(); });
}

StderrTap::~StderrTap() { stop(); }

void StderrTap::stop() {
  if (savedFd_ < 0) return;
  fflush(stderr);
  dup2(savedFd_, 2);  // the last write end closes: the loop sees the end
  if (thread_.joinable()) thread_.join();
  close(savedFd_);
  close(readFd_);
  savedFd_ = readFd_ = -1;
}

std::vector<std::string> StderrTap::lines() {
  std::lock_guard<std::mutex> guard(lock_);
  return lines_;
}

void StderrTap::loop() {
  std::string pending;
  char buffer[8192];
  for (;;) {
    ssize_t got = read(readFd_, buffer, sizeof buffer);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) break;
    for (ssize_t done = 0; done < got;) {
      ssize_t wrote = write(savedFd_, buffer + done, static_cast<size_t>(got - done));
      if (wrote < 0 && errno == EINTR) continue;
      if (wrote <= 0) break;
      done += wrote;
    }
    pending.append(buffer, static_cast<size_t>(got));
    size_t newline;
    while ((newline = pending.find('\n')) != std::string::npos) {
      std::lock_guard<std::mutex> guard(lock_);
      if (lines_.size() < kMaxLines) lines_.push_back(pending.substr(0, newline));
      pending.erase(0, newline + 1);
    }
  }
  if (!pending.empty()) {
    std::lock_guard<std::mutex> guard(lock_);
    if (lines_.size() < kMaxLines) lines_.push_back(pending);
  }
}

bool mentionsPath(const std::string &text, const std::string &path) {
  if (path.empty()) return false;
  for (size_t at = text.find(path); at != std::string::npos; at = text.find(path, at + 1)) {
    size_t end = at + path.size();
    if (end == text.size()) return true;
    char next = text[end];
    if (next == ' ' || next == ':' || next == '\'' || next == '"' || next == ')' || next == ',' || next == '\t')
      return true;
  }
  return false;
}

}  // namespace plzc
