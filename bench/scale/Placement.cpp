#include "bench/scale/Placement.h"

#include <cerrno>
#include <cstring>

#include "bench/scale/Failure.h"
#include "bench/scale/ProcessWatch.h"

namespace tn::bench {
namespace {

cpu_set_t only(int processor) {
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(processor, &set);
  return set;
}

void place(pid_t thread, const cpu_set_t& set) {
  // A thread that ended meanwhile (ESRCH) has nowhere to run.
  if (::sched_setaffinity(thread, sizeof set, &set) != 0 && errno != ESRCH) {
    fail("cannot place thread " + std::to_string(thread) + ": " + std::strerror(errno));
  }
}

void placeProcess(pid_t process, const cpu_set_t& set) {
  for (const pid_t thread : threadsOf(process)) place(thread, set);
}

}  // namespace

std::vector<int> usableProcessors() {
  cpu_set_t set;
  if (::sched_getaffinity(0, sizeof set, &set) != 0) return {};
  std::vector<int> processors;
  for (int processor = 0; processor < CPU_SETSIZE; ++processor) {
    if (CPU_ISSET(processor, &set)) processors.push_back(processor);
  }
  return processors;
}

ScopedPlacement::ScopedPlacement(int clientProcessor, int serverProcessor, const std::vector<pid_t>& servers) {
  if (::sched_getaffinity(0, sizeof client_, &client_) != 0) fail("cannot read the benchmark's affinity");
  for (const pid_t server : servers) {
    cpu_set_t before;
    if (::sched_getaffinity(server, sizeof before, &before) != 0) {
      fail("cannot read the affinity of process " + std::to_string(server));
    }
    servers_.emplace_back(server, before);
  }
  place(0, only(clientProcessor));
  for (const pid_t server : servers) placeProcess(server, only(serverProcessor));
}

ScopedPlacement::~ScopedPlacement() {
  ::sched_setaffinity(0, sizeof client_, &client_);
  for (const auto& [server, before] : servers_) {
    for (const pid_t thread : threadsOf(server)) ::sched_setaffinity(thread, sizeof before, &before);
  }
}

}  // namespace tn::bench
