// How a file is stored: plain, or compressed with a type and the bytes its compressed form
// takes. Read straight from the file's flags and attributes, without messages, so that worker
// threads can ask after each file.
#pragma once

#include <cstdint>

namespace plzc {

struct StoredForm {
  bool compressed = false;   // carries the compressed flag and a valid header
  uint32_t type = 0;         // the header's type; 0 when plain
  uint64_t logicalSize = 0;  // the data every reader sees
  // Bytes the data takes: the header attribute for type 3, the resource fork for type 4 (as the
  // compression query counts them), the data fork's size for a plain file.
  uint64_t storedSize = 0;
};

// Fills *form for the file at path; false with errno when the file cannot be examined, or with
// EINVAL when it carries the compressed flag without a valid header.
bool readStoredForm(const char *path, StoredForm *form);

}  // namespace plzc
