// Scratch buffers that a thread keeps between calls.
//
// Reading many files, or one file in many small pieces, would otherwise allocate and free the
// same buffers for every file or piece; buffers of this size live at the top of the heap, so
// each free shrinks the heap and the next call grows it again, and every shrink flushes the
// TLB. A KeptBuffer hands out the calling thread's buffer for its slot, allocated (with
// sys::malloc) on first use or when a larger one is asked for, and kept until the thread ends.
// Every use counts as one allocation for fault injection, whether or not one was made, so
// tests can fail it and call counts do not depend on which thread ran before. A second KeptBuffer of the same slot on the same thread while
// the first lives (a nested read) gets a buffer of its own, freed when it ends.
#pragma once

#include <stddef.h>
#include <stdint.h>

class KeptBuffer {
 public:
  enum Slot { kDecompressOutput, kChunkInput, kForkPending, kForkAhead, kSlotCount };

  KeptBuffer(Slot slot, size_t size);
  ~KeptBuffer();
  KeptBuffer(const KeptBuffer &) = delete;
  KeptBuffer &operator=(const KeptBuffer &) = delete;

  // At least size bytes, or null (errno ENOMEM) when they could not be allocated.
  uint8_t *get() const { return bytes_; }

 private:
  Slot slot_;
  uint8_t *bytes_ = nullptr;
  bool kept_ = false;  // the thread's buffer, not one of its own
};
