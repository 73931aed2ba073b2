// Path utilities.
#pragma once

// Creates path and every missing directory above it (mode 0755, less the umask). Returns 0 when
// the directory exists at the end (existing ones count), -1 with the failing mkdir's errno after
// "mkdir %s: %s". path is not modified.
int mkdirRecursive(const char *path);

// Writes into out (1024 bytes) the mount point of the volume that holds path, and returns out;
// NULL after a message ("statfs %s: %s" or "stat %s: %s") on failure.
char *volRoot(const char *path, char *out);
