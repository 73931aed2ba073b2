#include "FaultSweep.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <gtest/gtest.h>

#include <cctype>
#include <cerrno>
#include <cstring>

#include "Common/FileLock.h"
#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressData.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Platform/FileFlags.h"
#include "TestSupport.h"

// Sanitizer runtimes define this; a plain build does not.
extern "C" void __sanitizer_set_report_fd(void *fd) __attribute__((weak));

namespace plzctest {

namespace {

// The runs capture standard error; a sanitizer report written there would vanish with the
// capture when the process aborts. Send reports to a copy of the real standard error.
void keepSanitizerReportsVisible() {
  static bool done = false;
  if (done || !__sanitizer_set_report_fd) return;
  done = true;
  __sanitizer_set_report_fd(reinterpret_cast<void *>(static_cast<intptr_t>(fcntl(2, F_DUPFD_CLOEXEC, 3))));
}

constexpr int kKinds = static_cast<int>(sys::Call::Count);
// A sweep that keeps failing says the same thing over and over: stop it after this many runs.
constexpr int kMostFailingRuns = 12;

using Counts = std::vector<uint64_t>;

int failureCount() {
  const ::testing::TestInfo *test = ::testing::UnitTest::GetInstance()->current_test_info();
  return test ? test->result()->total_part_count() : 0;
}

Counts countsOf(const FaultWindow &window) {
  Counts counts(kKinds);
  for (int kind = 0; kind < kKinds; kind++) counts[kind] = window.calls(static_cast<sys::Call>(kind));
  return counts;
}

// One run with the checks every run shares. Returns the calls made in the window.
Counts runChecked(const std::function<void(FaultWindow &)> &run, const Fault *fault) {
  int descriptorsBefore = openDescriptorCount();
  FaultWindow window(fault);
  run(window);
  window.close();  // in case the run stopped early
  sys::clearFaults();
  if (fault) {
    EXPECT_TRUE(window.fired()) << "the run made fewer calls than the clean run";
  }
  EXPECT_EQ(openDescriptorCount(), descriptorsBefore) << "a descriptor was left open";
  EXPECT_EQ(throttlingDescriptorsHeld(), 0) << "the descriptor budget was not given back";
  EXPECT_EQ(throttlingMemoryCharged(), 0u) << "pooled memory was not given back";
  EXPECT_EQ(fileLockTableCount(), 0) << "a file lock was not released";
  return countsOf(window);
}

}  // namespace

const char *callName(sys::Call call) {
  static const char *const kNames[] = {
      "open",     "close",     "read",      "write",        "pread",        "pwrite",       "ftruncate",
      "truncate", "fsync",     "stat",      "lstat",     "fstat",        "statfs",       "fstatfs",      "getxattr",
      "lgetxattr", "fgetxattr", "setxattr", "lsetxattr",    "fsetxattr",    "removexattr",  "lremovexattr",
      "fremovexattr", "listxattr", "llistxattr", "flistxattr", "futimes", "rename", "mkdir",
      "realpath", "malloc",    "calloc",    "dup",          "lseek",        "chmod",        "utimes",       "sendfile",
  };
  static_assert(sizeof kNames / sizeof kNames[0] == kKinds, "one name per kind of call");
  return kNames[static_cast<int>(call)];
}

const char *errorName(int error) {
  switch (error) {
    case ENOSPC: return "ENOSPC";
    case EIO: return "EIO";
    case ENOMEM: return "ENOMEM";
    case EMFILE: return "EMFILE";
    case EINTR: return "EINTR";
    default: return "another errno";
  }
}

std::string describe(const Fault &fault) {
  return std::string(callName(fault.call)) + " #" + std::to_string(fault.nth) + " fails with " +
         errorName(fault.error);
}

std::vector<int> plausibleErrors(sys::Call call) {
  using sys::Call;
  switch (call) {
    // Opens without O_CREAT create nothing, so they cannot run out of space; every open can be
    // interrupted while it waits for a FIFO or a device.
    case Call::Open: return {EIO, ENOMEM, EMFILE, EINTR};
    case Call::Close: return {EIO, ENOSPC, EINTR};
    case Call::Read:
    case Call::Pread: return {EIO, EINTR};
    case Call::Write:
    case Call::Pwrite: return {ENOSPC, EIO, EINTR};
    case Call::Ftruncate:
    case Call::Truncate: return {EIO, EINTR};
    // Writing back delayed data may find the disk full.
    case Call::Fsync: return {EIO, ENOSPC, EINTR};
    case Call::Stat:
    case Call::Lstat:
    case Call::Fstat:
    case Call::Statfs:
    case Call::Fstatfs:
    case Call::Getxattr:
    case Call::Lgetxattr:
    case Call::Fgetxattr:
    case Call::Removexattr:
    case Call::Lremovexattr:
    case Call::Fremovexattr:
    case Call::Listxattr:
    case Call::Llistxattr:
    case Call::Flistxattr:
    case Call::Chmod:
    case Call::Realpath: return {EIO, ENOMEM};
    case Call::Setxattr:
    case Call::Lsetxattr:
    case Call::Fsetxattr:
    case Call::Rename:
    case Call::Mkdir: return {ENOSPC, EIO, ENOMEM};
    case Call::Futimes:
    case Call::Utimes: return {EIO};
    case Call::Malloc:
    case Call::Calloc: return {ENOMEM};
    case Call::Dup: return {EMFILE};
    case Call::Lseek:
    case Call::Sendfile: return {EIO};
    case Call::Count: break;
  }
  return {};
}

bool restartedAfterInterrupt(sys::Call call) {
  using sys::Call;
  return call == Call::Open || call == Call::Read || call == Call::Write || call == Call::Pread ||
         call == Call::Pwrite || call == Call::Sendfile || call == Call::Truncate || call == Call::Ftruncate;
}

void FaultWindow::open() {
  if (opened_) return;
  opened_ = true;
  for (int kind = 0; kind < kKinds; kind++) start_[kind] = sys::callCount(static_cast<sys::Call>(kind));
  if (fault_) sys::armFault(fault_->call, fault_->nth, fault_->error);
}

void FaultWindow::close() {
  if (!opened_ || closed_) return;
  closed_ = true;
  sys::clearFaults();
  for (int kind = 0; kind < kKinds; kind++) end_[kind] = sys::callCount(static_cast<sys::Call>(kind));
}

uint64_t FaultWindow::calls(sys::Call call) const {
  int kind = static_cast<int>(call);
  return closed_ ? end_[kind] - start_[kind] : 0;
}

bool FaultWindow::fired() const { return fault_ && calls(fault_->call) >= fault_->nth; }

SweepStats sweepFaults(const std::function<void(FaultWindow &)> &run, const SweepOptions &options) {
  keepSanitizerReportsVisible();
  SweepStats stats;
  Counts clean, again;
  {
    SCOPED_TRACE("clean run");
    clean = runChecked(run, nullptr);
    again = runChecked(run, nullptr);
  }
  for (int kind = 0; kind < kKinds; kind++) {
    EXPECT_EQ(clean[kind], again[kind]) << "two clean runs made different numbers of "
                                        << callName(static_cast<sys::Call>(kind)) << " calls";
    stats.callsInCleanRun += clean[kind];
  }
  if (::testing::Test::HasFailure()) return stats;

  std::vector<sys::Call> kinds = options.calls;
  if (kinds.empty())
    for (int kind = 0; kind < kKinds; kind++) kinds.push_back(static_cast<sys::Call>(kind));
  int failingRuns = 0;
  for (sys::Call call : kinds) {
    std::vector<int> errors = options.errors.empty() ? plausibleErrors(call) : options.errors;
    for (int error : errors)
      for (uint64_t nth = 1; nth <= clean[static_cast<int>(call)]; nth++) {
        Fault fault{call, nth, error};
        if (const char *only = getenv("PLZC_SWEEP_ONLY"); only && describe(fault) != only) continue;
        SCOPED_TRACE(describe(fault));
        int partsBefore = failureCount();
        runChecked(run, &fault);
        stats.runs++;
        if (failureCount() > partsBefore && ++failingRuns >= kMostFailingRuns) {
          ADD_FAILURE() << "stopping the sweep after " << kMostFailingRuns << " failing runs";
          return stats;
        }
      }
  }
  return stats;
}

int openDescriptorCount() {
  DIR *dir = opendir("/proc/self/fd");
  if (!dir) return -1;
  int count = 0;
  while (struct dirent *entry = readdir(dir))
    if (entry->d_name[0] != '.') count++;
  closedir(dir);
  return count;
}

FileState inspect(const std::string &path) {
  FileState state;
  platform::Stat st;
  if (platform::stat(path.c_str(), &st) != 0) return state;
  state.exists = true;
  state.flags = st.st_flags;
  state.mode = st.st.st_mode;
  state.accessed = st.st.st_atim;
  state.modified = st.st.st_mtim;
  state.dataFork = readFile(path);
  state.hasHeader = platform::getxattr(path.c_str(), kDecmpfsXattrName, nullptr, 0, 0, 0) >= 0;
  ssize_t forkSize = platform::getxattr(path.c_str(), kResourceForkXattrName, nullptr, 0, 0, 0);
  state.hasFork = forkSize >= 0;
  if (forkSize > 0) {
    state.fork.resize(static_cast<size_t>(forkSize));
    ssize_t got = platform::getxattr(path.c_str(), kResourceForkXattrName, state.fork.data(), state.fork.size(), 0, 0);
    state.fork.resize(got > 0 ? static_cast<size_t>(got) : 0);
  }
  if (state.hasHeader) {
    FdCapture quiet(2);  // a form that does not decompress says so; the verdict tells it here
    FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
    std::vector<uint8_t> data;
    int result = fh ? decompressData(
                          fh,
                          [](int64_t offset, const void *bytes, int64_t count, void *context) {
                            auto *out = static_cast<std::vector<uint8_t> *>(context);
                            if (out->size() < static_cast<size_t>(offset + count))
                              out->resize(static_cast<size_t>(offset + count));
                            memcpy(out->data() + offset, bytes, static_cast<size_t>(count));
                            return 0;
                          },
                          &data)
                    : -1;
    if (fh) fh->close(fh);
    if (result == 0) state.fromAttributes = std::move(data);
  }
  return state;
}

std::string whereDataLives(const FileState &state, const std::vector<uint8_t> &expected) {
  if (!state.exists) return "";
  bool marked = state.flags & kCompressedFlag;
  bool inAttributes = state.fromAttributes && *state.fromAttributes == expected;
  bool inDataFork = state.dataFork == expected;
  if (marked) {
    if (inAttributes && state.dataFork.empty()) return "compressed";
    if (inAttributes) return "marked compressed with a complete compressed form and data left in the data fork";
    if (inDataFork) return "marked compressed without a usable compressed form, data in the data fork";
    return "";
  }
  if (inDataFork) {
    if (state.hasHeader) return "plain, with a compression header attribute left behind";
    return "plain";
  }
  if (inAttributes)
    return state.dataFork.empty() ? "complete compressed form, data fork empty, not marked compressed"
                                  : "complete compressed form, data fork cut short, not marked compressed";
  return "";
}

namespace {

// "<Common|Compressors|Libraries|Platform>/<path>:<digits>: "
bool hasSourcePrefix(const std::string &line) {
  size_t slash = line.find('/');
  if (slash == std::string::npos) return false;
  std::string top = line.substr(0, slash);
  if (top != "Common" && top != "Compressors" && top != "Libraries" && top != "Platform") return false;
  size_t colon = line.find(':', slash);
  if (colon == std::string::npos || colon == slash + 1) return false;
  size_t digits = colon + 1;
  while (digits < line.size() && isdigit(static_cast<unsigned char>(line[digits]))) digits++;
  return digits > colon + 1 && line.compare(digits, 2, ": ") == 0;
}

}  // namespace

std::string malformedDiagnostic(const std::string &text) {
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    std::string line = text.substr(start, end == std::string::npos ? std::string::npos : end - start);
    if (!hasSourcePrefix(line)) return line;
    if (end == std::string::npos) break;
    start = end + 1;
  }
  return "";
}

bool contains(const std::string &text, const std::string &part) { return text.find(part) != std::string::npos; }

bool sameMicroseconds(const struct timespec &time, const struct timeval &expected) {
  return time.tv_sec == expected.tv_sec && time.tv_nsec / 1000 == expected.tv_usec;
}

bool namesCause(const std::string &text, int error) { return text.find(strerror(error)) != std::string::npos; }

void copyFileWithAttributes(const std::string &from, const std::string &to) {
  struct stat st;  // before reading moves the access time
  ASSERT_EQ(stat(from.c_str(), &st), 0);
  writeFile(to, readFile(from));
  for (const std::string &name : linuxAttributeNames(from)) {
    ssize_t size = getxattr(from.c_str(), name.c_str(), nullptr, 0);
    ASSERT_GE(size, 0) << name;
    std::vector<char> value(static_cast<size_t>(size));
    ASSERT_EQ(getxattr(from.c_str(), name.c_str(), value.data(), value.size()), size) << name;
    ASSERT_EQ(setxattr(to.c_str(), name.c_str(), value.data(), value.size(), 0), 0) << name << ": " << strerror(errno);
  }
  ASSERT_EQ(chmod(to.c_str(), st.st_mode & 07777), 0);
  struct timespec times[2] = {st.st_atim, st.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, to.c_str(), times, 0), 0);
  ASSERT_EQ(utimensat(AT_FDCWD, from.c_str(), times, 0), 0);  // reading it moved its access time
}

void HalfDoneStates::report() {
  for (const std::string &state : states_) printf("half-done state: %s\n", state.c_str());
  states_.clear();
}

}  // namespace plzctest
