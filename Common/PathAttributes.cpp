// The attribute-reader handle: reads the attributes of a file through its path, without
// opening it.
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Common/Diagnostics.h"
#include "Common/FileHandle.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/Syscalls.h"

static constexpr char kSourcePath[] = "Common/PathAttributes";

namespace {

int pathClose(FileHandle *fh) {
  if (!fh) return 0;
  free(fh->name);
  free(fh->path);
  free(fh);
  return 0;
}

int64_t pathGetxattr(FileHandle *fh, const char *name, void *buffer, uint64_t size, uint32_t position,
                     int options) {
  ssize_t got = platform::getxattr(fh->path, name, buffer, size, position, options);
  if (got < 0 && errno != ENOATTR) PLZC_ERR("%s:%d: getxattr: %s\n", strerror(errno));
  return got;
}

const FileHandle kPathAttributesTemplate = {
    .name = nullptr,
    .path = nullptr,
    .canUnread = 0,
    .close = pathClose,
    .reopen = nullptr,
    .mode = nullptr,
    .times = nullptr,
    .utimes = nullptr,
    .size = nullptr,
    .blockSize = nullptr,
    .pread = nullptr,
    .pwrite = nullptr,
    .unreadAlloc = nullptr,
    .unreadSetPos = nullptr,
    .unread = nullptr,
    .unreadDone = nullptr,
    .chflags = nullptr,
    .truncate = nullptr,
    .getxattr = pathGetxattr,
    .setxattr = nullptr,
    .removexattr = nullptr,
    .sync = nullptr,
    .priv = nullptr,
};

}  // namespace

FileHandle *openAttributeReader(const char *name, const char *path) {
  auto *handle = static_cast<FileHandle *>(sys::malloc(sizeof(FileHandle)));
  char *nameCopy = sys::strdup(name);
  char *pathCopy = sys::strdup(path);
  if (!handle || !nameCopy || !pathCopy) {
    free(handle);
    free(nameCopy);
    free(pathCopy);
    errno = ENOMEM;
    PLZC_ERR("%s:%d: open %s: %s\n", path, strerror(errno));
    return nullptr;
  }
  *handle = kPathAttributesTemplate;
  handle->name = nameCopy;
  handle->path = pathCopy;
  return handle;
}
