// platform/relay: the IPC transport of Tenon (library tn_relay, namespace relay).
//
// Processes talk over Unix stream sockets in frames: a big-endian u32
// length, a u64 id, a u64 replyTo and one CBOR map as body (Frame.h). A
// daemon offers a named service with a Listener; each client that connects
// becomes a Connection on its own serial event queue, identified by an
// AuditToken (pid, uid, gid, start time, pidfd) taken when it connected.
// Clients reach a service with Connection::connectToService. Requests and
// replies are dictionaries (tn::Value); replies find their request by
// replyTo and run on the queue the sender named.
//
// The peer is never trusted: every frame rule is checked, a violation ends
// that connection only, and each connection's memory is bounded (16 MiB
// frames, 32 MiB / 1024 undelivered inbound frames before reading pauses,
// 64 MiB unread outbound before the connection is dropped, 1024 live
// connections per user and listener). docs/relay.md has the details and
// the reasons.
//
// One I/O thread per process (Asio) moves the bytes; it runs no user code.
//
//   Listener.h          named endpoint of a service; socket activation
//   Connection.h        a conversation: events, send, sendWithReply, sendReply
//   Event.h             Event, Message, Reply
//   AuditToken.h        peer identity; PeerIdentity.h adds the executable path
//   Descriptors.h       descriptors that travel with a frame (SCM_RIGHTS)
//   PollerWatch.h       a descriptor or a time waited for on the I/O poller
//   KeepAlive.h         process-wide transaction count
//   Termination.h       terminationImminent()
//   SocketActivation.h  takeActivatedSocket(), notifyReady()
//   ServicePath.h       $TENON_ROOT/run/tenon/relay/<service>
//   Frame.h FrameReader.h  the wire format, as pure functions (fuzzed)
//   RelayError.h        error domain "relay"
//
// Internal: Channel (one socket), OutgoingBuffer, PendingReplies,
// InboundBudget, ConnectionLimit, IoContext, ProcessStartTime, UniqueFd.
//
// Including this header includes the public headers above.

#pragma once

#include "platform/relay/AuditToken.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Descriptors.h"
#include "platform/relay/Event.h"
#include "platform/relay/Frame.h"
#include "platform/relay/FrameReader.h"
#include "platform/relay/KeepAlive.h"
#include "platform/relay/Listener.h"
#include "platform/relay/PeerIdentity.h"
#include "platform/relay/PollerWatch.h"
#include "platform/relay/RelayError.h"
#include "platform/relay/ServicePath.h"
#include "platform/relay/SocketActivation.h"
#include "platform/relay/Termination.h"
