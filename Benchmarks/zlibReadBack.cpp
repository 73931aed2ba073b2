// zlibReadBack CORPUS TREE: checks that every file of TREE, a copy of CORPUS compressed with
// any engine, decodes to the corpus's bytes with zlib's own inflate and nothing of the
// library's reading code: the header and the resource fork are read as attributes, the chunk
// table is walked here, and each chunk goes to zlib's uncompress (or is taken raw behind the
// stored-chunk marker). Plain files are compared as they are. Prints one line; exit status 0
// when every file matched, 1 otherwise (each difference named), 2 on a usage error.
#include <zlib.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "Common/commonUtils.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"

namespace {

using Bytes = std::vector<uint8_t>;

uint32_t le32(const uint8_t *p) { return p[0] | p[1] << 8 | p[2] << 16 | static_cast<uint32_t>(p[3]) << 24; }
uint64_t le64(const uint8_t *p) { return le32(p) | static_cast<uint64_t>(le32(p + 4)) << 32; }

bool attribute(const std::string &path, const char *name, Bytes *value) {
  ssize_t size = platform::getxattr(path.c_str(), name, nullptr, 0, 0, 0);
  if (size < 0) return false;
  value->resize(static_cast<size_t>(size));
  return platform::getxattr(path.c_str(), name, value->data(), value->size(), 0, 0) == size;
}

// One chunk of at most `limit` logical bytes appended to out; false when zlib refuses it.
bool decodeChunk(const uint8_t *chunk, size_t length, size_t limit, Bytes *out) {
  if (length == 0) return false;
  if (chunk[0] == kStoredChunkMarker) {
    out->insert(out->end(), chunk + 1, chunk + length);
    return true;
  }
  size_t at = out->size();
  out->resize(at + limit);
  uLongf produced = limit;
  if (uncompress(out->data() + at, &produced, chunk, length) != Z_OK) return false;
  out->resize(at + produced);
  return true;
}

// The logical data of a compressed file, decoded by zlib alone; false when it cannot be.
bool decodeWithZlib(const std::string &path, Bytes *out) {
  Bytes header;
  if (!attribute(path, kDecmpfsXattrName, &header) || header.size() < 16 || le32(header.data()) != kDecmpfsMagic)
    return false;
  uint32_t type = le32(header.data() + 4);
  uint64_t size = le64(header.data() + 8);
  if (type == 3) return decodeChunk(header.data() + 16, header.size() - 16, size, out) && out->size() == size;
  if (type != 4) return false;
  Bytes fork;
  if (!attribute(path, kResourceForkXattrName, &fork) || fork.size() < 264) return false;
  uint32_t count = le32(fork.data() + 260);
  if (fork.size() < 264 + 8ull * count) return false;
  for (uint32_t i = 0; i < count; i++) {
    uint64_t offset = 260ull + le32(fork.data() + 264 + 8ull * i), length = le32(fork.data() + 268 + 8ull * i);
    if (offset + length > fork.size() || !decodeChunk(fork.data() + offset, length, 65536, out)) return false;
  }
  return out->size() == size;
}

Bytes readPlain(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return Bytes(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

}  // namespace

int main(int argc, char **argv) {
  if (argc != 3) {
    fprintf(stderr, "usage: zlibReadBack CORPUS TREE\n");
    return 2;
  }
  namespace fs = std::filesystem;
  const fs::path corpus = argv[1], tree = argv[2];
  uint64_t files = 0, compressed = 0, bytes = 0, wrong = 0;
  std::error_code error;
  for (const fs::directory_entry &entry : fs::recursive_directory_iterator(corpus, error)) {
    if (!entry.is_regular_file()) continue;
    const std::string copy = (tree / fs::relative(entry.path(), corpus)).string();
    Bytes expected = readPlain(entry.path().string()), got;
    platform::Stat st;
    bool ok = platform::stat(copy.c_str(), &st) == 0;
    if (ok && (st.st_flags & kCompressedFlag)) {
      compressed++;
      ok = decodeWithZlib(copy, &got);
    } else if (ok) {
      got = readPlain(copy);
    }
    if (!ok || got != expected) {
      wrong++;
      fprintf(stderr, "zlibReadBack: %s: %s\n", copy.c_str(), ok ? "differs from the corpus" : "cannot be decoded");
    }
    files++;
    bytes += expected.size();
  }
  if (error) {
    fprintf(stderr, "zlibReadBack: %s: %s\n", corpus.c_str(), error.message().c_str());
    return 1;
  }
  printf("zlib's inflate read %llu files (%llu compressed, %llu bytes): %s\n", static_cast<unsigned long long>(files),
         static_cast<unsigned long long>(compressed), static_cast<unsigned long long>(bytes),
         wrong ? "DIFFERENCES" : "identical to the corpus");
  return wrong ? 1 : 0;
}
