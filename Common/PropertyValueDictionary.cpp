// Dictionary values: an insertion-ordered hash table. Entries sit in a vector in the order they
// were added, which is the iteration order; an open-addressing index (linear probing) maps a
// key's hash to its entry. Removal leaves a hole in the vector and a deleted mark in the index,
// both cleared by the next rebuild, so removal stays O(1) and the order never changes.
#include "Common/PropertyValueObjects.h"
#include "PropertyValue.h"

namespace {

using Entry = PVDictionary::Entry;

bool retainsValues(const PVDictionary *d) { return d->mode == kPVDictionaryRetainedValues; }

size_t slotFor(uint64_t hash, size_t slotCount) {
  // hashes are mixed already (PVHash); the low bits are good enough
  return static_cast<size_t>(hash) & (slotCount - 1);
}

// The slot holding key, or -1.
ptrdiff_t findSlot(const PVDictionary *d, PVRef key, uint64_t hash) {
  size_t slotCount = d->slots.size();
  if (slotCount == 0) return -1;
  for (size_t i = slotFor(hash, slotCount), probes = 0; probes < slotCount; i = (i + 1) & (slotCount - 1), probes++) {
    int32_t slot = d->slots[i];
    if (slot == PVDictionary::kEmptySlot) return -1;
    if (slot == PVDictionary::kDeletedSlot) continue;
    const Entry &entry = d->entries[static_cast<size_t>(slot)];
    if (entry.hash == hash && PVEqual(entry.key, key)) return static_cast<ptrdiff_t>(i);
  }
  return -1;
}

// Rebuilds entries without holes and an index with room for `room` live entries at a load of
// at most 3/4. Throws std::bad_alloc with the dictionary unchanged.
void rebuild(PVDictionary *d, size_t room) {
  size_t slotCount = 8;
  while (slotCount * 3 < room * 4) slotCount *= 2;
  std::vector<Entry> entries;
  entries.reserve(room);
  std::vector<int32_t> slots(slotCount, PVDictionary::kEmptySlot);
  for (const Entry &entry : d->entries) {
    if (!entry.key) continue;
    size_t i = slotFor(entry.hash, slotCount);
    while (slots[i] != PVDictionary::kEmptySlot) i = (i + 1) & (slotCount - 1);
    slots[i] = static_cast<int32_t>(entries.size());
    entries.push_back(entry);
  }
  d->entries.swap(entries);
  d->slots.swap(slots);
}

// Adds or replaces an entry; the caller has checked key and value. Throws std::bad_alloc with
// the dictionary unchanged.
void setValue(PVDictionary *d, PVRef key, const void *value) {
  uint64_t hash = PVHash(key);
  ptrdiff_t found = findSlot(d, key, hash);
  if (found >= 0) {
    Entry &entry = d->entries[static_cast<size_t>(d->slots[static_cast<size_t>(found)])];
    if (retainsValues(d)) {
      PVRetain(value);  // before the release: value may be the one it replaces
      PVRelease(std::exchange(entry.value, value));
    } else {
      entry.value = value;
    }
    return;
  }
  // Holes count toward the load, so deleted marks never fill the index. Too many live entries
  // grow the index; mostly holes just compact it.
  if ((d->entries.size() + 1) * 4 > d->slots.size() * 3) {
    size_t live = static_cast<size_t>(d->count) + 1;
    rebuild(d, live * 4 > d->slots.size() * 3 ? live * 2 : live + live / 2 + 1);
  }
  d->entries.push_back(Entry{static_cast<const PVObject *>(key), value, hash});  // last throw
  size_t slotCount = d->slots.size();
  size_t i = slotFor(hash, slotCount);
  while (d->slots[i] >= 0) i = (i + 1) & (slotCount - 1);
  d->slots[i] = static_cast<int32_t>(d->entries.size() - 1);
  PVRetain(key);
  if (retainsValues(d)) PVRetain(value);
  d->count++;
}

PVDictionary *mutableDictionary(PVMutableDictionaryRef dictionary) {
  auto *d = pv::asDictionary(dictionary);
  return d && d->isMutable ? d : nullptr;
}

bool validEntry(const PVDictionary *d, PVRef key, const void *value) {
  return key && (value || !retainsValues(d));
}

// A new dictionary of count entries, entryAt(i, &key, &value) each, already validated.
template <class EntryAt>
PVDictionary *create(PVIndex count, PVIndex capacity, bool isMutable, PVDictionaryValueMode mode, EntryAt entryAt) {
  if (mode != kPVDictionaryRetainedValues && mode != kPVDictionaryPlainValues) return nullptr;
  auto *d = new (std::nothrow) PVDictionary(isMutable, mode);
  if (!d) return nullptr;
  bool built = pv::noThrow(false, [&] {
    PVIndex room = count > capacity ? count : capacity;
    if (room > 0) rebuild(d, static_cast<size_t>(room));
    for (PVIndex i = 0; i < count; i++) {
      PVRef key = nullptr;
      const void *value = nullptr;
      entryAt(i, &key, &value);
      setValue(d, key, value);
    }
    return true;
  });
  if (!built) {
    pv::freeDictionary(d);
    return nullptr;
  }
  return d;
}

PVDictionary *createCopy(PVDictionaryRef dictionary, bool isMutable) {
  auto *source = pv::asDictionary(dictionary);
  if (!source) return nullptr;
  // Copy the live entries in order; a source with holes is walked through them.
  std::vector<const Entry *> live;
  if (!pv::noThrow(false, [&] {
        live.reserve(static_cast<size_t>(source->count));
        for (const Entry &entry : source->entries)
          if (entry.key) live.push_back(&entry);
        return true;
      }))
    return nullptr;
  return create(source->count, 0, isMutable, source->mode, [&](PVIndex i, PVRef *key, const void **value) {
    *key = live[static_cast<size_t>(i)]->key;
    *value = live[static_cast<size_t>(i)]->value;
  });
}

}  // namespace

namespace pv {

void freeDictionary(PVDictionary *dictionary) {
  for (const Entry &entry : dictionary->entries) {
    if (!entry.key) continue;
    PVRelease(entry.key);
    if (retainsValues(dictionary)) PVRelease(entry.value);
  }
  delete dictionary;
}

bool dictionariesEqual(const PVDictionary *a, const PVDictionary *b) {
  if (a->count != b->count || a->mode != b->mode) return false;
  for (const Entry &entry : a->entries) {
    if (!entry.key) continue;
    ptrdiff_t found = findSlot(b, entry.key, entry.hash);
    if (found < 0) return false;
    const void *other = b->entries[static_cast<size_t>(b->slots[static_cast<size_t>(found)])].value;
    if (retainsValues(a) ? !PVEqual(entry.value, other) : entry.value != other) return false;
  }
  return true;
}

}  // namespace pv

extern "C" {

PVDictionaryRef PVDictionaryCreate(const PVRef *keys, const void *const *values, PVIndex count,
                                   PVDictionaryValueMode mode) {
  if (count < 0 || (count > 0 && (!keys || !values))) return nullptr;
  for (PVIndex i = 0; i < count; i++)
    if (!keys[i] || (!values[i] && mode == kPVDictionaryRetainedValues)) return nullptr;
  return create(count, 0, false, mode, [&](PVIndex i, PVRef *key, const void **value) {
    *key = keys[i];
    *value = values[i];
  });
}

PVMutableDictionaryRef PVDictionaryCreateMutable(PVIndex capacity, PVDictionaryValueMode mode) {
  if (capacity < 0) return nullptr;
  return create(0, capacity, true, mode, [](PVIndex, PVRef *, const void **) {});
}

PVDictionaryRef PVDictionaryCreateCopy(PVDictionaryRef dictionary) { return createCopy(dictionary, false); }

PVMutableDictionaryRef PVDictionaryCreateMutableCopy(PVDictionaryRef dictionary) {
  return createCopy(dictionary, true);
}

PVDictionaryValueMode PVDictionaryGetValueMode(PVDictionaryRef dictionary) {
  auto *d = pv::asDictionary(dictionary);
  return d ? d->mode : kPVDictionaryRetainedValues;
}

PVIndex PVDictionaryGetCount(PVDictionaryRef dictionary) {
  auto *d = pv::asDictionary(dictionary);
  return d ? d->count : 0;
}

bool PVDictionaryGetValueIfPresent(PVDictionaryRef dictionary, PVRef key, const void **value) {
  auto *d = pv::asDictionary(dictionary);
  if (!d || !key) return false;
  ptrdiff_t found = findSlot(d, key, PVHash(key));
  if (found < 0) return false;
  if (value) *value = d->entries[static_cast<size_t>(d->slots[static_cast<size_t>(found)])].value;
  return true;
}

const void *PVDictionaryGetValue(PVDictionaryRef dictionary, PVRef key) {
  const void *value = nullptr;
  return PVDictionaryGetValueIfPresent(dictionary, key, &value) ? value : nullptr;
}

bool PVDictionarySetValue(PVMutableDictionaryRef dictionary, PVRef key, const void *value) {
  auto *d = mutableDictionary(dictionary);
  if (!d || !validEntry(d, key, value)) return false;
  return pv::noThrow(false, [&] {
    setValue(d, key, value);
    return true;
  });
}

bool PVDictionaryRemoveValue(PVMutableDictionaryRef dictionary, PVRef key) {
  auto *d = mutableDictionary(dictionary);
  if (!d || !key) return false;
  ptrdiff_t found = findSlot(d, key, PVHash(key));
  if (found < 0) return false;
  auto slot = static_cast<size_t>(found);
  Entry removed = d->entries[static_cast<size_t>(d->slots[slot])];
  d->entries[static_cast<size_t>(d->slots[slot])].key = nullptr;
  d->slots[slot] = PVDictionary::kDeletedSlot;
  d->count--;
  // Released last: a key or value may own the very key the caller passed.
  PVRelease(removed.key);
  if (retainsValues(d)) PVRelease(removed.value);
  return true;
}

void PVDictionaryApply(PVDictionaryRef dictionary, PVDictionaryApplier applier, void *context) {
  auto *d = pv::asDictionary(dictionary);
  if (!d || !applier) return;
  for (const Entry &entry : d->entries)
    if (entry.key) applier(entry.key, entry.value, context);
}

void PVDictionaryGetKeysAndValues(PVDictionaryRef dictionary, PVRef *keys, const void **values) {
  auto *d = pv::asDictionary(dictionary);
  if (!d) return;
  size_t i = 0;
  for (const Entry &entry : d->entries) {
    if (!entry.key) continue;
    if (keys) keys[i] = entry.key;
    if (values) values[i] = entry.value;
    i++;
  }
}

}  // extern "C"
