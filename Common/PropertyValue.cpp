// What every property value shares: reference counting, kind, equality and hash.
#include "PropertyValue.h"

#include <cstring>

#include "Common/PropertyValueObjects.h"

namespace pv {

uint64_t hashBytes(const void *bytes, size_t length) {
  uint64_t hash = 0xcbf29ce484222325ull;
  auto *at = static_cast<const uint8_t *>(bytes);
  for (size_t i = 0; i < length; i++) {
    hash ^= at[i];
    hash *= 0x100000001b3ull;
  }
  return hash;
}

uint64_t hashInteger(uint64_t value) {
  // Final mix of splitmix64: consecutive integers (inode numbers) spread over all bits.
  value ^= value >> 30;
  value *= 0xbf58476d1ce4e5b9ull;
  value ^= value >> 27;
  value *= 0x94d049bb133111ebull;
  value ^= value >> 31;
  return value;
}

static void destroy(PVObject *object) {
  switch (object->type) {
    case kPVTypeString:
      freeString(static_cast<PVString *>(object));
      break;
    case kPVTypeNumber:
      delete static_cast<PVNumber *>(object);
      break;
    case kPVTypeData:
      freeData(static_cast<PVData *>(object));
      break;
    case kPVTypeArray:
      freeArray(static_cast<PVArray *>(object));
      break;
    case kPVTypeDictionary:
      freeDictionary(static_cast<PVDictionary *>(object));
      break;
    case kPVTypeBoolean:  // constants only
    case kPVTypeNone:
      break;
  }
}

}  // namespace pv

extern "C" {

PVType PVGetType(PVRef value) {
  return value ? static_cast<const PVObject *>(value)->type : kPVTypeNone;
}

PVRef PVRetain(PVRef value) {
  auto *object = static_cast<const PVObject *>(value);
  if (object && !object->isConstant) const_cast<PVObject *>(object)->refCount.fetch_add(1, std::memory_order_relaxed);
  return value;
}

void PVRelease(PVRef value) {
  auto *object = const_cast<PVObject *>(static_cast<const PVObject *>(value));
  if (!object || object->isConstant) return;
  // acq_rel: each holder's writes are published, and the thread that frees sees them all.
  // (A plain fence would do, but ThreadSanitizer does not model fences.)
  if (object->refCount.fetch_sub(1, std::memory_order_acq_rel) == 1) pv::destroy(object);
}

PVIndex PVGetRetainCount(PVRef value) {
  auto *object = static_cast<const PVObject *>(value);
  if (!object) return 0;
  if (object->isConstant) return PV_CONSTANT_RETAIN_COUNT;
  return object->refCount.load(std::memory_order_relaxed);
}

bool PVEqual(PVRef a, PVRef b) {
  if (a == b) return true;
  if (!a || !b) return false;
  auto *x = static_cast<const PVObject *>(a);
  auto *y = static_cast<const PVObject *>(b);
  if (x->type != y->type) return false;
  switch (x->type) {
    case kPVTypeString: {
      auto *s = static_cast<const PVString *>(x), *t = static_cast<const PVString *>(y);
      return s->length == t->length && memcmp(s->bytes, t->bytes, s->length) == 0;
    }
    case kPVTypeNumber:
      return pv::numbersEqual(static_cast<const PVNumber *>(x), static_cast<const PVNumber *>(y));
    case kPVTypeBoolean:
      return static_cast<const PVBoolean *>(x)->value == static_cast<const PVBoolean *>(y)->value;
    case kPVTypeData: {
      auto *d = static_cast<const PVData *>(x), *e = static_cast<const PVData *>(y);
      return d->length == e->length && (d->length == 0 || memcmp(d->bytes, e->bytes, d->length) == 0);
    }
    case kPVTypeArray:
      return pv::arraysEqual(static_cast<const PVArray *>(x), static_cast<const PVArray *>(y));
    case kPVTypeDictionary:
      return pv::dictionariesEqual(static_cast<const PVDictionary *>(x), static_cast<const PVDictionary *>(y));
    case kPVTypeNone:
      break;
  }
  return false;
}

uint64_t PVHash(PVRef value) {
  auto *object = static_cast<const PVObject *>(value);
  if (!object) return 0;
  switch (object->type) {
    case kPVTypeString: {
      auto *string = static_cast<const PVString *>(object);
      return pv::hashBytes(string->bytes, string->length);
    }
    case kPVTypeNumber:
      return pv::hashNumber(static_cast<const PVNumber *>(object));
    case kPVTypeBoolean:
      return pv::hashInteger(static_cast<const PVBoolean *>(object)->value ? 1 : 2);
    case kPVTypeData: {
      auto *data = static_cast<const PVData *>(object);
      return pv::hashBytes(data->bytes, data->length) ^ 0x5bd1e995u;
    }
    // Containers hash by count only: cheap, and consistent with deep equality.
    case kPVTypeArray:
      return pv::hashInteger(static_cast<const PVArray *>(object)->values.size() + 0xa0);
    case kPVTypeDictionary:
      return pv::hashInteger(static_cast<const PVDictionary *>(object)->count + 0xd0);
    case kPVTypeNone:
      break;
  }
  return 0;
}

}  // extern "C"
