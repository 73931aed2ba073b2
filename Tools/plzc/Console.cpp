#include "Console.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

namespace plzc {

namespace {

Console *gCurrent = nullptr;

void writeAll(int fd, const char *bytes, size_t length) {
  while (length > 0) {
    ssize_t wrote = write(fd, bytes, length);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote <= 0) return;  // nowhere left to report to
    bytes += wrote;
    length -= static_cast<size_t>(wrote);
  }
}

std::string vformat(const char *format, va_list args) {
  va_list copy;
  va_copy(copy, args);
  int length = vsnprintf(nullptr, 0, format, copy);
  va_end(copy);
  if (length <= 0) return {};
  std::string text(static_cast<size_t>(length), '\0');
  vsnprintf(text.data(), text.size() + 1, format, args);
  return text;
}

}  // namespace

Console::Console(bool verbose, bool wantProgress) : verbose_(verbose) {
  fflush(stdout);
  fflush(stderr);
  outFd_ = fcntl(1, F_DUPFD_CLOEXEC, 3);
  errFd_ = fcntl(2, F_DUPFD_CLOEXEC, 3);
  outStream_ = outFd_ >= 0 ? fdopen(outFd_, "w") : nullptr;
  progress_ = wantProgress && errFd_ >= 0 && isatty(errFd_);

  // The library's notes on standard output.
  if (!verbose_) {
    int devNull = open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (devNull >= 0) {
      dup2(devNull, 1);
      close(devNull);
    }
  } else if (progress_) {
    startRelay(stdoutRelay_, 1);
  } else {
    dup2(errFd_, 1);
  }
  // The library's messages on standard error must not run into the progress line.
  if (progress_) startRelay(stderrRelay_, 2);
  gCurrent = this;
}

Console::~Console() {
  fflush(stdout);  // library notes still buffered belong where descriptor 1 points now
  fflush(stderr);
  stopRelay(stdoutRelay_);
  stopRelay(stderrRelay_);
  {
    std::lock_guard<std::mutex> guard(lock_);
    clearLocked();
  }
  gCurrent = nullptr;
  if (outStream_) fflush(outStream_);
  if (outFd_ >= 0) dup2(outFd_, 1);
  if (outStream_)
    fclose(outStream_);
  else if (outFd_ >= 0)
    close(outFd_);
  if (errFd_ >= 0) close(errFd_);
}

Console *Console::current() { return gCurrent; }

void Console::out(const char *format, ...) {
  va_list args;
  va_start(args, format);
  std::lock_guard<std::mutex> guard(lock_);
  if (outStream_) vfprintf(outStream_, format, args);
  va_end(args);
}

void Console::err(const char *format, ...) {
  va_list args;
  va_start(args, format);
  std::string text = vformat(format, args);
  va_end(args);
  std::lock_guard<std::mutex> guard(lock_);
  clearLocked();
  writeErr(text.data(), text.size());
}

void Console::progress(const std::string &line) {
  if (!progress_) return;
  std::string text = "\r" + line + "\033[K";
  std::lock_guard<std::mutex> guard(lock_);
  writeErr(text.data(), text.size());
  progressShown_ = true;
}

void Console::clearProgress() {
  std::lock_guard<std::mutex> guard(lock_);
  clearLocked();
}

void Console::clearLocked() {
  if (!progressShown_) return;
  writeErr("\r\033[K", 4);
  progressShown_ = false;
}

void Console::writeErr(const char *bytes, size_t length) { writeAll(errFd_ >= 0 ? errFd_ : 2, bytes, length); }

void Console::startRelay(Relay &relay, int targetFd) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return;  // without a relay the lines still arrive, unformatted
  relay.savedFd = fcntl(targetFd, F_DUPFD_CLOEXEC, 3);
  if (relay.savedFd < 0) {
    close(fds[0]);
    close(fds[1]);
    return;
  }
  dup2(fds[1], targetFd);
  close(fds[1]);
  relay.targetFd = targetFd;
  relay.readFd = fds[0];
  relay.thread = std::thread([this, readFd = fds[0]] { relayLoop(readFd); });
}

void Console::stopRelay(Relay &relay) {
  if (relay.targetFd < 0) return;
  dup2(relay.savedFd, relay.targetFd);  // closes the pipe's last write end: the relay reads its end
  close(relay.savedFd);
  relay.thread.join();
  close(relay.readFd);
  relay.targetFd = -1;
}

void Console::relayLoop(int readFd) {
  std::vector<char> pending;
  char buffer[4096];
  for (;;) {
    ssize_t got = read(readFd, buffer, sizeof buffer);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) break;
    pending.insert(pending.end(), buffer, buffer + got);
    size_t lineEnd = 0;
    for (size_t i = 0; i < pending.size(); i++)
      if (pending[i] == '\n') lineEnd = i + 1;
    if (lineEnd == 0) continue;
    std::lock_guard<std::mutex> guard(lock_);
    clearLocked();
    writeErr(pending.data(), lineEnd);
    pending.erase(pending.begin(), pending.begin() + static_cast<long>(lineEnd));
  }
  if (!pending.empty()) {
    std::lock_guard<std::mutex> guard(lock_);
    clearLocked();
    writeErr(pending.data(), pending.size());
    writeErr("\n", 1);
  }
}

std::string visibleText(const std::string &text) {
  std::string shown;
  shown.reserve(text.size());
  for (size_t i = 0; i < text.size(); i++) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    if (c >= 0x20 && c != 0x7f) {
      shown += static_cast<char>(c);
    } else if (c == '\n' && i + 1 == text.size()) {
      shown += '\n';
    } else if (c == '\n' || c == '\t' || c == '\r') {
      shown += c == '\n' ? "\\n" : c == '\t' ? "\\t" : "\\r";
    } else {
      char escaped[8];
      snprintf(escaped, sizeof escaped, "\\x%02x", c);
      shown += escaped;
    }
  }
  return shown;
}

void report(const char *format, ...) {
  va_list args;
  va_start(args, format);
  std::string text = "plzc: " + vformat(format, args);
  va_end(args);
  reportText(visibleText(text));
}

void reportText(const std::string &text) {
  if (Console *console = Console::current())
    console->err("%s", text.c_str());
  else
    writeAll(2, text.data(), text.size());
}

}  // namespace plzc
