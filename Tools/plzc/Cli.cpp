#include "Cli.h"

#include <sched.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sstream>

#include "Common/ChunkEngine.h"
#include "Console.h"

namespace plzc {

namespace {

// Lock-free, so the handler may set it; worker threads read it.
std::atomic<bool> gInterrupted{false};
static_assert(std::atomic<bool>::is_always_lock_free);

void onInterrupt(int signal) {
  gInterrupted.store(true);
  // A second signal ends the process the ordinary way.
  std::signal(signal, SIG_DFL);
}

}  // namespace

int usageError(const char *command, const std::string &message) {
  std::string name = *command ? std::string("plzc ") + command : "plzc";
  reportText(name + ": " + message + "\nTry '" + name + " --help' for more information.\n");
  return kExitUsage;
}

int nextOption(const char *command, int argc, char **argv, const char *shortOptions, const option *longOptions) {
  opterr = 0;
  std::string silent = std::string(":") + shortOptions;  // ':' reports a missing argument apart
  int c = getopt_long(argc, argv, silent.c_str(), longOptions, nullptr);
  if (c != '?' && c != ':') return c;
  const char *text = optind > 0 && optind <= argc ? argv[optind - 1] : "";
  if (c == ':') {
    usageError(command, std::string("option '") + text + "' needs an argument");
  } else if (optopt > 0 && optopt < 256 && strncmp(text, "--", 2) != 0) {
    usageError(command, std::string("unknown option '-") + static_cast<char>(optopt) + "'");
  } else if (optopt != 0) {
    usageError(command, std::string("option '") + text + "' takes no argument");
  } else {
    usageError(command, std::string("unknown option '") + text + "'");
  }
  return '?';
}

bool parseNumber(const char *text, long min, long max, long *out) {
  if (!text || !*text) return false;
  char *end = nullptr;
  errno = 0;
  long value = strtol(text, &end, 10);
  if (errno != 0 || *end != '\0' || value < min || value > max) return false;
  *out = value;
  return true;
}

int chooseJobs(const char *command, const char *text, int *jobs) {
  long number = 0;
  if (!parseNumber(text, 1, 1024, &number))
    return usageError(command, std::string("invalid number of jobs '") + text + "': give 1 to 1024");
  *jobs = static_cast<int>(number);
  return kExitSuccess;
}

namespace {

bool validTypeList(const std::string &list) {
  std::stringstream tokens(list);
  std::string token;
  bool seen[5] = {};
  int count = 0;
  while (std::getline(tokens, token, ',')) {
    if (token != "3" && token != "4") return false;
    int type = token[0] - '0';
    if (seen[type]) return false;
    seen[type] = true;
    count++;
  }
  return count > 0 && list.back() != ',';
}

}  // namespace

int chooseTypes(const char *command, const char *text, std::string *types) {
  if (!validTypeList(text))
    return usageError(command,
                      std::string("invalid type list '") + text + "': give 3, 4, or both separated by a comma");
  *types = text;
  return kExitSuccess;
}

int chooseLevel(const char *command, const char *text, long *level) {
  if (!parseNumber(text, 1, 9, level))
    return usageError(command, std::string("invalid level '") + text + "': give 1 to 9");
  return kExitSuccess;
}

const char kEngineHelp[] =
    "      --engine=NAME  deflate engine: libdeflate (the default), zlib (the reference) or\n"
    "                     isal (fastest, larger output); every engine reads what any other wrote\n";
const char kFastHelp[] =
    "      --fast         speed over size: the isal engine at level 1 (same as --engine=isal -l 1)\n";

int chooseEngine(const char *command, const char *name) {
  ChunkEngine engine;
  if (!chunkEngineFromName(name, &engine))
    return usageError(command, std::string("unknown engine '") + name + "': give zlib, libdeflate or isal");
  if (!setChunkEngine(engine))
    return usageError(command, std::string("engine '") + name + "' is not built into this plzc");
  return kExitSuccess;
}

int chooseFastEngine(const char *command, long *level) {
  *level = 1;
  return chooseEngine(command, chunkEngineName(ChunkEngine::Isal));
}

std::vector<std::string> operands(int argc, char **argv) {
  std::vector<std::string> result;
  for (int i = optind; i < argc; i++) result.emplace_back(argv[i]);
  return result;
}

int availableProcessors() {
  cpu_set_t set;
  if (sched_getaffinity(0, sizeof set, &set) == 0) {
    int count = CPU_COUNT(&set);
    if (count > 0) return count;
  }
  long online = sysconf(_SC_NPROCESSORS_ONLN);
  return online > 0 ? static_cast<int>(online) : 1;
}

void installInterruptHandler() {
  std::signal(SIGINT, onInterrupt);
  std::signal(SIGTERM, onInterrupt);
}

bool interrupted() { return gInterrupted.load(); }

std::string humanBytes(uint64_t bytes) {
  char text[32];
  if (bytes < 1024)
    snprintf(text, sizeof text, "%llu B", static_cast<unsigned long long>(bytes));
  else if (bytes < (1ull << 20))
    snprintf(text, sizeof text, "%.1f KiB", static_cast<double>(bytes) / 1024);
  else if (bytes < (1ull << 30))
    snprintf(text, sizeof text, "%.1f MiB", static_cast<double>(bytes) / (1 << 20));
  else
    snprintf(text, sizeof text, "%.2f GiB", static_cast<double>(bytes) / (1 << 30));
  return text;
}

std::string humanDuration(double seconds) {
  long whole = seconds > 0 ? static_cast<long>(seconds) : 0;
  char text[32];
  if (whole >= 3600)
    snprintf(text, sizeof text, "%ld:%02ld:%02ld", whole / 3600, whole / 60 % 60, whole % 60);
  else
    snprintf(text, sizeof text, "%ld:%02ld", whole / 60, whole % 60);
  return text;
}

}  // namespace plzc
