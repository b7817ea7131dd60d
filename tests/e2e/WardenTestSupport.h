#pragma once

// What the end-to-end tests of plug-in activation share: a daemon root with
// the sandbox profiles and the example plug-in, one request to a service,
// and a host process (tests/e2e/helpers/warden_host) driven through two
// FIFOs: it readies plug-ins, starts them through the supervisor and talks
// to them. When the tests run as root, hosts run as uid 65534.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TrustedInstall.h"

namespace tn::test::warden_support {

namespace fs = std::filesystem;
using tn::test::ChildProcess;

inline constexpr uid_t kNobody = 65534;
inline constexpr const char* kPlugIn = "com.example.upcase";

inline void install(const fs::path& from, const fs::path& to, fs::perms mode) {
  fs::create_directories(to.parent_path());
  fs::copy_file(from, to, fs::copy_options::overwrite_existing);
  fs::permissions(to, mode);
}

// Every directory under root traversable and readable by every user (the
// plug-in and the host may run as 65534, and the checkout's umask may be
// 027), except the data containers, which belong to the plug-in's user.
inline void openDirectories(const std::string& root) {
  const fs::path containers = fs::path(root) / "var/lib/tenon/containers";
  fs::permissions(root, fs::perms(0755));
  for (auto entry = fs::recursive_directory_iterator(root); entry != fs::recursive_directory_iterator(); ++entry) {
    if (entry->path() == containers) {
      fs::permissions(entry->path(), fs::perms(0755));
      entry.disable_recursion_pending();
    } else if (entry->is_directory() && !entry->is_symlink()) {
      fs::permissions(entry->path(), fs::perms(0755));
    }
  }
}

// What the daemon's root needs: the profiles, the example bundle, and the
// plug-in's data container, owned by the user the plug-in will run as.
inline void prepareRoot(const std::string& root, uid_t hostUid) {
  for (const auto& profile : fs::directory_iterator(TENON_SOURCE_DIR "/packaging/sandbox-profiles")) {
    install(profile.path(), fs::path(root) / "usr/share/tenon/sandbox-profiles" / profile.path().filename(),
            fs::perms(0644));
  }
  const fs::path bundle = fs::path(root) / "opt/plugins/Upcase.bundle";
  install(TENON_SOURCE_DIR "/examples/plugins/Upcase.bundle/Info.manifest", bundle / "Info.manifest", fs::perms(0644));
  install(TENON_BINARY_DIR "/examples/plugins/upcase/upcase", bundle / "bin/upcase", fs::perms(0755));
  const fs::path container = fs::path(root) / "var/lib/tenon/containers" / kPlugIn;
  fs::create_directories(container);
  openDirectories(root);
  ASSERT_EQ(::chown(container.c_str(), hostUid, hostUid), 0);
  fs::permissions(container, fs::perms(0700));
}

// One request to a service of the daemon's root, answered within 20 s.
inline tn::Value ask(const std::string& service, tn::Value request) {
  auto queue = tn::dispatch::SerialQueue::create("test.ask");
  auto connection = relay::Connection::connectToService(service, queue);
  if (!connection.ok()) return tn::Dictionary{{"error", connection.error().description()}};
  (*connection)->setEventHandler([](const relay::Event&) {});
  (*connection)->resume();
  auto promise = std::make_shared<std::promise<relay::Reply>>();
  (*connection)->sendWithReply(std::move(request), queue, [promise](relay::Reply reply) { promise->set_value(reply); });
  auto future = promise->get_future();
  if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) return tn::Dictionary{{"error", "no reply"}};
  relay::Reply reply = future.get();
  (*connection)->cancel();
  return reply.ok() ? *reply : tn::Dictionary{{"error", reply.error().description()}};
}

// The host process and the two FIFOs the test drives it through.
class Host {
 public:
  Host(const std::string& root, uid_t uid) : commands_(root + "/host-commands"), answers_(root + "/host-answers") {
    ::mkfifo(commands_.c_str(), 0666);
    ::mkfifo(answers_.c_str(), 0666);
    ::chmod(commands_.c_str(), 0666);
    ::chmod(answers_.c_str(), 0666);
    // Both ends held here, so no open blocks whatever the host does.
    commandFd_ = ::open(commands_.c_str(), O_RDWR | O_CLOEXEC);
    answerFd_ = ::open(answers_.c_str(), O_RDWR | O_CLOEXEC);
    const bool drop = ::geteuid() == 0;
    // A copy in the root, which every user may traverse: the build tree may
    // not be (a checkout made with umask 027), and the host may run as 65534.
    const std::string program =
        tn::test::installFile(TENON_BINARY_DIR "/tests/e2e/warden_host", root, "usr/libexec/warden_host", 0755);
    child_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{program, commands_, answers_},
        std::vector<std::string>{"TENON_ROOT=" + root}, [drop, uid] {
          if (!drop) return true;
          return ::syscall(SYS_setgroups, 0, nullptr) == 0 && ::syscall(SYS_setresgid, uid, uid, uid) == 0 &&
                 ::syscall(SYS_setresuid, uid, uid, uid) == 0;
        });
  }
  ~Host() {
    if (child_->pid() > 0) command("exit");
    child_.reset();
    ::close(commandFd_);
    ::close(answerFd_);
  }

  pid_t pid() const { return child_->pid(); }

  // Sends one command and returns its answer line ("" after 20 s).
  std::string command(const std::string& line) {
    const std::string text = line + "\n";
    if (::write(commandFd_, text.data(), text.size()) != static_cast<ssize_t>(text.size())) return "";
    std::string answer;
    for (char c = 0;;) {
      pollfd ready{answerFd_, POLLIN, 0};
      if (::poll(&ready, 1, 20000) != 1 || ::read(answerFd_, &c, 1) != 1) return "";
      if (c == '\n') return answer;
      answer.push_back(c);
    }
  }

  tn::test::ProcessResult finish() { return child_->finish(); }

 private:
  std::string commands_;
  std::string answers_;
  int commandFd_ = -1;
  int answerFd_ = -1;
  std::unique_ptr<ChildProcess> child_;
};

inline pid_t startedPid(const std::string& answer) {
  return answer.rfind("started ", 0) == 0 ? static_cast<pid_t>(std::stoi(answer.substr(8))) : 0;
}

}  // namespace tn::test::warden_support
