// plzc mount: serves a directory through FUSE with its compressed files readable as plain ones.
#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <climits>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include <fuse_lowlevel.h>

#include "Cli.h"
#include "MountFileSystem.h"
#include "Platform/SystemLog.h"

namespace plzc {

namespace {

constexpr unsigned kDefaultMaxRead = 131072;

const option kMountOptions[] = {
    {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

void printMountHelp() {
  printf(
      "Usage: plzc mount [OPTION]... DIR MOUNTPOINT\n"
      "Serve DIR at MOUNTPOINT (which may be DIR itself) through FUSE: compressed files show\n"
      "their logical size and read as their logical bytes, decoded on demand; everything else\n"
      "passes through. Opening a compressed file for writing, or truncating it, first turns it\n"
      "into a plain file in DIR. Unmount with 'fusermount3 -u MOUNTPOINT' or, in the\n"
      "foreground, with Ctrl-C.\n"
      "\n"
      "  -f                 stay in the foreground (otherwise return once the mount is up)\n"
      "  -d                 print every FUSE request (implies -f)\n"
      "  -s                 serve one request at a time\n"
      "  -o OPTION[,...]    mount options:\n"
      "       ro                        read only\n"
      "       allow_other               let every user in (root, or user_allow_other)\n"
      "       show_compression_xattrs   show the compression attributes, hidden otherwise\n"
      "       cache_size=MIB            decoded chunks kept in memory (default 64)\n"
      "       attr_timeout=SECONDS      how long the kernel keeps names and attributes (default 1)\n"
      "       no_keep_cache             drop the kernel's pages of a file at each open\n"
      "       max_read=BYTES            the largest read request (default 131072)\n"
      "     and any other FUSE mount option\n"
      "  -h, --help         show this help and exit\n"
      "\n"
      "Exit status: 0 after a clean unmount, 1 when the mount failed, 2 on a usage error.\n");
}

struct ParsedOptions {
  MountSettings settings;
  bool foreground = false, debug = false, singleThreaded = false;
  std::string fuseOptions;  // passed on to FUSE
};

// Takes the mount's own options out of one -o list; false after a usage message.
bool parseOptionList(const std::string &list, ParsedOptions *parsed) {
  size_t start = 0;
  while (start <= list.size()) {
    size_t end = list.find(',', start);
    if (end == std::string::npos) end = list.size();
    std::string item = list.substr(start, end - start);
    start = end + 1;
    if (item.empty()) continue;
    std::string key = item.substr(0, item.find('='));
    std::string value = item.find('=') == std::string::npos ? "" : item.substr(item.find('=') + 1);
    long number = 0;
    if (item == "show_compression_xattrs") {
      parsed->settings.showCompressionAttributes = true;
    } else if (item == "no_keep_cache") {
      parsed->settings.keepCache = false;
    } else if (key == "cache_size") {
      if (!parseNumber(value.c_str(), 0, 1L << 20, &number)) {
        usageError("mount", "cache_size needs a whole number of MiB, not '" + value + "'");
        return false;
      }
      parsed->settings.cacheBytes = static_cast<size_t>(number) << 20;
    } else if (key == "attr_timeout") {
      char *rest = nullptr;
      double seconds = strtod(value.c_str(), &rest);
      if (value.empty() || *rest || seconds < 0) {
        usageError("mount", "attr_timeout needs a number of seconds, not '" + value + "'");
        return false;
      }
      parsed->settings.attributeTimeout = seconds;
    } else {
      if (key == "max_read") {
        if (!parseNumber(value.c_str(), 4096, 1L << 30, &number)) {
          usageError("mount", "max_read needs a number of bytes of at least 4096, not '" + value + "'");
          return false;
        }
        parsed->settings.maxRead = static_cast<unsigned>(number);
      }
      if (!parsed->fuseOptions.empty()) parsed->fuseOptions += ",";
      parsed->fuseOptions += item;
    }
  }
  return true;
}

// In the foreground, the log's messages also go to standard error, where the user looks.
void logAndPrint(int priority, const char *format, va_list arguments) {
  va_list copy;
  va_copy(copy, arguments);
  vsyslog(priority, format, arguments);
  vfprintf(stderr, format, copy);
  fputc('\n', stderr);
  va_end(copy);
}

// A clear reason when the kernel's FUSE device cannot be used; empty when it can.
std::string fuseDeviceProblem() {
  struct stat st;
  if (stat("/dev/fuse", &st) != 0)
    return std::string("/dev/fuse: ") + strerror(errno) +
           " (this kernel or container offers no FUSE; load the fuse module or pass the device in)";
  // fusermount3 opens the device for users who are not root.
  if (geteuid() == 0) {
    int fd = open("/dev/fuse", O_RDWR | O_CLOEXEC);
    if (fd < 0) return std::string("/dev/fuse: ") + strerror(errno);
    close(fd);
  }
  return "";
}

}  // namespace

int mountCommand(int argc, char **argv) {
  ParsedOptions parsed;
  optind = 0;
  int c;
  while ((c = nextOption("mount", argc, argv, "fdso:h", kMountOptions)) != -1) {
    switch (c) {
      case 'f':
        parsed.foreground = true;
        break;
      case 'd':
        parsed.debug = parsed.foreground = true;
        break;
      case 's':
        parsed.singleThreaded = true;
        break;
      case 'o':
        if (!parseOptionList(optarg, &parsed)) return kExitUsage;
        break;
      case 'h':
        printMountHelp();
        return kExitSuccess;
      default:
        return kExitUsage;
    }
  }
  std::vector<std::string> names = operands(argc, argv);
  if (names.size() != 2) return usageError("mount", names.size() < 2 ? "missing DIR or MOUNTPOINT" : "too many operands");
  const std::string &source = names[0], &mountPoint = names[1];

  int sourceFd = open(source.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (sourceFd < 0) {
    fprintf(stderr, "plzc mount: %s: %s\n", source.c_str(),
            errno == ENOTDIR ? "not a directory" : strerror(errno));
    return kExitFailure;
  }
  // Read requests of 128 KiB (two chunks): the kernel's read-ahead keeps several in flight, so
  // the server's threads decode a file's chunks in parallel; larger requests measured slower.
  if (!parsed.settings.maxRead) {
    parsed.settings.maxRead = kDefaultMaxRead;
    parsed.fuseOptions = "max_read=" + std::to_string(kDefaultMaxRead) +
                         (parsed.fuseOptions.empty() ? "" : "," + parsed.fuseOptions);
  }
  char resolved[PATH_MAX];
  parsed.settings.source = realpath(source.c_str(), resolved) ? resolved : source;
  auto fs = std::make_unique<MountFileSystem>(sourceFd, parsed.settings);
  std::string problem = fuseDeviceProblem();
  if (!problem.empty()) {
    fprintf(stderr, "plzc mount: cannot mount %s: %s\n", source.c_str(), problem.c_str());
    return kExitFailure;
  }

  std::string options = "fsname=plzc:" + parsed.settings.source + ",subtype=plzc,default_permissions";
  if (!parsed.fuseOptions.empty()) options += "," + parsed.fuseOptions;
  fuse_args args = FUSE_ARGS_INIT(0, nullptr);
  fuse_opt_add_arg(&args, "plzc");
  if (parsed.debug) fuse_opt_add_arg(&args, "-d");
  fuse_opt_add_arg(&args, "-o");
  fuse_opt_add_arg(&args, options.c_str());
  const fuse_operations &ops = MountFileSystem::operations();
  fuse *fuse = fuse_new(&args, &ops, sizeof ops, fs.get());
  fuse_opt_free_args(&args);
  if (!fuse) {
    fprintf(stderr, "plzc mount: the mount options '%s' were refused\n", options.c_str());
    return kExitUsage;
  }
  fuse_session *session = fuse_get_session(fuse);
  // Before the mount appears, so that a signal sent as soon as it is there unmounts cleanly.
  if (fuse_set_signal_handlers(session) != 0) {
    fuse_destroy(fuse);
    return kExitFailure;
  }
  // Unmounting at exit goes by this path, from wherever the server then runs.
  std::string absoluteMountPoint = realpath(mountPoint.c_str(), resolved) ? resolved : mountPoint;
  if (fuse_mount(fuse, absoluteMountPoint.c_str()) != 0) {
    fprintf(stderr, "plzc mount: cannot mount %s on %s (see the message above)\n", source.c_str(),
            mountPoint.c_str());
    fuse_remove_signal_handlers(session);
    fuse_destroy(fuse);
    return kExitFailure;
  }
  int status = kExitFailure;
  // The parent returns once the mount is up; the server goes on in the child.
  if (fuse_daemonize(parsed.foreground ? 1 : 0) == 0) {
    if (parsed.foreground) setSystemLogSink(logAndPrint);
    int result = parsed.singleThreaded ? fuse_loop(fuse) : fuse_loop_mt(fuse, 0);
    // An unmount from outside ends the loop with 0, a signal with its number, a failure with
    // -errno.
    status = result >= 0 ? kExitSuccess : kExitFailure;
    if (parsed.foreground) {
      ChunkCache::Stats stats = fs->cache().stats();
      fprintf(stderr,
              "plzc mount: chunk cache: %llu hits, %llu decodes, %llu whole chunks decoded straight into replies, "
              "%llu shared decodes, %llu evictions, peak %zu of %zu bytes\n",
              static_cast<unsigned long long>(stats.hits), static_cast<unsigned long long>(stats.misses),
              static_cast<unsigned long long>(fs->directDecodes.load()),
              static_cast<unsigned long long>(stats.waits), static_cast<unsigned long long>(stats.evictions),
              stats.peakBytes, fs->cache().limit());
    }
  }
  fuse_remove_signal_handlers(session);
  fuse_unmount(fuse);
  fuse_destroy(fuse);
  return status;
}

}  // namespace plzc
