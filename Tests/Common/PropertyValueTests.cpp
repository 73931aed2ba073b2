#include "PropertyValue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Common/PropertyValueObjects.h"

using pv::Owned;

namespace {

Owned<PVStringRef> string(const char *text) {
  Owned<PVStringRef> value(PVStringCreateWithCString(text, kPVStringEncodingUTF8));
  EXPECT_TRUE(value) << text;
  return value;
}

Owned<PVStringRef> bytesString(const std::string &bytes, PVStringEncoding encoding = kPVStringEncodingUTF8) {
  return Owned<PVStringRef>(PVStringCreateWithBytes(bytes.data(), static_cast<PVIndex>(bytes.size()), encoding));
}

Owned<PVNumberRef> int64Number(int64_t value) { return Owned<PVNumberRef>(PVNumberCreateInt64(value)); }

std::string text(PVRef string) {
  const char *bytes = PVStringGetCStringPtr(static_cast<PVStringRef>(string), kPVStringEncodingUTF8);
  return bytes ? bytes : "<not a plain string>";
}

std::string describe(PVRef value) {
  char *description = PVCopyDescriptionCString(value);
  std::string result = description ? description : "<failed>";
  free(description);
  return result;
}

std::string bytesOf(PVDataRef data) {
  const uint8_t *bytes = PVDataGetBytePtr(data);
  return bytes ? std::string(reinterpret_cast<const char *>(bytes), static_cast<size_t>(PVDataGetLength(data))) : "";
}

std::vector<std::string> keysInOrder(PVDictionaryRef dictionary) {
  std::vector<PVRef> keys(static_cast<size_t>(PVDictionaryGetCount(dictionary)));
  PVDictionaryGetKeysAndValues(dictionary, keys.data(), nullptr);
  std::vector<std::string> names;
  for (PVRef key : keys) names.push_back(text(key));
  return names;
}

// ---- Reference counts and lifetimes -------------------------------------------------------

TEST(PropertyValueLifetime, RetainAndReleaseCountReferences) {
  PVStringRef value = PVStringCreateWithCString("x", kPVStringEncodingUTF8);
  EXPECT_EQ(PVGetRetainCount(value), 1);
  EXPECT_EQ(PVRetain(value), value);
  EXPECT_EQ(PVGetRetainCount(value), 2);
  PVRelease(value);
  EXPECT_EQ(PVGetRetainCount(value), 1);
  PVRelease(value);  // frees; ASan reports a leak or a double free otherwise
  EXPECT_EQ(PVRetain(nullptr), nullptr);
  PVRelease(nullptr);
  EXPECT_EQ(PVGetType(nullptr), kPVTypeNone);
}

constinit PVString kConstantKey = PVString::constant("CompressionLevel");

TEST(PropertyValueLifetime, ConstantsAreNeverFreedAndBehaveAsValues) {
  for (PVRef constant : {PVRef(kPVBooleanTrue), PVRef(kPVBooleanFalse), PVRef(&kConstantKey)}) {
    for (int i = 0; i < 3; i++) PVRelease(constant);
    PVRetain(constant);
    EXPECT_EQ(PVGetRetainCount(constant), PV_CONSTANT_RETAIN_COUNT);
  }
  EXPECT_TRUE(PVBooleanGetValue(kPVBooleanTrue));
  EXPECT_FALSE(PVBooleanGetValue(kPVBooleanFalse));
  auto created = string("CompressionLevel");
  EXPECT_TRUE(PVEqual(&kConstantKey, created.get()));
  EXPECT_EQ(PVHash(&kConstantKey), PVHash(created.get()));
  Owned<PVMutableDictionaryRef> options(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  Owned<PVNumberRef> level(PVNumberCreateInt32(9));
  ASSERT_TRUE(PVDictionarySetValue(options.get(), created.get(), level.get()));
  EXPECT_EQ(PVDictionaryGetValue(options.get(), &kConstantKey), level.get());
}

TEST(PropertyValueLifetime, RetainedDictionaryReleasesKeysAndValuesWhenFreed) {
  auto key = string("com.tavix.decmpfs");
  Owned<PVMutableDataRef> value(PVDataCreateMutable(0));
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  ASSERT_TRUE(PVDictionarySetValue(dictionary, key.get(), value.get()));
  EXPECT_EQ(PVGetRetainCount(key.get()), 2);
  EXPECT_EQ(PVGetRetainCount(value.get()), 2);
  PVRelease(dictionary);
  EXPECT_EQ(PVGetRetainCount(key.get()), 1);
  EXPECT_EQ(PVGetRetainCount(value.get()), 1);
}

TEST(PropertyValueLifetime, PlainDictionaryStoresPointersWithoutTouchingThem) {
  // The enumerators' visited set: inode numbers to malloc'd paths the owner frees itself.
  PVMutableDictionaryRef visited = PVDictionaryCreateMutable(0, kPVDictionaryPlainValues);
  for (int64_t inode : {12, 7, 99}) {
    auto key = int64Number(inode);
    ASSERT_TRUE(PVDictionarySetValue(visited, key.get(), strdup(("/path/" + std::to_string(inode)).c_str())));
  }
  auto seven = int64Number(7);
  EXPECT_STREQ(static_cast<const char *>(PVDictionaryGetValue(visited, seven.get())), "/path/7");

  // A property value stored as a plain value is not retained or released.
  auto borrowed = string("borrowed");
  auto key = string("k");
  ASSERT_TRUE(PVDictionarySetValue(visited, key.get(), borrowed.get()));
  EXPECT_EQ(PVGetRetainCount(borrowed.get()), 1);
  ASSERT_TRUE(PVDictionaryRemoveValue(visited, key.get()));
  EXPECT_EQ(PVGetRetainCount(borrowed.get()), 1);

  // Integers and NULL are values too.
  auto zero = string("zero");
  ASSERT_TRUE(PVDictionarySetValue(visited, zero.get(), nullptr));
  const void *found = &found;
  EXPECT_TRUE(PVDictionaryGetValueIfPresent(visited, zero.get(), &found));
  EXPECT_EQ(found, nullptr);
  EXPECT_EQ(PVDictionaryGetValueMode(visited), kPVDictionaryPlainValues);
  PVDictionaryApply(
      visited, [](PVRef, const void *path, void *) { free(const_cast<void *>(path)); }, nullptr);
  PVRelease(visited);
  EXPECT_EQ(PVGetRetainCount(borrowed.get()), 1);
}

TEST(PropertyValueLifetime, ReplacingAValueReleasesTheOldOneAndKeepsTheFirstKey) {
  auto firstKey = string("name");
  auto secondKey = string("name");
  auto oldValue = int64Number(1), newValue = int64Number(2);
  Owned<PVMutableDictionaryRef> dictionary(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), firstKey.get(), oldValue.get()));
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), secondKey.get(), newValue.get()));
  EXPECT_EQ(PVGetRetainCount(oldValue.get()), 1);
  EXPECT_EQ(PVGetRetainCount(newValue.get()), 2);
  EXPECT_EQ(PVGetRetainCount(firstKey.get()), 2);
  EXPECT_EQ(PVGetRetainCount(secondKey.get()), 1);
  EXPECT_EQ(PVDictionaryGetCount(dictionary.get()), 1);

  // Setting the value it already holds, whose only other owner is gone, must not free it.
  PVRef held = PVDictionaryGetValue(dictionary.get(), firstKey.get());
  newValue.reset();
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), firstKey.get(), held));
  EXPECT_EQ(PVGetRetainCount(held), 1);
  EXPECT_EQ(describe(dictionary.get()), "{\"name\": 2}");
}

TEST(PropertyValueLifetime, RemovingWithTheStoredKeyItselfIsSafe) {
  Owned<PVMutableDictionaryRef> dictionary(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  {
    auto key = string("only the dictionary holds me");
    ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), key.get(), kPVBooleanTrue));
  }
  PVRef storedKey = nullptr;
  PVDictionaryGetKeysAndValues(dictionary.get(), &storedKey, nullptr);
  EXPECT_TRUE(PVDictionaryRemoveValue(dictionary.get(), storedKey));
  EXPECT_EQ(PVDictionaryGetCount(dictionary.get()), 0);
}

TEST(PropertyValueLifetime, ArraysRetainElementsAndReleaseThemOnRemoveReplaceAndFree) {
  auto a = string("a"), b = string("b");
  PVMutableArrayRef array = PVArrayCreateMutable(0);
  ASSERT_TRUE(PVArrayAppendValue(array, a.get()));
  ASSERT_TRUE(PVArrayAppendValue(array, a.get()));
  EXPECT_EQ(PVGetRetainCount(a.get()), 3);
  ASSERT_TRUE(PVArraySetValueAtIndex(array, 0, b.get()));
  EXPECT_EQ(PVGetRetainCount(a.get()), 2);
  ASSERT_TRUE(PVArraySetValueAtIndex(array, 0, PVArrayGetValueAtIndex(array, 0)));
  EXPECT_EQ(PVGetRetainCount(b.get()), 2);
  ASSERT_TRUE(PVArrayRemoveValueAtIndex(array, 1));
  EXPECT_EQ(PVGetRetainCount(a.get()), 1);
  PVRelease(array);
  EXPECT_EQ(PVGetRetainCount(b.get()), 1);
}

TEST(PropertyValueLifetime, ConcurrentRetainAndReleaseKeepTheCountExact) {
  constexpr int kThreads = 6, kRounds = 200000;
  auto shared = string("shared");
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++)
    threads.emplace_back([&] {
      for (int i = 0; i < kRounds; i++) {
        PVRetain(shared.get());
        PVRetain(shared.get());
        PVRelease(shared.get());
        PVRelease(shared.get());
      }
    });
  for (auto &thread : threads) thread.join();
  EXPECT_EQ(PVGetRetainCount(shared.get()), 1);
}

TEST(PropertyValueLifetime, TheLastOfSeveralThreadsFreesASharedDictionary) {
  // Each thread owns one reference and drops it; whichever drops last frees the dictionary,
  // which gives back its reference on the watched value (ASan also checks the free itself).
  auto watched = string("watched");
  for (int round = 0; round < 50; round++) {
    PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
    for (int i = 0; i < 20; i++) {
      auto key = int64Number(i);
      ASSERT_TRUE(PVDictionarySetValue(dictionary, key.get(), watched.get()));
    }
    ASSERT_EQ(PVGetRetainCount(watched.get()), 21);
    constexpr int kThreads = 4;
    for (int t = 1; t < kThreads; t++) PVRetain(dictionary);
    std::atomic<int> lookupsFound{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; t++)
      threads.emplace_back([dictionary, &lookupsFound] {
        auto key = int64Number(5);
        for (int i = 0; i < 100; i++) {
          PVRef value = PVRetain(PVDictionaryGetValue(dictionary, key.get()));
          lookupsFound += value != nullptr;
          PVRelease(value);
        }
        PVRelease(dictionary);
      });
    for (auto &thread : threads) thread.join();
    EXPECT_EQ(lookupsFound, kThreads * 100);
    EXPECT_EQ(PVGetRetainCount(watched.get()), 1);
  }
}

// ---- Dictionaries -------------------------------------------------------------------------

TEST(PropertyValueDictionary, IterationFollowsInsertionOrderThroughReplaceAndRemove) {
  Owned<PVMutableDictionaryRef> dictionary(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  for (const char *name : {"c", "a", "b", "d"}) {
    auto key = string(name);
    ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), key.get(), key.get()));
  }
  auto a = string("a"), c = string("c");
  auto replacement = int64Number(1);
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), a.get(), replacement.get()));
  EXPECT_EQ(keysInOrder(dictionary.get()), (std::vector<std::string>{"c", "a", "b", "d"}));
  ASSERT_TRUE(PVDictionaryRemoveValue(dictionary.get(), c.get()));
  EXPECT_FALSE(PVDictionaryRemoveValue(dictionary.get(), c.get()));
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), c.get(), c.get()));
  EXPECT_EQ(keysInOrder(dictionary.get()), (std::vector<std::string>{"a", "b", "d", "c"}));

  std::vector<std::string> applied;
  PVDictionaryApply(
      dictionary.get(),
      [](PVRef key, const void *, void *context) {
        static_cast<std::vector<std::string> *>(context)->push_back(text(key));
      },
      &applied);
  EXPECT_EQ(applied, keysInOrder(dictionary.get()));
}

TEST(PropertyValueDictionary, RandomOperationsMatchAnOrderedModel) {
  // Many inserts, replacements and removals over a small key space push the table through
  // growth, hole compaction and probing across deleted slots.
  std::mt19937 random(1234);
  std::vector<std::pair<int64_t, int64_t>> model;  // in insertion order
  Owned<PVMutableDictionaryRef> dictionary(PVDictionaryCreateMutable(0, kPVDictionaryPlainValues));
  for (int step = 0; step < 20000; step++) {
    int64_t k = random() % 300;
    auto key = int64Number(k);
    auto at = std::find_if(model.begin(), model.end(), [k](auto &entry) { return entry.first == k; });
    if (random() % 3 == 0) {
      EXPECT_EQ(PVDictionaryRemoveValue(dictionary.get(), key.get()), at != model.end());
      if (at != model.end()) model.erase(at);
    } else {
      int64_t v = step;
      ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), key.get(), reinterpret_cast<const void *>(v)));
      if (at != model.end())
        at->second = v;
      else
        model.emplace_back(k, v);
    }
    if (step % 1000 != 999) continue;
    ASSERT_EQ(PVDictionaryGetCount(dictionary.get()), static_cast<PVIndex>(model.size()));
    std::vector<PVRef> keys(model.size());
    std::vector<const void *> values(model.size());
    PVDictionaryGetKeysAndValues(dictionary.get(), keys.data(), values.data());
    for (size_t i = 0; i < model.size(); i++) {
      int64_t storedKey = -1;
      ASSERT_TRUE(PVNumberGetInt64(static_cast<PVNumberRef>(keys[i]), &storedKey));
      ASSERT_EQ(storedKey, model[i].first) << "at " << i;
      ASSERT_EQ(reinterpret_cast<int64_t>(values[i]), model[i].second);
      auto probe = int64Number(model[i].first);
      ASSERT_EQ(PVDictionaryGetValue(dictionary.get(), probe.get()), values[i]);
    }
  }
}

TEST(PropertyValueDictionary, KeysOfAnyKindCompareByContent) {
  Owned<PVMutableDictionaryRef> dictionary(PVDictionaryCreateMutable(4, kPVDictionaryPlainValues));
  // The lock table's 12-byte device-and-inode keys.
  const uint8_t identity[12] = {1, 0, 0, 0, 0x2a, 0, 0, 0, 0, 0, 0, 0};
  Owned<PVDataRef> dataKey(PVDataCreate(identity, sizeof identity));
  Owned<PVDataRef> sameIdentity(PVDataCreate(identity, sizeof identity));
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), dataKey.get(), reinterpret_cast<const void *>(1)));
  EXPECT_EQ(PVDictionaryGetValue(dictionary.get(), sameIdentity.get()), reinterpret_cast<const void *>(1));
  Owned<PVDataRef> otherIdentity(PVDataCreate(identity, 11));
  EXPECT_FALSE(PVDictionaryGetValueIfPresent(dictionary.get(), otherIdentity.get(), nullptr));

  // Numbers are equal by value whatever their type, so they find each other.
  Owned<PVNumberRef> five32(PVNumberCreateInt32(5)), fiveDouble(PVNumberCreateDouble(5.0));
  Owned<PVNumberRef> fiveAndAHalf(PVNumberCreateDouble(5.5));
  auto five64 = int64Number(5);
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), five64.get(), reinterpret_cast<const void *>(2)));
  EXPECT_EQ(PVDictionaryGetValue(dictionary.get(), five32.get()), reinterpret_cast<const void *>(2));
  EXPECT_EQ(PVDictionaryGetValue(dictionary.get(), fiveDouble.get()), reinterpret_cast<const void *>(2));
  EXPECT_EQ(PVDictionaryGetValue(dictionary.get(), fiveAndAHalf.get()), nullptr);

  // Strings: a key made separately from the same UTF-8 bytes.
  auto path = string("/opt/Café/bin");
  ASSERT_TRUE(PVDictionarySetValue(dictionary.get(), path.get(), reinterpret_cast<const void *>(3)));
  auto samePath = string("/opt/Café/bin");
  EXPECT_EQ(PVDictionaryGetValue(dictionary.get(), samePath.get()), reinterpret_cast<const void *>(3));
  auto casedPath = string("/opt/café/bin");
  EXPECT_EQ(PVDictionaryGetValue(dictionary.get(), casedPath.get()), nullptr);
  EXPECT_EQ(PVDictionaryGetCount(dictionary.get()), 3);
}

TEST(PropertyValueDictionary, ImmutableDictionariesAreBuiltOnceAndRefuseChanges) {
  auto a = string("a"), b = string("b");
  auto one = int64Number(1), two = int64Number(2), three = int64Number(3);
  PVRef keys[] = {a.get(), b.get(), a.get()};
  const void *values[] = {one.get(), two.get(), three.get()};
  Owned<PVDictionaryRef> dictionary(PVDictionaryCreate(keys, values, 3, kPVDictionaryRetainedValues));
  ASSERT_TRUE(dictionary);
  EXPECT_EQ(describe(dictionary.get()), "{\"a\": 3, \"b\": 2}");
  EXPECT_EQ(PVGetRetainCount(one.get()), 1);
  auto *cheat = const_cast<PVMutableDictionaryRef>(dictionary.get());
  EXPECT_FALSE(PVDictionarySetValue(cheat, b.get(), one.get()));
  EXPECT_FALSE(PVDictionaryRemoveValue(cheat, a.get()));
  EXPECT_EQ(PVDictionaryGetCount(dictionary.get()), 2);

  const void *withNull[] = {one.get(), nullptr};
  EXPECT_EQ(PVDictionaryCreate(keys, withNull, 2, kPVDictionaryRetainedValues), nullptr);
  Owned<PVDictionaryRef> plain(PVDictionaryCreate(keys, withNull, 2, kPVDictionaryPlainValues));
  EXPECT_EQ(PVDictionaryGetCount(plain.get()), 2);
  EXPECT_EQ(PVGetRetainCount(one.get()), 1);
}

TEST(PropertyValueDictionary, RetainedModeRefusesNullValuesAndKeys) {
  Owned<PVMutableDictionaryRef> dictionary(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  auto key = string("k");
  EXPECT_FALSE(PVDictionarySetValue(dictionary.get(), key.get(), nullptr));
  EXPECT_FALSE(PVDictionarySetValue(dictionary.get(), nullptr, key.get()));
  EXPECT_EQ(PVDictionaryGetCount(dictionary.get()), 0);
}

TEST(PropertyValueDictionary, CopiesAreIndependentAndKeepOrderAndMode) {
  Owned<PVMutableDictionaryRef> original(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  for (const char *name : {"z", "y", "x"}) {
    auto key = string(name);
    Owned<PVMutableDataRef> value(PVDataCreateMutable(0));
    ASSERT_TRUE(PVDataAppendBytes(value.get(), name, 1));
    ASSERT_TRUE(PVDictionarySetValue(original.get(), key.get(), value.get()));
  }
  auto y = string("y");
  PVDictionaryRemoveValue(original.get(), y.get());  // a hole the copy must skip
  Owned<PVMutableDictionaryRef> copy(PVDictionaryCreateMutableCopy(original.get()));
  Owned<PVDictionaryRef> frozen(PVDictionaryCreateCopy(original.get()));
  ASSERT_TRUE(copy && frozen);
  EXPECT_EQ(keysInOrder(copy.get()), (std::vector<std::string>{"z", "x"}));
  EXPECT_TRUE(PVEqual(copy.get(), original.get()));
  EXPECT_TRUE(PVEqual(frozen.get(), original.get()));
  EXPECT_FALSE(PVDictionarySetValue(const_cast<PVMutableDictionaryRef>(frozen.get()), y.get(), y.get()));

  ASSERT_TRUE(PVDictionarySetValue(copy.get(), y.get(), y.get()));
  EXPECT_EQ(PVDictionaryGetCount(original.get()), 2);
  auto z = string("z");
  EXPECT_EQ(PVGetRetainCount(PVDictionaryGetValue(original.get(), z.get())), 3);  // shallow copies

  Owned<PVMutableDictionaryRef> plain(PVDictionaryCreateMutable(0, kPVDictionaryPlainValues));
  Owned<PVDictionaryRef> plainCopy(PVDictionaryCreateCopy(plain.get()));
  EXPECT_EQ(PVDictionaryGetValueMode(plainCopy.get()), kPVDictionaryPlainValues);
}

TEST(PropertyValueDictionary, EqualityIgnoresOrderButNotModeOrValues) {
  auto a = string("a"), b = string("b");
  auto one = int64Number(1);
  Owned<PVNumberRef> oneDouble(PVNumberCreateDouble(1.0));
  PVRef ab[] = {a.get(), b.get()}, ba[] = {b.get(), a.get()};
  const void *values[] = {one.get(), oneDouble.get()}, *swapped[] = {oneDouble.get(), one.get()};
  Owned<PVDictionaryRef> first(PVDictionaryCreate(ab, values, 2, kPVDictionaryRetainedValues));
  Owned<PVDictionaryRef> reordered(PVDictionaryCreate(ba, swapped, 2, kPVDictionaryRetainedValues));
  Owned<PVDictionaryRef> plain(PVDictionaryCreate(ab, values, 2, kPVDictionaryPlainValues));
  Owned<PVDictionaryRef> fewer(PVDictionaryCreate(ab, values, 1, kPVDictionaryRetainedValues));
  const void *different[] = {one.get(), a.get()};
  Owned<PVDictionaryRef> otherValue(PVDictionaryCreate(ab, different, 2, kPVDictionaryRetainedValues));
  EXPECT_TRUE(PVEqual(first.get(), reordered.get()));
  EXPECT_EQ(PVHash(first.get()), PVHash(reordered.get()));
  EXPECT_FALSE(PVEqual(first.get(), plain.get()));
  EXPECT_FALSE(PVEqual(first.get(), fewer.get()));
  EXPECT_FALSE(PVEqual(first.get(), otherValue.get()));
}

// ---- Arrays -------------------------------------------------------------------------------

TEST(PropertyValueArray, InsertRemoveAndBoundsKeepTheOrder) {
  Owned<PVMutableArrayRef> array(PVArrayCreateMutable(2));
  auto a = string("a"), b = string("b"), c = string("c"), d = string("d");
  ASSERT_TRUE(PVArrayAppendValue(array.get(), b.get()));
  ASSERT_TRUE(PVArrayInsertValueAtIndex(array.get(), 0, a.get()));
  ASSERT_TRUE(PVArrayInsertValueAtIndex(array.get(), 2, d.get()));
  ASSERT_TRUE(PVArrayInsertValueAtIndex(array.get(), 2, c.get()));
  EXPECT_EQ(describe(array.get()), "[\"a\", \"b\", \"c\", \"d\"]");
  EXPECT_FALSE(PVArrayInsertValueAtIndex(array.get(), 5, a.get()));
  EXPECT_FALSE(PVArrayInsertValueAtIndex(array.get(), -1, a.get()));
  EXPECT_FALSE(PVArraySetValueAtIndex(array.get(), 4, a.get()));
  EXPECT_FALSE(PVArrayRemoveValueAtIndex(array.get(), 4));
  EXPECT_FALSE(PVArrayAppendValue(array.get(), nullptr));
  EXPECT_EQ(PVArrayGetValueAtIndex(array.get(), 4), nullptr);
  EXPECT_EQ(PVArrayGetValueAtIndex(array.get(), -1), nullptr);
  ASSERT_TRUE(PVArrayRemoveValueAtIndex(array.get(), 1));
  EXPECT_EQ(describe(array.get()), "[\"a\", \"c\", \"d\"]");

  std::string joined;
  PVArrayApply(
      array.get(),
      [](PVRef value, PVIndex index, void *context) {
        *static_cast<std::string *>(context) += std::to_string(index) + text(value);
      },
      &joined);
  EXPECT_EQ(joined, "0a1c2d");
}

TEST(PropertyValueArray, ImmutableArraysAndCopies) {
  auto a = string("a");
  auto one = int64Number(1);
  PVRef elements[] = {a.get(), one.get()};
  Owned<PVArrayRef> array(PVArrayCreate(elements, 2));
  ASSERT_TRUE(array);
  EXPECT_FALSE(PVArrayAppendValue(const_cast<PVMutableArrayRef>(array.get()), a.get()));
  PVRef withNull[] = {a.get(), nullptr};
  EXPECT_EQ(PVArrayCreate(withNull, 2), nullptr);

  Owned<PVMutableArrayRef> copy(PVArrayCreateMutableCopy(array.get()));
  ASSERT_TRUE(PVArrayAppendValue(copy.get(), a.get()));
  EXPECT_EQ(PVArrayGetCount(array.get()), 2);
  EXPECT_EQ(PVArrayGetCount(copy.get()), 3);
  EXPECT_FALSE(PVEqual(array.get(), copy.get()));
  ASSERT_TRUE(PVArrayRemoveValueAtIndex(copy.get(), 2));
  EXPECT_TRUE(PVEqual(array.get(), copy.get()));
  Owned<PVArrayRef> frozen(PVArrayCreateCopy(copy.get()));
  EXPECT_TRUE(PVEqual(frozen.get(), array.get()));
  EXPECT_EQ(PVGetRetainCount(a.get()), 4);  // the caller and three arrays
}

// ---- Data ---------------------------------------------------------------------------------

struct ReplaceCase {
  const char *name;
  PVIndex location, length;
  const char *replacement;
  const char *expected;  // nullptr: refused, data unchanged
};

TEST(PropertyValueData, RangedReplaceSplicesLikeMemmove) {
  const ReplaceCase cases[] = {
      {"insert at start", 0, 0, "XY", "XYabcdef"},
      {"insert in middle", 3, 0, "XY", "abcXYdef"},
      {"empty range at end appends", 6, 0, "XY", "abcdefXY"},
      {"empty range, empty bytes", 2, 0, "", "abcdef"},
      {"same length overwrites", 1, 2, "XY", "aXYdef"},
      {"grow in middle", 1, 1, "WXYZ", "aWXYZcdef"},
      {"shrink in middle", 1, 4, "X", "aXf"},
      {"range at end replaced longer", 4, 2, "WXYZ", "abcdWXYZ"},
      {"delete middle", 2, 2, "", "abef"},
      {"delete all", 0, 6, "", ""},
      {"replace all", 0, 6, "Q", "Q"},
      {"location past end", 7, 0, "X", nullptr},
      {"range past end", 4, 3, "X", nullptr},
      {"negative location", -1, 1, "X", nullptr},
      {"negative length", 2, -1, "X", nullptr},
  };
  for (const ReplaceCase &c : cases) {
    Owned<PVMutableDataRef> data(PVDataCreateMutable(0));
    ASSERT_TRUE(PVDataAppendBytes(data.get(), "abcdef", 6));
    bool done = PVDataReplaceBytes(data.get(), PVRangeMake(c.location, c.length), c.replacement,
                                   static_cast<PVIndex>(strlen(c.replacement)));
    EXPECT_EQ(done, c.expected != nullptr) << c.name;
    EXPECT_EQ(bytesOf(data.get()), c.expected ? c.expected : "abcdef") << c.name;
  }
}

TEST(PropertyValueData, SetLengthZeroFillsWhatItGrowsEvenAfterAShrink) {
  Owned<PVMutableDataRef> data(PVDataCreateMutable(64));
  EXPECT_EQ(PVDataGetLength(data.get()), 0);
  ASSERT_TRUE(PVDataAppendBytes(data.get(), "abcdef", 6));
  ASSERT_TRUE(PVDataSetLength(data.get(), 2));
  EXPECT_EQ(bytesOf(data.get()), "ab");
  ASSERT_TRUE(PVDataSetLength(data.get(), 5));  // within the old bytes: must not resurface them
  EXPECT_EQ(bytesOf(data.get()), std::string("ab\0\0\0", 5));
  ASSERT_TRUE(PVDataSetLength(data.get(), 100000));  // past the capacity
  const uint8_t *bytes = PVDataGetBytePtr(data.get());
  EXPECT_EQ(bytes[0], 'a');
  EXPECT_EQ(std::count(bytes + 2, bytes + 100000, 0), 99998);
  ASSERT_TRUE(PVDataSetLength(data.get(), 0));
  EXPECT_EQ(PVDataGetLength(data.get()), 0);
  EXPECT_FALSE(PVDataSetLength(data.get(), -1));
}

TEST(PropertyValueData, BytesFromInsideTheDataSurviveTheMove) {
  Owned<PVMutableDataRef> data(PVDataCreateMutable(0));
  ASSERT_TRUE(PVDataAppendBytes(data.get(), "0123456789abcdef", 16));
  std::string expected = "0123456789abcdef";
  // Each append doubles the data from its own bytes, forcing reallocations under the source.
  for (int i = 0; i < 6; i++) {
    ASSERT_TRUE(PVDataAppendBytes(data.get(), PVDataGetBytePtr(data.get()), PVDataGetLength(data.get())));
    expected += expected;
  }
  EXPECT_EQ(bytesOf(data.get()), expected);

  Owned<PVMutableDataRef> small(PVDataCreateMutable(0));
  ASSERT_TRUE(PVDataAppendBytes(small.get(), "abcdef", 6));
  ASSERT_TRUE(PVDataReplaceBytes(small.get(), PVRangeMake(0, 2), PVDataGetBytePtr(small.get()) + 2, 4));
  EXPECT_EQ(bytesOf(small.get()), "cdefcdef");
}

TEST(PropertyValueData, ImmutableDataAndCopies) {
  Owned<PVDataRef> data(PVDataCreate("abc", 3));
  auto *cheat = const_cast<PVMutableDataRef>(data.get());
  EXPECT_EQ(PVDataGetMutableBytePtr(cheat), nullptr);
  EXPECT_FALSE(PVDataAppendBytes(cheat, "d", 1));
  EXPECT_FALSE(PVDataSetLength(cheat, 1));
  EXPECT_EQ(bytesOf(data.get()), "abc");

  Owned<PVMutableDataRef> copy(PVDataCreateMutableCopy(data.get()));
  PVDataGetMutableBytePtr(copy.get())[0] = 'X';
  EXPECT_EQ(bytesOf(data.get()), "abc");
  EXPECT_EQ(bytesOf(copy.get()), "Xbc");
  Owned<PVDataRef> frozen(PVDataCreateCopy(copy.get()));
  EXPECT_TRUE(PVEqual(frozen.get(), copy.get()));
  EXPECT_EQ(PVHash(frozen.get()), PVHash(copy.get()));
  Owned<PVDataRef> empty(PVDataCreate(nullptr, 0));
  Owned<PVMutableDataRef> emptyMutable(PVDataCreateMutable(0));
  EXPECT_TRUE(PVEqual(empty.get(), emptyMutable.get()));
  EXPECT_EQ(PVDataCreate(nullptr, 3), nullptr);
}

// ---- Strings ------------------------------------------------------------------------------

struct SearchCase {
  const char *string, *needle;
  bool prefix, suffix;
  PVIndex foundAt;  // -1: absent
};

TEST(PropertyValueString, PrefixSuffixAndFindAreLiteralOverUTF8) {
  const SearchCase cases[] = {
      {"/usr/lib/Café/naïve.txt", "/usr/lib/", true, false, 0},
      {"/usr/lib/Café/naïve.txt", "naïve.txt", false, true, 15},
      {"/usr/lib/Café/naïve.txt", "Café", false, false, 9},
      {"/usr/lib/Café/naïve.txt", "é", false, false, 12},
      {"/usr/lib/Café/naïve.txt", "cafe", false, false, -1},
      {"/usr/lib/Café/naïve.txt", "Cafe\xcc\x81", false, false, -1},  // decomposed é: no normalising
      {"/usr/lib/Café/naïve.txt", "/usr/Lib/", false, false, -1},
      {"abc", "", true, true, 0},
      {"", "", true, true, 0},
      {"ab", "abc", false, false, -1},
      {"日本語", "本", false, false, 3},
      {"日本語", "語", false, true, 6},
  };
  for (const SearchCase &c : cases) {
    auto string = ::string(c.string), needle = ::string(c.needle);
    std::string label = std::string(c.string) + " / " + c.needle;
    EXPECT_EQ(PVStringHasPrefix(string.get(), needle.get()), c.prefix) << label;
    EXPECT_EQ(PVStringHasSuffix(string.get(), needle.get()), c.suffix) << label;
    PVRange found = PVRangeMake(-7, -7);
    EXPECT_EQ(PVStringFind(string.get(), needle.get(), &found), c.foundAt >= 0) << label;
    if (c.foundAt >= 0) {
      EXPECT_EQ(found.location, c.foundAt) << label;
      EXPECT_EQ(found.length, PVStringGetLength(needle.get())) << label;
    }
  }
}

TEST(PropertyValueString, EqualityComparisonAndHashFollowTheBytes) {
  auto cafe = string("café"), cafeAgain = string("café"), cafeDecomposed = string("cafe\xcc\x81");
  EXPECT_TRUE(PVEqual(cafe.get(), cafeAgain.get()));
  EXPECT_EQ(PVHash(cafe.get()), PVHash(cafeAgain.get()));
  EXPECT_FALSE(PVEqual(cafe.get(), cafeDecomposed.get()));
  EXPECT_EQ(PVStringCompare(cafe.get(), cafeAgain.get()), 0);
  const std::pair<const char *, const char *> ascending[] = {
      {"", "a"}, {"a", "ab"}, {"ab", "b"}, {"Z", "a"}, {"z", "é"}, {"é", "日"}, {"\xef\xbf\xbd", "😀"}};
  for (auto [low, high] : ascending) {
    auto a = string(low), b = string(high);
    EXPECT_LT(PVStringCompare(a.get(), b.get()), 0) << low << " < " << high;
    EXPECT_GT(PVStringCompare(b.get(), a.get()), 0) << high << " > " << low;
  }
  auto withNul = bytesString(std::string("a\0b", 3)), justA = string("a");
  ASSERT_TRUE(withNul);
  EXPECT_EQ(PVStringGetLength(withNul.get()), 3);
  EXPECT_FALSE(PVEqual(withNul.get(), justA.get()));
}

TEST(PropertyValueString, OnlyWellFormedTextIsAccepted) {
  const std::pair<std::string, bool> utf8[] = {
      {"plain", true},
      {"\xc3\xa9", true},                 // é
      {"\xf0\x9f\x98\x80", true},         // U+1F600
      {"\xf4\x8f\xbf\xbf", true},         // U+10FFFF
      {"\xed\x9f\xbf", true},             // U+D7FF, just below the surrogates
      {"\xc0\x80", false},                // overlong NUL
      {"\xe0\x80\xaf", false},            // overlong '/'
      {"\xed\xa0\x80", false},            // surrogate U+D800
      {"\xf4\x90\x80\x80", false},        // above U+10FFFF
      {"\xf5\x80\x80\x80", false},
      {"\xe2\x82", false},                // cut short
      {"\x80", false},                    // lone continuation
      {"a\xc3", false},
      {"\xc3\x28", false},                // bad continuation
  };
  for (const auto &[bytes, valid] : utf8) {
    auto string = bytesString(bytes);
    Owned<PVDataRef> raw(PVDataCreate(bytes.data(), static_cast<PVIndex>(bytes.size())));
    EXPECT_EQ(static_cast<bool>(string), valid) << describe(raw.get());
    Owned<PVStringRef> path(PVStringCreateWithFileSystemRepresentation(bytes.c_str()));
    EXPECT_EQ(static_cast<bool>(path), valid);
  }
  EXPECT_TRUE(bytesString("abc", kPVStringEncodingASCII));
  EXPECT_FALSE(bytesString("caf\xc3\xa9", kPVStringEncodingASCII));
  EXPECT_EQ(PVStringCreateWithCString(nullptr, kPVStringEncodingUTF8), nullptr);
  EXPECT_EQ(PVStringCreateWithBytes(nullptr, 2, kPVStringEncodingUTF8), nullptr);
}

TEST(PropertyValueString, CStringsFitOrFailWithAnEmptyBuffer) {
  auto name = string("com.tavix.decmpfs");  // 17 bytes
  char buffer[18];
  EXPECT_TRUE(PVStringGetCString(name.get(), buffer, 18, kPVStringEncodingUTF8));
  EXPECT_STREQ(buffer, "com.tavix.decmpfs");
  EXPECT_FALSE(PVStringGetCString(name.get(), buffer, 17, kPVStringEncodingUTF8));
  EXPECT_STREQ(buffer, "");
  EXPECT_TRUE(PVStringGetCString(name.get(), buffer, 18, kPVStringEncodingASCII));

  auto accented = string("é");
  EXPECT_TRUE(PVStringGetCString(accented.get(), buffer, sizeof buffer, kPVStringEncodingUTF8));
  EXPECT_STREQ(buffer, "é");
  EXPECT_FALSE(PVStringGetCString(accented.get(), buffer, sizeof buffer, kPVStringEncodingASCII));
  EXPECT_STREQ(buffer, "");
  EXPECT_EQ(PVStringGetCStringPtr(accented.get(), kPVStringEncodingASCII), nullptr);
  EXPECT_STREQ(PVStringGetCStringPtr(accented.get(), kPVStringEncodingUTF8), "é");
  EXPECT_EQ(PVStringGetMaximumSizeForEncoding(PVStringGetLength(accented.get()), kPVStringEncodingASCII), 2);

  auto withNul = bytesString(std::string("a\0b", 3));
  EXPECT_FALSE(PVStringGetCString(withNul.get(), buffer, sizeof buffer, kPVStringEncodingUTF8));
  EXPECT_EQ(PVStringGetCStringPtr(withNul.get(), kPVStringEncodingUTF8), nullptr);

  Owned<PVStringRef> path(PVStringCreateWithFileSystemRepresentation("/Volumes/Target/Café"));
  std::vector<char> pathBytes(static_cast<size_t>(PVStringGetMaximumSizeOfFileSystemRepresentation(path.get())));
  auto pathSize = static_cast<PVIndex>(pathBytes.size());
  ASSERT_TRUE(PVStringGetFileSystemRepresentation(path.get(), pathBytes.data(), pathSize));
  EXPECT_STREQ(pathBytes.data(), "/Volumes/Target/Café");
}

// ---- Numbers ------------------------------------------------------------------------------

struct NumberCase {
  const char *name;
  PVNumberRef (*create)();
  PVNumberType type;
  int32_t int32Value;
  bool int32Exact;
  int64_t int64Value;
  bool int64Exact;
  bool doubleExact;
};

constexpr int64_t kInt64Max = std::numeric_limits<int64_t>::max();
constexpr int64_t kInt64Min = std::numeric_limits<int64_t>::min();
constexpr int32_t kInt32Max = std::numeric_limits<int32_t>::max();
constexpr int32_t kInt32Min = std::numeric_limits<int32_t>::min();

TEST(PropertyValueNumber, GettersConvertAndReportExactness) {
  const NumberCase cases[] = {
      {"int32 5", [] { return PVNumberCreateInt32(5); }, kPVNumberInt32Type, 5, true, 5, true, true},
      {"int64 -7", [] { return PVNumberCreateInt64(-7); }, kPVNumberInt64Type, -7, true, -7, true, true},
      {"double 5.0", [] { return PVNumberCreateDouble(5.0); }, kPVNumberDoubleType, 5, true, 5, true, true},
      {"double 5.5", [] { return PVNumberCreateDouble(5.5); }, kPVNumberDoubleType, 5, false, 5, false, true},
      {"double -5.5", [] { return PVNumberCreateDouble(-5.5); }, kPVNumberDoubleType, -5, false, -5, false, true},
      {"int64 2^40", [] { return PVNumberCreateInt64(int64_t(1) << 40); }, kPVNumberInt64Type, kInt32Max, false,
       int64_t(1) << 40, true, true},
      {"int64 -2^40", [] { return PVNumberCreateInt64(-(int64_t(1) << 40)); }, kPVNumberInt64Type, kInt32Min, false,
       -(int64_t(1) << 40), true, true},
      {"int64 2^31", [] { return PVNumberCreateInt64(int64_t(1) << 31); }, kPVNumberInt64Type, kInt32Max, false,
       int64_t(1) << 31, true, true},
      {"int64 max", [] { return PVNumberCreateInt64(kInt64Max); }, kPVNumberInt64Type, kInt32Max, false, kInt64Max,
       true, false},
      {"int64 2^53+1", [] { return PVNumberCreateInt64((int64_t(1) << 53) + 1); }, kPVNumberInt64Type, kInt32Max,
       false, (int64_t(1) << 53) + 1, true, false},
      {"double 2^31-1", [] { return PVNumberCreateDouble(2147483647.0); }, kPVNumberDoubleType, kInt32Max, true,
       kInt32Max, true, true},
      {"double 2^31", [] { return PVNumberCreateDouble(2147483648.0); }, kPVNumberDoubleType, kInt32Max, false,
       int64_t(1) << 31, true, true},
      {"double -2^31", [] { return PVNumberCreateDouble(-2147483648.0); }, kPVNumberDoubleType, kInt32Min, true,
       kInt32Min, true, true},
      {"double -2^31-0.5", [] { return PVNumberCreateDouble(-2147483648.5); }, kPVNumberDoubleType, kInt32Min, false,
       kInt32Min, false, true},
      {"double 2^63", [] { return PVNumberCreateDouble(9223372036854775808.0); }, kPVNumberDoubleType, kInt32Max,
       false, kInt64Max, false, true},
      {"double -2^63", [] { return PVNumberCreateDouble(-9223372036854775808.0); }, kPVNumberDoubleType, kInt32Min,
       false, kInt64Min, true, true},
      {"double 1e300", [] { return PVNumberCreateDouble(1e300); }, kPVNumberDoubleType, kInt32Max, false, kInt64Max,
       false, true},
      {"double -inf", [] { return PVNumberCreateDouble(-INFINITY); }, kPVNumberDoubleType, kInt32Min, false,
       kInt64Min, false, true},
      {"double nan", [] { return PVNumberCreateDouble(NAN); }, kPVNumberDoubleType, 0, false, 0, false, true},
  };
  for (const NumberCase &c : cases) {
    Owned<PVNumberRef> number(c.create());
    ASSERT_TRUE(number) << c.name;
    EXPECT_EQ(PVNumberGetType(number.get()), c.type) << c.name;
    int32_t int32Value = 99;
    int64_t int64Value = 99;
    double doubleValue = 0;
    EXPECT_EQ(PVNumberGetInt32(number.get(), &int32Value), c.int32Exact) << c.name;
    EXPECT_EQ(int32Value, c.int32Value) << c.name;
    EXPECT_EQ(PVNumberGetInt64(number.get(), &int64Value), c.int64Exact) << c.name;
    EXPECT_EQ(int64Value, c.int64Value) << c.name;
    EXPECT_EQ(PVNumberGetDouble(number.get(), &doubleValue), c.doubleExact) << c.name;
  }
}

TEST(PropertyValueNumber, EqualityIsNumericAcrossTypesAndHashesAgree) {
  Owned<PVNumberRef> five32(PVNumberCreateInt32(5)), fiveDouble(PVNumberCreateDouble(5.0));
  Owned<PVNumberRef> fiveHalf(PVNumberCreateDouble(5.5)), negativeZero(PVNumberCreateDouble(-0.0));
  Owned<PVNumberRef> zero(PVNumberCreateInt32(0)), nan1(PVNumberCreateDouble(NAN)), nan2(PVNumberCreateDouble(NAN));
  Owned<PVNumberRef> big(PVNumberCreateInt64(kInt64Max)), bigDouble(PVNumberCreateDouble(9223372036854775808.0));
  auto five64 = int64Number(5);
  EXPECT_TRUE(PVEqual(five32.get(), five64.get()));
  EXPECT_TRUE(PVEqual(five32.get(), fiveDouble.get()));
  EXPECT_EQ(PVHash(five32.get()), PVHash(fiveDouble.get()));
  EXPECT_FALSE(PVEqual(five32.get(), fiveHalf.get()));
  EXPECT_TRUE(PVEqual(zero.get(), negativeZero.get()));
  EXPECT_EQ(PVHash(zero.get()), PVHash(negativeZero.get()));
  EXPECT_TRUE(PVEqual(nan1.get(), nan2.get()));
  EXPECT_EQ(PVHash(nan1.get()), PVHash(nan2.get()));
  EXPECT_FALSE(PVEqual(big.get(), bigDouble.get()));  // 2^63 - 1 is not 2^63
  EXPECT_FALSE(PVEqual(five32.get(), kPVBooleanTrue));
}

// ---- Description and kinds ----------------------------------------------------------------

TEST(PropertyValueDescription, NestedValuesDescribeDeterministically) {
  Owned<PVMutableDictionaryRef> options(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  Owned<PVMutableArrayRef> list(PVArrayCreateMutable(0));
  auto one = int64Number(1);
  Owned<PVNumberRef> half(PVNumberCreateDouble(2.5)), whole(PVNumberCreateDouble(5.0));
  Owned<PVDataRef> bytes(PVDataCreate("\x00\xff", 2));
  Owned<PVMutableDictionaryRef> empty(PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues));
  Owned<PVMutableDictionaryRef> plain(PVDictionaryCreateMutable(0, kPVDictionaryPlainValues));
  auto quoted = string("say \"hi\"\\\n\x01 café");
  for (PVRef element : {PVRef(one.get()), PVRef(half.get()), PVRef(kPVBooleanTrue), PVRef(bytes.get()),
                        PVRef(empty.get())})
    ASSERT_TRUE(PVArrayAppendValue(list.get(), element));
  auto name = string("name"), listKey = string("list"), level = string("level"), table = string("table");
  ASSERT_TRUE(PVDictionarySetValue(plain.get(), level.get(), reinterpret_cast<const void *>(0x1f)));
  ASSERT_TRUE(PVDictionarySetValue(options.get(), name.get(), quoted.get()));
  ASSERT_TRUE(PVDictionarySetValue(options.get(), listKey.get(), list.get()));
  ASSERT_TRUE(PVDictionarySetValue(options.get(), level.get(), whole.get()));
  ASSERT_TRUE(PVDictionarySetValue(options.get(), table.get(), plain.get()));
  const std::string expected =
      "{\"name\": \"say \\\"hi\\\"\\\\\\n\\x01 café\", \"list\": [1, 2.5, true, <00ff>, {}], \"level\": 5.0, "
      "\"table\": {\"level\": 0x1f}}";
  EXPECT_EQ(describe(options.get()), expected);
  Owned<PVStringRef> description(PVCopyDescription(options.get()));
  EXPECT_EQ(text(description.get()), expected);

  std::vector<uint8_t> large(100, 0xab);
  Owned<PVDataRef> largeData(PVDataCreate(large.data(), 100));
  std::string hex;
  for (int i = 0; i < 64; i++) hex += "ab";
  EXPECT_EQ(describe(largeData.get()), "<" + hex + "...> (100 bytes)");
  Owned<PVNumberRef> negative(PVNumberCreateInt32(-40)), tiny(PVNumberCreateDouble(1e-300));
  Owned<PVNumberRef> nan(PVNumberCreateDouble(NAN));
  EXPECT_EQ(describe(negative.get()), "-40");
  EXPECT_EQ(describe(tiny.get()), "1e-300");
  EXPECT_EQ(describe(nan.get()), "nan");
  EXPECT_EQ(describe(kPVBooleanFalse), "false");
  EXPECT_EQ(describe(nullptr), "NULL");
}

TEST(PropertyValueKinds, CallsOnTheWrongKindFailWithoutHarm) {
  auto string = ::string("text");
  Owned<PVMutableArrayRef> array(PVArrayCreateMutable(0));
  PVRef number = PVNumberCreateInt32(3);
  EXPECT_EQ(PVGetType(string.get()), kPVTypeString);
  EXPECT_EQ(PVGetType(array.get()), kPVTypeArray);
  EXPECT_EQ(PVGetType(number), kPVTypeNumber);
  EXPECT_EQ(PVGetType(kPVBooleanTrue), kPVTypeBoolean);
  EXPECT_EQ(PVStringGetLength(static_cast<PVStringRef>(number)), 0);
  EXPECT_FALSE(PVStringHasPrefix(static_cast<PVStringRef>(number), string.get()));
  EXPECT_EQ(PVDataGetBytePtr(reinterpret_cast<PVDataRef>(string.get())), nullptr);
  EXPECT_FALSE(PVDataSetLength(reinterpret_cast<PVMutableDataRef>(array.get()), 4));
  EXPECT_FALSE(PVArrayAppendValue(reinterpret_cast<PVMutableArrayRef>(const_cast<PVString *>(string.get())), number));
  EXPECT_EQ(PVDictionaryGetValue(reinterpret_cast<PVDictionaryRef>(array.get()), string.get()), nullptr);
  int32_t value = 7;
  EXPECT_FALSE(PVNumberGetInt32(reinterpret_cast<PVNumberRef>(string.get()), &value));
  EXPECT_EQ(value, 7);
  EXPECT_FALSE(PVBooleanGetValue(reinterpret_cast<PVBooleanRef>(number)));
  EXPECT_FALSE(PVEqual(string.get(), number));
  EXPECT_EQ(PVGetRetainCount(number), 1);
  PVRelease(number);
}

}  // namespace
