#include "Common/KeptBuffer.h"

#include <stdlib.h>

#include "Platform/Syscalls.h"

namespace {

struct ThreadBuffers {
  struct Kept {
    uint8_t *bytes = nullptr;
    size_t size = 0;
    bool taken = false;
  };
  Kept slots[KeptBuffer::kSlotCount];
  ~ThreadBuffers() {
    for (Kept &kept : slots) free(kept.bytes);
  }
};
thread_local ThreadBuffers tBuffers;

}  // namespace

KeptBuffer::KeptBuffer(Slot slot, size_t size) : slot_(slot) {
  ThreadBuffers::Kept &kept = tBuffers.slots[slot];
  if (kept.taken) {
    bytes_ = static_cast<uint8_t *>(sys::malloc(size ? size : 1));
    return;
  }
  if (kept.size < size || !kept.bytes) {
    free(kept.bytes);
    kept.bytes = static_cast<uint8_t *>(sys::malloc(size ? size : 1));
    kept.size = kept.bytes ? size : 0;
  } else if (!sys::callSucceeds(sys::Call::Malloc)) {
    return;  // an injected failure, as if the buffer had been allocated now
  }
  bytes_ = kept.bytes;
  kept_ = kept.taken = bytes_ != nullptr;
}

KeptBuffer::~KeptBuffer() {
  if (kept_) {
    tBuffers.slots[slot_].taken = false;
  } else {
    free(bytes_);
  }
}
