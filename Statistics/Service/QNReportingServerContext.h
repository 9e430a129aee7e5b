#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/dispatch.h"
#include "platform/log.h"
#include "platform/platform.h"

namespace qn {

class QNReportingSession;

// Every session the service has made, held weakly, so that an orderly shutdown can wait for
// the work still queued on the queues of the sessions that are alive. Expired entries are
// pruned as sessions are added. Safe from any thread.
class QNReportingSessionRegistry {
 public:
  void Add(const std::shared_ptr<QNReportingSession>& session);
  // The sessions still alive, in the order they were made.
  std::vector<std::shared_ptr<QNReportingSession>> Alive() const;

 private:
  mutable std::mutex mu_;
  std::vector<std::weak_ptr<QNReportingSession>> sessions_;  // GUARDED_BY(mu_)
  std::size_t pruneAt_ = 64;                                 // GUARDED_BY(mu_)
};

// The process-wide state of the service front, made once by the service delegate and
// shared with every server instance: the platform, the one serial server queue on which
// every request, every connection-end step and the defaults handler run, and the server
// log scope ("qnrs"). Immutable after construction; safe to read from any thread.
struct QNReportingServerContext {
  std::shared_ptr<const Platform> platform;
  // Serial, user-interactive, labelled "com.norvel.quenta.reporting.server".
  std::shared_ptr<SerialQueue> serverQueue;
  // The "qnrs" scope; null means the platform's default log.
  std::shared_ptr<const LogScope> logScope;
  // The most sessions the clients of one uid may hold at once. A create request for a new
  // reporter ID beyond it makes no session (its reply is still YES), so one user cannot
  // exhaust the daemon's memory or the others' sessions. Replacing an existing ID is always
  // allowed.
  static constexpr std::size_t kDefaultMaxSessionsPerUid = 16384;
  std::size_t maxSessionsPerUid = kDefaultMaxSessionsPerUid;
  // The most sessions all clients together may hold, counted in platform->counters
  // (sessionsOpen); beyond it a create makes no session either. It keeps the
  // getAllReporters: reply within a frame: each reporter ID takes at most 9 bytes.
  static constexpr std::size_t kDefaultMaxSessions = 65536;
  static constexpr std::size_t kMostMaxSessions = 100000;
  std::size_t maxSessions = kDefaultMaxSessions;

  // Whether a client's lookups across clients (start, send, service type, valid,
  // getAllReporters:) see the sessions of every client. Off: only those of clients with
  // the caller's uid, or all for a root caller.
  bool sharedSessions = false;

  // The sessions made by every server instance. Never null.
  std::shared_ptr<QNReportingSessionRegistry> sessions =
      std::make_shared<QNReportingSessionRegistry>();

  Log& log() const { return *platform->log; }
  const LogScope* scope() const { return logScope.get(); }
};

}  // namespace qn
