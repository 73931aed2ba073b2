#include "StoredForm.h"

#include <cerrno>
#include <cstring>
#include <vector>

#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"

namespace plzc {

bool readStoredForm(const char *path, StoredForm *form) {
  platform::Stat st;
  if (platform::stat(path, &st) != 0) return false;
  *form = StoredForm{};
  form->logicalSize = form->storedSize = static_cast<uint64_t>(st.st.st_size);
  if (!(st.st_flags & kCompressedFlag)) return true;

  ssize_t headerSize = platform::getxattr(path, kDecmpfsXattrName, nullptr, 0, 0, kShowCompressionOption);
  if (headerSize < 0) return false;
  std::vector<uint8_t> attribute(static_cast<size_t>(headerSize));
  if (headerSize < static_cast<ssize_t>(sizeof(DiskHeader)) ||
      platform::getxattr(path, kDecmpfsXattrName, attribute.data(), attribute.size(), 0, kShowCompressionOption) !=
          headerSize) {
    errno = EINVAL;
    return false;
  }
  DiskHeader header;
  memcpy(&header, attribute.data(), sizeof header);
  if (header.magic != kDecmpfsMagic) {
    errno = EINVAL;
    return false;
  }
  form->compressed = true;
  form->type = header.compressionType;
  form->logicalSize = header.uncompressedSize;
  form->storedSize = static_cast<uint64_t>(headerSize);
  if (header.compressionType == 4) {
    ssize_t forkSize = platform::getxattr(path, kResourceForkXattrName, nullptr, 0, 0, kShowCompressionOption);
    form->storedSize = forkSize > 0 ? static_cast<uint64_t>(forkSize) : 0;
  }
  return true;
}

}  // namespace plzc
