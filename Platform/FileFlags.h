// File flags: the 32-bit flag word of each file, with chflags, fchflags and a stat that
// reports it.
//
// Linux has no such word; it is kept in the reserved attribute "user.plzc#flags" (4 bytes,
// little-endian), so it travels with the file like its other attributes. No attribute means
// flags 0. The flags are recorded and reported, not enforced: an immutable flag does not stop
// Linux from writing the file.
#pragma once

#include <stdint.h>
#include <sys/stat.h>

enum : uint32_t {
  kFlagNoDump = 0x00000001,
  kFlagUserImmutable = 0x00000002,
  kFlagUserAppend = 0x00000004,
  kFlagOpaque = 0x00000008,
  kFlagCompressed = 0x00000020,  // data lives in the compression attributes
  kFlagTracked = 0x00000040,
  kFlagHidden = 0x00008000,
  kFlagArchived = 0x00010000,
  kFlagSystemImmutable = 0x00020000,
  kFlagSystemAppend = 0x00040000,
};

#ifdef __cplusplus
namespace platform {

// A Linux stat with the file's flag word beside it.
struct Stat {
  struct ::stat st;
  uint32_t st_flags;
};

// Like stat, lstat and fstat; 0, or -1 with errno. A flag word that cannot be read because the
// file cannot carry or show attributes (symbolic links, no read permission, no attribute
// support) reads as 0.
int stat(const char *path, Stat *out);
int lstat(const char *path, Stat *out);
int fstat(int fd, Stat *out);

// Replaces the whole flag word; 0, or -1 with errno. Flags 0 remove the attribute.
int chflags(const char *path, uint32_t flags);
int fchflags(int fd, uint32_t flags);

}  // namespace platform
#endif
