#include "Platform/FileFlags.h"

#include <cerrno>

#include "Platform/Syscalls.h"

namespace platform {
namespace {

constexpr char kFlagsName[] = "user.plzc#flags";

// Errors that mean "this file shows no flag word", not a failure of the stat.
bool meansNoFlags(int error) {
  return error == ENODATA || error == ENOTSUP || error == EPERM || error == EACCES;
}

int flagsFrom(ssize_t got, const uint8_t bytes[4], uint32_t *flags) {
  if (got < 0) {
    if (!meansNoFlags(errno)) return -1;
    *flags = 0;
    return 0;
  }
  if (got != 4) {
    errno = EIO;
    return -1;
  }
  *flags = static_cast<uint32_t>(bytes[0]) | static_cast<uint32_t>(bytes[1]) << 8 |
           static_cast<uint32_t>(bytes[2]) << 16 | static_cast<uint32_t>(bytes[3]) << 24;
  return 0;
}

void encode(uint32_t flags, uint8_t bytes[4]) {
  for (int i = 0; i < 4; i++) bytes[i] = static_cast<uint8_t>(flags >> (8 * i));
}

}  // namespace

int stat(const char *path, Stat *out) {
  if (sys::stat(path, &out->st) != 0) return -1;
  uint8_t bytes[4];
  return flagsFrom(sys::getxattr(path, kFlagsName, bytes, sizeof bytes), bytes, &out->st_flags);
}

int lstat(const char *path, Stat *out) {
  if (sys::lstat(path, &out->st) != 0) return -1;
  if (S_ISLNK(out->st.st_mode)) {
    out->st_flags = 0;
    return 0;
  }
  uint8_t bytes[4];
  return flagsFrom(sys::lgetxattr(path, kFlagsName, bytes, sizeof bytes), bytes, &out->st_flags);
}

int fstat(int fd, Stat *out) {
  if (sys::fstat(fd, &out->st) != 0) return -1;
  uint8_t bytes[4];
  return flagsFrom(sys::fgetxattr(fd, kFlagsName, bytes, sizeof bytes), bytes, &out->st_flags);
}

int chflags(const char *path, uint32_t flags) {
  if (flags == 0) {
    if (sys::removexattr(path, kFlagsName) == 0 || errno == ENODATA) return 0;
    return -1;
  }
  uint8_t bytes[4];
  encode(flags, bytes);
  return sys::setxattr(path, kFlagsName, bytes, sizeof bytes, 0);
}

int fchflags(int fd, uint32_t flags) {
  if (flags == 0) {
    if (sys::fremovexattr(fd, kFlagsName) == 0 || errno == ENODATA) return 0;
    return -1;
  }
  uint8_t bytes[4];
  encode(flags, bytes);
  return sys::fsetxattr(fd, kFlagsName, bytes, sizeof bytes, 0);
}

}  // namespace platform
