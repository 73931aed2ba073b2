// Internal part of the file enumerators (the exported calls are in Plenzo.h).
#pragma once

#include <stdint.h>

#include "Plenzo.h"

// 1 the first time this inode is offered (path is remembered), 0 afterwards after printing
// "already visited %s as %s".
int compressorVisitFile(FileEnumerator *enumerator, uint64_t inode, const char *path);

// Called for an entry of a directory walk that could not be read (a directory that cannot be
// opened, a name too long to reach, an entry that vanished), with its path and errno.
typedef void (*EnumProblemHandler)(const char *path, int error, void *context);

// enumFilesFromDir, but each entry the walk could not read is handed to problem (when not NULL)
// before it is skipped, instead of being skipped unseen.
int enumFilesFromDirReporting(FileEnumerator *enumerator, const char **pathOut, EnumProblemHandler problem,
                              void *context);
