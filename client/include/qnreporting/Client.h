#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/Protocol.h"
#include "common/Value.h"

// libqnreporting: the client side of the quenta reporting service's protocol.
//
//   std::string error;
//   auto client = qn::client::Client::Connect(qn::client::DefaultSocketPath(), &error);
//   if (!client) { fprintf(stderr, "%s\n", error.c_str()); return 1; }
//   client->createReportingSessionSync(42);
//   client->sendMessage(qn::Dictionary{{"route", "speaker"}}, 5, 1, std::vector<int64_t>{42},
//                       [](std::optional<qn::client::ReplyError> e) { ... });
//
// Threads: each Client runs one I/O thread of its own. Every method may be called from any
// thread. Reply callbacks and handlers run on the I/O thread, one at a time, in the order
// the replies arrive; they may call the asynchronous methods, but a blocking (...Sync)
// method called there returns nullopt at once instead of deadlocking.
namespace qn::client {

using Timeout = std::chrono::milliseconds;
inline constexpr Timeout kDefaultTimeout = std::chrono::seconds(10);

// The error domain of problems this library finds in what the service sent, and its codes.
inline constexpr const char* kClientErrorDomain = "com.norvel.quenta.client";
enum class ClientErrorCode : std::int64_t {
  kBadFrame = 1,  // a bad frame length, bad MessagePack or nesting too deep
  kBadReply = 2,  // not [request_id, result], or a result of the wrong type for its request
};

// A connection-level error: the frame [0, {"domain", "code", "message"}] the service sends
// before it closes the connection (codes: qn::protocol::ConnectionError), or a problem this
// library found in the service's bytes (domain kClientErrorDomain; it then closes too).
struct ConnectionError {
  std::string domain;
  std::int64_t code = 0;
  std::string message;
};

// The error reply of sendMessage: {"domain", "code", "userInfo"}.
struct ReplyError {
  std::string domain;
  std::int64_t code = 0;
  Value userInfo;  // nil or a dictionary
};

using BoolCallback = std::function<void(bool)>;
using ServiceTypeCallback = std::function<void(std::uint16_t)>;
using DictionaryCallback = std::function<void(const Dictionary&)>;
using ReporterIDsCallback = std::function<void(const std::vector<std::int64_t>&)>;
using ErrorCallback = std::function<void(const std::optional<ReplyError>&)>;
using ValueCallback = std::function<void(const Value&)>;

// The socket path a client uses by default: the one the daemon binds when started without
// --home or --socket by the same user (root: /run/quenta/reporting.sock). Empty for a user
// other than root without XDG_RUNTIME_DIR (there is no fallback in /tmp); Connect then fails.
std::string DefaultSocketPath();

// One connection to the service.
//
// Replies: each request gets a request id (1 up, wrapping, skipping 0 and ids still in
// use). Its callback is kept until the replies it can expect have arrived — two for
// getServiceNameForReporterID with ID 0, none for killService, one otherwise — or the
// connection ends; so a reply that comes late (a deferred start) still finds it. Replies
// beyond that go to the unexpected-reply handler. Callbacks not called when the connection
// ends are dropped without being called.
//
// Many requests may be in flight at once (pipelining); they are written in the order the
// methods were called, several per write when they queue up.
class Client {
 public:
  // Connects to the service listening at `socket_path`. On failure returns null and, when
  // `error` is given, describes the failure there.
  static std::unique_ptr<Client> Connect(const std::string& socket_path,
                                         std::string* error = nullptr);

  // Writes out the requests still queued (waiting at most a second for a peer that does
  // not read), closes the connection (see Close) and joins the I/O thread. May be called
  // from a callback: the I/O thread then finishes on its own.
  ~Client();

  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // Handlers. Set them before sending requests, or events that happened before are missed.
  // The invalidation handler is called once, when the connection ends for any reason
  // (end of stream, socket error, a connection error, Close). The interruption handler is
  // kept for symmetry with the service's IPC layer; a Unix socket is never interrupted.
  void SetInvalidationHandler(std::function<void()> handler);
  void SetInterruptionHandler(std::function<void()> handler);
  void SetConnectionErrorHandler(std::function<void(const ConnectionError&)> handler);
  // A reply whose request id has no callback left: (request id, result).
  void SetUnexpectedReplyHandler(std::function<void(std::uint32_t, const Value&)> handler);

  // The eleven operations, asynchronous. Each returns the request id, or 0 when the
  // connection has ended (the callback is then never called). A null callback is allowed.
  std::uint32_t createReportingSession(std::int64_t reporterID, BoolCallback reply);
  std::uint32_t setServiceType(std::uint16_t serviceType, std::int64_t reporterID,
                               BoolCallback reply);
  // Replies twice for reporter ID 0.
  std::uint32_t getServiceNameForReporterID(std::int64_t reporterID, ServiceTypeCallback reply);
  // REQUIRES: `configuration` is a dictionary.
  std::uint32_t setConfiguration(Value configuration, std::int64_t reporterID, BoolCallback reply);
  // The reply may come only when the session is stopped or started again.
  std::uint32_t startReportingSessionForID(std::int64_t reporterID, BoolCallback reply);
  // `reporterIDs` absent: every started session of every client.
  // REQUIRES: `message` is a dictionary.
  std::uint32_t sendMessage(Value message, std::uint32_t category, std::uint16_t type,
                            std::optional<std::vector<std::int64_t>> reporterIDs,
                            ErrorCallback reply);
  std::uint32_t stopReportingSessionForID(std::int64_t reporterID, BoolCallback reply);
  std::uint32_t destroyReportingSession(std::int64_t reporterID, BoolCallback reply);
  // {"reporterID": ..., "serviceType": ...}
  std::uint32_t reporterIDValid(std::int64_t reporterID, DictionaryCallback reply);
  std::uint32_t getAllReporters(ReporterIDsCallback reply);
  // Ends the service (it never replies).
  std::uint32_t killService(BoolCallback reply = nullptr);

  // Any request, untyped: `args` go on the wire as they are and the result comes back as
  // it was sent. `expected_replies` is how many replies the callback waits for.
  std::uint32_t SendRequest(protocol::Op op, Array args, ValueCallback reply,
                            int expected_replies = 1);
  // Writes `bytes` to the socket as they are, after whatever is queued (for testing the
  // service's handling of malformed input).
  void SendRawBytes(std::string bytes);

  // Blocking forms: the reply, or nullopt when none came within `timeout`, the connection
  // ended first, or the call was made on the I/O thread. getServiceNameForReporterIDSync
  // returns the last reply (the second one for ID 0).
  std::optional<bool> createReportingSessionSync(std::int64_t reporterID,
                                                 Timeout timeout = kDefaultTimeout);
  std::optional<bool> setServiceTypeSync(std::uint16_t serviceType, std::int64_t reporterID,
                                         Timeout timeout = kDefaultTimeout);
  std::optional<std::uint16_t> getServiceNameForReporterIDSync(std::int64_t reporterID,
                                                               Timeout timeout = kDefaultTimeout);
  std::optional<bool> setConfigurationSync(Value configuration, std::int64_t reporterID,
                                           Timeout timeout = kDefaultTimeout);
  std::optional<bool> startReportingSessionForIDSync(std::int64_t reporterID,
                                                     Timeout timeout = kDefaultTimeout);
  // The outer optional: whether a reply came; the inner: the error it carried.
  std::optional<std::optional<ReplyError>> sendMessageSync(
      Value message, std::uint32_t category, std::uint16_t type,
      std::optional<std::vector<std::int64_t>> reporterIDs, Timeout timeout = kDefaultTimeout);
  std::optional<bool> stopReportingSessionForIDSync(std::int64_t reporterID,
                                                    Timeout timeout = kDefaultTimeout);
  std::optional<bool> destroyReportingSessionSync(std::int64_t reporterID,
                                                  Timeout timeout = kDefaultTimeout);
  std::optional<Dictionary> reporterIDValidSync(std::int64_t reporterID,
                                                Timeout timeout = kDefaultTimeout);
  std::optional<std::vector<std::int64_t>> getAllReportersSync(Timeout timeout = kDefaultTimeout);

  // Waits until every request sent so far has had the replies it expects (and their
  // callbacks have returned). Returns false when `timeout` passed first, the connection
  // ended with replies outstanding (the invalidation handler has then run), or the call
  // was made on the I/O thread.
  bool WaitForReplies(Timeout timeout = kDefaultTimeout);
  // Waits until the connection has ended (the invalidation handler has run). Returns
  // whether it did within `timeout`.
  bool WaitUntilEnded(Timeout timeout = kDefaultTimeout);

  // Waits until everything sent so far has been written to the socket. Returns false when
  // `timeout` passed first, the connection ended, or the call was made on the I/O thread.
  bool Flush(Timeout timeout = kDefaultTimeout);

  // Closes the connection. Requests not yet written (see Flush) and replies not yet
  // received are dropped; the invalidation handler runs (once) if it has not yet. Returns
  // at once; the handler runs on the I/O thread.
  void Close();
  // Whether the connection is still open.
  bool connected() const;
  // Requests still waiting for replies they expect.
  std::size_t outstanding() const;

  class Impl;

 private:
  explicit Client(std::shared_ptr<Impl> impl);
  std::shared_ptr<Impl> impl_;
};

}  // namespace qn::client
