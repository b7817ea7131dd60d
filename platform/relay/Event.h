// Event, Message, Reply: what a connection hands to the code that owns it.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/relay/Descriptors.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace relay {

namespace detail {
class Channel;
}

// A request received on a connection. Answer it with
// Connection::sendReply(message, reply) on the connection it came from.
struct Message {
  uint64_t id = 0;  // the peer's id for the frame; a reply names it as replyTo
  tn::Value body;   // always a dictionary
  // The socket the request came on: a reply must leave on the same one (a
  // client connection that reconnected has a new socket and a new peer).
  std::weak_ptr<detail::Channel> channel;
  // The request's share of its connection's inbound budget (see
  // docs/relay.md, "Limits"): given back when the last copy of the message
  // is gone (or its owner resets this) and the reply sent with it, if any,
  // has left for the peer. An owner that keeps its requests until it has
  // answered them thereby limits how many a peer can have unanswered, and a
  // peer that does not read its replies stops being read itself.
  std::shared_ptr<const void> charge;
  // The descriptors that came with the frame (Descriptors.h), or null when
  // it brought none. Copies of the message share them; whoever keeps them
  // moves them out, and what is left is closed with the last copy.
  std::shared_ptr<Descriptors> descriptors = nullptr;
};

// What a reply handler receives: the reply's body (a dictionary), or a
// relay error (RelayError.h): ConnectionInvalid, ConnectionInterrupted, or a
// local refusal of the request (MessageTooLarge, NotAMessage).
using Reply = tn::Result<tn::Value>;
using ReplyHandler = std::function<void(Reply)>;
// A reply handler that also takes the descriptors the reply brought (empty
// for an error or a reply without any).
using DescriptorReplyHandler = std::function<void(Reply, Descriptors)>;

struct Event {
  enum class Kind {
    Message,                // a request from the peer: `message`
    ConnectionInterrupted,  // a client connection lost its service; see Connection.h
    ConnectionInvalid,      // the connection is over; always the last event
    TerminationImminent,    // this process is about to exit (relay::terminationImminent())
  };

  Kind kind = Kind::Message;
  relay::Message message;  // Kind::Message only
  std::string reason;      // why, for the other kinds ("the peer closed the connection")
};

}  // namespace relay
