#include "platform/warden/Spawner.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/close_range.h>
#include <linux/seccomp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/warden/WardenError.h"

namespace warden {
namespace {

// The steps of the child, for its failure report.
enum class Step : int { Signals = 1, Session, Groups, Gid, Uid, NoNewPrivs, Landlock, Descriptors, Seccomp, Exec };

const char* stepName(int step) {
  switch (static_cast<Step>(step)) {
    case Step::Signals: return "resetting signals";
    case Step::Session: return "setsid";
    case Step::Groups: return "setgroups";
    case Step::Gid: return "setgid";
    case Step::Uid: return "setuid";
    case Step::NoNewPrivs: return "no_new_privs";
    case Step::Landlock: return "landlock_restrict_self";
    case Step::Descriptors: return "arranging descriptors";
    case Step::Seccomp: return "installing the seccomp filter";
    case Step::Exec: return "exec";
  }
  return "starting";
}

// What the child reads; all pointers into memory prepared before the fork.
struct ChildArguments {
  const char* executable;
  char* const* argv;
  char* const* envp;
  bool changeUser;
  uid_t uid;
  gid_t gid;
  const gid_t* groups;
  std::size_t groupCount;
  int nullDevice;
  int socket;
  int ruleset;
  const sock_fprog* seccomp;
  int report;          // write end of the report pipe
  unsigned maxDescriptor;  // for closing when close_range is missing
};

[[noreturn]] void failChild(int report, Step step) {
  const std::array<int, 2> message{static_cast<int>(step), errno};
  [[maybe_unused]] const ssize_t ignored = ::write(report, message.data(), sizeof message);
  ::_exit(127);
}

bool resetSignals() {
  struct sigaction defaults {};
  defaults.sa_handler = SIG_DFL;
  for (int signal = 1; signal < NSIG; ++signal) {
    if (signal == SIGKILL || signal == SIGSTOP) continue;
    ::sigaction(signal, &defaults, nullptr);  // fails harmlessly for the C library's reserved ones
  }
  sigset_t none;
  ::sigemptyset(&none);
  return ::sigprocmask(SIG_SETMASK, &none, nullptr) == 0;
}

// Moves the descriptors the plug-in keeps into place and closes the rest.
// The report pipe stays open (close-on-exec) until exec.
bool arrangeDescriptors(const ChildArguments& child, int& report) {
  // Above everything that will be placed, so no dup2 below overwrites them.
  const int nullDevice = ::fcntl(child.nullDevice, F_DUPFD_CLOEXEC, 10);
  const int socket = ::fcntl(child.socket, F_DUPFD_CLOEXEC, 10);
  report = ::fcntl(child.report, F_DUPFD_CLOEXEC, 10);
  if (nullDevice < 0 || socket < 0 || report < 0) return false;
  for (int target = 0; target < 3; ++target) {
    if (::dup2(nullDevice, target) < 0) return false;
  }
  if (::dup2(socket, kPluginSocketDescriptor) < 0) return false;  // dup2 clears close-on-exec
  const unsigned first = kPluginSocketDescriptor + 1;
  if (::syscall(SYS_close_range, first, ~0U, CLOSE_RANGE_CLOEXEC) != 0) {
    for (unsigned fd = first; fd <= child.maxDescriptor; ++fd) {
      if (static_cast<int>(fd) != report) ::close(static_cast<int>(fd));
    }
  }
  return true;
}

[[noreturn]] void runChild(const ChildArguments& child) {
  int report = child.report;
  if (!resetSignals()) failChild(report, Step::Signals);
  if (::setsid() < 0) failChild(report, Step::Session);
  if (child.changeUser) {
    // Raw calls: the C library's wrappers would try to reach the parent's threads.
    if (::syscall(SYS_setgroups, child.groupCount, child.groups) != 0) failChild(report, Step::Groups);
    if (::syscall(SYS_setresgid, child.gid, child.gid, child.gid) != 0) failChild(report, Step::Gid);
    if (::syscall(SYS_setresuid, child.uid, child.uid, child.uid) != 0) failChild(report, Step::Uid);
  }
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) failChild(report, Step::NoNewPrivs);
  if (child.ruleset >= 0 && ::syscall(SYS_landlock_restrict_self, child.ruleset, 0) != 0) {
    failChild(report, Step::Landlock);
  }
  if (!arrangeDescriptors(child, report)) failChild(report, Step::Descriptors);
  if (child.seccomp != nullptr &&
      ::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, 0, child.seccomp) != 0) {
    failChild(report, Step::Seccomp);
  }
  ::execve(child.executable, child.argv, child.envp);
  failChild(report, Step::Exec);
}

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> result;
  result.reserve(strings.size() + 1);
  for (std::string& text : strings) result.push_back(text.data());
  result.push_back(nullptr);
  return result;
}

unsigned descriptorLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur == RLIM_INFINITY) return 65536;
  return static_cast<unsigned>(std::min<rlim_t>(limit.rlim_cur, 1u << 20));
}

// Reads the child's report: none when the pipe closed without one (exec worked).
tn::Result<void> readReport(int report, pid_t pid) {
  std::array<int, 2> message{};
  ssize_t n;
  do {
    n = ::read(report, message.data(), sizeof message);
  } while (n < 0 && errno == EINTR);
  if (n == 0) return {};
  if (n != static_cast<ssize_t>(sizeof message)) return makeSystemError("reading the start report", errno);
  siginfo_t ignored{};
  ::waitid(P_PID, static_cast<id_t>(pid), &ignored, WEXITED);  // reap the failed child
  return makeWardenError(message[1], fmt::format("starting the plug-in failed at {}: {}", stepName(message[0]),
                                                 std::strerror(message[1])));
}

}  // namespace

tn::Result<ProcessHandle> spawn(SpawnPlan& plan) {
  std::vector<char*> argv = pointers(plan.arguments);
  std::vector<char*> envp = pointers(plan.environment);
  const relay::UniqueFd nullDevice(::open("/dev/null", O_RDWR | O_CLOEXEC));
  if (!nullDevice.valid()) return makeSystemError("open /dev/null", errno);
  std::array<int, 2> pipeEnds{};
  if (::pipe2(pipeEnds.data(), O_CLOEXEC) != 0) return makeSystemError("pipe2", errno);
  const relay::UniqueFd reportRead(pipeEnds[0]);
  relay::UniqueFd reportWrite(pipeEnds[1]);
  sock_fprog program{static_cast<unsigned short>(plan.seccompProgram.size()), plan.seccompProgram.data()};
  const ChildArguments child{plan.executable.c_str(), argv.data(), envp.data(), plan.changeUser, plan.user.uid,
                             plan.user.gid, plan.user.groups.data(), plan.user.groups.size(), nullDevice.get(),
                             plan.socket.get(), plan.landlockRuleset.valid() ? plan.landlockRuleset.get() : -1,
                             plan.seccompProgram.empty() ? nullptr : &program, reportWrite.get(),
                             descriptorLimit()};
  const pid_t pid = ::fork();
  if (pid < 0) return makeSystemError("fork", errno);
  if (pid == 0) runChild(child);
  reportWrite.reset();
  const long pidfd = ::syscall(SYS_pidfd_open, pid, 0);
  if (tn::Result<void> report = readReport(reportRead.get(), pid); !report.ok()) {
    if (pidfd >= 0) ::close(static_cast<int>(pidfd));
    return report.error();
  }
  if (pidfd < 0) {
    const int error = errno;
    ::kill(pid, SIGKILL);
    siginfo_t ignored{};
    ::waitid(P_PID, static_cast<id_t>(pid), &ignored, WEXITED);
    return makeSystemError("pidfd_open for the started plug-in", error);
  }
  return ProcessHandle::adoptChild(pid, relay::UniqueFd(static_cast<int>(pidfd)));
}

}  // namespace warden
