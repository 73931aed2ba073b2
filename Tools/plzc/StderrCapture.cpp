#include "StderrCapture.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cstdio>
#include <mutex>

namespace plzc {

namespace {

// One memory file for the whole process, emptied after each capture: commands capture once per
// file, and making a new one each time cost more than the reads it wraps.
std::mutex captureLock;
int captureFd = -2;  // -2 not yet made, -1 could not be made

}  // namespace

std::string captureStderr(const std::function<void()> &call) {
  std::lock_guard<std::mutex> hold(captureLock);
  if (captureFd == -2) captureFd = memfd_create("plzc-stderr", MFD_CLOEXEC);
  int saved = captureFd >= 0 ? dup(2) : -1;
  if (saved < 0) {  // cannot capture: let the messages through as they are
    call();
    return "";
  }
  fflush(stderr);
  dup2(captureFd, 2);
  call();
  fflush(stderr);
  dup2(saved, 2);
  close(saved);
  std::string text;
  off_t written = lseek(captureFd, 0, SEEK_CUR);
  if (written <= 0) return text;
  text.resize(static_cast<size_t>(written));
  ssize_t got = pread(captureFd, text.data(), text.size(), 0);
  text.resize(got > 0 ? static_cast<size_t>(got) : 0);
  if (ftruncate(captureFd, 0) != 0 || lseek(captureFd, 0, SEEK_SET) != 0) {
    // A memory file that cannot be emptied would hand these messages out again: start a new one.
    close(captureFd);
    captureFd = -2;
  }
  return text;
}

}  // namespace plzc
