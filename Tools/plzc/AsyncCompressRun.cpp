// plzc compress --async: the files handed to the library's compression queue, which compresses
// and writes them out in place on its own threads.
#include <atomic>
#include <cerrno>
#include <cstring>

#include "Cli.h"
#include "Common/StreamCompressor.h"
#include "CompressRun.h"
#include "FileWalk.h"
#include "Plenzo.h"
#include "Progress.h"
#include "QueueOptions.h"
#include "StderrTap.h"
#include "StoredForm.h"

namespace plzc {

CompressResult runCompressAsync(const CompressOptions &options, const std::vector<std::string> &paths,
                                Console &console, const char *progressLabel) {
  CompressResult result;
  QueueOptionChoices choices;
  choices.types = options.types;
  choices.level = options.level;
  choices.largeForks = options.largeForks;
  std::string problem;
  PVDictionaryRef queueOptions = buildQueueOptions(choices, &problem);
  StreamCompressorQueue *queue =
      queueOptions ? CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, queueOptions) : nullptr;
  PVRelease(queueOptions);
  if (!queue) {
    report("cannot set up the compression queue%s%s\n", problem.empty() ? "" : ": ", problem.c_str());
    result.setupFailed = true;
    return result;
  }
  // Set up now, before the walk's threads take their memory: the pipeline's threads must be
  // started while the process can still afford them.
  if (!_SQLazyInit(queue)) {
    report("cannot start the compression queue: %s\n", strerror(errno ? errno : ENOMEM));
    FinishCompressionAndCleanUp(queue);
    result.setupFailed = true;
    return result;
  }

  std::mutex lock;
  std::vector<std::string> handed;
  std::atomic<uint64_t> failed{0};
  StderrTap tap;
  ProgressMeter progress(console, progressLabel);
  WalkResult walked = forEachFile(
      paths, WalkOptions{}, options.jobs,
      [&](const WalkedFile &file) {
        errno = 0;
        if (CompressFile(queue, file.path.c_str(), nullptr) != 1) {
          int error = errno;
          failed++;
          report("%s: not handed to the compression queue%s%s\n", file.path.c_str(), error ? ": " : "",
                 error ? strerror(error) : "");
        } else {
          std::lock_guard<std::mutex> guard(lock);
          handed.push_back(file.path);
        }
        progress.fileDone(file.size);
      },
      [&](uint64_t files) { progress.setTotalFiles(files); });
  size_t linesBefore = tap.lines().size();
  // The finish reports a failure on standard error only.
  FinishCompressionAndCleanUp(queue);
  result.seconds = progress.elapsedSeconds();
  result.bytesWalked = progress.bytes();
  tap.stop();
  std::vector<std::string> lines = tap.lines();
  bool finishFailed = lines.size() > linesBefore;
  if (finishFailed) report("the compression queue reported a failure\n");

  // What the queue did, read back from each file; a file named in a failure message is failed.
  Totals &totals = result.totals;
  for (const std::string &path : handed) {
    totals.files++;
    bool named = false;
    for (const std::string &line : lines)
      if (mentionsPath(line, path)) named = true;
    StoredForm form;
    if (named || !readStoredForm(path.c_str(), &form)) {
      totals.failed++;
      if (named) report("failed: %s\n", path.c_str());
      continue;
    }
    totals.logicalBytes += form.logicalSize;
    totals.storedBytes += form.storedSize;
    if (form.compressed) {
      totals.compressed++;
      totals.byType[form.type < kTypeSlots ? form.type : kTypeSlots - 1]++;
    } else if (form.logicalSize == 0) {
      totals.empty++;
    } else {
      totals.leftPlain++;
    }
  }
  totals.files += failed;
  totals.failed += failed + static_cast<uint64_t>(walked.failures);
  if (finishFailed && totals.failed == 0) totals.failed++;
  result.interrupted = walked.interrupted;
  return result;
}

}  // namespace plzc
