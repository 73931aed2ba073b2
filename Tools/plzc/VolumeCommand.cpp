// plzc volume: can this volume hold compressed files, and why not.
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "Cli.h"
#include "Console.h"
#include "VolumeReport.h"

namespace plzc {

int volumeCommand(int argc, char **argv) {
  const char *command = "volume";
  static const option kOptions[] = {{"help", no_argument, nullptr, 'h'}, {nullptr, 0, nullptr, 0}};
  for (int c; (c = nextOption(command, argc, argv, "h", kOptions)) != -1;) {
    if (c != 'h') return kExitUsage;
    printf(
        "Usage: plzc volume PATH...\n"
        "Tell whether the volume holding each PATH can hold compressed files, whose data lives in\n"
        "large extended attributes, and why not when it cannot.\n"
        "\n"
        "  -h, --help  show this help and exit\n"
        "\n"
        "Exit status: 0 when every volume can hold compressed files, 1 when one cannot, 2 when a\n"
        "PATH does not exist or on a usage error.\n");
    return kExitSuccess;
  }
  std::vector<std::string> paths = operands(argc, argv);
  if (paths.empty()) return usageError(command, "missing PATH");

  int status = kExitSuccess;
  Console console(false, false);
  for (const std::string &path : paths) {
    VolumeReport volume;
    if (!examineVolume(path, &volume)) {
      report("%s: %s\n", path.c_str(), strerror(errno));
      status = kExitUsage;
      continue;
    }
    std::string where = (volume.fileSystem.empty() ? std::string("a volume") : volume.fileSystem) +
                        (volume.mountPoint.empty() ? "" : " mounted at " + volume.mountPoint);
    if (volume.holds) {
      console.out("%s: holds compressed files (%s)\n", path.c_str(), where.c_str());
    } else {
      console.out("%s: cannot hold compressed files (%s): %s\n", path.c_str(), where.c_str(), volume.reason.c_str());
      if (status == kExitSuccess) status = kExitFailure;
    }
  }
  return status;
}

}  // namespace plzc
