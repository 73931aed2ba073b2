// Fault sweeps: run an operation once without faults to count the system calls it makes, then
// again and again with one of those calls failing, for every call index of every kind and every
// errno that call can really return on Linux; and the checks that every such run shares.
#pragma once

#include <sys/stat.h>
#include <sys/time.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Platform/Syscalls.h"

namespace plzctest {

// One injected failure: the nth call of a kind, counted from the opening of the window.
struct Fault {
  sys::Call call;
  uint64_t nth;
  int error;
};

const char *callName(sys::Call call);
const char *errorName(int error);
// "fsetxattr #3 fails with ENOSPC"
std::string describe(const Fault &fault);

// The errnos among ENOSPC, EIO, ENOMEM, EMFILE and EINTR that a call of this kind can return
// on Linux. EINTR only where a signal can interrupt the call (slow devices, pipes, FIFOs).
std::vector<int> plausibleErrors(sys::Call call);

// True when the wrappers restart this kind after EINTR: an interrupted call must then change
// nothing at all.
bool restartedAfterInterrupt(sys::Call call);

// The stretch of one run in which calls are counted and the fault is armed: opened just before
// the operation under test, closed right after it, so that preparing and checking files is
// never counted.
class FaultWindow {
 public:
  explicit FaultWindow(const Fault *fault) : fault_(fault) {}
  void open();
  void close();
  // The fault of this run; null for the clean run.
  const Fault *fault() const { return fault_; }
  // Calls of this kind made inside the window.
  uint64_t calls(sys::Call call) const;
  // The faulty call was reached.
  bool fired() const;

 private:
  const Fault *fault_;
  uint64_t start_[static_cast<int>(sys::Call::Count)] = {};
  uint64_t end_[static_cast<int>(sys::Call::Count)] = {};
  bool opened_ = false, closed_ = false;
};

struct SweepOptions {
  // Kinds to sweep; empty means every kind the clean run makes.
  std::vector<sys::Call> calls;
  // Errnos to inject; empty means plausibleErrors() of each kind.
  std::vector<int> errors;
};

struct SweepStats {
  int runs = 0;
  uint64_t callsInCleanRun = 0;
};

// Runs `run` once with a clean window (twice, to prove the call counts are deterministic), then
// once per fault. `run` prepares fresh files, opens the window, runs the operation, closes the
// window and checks the outcome (with SCOPED_TRACE of the fault already in place). Around each
// run the sweep checks that no descriptor stayed open and that the budgets of the throttling
// allocator and the file-lock table are back at rest. To replay one fault while debugging, set
// PLZC_SWEEP_ONLY to its description ("fsetxattr #3 fails with ENOSPC").
SweepStats sweepFaults(const std::function<void(FaultWindow &)> &run, const SweepOptions &options = {});

// Entries of /proc/self/fd.
int openDescriptorCount();

// What a file holds, as its readers and the library see it.
struct FileState {
  bool exists = false;
  std::vector<uint8_t> dataFork;
  uint32_t flags = 0;
  mode_t mode = 0;
  struct timespec accessed = {}, modified = {};
  bool hasHeader = false;  // "com.tavix.decmpfs"
  bool hasFork = false;    // "com.tavix.ResourceFork"
  std::vector<uint8_t> fork;
  // The logical data decompressed from the attributes, when they decompress.
  std::optional<std::vector<uint8_t>> fromAttributes;
};
FileState inspect(const std::string &path);

// Where the file keeps `expected` for its readers: "plain" (data fork, not marked compressed),
// "compressed" (marked, data fork empty, attributes complete), or the description of a
// half-done state in which the data survives somewhere (for example in the attributes of a
// file that is not marked compressed). Empty when the data is lost.
std::string whereDataLives(const FileState &state, const std::vector<uint8_t> &expected);

bool contains(const std::string &text, const std::string &part);
// The time, to the microsecond that utimes keeps, is `expected`.
bool sameMicroseconds(const struct timespec &time, const struct timeval &expected);

// Every line written by the library starts with "<source path>:<line>: " of one of its sources.
// Returns the first line that does not, or an empty string.
std::string malformedDiagnostic(const std::string &text);
// The text names the cause: strerror(error) appears in it.
bool namesCause(const std::string &text, int error);

// Copies a file with its data, every Linux extended attribute (the library's attributes and
// flag word among them), its mode and its times, with plain system calls (nothing counted).
void copyFileWithAttributes(const std::string &from, const std::string &to);

// Half-done states seen during a suite, printed at the end of the test that saw them.
class HalfDoneStates {
 public:
  void add(const std::string &state) { states_.insert(state); }
  // Prints the states seen so far and forgets them; the destructor does it too.
  void report();
  ~HalfDoneStates() { report(); }

 private:
  std::set<std::string> states_;
};

}  // namespace plzctest
