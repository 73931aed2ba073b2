// The stream pipeline under load: thousands of small files and files larger than a pool's
// ring, written through one queue by several caller threads at once, then read back and
// compared byte for byte (by MD5 digest), with every budget and descriptor given back.
//
// File contents are produced on the fly from a seed while they are written, and their digest
// is computed as they go, so that no file is ever held whole in memory.
#include <dirent.h>
#include <fcntl.h>
#include <md5.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cinttypes>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Common/DataPool.h"
#include "Common/StreamCompressor.h"
#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

#if defined(__SANITIZE_THREAD__)
#define PLZC_STRESS_TSAN 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define PLZC_STRESS_TSAN 1
#endif
#endif
#if defined(__SANITIZE_ADDRESS__)
#define PLZC_STRESS_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define PLZC_STRESS_ASAN 1
#endif
#endif

using namespace plzctest;

namespace {

#if defined(PLZC_STRESS_TSAN)
constexpr bool kUnderTsan = true;
#else
constexpr bool kUnderTsan = false;
#endif
#if defined(PLZC_STRESS_TSAN) || defined(PLZC_STRESS_ASAN)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif

constexpr int kCallerThreads = 4;
constexpr uint64_t kMiB = 1 << 20;

// A file of one chunk is stored in the header attribute (3802 bytes at most, 16 of them the
// header) whatever its content: a chunk that does not shrink is kept as a marker byte plus the
// data. So random files up to this size end compressed; larger random files never shrink.
constexpr uint64_t kLargestInlineRandomFile = 3802 - 16 - 1;

// kExecutable is text behind the header of a 64-bit Mach-O executable (MH_EXECUTE), which the
// queue's Mach-O filter leaves uncompressed.
enum class Content { kText, kRandom, kExecutable };

// Bytes of a file, made on the fly from a seed: the same seed gives the same bytes however
// they are cut into pieces. Neither kind repeats with any period, so that bytes delivered twice
// or out of order always change the digest. Text is 64-byte lines that begin with their line
// number in hex, followed by words from a small table, so it deflates well.
class ByteSource {
 public:
  ByteSource(Content content, uint32_t seed) : content_(content), state_(seed * 0x9E3779B97F4A7C15ull + 0x632BE5AB) {}

  void fill(uint8_t *out, size_t count) {
    while (count > 0) {
      if (used_ == kLineBytes) nextLine();
      size_t n = std::min(count, kLineBytes - used_);
      memcpy(out, line_ + used_, n);
      out += n;
      count -= n;
      used_ += n;
    }
  }

 private:
  static constexpr size_t kLineBytes = 64;

  uint64_t next() {  // xorshift64*
    state_ ^= state_ >> 12;
    state_ ^= state_ << 25;
    state_ ^= state_ >> 27;
    return state_ * 0x2545F4914F6CDD1Dull;
  }

  void nextLine() {
    used_ = 0;
    if (content_ == Content::kRandom) {
      for (size_t i = 0; i < kLineBytes; i += 8) {
        uint64_t word = next();
        memcpy(line_ + i, &word, 8);
      }
      return;
    }
    static const char *const kWords[16] = {"alpha", "stream", "pool",  "ring",   "queue", "chunk", "fork", "zlib",
                                           "write", "read",   "block", "header", "flag",  "data",  "io",   "cache"};
    static const char kHex[] = "0123456789abcdef";
    static const uint8_t kMachOHeader[16] = {0xcf, 0xfa, 0xed, 0xfe, 7, 0, 0, 1, 3, 0, 0, 0, 2, 0, 0, 0};
    bool first = lineNumber_ == 0;
    uint64_t number = lineNumber_++;
    for (int i = 9; i >= 0; i--, number >>= 4) line_[i] = static_cast<uint8_t>(kHex[number & 15]);
    size_t at = 10;
    uint64_t bits = next();
    for (int pick = 0; at < kLineBytes - 1; pick++) {
      if (pick == 16) bits = next(), pick = 0;
      const char *word = kWords[(bits >> (4 * pick)) & 15];
      size_t length = strlen(word);
      line_[at++] = ' ';
      for (size_t i = 0; i < length && at < kLineBytes - 1; i++) line_[at++] = static_cast<uint8_t>(word[i]);
    }
    line_[kLineBytes - 1] = '\n';
    if (first && content_ == Content::kExecutable) memcpy(line_, kMachOHeader, sizeof kMachOHeader);
  }

  Content content_;
  uint64_t state_;
  uint64_t lineNumber_ = 0;
  uint8_t line_[kLineBytes] = {};
  size_t used_ = kLineBytes;
};

struct FilePlan {
  std::string name;
  uint64_t size = 0;
  Content content = Content::kText;
  uint32_t seed = 0;
  size_t piece = 0;       // the caller's write size
  bool ruledOut = false;  // the shipped rules leave the name alone (an image or archive suffix)
  bool expectCompressed = false;

  // Filled by the caller thread that writes the file.
  bool streamCreated = false;
  bool allWritten = false;
  int closeResult = -2;
  int closeErrno = 0;
  uint8_t digest[MD5_DIGEST_LENGTH] = {};
};

// Items the pipeline runs for the file: compression and write-out, or the write-out alone.
int itemsFor(const FilePlan &plan) { return plan.size > 0 && !plan.ruledOut ? 2 : 1; }

uint32_t mix(uint32_t value) {
  value ^= value >> 16;
  value *= 0x7feb352d;
  value ^= value >> 15;
  value *= 0x846ca68b;
  value ^= value >> 16;
  return value;
}

// smallFiles of 0 to 20 KiB (text, random, text under a suffix the rules exclude, Mach-O
// executables, some empty, random files at the edge of the stored single chunk) and largeFiles
// just over the 64 MiB ring (text that type 4 refuses for its size, random, and random under an
// excluded suffix, which goes straight to the I/O queue). Large files come in adjacent groups
// of groupSize spread over the list, so that several callers write large files at once while
// the others write small ones.
std::vector<FilePlan> makeWorkload(int smallFiles, int largeFiles, int groupSize) {
  std::vector<FilePlan> plans;
  for (int i = 0; i < smallFiles; i++) {
    FilePlan plan;
    uint32_t r = mix(static_cast<uint32_t>(i) + 1);
    plan.seed = r;
    plan.size = r % 20481;
    char name[32];
    switch (r % 20) {
      case 0:
      case 1:
        plan.content = Content::kText;
        plan.ruledOut = true;
        snprintf(name, sizeof name, "s%05d.png", i);
        break;
      case 2:
      case 3:
      case 4:
      case 5:
      case 6:
      case 7:
        plan.content = Content::kRandom;
        snprintf(name, sizeof name, "s%05d.bin", i);
        break;
      default:
        plan.content = Content::kText;
        snprintf(name, sizeof name, "s%05d.txt", i);
        break;
    }
    if (i % 50 == 7) plan.size = 0;
    if (i % 250 == 3) {
      plan.content = Content::kExecutable;
      plan.ruledOut = false;
      plan.size = std::max<uint64_t>(plan.size, 28);  // the whole header, or the filter cannot tell
      snprintf(name, sizeof name, "s%05d", i);
    }
    // The edges of the stored single chunk, for random bytes.
    if (i % 500 == 11) plan.content = Content::kRandom, plan.size = kLargestInlineRandomFile, plan.ruledOut = false;
    if (i % 500 == 12) plan.content = Content::kRandom, plan.size = kLargestInlineRandomFile + 1, plan.ruledOut = false;
    if (plan.content == Content::kRandom && !plan.ruledOut) snprintf(name, sizeof name, "s%05d.bin", i);
    plan.name = name;
    plan.piece = i % 13 == 0 ? 7 : 1 + (r >> 8) % 8192;
    plans.push_back(plan);
  }

  std::vector<FilePlan> large;
  for (int k = 0; k < largeFiles; k++) {
    FilePlan plan;
    plan.seed = mix(0x10000u + static_cast<uint32_t>(k));
    // The smallest is one byte over the ring; the others end at odd places in it.
    plan.size = kDataPoolMaxCapacity + 1 + static_cast<uint64_t>(k) * 524287;
    static const size_t kPieces[] = {kMiB, kMiB + 13, 65536, 3 * kMiB - 1, 200001};
    plan.piece = kPieces[k % 5];
    char name[32];
    switch (k % 3) {
      case 0:
        plan.content = Content::kText;  // compressible, but over type 4's 64 MiB cap
        snprintf(name, sizeof name, "L%02d.txt", k);
        break;
      case 1:
        plan.content = Content::kRandom;
        snprintf(name, sizeof name, "L%02d.bin", k);
        break;
      default:
        plan.content = Content::kRandom;
        plan.ruledOut = true;  // not compressed by the rules: straight to the I/O queue
        snprintf(name, sizeof name, "L%02d.zip", k);
        break;
    }
    plan.name = name;
    large.push_back(plan);
  }
  // Large files are never compressed: over 64 MiB type 4 refuses them at once.
  for (FilePlan &plan : plans)
    plan.expectCompressed = plan.size > 0 && !plan.ruledOut && plan.content != Content::kExecutable &&
                            (plan.content == Content::kText || plan.size <= kLargestInlineRandomFile);
  size_t groups = static_cast<size_t>((largeFiles + groupSize - 1) / groupSize);
  size_t stride = plans.size() / (groups + 1) + 1;
  for (int k = 0; k < largeFiles; k++) {
    size_t at =
        std::min(plans.size(), static_cast<size_t>(k / groupSize + 1) * stride + static_cast<size_t>(k % groupSize));
    plans.insert(plans.begin() + static_cast<std::ptrdiff_t>(at), large[static_cast<size_t>(k)]);
  }
  return plans;
}

int openDescriptorCount() {
  int count = 0;
  DIR *dir = opendir("/proc/self/fd");
  if (!dir) return -1;
  while (dirent *entry = readdir(dir))
    if (entry->d_name[0] != '.') count++;
  closedir(dir);
  return count;
}

// Writes one new file through the queue, as an installer would: create, hand over the
// descriptor, write the bytes in pieces, close.
void writeThrough(StreamCompressorQueue *queue, const std::string &dir, FilePlan &plan, std::vector<uint8_t> &buffer) {
  std::string path = dir + "/" + plan.name;
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_EXCL, 0644);
  if (fd < 0) return;
  StreamCompressor *stream =
      CreateStreamCompressor(fd, path.c_str(), dir.c_str(), queue, static_cast<int64_t>(plan.size));
  close(fd);  // the stream has its own descriptor
  if (!stream) return;
  plan.streamCreated = true;
  if (buffer.size() < plan.piece) buffer.resize(plan.piece);
  MD5_CTX md5;
  MD5Init(&md5);
  ByteSource source(plan.content, plan.seed);
  uint64_t written = 0;
  while (written < plan.size) {
    size_t n = static_cast<size_t>(std::min<uint64_t>(plan.piece, plan.size - written));
    source.fill(buffer.data(), n);
    MD5Update(&md5, buffer.data(), n);
    if (WriteToStreamCompressor(stream, buffer.data(), n) != static_cast<int64_t>(n)) break;
    written += n;
  }
  plan.allWritten = written == plan.size;
  MD5Final(plan.digest, &md5);
  plan.closeResult = CloseStreamCompressor(stream);
  plan.closeErrno = plan.closeResult == 0 ? 0 : errno;
}

// A queue as an installer makes it: Mach-O executables stay uncompressed. The filter reads the
// first bytes of every file to be compressed and pushes them back into the overlay, so every
// file but the empty ones and those the rules leave alone goes through a push-back before it
// is compressed or written out.
StreamCompressorQueue *createQueue() {
  PVMutableArrayRef types = PVArrayCreateMutable(0);
  PVRef executable = PVStringCreateWithCString("MH_EXECUTE", kPVStringEncodingUTF8);
  PVArrayAppendValue(types, executable);
  PVRelease(executable);
  PVMutableDictionaryRef options = PVDictionaryCreateMutable(0, kPVDictionaryRetainedValues);
  PVDictionarySetValue(options, kPLZCSkipMachOFileTypes, types);
  PVRelease(types);
  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(options);
  PVRelease(options);
  return queue;
}

struct RunResult {
  int finishResult = -2;
  int finishErrno = 0;
  int32_t enqueued = -1, started = -1, completed = -1;
  double writeSeconds = 0, finishSeconds = 0;
};

// Writes every file from kCallerThreads threads that take the next file in list order, then
// finishes the queue and reads its counters.
RunResult runWorkload(std::vector<FilePlan> &plans, const std::string &dir) {
  RunResult result;
  StreamCompressorQueue *queue = createQueue();
  if (!queue) return result;
  auto start = std::chrono::steady_clock::now();
  std::atomic<size_t> nextFile{0}, filesClosed{0};

  // A pipeline that stops moving would hang the test until CTest kills it, saying nothing:
  // after kTimeLimit, say where it stands and abort.
  constexpr auto kTimeLimit = std::chrono::seconds(600);
  std::mutex watchLock;
  std::condition_variable watchChanged;
  bool finished = false;
  std::thread watchdog([&] {
    std::unique_lock<std::mutex> lock(watchLock);
    if (watchChanged.wait_for(lock, kTimeLimit, [&] { return finished; })) return;
    fprintf(stderr,
            "pipeline stuck after %lld s: %zu of %zu files closed by the callers; enqueued %d, started %d, "
            "completed %d; %" PRIu64 " bytes charged, %d descriptors held\n",
            static_cast<long long>(kTimeLimit.count()), filesClosed.load(), plans.size(), queue->enqueued.load(),
            queue->started.load(), queue->completed.load(), throttlingMemoryCharged(), throttlingDescriptorsHeld());
    abort();
  });

  std::vector<std::thread> callers;
  for (int t = 0; t < kCallerThreads; t++)
    callers.emplace_back([&] {
      std::vector<uint8_t> buffer;
      for (size_t i; (i = nextFile.fetch_add(1)) < plans.size(); filesClosed++)
        writeThrough(queue, dir, plans[i], buffer);
    });
  for (std::thread &caller : callers) caller.join();
  auto written = std::chrono::steady_clock::now();
  // An extra reference keeps the record alive past the finish, so its counters can be read.
  queue->refCount.fetch_add(1);
  result.finishResult = FinishStreamCompressorQueue(queue);
  result.finishErrno = errno;
  result.enqueued = queue->enqueued.load();
  result.started = queue->started.load();
  result.completed = queue->completed.load();
  {
    std::lock_guard<std::mutex> lock(watchLock);
    finished = true;
  }
  watchChanged.notify_one();
  watchdog.join();
  _SQRelease(queue);
  auto finishedAt = std::chrono::steady_clock::now();
  result.writeSeconds = std::chrono::duration<double>(written - start).count();
  result.finishSeconds = std::chrono::duration<double>(finishedAt - written).count();
  return result;
}

std::string hex(const uint8_t *bytes, size_t count) {
  std::string text;
  char two[3];
  for (size_t i = 0; i < count; i++) snprintf(two, sizeof two, "%02x", bytes[i]), text += two;
  return text;
}

// Checks every file as any reader sees it: its logical bytes, whether it ended compressed, its
// size, flags and compression attributes. Returns the number of files that passed; reports the
// first few that did not.
int verifyFiles(const std::vector<FilePlan> &plans, const std::string &dir) {
  int passed = 0, reported = 0;
  for (const FilePlan &plan : plans) {
    std::string path = dir + "/" + plan.name;
    std::string problem;
    platform::Stat status{};
    uint8_t digest[MD5_DIGEST_LENGTH] = {};
    if (!plan.streamCreated || !plan.allWritten || plan.closeResult != 0) {
      problem = "stream created " + std::to_string(plan.streamCreated) + ", all written " +
                std::to_string(plan.allWritten) + ", close " + std::to_string(plan.closeResult) + " (" +
                strerror(plan.closeErrno) + ")";
    } else if (platform::stat(path.c_str(), &status) != 0) {
      problem = std::string("stat: ") + strerror(errno);
    } else if (checksumFile(path.c_str(), digest) != 1) {
      problem = "checksumFile failed";
    } else if (memcmp(digest, plan.digest, sizeof digest) != 0) {
      problem = "logical data differs: MD5 " + hex(digest, sizeof digest) + ", written " +
                hex(plan.digest, sizeof plan.digest);
    } else {
      ssize_t header = platform::getxattr(path.c_str(), kDecmpfsXattrName, nullptr, 0, 0, 0);
      int headerErrno = errno;
      ssize_t fork = platform::getxattr(path.c_str(), kResourceForkXattrName, nullptr, 0, 0, 0);
      int forkErrno = errno;
      bool compressed = (status.st_flags & kCompressedFlag) != 0;
      if (compressed != plan.expectCompressed) {
        problem = std::string("ended ") + (compressed ? "compressed" : "plain") + ", expected " +
                  (plan.expectCompressed ? "compressed" : "plain");
      } else if (status.st_flags != (plan.expectCompressed ? kCompressedFlag : 0u)) {
        problem = "flags " + std::to_string(status.st_flags);
      } else if (plan.expectCompressed && (status.st.st_size != 0 || header < 16)) {
        problem = "compressed with data fork " + std::to_string(status.st.st_size) + " and header attribute " +
                  std::to_string(header);
      } else if (!plan.expectCompressed && (static_cast<uint64_t>(status.st.st_size) != plan.size || header != -1 ||
                                            headerErrno != ENOATTR || fork != -1 || forkErrno != ENOATTR)) {
        problem = "plain with data fork " + std::to_string(status.st.st_size) + ", header attribute " +
                  std::to_string(header) + ", resource fork " + std::to_string(fork);
      }
    }
    if (problem.empty()) {
      passed++;
    } else if (reported++ < 10) {
      ADD_FAILURE() << plan.name << " (" << plan.size << " bytes of "
                    << (plan.content == Content::kRandom ? "random bytes" : "text") << "): " << problem;
    }
  }
  return passed;
}

int countItems(const std::vector<FilePlan> &plans) {
  int items = 0;
  for (const FilePlan &plan : plans) items += itemsFor(plan);
  return items;
}

int countLarge(const std::vector<FilePlan> &plans) {
  return static_cast<int>(
      std::count_if(plans.begin(), plans.end(), [](const FilePlan &plan) { return plan.size > kDataPoolMaxCapacity; }));
}

// ---- Peak memory, measured in a child process ----------------------------------------------

// The child is this test program again, running only the memory test with this variable set
// to the descriptor on which it reports; a fresh process image, so the budget is set before
// the library has done anything (and no work-pool thread of the parent is missing in it).
constexpr char kChildVariable[] = "PLZC_PIPELINE_STRESS_MEMORY_CHILD";
constexpr char kMemoryTestFilter[] = "--gtest_filter=PipelineStress.PeakMemoryStaysWithinTheBudget";

// Two rings and some small pools fit; the workload asks for more (four callers, each blocked
// on a full 64 MiB ring of its own), so the budget binds.
constexpr uint64_t kChildBudget = 160 * kMiB;
// What the process holds besides pooled memory: the test program and its libraries, gtest,
// thread stacks, the callers' write buffers (up to 3 MiB each), zlib states and chunk buffers
// of the compression threads, compressed forms waiting for their write-out (ordinary memory,
// at most a few descriptors' worth of files), and malloc's per-thread arenas, which keep some
// freed small pools. It is kept below one ring (64 MiB), so that a single pool admitted past
// the budget shows.
constexpr uint64_t kChildAllowance = 40 * kMiB;

struct ChildReport {
  int files = -1, verified = -1;
  long startKiB = -1, peakKiB = -1;
  unsigned long long maxCharged = 0, budget = 0;
  int finishResult = -2;
};

void runMemoryChild(int reportFd) {
  throttlingSetMemoryBudget(kChildBudget);
  struct rusage usage;
  getrusage(RUSAGE_SELF, &usage);
  long startKiB = usage.ru_maxrss;
  ScratchDir dir;
  ASSERT_FALSE(dir.path().empty());

  // The allocator's own view: the charge never reaches the budget.
  std::atomic<bool> done{false};
  std::atomic<uint64_t> maxCharged{0};
  std::thread sampler([&] {
    while (!done.load()) {
      uint64_t charged = throttlingMemoryCharged();
      if (charged > maxCharged.load()) maxCharged.store(charged);
      std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
  });

  std::vector<FilePlan> plans = kUnderTsan ? makeWorkload(150, 4, 4) : makeWorkload(1200, 8, 4);
  RunResult run = runWorkload(plans, dir.path());
  done.store(true);
  sampler.join();
  getrusage(RUSAGE_SELF, &usage);
  long peakKiB = usage.ru_maxrss;

  EXPECT_EQ(run.finishResult, 0) << strerror(run.finishErrno);
  EXPECT_EQ(throttlingMemoryBudget(), kChildBudget);
  EXPECT_LT(maxCharged.load(), kChildBudget);
  int verified = verifyFiles(plans, dir.path());
  EXPECT_EQ(verified, static_cast<int>(plans.size()));
  dprintf(reportFd, "files %d verified %d startKiB %ld peakKiB %ld maxCharged %llu budget %llu finish %d\n",
          static_cast<int>(plans.size()), verified, startKiB, peakKiB,
          static_cast<unsigned long long>(maxCharged.load()), static_cast<unsigned long long>(kChildBudget),
          run.finishResult);
  close(reportFd);
}

// Runs the memory test in a child process; returns what it reported and its exit status.
ChildReport spawnMemoryChild(int *exitStatus) {
  ChildReport report;
  *exitStatus = -1;
  int ends[2];
  if (pipe(ends) != 0) return report;
  // Everything the child needs is made before the fork: only exec follows it there.
  std::string variable = std::string(kChildVariable) + "=" + std::to_string(ends[1]);
  std::vector<std::string> environment;
  for (char **entry = environ; *entry; entry++)
    if (strncmp(*entry, kChildVariable, strlen(kChildVariable)) != 0) environment.emplace_back(*entry);
  environment.push_back(variable);
  std::vector<char *> envp;
  for (std::string &entry : environment) envp.push_back(entry.data());
  envp.push_back(nullptr);
  std::string self = "/proc/self/exe", filter = kMemoryTestFilter;
  char *argv[] = {self.data(), filter.data(), nullptr};
  fflush(stdout);
  fflush(stderr);
  pid_t pid = fork();
  if (pid == 0) {
    close(ends[0]);
    execve(argv[0], argv, envp.data());
    _exit(127);
  }
  close(ends[1]);
  std::string text;
  char chunk[256];
  ssize_t got;
  while ((got = read(ends[0], chunk, sizeof chunk)) > 0) text.append(chunk, static_cast<size_t>(got));
  close(ends[0]);
  if (pid > 0 && waitpid(pid, exitStatus, 0) != pid) *exitStatus = -1;
  sscanf(text.c_str(), "files %d verified %d startKiB %ld peakKiB %ld maxCharged %llu budget %llu finish %d",
         &report.files, &report.verified, &report.startKiB, &report.peakKiB, &report.maxCharged, &report.budget,
         &report.finishResult);
  return report;
}

// Declared first, so that it also runs first when the whole program runs in one process: the
// child's peak includes what the parent had in memory when it started the child.
TEST(PipelineStress, PeakMemoryStaysWithinTheBudget) {
  if (const char *reportFd = getenv(kChildVariable)) {
    runMemoryChild(atoi(reportFd));
    return;
  }
  int status;
  ChildReport report = spawnMemoryChild(&status);
  ASSERT_TRUE(WIFEXITED(status)) << "child status " << status;
  EXPECT_EQ(WEXITSTATUS(status), 0) << "the child's checks failed (see its output above)";
  ASSERT_GT(report.files, 0) << "the child ran no workload";
  EXPECT_EQ(report.verified, report.files);
  EXPECT_EQ(report.finishResult, 0);
  EXPECT_EQ(report.budget, kChildBudget);
  EXPECT_LT(report.maxCharged, report.budget);
  // The pools alone would need more than budget plus allowance if throttling let them: each of
  // the callers that writes a large file fills a 64 MiB ring before its write-out drains it.
  double peakMiB = static_cast<double>(report.peakKiB) / 1024;
  printf(
      "peak resident memory %.1f MiB (%.1f MiB when the child started), budget %.0f MiB, allowance %.0f MiB, "
      "most charged %.1f MiB\n",
      peakMiB, static_cast<double>(report.startKiB) / 1024, static_cast<double>(kChildBudget) / kMiB,
      static_cast<double>(kChildAllowance) / kMiB, static_cast<double>(report.maxCharged) / kMiB);
  if (kSanitized) {
    // Shadow memory, quarantine and redzones make the resident size meaningless here; the
    // allocator's charge above is still checked.
    printf("sanitizer build: resident peak not compared with the budget\n");
  } else {
    EXPECT_LE(static_cast<uint64_t>(report.peakKiB) * 1024, kChildBudget + kChildAllowance);
  }
}

TEST(PipelineStress, ThousandsOfFilesFromFourThreadsReadBackExactly) {
  ScratchDir dir;
  ASSERT_FALSE(dir.path().empty());
  const int descriptorsBefore = openDescriptorCount();
  const uint64_t chargedBefore = throttlingMemoryCharged();
  const int32_t heldBefore = throttlingDescriptorsHeld();

  std::vector<FilePlan> plans = kUnderTsan ? makeWorkload(400, 3, 3) : makeWorkload(10000, 20, 4);
  ASSERT_GE(countLarge(plans), kUnderTsan ? 3 : 20);
  RunResult run = runWorkload(plans, dir.path());
  printf("%zu files (%d larger than the ring) written in %.1f s, finished %.1f s later\n", plans.size(),
         countLarge(plans), run.writeSeconds, run.finishSeconds);

  EXPECT_EQ(run.finishResult, 0) << strerror(run.finishErrno);
  EXPECT_EQ(run.enqueued, run.started);
  EXPECT_EQ(run.started, run.completed);
  EXPECT_EQ(run.enqueued, countItems(plans));
  EXPECT_EQ(openDescriptorCount(), descriptorsBefore);
  EXPECT_EQ(throttlingMemoryCharged(), chargedBefore);
  EXPECT_EQ(chargedBefore, 0u);
  EXPECT_EQ(throttlingDescriptorsHeld(), heldBefore);
  EXPECT_EQ(heldBefore, 0);

  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(verifyFiles(plans, dir.path()), static_cast<int>(plans.size()));
  printf("read back in %.1f s\n", std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
  int compressed = static_cast<int>(
      std::count_if(plans.begin(), plans.end(), [](const FilePlan &plan) { return plan.expectCompressed; }));
  // The mix covers every outcome.
  EXPECT_GT(compressed, 0);
  EXPECT_LT(compressed, static_cast<int>(plans.size()));
}

}  // namespace
