// Trees of test files: a quick deterministic mix to work on, and a record of what every file
// of a tree holds, to prove afterwards that a run lost nothing.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace plzctest {

// Writes `files` files under root (created with its subdirectories): text that compresses,
// incompressible noise and a few empty files, spread over nested directories, with sizes of
// 1 byte to maxBytes; plus `bigFiles` text files of exactly bigBytes. Deterministic per seed.
void writeMixedTree(const std::string &root, int files, uint64_t maxBytes, uint32_t seed, int bigFiles = 0,
                    uint64_t bigBytes = 0);

// Every regular file under root (symbolic links not followed), by path relative to root, with
// the data every reader sees (compressed files decompressed through catFile).
using TreeSnapshot = std::map<std::string, std::vector<uint8_t>>;
TreeSnapshot snapshotTree(const std::string &root);

// Expects root to hold every file of before with the same data, except the relative paths in
// spared (a file, or a directory and all below it); reports each missing or differing file by name. Returns the number of problems.
int expectTreeHolds(const std::string &root, const TreeSnapshot &before, const std::vector<std::string> &spared = {});

}  // namespace plzctest
