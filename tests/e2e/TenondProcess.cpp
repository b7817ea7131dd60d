#include "tests/e2e/TenondProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "platform/notify/Post.h"
#include "platform/relay/Connection.h"

extern char** environ;

namespace tn::test {
namespace {

std::string uniqueName(const char* prefix) {
  static std::atomic<int> counter{0};
  return std::string(prefix) + std::to_string(getpid()) + "-" + std::to_string(counter++);
}

}  // namespace

TenondProcess::TenondProcess(std::vector<std::string> arguments, bool addService) {
  root_ = (std::filesystem::temp_directory_path() / uniqueName("tenond-e2e-")).string();
  std::filesystem::create_directories(root_);
  service_ = uniqueName("com.ostrel.tenon.test.");
  logPath_ = root_ + "/tenond.log";

  std::vector<std::string> argv{std::string(TENON_BINARY_DIR) + "/tenond/tenond"};
  if (addService) argv.insert(argv.end(), {"-S", service_});
  argv.insert(argv.end(), arguments.begin(), arguments.end());
  std::vector<char*> args;
  for (auto& a : argv) args.push_back(a.data());
  args.push_back(nullptr);

  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    std::string entry(*e);
    if (entry.rfind("TENON_", 0) != 0 && entry.rfind("JOURNAL_STREAM=", 0) != 0) env.push_back(entry);
  }
  env.push_back("TENON_ROOT=" + root_);
  env.push_back("TENON_LOG=debug");
  std::vector<char*> envp;
  for (auto& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 2, logPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  posix_spawn(&pid_, args[0], &actions, nullptr, args.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);

  // The test's own connections look for the service under the same root.
  setenv("TENON_ROOT", root_.c_str(), 1);
  auto queue = dispatch::SerialQueue::create("probe");
  for (int i = 0; i < 500 && pid_ > 0; ++i) {
    if (waitpid(pid_, nullptr, WNOHANG) != 0) break;  // it exited
    if (relay::Connection::connectToService(service_, queue)) {
      accepting_ = true;
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
}

TenondProcess::~TenondProcess() {
  if (pid_ > 0 && waitpid(pid_, nullptr, WNOHANG) == 0) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

std::string TenondProcess::log() const {
  std::ifstream in(logPath_);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

int TenondProcess::terminate() {
  kill(pid_, SIGTERM);
  return wait();
}

int TenondProcess::wait(std::chrono::seconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  int status = 0;
  while (waitpid(pid_, &status, WNOHANG) == 0) {
    if (std::chrono::steady_clock::now() > deadline) return -1;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  pid_ = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

uint64_t annotationChangeCount(const std::string& root) {
  const char* saved = std::getenv("TENON_ROOT");
  std::string previous = saved ? saved : "";
  setenv("TENON_ROOT", root.c_str(), 1);
  auto count = notify::postCount("com.ostrel.tenon.annotation-change");
  setenv("TENON_ROOT", previous.c_str(), 1);
  return count ? *count : 0;
}

}  // namespace tn::test
