#include "Platform/Futex.h"

#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <climits>

namespace platform {

// The kernel reads the word as a plain aligned 32-bit integer.
static_assert(sizeof(std::atomic<uint32_t>) == sizeof(uint32_t));
static_assert(alignof(std::atomic<uint32_t>) == alignof(uint32_t));
static_assert(std::atomic<uint32_t>::is_always_lock_free);

int futexWait(const std::atomic<uint32_t> *word, uint32_t expected) {
  long result = syscall(SYS_futex, reinterpret_cast<const uint32_t *>(word), FUTEX_WAIT_PRIVATE, expected, nullptr,
                        nullptr, 0);
  return result == 0 ? 0 : -1;
}

int futexWakeAll(const std::atomic<uint32_t> *word) {
  long result =
      syscall(SYS_futex, reinterpret_cast<const uint32_t *>(word), FUTEX_WAKE_PRIVATE, INT_MAX, nullptr, nullptr, 0);
  return result < 0 ? -1 : static_cast<int>(result);
}

}  // namespace platform
