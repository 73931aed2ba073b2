// Running the plzc binary as a user would: a subprocess with its standard output and error
// captured, its exit status (or 128 + signal), wall time and peak memory reported. Resource
// limits and a user to run as can be applied in the child before it starts plzc.
#pragma once

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
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
  double seconds = 0;     // wall time from start to exit
  long maxRssKiB = 0;     // peak resident memory of the child
  bool timedOut = false;  // killed when the time given was up
};

// What the child changes about itself before it starts plzc.
struct ChildSetup {
  struct Limit {
    int resource;  // RLIMIT_NOFILE, RLIMIT_AS...
    rlim_t soft;
    rlim_t hard;   // RLIM_INFINITY keeps the current hard limit
  };
  std::vector<Limit> limits;
  // Run as this user and group (the caller must be root); -1 keeps the caller's.
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);
  // A child still running after this many seconds is killed (SIGKILL); 0 waits for ever.
  int timeoutSeconds = 0;
};

// A running plzc with its standard output and error on pipes.
class Process {
 public:
  explicit Process(const std::vector<std::string> &args, const ChildSetup &setup = {}) {
    int outPipe[2], errPipe[2];
    if (pipe2(outPipe, O_CLOEXEC) != 0 || pipe2(errPipe, O_CLOEXEC) != 0) return;
    // Everything the child needs is built before the fork: it may only make system calls.
    std::vector<char *> arguments = argv(args);
    std::vector<ChildSetup::Limit> limits = setup.limits;
    for (ChildSetup::Limit &limit : limits) {
      struct rlimit current {};
      getrlimit(limit.resource, &current);
      if (limit.hard == RLIM_INFINITY) limit.hard = current.rlim_max;
    }
    start_ = std::chrono::steady_clock::now();
    timeoutSeconds_ = setup.timeoutSeconds;
    pid_ = fork();
    if (pid_ == 0) {
      dup2(outPipe[1], 1);
      dup2(errPipe[1], 2);
      for (const ChildSetup::Limit &limit : limits) {
        struct rlimit value = {limit.soft, limit.hard};
        if (setrlimit(limit.resource, &value) != 0) _exit(126);
      }
      if (setup.gid != static_cast<gid_t>(-1) && (setgroups(0, nullptr) != 0 || setgid(setup.gid) != 0)) _exit(126);
      if (setup.uid != static_cast<uid_t>(-1) && setuid(setup.uid) != 0) _exit(126);
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
      if (timeoutSeconds_ > 0 && !run_.timedOut &&
          std::chrono::steady_clock::now() - start_ > std::chrono::seconds(timeoutSeconds_)) {
        run_.timedOut = true;
        kill(pid_, SIGKILL);
      }
    }
    int status = 0;
    struct rusage usage {};
    wait4(pid_, &status, 0, &usage);
    waited_ = true;
    run_.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    run_.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start_).count();
    run_.maxRssKiB = usage.ru_maxrss;
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
  std::chrono::steady_clock::time_point start_;
  int timeoutSeconds_ = 0;
  int outFd_ = -1, errFd_ = -1;
  bool waited_ = false;
  Finished run_;
};

inline Finished plzc(const std::vector<std::string> &args, const ChildSetup &setup = {}) {
  return Process(args, setup).wait();
}

}  // namespace plzctest
