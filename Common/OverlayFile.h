// The overlay handle: a FileHandle laid over another (the base) that captures attribute writes.
//
// Reads of data, size, block size and mode go to the base. Attribute writes land in the
// overlay's dictionary (attribute name to bytes) and never reach the base; attribute reads are
// answered from the dictionary, and from the base for names it does not hold. Data writes,
// truncation to a non-zero length and reopening are refused (EPERM); time and flag changes are
// accepted and ignored. An unread buffer lets a reader push consumed bytes back, so that the
// next reader of a read-once base starts again at offset 0; when no memory can be had for it,
// the bytes cannot come back and every later read fails with ENOMEM.
//
// The resource fork may be written at any position (it grows with zeros); every other
// attribute is written whole and holds at most 3802 bytes (ERANGE beyond). A removed
// attribute is an entry with no bytes: it reads as missing (ENOATTR) and is never applied.
#pragma once

#include <stdint.h>

#include "Common/FileHandle.h"
#include "PropertyValue.h"

// Opens an overlay over base (borrowed: it must outlive the overlay, which never closes it).
// tocDict is a mutable dictionary of string keys to mutable data values, retained by the
// overlay until it closes. canUnread enables the unread operations. NULL when out of memory.
FileHandle *openTocFile(FileHandle *base, PVMutableDictionaryRef tocDict, int32_t canUnread);

// Makes the overlay independent of its base, so that the base may be closed while the overlay
// lives on with the compressed form it captured: the overlay takes its own copy of the base's
// name (its name and path from then on) and answers what it would have asked the base for
// (attributes it does not hold, data, size) as a handle with nothing behind it: ENOATTR for
// attributes, EBADF otherwise. 0, or -1 with ENOMEM when the copy cannot be made (the overlay
// then still needs its base).
int overlayDetachBase(FileHandle *overlay);

// The entry for name in the overlay's dictionary, borrowed; created empty when absent and
// create is non-zero, else NULL with errno ENOATTR when absent. NULL with ENOMEM when out of
// memory.
PVMutableDataRef getDataForAttr(FileHandle *overlay, const char *name, int32_t create);

// Sets every non-empty entry as an attribute of fd. 0; or -1 with errno after removing every
// entry's attribute from fd again (all or nothing).
int32_t applyTocDictToFd(int32_t fd, PVDictionaryRef tocDict);

// Appends one table-of-contents record for path at fd's current offset: the path and a 0
// byte, a little-endian u32 entry count, then per non-empty entry its name and a 0 byte, a
// u32 length and the bytes. A dictionary without non-empty entries leaves no record. Callers
// serialise calls on one descriptor.
void writeTocDictToFile(int32_t fd, const char *path, PVDictionaryRef tocDict);
