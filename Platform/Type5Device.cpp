#include "Platform/Type5Device.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>

#include "Platform/Syscalls.h"

namespace plzc {
namespace {

std::atomic<const char *> gDevicePath{nullptr};

int connectSequencedPacket(const char *path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  size_t length = strlen(path);
  if (length >= sizeof address.sun_path) {
    errno = ENAMETOOLONG;
    return -1;
  }
  memcpy(address.sun_path, path, length + 1);
  int fd = ::socket(AF_UNIX, SOCK_SEQPACKET, 0);
  if (fd < 0) return -1;
  if (::connect(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) {
    int savedErrno = errno;
    sys::close(fd);
    errno = savedErrno;
    return -1;
  }
  return fd;
}

}  // namespace

int openType5Device(const char *path) {
  int fd = sys::open(path, O_RDWR, 0);
  // open() refuses a UNIX socket with ENXIO; only then is the path looked at more closely.
  if (fd >= 0 || errno != ENXIO) return fd;
  struct ::stat status;
  if (sys::stat(path, &status) != 0 || !S_ISSOCK(status.st_mode)) {
    errno = ENXIO;
    return -1;
  }
  return connectSequencedPacket(path);
}

const char *type5DevicePath() {
  const char *path = gDevicePath.load(std::memory_order_acquire);
  return path ? path : kType5DevicePath;
}

void setType5DevicePath(const char *path) { gDevicePath.store(path, std::memory_order_release); }

}  // namespace plzc
