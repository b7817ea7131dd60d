#include "tests/support/DaemonProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

extern char** environ;

namespace tn::test {
namespace {

constexpr std::chrono::seconds kStartLimit{10};
constexpr std::chrono::seconds kStopLimit{10};
constexpr std::chrono::milliseconds kPollInterval{20};

std::string uniqueSuffix() {
  static std::atomic<int> counter{0};
  return std::to_string(::getpid()) + "-" + std::to_string(counter++);
}

// This process's environment without Tenon's own variables (a test's
// TENON_ROOT or TENON_LOG must not leak in) and without a journal stream,
// plus the daemon's root and full logging.
std::vector<std::string> daemonEnvironment(const std::string& root) {
  std::vector<std::string> env;
  for (char** entry = environ; *entry; ++entry) {
    const std::string text(*entry);
    if (!text.starts_with("TENON_") && !text.starts_with("JOURNAL_STREAM=")) env.push_back(text);
  }
  env.push_back("TENON_ROOT=" + root);
  env.push_back("TENON_LOG=debug");
  return env;
}

std::vector<char*> pointersTo(std::vector<std::string>& strings) {
  std::vector<char*> pointers;
  for (std::string& s : strings) pointers.push_back(s.data());
  pointers.push_back(nullptr);
  return pointers;
}

// Starts the daemon with stdin and stdout on /dev/null and stderr into its
// log, killed (SIGTERM) if this test program dies first: a crashed test must
// neither leave a daemon behind nor keep CTest's output pipe open through
// one. Only async-signal-safe calls between fork and exec.
pid_t startChild(const std::vector<char*>& argp, const std::vector<char*>& envp, const std::string& logPath) {
  const pid_t parent = ::getpid();
  const pid_t child = ::fork();
  if (child != 0) return child;
  ::prctl(PR_SET_PDEATHSIG, SIGTERM);
  if (::getppid() != parent) ::_exit(127);
  const int in = ::open("/dev/null", O_RDONLY);
  const int out = ::open("/dev/null", O_WRONLY);
  const int log = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  if (in < 0 || out < 0 || log < 0 || ::dup2(in, STDIN_FILENO) < 0 || ::dup2(out, STDOUT_FILENO) < 0 ||
      ::dup2(log, STDERR_FILENO) < 0) {
    ::_exit(127);
  }
  ::execve(argp[0], argp.data(), envp.data());
  ::_exit(127);
}

}  // namespace

DaemonProcess::DaemonProcess(std::string binary, std::vector<std::string> arguments,
                             const std::function<void(const std::string& root)>& prepare,
                             const std::vector<std::string>& extraEnvironment) {
  root_ = (std::filesystem::temp_directory_path() / ("tenond-test-" + uniqueSuffix())).string();
  std::filesystem::create_directories(root_);
  std::filesystem::permissions(root_, std::filesystem::perms(0755));
  if (prepare) prepare(root_);
  service_ = "com.ostrel.tenon.test." + uniqueSuffix();
  logPath_ = root_ + "/tenond.log";

  std::vector<std::string> argv{std::move(binary), "-S", service_};
  argv.insert(argv.end(), arguments.begin(), arguments.end());
  std::vector<std::string> env = daemonEnvironment(root_);
  env.insert(env.end(), extraEnvironment.begin(), extraEnvironment.end());
  std::vector<char*> argp = pointersTo(argv);
  std::vector<char*> envp = pointersTo(env);

  pid_ = startChild(argp, envp, logPath_);
  const auto deadline = std::chrono::steady_clock::now() + kStartLimit;
  while (pid_ > 0 && std::chrono::steady_clock::now() < deadline) {
    if (socketAccepts()) {
      accepting_ = true;
      break;
    }
    if (waitpid(pid_, nullptr, WNOHANG) == pid_) {  // it exited before accepting
      pid_ = -1;
      break;
    }
    std::this_thread::sleep_for(kPollInterval);
  }
}

DaemonProcess::~DaemonProcess() {
  if (pid_ > 0) terminate();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

std::string DaemonProcess::socketPath() const { return root_ + "/run/tenon/relay/" + service_; }

std::vector<std::string> DaemonProcess::environment() const { return {"TENON_ROOT=" + root_}; }

std::string DaemonProcess::log() const {
  std::ifstream in(logPath_);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

int DaemonProcess::terminate() {
  if (pid_ <= 0) return -1;
  kill(pid_, SIGTERM);
  return reap(kStopLimit);
}

// A plain connect, so that this process needs neither the relay nor
// TENON_ROOT to know the daemon is listening. The daemon sees a client come
// and go.
bool DaemonProcess::socketAccepts() const {
  const std::string path = socketPath();
  sockaddr_un address{};
  if (path.size() >= sizeof address.sun_path) return false;
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  const bool connected = ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  ::close(fd);
  return connected;
}

int DaemonProcess::reap(std::chrono::seconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  int status = 0;
  while (waitpid(pid_, &status, WNOHANG) == 0) {
    if (std::chrono::steady_clock::now() > deadline) {
      kill(pid_, SIGKILL);
      waitpid(pid_, &status, 0);
      pid_ = -1;
      return -1;
    }
    std::this_thread::sleep_for(kPollInterval);
  }
  pid_ = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace tn::test
