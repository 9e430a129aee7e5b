#pragma once

#include <unistd.h>

#include <array>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

#include "common/Counters.h"
#include "platform/ipc.h"
#include "platform/log.h"

namespace qn {

// What a peer makes the IPC layer hold, in bytes; each has a budget per uid and one for all
// peers together.
enum IpcBudget : std::size_t {
  kIpcRequestBytes,  // requests handed to the exported object, not yet taken in
  kIpcFrameBytes,    // bytes read and not yet handed over: partial frames, and whole ones
                     // waiting their turn
  kIpcReplyBytes,    // replies not yet written to the peer
  kIpcBudgetCount,
};
struct IpcByteBudget {
  std::size_t per_uid;
  std::size_t total;
};

struct LinuxIpcOptions {
  // The socket path to bind when the process was not started by socket activation.
  std::string socket_path;
  // Whether to take the listening socket from systemd (sd_listen_fds) when there is one.
  bool socket_activation = true;
  // Whether Resume tells systemd the service is ready (sd_notify READY=1; a no-op when
  // not started by systemd).
  bool notify_ready = true;
  // Connections open at once, in all and of one uid; one more gets the error frame (code 8)
  // and is closed.
  std::size_t max_connections = 4096;
  std::size_t max_connections_per_uid = 512;
  // While the connections of a peer's uid, or of all uids, hold a budget's bytes or more,
  // that peer is not read (a request or reply budget also holds back the requests already
  // read). Nothing is dropped: the peer's writes wait in its socket.
  std::array<IpcByteBudget, kIpcBudgetCount> budgets = {IpcByteBudget{4u << 20, 16u << 20},
                                                        IpcByteBudget{4u << 20, 16u << 20},
                                                        IpcByteBudget{4u << 20, 16u << 20}};
  // A connection whose read bytes hold no whole frame for this long gets the error frame
  // (code 2) and is closed, so a frame that never ends cannot hold its buffer for ever.
  int partial_frame_timeout_ms = 30000;
  // A connection is not read while this many of its requests (or this many bytes of them)
  // have been handed to its exported object and not yet taken in (IpcExportedObject::
  // AfterRequests), so the server queue holds a bounded number of any one client's requests.
  std::size_t max_pending_requests = 256;
  std::size_t max_pending_request_bytes = 1u << 20;
  // A connection is closed when the replies its peer has not read pass this many bytes; it
  // is not read while they are an eighth of that or more.
  std::size_t max_outgoing_bytes = 8u << 20;
  // While the service holds this many bytes or more for a peer's uid of messages waiting
  // for the store, or of single messages waiting in delay timers (IpcConnection::
  // PeerHeldBytes), that uid's connections that have sent a message are not read.
  std::size_t max_store_bytes_per_uid = 4u << 20;
  std::size_t max_parked_bytes_per_uid = 4u << 20;
  // While this returns true, connections that have sent a message are not read (the store
  // is behind). Called on the IPC thread before each frame; may be empty.
  std::function<bool()> message_intake_blocked;
  // Where the IPC layer counts requests, bad frames, pauses and refusals; may be null.
  std::shared_ptr<Counters> counters;
  // The most reporter IDs a request's ID list may hold; a longer list gets the error frame,
  // code 6, and the connection closes. It bounds what one message can make the daemon do.
  std::size_t max_reporter_ids = 256;
  // Besides root, the one uid whose peers may make privileged requests (protocol::
  // IsPrivileged); from any other peer such a request gets the error frame, code 10, and
  // the connection closes. The daemon's own uid.
  uid_t privileged_uid = ::geteuid();
  // How long a connection closed for bad input waits for its error frame to be written.
  int error_flush_timeout_ms = 1000;
};

struct LinuxIpcListenerResult {
  std::shared_ptr<IpcListener> listener;  // null on failure
  std::string error;                      // what failed, when listener is null
  // Call from any thread when message_intake_blocked may have turned false (the store wrote
  // a batch): the connections held back for it are looked at again at once, not at their
  // next periodic look. Cheap when none is held; harmless after the listener is gone.
  std::function<void()> wake_message_intake;
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
// line in `log` (scope `scope`, may be null), and closes that connection only. The replies
// of the requests read before the bad frame go out first. A reply too large for a frame
// closes its connection the same way (code 9).
//
// Flow control (see LinuxIpcOptions): a connection is read only while it has few enough
// requests waiting in the service, its peer reads its replies, its uid and all uids stay
// within their byte budgets, and, once it has sent a message, the store keeps up. A connection held
// back is simply not read; nothing it sent is dropped.
//
// REQUIRES: `log` is not null.
LinuxIpcListenerResult NewLinuxIpcListener(const LinuxIpcOptions& options, std::shared_ptr<Log> log,
                                           std::shared_ptr<const LogScope> scope = nullptr);

}  // namespace qn
