#include "TreeSnapshot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <filesystem>

#include "TestSupport.h"

namespace plzctest {

namespace fs = std::filesystem;

void writeMixedTree(const std::string &root, int files, uint64_t maxBytes, uint32_t seed, int bigFiles,
                    uint64_t bigBytes) {
  fs::create_directories(root);
  uint64_t state = seed * 0x9e3779b97f4a7c15ULL + 1;
  auto next = [&state] {
    state ^= state << 13;
    state ^= state >> 7;
    state ^= state << 17;
    return state;
  };
  for (int i = 0; i < files; i++) {
    std::string directory = root + "/d" + std::to_string(i % 7) + (i % 3 ? "/e" + std::to_string(i % 4) : "");
    fs::create_directories(directory);
    // Sizes spread evenly over the orders of magnitude up to maxBytes.
    double unit = static_cast<double>(next() >> 11) / 9007199254740992.0;
    uint64_t size = static_cast<uint64_t>(std::pow(static_cast<double>(maxBytes), unit));
    std::string name = directory + "/f" + std::to_string(i);
    if (i % 23 == 0) {
      writeFile(name + ".empty", std::string());
    } else if (i % 4 == 0) {
      writeFile(name + ".bin", randomBytes(static_cast<size_t>(size), seed + static_cast<uint32_t>(i)));
    } else {
      writeFile(name + ".txt", compressibleBytes(static_cast<size_t>(size), seed + static_cast<uint32_t>(i)));
    }
  }
  for (int i = 0; i < bigFiles; i++)
    writeFile(root + "/big" + std::to_string(i) + ".txt", compressibleBytes(static_cast<size_t>(bigBytes), seed + 1000 + i));
}

TreeSnapshot snapshotTree(const std::string &root) {
  TreeSnapshot snapshot;
  std::error_code error;
  for (auto it = fs::recursive_directory_iterator(root, error); !error && it != fs::recursive_directory_iterator();
       it.increment(error)) {
    if (!it->is_regular_file(error) || it->is_symlink(error)) continue;
    std::vector<uint8_t> data;
    std::string problems = catFileTo(it->path().string(), [&](const uint8_t *bytes, size_t count) {
      data.insert(data.end(), bytes, bytes + count);
    });
    EXPECT_EQ(problems, "") << it->path();
    snapshot[fs::relative(it->path(), root).string()] = std::move(data);
  }
  EXPECT_FALSE(error) << root << ": " << error.message();
  return snapshot;
}

int expectTreeHolds(const std::string &root, const TreeSnapshot &before, const std::vector<std::string> &spared) {
  TreeSnapshot after = snapshotTree(root);
  int problems = 0;
  for (const auto &[relative, data] : before) {
    bool isSpared = std::any_of(spared.begin(), spared.end(), [&](const std::string &name) {
      return relative == name || relative.rfind(name + "/", 0) == 0;
    });
    if (isSpared) continue;
    auto found = after.find(relative);
    if (found == after.end()) {
      ADD_FAILURE() << root << "/" << relative << ": missing";
      problems++;
    } else if (found->second != data) {
      // Whose data it holds, when it holds another file's: names mixed up, not bytes.
      std::string whose;
      for (const auto &[other, otherData] : before)
        if (other != relative && otherData == found->second) whose = " (the data of " + other + ")";
      ADD_FAILURE() << root << "/" << relative << ": holds " << found->second.size() << " bytes that differ from the "
                    << data.size() << " it held" << whose;
      problems++;
    }
  }
  return problems;
}

}  // namespace plzctest
