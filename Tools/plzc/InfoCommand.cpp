// plzc info: how files are stored, and sums over trees.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <functional>
#include <sstream>
#include <string>

#include "Cli.h"
#include "Console.h"
#include "FileWalk.h"
#include "Plenzo.h"
#include "StderrCapture.h"
#include "Totals.h"

namespace plzc {

namespace {

const option kOptions[] = {
    {"recursive", no_argument, nullptr, 'r'},
    {"verbose", no_argument, nullptr, 'v'},
    {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

void printHelp() {
  printf(
      "Usage: plzc info [OPTION]... PATH...\n"
      "Show how each file is stored: its compression type (- for a plain file), its logical size,\n"
      "the bytes it takes (the header attribute for type 3, the resource fork for type 4, the data\n"
      "for a plain file) and the ratio of the two. With -r a directory is summed up: files,\n"
      "compressed files by type, logical and stored bytes, savings.\n"
      "\n"
      "  -r, --recursive  sum up the trees named (a directory is refused without it)\n"
      "  -v, --verbose    with -r, also list every file of the trees\n"
      "  -h, --help       show this help and exit\n"
      "\n"
      "Exit status: 0 when every file could be examined, 1 otherwise, 2 on a usage error.\n");
}

// On Linux a compressed file's data fork is empty, so the library's comparison of the header's
// size with the data fork's always fails for it; that one line is not news to the user.
const char kEmptyForkMismatch[] = "as reported by stat did not match size in disk header";

struct FileInfo {
  bool ok = false;
  CompressionInfo info{};
  bool sizeKnown = true;  // type 5 data is served by a process; its stored size is unknown
};

FileInfo examine(const std::string &path) {
  FileInfo result;
  struct stat st;
  bool dataForkEmpty = ::stat(path.c_str(), &st) == 0 && st.st_size == 0;
  int error = 0;
  std::string messages = captureStderr([&] {
    errno = 0;
    result.ok = queryCompressionInfo(path.c_str(), &result.info) == 0;
    error = errno;
  });
  std::istringstream lines(messages);
  std::string line, passOn;
  while (std::getline(lines, line)) {
    bool expected = dataForkEmpty && result.info.compressionType != 0 && line.find(kEmptyForkMismatch) != std::string::npos;
    if (!expected) passOn += line + "\n";
  }
  reportText(passOn);
  if (!result.ok) report("%s: cannot be examined: %s\n", path.c_str(), error ? strerror(error) : "invalid compression header");
  result.sizeKnown = result.info.compressionType != 5;
  return result;
}

uint64_t storedSize(const FileInfo &file) {
  return file.info.compressionType == 0 ? file.info.uncompressedSize : file.info.compressedSize;
}

void printHeader(Console &console) { console.out("%-5s %14s %14s %7s  %s\n", "type", "logical", "stored", "ratio", "path"); }

void printRow(Console &console, const std::string &path, const FileInfo &file) {
  std::string type = file.info.compressionType ? std::to_string(file.info.compressionType) : "-";
  std::string stored = file.sizeKnown ? std::to_string(storedSize(file)) : "?";
  char ratio[16] = "-";
  if (file.sizeKnown && file.info.uncompressedSize)
    snprintf(ratio, sizeof ratio, "%.3f",
             static_cast<double>(storedSize(file)) / static_cast<double>(file.info.uncompressedSize));
  console.out("%-5s %14llu %14s %7s  %s\n", type.c_str(), static_cast<unsigned long long>(file.info.uncompressedSize),
              stored.c_str(), ratio, visibleText(path).c_str());
}

void addTo(Totals &totals, const FileInfo &file) {
  totals.files++;
  if (file.info.compressionType) {
    totals.compressed++;
    totals.byType[file.info.compressionType < kTypeSlots ? file.info.compressionType : kTypeSlots - 1]++;
  } else if (file.info.uncompressedSize == 0) {
    totals.empty++;
  } else {
    totals.leftPlain++;
  }
  if (!file.sizeKnown) return;
  totals.logicalBytes += file.info.uncompressedSize;
  totals.storedBytes += storedSize(file);
}

}  // namespace

int infoCommand(int argc, char **argv) {
  const char *command = "info";
  bool recursive = false, verbose = false;
  for (int c; (c = nextOption(command, argc, argv, "rvh", kOptions)) != -1;) {
    switch (c) {
      case 'r': recursive = true; break;
      case 'v': verbose = true; break;
      case 'h': printHelp(); return kExitSuccess;
      default: return kExitUsage;
    }
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.empty()) return usageError(command, "missing PATH");

  Console console(verbose, false);
  bool headerShown = false, anyOutput = false;
  auto header = [&] {
    if (!headerShown) printHeader(console);
    headerShown = anyOutput = true;
  };
  int failures = 0;
  for (const std::string &path : paths) {
    struct stat st;
    bool isTree = ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) && recursive;
    if (!isTree) {
      // A file, or an argument the walk reports on (missing, a directory without -r).
      WalkOptions single;
      single.recurse = false;
      single.directoryHint = "is a directory (-r sums up a tree)";
      WalkResult walked = forEachFile({path}, single, 1, [&](const WalkedFile &file) {
        FileInfo info = examine(file.path);
        if (!info.ok) {
          failures++;
          return;
        }
        header();
        printRow(console, file.path, info);
      });
      failures += walked.failures;
      continue;
    }
    Totals totals;
    WalkResult walked = forEachFile({path}, WalkOptions{}, 1, [&](const WalkedFile &file) {
      FileInfo info = examine(file.path);
      if (!info.ok) {
        totals.failed++;
        return;
      }
      addTo(totals, info);
      if (verbose) {
        header();
        printRow(console, file.path, info);
      }
    });
    totals.failed += static_cast<uint64_t>(walked.failures);
    failures += static_cast<int>(totals.failed);
    console.out("%stree        %s\n%s", anyOutput ? "\n" : "", visibleText(path).c_str(), formatTotals(totals).c_str());
    anyOutput = true;
    headerShown = false;
  }
  return failures ? kExitFailure : kExitSuccess;
}

}  // namespace plzc
