// Data values: bytes in one malloc block that mutable data grows geometrically.
#include <cstdlib>
#include <cstring>

#include "Common/PropertyValueObjects.h"
#include "Platform/Syscalls.h"
#include "PropertyValue.h"

namespace {

// Makes room for `needed` bytes; new capacity is at least double the old one so appends stay
// linear overall.
bool reserve(PVData *data, PVIndex needed) {
  if (needed <= data->capacity) return true;
  PVIndex capacity = data->capacity < 16 ? 16 : data->capacity;
  while (capacity < needed) capacity = capacity > PTRDIFF_MAX / 2 ? needed : capacity * 2;
  auto *bytes = static_cast<uint8_t *>(sys::realloc(data->bytes, static_cast<size_t>(capacity)));
  if (!bytes) return false;
  data->bytes = bytes;
  data->capacity = capacity;
  return true;
}

PVData *create(const void *bytes, PVIndex length, PVIndex capacity, bool isMutable) {
  if (length < 0 || capacity < 0 || (!bytes && length > 0)) return nullptr;
  auto *data = new (std::nothrow) PVData(isMutable);
  if (!data) return nullptr;
  PVIndex size = length > capacity ? length : capacity;
  if (size > 0) {
    data->bytes = static_cast<uint8_t *>(sys::malloc(static_cast<size_t>(size)));
    if (!data->bytes) {
      delete data;
      return nullptr;
    }
    data->capacity = size;
  }
  if (length > 0) memcpy(data->bytes, bytes, static_cast<size_t>(length));
  data->length = length;
  return data;
}

PVData *mutableData(PVMutableDataRef data) {
  auto *d = pv::asData(data);
  return d && d->isMutable ? d : nullptr;
}

}  // namespace

namespace pv {

void freeData(PVData *data) {
  free(data->bytes);
  delete data;
}

}  // namespace pv

extern "C" {

PVDataRef PVDataCreate(const void *bytes, PVIndex length) { return create(bytes, length, 0, false); }

PVMutableDataRef PVDataCreateMutable(PVIndex capacity) { return create(nullptr, 0, capacity, true); }

PVDataRef PVDataCreateCopy(PVDataRef data) {
  auto *d = pv::asData(data);
  return d ? create(d->bytes, d->length, 0, false) : nullptr;
}

PVMutableDataRef PVDataCreateMutableCopy(PVDataRef data) {
  auto *d = pv::asData(data);
  return d ? create(d->bytes, d->length, 0, true) : nullptr;
}

PVIndex PVDataGetLength(PVDataRef data) {
  auto *d = pv::asData(data);
  return d ? d->length : 0;
}

const uint8_t *PVDataGetBytePtr(PVDataRef data) {
  auto *d = pv::asData(data);
  return d ? d->bytes : nullptr;
}

uint8_t *PVDataGetMutableBytePtr(PVMutableDataRef data) {
  auto *d = mutableData(data);
  return d ? d->bytes : nullptr;
}

bool PVDataSetLength(PVMutableDataRef data, PVIndex length) {
  auto *d = mutableData(data);
  if (!d || length < 0 || !reserve(d, length)) return false;
  if (length > d->length) memset(d->bytes + d->length, 0, static_cast<size_t>(length - d->length));
  d->length = length;
  return true;
}

bool PVDataAppendBytes(PVMutableDataRef data, const void *bytes, PVIndex length) {
  auto *d = mutableData(data);
  if (!d) return false;
  return PVDataReplaceBytes(data, PVRangeMake(d->length, 0), bytes, length);
}

bool PVDataReplaceBytes(PVMutableDataRef data, PVRange range, const void *newBytes, PVIndex newLength) {
  auto *d = mutableData(data);
  if (!d || range.location < 0 || range.length < 0 || range.location > d->length ||
      range.length > d->length - range.location || newLength < 0 || (!newBytes && newLength > 0) ||
      newLength > PTRDIFF_MAX - (d->length - range.length))
    return false;
  PVIndex tail = d->length - range.location - range.length;
  PVIndex length = d->length - range.length + newLength;
  // Source bytes inside our own buffer move on realloc and on the tail shift: take them as an
  // offset now and copy them aside before anything moves.
  auto *source = static_cast<const uint8_t *>(newBytes);
  auto sourceAddress = reinterpret_cast<uintptr_t>(source), ownAddress = reinterpret_cast<uintptr_t>(d->bytes);
  bool inside = d->bytes && newLength > 0 && sourceAddress >= ownAddress &&
                sourceAddress < ownAddress + static_cast<uintptr_t>(d->length);
  uint8_t *aside = nullptr;
  if (inside) {
    aside = static_cast<uint8_t *>(sys::malloc(static_cast<size_t>(newLength)));
    if (!aside) return false;
    memcpy(aside, source, static_cast<size_t>(newLength));
    source = aside;
  }
  if (!reserve(d, length)) {
    free(aside);
    return false;
  }
  if (length > 0) {  // otherwise there is nothing to move and bytes may be NULL
    uint8_t *at = d->bytes + range.location;
    if (tail > 0 && newLength != range.length) memmove(at + newLength, at + range.length, static_cast<size_t>(tail));
    if (newLength > 0) memcpy(at, source, static_cast<size_t>(newLength));
  }
  d->length = length;
  free(aside);
  return true;
}

}  // extern "C"
