// plzc decompress and plzc cat: compressed files back into plain files, or their data to
// standard output.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include "Cli.h"
#include "Console.h"
#include "FileWalk.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "StoredForm.h"

namespace plzc {

namespace {

enum LongOnly { kVerify = 256, kUserSpace, kNoProgress, kEngine };

const option kDecompressOptions[] = {
    {"verify", no_argument, nullptr, kVerify}, {"user-space", no_argument, nullptr, kUserSpace},
    {"jobs", required_argument, nullptr, 'j'}, {"verbose", no_argument, nullptr, 'v'},
    {"no-progress", no_argument, nullptr, kNoProgress}, {"engine", required_argument, nullptr, kEngine},
    {"help", no_argument, nullptr, 'h'},               {nullptr, 0, nullptr, 0},
};

void printDecompressHelp() {
  printf(
      "Usage: plzc decompress [OPTION]... PATH...\n"
      "Turn compressed files, and every compressed file in the trees named, back into plain files\n"
      "in place, with their times, mode and other flags as they were. Plain files are left alone.\n"
      "\n"
      "      --verify       checksum each file's data before and compare it afterwards\n"
      "      --user-space   decompress in the library even where the kernel could (on Linux the\n"
      "                     library always does)\n"
      "%s"
      "  -j, --jobs=N       worker threads (default: one per processor, here %d)\n"
      "  -v, --verbose      report every file on standard error and close with a summary\n"
      "      --no-progress  never draw the progress line (drawn only on a terminal)\n"
      "  -h, --help         show this help and exit\n"
      "\n"
      "Exit status: 0 when every compressed file was decompressed, 1 when a file or a PATH failed,\n"
      "2 on a usage error, 130 when interrupted.\n",
      kEngineHelp, availableProcessors());
}

// After a failed decompression (a volume that filled up, say) the file still holds its
// compressed form but may carry part of its data in its data fork, a widened mode and cleared
// flags: the library leaves what it had done. Puts it back as it was, so that it takes no more
// room than before and reads as before. Works through a descriptor on the very file examined
// before, never on another file renamed into its place since. Says what the file was left as.
std::string putBack(const char *path, const platform::Stat &initial, uint64_t logicalSize) {
  int fd = open(path, O_RDWR | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return std::string("left as it is: ") + strerror(errno);
  auto done = [fd](std::string outcome) {
    close(fd);
    return outcome;
  };
  platform::Stat now;
  if (platform::fstat(fd, &now) != 0) return done(std::string("left as it is: ") + strerror(errno));
  if (now.st.st_dev != initial.st.st_dev || now.st.st_ino != initial.st.st_ino)
    return done("left as it is: another file took its place meanwhile");
  if (!(now.st_flags & kFlagCompressed)) {
    // The failure came after the compressed form was removed: the data fork holds the data.
    return done(static_cast<uint64_t>(now.st.st_size) == logicalSize ? "left decompressed"
                                                                       : "left without its compressed form");
  }
  if (platform::fgetxattr(fd, kDecmpfsXattrName, nullptr, 0, 0, 0) < static_cast<ssize_t>(sizeof(DiskHeader)))
    return done("left without its compression header");
  auto cannot = [&](const char *what) {
    return done(std::string("not put back as it was: cannot ") + what + ": " + strerror(errno));
  };
  if (ftruncate(fd, initial.st.st_size) != 0) return cannot("truncate its data");
  // The flag word is an attribute that needs write permission: before the mode.
  if (platform::fchflags(fd, initial.st_flags) != 0) return cannot("restore its flags");
  timespec times[2] = {initial.st.st_atim, initial.st.st_mtim};
  if (futimens(fd, times) != 0) return cannot("restore its times");
  if (fchmod(fd, initial.st.st_mode & 07777) != 0) return cannot("restore its mode");
  return done("left compressed as it was");
}

struct DecompressTotals {
  std::atomic<uint64_t> files{0}, decompressed{0}, plain{0}, failed{0}, logicalBytes{0};
};

// Returns the file's logical size, for the progress line (a compressed file's data fork is empty).
uint64_t decompressOne(const char *path, bool verify, bool userSpace, Console &console, DecompressTotals &totals) {
  totals.files++;
  StoredForm before;
  if (!readStoredForm(path, &before)) {
    totals.failed++;
    report("%s: %s\n", path, strerror(errno));
    return 0;
  }
  if (!before.compressed) {
    totals.plain++;
    if (console.verbose()) console.err("%s: not compressed, left as it is\n", visibleText(path).c_str());
    return before.logicalSize;
  }
  platform::Stat initial;
  if (platform::stat(path, &initial) != 0) {
    totals.failed++;
    report("%s: %s\n", path, strerror(errno));
    return 0;
  }
  errno = 0;
  if (decompressFile(path, verify, userSpace) != 0) {
    int error = errno;
    totals.failed++;
    std::string outcome = putBack(path, initial, before.logicalSize);
    report("%s: cannot decompress%s%s; %s\n", path, error ? ": " : "", error ? strerror(error) : "", outcome.c_str());
    return before.logicalSize;
  }
  platform::Stat after;
  if (platform::stat(path, &after) != 0 || (after.st_flags & kFlagCompressed) ||
      static_cast<uint64_t>(after.st.st_size) != before.logicalSize) {
    totals.failed++;
    report("%s: still not a plain file of %llu bytes after decompression\n", path,
           static_cast<unsigned long long>(before.logicalSize));
    return before.logicalSize;
  }
  totals.decompressed++;
  totals.logicalBytes += before.logicalSize;
  if (console.verbose())
    console.err("%s: decompressed (type %u), %llu -> %llu bytes\n", visibleText(path).c_str(), before.type,
                static_cast<unsigned long long>(before.storedSize),
                static_cast<unsigned long long>(before.logicalSize));
  return before.logicalSize;
}

}  // namespace

int decompressCommand(int argc, char **argv) {
  const char *command = "decompress";
  bool verify = false, userSpace = false, verbose = false, progressWanted = true;
  int jobs = availableProcessors();
  for (int c; (c = nextOption(command, argc, argv, "j:vh", kDecompressOptions)) != -1;) {
    switch (c) {
      case kVerify: verify = true; break;
      case kUserSpace: userSpace = true; break;
      case kEngine:
        if (int status = chooseEngine(command, optarg); status != kExitSuccess) return status;
        break;
      case kNoProgress: progressWanted = false; break;
      case 'j':
        if (chooseJobs(command, optarg, &jobs) != kExitSuccess) return kExitUsage;
        break;
      case 'v': verbose = true; break;
      case 'h': printDecompressHelp(); return kExitSuccess;
      default: return kExitUsage;
    }
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.empty()) return usageError(command, "missing PATH");

  installInterruptHandler();
  Console console(verbose, progressWanted);
  DecompressTotals totals;
  double seconds;
  WalkResult walked = walkWithProgress(
      console, "plzc decompress", paths, jobs,
      [&](const WalkedFile &file) { return decompressOne(file.path.c_str(), verify, userSpace, console, totals); },
      &seconds);
  uint64_t failed = totals.failed + static_cast<uint64_t>(walked.failures);
  if (verbose)
    console.err(
        "plzc decompress: %llu files in %.2f s: %llu decompressed (%s), %llu not compressed, %llu failed\n",
        static_cast<unsigned long long>(totals.files.load()), seconds,
        static_cast<unsigned long long>(totals.decompressed.load()), humanBytes(totals.logicalBytes).c_str(),
        static_cast<unsigned long long>(totals.plain.load()), static_cast<unsigned long long>(failed));
  if (walked.interrupted) {
    report("interrupted; the files not reached are unchanged\n");
    return kExitInterrupted;
  }
  return failed ? kExitFailure : kExitSuccess;
}

int catCommand(int argc, char **argv) {
  const char *command = "cat";
  static const option kCatOptions[] = {
      {"engine", required_argument, nullptr, kEngine}, {"help", no_argument, nullptr, 'h'}, {nullptr, 0, nullptr, 0}};
  for (int c; (c = nextOption(command, argc, argv, "h", kCatOptions)) != -1;) {
    if (c == kEngine) {
      if (int status = chooseEngine(command, optarg); status != kExitSuccess) return status;
      continue;
    }
    if (c != 'h') return kExitUsage;
    printf(
        "Usage: plzc cat [--engine=NAME] PATH...\n"
        "Write the data of each file to standard output, decompressing compressed files, in the\n"
        "order given.\n"
        "\n"
        "%s"
        "  -h, --help         show this help and exit\n"
        "\n"
        "Exit status: 0 when every file was written whole, 1 otherwise, 2 on a usage error.\n",
        kEngineHelp);
    return kExitSuccess;
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.empty()) return usageError(command, "missing PATH");

  int status = kExitSuccess;
  for (const std::string &path : paths) {
    // One stat, shared with the library's read: it costs as much as reading a small file.
    platform::Stat st;
    if (platform::stat(path.c_str(), &st) != 0) {
      report("%s: %s\n", path.c_str(), strerror(errno));
      status = kExitFailure;
      continue;
    }
    if (!S_ISREG(st.st.st_mode)) {
      report("%s: %s\n", path.c_str(), S_ISDIR(st.st.st_mode) ? "is a directory" : "not a regular file");
      status = kExitFailure;
      continue;
    }
    fflush(stdout);
    if (catFileStatusOf(path.c_str(), st, 0) != 0) {
      report("%s: could not be read whole\n", path.c_str());
      status = kExitFailure;
    }
  }
  return status;
}

}  // namespace plzc
