#include "Platform/KernelDecompression.h"

#include <cstdlib>

namespace platform {

int kernelDecompressesFiles() { return 0; }

int releaseDecompressesFiles(const char *release) { return atoi(release) >= 10 ? 1 : 0; }

}  // namespace platform
