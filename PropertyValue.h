/*
 * PropertyValue: small reference-counted values with a C API (strings, numbers, booleans,
 * data, arrays and dictionaries), used for options, rules, captured attributes and tables.
 *
 * Ownership. A function with "Create" or "Copy" in its name returns a value the caller owns
 * and gives back with PVRelease. "Get" functions return borrowed values that stay valid while
 * their container holds them (and the container is alive). Containers retain the values put
 * into them and release them when they are removed, replaced or freed.
 *
 * Failure. Creation returns NULL when memory runs out or an argument is invalid (a NULL
 * pointer, a negative length, bytes that are not valid in the given encoding). Functions that
 * change a value return false and leave it as it was. Passing a value of the wrong kind gives
 * the failure result; it never crashes. Nothing here throws; errno is not part of any result.
 *
 * Threads. Reference counts change atomically: any value may be retained and released from
 * several threads at once. Immutable values may be read by any number of threads; a mutable
 * value needs its owner's lock around changes.
 *
 * Sizes, lengths and indexes are PVIndex (signed; a negative one is invalid).
 */
#ifndef PROPERTY_VALUE_H
#define PROPERTY_VALUE_H

#include <limits.h>
#include <stdbool.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#if defined(PLZC_BUILDING_LIBRARY)
#define PV_EXPORT __attribute__((visibility("default")))
#else
#define PV_EXPORT
#endif

typedef long PVIndex;

/* A run of bytes (in data) or of UTF-8 bytes (in strings). */
typedef struct PVRange {
  PVIndex location;
  PVIndex length;
} PVRange;

static inline PVRange PVRangeMake(PVIndex location, PVIndex length) {
  PVRange range = {location, length};
  return range;
}

/* Any value. Every specific reference below converts to it implicitly. */
typedef const void *PVRef;

typedef const struct PVString *PVStringRef;
typedef const struct PVNumber *PVNumberRef;
typedef const struct PVBoolean *PVBooleanRef;
typedef const struct PVData *PVDataRef;
typedef struct PVData *PVMutableDataRef;
typedef const struct PVArray *PVArrayRef;
typedef struct PVArray *PVMutableArrayRef;
typedef const struct PVDictionary *PVDictionaryRef;
typedef struct PVDictionary *PVMutableDictionaryRef;

/* ---- Every value ---------------------------------------------------------------------- */

typedef enum PVType {
  kPVTypeNone = 0, /* what PVGetType says for NULL */
  kPVTypeString = 1,
  kPVTypeNumber = 2,
  kPVTypeBoolean = 3,
  kPVTypeData = 4,
  kPVTypeArray = 5,
  kPVTypeDictionary = 6,
} PVType;

/* Returns the kind of value, kPVTypeNone for NULL. */
PV_EXPORT PVType PVGetType(PVRef value);

/* Takes one more reference on value and returns it. NULL gives NULL. */
PV_EXPORT PVRef PVRetain(PVRef value);

/* Gives back one reference; the last one frees the value. NULL does nothing. */
PV_EXPORT void PVRelease(PVRef value);

/* Returns the number of references held (for tests and diagnostics); constants, which are
 * never freed, report PV_CONSTANT_RETAIN_COUNT. 0 for NULL. */
#define PV_CONSTANT_RETAIN_COUNT ((PVIndex)LONG_MAX)
PV_EXPORT PVIndex PVGetRetainCount(PVRef value);

/* Deep equality by content: same kind (numbers compare by numeric value whatever their type,
 * mutable and immutable values compare alike), equal elements in order for arrays, equal keys
 * with equal values for dictionaries (plain-pointer values compare as pointers; dictionaries of
 * different value modes are not equal). Two NULLs are equal; NULL and a value are not. */
PV_EXPORT bool PVEqual(PVRef a, PVRef b);

/* Hash consistent with PVEqual (equal values hash alike). 0 for NULL. */
PV_EXPORT uint64_t PVHash(PVRef value);

/* A readable, deterministic one-line description: strings in double quotes with \" \\ and
 * control characters escaped, numbers in decimal (a floating value always shows a '.', an
 * exponent, "nan" or "inf"), true/false, data as <00ff> (past 64 bytes: the first 64, then
 * "...> (N bytes)"), arrays as [a, b], dictionaries as {key: value, ...} in iteration order,
 * plain-pointer values as 0x hex. NULL describes as "NULL". Returns a new string, or NULL when
 * memory runs out. */
PV_EXPORT PVStringRef PVCopyDescription(PVRef value);

/* The same description as a NUL-terminated UTF-8 C string allocated with malloc; the caller
 * frees it with free(). NULL when memory runs out. */
PV_EXPORT char *PVCopyDescriptionCString(PVRef value);

/* ---- Strings -------------------------------------------------------------------------- */
/* Immutable Unicode text, stored as UTF-8. Lengths and ranges count UTF-8 bytes, not
 * characters. Comparisons are literal: byte for byte, case-sensitive, no normalisation. */

typedef enum PVStringEncoding {
  kPVStringEncodingUTF8 = 0,
  kPVStringEncodingASCII = 1, /* 7-bit only: bytes 0x00 to 0x7F */
} PVStringEncoding;

/* Creates a string from a NUL-terminated C string in the given encoding. NULL when cString is
 * NULL or not valid in that encoding (malformed UTF-8, a byte above 0x7F for ASCII). */
PV_EXPORT PVStringRef PVStringCreateWithCString(const char *cString, PVStringEncoding encoding);

/* Creates a string from length bytes in the given encoding (embedded NUL bytes are kept).
 * NULL as for PVStringCreateWithCString; bytes may be NULL only when length is 0. */
PV_EXPORT PVStringRef PVStringCreateWithBytes(const void *bytes, PVIndex length, PVStringEncoding encoding);

/* Creates a string from a path as the file system names it. On Linux names are bytes and we
 * take them as UTF-8: NULL when the bytes are not valid UTF-8 (or path is NULL). */
PV_EXPORT PVStringRef PVStringCreateWithFileSystemRepresentation(const char *path);

/* Returns the length in UTF-8 bytes (without a terminating NUL); 0 for a non-string. */
PV_EXPORT PVIndex PVStringGetLength(PVStringRef string);

/* Returns the most bytes (without the terminating NUL) that a string of `length` (as returned
 * by PVStringGetLength) can take in the encoding. -1 for a negative length. */
PV_EXPORT PVIndex PVStringGetMaximumSizeForEncoding(PVIndex length, PVStringEncoding encoding);

/* Copies the string, NUL-terminated, into buffer (bufferSize bytes). Returns true when it fit;
 * false, with buffer holding "" (when bufferSize > 0), when it does not fit, holds a character
 * the encoding cannot represent, or holds an embedded NUL. */
PV_EXPORT bool PVStringGetCString(PVStringRef string, char *buffer, PVIndex bufferSize,
                                  PVStringEncoding encoding);

/* Returns the string's own NUL-terminated bytes in the encoding, valid while the string is,
 * or NULL when they cannot be given without conversion (non-ASCII text asked as ASCII, an
 * embedded NUL). UTF-8 never needs a conversion. */
PV_EXPORT const char *PVStringGetCStringPtr(PVStringRef string, PVStringEncoding encoding);

/* Returns the buffer size (terminating NUL included) that always holds the string's file-system
 * representation; 0 for a non-string. */
PV_EXPORT PVIndex PVStringGetMaximumSizeOfFileSystemRepresentation(PVStringRef string);

/* Copies the path bytes naming the string on the file system (UTF-8 on Linux), NUL-terminated,
 * into buffer. Returns true when they fit, false as for PVStringGetCString. */
PV_EXPORT bool PVStringGetFileSystemRepresentation(PVStringRef string, char *buffer, PVIndex bufferSize);

/* True when string begins with prefix (an empty prefix always matches). */
PV_EXPORT bool PVStringHasPrefix(PVStringRef string, PVStringRef prefix);

/* True when string ends with suffix (an empty suffix always matches). */
PV_EXPORT bool PVStringHasSuffix(PVStringRef string, PVStringRef suffix);

/* Looks for the first occurrence of needle in string. Returns true and sets *found (if not
 * NULL) to its byte range; false when absent. An empty needle is found at 0. */
PV_EXPORT bool PVStringFind(PVStringRef string, PVStringRef needle, PVRange *found);

/* Orders two strings by Unicode code point (UTF-8 byte order): negative, 0 or positive.
 * Equality is PVEqual. */
PV_EXPORT int PVStringCompare(PVStringRef a, PVStringRef b);

/* ---- Numbers -------------------------------------------------------------------------- */
/* Immutable numbers. A number keeps the type it was created with; the getters convert. */

typedef enum PVNumberType {
  kPVNumberInt32Type = 1,
  kPVNumberInt64Type = 2,
  kPVNumberDoubleType = 3, /* IEEE 754 binary64 */
} PVNumberType;

PV_EXPORT PVNumberRef PVNumberCreateInt32(int32_t value);
PV_EXPORT PVNumberRef PVNumberCreateInt64(int64_t value);
/* Any double, NaN and infinities included. */
PV_EXPORT PVNumberRef PVNumberCreateDouble(double value);

/* Returns the type the number was created with; 0 for a non-number. */
PV_EXPORT PVNumberType PVNumberGetType(PVNumberRef number);

/* Each getter stores the number converted to its type in *value: fractions are truncated
 * toward zero, values out of range are clamped to the type's limits, NaN gives 0. It returns
 * true only when the conversion was exact (5.0 is an exact 5; 5.5 and 2^40 as int32 are not).
 * A non-number returns false and leaves *value untouched. */
PV_EXPORT bool PVNumberGetInt32(PVNumberRef number, int32_t *value);
PV_EXPORT bool PVNumberGetInt64(PVNumberRef number, int64_t *value);
/* Integers beyond 2^53 may not be exact as a double; they round to nearest. */
PV_EXPORT bool PVNumberGetDouble(PVNumberRef number, double *value);

/* ---- Booleans ------------------------------------------------------------------------- */
/* The two boolean values are shared constants: retaining and releasing them does nothing. */

PV_EXPORT extern const PVBooleanRef kPVBooleanTrue;
PV_EXPORT extern const PVBooleanRef kPVBooleanFalse;

/* Returns the boolean's value; false for a non-boolean. */
PV_EXPORT bool PVBooleanGetValue(PVBooleanRef boolean);

/* ---- Data ----------------------------------------------------------------------------- */
/* Bytes. A mutable data value can be resized, appended to and spliced; pointers into its bytes
 * are valid until its next change. */

/* Creates immutable data holding a copy of length bytes (bytes may be NULL when length is 0). */
PV_EXPORT PVDataRef PVDataCreate(const void *bytes, PVIndex length);

/* Creates empty mutable data; capacity is a hint (bytes reserved), not a limit. */
PV_EXPORT PVMutableDataRef PVDataCreateMutable(PVIndex capacity);

/* Creates an immutable (Copy) or mutable (MutableCopy) copy of data's bytes. */
PV_EXPORT PVDataRef PVDataCreateCopy(PVDataRef data);
PV_EXPORT PVMutableDataRef PVDataCreateMutableCopy(PVDataRef data);

/* Returns the length in bytes; 0 for a non-data value. */
PV_EXPORT PVIndex PVDataGetLength(PVDataRef data);

/* Returns the bytes, borrowed; NULL for a non-data value and possibly for empty data. */
PV_EXPORT const uint8_t *PVDataGetBytePtr(PVDataRef data);

/* Returns the bytes for writing in place; NULL for immutable data (and possibly when empty). */
PV_EXPORT uint8_t *PVDataGetMutableBytePtr(PVMutableDataRef data);

/* Sets the length: new bytes past the old end are zero, a shorter length drops the tail.
 * Returns false (data unchanged) when memory runs out or data is not mutable. */
PV_EXPORT bool PVDataSetLength(PVMutableDataRef data, PVIndex length);

/* Appends length bytes (they may lie inside data itself). Returns false as PVDataSetLength. */
PV_EXPORT bool PVDataAppendBytes(PVMutableDataRef data, const void *bytes, PVIndex length);

/* Replaces the bytes in range with newLength bytes from newBytes (which may lie inside data
 * itself), moving the tail: an empty range inserts, an empty replacement deletes, a range at
 * the end appends. Returns false (data unchanged) when the range is not within 0..length, when
 * memory runs out or data is not mutable. */
PV_EXPORT bool PVDataReplaceBytes(PVMutableDataRef data, PVRange range, const void *newBytes, PVIndex newLength);

/* ---- Arrays --------------------------------------------------------------------------- */
/* Ordered values, each retained by the array. Elements are never NULL. */

/* Creates an immutable array of count values (all non-NULL; NULL result otherwise). */
PV_EXPORT PVArrayRef PVArrayCreate(const PVRef *values, PVIndex count);

/* Creates an empty mutable array; capacity is a hint. */
PV_EXPORT PVMutableArrayRef PVArrayCreateMutable(PVIndex capacity);

/* Creates an immutable or mutable array holding the same elements (retained again). */
PV_EXPORT PVArrayRef PVArrayCreateCopy(PVArrayRef array);
PV_EXPORT PVMutableArrayRef PVArrayCreateMutableCopy(PVArrayRef array);

/* Returns the number of elements; 0 for a non-array. */
PV_EXPORT PVIndex PVArrayGetCount(PVArrayRef array);

/* Returns the element at index, borrowed; NULL when index is out of range. */
PV_EXPORT PVRef PVArrayGetValueAtIndex(PVArrayRef array, PVIndex index);

/* Appends value (retained). False when value is NULL, memory runs out or array is immutable. */
PV_EXPORT bool PVArrayAppendValue(PVMutableArrayRef array, PVRef value);

/* Inserts value before index (0..count; count appends). False as PVArrayAppendValue or for a
 * bad index. */
PV_EXPORT bool PVArrayInsertValueAtIndex(PVMutableArrayRef array, PVIndex index, PVRef value);

/* Replaces the element at index (0..count-1) with value, releasing the old one. False as
 * PVArrayInsertValueAtIndex. */
PV_EXPORT bool PVArraySetValueAtIndex(PVMutableArrayRef array, PVIndex index, PVRef value);

/* Removes the element at index, releasing it. False for a bad index or an immutable array. */
PV_EXPORT bool PVArrayRemoveValueAtIndex(PVMutableArrayRef array, PVIndex index);

typedef void (*PVArrayApplier)(PVRef value, PVIndex index, void *context);

/* Calls applier for every element in index order. The applier must not change the array. */
PV_EXPORT void PVArrayApply(PVArrayRef array, PVArrayApplier applier, void *context);

/* ---- Dictionaries --------------------------------------------------------------------- */
/* Maps from keys to values. Keys are values of any kind, retained, hashed with PVHash and
 * compared by content with PVEqual (a key must not change while it is in a dictionary).
 * Iteration order is insertion order: replacing a value keeps its key's place, removing a key
 * and setting it again moves it to the end. */

typedef enum PVDictionaryValueMode {
  /* Values are property values, retained while in the dictionary, never NULL. */
  kPVDictionaryRetainedValues = 0,
  /* Values are plain pointers (or integers cast to pointers, NULL included) that the
   * dictionary stores as they are and never retains, releases or frees. */
  kPVDictionaryPlainValues = 1,
} PVDictionaryValueMode;

/* Creates an immutable dictionary of count entries (keys[i] maps to values[i]; a key given
 * twice keeps its first place and its last value). NULL for a NULL key, or a NULL value in
 * retained mode. */
PV_EXPORT PVDictionaryRef PVDictionaryCreate(const PVRef *keys, const void *const *values, PVIndex count,
                                             PVDictionaryValueMode mode);

/* Creates an empty mutable dictionary; capacity (entries) is a hint. */
PV_EXPORT PVMutableDictionaryRef PVDictionaryCreateMutable(PVIndex capacity, PVDictionaryValueMode mode);

/* Creates an immutable or mutable dictionary with the same entries, order and value mode
 * (keys and retained values retained again, plain values copied as pointers). */
PV_EXPORT PVDictionaryRef PVDictionaryCreateCopy(PVDictionaryRef dictionary);
PV_EXPORT PVMutableDictionaryRef PVDictionaryCreateMutableCopy(PVDictionaryRef dictionary);

/* Returns the value mode; kPVDictionaryRetainedValues for a non-dictionary. */
PV_EXPORT PVDictionaryValueMode PVDictionaryGetValueMode(PVDictionaryRef dictionary);

/* Returns the number of entries; 0 for a non-dictionary. */
PV_EXPORT PVIndex PVDictionaryGetCount(PVDictionaryRef dictionary);

/* Returns the value stored under key, borrowed; NULL when absent. In plain mode a stored NULL
 * looks absent: use PVDictionaryGetValueIfPresent. */
PV_EXPORT const void *PVDictionaryGetValue(PVDictionaryRef dictionary, PVRef key);

/* Returns true when key is present and, if value is not NULL, stores its value there. */
PV_EXPORT bool PVDictionaryGetValueIfPresent(PVDictionaryRef dictionary, PVRef key, const void **value);

/* Sets the value under key: adds the entry at the end, or replaces the value in place
 * (releasing the old one in retained mode; the first key stays). Returns false (dictionary
 * unchanged) for a NULL key, a NULL value in retained mode, an immutable dictionary, or when
 * memory runs out. */
PV_EXPORT bool PVDictionarySetValue(PVMutableDictionaryRef dictionary, PVRef key, const void *value);

/* Removes the entry under key, releasing its key (and value in retained mode). Returns true
 * when an entry was removed. */
PV_EXPORT bool PVDictionaryRemoveValue(PVMutableDictionaryRef dictionary, PVRef key);

typedef void (*PVDictionaryApplier)(PVRef key, const void *value, void *context);

/* Calls applier for every entry in iteration order. The applier must not change the
 * dictionary. */
PV_EXPORT void PVDictionaryApply(PVDictionaryRef dictionary, PVDictionaryApplier applier, void *context);

/* Fills keys[0..count-1] and values[0..count-1] (borrowed) in iteration order; either array
 * may be NULL. */
PV_EXPORT void PVDictionaryGetKeysAndValues(PVDictionaryRef dictionary, PVRef *keys, const void **values);

/* ---- Property lists ------------------------------------------------------------------- */
/* XML property lists become immutable values: dict, array, string, integer (int64), real
 * (double), true/false, data. Dates and keyed-archive identifiers have no value kind here and
 * make the whole list fail. */

/* Parses data holding an XML property list. Returns the top-level value, or NULL when the
 * data is not a well-formed XML property list or holds a kind listed above as unsupported. */
PV_EXPORT PVRef PVPropertyListCreateWithXMLData(PVDataRef data);

/* Reads a whole file into a new data value; NULL with errno when it cannot be read. */
PV_EXPORT PVDataRef PVDataCreateWithContentsOfFile(const char *path);

#ifdef __cplusplus
}
#endif

#endif /* PROPERTY_VALUE_H */
