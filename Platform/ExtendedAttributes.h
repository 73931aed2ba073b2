// Extended attributes with a byte position and option bits, over Linux `user.` attributes.
//
// The attribute named N is the Linux attribute "user.N", so it moves with the file on rename,
// vanishes with it, and is copied by `cp -a`, `rsync -X` and `tar --xattrs`. A value that fits
// in one Linux attribute is stored there unchanged (`getfattr -n user.N` reads it). A larger
// value is cut into segments under reserved names ("user.plzc#N#..."), published by a small
// index record that holds its length; readers see one value.
//
// Semantics, as on the systems these calls come from:
// - `position` is a byte offset, allowed only for the resource fork "com.tavix.ResourceFork";
//   any other attribute with a non-zero position fails with EINVAL.
// - Writing the resource fork at a position overwrites [position, position + size) and extends
//   the value when that range ends past it (a write of no bytes past the end extends it to the
//   position); it never truncates. Bytes never written read as zeros. Every other attribute is
//   replaced whole.
// - Reading with a null buffer returns the value's length. Reading the resource fork copies
//   what lies between position and the end (0 at or past the end); reading any other attribute
//   into a buffer smaller than its value fails with ERANGE.
// - A missing attribute fails with ENOATTR (Linux ENODATA). Names are at most 127 bytes
//   (ENAMETOOLONG); names in the reserved "plzc#" space cannot be read (ENOATTR) or written
//   (EINVAL). Unknown option bits, or create together with replace, fail with EINVAL.
// - On a file system that cannot hold the value the call fails with that file system's errno
//   (ENOSPC, E2BIG) and the previous value stays intact.
// - A reader sees the old or the new value of a whole replacement, never a mix: new segments
//   are written under a new generation before the index is switched to them. A positional
//   write publishes a new length only after its segments are written; the bytes it overwrites
//   within the old length change segment by segment, like a file write.
// - The show-compression option (0x20) is accepted and changes nothing: the Linux kernel never
//   hides these attributes.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

#include <errno.h>

#ifndef ENOATTR
#define ENOATTR ENODATA
#endif

// Option bits.
enum {
  kXattrNoFollow = 0x0001,          // act on a symbolic link itself
  kXattrCreate = 0x0002,            // fail with EEXIST if the attribute exists
  kXattrReplace = 0x0004,           // fail with ENOATTR if it does not
  kXattrNoSecurity = 0x0008,        // accepted, no effect
  kXattrNoDefault = 0x0010,         // accepted, no effect
  kXattrShowCompression = 0x0020,   // accepted, no effect
};

// The attribute that may be read and written at a position.
#define PLZC_RESOURCE_FORK_NAME "com.tavix.ResourceFork"

#ifdef __cplusplus
#include <string>
#include <vector>

namespace platform {

// Attribute size (null value) or bytes copied; -1 with errno.
ssize_t getxattr(const char *path, const char *name, void *value, size_t size, uint32_t position, int options);
ssize_t fgetxattr(int fd, const char *name, void *value, size_t size, uint32_t position, int options);
// 0, or -1 with errno.
int setxattr(const char *path, const char *name, const void *value, size_t size, uint32_t position,
             int options);
int fsetxattr(int fd, const char *name, const void *value, size_t size, uint32_t position, int options);
// Removes the value and every segment of it; 0, or -1 with errno (ENOATTR when missing).
int removexattr(const char *path, const char *name, int options);
int fremovexattr(int fd, const char *name, int options);
// Names of the attributes, each followed by a NUL, reserved names left out; with a null
// buffer, the size needed. -1 with errno (ERANGE when the buffer is too small).
ssize_t listxattr(const char *path, char *names, size_t size, int options);
ssize_t flistxattr(int fd, char *names, size_t size, int options);

// Counters of segment reads and writes made by this thread, for tests and benchmarks that show
// how many segments an operation touches.
struct XattrSegmentCounters {
  uint64_t reads = 0;
  uint64_t writes = 0;
};
XattrSegmentCounters &xattrSegmentCounters();

// While an object of this class lives, positional reads of a segmented resource fork made by
// its thread keep the value's index record and the last segments they read, and serve later
// reads from them, so that a reader going through a fork in small pieces (a chunk table entry,
// then the chunk, then the next entry) reads the index once and each segment about once. The
// reader goes on with the value as it was at its first read for as long as that value's
// segments are there: a value that another process replaces meanwhile is seen from the first
// segment that is no longer found (the remover takes them all), not before. Any attribute write
// or removal made by this process empties the cache. (Another process overwriting the value in
// place during the read gives a torn read with or without the cache, as with a plain file.)
// Meant for one reader going through one file, as decompression does; a second object on the
// same thread while one lives does nothing.
class XattrReadCache {
 public:
  XattrReadCache();
  ~XattrReadCache();
  XattrReadCache(const XattrReadCache &) = delete;
  XattrReadCache &operator=(const XattrReadCache &) = delete;

 private:
  bool active_;
};

// The Linux attribute name prefix of the layer's reserved names ("user.plzc#").
extern const char kReservedLinuxPrefix[];

// Leftovers of interrupted writers: reserved Linux attributes that no value owns.
//
// A writer that dies while it replaces, extends or removes a large value can leave behind
// segments of a generation it never published, or of the generation it was replacing;
// segments past the published length; segments whose index was already removed; and, when it
// died between publishing a segmented value and removing the small value it replaced, a whole
// index with its segments, hidden behind the small value that readers still see. No reader
// ever looks at them: they only take room, and they may be removed as long as no writer is
// working on the file.
//
// flistunownedsegments: replaces *names with the Linux names of those attributes of the file
// open at fd, every index before the segments of its value. Returns their count, or -1 with
// errno. A value whose index record is damaged is left out: what it owns cannot be known.
// fremoveunownedsegments: removes the given Linux names (as listed by the call above, with no
// writer on the file since); a name already gone is no failure. 0, or -1 with the errno of the
// first failure, after trying every name.
ssize_t flistunownedsegments(int fd, std::vector<std::string> *names);
int fremoveunownedsegments(int fd, const std::vector<std::string> &names);

}  // namespace platform
#endif
