// Property values inside the library: the object layouts behind the opaque references of
// PropertyValue.h, the hooks each kind gives the shared code (free, equality, hash,
// description), constant strings for exported keys, and an owning holder for C++ callers.
#pragma once

#include <atomic>
#include <cstdint>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "PropertyValue.h"

// Header shared by every value. Constants (static storage) ignore retain and release.
struct PVObject {
  std::atomic<uint32_t> refCount;
  const PVType type;
  const bool isMutable;
  const bool isConstant;

  constexpr PVObject(PVType type, bool isMutable, bool isConstant = false)
      : refCount(1), type(type), isMutable(isMutable), isConstant(isConstant) {}
  PVObject(const PVObject &) = delete;
  PVObject &operator=(const PVObject &) = delete;
};

// UTF-8 text; bytes are NUL-terminated and never NULL.
struct PVString : PVObject {
  const char *bytes;
  PVIndex length;
  bool isASCII;
  bool hasNul;

  PVString(char *ownedBytes, PVIndex length, bool isASCII, bool hasNul)
      : PVObject(kPVTypeString, false), bytes(ownedBytes), length(length), isASCII(isASCII), hasNul(hasNul) {}

  // A string constant over a literal, for keys the library exports:
  //   constinit PVString kFooKey = PVString::constant("Foo");
  //   const PVStringRef kPLZCFoo = &kFooKey;
  // The literal must be ASCII without NUL bytes.
  template <size_t N>
  static consteval PVString constant(const char (&literal)[N]) {
    return PVString(literal, N - 1);
  }

 private:
  constexpr PVString(const char *literal, PVIndex length)
      : PVObject(kPVTypeString, false, true), bytes(literal), length(length), isASCII(true), hasNul(false) {}
};

struct PVNumber : PVObject {
  PVNumberType numberType;
  int64_t integer;  // for the integer types
  double real;      // for kPVNumberDoubleType

  PVNumber(PVNumberType numberType, int64_t integer, double real)
      : PVObject(kPVTypeNumber, false), numberType(numberType), integer(integer), real(real) {}
};

struct PVBoolean : PVObject {
  bool value;
  constexpr explicit PVBoolean(bool value) : PVObject(kPVTypeBoolean, false, true), value(value) {}
};

// Bytes from malloc, grown with realloc; bytes may be NULL while capacity is 0.
struct PVData : PVObject {
  uint8_t *bytes = nullptr;
  PVIndex length = 0;
  PVIndex capacity = 0;
  explicit PVData(bool isMutable) : PVObject(kPVTypeData, isMutable) {}
};

struct PVArray : PVObject {
  std::vector<const PVObject *> values;  // each retained
  explicit PVArray(bool isMutable) : PVObject(kPVTypeArray, isMutable) {}
};

// An insertion-ordered hash table: entries in order of insertion (a removed entry leaves a
// hole, key NULL, until the next rebuild) and an open-addressing index of slots into them.
struct PVDictionary : PVObject {
  struct Entry {
    const PVObject *key;  // retained; NULL for a hole
    const void *value;    // retained in kPVDictionaryRetainedValues mode
    uint64_t hash;
  };
  static constexpr int32_t kEmptySlot = -1;
  static constexpr int32_t kDeletedSlot = -2;

  const PVDictionaryValueMode mode;
  std::vector<Entry> entries;
  std::vector<int32_t> slots;  // size 0 or a power of two
  PVIndex count = 0;

  PVDictionary(bool isMutable, PVDictionaryValueMode mode) : PVObject(kPVTypeDictionary, isMutable), mode(mode) {}
};

namespace pv {

// The object behind a reference, or nullptr when it is NULL or of another kind.
template <class T, PVType kType>
inline T *as(PVRef value) {
  auto *object = static_cast<const PVObject *>(value);
  return object && object->type == kType ? const_cast<T *>(static_cast<const T *>(object)) : nullptr;
}
inline PVString *asString(PVRef value) { return as<PVString, kPVTypeString>(value); }
inline PVNumber *asNumber(PVRef value) { return as<PVNumber, kPVTypeNumber>(value); }
inline PVBoolean *asBoolean(PVRef value) { return as<PVBoolean, kPVTypeBoolean>(value); }
inline PVData *asData(PVRef value) { return as<PVData, kPVTypeData>(value); }
inline PVArray *asArray(PVRef value) { return as<PVArray, kPVTypeArray>(value); }
inline PVDictionary *asDictionary(PVRef value) { return as<PVDictionary, kPVTypeDictionary>(value); }

// Runs body and turns any exception (only std::bad_alloc is expected) into `failure`, so that
// nothing crosses the C boundary.
template <class Result, class Body>
inline Result noThrow(Result failure, Body &&body) noexcept {
  try {
    return body();
  } catch (...) {
    return failure;
  }
}

// Hash mixing shared by the kinds (FNV-1a over bytes, a finaliser for integers).
uint64_t hashBytes(const void *bytes, size_t length);
uint64_t hashInteger(uint64_t value);

// Per-kind hooks used by PVRelease, PVEqual, PVHash and the description.
void freeString(PVString *string);
void freeData(PVData *data);
void freeArray(PVArray *array);
void freeDictionary(PVDictionary *dictionary);
bool numbersEqual(const PVNumber *a, const PVNumber *b);
uint64_t hashNumber(const PVNumber *number);
bool arraysEqual(const PVArray *a, const PVArray *b);
bool dictionariesEqual(const PVDictionary *a, const PVDictionary *b);
// Appends the description of value (which may be NULL) to out; throws std::bad_alloc.
void describe(PVRef value, std::string &out);

// Creates a string from UTF-8 bytes known to be valid.
PVStringRef createStringFromValidUTF8(const char *bytes, size_t length);

// Owns one reference and gives it back when it goes out of scope:
//   pv::Owned<PVStringRef> name(PVStringCreateWithCString(text, kPVStringEncodingUTF8));
//   if (!name) return -1;
template <class Ref>
class Owned {
 public:
  Owned() = default;
  explicit Owned(Ref value) : value_(value) {}
  Owned(Owned &&other) noexcept : value_(std::exchange(other.value_, nullptr)) {}
  Owned &operator=(Owned &&other) noexcept {
    if (this != &other) reset(std::exchange(other.value_, nullptr));
    return *this;
  }
  ~Owned() { PVRelease(value_); }
  Owned(const Owned &) = delete;
  Owned &operator=(const Owned &) = delete;

  Ref get() const { return value_; }
  explicit operator bool() const { return value_ != nullptr; }
  // Hands the reference to the caller.
  Ref release() { return std::exchange(value_, nullptr); }
  void reset(Ref value = nullptr) { PVRelease(std::exchange(value_, value)); }

 private:
  Ref value_ = nullptr;
};

}  // namespace pv
