// plzc compress: in-place or table-of-contents compression of files and trees.
#include <cstdio>
#include <string>

#include "Cli.h"
#include "CompressRun.h"
#include "Console.h"
#include "Progress.h"

namespace plzc {

namespace {

enum LongOnly { kVerify = 256, kToc, kLargeForks, kNoProgress, kAsync, kEngine, kFast };

const option kOptions[] = {
    {"types", required_argument, nullptr, 't'},   {"level", required_argument, nullptr, 'l'},
    {"verify", no_argument, nullptr, kVerify},    {"toc", required_argument, nullptr, kToc},
    {"large-forks", no_argument, nullptr, kLargeForks}, {"jobs", required_argument, nullptr, 'j'},
    {"verbose", no_argument, nullptr, 'v'},       {"no-progress", no_argument, nullptr, kNoProgress},
    {"async", no_argument, nullptr, kAsync},      {"engine", required_argument, nullptr, kEngine},
    {"fast", no_argument, nullptr, kFast},        {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

void printHelp() {
  printf(
      "Usage: plzc compress [OPTION]... PATH...\n"
      "Compress files, and every file in the trees named, in place: each file keeps its name and\n"
      "its data, which move into its extended attributes. Files that do not shrink enough are left\n"
      "as they are.\n"
      "\n"
      "  -t, --types=LIST   compression types to try, in this order (default 3,4): type 3 keeps a\n"
      "                     small file inside its header attribute, type 4 keeps 64 KiB chunks in\n"
      "                     the resource fork\n"
      "  -l, --level=LEVEL  level, 1 (fastest) to 9 (smallest) (default 5)\n"
      "%s"
      "%s"
      "      --verify       read each compressed file back and compare it with the original\n"
      "      --toc=FILE     leave the files unchanged and write their compressed attributes to\n"
      "                     FILE, a table of contents (see 'plzc toc list')\n"
      "      --large-forks  also compress files over 64 MiB, into resource forks over 16 MiB\n"
      "      --async        hand the files to the library's compression queue, which compresses\n"
      "                     and writes them out on its own threads (not with --verify or --toc)\n"
      "  -j, --jobs=N       worker threads (default: one per processor, here %d)\n"
      "  -v, --verbose      report every file on standard error and close with a summary\n"
      "      --no-progress  never draw the progress line (drawn only on a terminal)\n"
      "  -h, --help         show this help and exit\n"
      "\n"
      "Trees are walked without following symbolic links or entering other file systems; a file\n"
      "with several hard links is compressed once. In place, the volume must be able to hold\n"
      "compressed files (see 'plzc volume').\n"
      "\n"
      "Exit status: 0 when every file was compressed or left as it was for a reason of its own\n"
      "(did not shrink, empty, already compressed), 1 when a file or a PATH failed, 2 on a usage\n"
      "error, 130 when interrupted.\n",
      kEngineHelp, kFastHelp, availableProcessors());
}

}  // namespace

int compressCommand(int argc, char **argv) {
  const char *command = "compress";
  CompressOptions options;
  options.jobs = availableProcessors();
  bool verbose = false, progress = true;
  long number;
  for (int c; (c = nextOption(command, argc, argv, "t:l:j:vh", kOptions)) != -1;) {
    switch (c) {
      case 't':
        if (chooseTypes(command, optarg, &options.types) != kExitSuccess) return kExitUsage;
        break;
      case 'l':
        if (chooseLevel(command, optarg, &number) != kExitSuccess) return kExitUsage;
        options.level = static_cast<int>(number);
        break;
      case 'j':
        if (chooseJobs(command, optarg, &options.jobs) != kExitSuccess) return kExitUsage;
        break;
      case kVerify: options.verify = true; break;
      case kToc:
        if (!*optarg) return usageError(command, "--toc needs a file name");
        options.tocPath = optarg;
        break;
      case kLargeForks: options.largeForks = true; break;
      case kAsync: options.async = true; break;
      case kEngine:
        if (int status = chooseEngine(command, optarg); status != kExitSuccess) return status;
        break;
      case kFast:
        if (int status = chooseFastEngine(command, &number); status != kExitSuccess) return status;
        options.level = static_cast<int>(number);
        break;
      case kNoProgress: progress = false; break;
      case 'v': verbose = true; break;
      case 'h': printHelp(); return kExitSuccess;
      default: return kExitUsage;
    }
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.empty()) return usageError(command, "missing PATH");
  if (options.async && (options.verify || !options.tocPath.empty()))
    return usageError(command, "--async does not go with --verify or --toc");

  installInterruptHandler();
  Console console(verbose, progress);
  CompressResult result = options.async ? runCompressAsync(options, paths, console, "plzc compress")
                                        : runCompress(options, paths, console, "plzc compress");
  if (result.setupFailed) return kExitFailure;
  if (verbose) {
    console.err("plzc compress: %s%s, %llu files in %.2f s, %.1f MB/s, %d thread%s\n",
                options.tocPath.empty() ? "in place" : ("table of contents " + options.tocPath).c_str(),
                options.async ? " through the compression queue" : "",
                static_cast<unsigned long long>(result.totals.files), result.seconds,
                megabytesPerSecond(result.bytesWalked, result.seconds), options.jobs,
                options.jobs == 1 ? "" : "s");
    console.err("%s", formatTotals(result.totals, "  ").c_str());
  }
  if (result.interrupted) {
    report("interrupted; the files not reached are unchanged\n");
    return kExitInterrupted;
  }
  return result.totals.failed ? kExitFailure : kExitSuccess;
}

}  // namespace plzc
