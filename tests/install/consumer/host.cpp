// A host program as someone outside the Tenon tree writes it: only the
// installed headers and library. It asks tenond (service argv[1]) for a
// plug-in by a random UUID and for its matches, and prints what it got:
//   find: <the daemon's error>
//   match: <number of matches>
// Exit status 0 when both replies came from the daemon, 1 otherwise.

#include <tenon/TNDaemonClient.h>

#include <future>
#include <iostream>
#include <string>

namespace {

// The reply to one request, waited for on this thread.
relay::Reply await(const std::function<void(tn::TNDaemonClient::ReplyBlock)>& send) {
  std::promise<relay::Reply> promise;
  send([&promise](relay::Reply reply) { promise.set_value(std::move(reply)); });
  return promise.get_future().get();
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::cerr << "usage: host SERVICE\n";
    return 2;
  }
  tn::TNDaemonClient client{std::string(argv[1])};

  relay::Reply found = await([&](auto reply) { client.findPlugInByUUID(tn::UUID::random(), reply); });
  if (!found) {
    std::cerr << "host: tenond not reached: " << found.error().description() << "\n";
    return 1;
  }
  std::optional<tn::Error> error = tn::TNDaemonClient::errorInReply(found);
  std::cout << "find: " << (error ? error->description() : found->description()) << "\n";

  relay::Reply matched = await([&](auto reply) { client.matchPlugIns(tn::Dictionary{}, 0, reply); });
  if (!matched || tn::TNDaemonClient::errorInReply(matched)) {
    std::cerr << "host: match failed\n";
    return 1;
  }
  const tn::Value matches = client.convertFromRelay((*matched)["matches"]);
  std::cout << "match: " << (matches.array() != nullptr ? matches.array()->size() : 0) << "\n";
  return 0;
}
