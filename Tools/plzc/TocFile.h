// Reading a table-of-contents file: records back to back, each the file's path and a 0 byte,
// an entry count N >= 1 (u32, little-endian), then N entries: attribute name and a 0 byte
// (at most 499 name bytes), value length L >= 1 (u32, little-endian), L value bytes.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace plzc {

struct TocEntry {
  std::string name;
  size_t valueOffset = 0;  // where the value starts in the file
  uint32_t length = 0;
};

struct TocRecord {
  size_t offset = 0;  // where the record starts in the file
  std::string path;
  std::vector<TocEntry> entries;
};

struct TocError {
  size_t offset = 0;  // where the fault is
  std::string reason;
};

// Parses a whole table of contents. True with every record; false with the first fault and no
// records. An empty input holds no record and is valid.
bool parseToc(const std::vector<uint8_t> &bytes, std::vector<TocRecord> *records, TocError *error);

// Reads a whole file; false with errno.
bool readWholeFile(const std::string &path, std::vector<uint8_t> *bytes);

}  // namespace plzc
