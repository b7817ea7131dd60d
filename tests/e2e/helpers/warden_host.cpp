// warden_host: a host process for the supervisor's end-to-end tests. It
// reads commands, one per line, from the FIFO named by its first argument
// and writes one answer line per command to the FIFO named by its second:
//
//   start <plug-in>   asks the supervisor to start it; "started <pid>" or
//                     "error <code> <message>"; keeps the socket it got (and
//                     those of the plug-ins it started before)
//   send <line>       writes the line to the plug-in started last, answers
//                     the plug-in's answer line ("closed" when it went away)
//   ready <service> <uuid>
//                     asks the daemon (its relay service) to make the plug-in
//                     ready for this process; "ready" or "error <code> <message>"
//   hold <service> <flags> <path>
//                     asks the daemon to hold the plug-ins at the path
//                     ("lock"); "held <token>" or "error <code> <message>";
//                     the connection, and so the hold, stays open until exit
//   exit              answers "bye" and exits
//
// It uses the relay like any host: TENON_ROOT names the platform root.

#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <fstream>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"

namespace {

relay::UniqueFd plugInSocket;                  // of the plug-in started last
std::vector<relay::UniqueFd> earlierSockets;  // kept, so those instances keep running

std::string start(const std::string& plugIn) {
  auto queue = tn::dispatch::SerialQueue::create("host");
  auto connection = relay::Connection::connectToService("com.ostrel.tenon.warden", queue);
  if (!connection.ok()) return "error 0 " + connection.error().description();
  (*connection)->setEventHandler([](const relay::Event&) {});
  (*connection)->resume();
  std::promise<std::pair<relay::Reply, relay::Descriptors>> promise;
  (*connection)->sendWithReply(tn::Dictionary{{"request", "start"}, {"plug-in", plugIn}}, relay::Descriptors(),
                               queue, [&](relay::Reply reply, relay::Descriptors descriptors) {
                                 promise.set_value({std::move(reply), std::move(descriptors)});
                               });
  auto [reply, descriptors] = promise.get_future().get();
  (*connection)->cancel();
  if (!reply.ok()) return "error 0 " + reply.error().description();
  if (const auto code = (*reply)["errorcode"].uint64()) {
    const std::string* message = (*reply)["error"].string();
    return "error " + std::to_string(*code) + " " + (message ? *message : "");
  }
  if (descriptors.size() != 1) return "error 0 the reply brought " + std::to_string(descriptors.size()) + " descriptors";
  if (plugInSocket.valid()) earlierSockets.push_back(std::move(plugInSocket));
  plugInSocket = std::move(descriptors[0]);
  return "started " + std::to_string((*reply)["pid"].int64().value_or(0));
}

// The outcome of one request to the daemon.
struct Asked {
  std::string failure;  // "error <code> <message>", or empty
  tn::Value reply;
};

std::vector<std::shared_ptr<relay::Connection>> holdingConnections;

// Sends `request` to `service` on a connection of its own and waits for
// the reply; with `keep`, the connection stays open until the host exits
// (what the daemon ties to it, a hold, lasts as long).
Asked ask(const std::string& service, tn::Value request, bool keep) {
  auto queue = tn::dispatch::SerialQueue::create("host");
  auto connection = relay::Connection::connectToService(service, queue);
  if (!connection.ok()) return {"error 0 " + connection.error().description(), {}};
  (*connection)->setEventHandler([](const relay::Event&) {});
  (*connection)->resume();
  std::promise<relay::Reply> promise;
  (*connection)->sendWithReply(std::move(request), queue,
                               [&](relay::Reply reply) { promise.set_value(std::move(reply)); });
  relay::Reply reply = promise.get_future().get();
  if (keep) {
    holdingConnections.push_back(*connection);
  } else {
    (*connection)->cancel();
  }
  if (!reply.ok()) return {"error 0 " + reply.error().description(), {}};
  if (const auto code = (*reply)["errorcode"].uint64()) {
    const std::string* message = (*reply)["error"].string();
    return {"error " + std::to_string(*code) + " " + (message ? *message : ""), {}};
  }
  return {"", *reply};
}

std::string ready(const std::string& arguments) {
  const std::size_t space = arguments.find(' ');
  const std::optional<tn::UUID> uuid =
      space == std::string::npos ? std::nullopt : tn::UUID::parse(arguments.substr(space + 1));
  if (!uuid) return "error 0 usage: ready <service> <uuid>";
  const Asked asked = ask(arguments.substr(0, space),
                          tn::Dictionary{{"request", "ready"}, {"version", 3}, {"uuids", tn::Array{tn::Value(*uuid)}}},
                          false);
  return asked.failure.empty() ? "ready" : asked.failure;
}

std::string hold(const std::string& arguments) {
  const std::size_t first = arguments.find(' ');
  const std::size_t second = first == std::string::npos ? first : arguments.find(' ', first + 1);
  if (second == std::string::npos) return "error 0 usage: hold <service> <flags> <path>";
  const Asked asked = ask(arguments.substr(0, first),
                          tn::Dictionary{{"request", "lock"}, {"version", 3},
                                         {"flags", std::stoull(arguments.substr(first + 1, second - first - 1),
                                                               nullptr, 0)},
                                         {"paths", tn::Array{tn::Value(arguments.substr(second + 1))}}},
                          true);
  if (!asked.failure.empty()) return asked.failure;
  const std::optional<tn::UUID> token = asked.reply["uuids"].uuid();
  return token ? "held " + token->string() : "error 0 no token in the reply";
}

std::string send(const std::string& line) {
  if (!plugInSocket.valid()) return "closed";
  const std::string text = line + "\n";
  if (::write(plugInSocket.get(), text.data(), text.size()) != static_cast<ssize_t>(text.size())) return "closed";
  std::string answer;
  char c = 0;
  while (::read(plugInSocket.get(), &c, 1) == 1) {
    if (c == '\n') return answer;
    answer.push_back(c);
  }
  return "closed";
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) {
    std::fprintf(stderr, "usage: warden_host <command fifo> <answer fifo>\n");
    return 2;
  }
  std::ifstream commands(argv[1]);
  std::ofstream answers(argv[2]);
  for (std::string line; std::getline(commands, line);) {
    std::string answer;
    if (line.rfind("start ", 0) == 0) {
      answer = start(line.substr(6));
    } else if (line.rfind("ready ", 0) == 0) {
      answer = ready(line.substr(6));
    } else if (line.rfind("hold ", 0) == 0) {
      answer = hold(line.substr(5));
    } else if (line.rfind("send ", 0) == 0) {
      answer = send(line.substr(5));
    } else if (line == "exit") {
      answers << "bye" << std::endl;
      return 0;
    } else {
      answer = "unknown command";
    }
    answers << answer << std::endl;
  }
  return 0;
}
