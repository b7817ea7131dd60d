// SocketActivation: taking over a listening socket passed by systemd, and
// telling systemd the daemon is ready.
//
// With socket activation the service manager binds the socket and starts
// the daemon with it (LISTEN_FDS, LISTEN_PID, optionally LISTEN_FDNAMES). A
// Listener asks takeActivatedSocket() first and binds its own socket only
// when nothing was passed for its service.

#pragma once

#include <string_view>

#include "platform/relay/UniqueFd.h"

namespace relay {

// The passed listening AF_UNIX stream socket for `serviceName`, or an
// invalid fd when there is none. When the sockets carry names
// (FileDescriptorName= in the socket unit) only the one named `serviceName`
// matches; unnamed sockets ("unknown", or no LISTEN_FDNAMES) are handed out
// in order to whichever listeners ask. Each passed socket is handed out at
// most once per process. The environment is left as it is (child processes
// see a LISTEN_PID that is not theirs and ignore it). Threads: any.
UniqueFd takeActivatedSocket(std::string_view serviceName);

// Reports readiness to the service manager (sd_notify "READY=1"). Does
// nothing, harmlessly, when the process was not started with a notify
// socket. Call once the listeners are resumed. Threads: any.
void notifyReady();

}  // namespace relay
