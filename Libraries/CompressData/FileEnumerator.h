// Internal part of the file enumerators (the exported calls are in Plenzo.h).
#pragma once

#include <stdint.h>

#include "Plenzo.h"

// 1 the first time this inode is offered (path is remembered), 0 afterwards after printing
// "already visited %s as %s".
int compressorVisitFile(FileEnumerator *enumerator, uint64_t inode, const char *path);
