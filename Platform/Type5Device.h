// The kernel's type-5 device.
//
// No Linux kernel serves type-5 files, so the device is whatever sits at the path. A device
// node (or a FIFO, or a file) is opened for reading and writing. A UNIX socket is connected to
// as a sequenced-packet socket instead: a user-space stand-in for the kernel, or a test, then
// plays the device's side, one 48-byte record per packet in each direction.
#pragma once

namespace plzc {

// Where the type-5 handler finds the device.
inline constexpr char kType5DevicePath[] = "/dev/plzc_type5";

// Opens the device at `path`: open(path, O_RDWR), or, when path names a UNIX socket,
// socket(AF_UNIX, SOCK_SEQPACKET) connected to it. Returns the descriptor, or -1 with errno
// from open (or from socket/connect for a socket).
int openType5Device(const char *path);

// The path the type-5 handler opens: kType5DevicePath unless a test has set another.
const char *type5DevicePath();

// For tests only (not exported): makes type5DevicePath() answer `path` in this process, so that
// tests running in parallel processes each serve their own socket. The caller keeps the string
// alive while it is set; nullptr restores kType5DevicePath.
void setType5DevicePath(const char *path);

}  // namespace plzc
