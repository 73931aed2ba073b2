// plzc install: copies files and trees to a destination as new files, compressed on the way by
// the stream pipeline.
#include <cstdio>
#include <cstring>
#include <string>

#include "Cli.h"
#include "CompressRun.h"
#include "Console.h"
#include "Installer.h"
#include "Progress.h"
#include "QueueOptions.h"

namespace plzc {

namespace {

enum LongOnly { kOptionsFile = 256, kRules, kSkipMachO, kIgnoreXattrErrors, kThrottled, kLargeForks, kNoProgress,
               kEngine, kFast };

const option kOptions[] = {
    {"options", required_argument, nullptr, kOptionsFile},
    {"types", required_argument, nullptr, 't'},
    {"level", required_argument, nullptr, 'l'},
    {"rules", required_argument, nullptr, kRules},
    {"skip-macho", required_argument, nullptr, kSkipMachO},
    {"ignore-xattr-errors", no_argument, nullptr, kIgnoreXattrErrors},
    {"throttled", no_argument, nullptr, kThrottled},
    {"large-forks", no_argument, nullptr, kLargeForks},
    {"jobs", required_argument, nullptr, 'j'},
    {"verbose", no_argument, nullptr, 'v'},
    {"no-progress", no_argument, nullptr, kNoProgress},
    {"engine", required_argument, nullptr, kEngine},
    {"fast", no_argument, nullptr, kFast},
    {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

// The shared help lines, moved to this list's wider column.
std::string indentedEngineHelp(const char *lines) {
  std::string out;
  for (const char *line = lines; *line;) {
    const char *end = strchr(line, '\n');
    std::string text(line, end - line);
    out += text.substr(0, 21) + "      " + text.substr(21) + "\n";
    line = end + 1;
  }
  return out;
}

void printHelp() {
  printf(
      "Usage: plzc install [OPTION]... SRC... DEST\n"
      "Copy files and trees to DEST as new files, compressed on the way by the stream pipeline\n"
      "where its rules allow and the data shrinks. With one SRC and DEST not a directory, SRC is\n"
      "copied as DEST; otherwise each SRC is copied into the directory DEST.\n"
      "\n"
      "      --options=FILE       queue options: an XML property list holding a dictionary of the\n"
      "                           queue's keys (CompressionTypes, CompressionLevel,\n"
      "                           CompressionRules, SkipMachOFileTypes, ...); the options below\n"
      "                           override its keys\n"
      "  -t, --types=LIST         compression types to try, in this order: 3, 4, 3,4 or 4,3\n"
      "                           (default: the library's, type 4)\n"
      "  -l, --level=LEVEL        level, 1 (fastest) to 9 (smallest)\n"
      "%s"
      "%s"
      "      --rules=FILE         an XML property list holding an array of rule dictionaries,\n"
      "                           applied before the system rules\n"
      "      --skip-macho=TYPES   leave Mach-O files of these types uncompressed: names such as\n"
      "                           MH_EXECUTE, numbers 1 to 31, or '*', separated by commas\n"
      "      --ignore-xattr-errors  write the plain data when the compressed form cannot be stored\n"
      "      --throttled          run the work at background I/O and CPU priority\n"
      "      --large-forks        also compress files over 64 MiB, into resource forks over 16 MiB\n"
      "  -j, --jobs=N             threads reading sources into the pipeline (default: one per\n"
      "                           processor, here %d)\n"
      "  -v, --verbose            close with a summary of how the files were stored and of\n"
      "                           the pipeline's work items (queued, started, completed)\n"
      "      --no-progress        never draw the progress line (drawn only on a terminal)\n"
      "  -h, --help               show this help and exit\n"
      "\n"
      "Directories, symbolic links, hard links within the sources, pipes, modes, times, owners (as\n"
      "far as permitted) and extended attributes are kept, as 'cp -a' keeps them; file flags are\n"
      "not copied. Symbolic links among SRC are copied as links, not followed. Compressed sources\n"
      "are read through the library. Files whose names begin with '._' are copied as they are.\n"
      "An existing file at a destination path is replaced by a new file. Each new file is written\n"
      "under a temporary name (%s...) beside its destination and takes its name once it\n"
      "is whole, so an interrupted install leaves no partial file under a destination's name;\n"
      "'plzc repair' lists the temporary files it left.\n"
      "\n"
      "Exit status: 0 when everything was copied, 1 when a file failed or the pipeline's finish\n"
      "failed (the files named in its messages are listed), 2 on a usage error or an unusable\n"
      "--options or --rules file, 130 when interrupted.\n",
      indentedEngineHelp(kEngineHelp).c_str(), indentedEngineHelp(kFastHelp).c_str(), availableProcessors(),
      kUnfinishedInstallPrefix);
}

}  // namespace

int installCommand(int argc, char **argv) {
  const char *command = "install";
  QueueOptionChoices choices;
  int jobs = availableProcessors();
  bool verbose = false, progress = true;
  long number;
  for (int c; (c = nextOption(command, argc, argv, "t:l:j:vh", kOptions)) != -1;) {
    switch (c) {
      case kOptionsFile:
        if (!*optarg) return usageError(command, "--options needs a file name");
        choices.optionsFile = optarg;
        break;
      case 't':
        if (chooseTypes(command, optarg, &choices.types) != kExitSuccess) return kExitUsage;
        break;
      case 'l':
        if (chooseLevel(command, optarg, &choices.level) != kExitSuccess) return kExitUsage;
        break;
      case kRules:
        if (!*optarg) return usageError(command, "--rules needs a file name");
        choices.rulesFile = optarg;
        break;
      case kSkipMachO:
        if (!*optarg) return usageError(command, "--skip-macho needs a list of types");
        choices.skipMachO = optarg;
        break;
      case kIgnoreXattrErrors: choices.ignoreXattrErrors = true; break;
      case kThrottled: choices.throttled = true; break;
      case kLargeForks: choices.largeForks = true; break;
      case 'j':
        if (chooseJobs(command, optarg, &jobs) != kExitSuccess) return kExitUsage;
        break;
      case kEngine:
        if (int status = chooseEngine(command, optarg); status != kExitSuccess) return status;
        break;
      case kFast:
        if (int status = chooseFastEngine(command, &number); status != kExitSuccess) return status;
        choices.level = number;
        break;
      case kNoProgress: progress = false; break;
      case 'v': verbose = true; break;
      case 'h': printHelp(); return kExitSuccess;
      default: return kExitUsage;
    }
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.size() < 2) return usageError(command, paths.empty() ? "missing SRC and DEST" : "missing DEST");
  std::string dest = paths.back();
  paths.pop_back();

  std::string problem;
  PVDictionaryRef options = buildQueueOptions(choices, &problem);
  if (!options) return usageError(command, problem);

  installInterruptHandler();
  InstallResult result;
  {
    Console console(verbose, progress);
    result = runInstall(paths, dest, options, jobs, console);
    if (verbose && !result.setupFailed) {
      console.err("plzc install: %llu files (%s) in %.2f s, %.1f MB/s, %d thread%s; %llu directories, %llu symbolic "
                  "links, %llu hard links, %llu copied as they are\n",
                  static_cast<unsigned long long>(result.totals.files), humanBytes(result.bytes).c_str(),
                  result.seconds, megabytesPerSecond(result.bytes, result.seconds), jobs, jobs == 1 ? "" : "s",
                  static_cast<unsigned long long>(result.directories),
                  static_cast<unsigned long long>(result.symlinks),
                  static_cast<unsigned long long>(result.hardLinks),
                  static_cast<unsigned long long>(result.plainCopies));
      console.err("%s", formatTotals(result.totals, "  ").c_str());
      console.err("  pipeline    %lld items queued, %lld started, %lld completed; finish %s\n",
                  static_cast<long long>(result.itemsQueued), static_cast<long long>(result.itemsStarted),
                  static_cast<long long>(result.itemsCompleted),
                  result.queueFailed ? ("failed: " + std::string(strerror(result.queueError))).c_str() : "succeeded");
    }
  }
  PVRelease(options);
  if (result.setupFailed) return kExitFailure;
  if (result.queueFailed) {
    if (result.failedFiles.empty())
      report("the messages above name no file of this run\n");
    for (const std::string &path : result.failedFiles) report("failed: %s\n", path.c_str());
  }
  if (result.interrupted) {
    report("interrupted; the files not reached were not copied\n");
    return kExitInterrupted;
  }
  return result.queueFailed || result.totals.failed ? kExitFailure : kExitSuccess;
}

}  // namespace plzc
