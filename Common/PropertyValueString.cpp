// String values: validated UTF-8 with a terminating NUL, so the UTF-8 C string is always at hand.
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "Common/PropertyValueObjects.h"
#include "Platform/Syscalls.h"
#include "PropertyValue.h"

namespace {

// Strict UTF-8 (RFC 3629): no overlong forms, no surrogates, nothing above U+10FFFF.
bool isValidUTF8(const uint8_t *at, size_t length) {
  size_t i = 0;
  while (i < length) {
    uint8_t lead = at[i];
    if (lead < 0x80) {
      i++;
      continue;
    }
    size_t extra;
    uint8_t low = 0x80, high = 0xBF;  // bounds of the first continuation byte
    if (lead >= 0xC2 && lead <= 0xDF) {
      extra = 1;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
      extra = 2;
      if (lead == 0xE0) low = 0xA0;
      if (lead == 0xED) high = 0x9F;
    } else if (lead >= 0xF0 && lead <= 0xF4) {
      extra = 3;
      if (lead == 0xF0) low = 0x90;
      if (lead == 0xF4) high = 0x8F;
    } else {
      return false;
    }
    if (length - i <= extra) return false;
    if (at[i + 1] < low || at[i + 1] > high) return false;
    for (size_t k = 2; k <= extra; k++)
      if ((at[i + k] & 0xC0) != 0x80) return false;
    i += extra + 1;
  }
  return true;
}

std::string_view view(const PVString *string) { return {string->bytes, static_cast<size_t>(string->length)}; }

bool copyOut(const PVString *string, char *buffer, PVIndex bufferSize, bool asciiOnly) {
  if (!buffer || bufferSize <= 0) return false;
  if (!string || string->hasNul || (asciiOnly && !string->isASCII) || string->length >= bufferSize) {
    buffer[0] = '\0';
    return false;
  }
  memcpy(buffer, string->bytes, string->length + 1);
  return true;
}

}  // namespace

namespace pv {

PVStringRef createStringFromValidUTF8(const char *bytes, size_t length) {
  auto *copy = static_cast<char *>(sys::malloc(length + 1));
  if (!copy) return nullptr;
  if (length) memcpy(copy, bytes, length);
  copy[length] = '\0';
  bool isASCII = true, hasNul = false;
  for (size_t i = 0; i < length; i++) {
    auto byte = static_cast<uint8_t>(bytes[i]);
    isASCII &= byte < 0x80;
    hasNul |= byte == 0;
  }
  auto *string = new (std::nothrow) PVString(copy, static_cast<PVIndex>(length), isASCII, hasNul);
  if (!string) free(copy);
  return string;
}

void freeString(PVString *string) {
  free(const_cast<char *>(string->bytes));
  delete string;
}

}  // namespace pv

extern "C" {

PVStringRef PVStringCreateWithBytes(const void *bytes, PVIndex length, PVStringEncoding encoding) {
  if (length < 0 || (!bytes && length > 0)) return nullptr;
  auto *at = static_cast<const uint8_t *>(bytes);
  auto size = static_cast<size_t>(length);
  switch (encoding) {
    case kPVStringEncodingUTF8:
      if (!isValidUTF8(at, size)) return nullptr;
      break;
    case kPVStringEncodingASCII:
      for (size_t i = 0; i < size; i++)
        if (at[i] >= 0x80) return nullptr;
      break;
    default:
      return nullptr;
  }
  return pv::createStringFromValidUTF8(static_cast<const char *>(bytes), size);
}

PVStringRef PVStringCreateWithCString(const char *cString, PVStringEncoding encoding) {
  if (!cString) return nullptr;
  return PVStringCreateWithBytes(cString, static_cast<PVIndex>(strlen(cString)), encoding);
}

PVStringRef PVStringCreateWithFileSystemRepresentation(const char *path) {
  return PVStringCreateWithCString(path, kPVStringEncodingUTF8);
}

PVIndex PVStringGetLength(PVStringRef string) {
  auto *s = pv::asString(string);
  return s ? s->length : 0;
}

PVIndex PVStringGetMaximumSizeForEncoding(PVIndex length, PVStringEncoding encoding) {
  // Lengths are in UTF-8 bytes already; ASCII takes one byte per character, never more.
  if (length < 0) return -1;
  return length;
}

bool PVStringGetCString(PVStringRef string, char *buffer, PVIndex bufferSize, PVStringEncoding encoding) {
  if (encoding != kPVStringEncodingUTF8 && encoding != kPVStringEncodingASCII) {
    if (buffer && bufferSize > 0) buffer[0] = '\0';
    return false;
  }
  return copyOut(pv::asString(string), buffer, bufferSize, encoding == kPVStringEncodingASCII);
}

const char *PVStringGetCStringPtr(PVStringRef string, PVStringEncoding encoding) {
  auto *s = pv::asString(string);
  if (!s || s->hasNul) return nullptr;
  if (encoding == kPVStringEncodingUTF8) return s->bytes;
  if (encoding == kPVStringEncodingASCII && s->isASCII) return s->bytes;
  return nullptr;
}

PVIndex PVStringGetMaximumSizeOfFileSystemRepresentation(PVStringRef string) {
  auto *s = pv::asString(string);
  return s ? s->length + 1 : 0;
}

bool PVStringGetFileSystemRepresentation(PVStringRef string, char *buffer, PVIndex bufferSize) {
  return copyOut(pv::asString(string), buffer, bufferSize, false);
}

// Byte comparisons are exact on valid UTF-8: a valid needle can only match at a character
// boundary, and byte order is code-point order.
bool PVStringHasPrefix(PVStringRef string, PVStringRef prefix) {
  auto *s = pv::asString(string), *p = pv::asString(prefix);
  return s && p && view(s).starts_with(view(p));
}

bool PVStringHasSuffix(PVStringRef string, PVStringRef suffix) {
  auto *s = pv::asString(string), *p = pv::asString(suffix);
  return s && p && view(s).ends_with(view(p));
}

bool PVStringFind(PVStringRef string, PVStringRef needle, PVRange *found) {
  auto *s = pv::asString(string), *n = pv::asString(needle);
  if (!s || !n) return false;
  size_t at = view(s).find(view(n));
  if (at == std::string_view::npos) return false;
  if (found) *found = PVRangeMake(static_cast<PVIndex>(at), n->length);
  return true;
}

int PVStringCompare(PVStringRef a, PVStringRef b) {
  auto *s = pv::asString(a), *t = pv::asString(b);
  if (!s || !t) return (s != nullptr) - (t != nullptr);
  int order = view(s).compare(view(t));
  return (order > 0) - (order < 0);
}

}  // extern "C"
