// The file handle: one record with a table of operations, through which the library reads
// and writes every file's data and attributes.
//
// Four kinds fill it in: plain files on disk (Common/PlainFile), attribute readers by path
// (Common/PathAttributes), data pools and overlays.
// Callers reach an operation through its slot, handle first (`fh->pread(fh, buf, n, off)`), and
// call only the slots the kind implements: a kind leaves the slots it lacks null, and the unread
// family is used only when `canUnread` is non-zero.
//
// Every operation that fails returns -1 (or the value its line below gives) with errno from the
// failing call, after printing one message. getxattr and removexattr fail silently with ENOATTR
// when the attribute does not exist.
#pragma once

#include <stdint.h>
#include <time.h>

#include "Platform/ExtendedAttributes.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct FileHandle FileHandle;

struct FileHandle {
  char *name;         // name used in messages
  char *path;         // path used by the operations that act by path
  int32_t canUnread;  // non-zero when the unread family may be used

  // Releases the handle; 0, or -1 when closing the underlying object failed. Frees the record.
  int (*close)(FileHandle *fh);
  // Swaps the underlying object for one opened anew with these flags; on failure keeps it.
  int (*reopen)(FileHandle *fh, int openFlags);
  // File mode, 0 on failure.
  uint16_t (*mode)(FileHandle *fh);
  // Writes access then modification time into times[2]; 0 or -1.
  int (*times)(FileHandle *fh, struct timespec times[2]);
  // Sets access and modification time (to the microsecond); 0 or -1.
  int (*utimes)(FileHandle *fh, const struct timespec times[2]);
  // Size in bytes, -1 on failure.
  int64_t (*size)(FileHandle *fh);
  // Preferred I/O size, 4096 on failure.
  int64_t (*blockSize)(FileHandle *fh);
  // Positional read and write; bytes transferred (0 at end of data), or -1.
  int64_t (*pread)(FileHandle *fh, void *buffer, int64_t count, int64_t offset);
  int64_t (*pwrite)(FileHandle *fh, const void *buffer, int64_t count, int64_t offset);
  // Push-back of consumed bytes: get a buffer, fill it, finish; the next preads return it first.
  void *(*unreadAlloc)(FileHandle *fh, int64_t size);
  int (*unreadSetPos)(FileHandle *fh, int64_t position);
  int (*unread)(FileHandle *fh, const void *buffer, int64_t count);
  int (*unreadDone)(FileHandle *fh);
  // Replaces the whole file-flag word; 0 or -1.
  int (*chflags)(FileHandle *fh, uint32_t flags);
  // Sets the data length; 0 or -1.
  int (*truncate)(FileHandle *fh, int64_t length);
  // Attribute calls with a byte position and option bits, as Platform/ExtendedAttributes.h.
  int64_t (*getxattr)(FileHandle *fh, const char *name, void *buffer, uint64_t size, uint32_t position,
                      int options);
  int (*setxattr)(FileHandle *fh, const char *name, const void *buffer, uint64_t size, uint32_t position,
                  int options);
  int (*removexattr)(FileHandle *fh, const char *name, int options);
  // Makes the file's data and attributes durable (they survive a power loss); 0 or -1. Null
  // for kinds that keep nothing on disk.
  int (*sync)(FileHandle *fh);

  void *priv;  // the kind's private state
};

// Opens the plain file at path (name is used in messages; both are copied) with open flags
// oflag (0 read only, 2 read and write). Returns the handle, or NULL with errno set after
// "open %s: %s". The caller closes it with fh->close(fh).
FileHandle *openFile(const char *name, const char *path, int oflag);

// A handle on the attributes of the file at path (Common/PathAttributes), for a reader that
// needs nothing else: reading a compressed file's data takes only its attributes, and this
// spares it opening and closing the file. Only getxattr and close are set. Each call reaches
// the file through its path anew (following symbolic links), so a file renamed over path
// between two calls is read from then on, as a file opened anew would be. Returns the handle,
// or NULL (ENOMEM) after a message.
FileHandle *openAttributeReader(const char *name, const char *path);

#ifdef __cplusplus
}
#endif
