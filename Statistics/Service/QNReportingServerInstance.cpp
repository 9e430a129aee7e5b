#include "Statistics/Service/QNReportingServerInstance.h"

#include <algorithm>
#include <utility>

#include "Statistics/QNReportingEnerdexUtility.h"
#include "Statistics/QNReportingStatlynBridge.h"
#include "Statistics/Service/QNReportingSession.h"
#include "common/Format.h"
#include "platform/log.h"

namespace qn {

namespace {

// Trace codes of the requests.
constexpr std::uint32_t kTraceCreateRequest = 0x21042814;
constexpr std::uint32_t kTraceStartRequest = 0x21042818;
constexpr std::uint32_t kTraceStopRequest = 0x2104281C;
constexpr std::uint32_t kTraceDestroyRequest = 0x21042820;
constexpr std::uint32_t kTraceSendRequest = 0x21042824;

// The error of a send while reporting is disabled.
constexpr const char* kReportingErrorDomain = "com.norvel.audio.reporting";
constexpr std::int64_t kReportingDisabledCode = 1;

// The printed form of sessions in the broadcast's log lines.
Value DescribeSessions(const std::vector<std::shared_ptr<QNReportingSession>>& sessions) {
  Array items;
  items.reserve(sessions.size());
  for (const auto& session : sessions) {
    items.emplace_back(StringWithFormat(
        "<QNReportingSession reporterID=%lli serviceName=%@ started=%@>", session->reporterID(),
        session->serviceName(), session->started() ? "YES" : "NO"));
  }
  return Value(std::move(items));
}

// Runs `then` on the server queue once every summary file that stops have queued so far is
// renamed into place (at once when files are written inline), so that a client that has
// its reply finds the file, and a killService: sent after the reply cannot lose it.
void AfterSummaryFiles(const QNReportingServerContext& ctx, Task then) {
  if (const auto& summaries = ctx.platform->summary_queue) {
    summaries->Async([server = ctx.serverQueue, then = std::move(then)]() mutable {
      server->Async(std::move(then));
    });
    return;
  }
  then();
}

}  // namespace

// ---------------------------------------------------------------------------------------
// QNReportingSessionMap

std::shared_ptr<QNReportingSession> QNReportingSessionMap::Find(std::int64_t reporterID) const {
  auto it = index_.find(reporterID);
  return it == index_.end() ? nullptr : it->second->second;
}

void QNReportingSessionMap::Set(std::int64_t reporterID,
                                std::shared_ptr<QNReportingSession> session) {
  auto it = index_.find(reporterID);
  if (it != index_.end()) {
    it->second->second = std::move(session);
    return;
  }
  entries_.emplace_back(reporterID, std::move(session));
  index_.emplace(reporterID, std::prev(entries_.end()));
}

bool QNReportingSessionMap::Erase(std::int64_t reporterID) {
  auto it = index_.find(reporterID);
  if (it == index_.end()) return false;
  entries_.erase(it->second);
  index_.erase(it);
  return true;
}

// ---------------------------------------------------------------------------------------
// QNReportingSessionRegistry

void QNReportingSessionRegistry::Add(const std::shared_ptr<QNReportingSession>& session) {
  std::lock_guard lock(mu_);
  sessions_.push_back(session);
  if (sessions_.size() < pruneAt_) return;
  std::erase_if(sessions_, [](const auto& weak) { return weak.expired(); });
  pruneAt_ = std::max<std::size_t>(64, sessions_.size() * 2);
}

std::vector<std::shared_ptr<QNReportingSession>> QNReportingSessionRegistry::Alive() const {
  std::lock_guard lock(mu_);
  std::vector<std::shared_ptr<QNReportingSession>> alive;
  for (const auto& weak : sessions_) {
    if (auto session = weak.lock()) alive.push_back(std::move(session));
  }
  return alive;
}

// ---------------------------------------------------------------------------------------
// QNReportingServerInstance

std::shared_ptr<QNReportingServerInstance> QNReportingServerInstance::initWithPID(
    pid_t pid, uid_t uid, std::shared_ptr<HeldBytes> heldBytes,
    std::weak_ptr<QNReportingServiceDelegateProtocol> delegate, QNReportingServerContext context) {
  QN_LOG(context.log(), context.scope(), LogLevel::kDefault, "%s:%d:%s: new client with pid %lu",
         static_cast<unsigned long>(pid));
  return std::make_shared<QNReportingServerInstance>(Token{}, pid, uid, std::move(heldBytes),
                                                     std::move(delegate), std::move(context));
}

QNReportingServerInstance::QNReportingServerInstance(
    Token, pid_t pid, uid_t uid, std::shared_ptr<HeldBytes> heldBytes,
    std::weak_ptr<QNReportingServiceDelegateProtocol> delegate, QNReportingServerContext context)
    : context_(std::move(context)),
      delegate_(std::move(delegate)),
      processIdentifier_(pid),
      peerUid_(uid),
      heldBytes_(std::move(heldBytes)) {}

std::optional<uid_t> QNReportingServerInstance::sessionScope() const {
  if (context_.sharedSessions || peerUid_ == 0) return std::nullopt;
  return peerUid_;
}

QNReportingServerInstance::~QNReportingServerInstance() {
  Counters::Add(context_.platform->counters->sessionsOpen,
                -static_cast<std::int64_t>(sessions_.size()));
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault,
         "%s:%d:%s: dealloc %i from the server client list", processIdentifier_);
}

std::optional<Date> QNReportingServerInstance::clientStartDate() const {
  std::lock_guard lock(propertyLock_);
  return clientStartDate_;
}

void QNReportingServerInstance::setClientStartDate(std::optional<Date> date) {
  std::lock_guard lock(propertyLock_);
  clientStartDate_ = date;
}

std::optional<std::string> QNReportingServerInstance::clientProcessName() const {
  std::lock_guard lock(propertyLock_);
  return clientProcessName_;
}

void QNReportingServerInstance::setClientProcessName(std::optional<std::string> name) {
  std::lock_guard lock(propertyLock_);
  clientProcessName_ = std::move(name);
}

std::shared_ptr<QNReportingSession> QNReportingServerInstance::findReportingSessionForID(
    std::int64_t reporterID, bool acrossAllClients) const {
  if (auto own = sessions_.Find(reporterID)) return own;
  if (!acrossAllClients) return nullptr;
  auto delegate = delegate_.lock();
  return delegate ? delegate->findReportingSessionForID(reporterID, sessionScope()) : nullptr;
}

template <typename Work>
void QNReportingServerInstance::OnServerQueue(Work work) {
  // Requests arrive on the IPC thread; when the server queue is idle the request runs there
  // at once (in order, the queue held), which saves two thread hand-offs per request.
  context_.serverQueue->AsyncOrRun([self = shared_from_this(), work = std::move(work)]() mutable {
    const HeldBytes::Charge charge(self->heldBytes_);
    work(*self);
  });
}

// ---------------------------------------------------------------------------------------
// The protocol operations. Each writes its entry line here, on the caller's thread, and
// does its work on the server queue.

void QNReportingServerInstance::createReportingSession(std::int64_t reporterID, BoolReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug,
         "%s:%d:%s: creating session for reporter %lli", reporterID);
  OnServerQueue([reporterID, reply = std::move(reply)](QNReportingServerInstance& self) {
    const auto& ctx = self.context_;
    ctx.platform->trace->TracePoint(kTraceCreateRequest);
    std::shared_ptr<QNReportingSession> session;
    Counters& counters = *ctx.platform->counters;
    const bool isNew = !self.sessions_.Contains(reporterID);
    const auto open = static_cast<std::size_t>(Counters::Get(counters.sessionsOpen));
    std::size_t ofUid = 0;  // the sessions of the clients of this client's uid
    if (auto delegate = isNew ? self.delegate_.lock() : nullptr) {
      for (const auto& client : delegate->getAllClients()) {
        if (client->peerUid_ == self.peerUid_) ofUid += client->sessions_.size();
      }
    }
    if (isNew && ofUid >= ctx.maxSessionsPerUid) {
      Counters::Add(counters.sessionsRefused);
      QN_LOG(ctx.log(), ctx.scope(), LogLevel::kError,
             "%s:%d:%s: uid %u already holds %lu sessions, no session for reporter %lli of client "
             "%i",
             self.peerUid_, ofUid, reporterID, self.processIdentifier_);
    } else if (isNew && open >= ctx.maxSessions) {
      Counters::Add(counters.sessionsRefused);
      QN_LOG(ctx.log(), ctx.scope(), LogLevel::kError,
             "%s:%d:%s: the clients hold %lu sessions, the most allowed; no session for reporter "
             "%lli of client %i",
             open, reporterID, self.processIdentifier_);
    } else {
      session = QNReportingSession::initWithID(ctx.platform, reporterID,
                                               Array{Value(self.processIdentifier_)});
    }
    if (session) {
      ctx.sessions->Add(session);
      if (isNew) Counters::Add(counters.sessionsOpen, 1);
      self.sessions_.Set(reporterID, std::move(session));
      QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault,
             "%s:%d:%s: session created for reporter %lli", reporterID);
    }
    reply(true);
  });
}

void QNReportingServerInstance::setServiceType(std::uint16_t serviceType, std::int64_t reporterID,
                                               BoolReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug,
         "%s:%d:%s: setting service type %i for reporter %lli", serviceType, reporterID);
  OnServerQueue(
      [serviceType, reporterID, reply = std::move(reply)](QNReportingServerInstance& self) {
        if (reporterID == 0) {
          reply(true);
          return;
        }
        if (auto session = self.findReportingSessionForID(reporterID, false)) {
          session->setServiceType(serviceType);
          QN_LOG(self.context_.log(), self.context_.scope(), LogLevel::kDefault,
                 "%s:%d:%s: service type %i set for reporter  %lli", serviceType, reporterID);
        }
        reply(true);
      });
}

void QNReportingServerInstance::getServiceNameForReporterID(std::int64_t reporterID,
                                                            ServiceTypeReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug, "%s:%d:%s: fetching seviceType");
  OnServerQueue([reporterID, reply = std::move(reply)](QNReportingServerInstance& self) {
    // ID 0 deliberately gets a first answer at once and then the search's answer too.
    if (reporterID == 0) reply(kUnknownServiceType);
    auto session = self.findReportingSessionForID(reporterID, true);
    const std::uint16_t result = session ? session->serviceType() : kUnknownServiceType;
    reply(result);
    QN_LOG(self.context_.log(), self.context_.scope(), LogLevel::kDefault,
           "%s:%d:%s: returnning service type %i for reporter  %lli", result, reporterID);
  });
}

void QNReportingServerInstance::setConfiguration(MessagePayload configuration,
                                                 std::int64_t reporterID, BoolReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug, "%s:%d:%s: setting configuration");
  OnServerQueue([configuration = std::move(configuration), reporterID,
                 reply = std::move(reply)](QNReportingServerInstance& self) {
    if (auto session = self.findReportingSessionForID(reporterID, false)) {
      session->setConfiguration(configuration);
    }
    reply(true);
  });
}

void QNReportingServerInstance::startReportingSessionForID(std::int64_t reporterID,
                                                           BoolReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug,
         "%s:%d:%s: starting session for reporter %lli", reporterID);
  OnServerQueue([reporterID, reply = std::move(reply)](QNReportingServerInstance& self) mutable {
    self.context_.platform->trace->TracePoint(kTraceStartRequest);
    if (reporterID == 0) {
      reply(true);
      return;
    }
    auto session = self.findReportingSessionForID(reporterID, true);
    if (!session || session->started()) {
      reply(true);
      return;
    }
    session->start();
    auto delegate = self.delegate_.lock();
    session->setDriverSnapShot(
        delegate ? std::make_shared<const Dictionary>(delegate->getSnapShot()) : nullptr);
    if (auto pending = session->transactionCompleteBlock()) {
      pending(true);
      session->setTransactionCompleteBlock(nullptr);
    }
    // The reply waits in the session until a later start replaces it or stop delivers it.
    session->setTransactionCompleteBlock(std::move(reply));
  });
}

void QNReportingServerInstance::sendMessage(MessagePayload message, std::uint32_t category,
                                            std::uint16_t type,
                                            std::optional<std::vector<std::int64_t>> reporterIDs,
                                            ErrorReply reply) {
  if (context_.log().LogEnabled(context_.scope(), 5)) {
    // An absent list prints as a missing object does.
    const FormatArg ids = reporterIDs
                              ? FormatArg(Value(Array(reporterIDs->begin(), reporterIDs->end())))
                              : FormatArg(NullObject{});
    QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug,
           "%s:%d:%s: sending message for reporter %@", ids);
  }
  OnServerQueue([message = std::move(message), category, type, reporterIDs = std::move(reporterIDs),
                 reply = std::move(reply)](QNReportingServerInstance& self) {
    const auto& ctx = self.context_;
    const Platform& platform = *ctx.platform;
    platform.trace->TracePoint(kTraceSendRequest);
    auto delegate = self.delegate_.lock();
    if (!delegate || !delegate->isReportingEnabled()) {
      reply(Error{kReportingErrorDomain, kReportingDisabledCode, ""});
      return;
    }

    // The analytics events of this message share their payloads (a repeated ID, or
    // sessions of one host application, cost no copy each).
    QNReportingStatlynBridge::SharedPayload analytics;
    if (reporterIDs) {
      // Listed sessions: the bridges first, then the session.
      for (std::int64_t reporterID : *reporterIDs) {
        if (reporterID == 0) continue;
        auto session = self.findReportingSessionForID(reporterID, true);
        if (!session) continue;
        QNReportingStatlynBridge::handleEvent(platform, message.get(), category, type,
                                              session.get(), &analytics);
        QNReportingEnerdexUtility::handleEvent(platform, message.get(), category, type,
                                               session.get());
        session->sendMessage(message, category, type, nullptr);
      }
      reply(std::nullopt);
      return;
    }

    // Broadcast: every started session of every client in scope, in client order.
    std::vector<std::shared_ptr<QNReportingSession>> active;
    const std::optional<uid_t> scope = self.sessionScope();
    for (const auto& client : delegate->getAllClients()) {
      if (!client->inScope(scope)) continue;
      std::vector<std::shared_ptr<QNReportingSession>> all;
      for (const auto& entry : client->clientReportingSessionMap()) all.push_back(entry.second);
      QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault, "%s:%d:%s: sessions for client %i : %@",
             client->processIdentifier(), DescribeSessions(all));
      for (auto& session : all) {
        if (session->started()) active.push_back(std::move(session));
      }
    }
    QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault,
           "%s:%d:%s: active reporting sessions %lu : %@", active.size(), DescribeSessions(active));
    if (!active.empty()) {
      // Here the session goes first, then the bridges.
      for (const auto& session : active) {
        session->sendMessage(message, category, type, nullptr);
        QNReportingStatlynBridge::handleEvent(platform, message.get(), category, type,
                                              session.get(), &analytics);
        QNReportingEnerdexUtility::handleEvent(platform, message.get(), category, type,
                                               session.get());
      }
    } else {
      QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault,
             "%s:%d:%s: no active reporting sessions found, sending as standalone");
      QNReportingEnerdexUtility::handleEvent(platform, message.get(), category, type, nullptr);
      QNReportingSession::sendSingleMessage(ctx.platform, message, category, type,
                                            kStandaloneServiceType, delegate->getDefaults(),
                                            nullptr);
    }
    reply(std::nullopt);
  });
}

void QNReportingServerInstance::stopReportingSessionForID(std::int64_t reporterID,
                                                          BoolReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug,
         "%s:%d:%s: stopping session for reporter %lli", reporterID);
  OnServerQueue([reporterID, reply = std::move(reply)](QNReportingServerInstance& self) {
    const auto& ctx = self.context_;
    ctx.platform->trace->TracePoint(kTraceStopRequest);
    if (reporterID == 0) {
      reply(true);
      return;
    }
    QNReportingSession::TransactionCompleteBlock pending;
    if (auto session = self.findReportingSessionForID(reporterID, false)) {
      auto delegate = self.delegate_.lock();
      std::optional<Dictionary> stats;
      if (delegate) {
        auto snapshot = session->driverSnapShot();
        stats = delegate->getDriverStatisticsRelativeToSnapShot(snapshot.get());
      }
      if (stats) {
        auto shared = std::make_shared<const Dictionary>(std::move(*stats));
        session->sendMessage(shared, kDriverStatisticsCategory, kDriverStatisticsType, nullptr);
        QNReportingStatlynBridge::handleEvent(*ctx.platform, shared.get(),
                                              kDriverStatisticsCategory, kDriverStatisticsType,
                                              session.get());
        QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault, "%s:%d:%s: fetching driver logs %@",
               Value(shared));
      } else {
        QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault,
               "%s:%d:%s: nothing interesting to fetch from the drivers");
      }
      session->setDriverSnapShot(nullptr);
      session->stop();
      pending = session->transactionCompleteBlock();
      session->setTransactionCompleteBlock(nullptr);
    }
    QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault, "%s:%d:%s: stopping %lli", reporterID);
    // The summary file first, then the pending start reply, then this one.
    AfterSummaryFiles(ctx, [pending = std::move(pending), reply = std::move(reply)] {
      if (pending) pending(true);
      reply(true);
    });
  });
}

void QNReportingServerInstance::destroyReportingSession(std::int64_t reporterID, BoolReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug,
         "%s:%d:%s: destroying session for reporter %lli", reporterID);
  OnServerQueue([reporterID, reply = std::move(reply)](QNReportingServerInstance& self) {
    const auto& ctx = self.context_;
    ctx.platform->trace->TracePoint(kTraceDestroyRequest);
    if (reporterID == 0) {
      reply(true);
      return;
    }
    // A pending start reply stays undelivered and no driver statistics are sent.
    if (auto session = self.sessions_.Find(reporterID)) {
      if (session->started()) session->stop();
      self.sessions_.Erase(reporterID);
      Counters::Add(ctx.platform->counters->sessionsOpen, -1);
    }
    QN_LOG(ctx.log(), ctx.scope(), LogLevel::kDefault, "%s:%d:%s: destroying %lli", reporterID);
    // The reply waits for the summary files queued so far, that of a session stopped here too.
    AfterSummaryFiles(ctx, [reply = std::move(reply)] { reply(true); });
  });
}

void QNReportingServerInstance::reporterIDValid(std::int64_t reporterID, DictionaryReply reply) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDebug, "%s:%d:%s: validating reporter %lli",
         reporterID);
  OnServerQueue([reporterID, reply = std::move(reply)](QNReportingServerInstance& self) {
    Dictionary result{
        {"reporterID", Value(std::int64_t{0})},
        {"serviceType", Value(kUnknownServiceType)},
    };
    if (auto session = self.findReportingSessionForID(reporterID, true)) {
      result.Set("reporterID", Value(reporterID));
      result.Set("serviceType", Value(session->serviceType()));
    }
    QN_LOG(self.context_.log(), self.context_.scope(), LogLevel::kDefault,
           "%s:%d:%s: validating reporter %lli", reporterID);
    reply(std::move(result));
  });
}

void QNReportingServerInstance::getAllReporters(ReporterIDsReply reply) {
  OnServerQueue([reply = std::move(reply)](QNReportingServerInstance& self) {
    std::vector<std::int64_t> ids;
    if (auto delegate = self.delegate_.lock()) {
      const std::optional<uid_t> scope = self.sessionScope();
      for (const auto& client : delegate->getAllClients()) {
        if (!client->inScope(scope)) continue;
        for (const auto& entry : client->clientReportingSessionMap()) ids.push_back(entry.first);
      }
    }
    reply(std::move(ids));
  });
}

void QNReportingServerInstance::killService(BoolReply /*reply*/) {
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault, "%s:%d:%s: DESTROYING SERVICE");
  context_.platform->process->Exit(2);
}

void QNReportingServerInstance::handleConnectionError() {
  OnServerQueue([](QNReportingServerInstance& self) {
    auto delegate = self.delegate_.lock();
    if (!delegate) return;
    const auto& clients = delegate->getAllClients();
    const bool listed = std::any_of(clients.begin(), clients.end(),
                                    [&self](const auto& client) { return client.get() == &self; });
    if (!listed) return;
    // Sessions are stopped, not destroyed; no driver statistics are sent.
    for (const auto& entry : self.sessions_) {
      if (entry.second->started()) entry.second->stop();
    }
    delegate->removeClient(&self);
    QN_LOG(self.context_.log(), self.context_.scope(), LogLevel::kDefault,
           "%s:%d:%s: removing %i from the server client list", self.processIdentifier_);
  });
}

}  // namespace qn
