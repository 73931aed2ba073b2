// File locks by device and inode, inside this process (the exported calls are in Plenzo.h).
//
// One record per locked file lives in a process-wide table keyed by the 12 bytes of device
// (32-bit) and inode (64-bit) number, and exists exactly while some thread holds or waits for
// that file's lock. The table's own lock is held only for table operations, never while a
// thread waits for a file.
#pragma once

#include <stdint.h>

#include "Plenzo.h"

// Number of files that have a record in the table (held or waited for); for tests.
int64_t fileLockTableCount();

// Number of threads that hold or wait for this record's lock; for tests.
int32_t fileLockHolders(FileLock *lock);
