#pragma once

#include <sys/types.h>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "common/HeldBytes.h"
#include "common/Protocol.h"
#include "common/Value.h"

namespace qn {

// Sends the reply [request_id, result] for one request. May be called from any thread,
// any number of times (some operations reply twice, some never); does nothing once the
// connection has ended. Replies of one connection go out in the order they are made.
using IpcReply = std::function<void(Value result)>;

// The object a connection hands requests to (the exported object).
class IpcExportedObject {
 public:
  virtual ~IpcExportedObject() = default;
  // One request whose arguments the connection has already checked against the
  // operation table (protocol::ValidateRequest): `args` are the request's arguments only.
  // Called on the IPC layer's thread, one request at a time per connection, in order.
  virtual void HandleRequest(protocol::Op op, const Array& args, IpcReply reply) = 0;

  // Calls `done` once every request handed to HandleRequest before this call has been
  // taken in: its work ran and the replies it makes at once were made (a reply the object
  // keeps back to send later does not count). `done` may run on any thread. Connections use
  // it to bound the requests they have handed over but not yet seen taken in, and to send
  // the replies of requests read before a bad frame ahead of the error frame.
  virtual void AfterRequests(std::function<void()> done) = 0;
};

// One client connection. Handlers and the exported object are set before Resume; the
// connection holds its exported object strongly until it ends.
class IpcConnection {
 public:
  virtual ~IpcConnection() = default;

  // The peer's process and user identifiers (SO_PEERCRED), fixed at accept.
  virtual pid_t PeerPid() const = 0;
  virtual uid_t PeerUid() const = 0;
  // What the service holds for the peer's uid beyond the IPC layer's buffers: one account
  // for every connection of that uid, kept while anything holds it (a reconnecting peer
  // finds its bytes still counted). Never null.
  virtual std::shared_ptr<HeldBytes> PeerHeldBytes() const = 0;
  // A one-line description for logs.
  virtual std::string Description() const = 0;

  virtual void SetExportedObject(std::shared_ptr<IpcExportedObject> object) = 0;
  // Interruption: the peer went away but could come back. A Unix socket is never
  // interrupted, so on Linux this handler is kept but never called.
  virtual void SetInterruptionHandler(std::function<void()> handler) = 0;
  // Invalidation: the connection ended (end of stream, socket error, bad input, or the
  // service closed it). Called exactly once, on the IPC layer's thread.
  virtual void SetInvalidationHandler(std::function<void()> handler) = 0;

  // Starts reading requests.
  virtual void Resume() = 0;
};

class IpcListener;

// Decides on each new connection (the listener's delegate).
class IpcListenerDelegate {
 public:
  virtual ~IpcListenerDelegate() = default;
  // Called on the IPC layer's thread for each accepted connection. Returning false closes it.
  virtual bool ShouldAcceptNewConnection(IpcListener& listener,
                                         std::shared_ptr<IpcConnection> connection) = 0;
};

// The service's listener.
class IpcListener {
 public:
  virtual ~IpcListener() = default;
  // The listener holds its delegate strongly.
  virtual void SetDelegate(std::shared_ptr<IpcListenerDelegate> delegate) = 0;
  // Accepts connections and runs the IPC layer on the calling thread until Stop.
  virtual void Resume() = 0;
  // Stops accepting (safe from any thread or a signal-handling thread); Resume returns
  // once the listener is closed. Open connections are closed (invalidated) too.
  virtual void Stop() = 0;
};

}  // namespace qn
