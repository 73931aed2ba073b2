// Where plzc writes, and where the library's own lines go.
//
// plzc's results go to standard output and its messages to standard error. The library also
// prints: failures on standard error (kept), and notes on standard output ("already visited",
// "Type4 file did not shrink"). Those notes would mix with plzc's own output, so while a
// Console is set up the library's standard output is discarded, or sent to standard error
// with --verbose. When standard error is a terminal and progress is wanted, a progress line is
// drawn there, and every line the library prints passes through a relay that clears the
// progress line first.
#pragma once

#include <cstdarg>
#include <cstdio>
#include <mutex>
#include <string>
#include <thread>

namespace plzc {

class Console {
 public:
  // Reroutes descriptors 1 and 2 as described above, until the destructor.
  Console(bool verbose, bool wantProgress);
  ~Console();
  Console(const Console &) = delete;
  Console &operator=(const Console &) = delete;

  // The one console of this process, or null when none is set up.
  static Console *current();

  bool progressEnabled() const { return progress_; }
  bool verbose() const { return verbose_; }

  // plzc's own standard output (buffered; flushed by the destructor).
  void out(const char *format, ...) __attribute__((format(printf, 2, 3)));
  // One message on standard error, after clearing the progress line.
  void err(const char *format, ...) __attribute__((format(printf, 2, 3)));
  // Replaces the progress line (only when progress is enabled).
  void progress(const std::string &line);
  void clearProgress();

 private:
  // Forwards the lines written to one descriptor to standard error.
  struct Relay {
    int targetFd = -1;
    int savedFd = -1;   // the descriptor that was at targetFd before
    int readFd = -1;
    std::thread thread;
  };
  void startRelay(Relay &relay, int targetFd);
  void stopRelay(Relay &relay);
  void relayLoop(int readFd);
  void writeErr(const char *bytes, size_t length);  // with lock_ held
  void clearLocked();

  bool verbose_;
  bool progress_ = false;
  bool progressShown_ = false;
  int outFd_ = -1;      // the process's real standard output
  int errFd_ = -1;      // the process's real standard error
  int savedStdout_ = -1;
  FILE *outStream_ = nullptr;
  Relay stdoutRelay_, stderrRelay_;
  std::mutex lock_;
};

// Text as one line can show it: control characters (a newline inside a file name, say) become
// \n, \t, \r or \xNN, except a newline that ends the text. Other bytes pass unchanged.
std::string visibleText(const std::string &text);

// Messages for code that may run with or without a console: "plzc: " + text, on standard error,
// through visibleText.
void report(const char *format, ...) __attribute__((format(printf, 1, 2)));
// The text as it stands, on standard error.
void reportText(const std::string &text);

}  // namespace plzc
