#pragma once

// The real tenond, started for one test on a private TENON_ROOT with every
// log level on and its stderr kept in a file the test can read.

#include <sys/types.h>

#include <chrono>
#include <string>
#include <vector>

namespace tn::test {

class TenondProcess {
 public:
  // Starts build/.../tenond/tenond with `arguments` (a unique -S is added
  // unless `addService` is false) and waits until the service accepts
  // connections, or until the process exits.
  explicit TenondProcess(std::vector<std::string> arguments = {}, bool addService = true);
  ~TenondProcess();

  const std::string& root() const { return root_; }
  const std::string& service() const { return service_; }
  pid_t pid() const { return pid_; }
  bool accepting() const { return accepting_; }

  // Everything the daemon logged so far.
  std::string log() const;
  // Sends SIGTERM and waits; the exit status, or -1 when it did not exit normally.
  int terminate();
  // Waits for the process to exit on its own; its exit status.
  int wait(std::chrono::seconds limit = std::chrono::seconds(10));

 private:
  std::string root_;
  std::string service_;
  std::string logPath_;
  pid_t pid_ = -1;
  bool accepting_ = false;
};

// Counts of the annotation-change notification under `root`.
uint64_t annotationChangeCount(const std::string& root);

}  // namespace tn::test
