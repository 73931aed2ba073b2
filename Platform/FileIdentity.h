// Whether a path still names an open file.
//
// Operations that must act by path (the flag word, attributes and truncation of a file open
// read-only) would otherwise land on whatever file another process has since renamed into
// that place.
#pragma once

namespace platform {

// True when path (symbolic links followed) names the file open on fd: same device and inode.
// False, with errno ESTALE, when it names another file, or with the errno of the failed stat.
// The answer can be overtaken by a rename right after it; it narrows the window from a whole
// compression to the next system call.
bool pathNamesOpenFile(const char *path, int fd);

}  // namespace platform
