// plzc repair: finds the files that an interrupted plzc (or any user of the library) left
// half-done, and makes each whole again.
#include <atomic>
#include <cstdio>
#include <cstring>
#include <string>

#include "Cli.h"
#include "Console.h"
#include "FileWalk.h"
#include "Installer.h"
#include "Libraries/CompressData/Repair.h"

namespace plzc {

namespace {

enum LongOnly { kNoProgress = 256 };

const option kOptions[] = {
    {"dry-run", no_argument, nullptr, 'n'},          {"jobs", required_argument, nullptr, 'j'},
    {"verbose", no_argument, nullptr, 'v'},          {"no-progress", no_argument, nullptr, kNoProgress},
    {"help", no_argument, nullptr, 'h'},             {nullptr, 0, nullptr, 0},
};

void printHelp() {
  printf(
      "Usage: plzc repair [OPTION]... PATH...\n"
      "Find the files, among those named and in the trees named, that a compression or\n"
      "decompression interrupted by a crash left half-done, and make each whole again: finish\n"
      "what can be finished, undo what can be undone. A file is changed only when its state\n"
      "proves where its data is (every chunk of a compressed form must decode, with its\n"
      "checksum, to exactly its size); any other file is left as it is and reported.\n"
      "\n"
      "  -n, --dry-run      report what would be done, change nothing\n"
      "  -j, --jobs=N       worker threads (default: one per processor, here %d)\n"
      "  -v, --verbose      also list the files found clean\n"
      "      --no-progress  never draw the progress line (drawn only on a terminal)\n"
      "  -h, --help         show this help and exit\n"
      "\n"
      "Each file found half-done gets one line on standard output: its path, the state found and\n"
      "what was done; a summary follows. Copies left by an interrupted 'plzc install' (named\n"
      "%s...) are reported and left alone: they never were user data. Trees are walked\n"
      "without following symbolic links. Run it while nothing else works on these files.\n"
      "\n"
      "Exit status: 0 when every file is clean or was repaired, 1 when a file was left alone\n"
      "because its state cannot be proven, a repair step failed, or a PATH failed; 2 on a usage\n"
      "error, 130 when interrupted.\n",
      availableProcessors(), kUnfinishedInstallPrefix);
}

struct RepairTotals {
  std::atomic<uint64_t> files{0}, clean{0}, repaired{0}, leftAlone{0}, failed{0}, unfinishedCopies{0};
};

std::string baseName(const std::string &path) {
  size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

void repairOne(const std::string &path, bool dryRun, Console &console, RepairTotals &totals) {
  totals.files++;
  if (baseName(path).compare(0, strlen(kUnfinishedInstallPrefix), kUnfinishedInstallPrefix) == 0) {
    totals.unfinishedCopies++;
    console.out("%s: an unfinished copy of an interrupted plzc install: left alone: not user data; remove it, or "
                "run the install again\n",
                path.c_str());
    return;
  }
  RepairReport report = repairFile(path.c_str(), dryRun);
  switch (report.verdict) {
    case RepairVerdict::Clean:
      totals.clean++;
      if (console.verbose()) console.out("%s: clean\n", path.c_str());
      return;
    case RepairVerdict::Repaired: totals.repaired++; break;
    case RepairVerdict::LeftAlone: totals.leftAlone++; break;
    case RepairVerdict::Failed:
      totals.failed++;
      plzc::report("%s: %s\n", path.c_str(), report.action.c_str());
      break;
  }
  console.out("%s: %s: %s\n", path.c_str(), report.state.c_str(), report.action.c_str());
}

}  // namespace

int repairCommand(int argc, char **argv) {
  const char *command = "repair";
  bool dryRun = false, verbose = false, progressWanted = true;
  int jobs = availableProcessors();
  for (int c; (c = nextOption(command, argc, argv, "nj:vh", kOptions)) != -1;) {
    switch (c) {
      case 'n': dryRun = true; break;
      case 'j':
        if (chooseJobs(command, optarg, &jobs) != kExitSuccess) return kExitUsage;
        break;
      case 'v': verbose = true; break;
      case kNoProgress: progressWanted = false; break;
      case 'h': printHelp(); return kExitSuccess;
      default: return kExitUsage;
    }
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.empty()) return usageError(command, "missing PATH");

  installInterruptHandler();
  Console console(verbose, progressWanted);
  RepairTotals totals;
  double seconds;
  WalkResult walked = walkWithProgress(
      console, "plzc repair", paths, jobs,
      [&](const WalkedFile &file) {
        repairOne(file.path, dryRun, console, totals);
        return file.size;
      },
      &seconds);
  uint64_t failed = totals.failed + static_cast<uint64_t>(walked.failures);
  console.out("plzc repair: %llu files in %.2f s: %llu clean, %llu %s, %llu left alone, %llu failed",
              static_cast<unsigned long long>(totals.files.load()), seconds,
              static_cast<unsigned long long>(totals.clean.load()),
              static_cast<unsigned long long>(totals.repaired.load()), dryRun ? "to repair" : "repaired",
              static_cast<unsigned long long>(totals.leftAlone.load()), static_cast<unsigned long long>(failed));
  if (totals.unfinishedCopies) console.out(", %llu unfinished install copies",
                                           static_cast<unsigned long long>(totals.unfinishedCopies.load()));
  console.out("\n");
  if (walked.interrupted) {
    report("interrupted; the files not reached are unchanged\n");
    return kExitInterrupted;
  }
  return failed || totals.leftAlone || totals.unfinishedCopies ? kExitFailure : kExitSuccess;
}

}  // namespace plzc
