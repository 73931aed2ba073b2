// Whole-file compression and reading back, inside the library.
#pragma once

#include <stdint.h>

#include "Common/FileHandle.h"

// MD5 of the file's logical data: the data fork of a plain file, the decompressed data of a
// compressed one (the Linux kernel does not decompress, so the library reads it). 1 with the
// 16-byte digest, 0 when the file cannot be opened (silently), its flags cannot be read or its
// compressed data cannot be decompressed (both reported). A read error of a plain file is
// reported and ends the digest early, which is still returned.
int checksumFile(const char *path, uint8_t digest[16]);

// The largest piece a DecompressWriter receives. A piece is handed over only when every chunk
// in it decoded: the data before a damaged chunk reaches the writer, up to this granularity.
constexpr int64_t kDecompressPieceSize = 131072;

// Receives the logical data in order, in pieces of at most kDecompressPieceSize bytes: -1 stops
// with failure.
typedef int (*DecompressWriter)(int64_t offset, const void *bytes, int64_t count, void *writerCtx);

// Hands the logical data of the compressed file behind fh to writer. 0 when every byte went
// out; -1 on failure (reported) or when the writer returned -1.
int decompressData(FileHandle *fh, DecompressWriter writer, void *writerCtx);

// catFile, telling its caller what happened: 0 when the whole file was written to standard
// output, -1 after the failure was reported on standard error.
int catFileStatus(const char *path, int forceUserSpace);

namespace platform {
struct Stat;
}
// catFileStatus for a caller that has just called platform::stat on path itself: st is that
// result, used instead of a second stat.
int catFileStatusOf(const char *path, const platform::Stat &st, int forceUserSpace);
