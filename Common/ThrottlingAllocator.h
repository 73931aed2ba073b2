// Process-wide budgets for pooled memory and open descriptors.
//
// A thread that would pass a budget blocks until another gives some back, so that callers who
// hand over files faster than they are compressed are slowed down instead of exhausting memory
// or descriptors. The memory budget is the physical memory less 700 MiB, never below 100 MiB;
// the descriptor budget is the number of descriptors by which the soft limit was raised (at
// most 64, at least 10), of which nine tenths may be held at once.
#pragma once

#include <stdint.h>

// Blocks until size more bytes fit the memory budget, then allocates them (zero-filled when
// zeroFill is non-zero). Returns the block, or NULL when the system has no memory (nothing is
// then charged). Requests should stay below 100 MiB; one that the whole budget cannot hold
// returns NULL with ENOMEM at once instead of waiting for ever.
void *waitThenAllocate(uint64_t size, int32_t zeroFill);

// Frees a block from waitThenAllocate and gives its size (the same size) back to the budget.
void freeAndSignal(void *block, uint64_t size);

// Blocks until the descriptor budget admits one more, then opens path read-only, or duplicates
// fd when path is NULL. Too many open files in the process or the system is waited on, not
// reported. Returns the descriptor, or -1 with errno after a message.
int32_t waitThenDupOrOpen(const char *path, int32_t fd);

// Closes a descriptor from waitThenDupOrOpen and gives it back, also when close reports an
// error (the descriptor is released all the same). 0 for fd below 1 (nothing done), else the
// result of close.
int32_t closeAndSignal(int32_t fd);

// The budgets, for tests and diagnostics.
uint64_t throttlingMemoryBudget();
uint64_t throttlingMemoryCharged();
uint64_t throttlingDescriptorBudget();
int32_t throttlingDescriptorsHeld();

// The memory budget for a machine with this much memory.
uint64_t memoryBudgetFor(uint64_t physicalMemory);
// The raised soft limit and the descriptor budget for these limits.
void descriptorBudgetFor(uint64_t soft, uint64_t hard, uint64_t *newSoft, uint64_t *budget);

// Fixes the memory budget before first use (tests only).
void throttlingSetMemoryBudget(uint64_t budget);
// Shortens the wait after too many open files (5000 ms) for tests that cause that on purpose.
void throttlingSetTooManyFilesWait(uint32_t waitMs);
