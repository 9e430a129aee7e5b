#pragma once

#include <sys/types.h>
#include <cstddef>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Statistics/Service/QNReportingServerContext.h"
#include "Statistics/Service/QNReportingServiceDelegateProtocol.h"
#include "Statistics/Service/QNReportingServiceProtocol.h"
#include "common/HeldBytes.h"
#include "common/Value.h"

namespace qn {

class QNReportingSession;

// One client's sessions by reporter ID, in the order their IDs were first stored.
// Replacing the session of an existing ID keeps the ID's place. Not thread-safe: the
// server instance touches it on the server queue only.
class QNReportingSessionMap {
 public:
  using Entry = std::pair<std::int64_t, std::shared_ptr<QNReportingSession>>;

  // The session under `reporterID`, or null.
  std::shared_ptr<QNReportingSession> Find(std::int64_t reporterID) const;
  bool Contains(std::int64_t reporterID) const { return index_.count(reporterID) != 0; }
  // Stores `session` under `reporterID`, replacing any session stored there.
  void Set(std::int64_t reporterID, std::shared_ptr<QNReportingSession> session);
  // Removes the entry; returns whether there was one.
  bool Erase(std::int64_t reporterID);

  std::size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  auto begin() const { return entries_.begin(); }
  auto end() const { return entries_.end(); }

 private:
  std::list<Entry> entries_;
  std::unordered_map<std::int64_t, std::list<Entry>::iterator> index_;
};

// The exported object of one client connection: owns the client's reporting sessions and
// implements every operation of the client protocol.
//
// Threads: each protocol operation may be called from any thread (the IPC layer's); it
// writes its entry line there (debug level, only when level 5 is on for the "qnrs" scope)
// and queues the work, holding the instance strongly, on the server queue, where all state
// changes and replies happen in arrival order. killService is the exception: it logs and
// ends the process on the caller's thread. Property accessors are safe from any thread
// except clientReportingSessionMap and findReportingSessionForID (server queue only).
//
// Lifetime: reference counted; the connection holds it (through its exported object) and
// queued requests hold it until they have run. It holds its delegate weakly: when the
// delegate is gone, delegate calls answer nothing (no defaults, no clients, reporting
// disabled, no snapshot, no cross-client session).
class QNReportingServerInstance final
    : public QNReportingServiceProtocol,
      public std::enable_shared_from_this<QNReportingServerInstance> {
 public:
  // The analytics/power-log category and type of the driver statistics delta ("Ostreling",
  // "Generic"), and the service type of standalone messages.
  static constexpr std::uint32_t kDriverStatisticsCategory = 9;
  static constexpr std::uint16_t kDriverStatisticsType = 0;
  static constexpr std::uint16_t kStandaloneServiceType = 5;
  static constexpr std::uint16_t kUnknownServiceType = 65535;

  // Makes the instance for peer `pid` of user `uid` (logs "new client with pid"), with an
  // empty session map. `context` supplies the platform, the server queue and the log scope.
  // `heldBytes` (may be null) is the uid's account (IpcConnection::PeerHeldBytes): the
  // client's requests run charged to it (HeldBytes::Charge), so what they make the daemon
  // hold (store records, parked messages, its sessions' configurations) counts there.
  static std::shared_ptr<QNReportingServerInstance> initWithPID(
      pid_t pid, uid_t uid, std::shared_ptr<HeldBytes> heldBytes,
      std::weak_ptr<QNReportingServiceDelegateProtocol> delegate, QNReportingServerContext context);

  // Logs "dealloc <pid> from the server client list"; the sessions go with the map.
  ~QNReportingServerInstance() override;

  QNReportingServerInstance(const QNReportingServerInstance&) = delete;
  QNReportingServerInstance& operator=(const QNReportingServerInstance&) = delete;

  // Properties. The start date and process name are set once the connection is listed.
  pid_t processIdentifier() const { return processIdentifier_; }
  uid_t peerUid() const { return peerUid_; }
  // Whose sessions this client's lookups across clients see: the clients of this uid, or
  // every client (nullopt) for a root peer and when the context shares sessions.
  std::optional<uid_t> sessionScope() const;
  // Whether this client is among those `scope` sees.
  bool inScope(std::optional<uid_t> scope) const { return !scope || *scope == peerUid_; }
  std::optional<Date> clientStartDate() const;
  void setClientStartDate(std::optional<Date> date);
  std::optional<std::string> clientProcessName() const;
  void setClientProcessName(std::optional<std::string> name);
  // REQUIRES: on the server queue.
  const QNReportingSessionMap& clientReportingSessionMap() const { return sessions_; }

  // The session under `reporterID` in this client's map; when there is none and
  // `acrossAllClients`, the delegate's search of the clients in sessionScope() (none for
  // ID 0 or while reporting is disabled). Takes no lock of its own. REQUIRES: on the server queue.
  std::shared_ptr<QNReportingSession> findReportingSessionForID(std::int64_t reporterID,
                                                                bool acrossAllClients) const;

  // QNReportingServiceProtocol. Every BOOL reply is YES; see each operation's rules for
  // reporter ID 0 and unknown IDs.
  void createReportingSession(std::int64_t reporterID, BoolReply reply) override;
  void setServiceType(std::uint16_t serviceType, std::int64_t reporterID, BoolReply reply) override;
  // Replies twice for ID 0: 65535 at once, then the search result.
  void getServiceNameForReporterID(std::int64_t reporterID, ServiceTypeReply reply) override;
  void setConfiguration(MessagePayload configuration, std::int64_t reporterID,
                        BoolReply reply) override;
  // When this call starts a session, the reply is kept as the session's
  // transactionCompleteBlock and delivered by a later start (which replaces it) or by stop.
  void startReportingSessionForID(std::int64_t reporterID, BoolReply reply) override;
  // Error code 1 in domain "com.norvel.audio.reporting" when reporting is disabled.
  void sendMessage(MessagePayload message, std::uint32_t category, std::uint16_t type,
                   std::optional<std::vector<std::int64_t>> reporterIDs, ErrorReply reply) override;
  // The session's pending start reply and then this reply leave after the summary queue
  // (when the platform has one) has written the summary file that the stop queued.
  void stopReportingSessionForID(std::int64_t reporterID, BoolReply reply) override;
  // Stops a started session (its pending start reply stays undelivered); the reply waits
  // for the summary file as the stop's does.
  void destroyReportingSession(std::int64_t reporterID, BoolReply reply) override;
  void reporterIDValid(std::int64_t reporterID, DictionaryReply reply) override;
  void getAllReporters(ReporterIDsReply reply) override;
  // Logs "DESTROYING SERVICE" and ends the process with status 2 on the calling thread;
  // the reply is never invoked. The IPC layer passes it on only from root and the daemon's
  // own uid.
  void killService(BoolReply reply) override;

  // The connection was interrupted or invalidated: queues on the server queue the stop of
  // every started session and the removal of this instance from the client list (nothing
  // when it is no longer listed, so a second call is harmless).
  void handleConnectionError();

 private:
  struct Token {};

 public:
  // Use initWithPID.
  QNReportingServerInstance(Token, pid_t pid, uid_t uid, std::shared_ptr<HeldBytes> heldBytes,
                            std::weak_ptr<QNReportingServiceDelegateProtocol> delegate,
                            QNReportingServerContext context);

 private:
  // Queues `work` on the server queue, holding this instance strongly.
  template <typename Work>
  void OnServerQueue(Work work);

  const QNReportingServerContext context_;
  const std::weak_ptr<QNReportingServiceDelegateProtocol> delegate_;
  const pid_t processIdentifier_;
  const uid_t peerUid_;
  const std::shared_ptr<HeldBytes> heldBytes_;

  mutable std::mutex propertyLock_;               // guards the two properties below only
  std::optional<Date> clientStartDate_;           // GUARDED_BY(propertyLock_)
  std::optional<std::string> clientProcessName_;  // GUARDED_BY(propertyLock_)

  QNReportingSessionMap sessions_;  // server queue only
};

}  // namespace qn
