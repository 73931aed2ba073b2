// The data pool: one file's bytes on their way from the thread that writes them to the thread
// that compresses or writes them out.
//
// A bounded ring for exactly one writer and one reader. The writer announces the file's size
// when the pool is created and adds data in pieces of any size; the reader takes it in order.
// Files up to 64 MiB fit whole, larger ones stream through a 64 MiB ring. The writer blocks
// while the ring is full, the reader while it is empty; either side (or a third thread) can
// abort, after which every add fails with ENOSPC and every get with EINVAL. A waiting side
// sleeps in the kernel after a short spin; it does not poll.
//
// The pool, header and ring, is one block charged to the memory budget of the throttling
// allocator for as long as it lives. It is reference counted: the creator holds one reference,
// retainDataPool adds one, each holder gives its own back with releaseDataPool, and the last
// release frees the block and gives its memory back to the budget.
#pragma once

#include <stdint.h>

#include "Common/FileHandle.h"

typedef struct DataPool DataPool;

// Bytes of the ring of a pool of the given size: the size, at most 64 MiB.
constexpr uint64_t kDataPoolMaxCapacity = 67108864;

// Creates a pool for a file of size bytes, holding one reference for the caller. Blocks while
// the memory budget cannot admit header and ring. Returns NULL with errno EINVAL for a
// negative size, or ENOMEM after a message when the system has no memory for the block;
// callers must check.
DataPool *newDataPool(int64_t size);

// The size announced at creation.
int64_t dataPoolSize(DataPool *pool);

// Writer: appends count bytes from buffer, blocking while the ring is full. Returns count (0 at
// once for 0); -1 without changing anything (errno untouched) after "attempted to write past
// end of pool" when count exceeds the bytes not yet added; -1 with ENOSPC when the pool is or
// becomes aborted (bytes already copied stay in the ring, but still count as not added).
int64_t addDataToPool(DataPool *pool, const void *buffer, uint64_t count);

// Writer: like addDataToPool, but the bytes are read from fd (at its offset) straight into the
// ring, until count bytes were added or the file ends: the bytes added, fewer than count only at
// the end of the file; -1 with read's errno (what was read before stays added), or as
// addDataToPool fails.
int64_t addFileDataToPool(DataPool *pool, int fd, uint64_t count);

// Writer: no more data. Silent when every announced byte was added or the pool is aborted;
// otherwise prints "finished pool without filling it" and aborts the pool, so that the reader
// fails instead of waiting for bytes that will never come.
void finishDataPool(DataPool *pool);

// Reader: copies the next min(count, bytes not yet read) bytes into buffer, blocking until all
// of them have arrived. Returns that number (0 once everything was read), or -1 with EINVAL
// when the pool is or becomes aborted, even with data left in the ring.
int64_t getDataFromPool(DataPool *pool, void *buffer, uint64_t count);

// Aborts the transfer: every later or waiting add and get fails. Final. Any thread that holds a
// reference may call it.
void abortDataPool(DataPool *pool);

// Takes one more reference.
void retainDataPool(DataPool *pool);

// Gives one reference back. Returns 1 when that was the last one and the pool was freed, else 0
// (also for NULL).
int32_t releaseDataPool(DataPool *pool);

// Opens a read-only, strictly sequential handle on the pool's reader side, with its own
// reference on the pool (given back by its close). name (copied once) serves as both the
// handle's name and path. Implements close, size (the announced size), blockSize (4096), pread
// (only at the offset that follows the bytes already read; elsewhere "can't read from position
// %lld, curPos %lld" on standard output and EINVAL) and getxattr (always ENOATTR); every other
// slot is null and canUnread is 0. NULL with ENOMEM when out of memory (the pool's references
// are then unchanged).
FileHandle *openDataPoolFile(DataPool *pool, const char *name);
