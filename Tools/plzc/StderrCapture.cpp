#include "StderrCapture.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cstdio>

namespace plzc {

std::string captureStderr(const std::function<void()> &call) {
  int capture = memfd_create("plzc-stderr", MFD_CLOEXEC);
  int saved = capture >= 0 ? dup(2) : -1;
  if (saved < 0) {  // cannot capture: let the messages through as they are
    if (capture >= 0) close(capture);
    call();
    return "";
  }
  fflush(stderr);
  dup2(capture, 2);
  call();
  fflush(stderr);
  dup2(saved, 2);
  close(saved);
  std::string text;
  char buffer[4096];
  ssize_t got;
  lseek(capture, 0, SEEK_SET);
  while ((got = read(capture, buffer, sizeof buffer)) > 0) text.append(buffer, static_cast<size_t>(got));
  close(capture);
  return text;
}

}  // namespace plzc
