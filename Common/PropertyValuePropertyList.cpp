// XML property lists read with libplist and turned into property values.
#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "Common/PropertyValueObjects.h"
#include "Platform/Syscalls.h"
#include "PropertyValue.h"

namespace {

// Nested lists deeper than this are refused rather than risking the stack.
constexpr int kMaxDepth = 512;

PVRef convert(plist_t node, int depth);

PVRef convertArray(plist_t node, int depth) {
  uint32_t count = plist_array_get_size(node);
  PVMutableArrayRef array = PVArrayCreateMutable(static_cast<PVIndex>(count));
  if (!array) return nullptr;
  for (uint32_t i = 0; i < count; i++) {
    PVRef element = convert(plist_array_get_item(node, i), depth + 1);
    bool added = element && PVArrayAppendValue(array, element);
    PVRelease(element);
    if (!added) {
      PVRelease(array);
      return nullptr;
    }
  }
  return array;
}

PVRef convertDictionary(plist_t node, int depth) {
  PVMutableDictionaryRef dictionary = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  if (!dictionary) return nullptr;
  plist_dict_iter iterator = nullptr;
  plist_dict_new_iter(node, &iterator);
  bool ok = iterator != nullptr;
  while (ok) {
    char *name = nullptr;
    plist_t item = nullptr;
    plist_dict_next_item(node, iterator, &name, &item);
    if (!name) break;
    PVStringRef key = PVStringCreateWithCString(name, kPVStringEncodingUTF8);
    free(name);
    PVRef value = convert(item, depth + 1);
    ok = key && value && PVDictionarySetValue(dictionary, key, value);
    PVRelease(key);
    PVRelease(value);
  }
  free(iterator);
  if (!ok) {
    PVRelease(dictionary);
    return nullptr;
  }
  return dictionary;
}

PVRef convert(plist_t node, int depth) {
  if (!node || depth > kMaxDepth) return nullptr;
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t value = 0;
      plist_get_bool_val(node, &value);
      return value ? kPVBooleanTrue : kPVBooleanFalse;
    }
    case PLIST_UINT: {
      // Negative integers come back as their two's-complement bit pattern.
      uint64_t value = 0;
      plist_get_uint_val(node, &value);
      return PVNumberCreateInt64(static_cast<int64_t>(value));
    }
    case PLIST_REAL: {
      double value = 0;
      plist_get_real_val(node, &value);
      return PVNumberCreateDouble(value);
    }
    case PLIST_STRING: {
      // XML cannot carry a NUL character, yet libplist keeps a raw 0 byte of the text inside
      // the string (and its plist_get_string_val asserts on such strings): refuse the list.
      uint64_t length = 0;
      const char *value = plist_get_string_ptr(node, &length);
      if (!value || strlen(value) != length) return nullptr;
      return PVStringCreateWithCString(value, kPVStringEncodingUTF8);
    }
    case PLIST_DATA: {
      char *bytes = nullptr;
      uint64_t length = 0;
      plist_get_data_val(node, &bytes, &length);
      PVRef data = PVDataCreate(bytes, static_cast<PVIndex>(length));
      free(bytes);
      return data;
    }
    case PLIST_ARRAY:
      return convertArray(node, depth);
    case PLIST_DICT:
      return convertDictionary(node, depth);
    default:
      return nullptr;
  }
}

}  // namespace

PVRef PVPropertyListCreateWithXMLData(PVDataRef data) {
  PVIndex length = PVDataGetLength(data);
  if (!data || length <= 0 || length > INT32_MAX) return nullptr;
  std::string_view text(reinterpret_cast<const char *>(PVDataGetBytePtr(data)), static_cast<size_t>(length));
  // Only the XML form is accepted: binary lists and other text are refused before parsing.
  if (text.find("<plist") == std::string_view::npos) return nullptr;
  plist_t root = nullptr;
  plist_from_xml(text.data(), static_cast<uint32_t>(length), &root);
  if (!root) return nullptr;
  PVRef value = convert(root, 0);
  plist_free(root);
  return value;
}

PVDataRef PVDataCreateWithContentsOfFile(const char *path) {
  int fd = sys::open(path, O_RDONLY | O_CLOEXEC, 0);
  if (fd < 0) return nullptr;
  struct stat st;
  if (sys::fstat(fd, &st) != 0) {
    int saved = errno;
    sys::close(fd);
    errno = saved;
    return nullptr;
  }
  PVMutableDataRef data = PVDataCreateMutable(st.st_size > 0 ? st.st_size : 0);
  uint8_t block[65536];
  ssize_t got = 0;
  while (data && (got = sys::read(fd, block, sizeof block)) > 0)
    if (!PVDataAppendBytes(data, block, got)) got = -1, errno = ENOMEM;
  int saved = errno;
  sys::close(fd);
  if (!data || got < 0) {
    PVRelease(data);
    errno = saved;
    return nullptr;
  }
  return data;
}
