#pragma once

#include <cstddef>
#include <memory>
#include <string>

#include "platform/ipc.h"
#include "platform/log.h"

namespace qn {

struct LinuxIpcOptions {
  // The socket path to bind when the process was not started by socket activation.
  std::string socket_path;
  // Whether to take the listening socket from systemd (sd_listen_fds) when there is one.
  bool socket_activation = true;
  // Whether Resume tells systemd the service is ready (sd_notify READY=1; a no-op when
  // not started by systemd).
  bool notify_ready = true;
  // A connection whose peer leaves more than this many reply bytes unread is closed.
  std::size_t max_outgoing_bytes = 8u << 20;
  // How long a connection closed for bad input waits for its error frame to be written.
  int error_flush_timeout_ms = 1000;
};

struct LinuxIpcListenerResult {
  std::shared_ptr<IpcListener> listener;  // null on failure
  std::string error;                      // what failed, when listener is null
};

// The IPC layer on a Unix domain stream socket, framed MessagePack (common/Frame.h,
// common/MsgPack.h), on one asio io_context that IpcListener::Resume runs on the calling
// thread: accepting, reading, request checks, HandleRequest calls and the invalidation
// handlers all happen there, so requests reach their exported objects one at a time, in
// order. Replies may be made from any thread.
//
// The listening socket is, in this order: the first socket systemd passed (it must be a
// listening AF_UNIX stream socket), or `socket_path`, bound here with mode 0660 after
// creating its folder (0755). A socket file left behind by a dead daemon is replaced; a path
// where a live daemon answers, or that is not a socket, is refused. A socket file bound
// here is removed again when the listener is destroyed.
//
// Bad input on a connection (bad frame length, bad MessagePack, nesting too deep, not a
// request, unknown operation, wrong arguments) gets the connection error frame, an error
// line in `log` (scope `scope`, may be null), and closes that connection only.
//
// REQUIRES: `log` is not null.
LinuxIpcListenerResult NewLinuxIpcListener(const LinuxIpcOptions& options, std::shared_ptr<Log> log,
                                           std::shared_ptr<const LogScope> scope = nullptr);

}  // namespace qn
