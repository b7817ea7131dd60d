#include "platform/relay/Termination.h"

#include <algorithm>
#include <mutex>
#include <vector>

#include "platform/relay/Connection.h"

namespace relay {
namespace {

struct Registry {
  std::mutex mutex;
  std::vector<std::weak_ptr<Connection>> connections;  // guarded by mutex
  bool announced = false;                              // guarded by mutex
  std::size_t compactAt = 64;  // guarded by mutex: drop expired entries at this size
};

Registry& registry() {
  static Registry* const instance = new Registry;  // used while the process exits
  return *instance;
}

}  // namespace

void announceTerminationTo(Connection& connection) { connection.deliverTerminationImminent(); }

void terminationImminent() {
  std::vector<std::weak_ptr<Connection>> connections;
  {
    Registry& all = registry();
    const std::lock_guard lock(all.mutex);
    all.announced = true;
    connections = all.connections;
  }
  for (const std::weak_ptr<Connection>& weak : connections) {
    if (const std::shared_ptr<Connection> connection = weak.lock()) announceTerminationTo(*connection);
  }
}

namespace detail {

bool registerForTermination(const std::shared_ptr<Connection>& connection) {
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  if (all.connections.size() >= all.compactAt) {
    std::erase_if(all.connections, [](const std::weak_ptr<Connection>& weak) { return weak.expired(); });
    all.compactAt = std::max<std::size_t>(64, 2 * all.connections.size());
  }
  all.connections.push_back(connection);
  return all.announced;
}

}  // namespace detail

}  // namespace relay
