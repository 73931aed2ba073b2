// Questions about a file and a volume that change nothing: is the file compressed (type,
// sizes), can the volume hold compressed files.
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/pathUtils.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Platform/Syscalls.h"
#include "Platform/VolumeCapabilities.h"
#include "Plenzo.h"

static constexpr char kSourcePath[] = "Libraries/CompressData/CompressionQuery";

// Header and table bytes of a type-4 fork: 8 per 128 KiB of data, plus 326.
static uint32_t type4MetadataSize(uint64_t uncompressedSize) {
  return static_cast<uint32_t>((((uncompressedSize + 0x1FFFF) >> 14) & ~UINT64_C(7)) + 326);
}

int queryCompressionInfo(const char *path, CompressionInfo *info) {
  if (!info || !path) return -1;
  platform::Stat st;
  if (platform::stat(path, &st) != 0) return -1;
  info->uncompressedSize = static_cast<uint64_t>(st.st.st_size);
  info->compressionType = 0;
  info->metadataSize = 0;
  info->compressedSize = 0;
  if (!(st.st_flags & kCompressedFlag)) return 0;

  ssize_t attributeSize = platform::getxattr(path, kDecmpfsXattrName, nullptr, 0, 0, kShowCompressionOption);
  if (attributeSize < 0) {
    PLZC_ERR("%s:%d: Error: Could not get decmpfs xattr for path %s; %s (%d)\n", path, strerror(errno), errno);
    return -1;
  }
  if (attributeSize > kMaxReadableHeaderSize) {
    errno = EINVAL;
    PLZC_ERR("%s:%d: Error: decmpfs xattr for path %s claims %lld bytes: damaged\n", path,
             static_cast<long long>(attributeSize));
    return -1;
  }
  auto *attribute = static_cast<uint8_t *>(sys::malloc(attributeSize > 0 ? static_cast<size_t>(attributeSize) : 1));
  if (!attribute) return -1;
  ssize_t got = platform::getxattr(path, kDecmpfsXattrName, attribute, static_cast<size_t>(attributeSize), 0,
                                   kShowCompressionOption);
  if (got != attributeSize) {
    PLZC_ERR("%s:%d: Error: Failed to get all of decmpfs xattr for path %s\n", path);
    free(attribute);
    return -1;
  }
  DiskHeader header{};
  // A header shorter than 16 bytes cannot carry the magic: reject it as a wrong one.
  if (attributeSize >= static_cast<ssize_t>(sizeof header)) memcpy(&header, attribute, sizeof header);
  free(attribute);
  if (header.magic != kDecmpfsMagic) {
    PLZC_ERR("%s:%d: Error: Compressed file at path '%s' had incorrect magic in disk header\n", path);
    return -1;
  }
  info->compressionType = header.compressionType;
  info->uncompressedSize = header.uncompressedSize;
  // Where the kernel does not decompress, stat reports the data fork, empty once compressed:
  // only a non-empty data fork can disagree with the header.
  bool statShowsLogicalSize = osSupportsDecmpfs() || st.st.st_size != 0;
  if (statShowsLogicalSize && header.uncompressedSize != static_cast<uint64_t>(st.st.st_size))
    PLZC_ERR("%s:%d: Error: Uncompressed size for path '%s' as reported by stat did not match size in disk header!\n",
             path);

  switch (header.compressionType) {
    case 5:
      info->compressedSize = UINT64_MAX;
      info->metadataSize = UINT32_MAX;
      return 0;
    case 4: {
      ssize_t forkSize = platform::getxattr(path, kResourceForkXattrName, nullptr, 0, 0, kShowCompressionOption);
      if (forkSize < 0) {
        PLZC_ERR("%s:%d: Error: Type4 compressed file at path '%s' did not have a resource fork\n", path);
        return 0;
      }
      info->compressedSize = static_cast<uint64_t>(forkSize);
      info->metadataSize = type4MetadataSize(header.uncompressedSize);
      return 0;
    }
    case 3:
      info->compressedSize = static_cast<uint64_t>(attributeSize);
      info->metadataSize = kDiskHeaderSize;
      return 0;
    default:
      PLZC_ERR("%s:%d: Error: Unknown compression type encountered for file '%s'\n", path);
      return 0;
  }
}

int VolumeSupportsCompression(const char *path) {
  char root[1024];
  if (!volRoot(path, root)) return 0;
  uint32_t capabilities[4];
  if (platform::getVolumeCapabilities(root, capabilities) == 0)
    return (capabilities[0] & platform::kVolumeCapabilityCompression) ? 1 : 0;
  if (errno == EINVAL) {
    platform::FileSystemInfo fs;
    if (platform::statfs(path, &fs) != 0) {
      PLZC_ERR("%s:%d: statfs %s: %s\n", path, strerror(errno));
      return 0;
    }
    return platform::fileSystemHoldsLargeAttributes(fs.type) ? 1 : 0;
  }
  PLZC_ERR("%s:%d: getattrlist %s: %s\n", root, strerror(errno));
  return 0;
}
