/*
 * Plenzo: transparent file compression in extended attributes.
 *
 * A compressed file keeps its name and logical contents; its data fork is empty, a 16-byte
 * header (plus, for small files, the compressed data) lives in the attribute
 * "com.tavix.decmpfs", the zlib chunks of larger files in "com.tavix.ResourceFork", and the
 * file carries the compressed flag 0x20 among its file flags.
 *
 * Every chunk is one zlib-format stream (or a stored chunk), whichever engine wrote it, and
 * every engine reads what any other wrote. The engine of a process is taken from the
 * environment variable PLZC_ENGINE when the library is loaded: "libdeflate" (the default),
 * "zlib" (the reference) or "isal" (the fastest, at a larger size: for speed over size, set
 * PLZC_ENGINE=isal and use level 1). An unknown or unbuilt name is reported on standard error
 * and the default used. Levels are zlib's 0 to 9; each engine maps them to its own so that
 * libdeflate stores at least as small as zlib at every level.
 *
 * Conventions of every function here: 0 for success and -1 for failure with errno set, a
 * pointer or NULL, or a count and -1, as each entry says. Diagnostics go to standard error and
 * name the file and the cause. Nothing here throws. The caller owns what it creates and
 * releases it with the matching call.
 */
#ifndef PLENZO_H
#define PLENZO_H

#include <stdbool.h>
#include <stdint.h>

#include "PropertyValue.h"

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

/* ---- Compressor context --------------------------------------------------------------- */

/* The caller's choices for a series of compressions: types to try, level, checksums,
 * in place or into a table-of-contents file; and statistics of what was done. */
typedef struct CompressorContext CompressorContext;

/* Builds a context from compressorList, comma-separated type numbers tried in that order
 * ("3,4" or "4"). initArg1 and initArg2 are handed to every type's set-up (pass NULL). With
 * tocPath, files are left unchanged and their compressed attributes appended to that file
 * (created with its directories, truncated); with NULL, files are compressed in place.
 * Returns the context, or NULL with errno: an unknown or empty type prints a message per bad
 * entry, then "error setting up compressor list". Release it with freeCompressor. */
PLZC_EXPORT CompressorContext *initCompressor(const char *compressorList, void *initArg1, void *initArg2,
                                              const char *tocPath, bool verifyChecksums, int32_t compressionLevel,
                                              bool allowLargeResourceForks);

/* Releases the context and closes its table-of-contents file. NULL is ignored. No other
 * thread may be using it. */
PLZC_EXPORT void freeCompressor(CompressorContext *ctx);

/* ---- Whole-file compression --------------------------------------------------------- */

/* A handle on a file's data and attributes (see openTocFile); opaque to callers. */
typedef struct FileHandle FileHandle;

/* Compresses one file with the context's types, tried in order until one takes it. fh is a
 * handle open on the file, or NULL to open path read-only for the call. In place, the data fork
 * is then truncated, the times restored and the flags set to the compressed flag; in
 * table-of-contents mode the file is untouched and its compressed attributes appended to the
 * context's file. Returns 0 when compressed, and when there was nothing to do (empty, or
 * already has "com.tavix.decmpfs"); -1 when no type took it (a file with its own resource fork
 * is refused) or a step failed. Safe on many threads with one context. */
PLZC_EXPORT int compressFile(CompressorContext *ctx, const char *path, FileHandle *fh);

/* ---- Decompression and reading -------------------------------------------------------- */

/* Turns the compressed file at path back into a plain file in place: its data fork holds the
 * logical data, both compression attributes are removed, times, mode and the other flags are
 * as before. With verify, the logical data is checksummed before and compared after. The
 * library decompresses itself (the Linux kernel never does; forceUserSpace forces it where a
 * kernel could). Returns 0, also for a file that is not compressed; -1 after a message. */
PLZC_EXPORT int decompressFile(const char *path, bool verify, int forceUserSpace);

/* Writes the logical data of the file at path to standard output, decompressing when it is
 * compressed. Failures are reported on standard error only. */
PLZC_EXPORT void catFile(const char *path, int forceUserSpace);

/* ---- File enumerators ------------------------------------------------------------------ */

/* Yields regular files one at a time, a file with several hard links once, under the first
 * path met (later paths print "already visited %s as %s"). The directory kind walks a tree
 * without following symbolic links or crossing into other file systems; the list kind reads a
 * text file of paths, one per line. */
typedef struct FileEnumerator FileEnumerator;

/* Starts a walk of the tree at path; NULL after a message. */
PLZC_EXPORT FileEnumerator *initFileEnumeratorFromDir(const char *path);
/* Stores the next file's path (owned by the enumerator, valid until the next call) in *pathOut
 * and returns 1; 0 when the walk is over. */
PLZC_EXPORT int enumFilesFromDir(FileEnumerator *enumerator, const char **pathOut);
/* Ends the walk and frees the enumerator; NULL is ignored. */
PLZC_EXPORT void freeFileEnumeratorFromDir(FileEnumerator *enumerator);

/* Starts reading the list file at listPath; each line is a path, examined under prefix (a
 * directory, or NULL for the lines as they stand). Lines of 1028 bytes or more are reported
 * and skipped. NULL after a message. */
PLZC_EXPORT FileEnumerator *initFileEnumeratorFromFileList(const char *listPath, const char *prefix);
/* Stores the next line naming a regular file (as written, without the prefix) in *pathOut and
 * returns 1; 0 at the end of the list. Lines that name nothing usable are reported and skipped. */
PLZC_EXPORT int enumFilesFromFileList(FileEnumerator *enumerator, const char **pathOut);
/* Releases the list and frees the enumerator; NULL is ignored. */
PLZC_EXPORT void freeFileEnumeratorFromFileList(FileEnumerator *enumerator);

/* ---- Compression rules ------------------------------------------------------------------ */

/* Keys and values of a rule dictionary, for building rule arrays ("CompressionRules",
 * "SystemCompressionRules" options). A rule is {"RuleType": "Include" | "Exclude", and one
 * match key: "PathEndsWithString", "PathBeginsWithString", "PathContainsString" or
 * "PathExactlyEqualsString"}. Constants: never release them. */
PLZC_EXPORT extern const PVStringRef kPLZCRuleTypeKey;
PLZC_EXPORT extern const PVStringRef kPLZCRuleTypeInclude;
PLZC_EXPORT extern const PVStringRef kPLZCRuleTypeExclude;
PLZC_EXPORT extern const PVStringRef kPLZCPathEndsWithStringKey;
PLZC_EXPORT extern const PVStringRef kPLZCPathBeginsWithStringKey;
PLZC_EXPORT extern const PVStringRef kPLZCPathContainsStringKey;
PLZC_EXPORT extern const PVStringRef kPLZCPathExactlyEqualsStringKey;

/* Options naming Mach-O file types left uncompressed (an array of names such as "MH_EXECUTE",
 * numbers 1 to 31, or "*" for every type), and paths relative to the destination root that are
 * compressed whatever their type (an array of strings). */
PLZC_EXPORT extern const PVStringRef kPLZCSkipMachOFileTypes;
PLZC_EXPORT extern const PVStringRef kPLZCSkipMachOOverridePaths;

/* ---- Stream compression ----------------------------------------------------------------- */

/* One run of the asynchronous pipeline: new files are written through streams, compressed on
 * worker threads while the caller goes on, and written out compressed (or plain when
 * compression does not pay or is not wanted). Create the queue, create a stream per file, write
 * the file's bytes and close the stream; finish the queue once every stream is closed. */
typedef struct StreamCompressorQueue StreamCompressorQueue;
typedef struct StreamCompressor StreamCompressor;

/* Option keys (constants; never release them):
 * "IgnoreXattrErrors" (boolean): write the plain data when compressed attributes cannot be
 *   stored, instead of failing the queue.
 * "CompressionRules", "SystemCompressionRules" (arrays of rules, see the rule keys above): the
 *   caller's rules, and system rules replacing the library's own list.
 * "CompressionTypes" (string, default "4"): compression types to try, as for initCompressor.
 * "CompressionLevel" (integer, default from the settings file, else 5).
 * "AllowLargeResourceForks" (boolean): lift type 4's 64 MiB file and 16 MiB fork caps.
 * "PLZCThrottledIO" (boolean): run the work with background I/O and CPU priority.
 * "SkipMachOFileTypes", "SkipMachOOverridePaths": see above. */
PLZC_EXPORT extern const PVStringRef kPLZCIgnoreXattrErrors;
PLZC_EXPORT extern const PVStringRef kPLZCCompressionRulesKey;
PLZC_EXPORT extern const PVStringRef kPLZCCompressionSystemRulesKey;
PLZC_EXPORT extern const PVStringRef kPLZCCompressionTypes;
PLZC_EXPORT extern const PVStringRef kPLZCCompressionLevel;
PLZC_EXPORT extern const PVStringRef kPLZCAllowLargeResourceForks;
PLZC_EXPORT extern const PVStringRef kPLZCThrottledIO;

/* A new queue from options (a dictionary, retained; NULL for every default). NULL when out of
 * memory or when "SkipMachOFileTypes" holds an invalid item (reported). */
PLZC_EXPORT StreamCompressorQueue *CreateStreamCompressorQueueWithOptions(PVDictionaryRef options);
PLZC_EXPORT StreamCompressorQueue *CreateStreamCompressorQueue(void);

/* Waits until every file of the queue has been compressed and written out, then releases the
 * caller's reference. 0, or -1 with errno: the last error any file recorded, or EINVAL when
 * the queue is NULL or not every item ran. The queue must not be used afterwards. */
PLZC_EXPORT int FinishStreamCompressorQueue(StreamCompressorQueue *queue);

/* A stream for the file open on fd (writable; positioned at its start, not written through by
 * the caller meanwhile) at path, under the destination root prefix (or NULL), whose final size
 * is expectedSize bytes. The pipeline decides by the rules whether to compress it and starts
 * its work at once. NULL when the pipeline takes no part in the file (a name beginning "._")
 * or on failure (reported). */
PLZC_EXPORT StreamCompressor *CreateStreamCompressor(int fd, const char *path, const char *prefix,
                                                     StreamCompressorQueue *queue, int64_t expectedSize);

/* Adds count bytes of the file; blocks while the stream's 64 MiB ring is full. count, or -1
 * with errno (the queue's recorded error; ENOSPC when the pipeline stopped taking this file's
 * data; a write past expectedSize). */
PLZC_EXPORT int64_t WriteToStreamCompressor(StreamCompressor *stream, const void *buffer, uint64_t count);

/* Ends the file's data and gives the stream back; the pipeline finishes the file later. 0, or
 * -1 with the queue's recorded error (the stream is closed either way). */
PLZC_EXPORT int CloseStreamCompressor(StreamCompressor *stream);

/* ---- Compression queue -------------------------------------------------------------------- */

/* Existing files compressed in place through the stream pipeline: a queue in in-place mode.
 * The first four arguments are ignored; options as for the stream queue. NULL on failure. */
PLZC_EXPORT StreamCompressorQueue *CreateCompressionQueue(void *unused1, void *unused2, void *unused3, void *unused4,
                                                          PVDictionaryRef options);

/* Hands the file at path (prefix: the root the rules see it under, or NULL) to the queue and
 * returns once its data is in the pipeline; compression and write-out go on afterwards. 1 when
 * handed over, or when the pipeline takes no part in the file (rules, empty, "._" names); 0 on
 * failure (reported). May be called from several threads at once. */
PLZC_EXPORT int CompressFile(StreamCompressorQueue *queue, const char *path, const char *prefix);

/* Waits for every file of the queue and releases it; a failure is reported on standard error. */
PLZC_EXPORT void FinishCompressionAndCleanUp(StreamCompressorQueue *queue);

/* ---- Type-5 request handler ----------------------------------------------------------- */

/* The answer to one type-1 request: an opaque, reference-counted handle on that request's own
 * 48-byte record and on the device it came from. Any thread may copy, invoke and release
 * handles at any time, concurrently. A record and the device stay valid while any copy of a
 * handle on it is held. */
typedef struct Type5Completion Type5Completion;

/* The caller's handlers of the requests of type5_handler_function, in this order. Both run on
 * the loop's thread, which reads the next request only when the handler returns. Their results
 * are ignored. A NULL entry handles its requests by doing nothing. */
typedef struct Type5Callbacks {
  /* Type-1 request. `completion` is lent for the duration of this call only: to answer after
   * returning, keep Type5CompletionCopy(completion) and release that copy when done. Nothing
   * is answered until a completion is invoked. */
  int (*type1Handler)(uint64_t value1, uint64_t value2, uint64_t value3, uint64_t value4,
                      Type5Completion *completion);
  /* Type-2 request. When it returns, the request's 48 bytes are written back unchanged. */
  int (*type2Handler)(uint64_t value1, uint64_t value2);
} Type5Callbacks;

/* Serves the kernel's type-5 device "/dev/plzc_type5" on the calling thread: reads 48-byte
 * requests one at a time and hands each to `callbacks` by its type (1 or 2). Returns 0 when
 * the loop ends: the device cannot be opened, a read fails (its record reads as type 0), or a
 * request of any type but 1 and 2 arrives. NULL callbacks serve as two NULL entries.
 * Diagnostics go to the system log at LOG_ERR only.
 * The device is closed once the loop has ended and the last completion handle is released. */
PLZC_EXPORT int type5_handler_function(const Type5Callbacks *callbacks);

/* Returns `completion` with one more reference (NULL for NULL): a copy to keep past the
 * handler's return. Every copy is given back with one Type5CompletionRelease. */
PLZC_EXPORT Type5Completion *Type5CompletionCopy(Type5Completion *completion);

/* Answers the request with one 48-byte write of its record with r1 at offset 16, r3 at offset
 * 24 and r2 at offset 32; header, type and value4 stay as received. May be called any number
 * of times, from any thread. Returns 0 when the 48 bytes were written, else -1 with errno
 * (EINVAL for NULL) after logging "send response: ...". */
PLZC_EXPORT int Type5CompletionInvoke(Type5Completion *completion, uint64_t r1, uint64_t r2, uint64_t r3);

/* Gives back one reference; the last one frees the record. NULL does nothing. */
PLZC_EXPORT void Type5CompletionRelease(Type5Completion *completion);

/* ---- File locks by inode -------------------------------------------------------------- */

/* An exclusive lock on a file identified by its device and inode numbers, so that every path
 * to the file (hard links, symbolic links, a descriptor) takes the same lock. It orders the
 * threads of this process only; other processes and the file system never see it. The
 * library's write-out holds it while it rewrites a file. Each successful lock call is matched
 * by exactly one PLZCUnlockFile on the same thread; a thread must not lock a file it already
 * holds (it would wait for itself). The handle is opaque. */
typedef struct FileLock FileLock;

/* Blocks until the calling thread holds the lock of the file with device number dev (st_dev,
 * as 32 bits) and inode number ino. Returns the handle, or NULL with errno ENOMEM. */
PLZC_EXPORT FileLock *PLZCLockFileIno(int32_t dev, uint64_t ino);

/* As PLZCLockFileIno for the file open on fd. NULL with errno from fstat after a message. */
PLZC_EXPORT FileLock *PLZCLockFileFd(int fd);

/* As PLZCLockFileIno for the file at path, symbolic links followed. NULL with errno from stat
 * after a message. */
PLZC_EXPORT FileLock *PLZCLockFilePath(const char *path);

/* Releases a lock taken by this thread; the handle is invalid afterwards. 0, or -1 with
 * errno EINVAL for NULL. */
PLZC_EXPORT int PLZCUnlockFile(FileLock *lock);

#ifdef __cplusplus
}
#endif

#endif /* PLENZO_H */
