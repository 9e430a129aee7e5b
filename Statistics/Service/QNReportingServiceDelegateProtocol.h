#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "common/Value.h"

namespace qn {

class QNReportingServerInstance;
class QNReportingSession;

// What a server instance asks of the service delegate: the defaults, the client list, the
// reporting switch, the cross-client session search, driver snapshots and client removal.
// Every operation is called on the server queue, one at a time.
class QNReportingServiceDelegateProtocol {
 public:
  using ClientList = std::vector<std::shared_ptr<QNReportingServerInstance>>;

  virtual ~QNReportingServiceDelegateProtocol() = default;

  // The last-read reporting defaults; null before the first defaults notification.
  virtual std::shared_ptr<const Dictionary> getDefaults() const = 0;

  // The live client list itself (not a copy), in order of acceptance. The reference stays
  // valid for the delegate's life; it changes only on the server queue.
  virtual const ClientList& getAllClients() const = 0;

  // The reporting switch: true unless the defaults disable reporting.
  virtual bool isReportingEnabled() const = 0;

  // The session under `reporterID` of the first listed client in `scope` (the clients of
  // that uid; nullopt: every client) that holds one; null for ID 0, whenever reporting is
  // disabled, and when no such client holds the ID.
  virtual std::shared_ptr<QNReportingSession> findReportingSessionForID(
      std::int64_t reporterID, std::optional<uid_t> scope) = 0;

  // A snapshot of every subscribed driver counter (never absent; empty without drivers).
  virtual Dictionary getSnapShot() = 0;

  // The driver counters that grew since `snapshot` (may be null), or nullopt when none did.
  virtual std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const Dictionary* snapshot) = 0;

  // Removes every occurrence of `instance` (by identity) from the client list.
  virtual void removeClient(const QNReportingServerInstance* instance) = 0;
};

}  // namespace qn
