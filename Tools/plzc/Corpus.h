// A deterministic mixed tree of files to compress: source code, logs, prose, binary tables,
// already-compressed (random) data; tiny, medium and large files; empty files, hard links and a
// symbolic link, laid out like a small project.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace plzc {

struct CorpusFile {
  std::string path;  // relative to the corpus directory
  uint64_t size = 0;
  uint8_t digest[16] = {};  // MD5 of the data written
  bool hardLink = false;    // a second name of a file listed before it
};

struct CorpusStats {
  uint64_t files = 0;  // distinct files (inodes)
  uint64_t paths = 0;  // names of regular files, hard links included
  uint64_t bytes = 0;  // data of the distinct files
};

// Writes the corpus into dir (which must exist and be empty) from seed, about totalBytes in
// all, and lists every regular file's path with its digest. False with a message in *error.
bool generateCorpus(const std::string &dir, uint64_t totalBytes, uint64_t seed, std::vector<CorpusFile> *files,
                    CorpusStats *stats, std::string *error);

}  // namespace plzc
