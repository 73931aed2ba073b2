// Array values: a vector of retained references.
#include "Common/PropertyValueObjects.h"
#include "PropertyValue.h"

namespace {

PVArray *mutableArray(PVMutableArrayRef array) {
  auto *a = pv::asArray(array);
  return a && a->isMutable ? a : nullptr;
}

// Builds an array of count values, valueAt(i) each (none NULL); nullptr when memory runs out.
template <class ValueAt>
PVArray *create(PVIndex count, PVIndex capacity, bool isMutable, ValueAt valueAt) {
  return pv::noThrow<PVArray *>(nullptr, [&] {
    auto *array = new PVArray(isMutable);
    try {
      array->values.reserve(static_cast<size_t>(count > capacity ? count : capacity));
    } catch (...) {
      delete array;
      throw;
    }
    for (PVIndex i = 0; i < count; i++)  // cannot throw after the reserve
      array->values.push_back(static_cast<const PVObject *>(PVRetain(valueAt(i))));
    return array;
  });
}

PVArray *createCopy(PVArrayRef array, bool isMutable) {
  auto *a = pv::asArray(array);
  if (!a) return nullptr;
  return create(static_cast<PVIndex>(a->values.size()), 0, isMutable,
                [a](PVIndex i) { return a->values[static_cast<size_t>(i)]; });
}

}  // namespace

namespace pv {

void freeArray(PVArray *array) {
  for (const PVObject *value : array->values) PVRelease(value);
  delete array;
}

bool arraysEqual(const PVArray *a, const PVArray *b) {
  if (a->values.size() != b->values.size()) return false;
  for (size_t i = 0; i < a->values.size(); i++)
    if (!PVEqual(a->values[i], b->values[i])) return false;
  return true;
}

}  // namespace pv

extern "C" {

PVArrayRef PVArrayCreate(const PVRef *values, PVIndex count) {
  if (count < 0 || (!values && count > 0)) return nullptr;
  for (PVIndex i = 0; i < count; i++)
    if (!values[i]) return nullptr;
  return create(count, 0, false, [values](PVIndex i) { return values[i]; });
}

PVMutableArrayRef PVArrayCreateMutable(PVIndex capacity) {
  if (capacity < 0) return nullptr;
  return create(0, capacity, true, [](PVIndex) { return PVRef(nullptr); });
}

PVArrayRef PVArrayCreateCopy(PVArrayRef array) { return createCopy(array, false); }

PVMutableArrayRef PVArrayCreateMutableCopy(PVArrayRef array) { return createCopy(array, true); }

PVIndex PVArrayGetCount(PVArrayRef array) {
  auto *a = pv::asArray(array);
  return a ? static_cast<PVIndex>(a->values.size()) : 0;
}

PVRef PVArrayGetValueAtIndex(PVArrayRef array, PVIndex index) {
  auto *a = pv::asArray(array);
  if (!a || index < 0 || static_cast<size_t>(index) >= a->values.size()) return nullptr;
  return a->values[static_cast<size_t>(index)];
}

bool PVArrayInsertValueAtIndex(PVMutableArrayRef array, PVIndex index, PVRef value) {
  auto *a = mutableArray(array);
  if (!a || !value || index < 0 || static_cast<size_t>(index) > a->values.size()) return false;
  return pv::noThrow(false, [&] {
    a->values.insert(a->values.begin() + index, static_cast<const PVObject *>(value));
    PVRetain(value);
    return true;
  });
}

bool PVArrayAppendValue(PVMutableArrayRef array, PVRef value) {
  auto *a = mutableArray(array);
  return a && PVArrayInsertValueAtIndex(array, static_cast<PVIndex>(a->values.size()), value);
}

bool PVArraySetValueAtIndex(PVMutableArrayRef array, PVIndex index, PVRef value) {
  auto *a = mutableArray(array);
  if (!a || !value || index < 0 || static_cast<size_t>(index) >= a->values.size()) return false;
  PVRetain(value);  // before the release: value may be the element it replaces
  PVRelease(std::exchange(a->values[static_cast<size_t>(index)], static_cast<const PVObject *>(value)));
  return true;
}

bool PVArrayRemoveValueAtIndex(PVMutableArrayRef array, PVIndex index) {
  auto *a = mutableArray(array);
  if (!a || index < 0 || static_cast<size_t>(index) >= a->values.size()) return false;
  const PVObject *removed = a->values[static_cast<size_t>(index)];
  a->values.erase(a->values.begin() + index);
  PVRelease(removed);
  return true;
}

void PVArrayApply(PVArrayRef array, PVArrayApplier applier, void *context) {
  auto *a = pv::asArray(array);
  if (!a || !applier) return;
  for (size_t i = 0; i < a->values.size(); i++) applier(a->values[i], static_cast<PVIndex>(i), context);
}

}  // extern "C"
