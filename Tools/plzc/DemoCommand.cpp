// plzc demo: the whole job on a built-in default. A generated mixed corpus is compressed in
// place exactly as 'plzc compress' does it, the savings are printed, and every file is read
// back and compared with the digest taken when it was written.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>

#include "Cli.h"
#include "CompressRun.h"
#include "Console.h"
#include "Corpus.h"
#include "Libraries/CompressData/CompressData.h"
#include "Progress.h"
#include "StoredForm.h"
#include "VolumeReport.h"

namespace plzc {

namespace {

enum LongOnly { kSizeMb = 256, kKeep, kGenerateOnly, kSeed, kNoProgress };

const option kOptions[] = {
    {"size-mb", required_argument, nullptr, kSizeMb}, {"keep", no_argument, nullptr, kKeep},
    {"generate-only", no_argument, nullptr, kGenerateOnly}, {"seed", required_argument, nullptr, kSeed},
    {"jobs", required_argument, nullptr, 'j'},         {"verbose", no_argument, nullptr, 'v'},
    {"no-progress", no_argument, nullptr, kNoProgress}, {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

constexpr long kDefaultSizeMb = 96;

void printHelp() {
  printf(
      "Usage: plzc demo [OPTION]... [DIR]\n"
      "Generate a mixed corpus (source code, logs, prose, binary tables, already-compressed data;\n"
      "tiny to large files, empty files, hard links, a symbolic link) in a new directory under DIR\n"
      "(default /dev/shm), compress it in place as 'plzc compress' does, print the savings, and\n"
      "check that every file reads back byte for byte against the digest taken when it was\n"
      "written. The volume of DIR must hold compressed files (see 'plzc volume').\n"
      "\n"
      "      --size-mb=N      corpus size in MiB (default %ld)\n"
      "      --seed=N         seed of the corpus (default 1); the same seed gives the same files\n"
      "  -j, --jobs=N         worker threads (default: one per processor, here %d)\n"
      "      --keep           keep the corpus afterwards (it is removed by default)\n"
      "      --generate-only  write the corpus, print its directory and stop (implies --keep)\n"
      "  -v, --verbose        report every file on standard error\n"
      "      --no-progress    never draw the progress line (drawn only on a terminal)\n"
      "  -h, --help           show this help and exit\n"
      "\n"
      "Exit status: 0 when every file reads back as written, 1 otherwise, 2 on a usage error.\n",
      kDefaultSizeMb, availableProcessors());
}

double secondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// Every path of the corpus must give back the digest taken when it was written; returns the
// number that do not.
uint64_t verifyCorpus(const std::string &dir, const std::vector<CorpusFile> &files) {
  uint64_t mismatches = 0;
  for (const CorpusFile &file : files) {
    std::string path = dir + "/" + file.path;
    uint8_t digest[16];
    StoredForm form;
    if (!checksumFile(path.c_str(), digest)) {
      report("%s: cannot be read back\n", path.c_str());
      mismatches++;
    } else if (memcmp(digest, file.digest, sizeof digest) != 0) {
      report("%s: reads back differently from what was written\n", path.c_str());
      mismatches++;
    } else if (!readStoredForm(path.c_str(), &form) || form.logicalSize != file.size) {
      report("%s: logical size is not the %llu bytes written\n", path.c_str(),
             static_cast<unsigned long long>(file.size));
      mismatches++;
    }
  }
  return mismatches;
}

}  // namespace

int demoCommand(int argc, char **argv) {
  const char *command = "demo";
  long sizeMb = kDefaultSizeMb, seed = 1;
  bool keep = false, generateOnly = false, verbose = false, progress = true;
  CompressOptions options;
  options.jobs = availableProcessors();
  for (int c; (c = nextOption(command, argc, argv, "j:vh", kOptions)) != -1;) {
    switch (c) {
      case kSizeMb:
        if (!parseNumber(optarg, 1, 65536, &sizeMb))
          return usageError(command, std::string("invalid size '") + optarg + "': give 1 to 65536 (MiB)");
        break;
      case kSeed:
        if (!parseNumber(optarg, 0, 1L << 40, &seed))
          return usageError(command, std::string("invalid seed '") + optarg + "'");
        break;
      case 'j':
        if (chooseJobs(command, optarg, &options.jobs) != kExitSuccess) return kExitUsage;
        break;
      case kKeep: keep = true; break;
      case kGenerateOnly: generateOnly = keep = true; break;
      case kNoProgress: progress = false; break;
      case 'v': verbose = true; break;
      case 'h': printHelp(); return kExitSuccess;
      default: return kExitUsage;
    }
  }
  std::vector<std::string> words = operands(argc, argv);
  if (words.size() > 1) return usageError(command, "give at most one DIR");
  std::string parent = words.empty() ? "/dev/shm" : words[0];

  installInterruptHandler();
  Console console(verbose, progress);
  VolumeReport volume;
  if (!examineVolume(parent, &volume)) {
    report("%s: %s\n", parent.c_str(), strerror(errno));
    return kExitFailure;
  }
  if (!volume.holds && !generateOnly) {
    report("%s: the volume cannot hold compressed files: %s; give a DIR on one that can\n", parent.c_str(),
           volume.reason.c_str());
    return kExitFailure;
  }
  std::string pattern = parent + "/plzc-demo-XXXXXX";
  std::vector<char> buffer(pattern.begin(), pattern.end());
  buffer.push_back('\0');
  if (!mkdtemp(buffer.data())) {
    report("%s: cannot make a directory there: %s\n", parent.c_str(), strerror(errno));
    return kExitFailure;
  }
  std::string dir = buffer.data();
  auto cleanUp = [&] {
    if (keep) return;
    std::error_code ignored;
    std::filesystem::remove_all(dir, ignored);
  };

  auto start = std::chrono::steady_clock::now();
  std::vector<CorpusFile> files;
  CorpusStats stats;
  std::string error;
  if (!generateCorpus(dir, static_cast<uint64_t>(sizeMb) << 20, static_cast<uint64_t>(seed), &files, &stats, &error)) {
    report("cannot write the corpus: %s\n", error.c_str());
    cleanUp();
    return kExitFailure;
  }
  console.out("plzc demo: corpus of %llu files (%llu paths with the hard links), %s, written in %.1f s to %s\n",
              static_cast<unsigned long long>(stats.files), static_cast<unsigned long long>(stats.paths),
              humanBytes(stats.bytes).c_str(), secondsSince(start), dir.c_str());
  if (generateOnly) return kExitSuccess;

  CompressResult result = runCompress(options, {dir}, console, "plzc demo: compress");
  if (result.setupFailed || result.interrupted) {
    if (result.interrupted) report("interrupted\n");
    cleanUp();
    return result.interrupted ? kExitInterrupted : kExitFailure;
  }
  console.out("plzc demo: compressed in place on %s in %.2f s with %d thread%s (%.1f MB/s)\n",
              volume.fileSystem.empty() ? "this volume" : volume.fileSystem.c_str(), result.seconds, options.jobs,
              options.jobs == 1 ? "" : "s", megabytesPerSecond(result.bytesWalked, result.seconds));
  console.out("%s", formatTotals(result.totals).c_str());

  start = std::chrono::steady_clock::now();
  uint64_t mismatches = verifyCorpus(dir, files);
  bool ok = mismatches == 0 && result.totals.failed == 0 && result.totals.compressed > 0;
  if (mismatches == 0)
    console.out("plzc demo: verified %zu paths in %.2f s: every file reads back byte for byte\n", files.size(),
                secondsSince(start));
  else
    report("%llu of %zu paths do not read back as written\n", static_cast<unsigned long long>(mismatches),
           files.size());
  if (result.totals.failed) report("%llu files failed to compress\n", static_cast<unsigned long long>(result.totals.failed));
  if (result.totals.compressed == 0) report("no file was compressed\n");
  if (keep) console.out("plzc demo: the corpus stays in %s\n", dir.c_str());
  cleanUp();
  return ok ? kExitSuccess : kExitFailure;
}

}  // namespace plzc
