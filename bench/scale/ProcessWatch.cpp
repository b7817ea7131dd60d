#include "bench/scale/ProcessWatch.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "bench/scale/Failure.h"

namespace tn::bench {
namespace {

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

// The value after "key:" in a /proc status file, or 0.
uint64_t statusField(const std::string& status, const std::string& key) {
  const std::size_t at = status.find("\n" + key + ":");
  if (at == std::string::npos) return 0;
  return std::strtoull(status.c_str() + at + key.size() + 2, nullptr, 10);
}

}  // namespace

ChildDaemon::ChildDaemon(const std::vector<std::string>& argv) {
  std::vector<char*> pointers;
  for (const std::string& argument : argv) pointers.push_back(const_cast<char*>(argument.c_str()));
  pointers.push_back(nullptr);
  const pid_t parent = ::getpid();
  pid_ = ::fork();
  if (pid_ < 0) fail("cannot fork");
  if (pid_ == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (::getppid() != parent) ::_exit(127);
    const int null = ::open("/dev/null", O_WRONLY);
    ::dup2(null, STDERR_FILENO);
    ::execv(pointers[0], pointers.data());
    ::_exit(127);
  }
}

ChildDaemon::~ChildDaemon() { stop(); }

void ChildDaemon::stop() {
  if (pid_ <= 0) return;
  ::kill(pid_, SIGTERM);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (::waitpid(pid_, nullptr, WNOHANG) == 0) {
    if (std::chrono::steady_clock::now() > deadline) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  pid_ = -1;
}

uint64_t residentBytes(pid_t pid) {
  const std::string status = readFile("/proc/" + std::to_string(pid) + "/status");
  if (status.empty()) fail("process " + std::to_string(pid) + " is gone");
  return statusField(status, "VmRSS") * 1024;
}

uint64_t cpuTicks(pid_t pid) {
  const std::string stat = readFile("/proc/" + std::to_string(pid) + "/stat");
  // The name (field 2) is in parentheses and may hold spaces: count from
  // after it. utime and stime are fields 14 and 15.
  const std::size_t close = stat.rfind(')');
  if (close == std::string::npos) fail("process " + std::to_string(pid) + " is gone");
  std::istringstream fields(stat.substr(close + 2));
  std::string field;
  uint64_t ticks = 0;
  for (int number = 3; number <= 15 && fields >> field; ++number) {
    if (number >= 14) ticks += std::stoull(field);
  }
  return ticks;
}

std::vector<pid_t> threadsOf(pid_t pid) {
  std::vector<pid_t> threads;
  std::error_code error;
  for (const auto& task : std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", error)) {
    threads.push_back(static_cast<pid_t>(std::stol(task.path().filename().string())));
  }
  if (error) fail("cannot list the threads of process " + std::to_string(pid));
  return threads;
}

std::map<std::string, uint64_t> threadSwitches(pid_t pid) {
  std::map<std::string, uint64_t> switches;
  for (const pid_t thread : threadsOf(pid)) {
    const std::string task = "/proc/" + std::to_string(pid) + "/task/" + std::to_string(thread);
    std::string name = readFile(task + "/comm");
    if (!name.empty() && name.back() == '\n') name.pop_back();
    const std::string status = readFile(task + "/status");
    switches[std::to_string(thread) + " " + name] =
        statusField(status, "voluntary_ctxt_switches") + statusField(status, "nonvoluntary_ctxt_switches");
  }
  return switches;
}

std::map<std::string, uint64_t> wokenThreads(const std::map<std::string, uint64_t>& earlier,
                                             const std::map<std::string, uint64_t>& later) {
  std::map<std::string, uint64_t> woken;
  for (const auto& [thread, count] : later) {
    const auto before = earlier.find(thread);
    const uint64_t base = before == earlier.end() ? 0 : before->second;
    if (count > base) woken[thread] = count - base;
  }
  return woken;
}

}  // namespace tn::bench
