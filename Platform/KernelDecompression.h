// Whether the running kernel decompresses compressed files itself.
#pragma once

namespace platform {

// 1 when the kernel serves compressed files' logical data on read, 0 when the library must
// decompress them. The Linux kernel never does.
int kernelDecompressesFiles();

// The rule for kernels that identify themselves by release number: a release whose leading
// number is 10 or more ("10.0.0", "10.8.0") decompresses, an older one ("9.8.0") does not.
int releaseDecompressesFiles(const char *release);

}  // namespace platform
