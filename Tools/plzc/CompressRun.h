// One run of in-place (or table-of-contents) compression over files and trees: worker threads
// share one compressor context and take paths from the directory enumerator.
#pragma once

#include <string>
#include <vector>

#include "Console.h"
#include "Totals.h"

namespace plzc {

struct CompressOptions {
  std::string types = "3,4";  // tried in this order
  int level = 5;
  bool verify = false;
  std::string tocPath;        // empty: in place
  bool largeForks = false;
  int jobs = 1;
  bool async = false;  // through the compression queue
};

struct CompressResult {
  Totals totals;
  double seconds = 0;
  uint64_t bytesWalked = 0;   // data of every file handed to the workers, for the throughput
  bool interrupted = false;
  bool setupFailed = false;   // nothing was compressed: the context could not be made
};

// Compresses every regular file named by paths or found under them. Each failure is reported
// on the console ("plzc: PATH: cause"); with the console's verbose flag every file gets a line
// on standard error. Files that do not shrink, are empty or already compressed are left as
// they are and are not failures. In place, a PATH on a volume that cannot hold compressed files
// is reported and skipped.
CompressResult runCompress(const CompressOptions &options, const std::vector<std::string> &paths, Console &console,
                           const char *progressLabel);

// The same work through the library's compression queue, which compresses and writes the files
// out on its own threads; the totals are read back from the files once the queue has finished.
// Neither verify nor a table of contents applies.
CompressResult runCompressAsync(const CompressOptions &options, const std::vector<std::string> &paths,
                                Console &console, const char *progressLabel);

}  // namespace plzc
