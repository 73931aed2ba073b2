/*
 * Plenzo: transparent file compression in extended attributes.
 *
 * A compressed file keeps its name and logical contents; its data fork is empty, a 16-byte
 * header (plus, for small files, the compressed data) lives in the attribute
 * "com.tavix.decmpfs", the zlib chunks of larger files in "com.tavix.ResourceFork", and the
 * file carries the compressed flag 0x20 among its file flags.
 *
 * Conventions of every function here: 0 for success and -1 for failure with errno set, a
 * pointer or NULL, or a count and -1, as each entry says. Diagnostics go to standard error and
 * name the file and the cause. Nothing here throws. The caller owns what it creates and
 * releases it with the matching call.
 */
#ifndef PLENZO_H
#define PLENZO_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#if defined(PLZC_BUILDING_LIBRARY)
#define PLZC_EXPORT __attribute__((visibility("default")))
#else
#define PLZC_EXPORT
#endif

/* ---- Compression query and volume support ------------------------------------------- */

/* What queryCompressionInfo reports about one file. */
typedef struct CompressionInfo {
  uint32_t compressionType;  /* header's type; 0 when the file is not compressed */
  uint32_t metadataSize;     /* header and table bytes: 16 (type 3), 8*ceil(size/131072)+326
                                (type 4), 0xFFFFFFFF (type 5), 0 otherwise */
  uint64_t compressedSize;   /* bytes of the compressed form: size of the header attribute
                                (type 3), of the resource fork (type 4), all ones (type 5) */
  uint64_t uncompressedSize; /* logical size: the header's size when compressed, else st_size */
} CompressionInfo;

/* Fills *info for the file at path. Returns 0 when filled (also for a plain file, a size
 * mismatch, a type-4 file without fork and an unknown type, which are reported on standard
 * error), -1 for a null argument, a failed stat (silent), an unreadable or short header
 * attribute, or a wrong magic. */
PLZC_EXPORT int queryCompressionInfo(const char *path, CompressionInfo *info);

/* Returns 1 when the volume holding path can store compressed files, else 0 (every failure
 * gives 0 after a message). */
PLZC_EXPORT int VolumeSupportsCompression(const char *path);

#ifdef __cplusplus
}
#endif

#endif /* PLENZO_H */
