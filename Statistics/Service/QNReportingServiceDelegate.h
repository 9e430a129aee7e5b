#pragma once

#include <sys/types.h>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Statistics/QNReportingDriverUtility.h"
#include "Statistics/Service/QNReportingServerContext.h"
#include "Statistics/Service/QNReportingServiceDelegateProtocol.h"
#include "common/Value.h"
#include "platform/ipc.h"
#include "platform/platform.h"

namespace qn {

class QNReportingServerInstance;

// The name of the defaults suite and of the notification that makes the service re-read it.
inline constexpr const char* kQNReportingDefaultsSuite = "com.norvel.quenta";
inline constexpr const char* kQNReportingDefaultsNotification = "com.norvel.quenta.reporting";
// The analytics event sent when a client's connection ends.
inline constexpr const char* kQNReportingClientUptimeEvent =
    "com.norvel.quenta.qnreportingclientuptime";

// Reads the reporting defaults from the suite "com.norvel.quenta": "device_name" (the
// suite's string value, only when the suite holds the key) and "disable_reporting" (the
// suite's boolean reading, or the integer 0 when the suite lacks the key). A new
// dictionary each call. Safe from any thread.
Dictionary QNReportingDefaults(const Platform& platform);

// The service delegate: the root of the service front. It accepts every client connection
// (one QNReportingServerInstance per connection, exported through the client protocol),
// keeps the list of connected clients in order of acceptance, ends their bookkeeping when a
// connection goes (with the client-uptime analytics event), searches sessions across
// clients, and owns the reporting defaults, the reporting switch and the driver utility.
//
// Threads: ShouldAcceptNewConnection and the connection handlers run on the IPC layer's
// thread; everything that reads or changes the client list (listing, removal, requests, the
// defaults handler) runs on the one serial server queue. The delegate's own lock (its
// monitor) is taken only while a connection's exported object is made and during the
// cross-client session search; it is never held while another lock is taken.
//
// Lifetime: made once by Create and kept for the life of the process (tests make many).
class QNReportingServiceDelegate final
    : public IpcListenerDelegate,
      public QNReportingServiceDelegateProtocol,
      public std::enable_shared_from_this<QNReportingServiceDelegate> {
 public:
  // The server queue's label; the log scope's code, its string and its name.
  static constexpr const char* kServerQueueLabel = "com.norvel.quenta.reporting.server";
  static constexpr std::uint64_t kLogScopeCode = 0x716E7273;  // "qnrs"
  static constexpr const char* kLogScopeName = "reporting_server_verbose";

  // Builds the delegate, in this order: registers the "qnrs" log scope, creates the server
  // queue, an empty client list, reporting enabled, registers for the defaults notification
  // (the defaults are not read until it first arrives) and, last, the driver utility (which
  // subscribes to the driver channels at once).
  // REQUIRES: `platform` has every service set (log, trace, dispatcher, notify, defaults,
  // process, analytics, enerdex, livo_reporting, ostrel, device_info, orientation).
  struct Options {
    // The most sessions the clients of one uid may hold (see QNReportingServerContext).
    std::size_t maxSessionsPerUid = QNReportingServerContext::kDefaultMaxSessionsPerUid;
    // The most sessions all clients together may hold.
    std::size_t maxSessions = QNReportingServerContext::kDefaultMaxSessions;
    // Whether lookups across clients see every client's sessions (see the context).
    bool sharedSessions = false;
  };
  static std::shared_ptr<QNReportingServiceDelegate> Create(
      std::shared_ptr<const Platform> platform, Options options);
  static std::shared_ptr<QNReportingServiceDelegate> Create(
      std::shared_ptr<const Platform> platform) {
    return Create(std::move(platform), Options{});
  }

  // Cancels the defaults notification registration.
  ~QNReportingServiceDelegate() override;

  QNReportingServiceDelegate(const QNReportingServiceDelegate&) = delete;
  QNReportingServiceDelegate& operator=(const QNReportingServiceDelegate&) = delete;

  // IpcListenerDelegate: exports a new server instance for the peer on `connection`, queues
  // its listing (start date, process name) on the server queue, installs the interruption
  // and invalidation handlers (holding the instance weakly) and resumes the connection.
  // Always accepts.
  bool ShouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;

  // QNReportingServiceDelegateProtocol (all on the server queue).
  std::shared_ptr<const Dictionary> getDefaults() const override { return defaults_.load(); }
  const ClientList& getAllClients() const override { return clients_; }
  bool isReportingEnabled() const override { return reportingEnabled_.load(); }
  std::shared_ptr<QNReportingSession> findReportingSessionForID(
      std::int64_t reporterID, std::optional<uid_t> scope) override;
  Dictionary getSnapShot() override;
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const Dictionary* snapshot) override;
  void removeClient(const QNReportingServerInstance* instance) override;

  // Registers the defaults-change handler for "com.norvel.quenta.reporting" on the server
  // queue and logs the registration's status. A failed registration is only logged: the
  // service then keeps reporting enabled and no defaults. Called once, by Create.
  void listenForDefaultsNotification();

  // Properties. `defaults` and `reportingEnabled` are safe from any thread; `clients` only
  // on the server queue.
  const ClientList& clients() const { return clients_; }
  std::shared_ptr<const Dictionary> defaults() const { return defaults_.load(); }
  bool reportingEnabled() const { return reportingEnabled_.load(); }
  const std::shared_ptr<const QNReportingDriverUtility>& driverUtility() const {
    return driverUtility_;
  }
  // The platform, the server queue and the "qnrs" scope, as handed to server instances.
  const QNReportingServerContext& context() const { return context_; }

 private:
  struct Token {};

 public:
  // Use Create.
  QNReportingServiceDelegate(Token, std::shared_ptr<const Platform> platform, Options options);

 private:
  // The defaults-change handler, on the server queue.
  void DefaultsChanged(int token);
  // The connection-end step, on the IPC layer's thread.
  void ConnectionEnded(const std::weak_ptr<QNReportingServerInstance>& weakInstance, pid_t pid);
  // The process name of `pid`: the own name for the own pid, the kernel's short command
  // name for other positive pids, none for pid <= 0 or an unreadable process.
  std::optional<std::string> ProcessNameOf(pid_t pid) const;
  Date Now() const;

  QNReportingServerContext context_;

  // The monitor: see the class comment.
  std::mutex lock_;

  ClientList clients_;  // server queue only
  std::atomic<std::shared_ptr<const Dictionary>> defaults_;
  std::atomic<bool> reportingEnabled_{true};
  std::shared_ptr<const QNReportingDriverUtility> driverUtility_;  // set by Create, then fixed

  // The defaults notification token; written before the server queue may run the handler.
  std::atomic<int> notifyToken_{0};
  bool notifyRegistered_ = false;  // set by listenForDefaultsNotification, then fixed
};

}  // namespace qn
