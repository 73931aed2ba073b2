// Runs a fuzz target over files, without libFuzzer: the ordinary build's test of each target
// feeds it every regression input and seed this way. Arguments are files or directories (every
// regular file in them, in name order); arguments beginning with '-' are libFuzzer options and
// are ignored, and a directory that does not exist holds nothing.
#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "FuzzSupport.h"

extern "C" __attribute__((weak)) int LLVMFuzzerInitialize(int *argc, char ***argv);

namespace {

bool runFile(const std::filesystem::path &path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    fprintf(stderr, "cannot read %s\n", path.c_str());
    return false;
  }
  std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  // Announced first, so that a crash names its input.
  fprintf(stderr, "running %s (%zu bytes)\n", path.c_str(), bytes.size());
  LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
  return true;
}

}  // namespace

int main(int argc, char **argv) {
  if (LLVMFuzzerInitialize) LLVMFuzzerInitialize(&argc, &argv);
  size_t ran = 0;
  bool ok = true;
  for (int i = 1; i < argc; i++) {
    std::filesystem::path argument = argv[i];
    if (argv[i][0] == '-') continue;
    std::error_code error;
    if (std::filesystem::is_directory(argument, error)) {
      std::vector<std::filesystem::path> files;
      for (const auto &entry : std::filesystem::directory_iterator(argument))
        if (entry.is_regular_file()) files.push_back(entry.path());
      std::sort(files.begin(), files.end());
      for (const auto &file : files) ran += runFile(file) ? 1 : 0;
    } else if (std::filesystem::exists(argument, error)) {
      if (runFile(argument)) {
        ran++;
      } else {
        ok = false;
      }
    }
  }
  fprintf(stderr, "%s: %zu inputs ran\n", argv[0], ran);
  return ok ? 0 : 1;
}
