// Sleeping on a 32-bit word: the kernel's futex, for waits that must not burn a processor.
//
// A waiter reads the word, decides to sleep while it still holds that value, and calls
// futexWait with it; the kernel compares and sleeps in one step, so a change made (and woken)
// after the read is never missed. A waker changes the word first, then calls futexWake.
// Both are private to the process.
#pragma once

#include <atomic>
#include <cstdint>

namespace platform {

// Sleeps while *word equals expected, until a futexWake on word (or a signal, or a spurious
// wake-up). 0 when woken; -1 with errno EAGAIN when *word already differed, EINTR when a
// signal interrupted the sleep. Callers re-test their condition in a loop either way.
int futexWait(const std::atomic<uint32_t> *word, uint32_t expected);

// Wakes every thread sleeping in futexWait on word. Returns how many were woken, or -1.
int futexWakeAll(const std::atomic<uint32_t> *word);

// One step of a busy-wait: tells the processor that the caller is spinning.
inline void spinPause() {
#if defined(__x86_64__) || defined(__i386__)
  __builtin_ia32_pause();
#elif defined(__aarch64__)
  asm volatile("yield" ::: "memory");
#endif
}

}  // namespace platform
