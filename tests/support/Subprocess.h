#pragma once

// Runs a program for a test and captures what it printed: to completion
// (runProcess), or as a child the test talks to meanwhile (ChildProcess).

#include <sys/types.h>

#include <string>
#include <vector>

namespace tn::test {

struct ProcessResult {
  int exitStatus = -1;  // -1 when the process did not exit normally
  std::string out;
  std::string err;
};

// Runs argv[0] (a path) with the given arguments and extra "NAME=value"
// environment entries added to the current environment; stdin is /dev/null.
ProcessResult runProcess(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnvironment = {});

// The current environment with the extra "NAME=value" entries replacing or
// added to it, as runProcess passes it on.
std::vector<std::string> environmentWith(const std::vector<std::string>& extraEnvironment);

// A forked child whose stdout and stderr the test reads and whose exit
// status it collects. setUp runs in the child before exec (it may drop to
// another user, install a seccomp filter, ...), and must make only
// async-signal-safe calls, since this process has threads; when it returns
// false the child exits with kSetUpFailed. env is the child's whole
// environment. stdin is /dev/null.
class ChildProcess {
 public:
  static constexpr int kSetUpFailed = 77;

  template <typename SetUp>
  ChildProcess(std::vector<std::string> argv, std::vector<std::string> env, SetUp setUp) {
    start(std::move(argv), std::move(env), [](void* context) -> bool { return (*static_cast<SetUp*>(context))(); },
          &setUp);
  }
  ~ChildProcess() { finish(); }
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  // -1 once finished.
  pid_t pid() const { return pid_; }

  // Reads everything the child prints until it exits, and reaps it.
  ProcessResult finish();

 private:
  void start(std::vector<std::string> argv, std::vector<std::string> env, bool (*setUp)(void*), void* context);

  pid_t pid_ = -1;
  int out_ = -1;
  int err_ = -1;
  ProcessResult result_;
};

}  // namespace tn::test
