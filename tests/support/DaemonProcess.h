#pragma once

// DaemonProcess: the real tenond, started for one test on a private
// TENON_ROOT under a unique service name, with every log level on and its
// stderr kept in a file the test can read.
//
//   tn::test::DaemonProcess daemon(tn::test::tenondBinaryPath());
//   ASSERT_TRUE(daemon.accepting()) << daemon.log();
//   runProcess({tnctl, "match", "--service", daemon.service()}, daemon.environment());
//
// The root is made with mode 0755 whatever the umask (the daemon trusts
// documents only in directories nobody else may write to); `prepare`, when
// given, runs on it before the daemon starts, for what the daemon reads at
// start-up (its configuration, say).
//
// The constructor returns once the daemon's socket accepts connections (or
// the daemon exited, or 10 seconds passed). It does not change this
// process's environment: subprocesses get environment(); a test that talks
// to the daemon itself sets TENON_ROOT to root() first.
//
// The destructor stops a daemon still running with SIGTERM, waits for it
// (SIGKILL after 10 seconds), reaps it and removes the root.

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <vector>

namespace tn::test {

#ifdef TENON_BINARY_DIR
// Where the build puts the daemon (test programs define TENON_BINARY_DIR).
inline std::string tenondBinaryPath() { return std::string(TENON_BINARY_DIR "/tenond/tenond"); }
#endif

class DaemonProcess {
 public:
  // Starts `binary` (usually tenondBinaryPath()) with "-S <unique service>"
  // followed by `arguments`, after prepare(root()), with the "NAME=value"
  // entries of `extraEnvironment` added to its environment.
  explicit DaemonProcess(std::string binary, std::vector<std::string> arguments = {},
                         const std::function<void(const std::string& root)>& prepare = {},
                         const std::vector<std::string>& extraEnvironment = {});
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  const std::string& root() const { return root_; }
  const std::string& service() const { return service_; }
  // $root/run/tenon/relay/<service>
  std::string socketPath() const;
  pid_t pid() const { return pid_; }
  // True when the socket accepted a connection after start.
  bool accepting() const { return accepting_; }

  // "TENON_ROOT=<root>", for runProcess()'s extra environment.
  std::vector<std::string> environment() const;

  // Everything the daemon wrote to stderr so far.
  std::string log() const;

  // Sends SIGTERM and reaps the daemon: its exit status, or -1 when it was
  // killed by a signal or did not exit within 10 seconds (it is then killed).
  int terminate();

 private:
  bool socketAccepts() const;
  int reap(std::chrono::seconds limit);

  std::string root_;
  std::string service_;
  std::string logPath_;
  pid_t pid_ = -1;
  bool accepting_ = false;
};

}  // namespace tn::test
