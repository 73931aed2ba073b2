// The crash harness: runs plzc compress, compress --async, decompress and install over files of
// every kind, kills each run with SIGKILL at a seeded random moment spread over that command's
// measured duration, runs plzc repair, and checks that no file lost or changed a byte of its
// data (or of its own resource fork), read back through the library. Then it runs the command
// again to its end and checks again: what repair left must be usable.
//
//   crashHarness [--trials N] [--seed S] [--commands compress,async,decompress,install]
//                [--big-every K] [--dir DIR] [--keep-failures] [--verbose]
//
// Every Kth trial of a command (default 10) adds a file larger than the stream pool's 64 MiB
// ring. The same seed gives the same files, commands and kill delays. Exit status 0 when no
// trial lost anything, 1 otherwise, 2 on a usage error.
#include <fcntl.h>
#include <md5.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <map>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Support/PlzcProcess.h"
#include "Support/TestSupport.h"

namespace fs = std::filesystem;
using plzctest::Finished;
using plzctest::Process;

namespace {

using Clock = std::chrono::steady_clock;
using Digest = std::array<uint8_t, 16>;

constexpr const char kInstallPrefix[] = ".plzc-install-";  // the install's unfinished copies

struct Options {
  int trials = 40;
  uint64_t seed = 1;
  std::vector<std::string> commands = {"compress", "async", "decompress", "install"};
  int bigEvery = 10;
  std::string dir;
  bool keepFailures = false;
  bool verbose = false;
};

// One file of the corpus, and what must survive of it.
struct CorpusFile {
  std::string relative;
  std::vector<uint8_t> data;
  std::vector<uint8_t> fork;  // its own resource fork, if any
  uint32_t flags = 0;
  mode_t mode = 0644;
  bool precompressed = false;  // compressed in every template
  std::string linkOf;          // a hard link to this other file
};

struct Expected {
  std::string relative;
  Digest digest;
  std::vector<uint8_t> fork;
  uint64_t size;
};

Digest md5Of(const std::vector<uint8_t> &bytes) {
  MD5_CTX md5;
  MD5Init(&md5);
  MD5Update(&md5, bytes.data(), bytes.size());
  Digest digest;
  MD5Final(digest.data(), &md5);
  return digest;
}

// Files of every kind: type 3, type 4 with a small and a segmented fork, incompressible, mixed,
// with their own resource forks (small and segmented), other flags, read-only, empty, a "._"
// file, a hard link, one already compressed; with `big`, one larger than the pool's ring.
std::vector<CorpusFile> corpus(bool big) {
  using plzctest::compressibleBytes;
  using plzctest::randomBytes;
  std::vector<CorpusFile> files;
  auto add = [&](std::string relative, std::vector<uint8_t> data) -> CorpusFile & {
    CorpusFile file;
    file.relative = std::move(relative);
    file.data = std::move(data);
    files.push_back(std::move(file));
    return files.back();
  };
  add("docs/small.txt", compressibleBytes(3000, 1));
  add("docs/guide.txt", compressibleBytes(300 << 10, 2));
  add("docs/log.txt", compressibleBytes(3 << 20, 3));
  add("noise.bin", randomBytes(200 << 10, 4));
  std::vector<uint8_t> mixed = compressibleBytes(600 << 10, 5), tail = randomBytes(400 << 10, 6);
  mixed.insert(mixed.end(), tail.begin(), tail.end());
  add("mixed.dat", mixed);
  add("hidden.txt", compressibleBytes(150 << 10, 7)).flags = kFlagHidden;
  add("readonly.txt", compressibleBytes(200 << 10, 8)).mode = 0444;
  add("forked.txt", compressibleBytes(120 << 10, 9)).fork = randomBytes(20 << 10, 10);
  add("forked-large.txt", compressibleBytes(500 << 10, 11)).fork = randomBytes(150 << 10, 12);
  add("empty", {});
  add("._meta", compressibleBytes(4 << 10, 13));
  add("pre.txt", compressibleBytes(400 << 10, 14)).precompressed = true;
  add("docs/guide-link.txt", {}).linkOf = "docs/guide.txt";
  if (big) add("big.dat", compressibleBytes((65 << 20) + 4321, 15));
  return files;
}

std::string shellQuote(const std::string &text) { return "'" + text + "'"; }

bool shell(const std::string &command) { return std::system(command.c_str()) == 0; }

std::vector<uint8_t> forkOf(const std::string &path) {
  ssize_t size = platform::getxattr(path.c_str(), kResourceForkXattrName, nullptr, 0, 0, 0);
  if (size <= 0) return {};
  std::vector<uint8_t> value(static_cast<size_t>(size));
  ssize_t got = platform::getxattr(path.c_str(), kResourceForkXattrName, value.data(), value.size(), 0, 0);
  value.resize(static_cast<size_t>(std::max<ssize_t>(got, 0)));
  return value;
}

// Repair's line with the path taken off and numbers replaced, for counting kinds of states.
std::string stateKind(const std::string &line, const std::string &root) {
  std::string rest = line;
  size_t colon = rest.find(": ");
  if (rest.compare(0, root.size(), root) == 0 && colon != std::string::npos) rest = rest.substr(colon + 2);
  std::string kind;
  bool inNumber = false;
  for (char c : rest) {
    if (isdigit(static_cast<unsigned char>(c))) {
      if (!inNumber) kind += 'N';
      inNumber = true;
    } else {
      kind += c;
      inNumber = false;
    }
  }
  return kind;
}

struct CommandTally {
  int trials = 0, killed = 0, finishedFirst = 0, bigTrials = 0, losses = 0, repairExitNonZero = 0;
  std::map<std::string, int> states;  // kind of state and action -> files
  double seconds = 0;                 // the measured duration of a whole run (small corpus)
  double bigSeconds = 0;
};

class Harness {
 public:
  explicit Harness(const Options &options) : options_(options), random_(options.seed) {}

  int run() {
    std::string base = options_.dir.empty() ? (getenv("PLZC_TEST_DIR") ? getenv("PLZC_TEST_DIR") : "/dev/shm")
                                            : options_.dir;
    std::string pattern = base + "/plzc-crash-XXXXXX";
    if (!mkdtemp(pattern.data())) {
      fprintf(stderr, "crashHarness: cannot make a directory under %s: %s\n", base.c_str(), strerror(errno));
      return 1;
    }
    root_ = pattern;
    bool big = options_.bigEvery > 0;
    if (!makeTemplates(false) || (big && !makeTemplates(true))) return finish(1);
    for (const std::string &command : options_.commands) {
      tallies_[command].seconds = measure(command, false);
      if (big) tallies_[command].bigSeconds = measure(command, true);
    }
    for (int trial = 0; trial < options_.trials; trial++) {
      const std::string &command = options_.commands[static_cast<size_t>(trial) % options_.commands.size()];
      int round = trial / static_cast<int>(options_.commands.size());
      bool bigTrial = big && round % options_.bigEvery == options_.bigEvery - 1;
      runTrial(trial, command, bigTrial);
    }
    printSummary();
    return finish(losses_ ? 1 : 0);
  }

 private:
  int finish(int status) {
    if (!(status && options_.keepFailures)) fs::remove_all(root_);
    else fprintf(stderr, "crashHarness: kept %s\n", root_.c_str());
    return status;
  }

  std::string templateDir(bool big, bool compressed) const {
    return root_ + "/template-" + (big ? "big" : "small") + (compressed ? "-compressed" : "");
  }
  std::string plzc() const { return plzctest::plzcBinary(); }

  // The plain template (with its one precompressed file) and a copy compressed by plzc.
  bool makeTemplates(bool big) {
    std::vector<CorpusFile> files = corpus(big);
    std::string plain = templateDir(big, false);
    for (const CorpusFile &file : files) {
      std::string path = plain + "/" + file.relative;
      fs::create_directories(fs::path(path).parent_path());
      if (!file.linkOf.empty()) {
        if (link((plain + "/" + file.linkOf).c_str(), path.c_str()) != 0) return setupFailed("link " + path);
        continue;
      }
      plzctest::writeFile(path, file.data);
      if (!file.fork.empty() &&
          platform::setxattr(path.c_str(), kResourceForkXattrName, file.fork.data(), file.fork.size(), 0, 0) != 0)
        return setupFailed("resource fork of " + path);
      if (file.precompressed && !shell(plzc() + " compress --no-progress " + shellQuote(path)))
        return setupFailed("compress " + path);
      uint32_t flags = file.flags | (file.precompressed ? static_cast<uint32_t>(kFlagCompressed) : 0u);
      if (file.flags && platform::chflags(path.c_str(), flags) != 0)
        return setupFailed("flags of " + path);
      chmod(path.c_str(), file.mode);
    }
    std::vector<Expected> &expected = expected_[big];
    for (const CorpusFile &file : files) {
      const CorpusFile &owner = file.linkOf.empty() ? file
                                                    : *std::find_if(files.begin(), files.end(), [&](const CorpusFile &f) {
                                                        return f.relative == file.linkOf;
                                                      });
      expected.push_back({file.relative, md5Of(owner.data), owner.fork, owner.data.size()});
    }
    std::string compressed = templateDir(big, true);
    if (!shell("cp -a " + shellQuote(plain) + " " + shellQuote(compressed)) ||
        !shell(plzc() + " compress --large-forks --no-progress -j 2 " + shellQuote(compressed) + " 2>/dev/null"))
      return setupFailed("compressed template " + compressed);
    // The data of every template as the library reads it: a harness that starts from a wrong
    // template would blame the commands.
    std::string problem;
    if (!checkFiles(plain, expected, false, &problem) || !checkFiles(compressed, expected, false, &problem))
      return setupFailed("template: " + problem);
    return true;
  }

  bool setupFailed(const std::string &what) {
    fprintf(stderr, "crashHarness: setting up failed: %s: %s\n", what.c_str(), strerror(errno));
    return false;
  }

  // The command line of a run over a trial directory.
  std::vector<std::string> commandLine(const std::string &command, const std::string &trialDir, bool big) const {
    if (command == "compress") return {"compress", "--large-forks", "--no-progress", "-j", "2", trialDir + "/files"};
    if (command == "async")
      return {"compress", "--async", "--large-forks", "--no-progress", "-j", "2", trialDir + "/files"};
    if (command == "decompress") return {"decompress", "--no-progress", "-j", "2", trialDir + "/files"};
    // "SRC/." copies as DEST when DEST is absent, into DEST when a killed run left it.
    return {"install", "--large-forks", "--no-progress", "-j", "2", templateDir(big, false) + "/.", trialDir + "/dest"};
  }

  // A fresh trial directory: the files the command works on (install reads the plain template
  // itself, which must stay untouched).
  std::string prepare(const std::string &command, bool big, int trial) {
    std::string trialDir = root_ + "/trial-" + std::to_string(trial);
    fs::remove_all(trialDir);
    fs::create_directories(trialDir);
    if (command != "install")
      shell("cp -a " + shellQuote(templateDir(big, command == "decompress")) + " " + shellQuote(trialDir + "/files"));
    return trialDir;
  }

  // The median of three whole runs: one run slowed by other work on the machine would push
  // most kills past the end of the runs that follow.
  double measure(const std::string &command, bool big) {
    std::vector<double> runs;
    for (int i = 0; i < 3; i++) {
      std::string trialDir = prepare(command, big, -1);
      auto start = Clock::now();
      Finished done = Process(commandLine(command, trialDir, big)).wait();
      runs.push_back(std::chrono::duration<double>(Clock::now() - start).count());
      if (done.status != 0)
        fprintf(stderr, "crashHarness: a whole %s run ended with status %d: %s\n", command.c_str(), done.status,
                done.err.c_str());
      fs::remove_all(trialDir);
    }
    std::sort(runs.begin(), runs.end());
    return runs[1];
  }

  void runTrial(int trial, const std::string &command, bool big) {
    CommandTally &tally = tallies_[command];
    tally.trials++;
    tally.bigTrials += big;
    double span = big ? tally.bigSeconds : tally.seconds;
    double delay = std::uniform_real_distribution<double>(0, span)(random_);
    std::string trialDir = prepare(command, big, trial);

    Process victim(commandLine(command, trialDir, big));
    std::this_thread::sleep_for(std::chrono::duration<double>(delay));
    victim.signal(SIGKILL);
    Finished killed = victim.wait();
    bool wasKilled = killed.status == 128 + SIGKILL;
    tally.killed += wasKilled;
    tally.finishedFirst += !wasKilled;

    bool install = command == "install";
    std::string checked = trialDir + (install ? "/dest" : "/files");
    std::vector<std::string> problems;
    std::string repairOut;
    if (fs::exists(checked)) {
      Finished repaired = Process({"repair", "--no-progress", "-j", "2", checked}).wait();
      repairOut = repaired.out;
      tally.repairExitNonZero += repaired.status != 0;
      if (repaired.status != 0 && repaired.status != 1)
        problems.push_back("repair ended with status " + std::to_string(repaired.status) + ": " + repaired.err);
      std::istringstream lines(repaired.out);
      for (std::string line; std::getline(lines, line);)
        if (line.compare(0, 13, "plzc repair: ") != 0) tally.states[stateKind(line, checked)]++;
    }
    std::string problem;
    const std::vector<Expected> &expected = expected_[big];
    if (install) {
      if (!checkFiles(templateDir(big, false), expected, false, &problem)) problems.push_back("source: " + problem);
      if (fs::exists(checked) && !checkInstalled(checked, expected, repairOut, &problem)) problems.push_back(problem);
    } else if (!checkFiles(checked, expected, false, &problem)) {
      problems.push_back("after repair: " + problem);
    }

    // What repair left must be usable: the command run again to its end leaves every file whole.
    Finished again = Process(commandLine(command, trialDir, big)).wait();
    if (again.status != 0) problems.push_back("the run after repair ended with status " + std::to_string(again.status) + ": " + again.err);
    if (!checkFiles(checked, expected, false, &problem)) problems.push_back("after a whole run: " + problem);

    if (options_.verbose || !problems.empty())
      printf("trial %d: %s%s, killed after %.3f s of %.3f s%s\n", trial, command.c_str(), big ? " (big)" : "", delay,
             span, wasKilled ? "" : " (it had finished)");
    if (!problems.empty()) {
      tally.losses++;
      losses_++;
      for (const std::string &text : problems) printf("  LOSS: %s\n", text.c_str());
      printf("  repair said:\n%s", repairOut.c_str());
      if (options_.keepFailures) {
        fs::rename(trialDir, root_ + "/failed-trial-" + std::to_string(trial));
        return;
      }
    }
    fs::remove_all(trialDir);
  }

  // Every expected file under dir reads back its data and keeps its own fork; with
  // allowMissing a missing file is no loss.
  bool checkFiles(const std::string &dir, const std::vector<Expected> &expected, bool allowMissing, std::string *problem) {
    for (const Expected &file : expected) {
      std::string path = dir + "/" + file.relative;
      struct stat st;
      if (lstat(path.c_str(), &st) != 0) {
        if (allowMissing) continue;
        *problem = path + ": missing";
        return false;
      }
      Digest digest;
      if (checksumFile(path.c_str(), digest.data()) != 1 || digest != file.digest) {
        *problem = path + ": its data is not the original " + std::to_string(file.size) + " bytes";
        return false;
      }
      // A compressed file's fork is its compressed form; only a plain file can have its own.
      platform::Stat flags;
      bool compressed = platform::stat(path.c_str(), &flags) == 0 && (flags.st_flags & kFlagCompressed);
      if (compressed ? !file.fork.empty() : forkOf(path) != file.fork) {
        *problem = path + ": its resource fork is not its own";
        return false;
      }
    }
    return true;
  }

  // After an interrupted install: every file under a destination name is whole; nothing else is
  // there but directories and the unfinished copies, each of which repair reported.
  bool checkInstalled(const std::string &dest, const std::vector<Expected> &expected, const std::string &repairOut,
                      std::string *problem) {
    if (!checkFiles(dest, expected, true, problem)) return false;
    std::set<std::string> names;
    for (const Expected &file : expected) names.insert(dest + "/" + file.relative);
    for (const auto &entry : fs::recursive_directory_iterator(dest)) {
      if (entry.is_directory()) continue;
      std::string path = entry.path().string();
      if (names.count(path)) continue;
      if (entry.path().filename().string().compare(0, strlen(kInstallPrefix), kInstallPrefix) == 0) {
        if (repairOut.find(path + ": an unfinished copy") == std::string::npos) {
          *problem = path + ": an unfinished copy that repair did not report";
          return false;
        }
        continue;
      }
      *problem = path + ": a file that is not in the source";
      return false;
    }
    return true;
  }

  void printSummary() {
    printf("crash harness: seed %llu, %d trials; kill delays spread over each command's measured run\n",
           static_cast<unsigned long long>(options_.seed), options_.trials);
    printf("%-11s %6s %6s %9s %5s %8s %10s %6s\n", "command", "trials", "killed", "finished", "big", "run (s)",
           "repair!=0", "losses");
    for (const std::string &command : options_.commands) {
      const CommandTally &t = tallies_[command];
      printf("%-11s %6d %6d %9d %5d %4.2f/%-4.1f %9d %6d\n", command.c_str(), t.trials, t.killed, t.finishedFirst,
             t.bigTrials, t.seconds, t.bigSeconds, t.repairExitNonZero, t.losses);
    }
    printf("states repair found (files) and what it did:\n");
    for (const std::string &command : options_.commands)
      for (const auto &[kind, count] : tallies_[command].states) printf("  %-10s %5d  %s\n", command.c_str(), count, kind.c_str());
    printf("%s\n", losses_ ? "LOSSES FOUND" : "no file lost or changed a byte in any trial");
  }

  Options options_;
  std::mt19937_64 random_;
  std::string root_;
  std::map<bool, std::vector<Expected>> expected_;
  std::map<std::string, CommandTally> tallies_;
  int losses_ = 0;
};

int usage(const char *message) {
  fprintf(stderr,
          "crashHarness: %s\nUsage: crashHarness [--trials N] [--seed S] [--commands LIST] [--big-every K] [--dir DIR] "
          "[--keep-failures] [--verbose]\n",
          message);
  return 2;
}

}  // namespace

int main(int argc, char **argv) {
  Options options;
  for (int i = 1; i < argc; i++) {
    std::string arg = argv[i];
    auto value = [&]() -> const char * { return i + 1 < argc ? argv[++i] : nullptr; };
    if (arg == "--trials" || arg == "--seed" || arg == "--big-every" || arg == "--dir" || arg == "--commands") {
      const char *text = value();
      if (!text) return usage(("missing value of " + arg).c_str());
      if (arg == "--trials") options.trials = atoi(text);
      else if (arg == "--seed") options.seed = strtoull(text, nullptr, 10);
      else if (arg == "--big-every") options.bigEvery = atoi(text);
      else if (arg == "--dir") options.dir = text;
      else {
        options.commands.clear();
        std::stringstream list(text);
        for (std::string word; std::getline(list, word, ',');) {
          if (word != "compress" && word != "async" && word != "decompress" && word != "install")
            return usage(("unknown command " + word).c_str());
          options.commands.push_back(word);
        }
      }
    } else if (arg == "--keep-failures") {
      options.keepFailures = true;
    } else if (arg == "--verbose") {
      options.verbose = true;
    } else {
      return usage(("unknown argument " + arg).c_str());
    }
  }
  if (options.trials < 0 || options.commands.empty()) return usage("nothing to run");
  setvbuf(stdout, nullptr, _IOLBF, 0);
  return Harness(options).run();
}
