// Descriptions: one deterministic line per value, nested for containers (see PropertyValue.h).
#include <charconv>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Common/PropertyValueObjects.h"
#include "PropertyValue.h"

namespace {

constexpr PVIndex kDataBytesShown = 64;

void describeString(const PVString *string, std::string &out) {
  out += '"';
  for (PVIndex i = 0; i < string->length; i++) {
    auto byte = static_cast<unsigned char>(string->bytes[i]);
    switch (byte) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\t': out += "\\t"; break;
      case '\r': out += "\\r"; break;
      default:
        if (byte < 0x20 || byte == 0x7f) {
          char escaped[8];
          snprintf(escaped, sizeof escaped, "\\x%02x", byte);
          out += escaped;
        } else {
          out += static_cast<char>(byte);  // UTF-8 passes through whole
        }
    }
  }
  out += '"';
}

void describeNumber(const PVNumber *number, std::string &out) {
  char text[64];
  if (number->numberType != kPVNumberDoubleType) {
    snprintf(text, sizeof text, "%" PRId64, number->integer);
    out += text;
    return;
  }
  double d = number->real;
  if (std::isnan(d)) {
    out += "nan";
    return;
  }
  if (std::isinf(d)) {
    out += d < 0 ? "-inf" : "inf";
    return;
  }
  // Shortest text that reads back as the same double; ".0" marks an integral value as floating.
  auto result = std::to_chars(text, text + sizeof text, d);
  std::string_view shown(text, static_cast<size_t>(result.ptr - text));
  out += shown;
  if (shown.find_first_of(".e") == std::string_view::npos) out += ".0";
}

void describeData(const PVData *data, std::string &out) {
  static const char kHex[] = "0123456789abcdef";
  PVIndex shown = data->length < kDataBytesShown ? data->length : kDataBytesShown;
  out += '<';
  for (PVIndex i = 0; i < shown; i++) {
    out += kHex[data->bytes[i] >> 4];
    out += kHex[data->bytes[i] & 0xf];
  }
  if (shown < data->length) {
    char text[48];
    snprintf(text, sizeof text, "...> (%ld bytes)", data->length);
    out += text;
  } else {
    out += '>';
  }
}

void describePointer(const void *pointer, std::string &out) {
  char text[32];
  snprintf(text, sizeof text, "0x%" PRIxPTR, reinterpret_cast<uintptr_t>(pointer));
  out += text;
}

}  // namespace

namespace pv {

void describe(PVRef value, std::string &out) {
  auto *object = static_cast<const PVObject *>(value);
  if (!object) {
    out += "NULL";
    return;
  }
  switch (object->type) {
    case kPVTypeString:
      describeString(static_cast<const PVString *>(object), out);
      return;
    case kPVTypeNumber:
      describeNumber(static_cast<const PVNumber *>(object), out);
      return;
    case kPVTypeBoolean:
      out += static_cast<const PVBoolean *>(object)->value ? "true" : "false";
      return;
    case kPVTypeData:
      describeData(static_cast<const PVData *>(object), out);
      return;
    case kPVTypeArray: {
      out += '[';
      const char *separator = "";
      for (const PVObject *element : static_cast<const PVArray *>(object)->values) {
        out += separator;
        describe(element, out);
        separator = ", ";
      }
      out += ']';
      return;
    }
    case kPVTypeDictionary: {
      auto *dictionary = static_cast<const PVDictionary *>(object);
      out += '{';
      const char *separator = "";
      for (const PVDictionary::Entry &entry : dictionary->entries) {
        if (!entry.key) continue;
        out += separator;
        describe(entry.key, out);
        out += ": ";
        if (dictionary->mode == kPVDictionaryRetainedValues)
          describe(entry.value, out);
        else
          describePointer(entry.value, out);
        separator = ", ";
      }
      out += '}';
      return;
    }
    case kPVTypeNone:
      break;
  }
}

}  // namespace pv

extern "C" {

PVStringRef PVCopyDescription(PVRef value) {
  return pv::noThrow<PVStringRef>(nullptr, [&] {
    std::string text;
    pv::describe(value, text);
    return pv::createStringFromValidUTF8(text.data(), text.size());
  });
}

char *PVCopyDescriptionCString(PVRef value) {
  return pv::noThrow<char *>(nullptr, [&] {
    std::string text;
    pv::describe(value, text);
    return strdup(text.c_str());
  });
}

}  // extern "C"
