// Running the plzc binary as a user would: a subprocess with its standard output and error
// captured, its exit status (or 128 + signal) reported.
#pragma once

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

namespace plzctest {

// $PLZC_BINARY, or the tool built beside the test programs.
inline std::string plzcBinary() {
  if (const char *configured = getenv("PLZC_BINARY")) return configured;
  std::filesystem::path self = std::filesystem::read_symlink("/proc/self/exe");
  return (self.parent_path().parent_path() / "Tools" / "plzc" / "plzc").string();
}

struct Finished {
  int status = -1;  // exit status, or 128 + signal
  std::string out, err;
};

// A running plzc with its standard output and error on pipes.
class Process {
 public:
  explicit Process(const std::vector<std::string> &args) {
    int outPipe[2], errPipe[2];
    if (pipe2(outPipe, O_CLOEXEC) != 0 || pipe2(errPipe, O_CLOEXEC) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      dup2(outPipe[1], 1);
      dup2(errPipe[1], 2);
      std::vector<char *> arguments = argv(args);
      execv(arguments[0], arguments.data());
      _exit(127);
    }
    close(outPipe[1]);
    close(errPipe[1]);
    outFd_ = outPipe[0];
    errFd_ = errPipe[0];
  }
  ~Process() {
    if (pid_ > 0 && !waited_) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    if (outFd_ >= 0) close(outFd_);
    if (errFd_ >= 0) close(errFd_);
  }

  // Reads until standard error holds text, or the time is up; true when it does.
  bool waitForErr(const std::string &text, std::chrono::seconds limit) {
    auto end = std::chrono::steady_clock::now() + limit;
    while (run_.err.find(text) == std::string::npos) {
      if (std::chrono::steady_clock::now() > end || !pump(100)) return false;
    }
    return true;
  }
  void signal(int number) { kill(pid_, number); }
  pid_t pid() const { return pid_; }

  Finished wait() {
    while (pump(1000)) {
    }
    int status = 0;
    waitpid(pid_, &status, 0);
    waited_ = true;
    run_.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return run_;
  }

 private:
  static std::vector<char *> argv(const std::vector<std::string> &args) {
    static std::string binary = plzcBinary();
    std::vector<char *> result{binary.data()};
    for (const std::string &arg : args) result.push_back(const_cast<char *>(arg.c_str()));
    result.push_back(nullptr);
    return result;
  }
  // One round of reading; false once both pipes are closed.
  bool pump(int timeoutMs) {
    pollfd fds[2] = {{outFd_, POLLIN, 0}, {errFd_, POLLIN, 0}};
    int open = (outFd_ >= 0) + (errFd_ >= 0);
    if (open == 0) return false;
    if (poll(fds, 2, timeoutMs) <= 0) return true;
    char buffer[65536];
    for (int i = 0; i < 2; i++) {
      if (fds[i].fd < 0 || !(fds[i].revents & (POLLIN | POLLHUP))) continue;
      ssize_t got = read(fds[i].fd, buffer, sizeof buffer);
      if (got > 0) {
        (i == 0 ? run_.out : run_.err).append(buffer, static_cast<size_t>(got));
      } else {
        close(fds[i].fd);
        (i == 0 ? outFd_ : errFd_) = -1;
      }
    }
    return true;
  }

  pid_t pid_ = -1;
  int outFd_ = -1, errFd_ = -1;
  bool waited_ = false;
  Finished run_;
};

inline Finished plzc(const std::vector<std::string> &args) { return Process(args).wait(); }

}  // namespace plzctest
