#include "Common/KeptBuffer.h"

#include <cerrno>
#include <cstring>
#include <thread>

#include <gtest/gtest.h>

#include "Platform/Syscalls.h"

namespace {

// The thread's buffer comes back for the next use of its slot, grows when a larger one is
// asked for, and is never handed to two users at once.
TEST(KeptBuffer, ReusedByTheThreadAndNeverSharedWhileTaken) {
  uint8_t *first;
  {
    KeptBuffer a(KeptBuffer::kDecompressOutput, 1000);
    first = a.get();
    ASSERT_NE(first, nullptr);
    memset(first, 0xAB, 1000);
    KeptBuffer nested(KeptBuffer::kDecompressOutput, 1000);
    ASSERT_NE(nested.get(), nullptr);
    EXPECT_NE(nested.get(), first);
    memset(nested.get(), 0xCD, 1000);  // its own: the outer buffer keeps its bytes
    EXPECT_EQ(first[999], 0xAB);
    KeptBuffer otherSlot(KeptBuffer::kChunkInput, 1000);
    EXPECT_NE(otherSlot.get(), first);
    EXPECT_NE(otherSlot.get(), nested.get());
  }
  {
    KeptBuffer again(KeptBuffer::kDecompressOutput, 500);
    EXPECT_EQ(again.get(), first);
  }
  {
    KeptBuffer larger(KeptBuffer::kDecompressOutput, 1 << 20);
    ASSERT_NE(larger.get(), nullptr);
    memset(larger.get(), 0, 1 << 20);  // the whole size is usable (checked by ASan)
  }
  // Another thread has buffers of its own.
  uint8_t *theirs = nullptr;
  std::thread([&] {
    KeptBuffer b(KeptBuffer::kDecompressOutput, 1000);
    theirs = b.get();
    ASSERT_NE(theirs, nullptr);
    memset(theirs, 1, 1000);
  }).join();
  KeptBuffer mine(KeptBuffer::kDecompressOutput, 1000);
  EXPECT_NE(mine.get(), nullptr);
}

// An allocation that fails gives null, and the next use tries again. Every use counts as one
// allocation, so an injected failure hits a thread that already keeps a buffer too.
TEST(KeptBuffer, EveryUseCanBeFailedLikeAnAllocation) {
  std::thread([] {
    sys::armFault(sys::Call::Malloc, 1, ENOMEM);
    {
      KeptBuffer failed(KeptBuffer::kChunkInput, 4096);
      EXPECT_EQ(failed.get(), nullptr);
    }
    sys::clearFaults();
    { KeptBuffer retried(KeptBuffer::kChunkInput, 4096); EXPECT_NE(retried.get(), nullptr); }
    uint64_t before = sys::callCount(sys::Call::Malloc);
    { KeptBuffer reused(KeptBuffer::kChunkInput, 4096); EXPECT_NE(reused.get(), nullptr); }
    EXPECT_EQ(sys::callCount(sys::Call::Malloc), before + 1);
    sys::armFault(sys::Call::Malloc, 1, ENOMEM);
    KeptBuffer failedAgain(KeptBuffer::kChunkInput, 4096);
    sys::clearFaults();
    EXPECT_EQ(failedAgain.get(), nullptr);
    EXPECT_EQ(errno, ENOMEM);
  }).join();
}

}  // namespace
