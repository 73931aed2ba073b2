// The type-5 service loop: reads 48-byte requests from the type-5 device and answers them
// through the caller's callbacks, type 2 at once, type 1 through completion handles that may
// answer later from any thread. Its messages go only to the system log, at LOG_ERR.
#include "Plenzo.h"

#include <syslog.h>

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <new>

#include "Platform/SystemLog.h"
#include "Platform/Syscalls.h"
#include "Platform/Type5Device.h"

namespace {

// One request or answer on the device, in the machine's byte order.
struct Type5Record {
  uint64_t header;
  int64_t requestType;
  uint64_t value1;
  uint64_t value2;
  uint64_t value3;
  uint64_t value4;
};
static_assert(sizeof(Type5Record) == 48);
static_assert(offsetof(Type5Record, value1) == 16 && offsetof(Type5Record, value4) == 40);

// The device descriptor, shared by the loop and every completion of its requests: it is closed
// when neither can write to it any more, so a kept completion never writes to a descriptor
// number that was closed and reused.
struct SharedDevice {
  std::atomic<uint32_t> references;
  int fd;
};

void retainDevice(SharedDevice *device) { device->references.fetch_add(1, std::memory_order_relaxed); }

void releaseDevice(SharedDevice *device) {
  if (device->references.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
  sys::close(device->fd);
  device->~SharedDevice();
  free(device);
}

// One write of the whole record; logs a failed or short write. 0 or -1 with errno.
int sendRecord(int fd, const Type5Record &record) {
  errno = 0;
  ssize_t written = sys::write(fd, &record, sizeof record);
  if (written == static_cast<ssize_t>(sizeof record)) return 0;
  plzc::systemLog(LOG_ERR, "send response: %s", strerror(errno));
  if (written >= 0) errno = EIO;
  return -1;
}

}  // namespace

// Each request's record. The loop holds one reference while it serves the request; a type-1
// handler's copies hold the others. The record keeps the request as read and is never written
// after, so copies on several threads can answer at once without a lock.
struct Type5Completion {
  std::atomic<uint32_t> references;
  SharedDevice *device;
  Type5Record request;
};

namespace {

// A fresh zero-filled record on `device`, or nullptr with errno ENOMEM.
Type5Completion *newCompletion(SharedDevice *device) {
  void *memory = sys::malloc(sizeof(Type5Completion));
  if (!memory) return nullptr;
  retainDevice(device);
  return new (memory) Type5Completion{{1}, device, {}};
}

}  // namespace

extern "C" Type5Completion *Type5CompletionCopy(Type5Completion *completion) {
  if (completion) completion->references.fetch_add(1, std::memory_order_relaxed);
  return completion;
}

extern "C" void Type5CompletionRelease(Type5Completion *completion) {
  if (!completion || completion->references.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
  SharedDevice *device = completion->device;
  completion->~Type5Completion();
  free(completion);
  releaseDevice(device);
}

extern "C" int Type5CompletionInvoke(Type5Completion *completion, uint64_t r1, uint64_t r2, uint64_t r3) {
  if (!completion) {
    errno = EINVAL;
    return -1;
  }
  Type5Record answer = completion->request;
  // Crossed on purpose: the second value goes to offset 32, the third to offset 24.
  answer.value1 = r1;
  answer.value2 = r3;
  answer.value3 = r2;
  return sendRecord(completion->device->fd, answer);
}

extern "C" int type5_handler_function(const Type5Callbacks *callbacks) {
  void *memory = sys::malloc(sizeof(SharedDevice));
  if (!memory) {
    plzc::systemLog(LOG_ERR, "plzc open: %s", strerror(errno));
    return 0;
  }
  int fd = plzc::openType5Device(plzc::type5DevicePath());
  if (fd < 0) {
    plzc::systemLog(LOG_ERR, "plzc open: %s", strerror(errno));
    free(memory);
    return 0;
  }
  SharedDevice *device = new (memory) SharedDevice{{1}, fd};

  for (;;) {
    Type5Completion *completion = newCompletion(device);
    if (!completion) {
      // No record to read into: served as a failed read, whose zeroed record has type 0.
      plzc::systemLog(LOG_ERR, "read request: %s", strerror(errno));
      plzc::systemLog(LOG_ERR, "unknown request type %lld\n", 0LL);
      break;
    }
    Type5Record &request = completion->request;
    errno = 0;
    if (sys::read(fd, &request, sizeof request) != static_cast<ssize_t>(sizeof request)) {
      // A short packet is served as far as it filled the record; a failed read left it zero.
      plzc::systemLog(LOG_ERR, "read request: %s", strerror(errno));
    }

    if (request.requestType == 2) {
      if (callbacks && callbacks->type2Handler) callbacks->type2Handler(request.value1, request.value2);
      sendRecord(fd, request);
    } else if (request.requestType == 1) {
      if (callbacks && callbacks->type1Handler)
        callbacks->type1Handler(request.value1, request.value2, request.value3, request.value4, completion);
    } else {
      plzc::systemLog(LOG_ERR, "unknown request type %lld\n", static_cast<long long>(request.requestType));
      Type5CompletionRelease(completion);
      break;
    }
    Type5CompletionRelease(completion);
  }
  releaseDevice(device);
  return 0;
}
