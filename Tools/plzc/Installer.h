// One run of plzc install: sources copied to a destination as new files written through the
// stream pipeline, which compresses them by its rules on worker threads.
#pragma once

#include <string>
#include <vector>

#include "Console.h"
#include "PropertyValue.h"
#include "Totals.h"

namespace plzc {

// Every new file is written under a temporary name of this prefix beside its destination and
// renamed to the destination once the pipeline has written it whole: an interrupted install
// leaves no partial file under a destination's name, only these.
extern const char kUnfinishedInstallPrefix[];

struct InstallResult {
  Totals totals;                        // regular files; with verbose, how they were stored
  uint64_t directories = 0, symlinks = 0, hardLinks = 0, plainCopies = 0, specials = 0;
  uint64_t bytes = 0;                   // logical bytes of the files written
  double seconds = 0;
  bool setupFailed = false;             // nothing was done (reported)
  bool queueFailed = false;             // the queue's finish failed (reported)
  int queueError = 0;                   // errno of a failed finish
  // The pipeline's work items as its finish counted them: submitted, begun and ended. A file
  // handed to compression is two items (compression, write-out), any other streamed file one.
  int64_t itemsQueued = 0, itemsStarted = 0, itemsCompleted = 0;
  bool interrupted = false;
  std::vector<std::string> failedFiles; // destination files named in failure messages
};

// Copies each source (file, symbolic link, directory tree) to dest: into dest when it is a
// directory, as dest when there is one source and dest is not a directory. queueOptions (not
// released) configures the stream queue; jobs threads feed it.
InstallResult runInstall(const std::vector<std::string> &sources, const std::string &dest, PVDictionaryRef queueOptions,
                         int jobs, Console &console);

}  // namespace plzc
