#include "Libraries/CompressData/DiskHeader.h"

#include <atomic>

#include "Platform/KernelDecompression.h"

// -1 until the first call; two racing first calls compute and store the same answer.
static std::atomic<int> gKernelDecompresses{-1};

int osSupportsDecmpfs(void) {
  int cached = gKernelDecompresses.load(std::memory_order_relaxed);
  if (cached != -1) return cached;
  int answer = platform::kernelDecompressesFiles();
  gKernelDecompresses.store(answer, std::memory_order_relaxed);
  return answer;
}
