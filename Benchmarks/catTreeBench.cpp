// catFile of every file of a tree, in one process: the library's read of a whole tree without
// the cost of starting the processes that plzc cat takes, to set against raw zlib inflate of
// the same data.
//
//   catTreeBench TREE LIST [REPEATS]
//
// LIST holds paths relative to TREE, each ended by a NUL byte (find -print0). Every file is
// read once with catFile untimed (the warm-up), then REPEATS times (default 1) timed, standard
// output on /dev/null meanwhile. Prints the median seconds of the timed passes on standard
// output. Exits 1, naming the file, when catFile fails on one.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "Libraries/CompressData/CompressData.h"

namespace {

[[noreturn]] void fail(const char *what, const char *why) {
  fprintf(stderr, "catTreeBench: %s: %s\n", what, why);
  exit(1);
}

std::vector<std::string> readList(const char *listPath) {
  std::ifstream in(listPath, std::ios::binary);
  if (!in) fail(listPath, strerror(errno));
  std::string all((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  std::vector<std::string> paths;
  for (size_t start = 0, end; start < all.size(); start = end + 1) {
    end = all.find('\0', start);
    if (end == std::string::npos) end = all.size();
    if (end > start) paths.push_back(all.substr(start, end - start));
  }
  if (paths.empty()) fail(listPath, "no paths");
  return paths;
}

// One pass over every file; the seconds it took.
double pass(const std::vector<std::string> &paths) {
  auto start = std::chrono::steady_clock::now();
  for (const std::string &path : paths)
    if (catFileStatus(path.c_str(), 0) != 0) fail(path.c_str(), "catFile failed");
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

}  // namespace

int main(int argc, char **argv) {
  if (argc < 3 || argc > 4) fail("usage", "catTreeBench TREE LIST [REPEATS]");
  int repeats = argc == 4 ? atoi(argv[3]) : 1;
  if (repeats < 1) fail(argv[3], "REPEATS must be at least 1");
  std::vector<std::string> paths = readList(argv[2]);
  if (chdir(argv[1]) != 0) fail(argv[1], strerror(errno));

  int results = dup(1);
  int devNull = open("/dev/null", O_WRONLY);
  if (results < 0 || devNull < 0 || dup2(devNull, 1) < 0) fail("/dev/null", strerror(errno));
  pass(paths);
  std::vector<double> seconds;
  for (int i = 0; i < repeats; i++) seconds.push_back(pass(paths));
  std::sort(seconds.begin(), seconds.end());
  double median = repeats % 2 ? seconds[repeats / 2] : (seconds[repeats / 2 - 1] + seconds[repeats / 2]) / 2;
  dprintf(results, "%.3f\n", median);
  return 0;
}
