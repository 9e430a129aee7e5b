#include "Statistics/Service/QNReportingServiceDelegate.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <utility>

#include "Statistics/Service/QNReportingServerInstance.h"
#include "Statistics/Service/QNReportingServiceProtocol.h"
#include "Statistics/Service/QNReportingSession.h"
#include "common/Format.h"
#include "platform/log.h"

namespace qn {

namespace {

// The boolean reading of a defaults value: a bool as itself, a number when non-zero.
bool BoolValue(const Value& value) {
  if (const bool* b = value.as_bool()) return *b;
  if (auto d = value.as_double()) return *d != 0.0;
  return false;
}

// A process name for "%@": the name, or "(null)" when there is none.
FormatArg NameArg(const std::optional<std::string>& name) {
  return name ? FormatArg(*name) : FormatArg(NullObject{});
}

}  // namespace

Dictionary QNReportingDefaults(const Platform& platform) {
  std::unique_ptr<DefaultsSuite> suite = platform.defaults->OpenSuite(kQNReportingDefaultsSuite);
  Dictionary result;
  if (suite->ObjectForKey("device_name")) {
    if (auto name = suite->StringForKey("device_name")) result.Set("device_name", *name);
  }
  if (suite->ObjectForKey("disable_reporting")) {
    result.Set("disable_reporting", suite->BoolForKey("disable_reporting"));
  } else {
    result.Set("disable_reporting", 0);
  }
  return result;
}

// ---------------------------------------------------------------------------------------
// Construction

std::shared_ptr<QNReportingServiceDelegate> QNReportingServiceDelegate::Create(
    std::shared_ptr<const Platform> platform, Options options) {
  auto delegate = std::make_shared<QNReportingServiceDelegate>(Token{}, platform, options);
  delegate->listenForDefaultsNotification();
  delegate->driverUtility_ = std::make_shared<const QNReportingDriverUtility>(std::move(platform));
  return delegate;
}

QNReportingServiceDelegate::QNReportingServiceDelegate(Token,
                                                       std::shared_ptr<const Platform> platform,
                                                       Options options) {
  context_.platform = std::move(platform);
  context_.maxSessionsPerUid = options.maxSessionsPerUid;
  context_.maxSessions = options.maxSessions;
  context_.sharedSessions = options.sharedSessions;
  const Platform& p = *context_.platform;
  context_.logScope =
      p.log->RegisterScope(true, kLogScopeCode, "qnrs", "com.norvel.quenta", kLogScopeName, 31);
  context_.serverQueue =
      p.dispatcher->CreateSerialQueue(kServerQueueLabel, QualityOfService::kUserInteractive);
}

QNReportingServiceDelegate::~QNReportingServiceDelegate() {
  if (notifyRegistered_) context_.platform->notify->Cancel(notifyToken_.load());
}

// ---------------------------------------------------------------------------------------
// Connections

bool QNReportingServiceDelegate::ShouldAcceptNewConnection(
    IpcListener& /*listener*/, std::shared_ptr<IpcConnection> connection) {
  const pid_t pid = connection->PeerPid();
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault, "%s:%d:%s: newConnection: %@",
         connection->Description());

  // The instance logs its creation, and the connection guards itself, so both happen
  // outside the monitor, which is never held while another lock is taken.
  std::weak_ptr<QNReportingServiceDelegateProtocol> weakSelf = shared_from_this();
  auto instance = QNReportingServerInstance::initWithPID(
      pid, connection->PeerUid(), connection->PeerHeldBytes(), weakSelf, context_);
  std::shared_ptr<IpcExportedObject> exported;
  {
    std::lock_guard monitor(lock_);
    exported = MakeExportedObject(instance, context_.serverQueue, context_.platform->summary_queue);
  }
  connection->SetExportedObject(std::move(exported));

  std::weak_ptr<QNReportingServerInstance> weakInstance = instance;
  instance.reset();  // from here on the connection alone keeps it alive

  context_.serverQueue->Async([self = shared_from_this(), weakInstance, pid] {
    auto listed = weakInstance.lock();
    if (!listed) return;
    self->clients_.push_back(listed);
    listed->setClientStartDate(self->Now());
    listed->setClientProcessName(self->ProcessNameOf(pid));
  });

  connection->SetInterruptionHandler([self = shared_from_this(), weakInstance] {
    QN_LOG(self->context_.log(), self->context_.scope(), LogLevel::kDefault,
           "%s:%d:%s: InterruptionHandler: connection exited");
    if (auto instance = weakInstance.lock()) instance->handleConnectionError();
  });
  connection->SetInvalidationHandler(
      [self = shared_from_this(), weakInstance, pid] { self->ConnectionEnded(weakInstance, pid); });

  connection->Resume();
  return true;
}

void QNReportingServiceDelegate::ConnectionEnded(
    const std::weak_ptr<QNReportingServerInstance>& weakInstance, pid_t pid) {
  auto instance = weakInstance.lock();
  // Only queues the removal; the rest runs here, on the IPC layer's thread.
  if (instance) instance->handleConnectionError();

  const Date now = Now();
  Value uptime(-1);
  const std::optional<Date> startDate = instance ? instance->clientStartDate() : std::nullopt;
  const std::optional<std::string> processName =
      instance ? instance->clientProcessName() : std::nullopt;
  const std::string nameOrUnknown = processName.value_or("unknown");
  double seconds = -1;
  if (!startDate) {
    QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault,
           "%s:%d:%s: clientStartDate is nil. clientpid=%d clientprocessname=%@", pid,
           nameOrUnknown);
  } else {
    const double difference = startDate->seconds_since_1970 - now.seconds_since_1970;
    seconds = std::fabs(difference);
    uptime = Value(seconds);
    // The wording is kept although the line fires for a start date after now.
    if (difference > 0.0) {
      QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault,
             "%s:%d:%s: clientStartDate is in the past. clientpid=%d clientprocessname=%@", pid,
             nameOrUnknown);
    }
  }
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault,
         "%s:%d:%s: InvalidationHandler: connection exited process=%@ uptime_sec=%d",
         NameArg(processName), static_cast<int>(seconds));

  if (processName) {
    auto payload = std::make_shared<const Dictionary>(Dictionary{
        {"processName", *processName},
        {"seconds", uptime},
    });
    const std::size_t bytes = Value(payload).ApproximateBytes();
    context_.platform->analytics->SendEventLazy(
        kQNReportingClientUptimeEvent, [payload] { return Value(payload); }, bytes);
  } else {
    QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault,
           "%s:%d:%s: clientProcessName is nil. clientpid=%d", pid);
  }
}

std::optional<std::string> QNReportingServiceDelegate::ProcessNameOf(pid_t pid) const {
  const Process& process = *context_.platform->process;
  if (pid == process.Pid()) return process.OwnName();
  if (pid >= 1) return process.NameOf(pid);
  return std::nullopt;
}

Date QNReportingServiceDelegate::Now() const {
  const auto since = context_.platform->dispatcher->WallNow().time_since_epoch();
  return Date{std::chrono::duration<double>(since).count()};
}

void QNReportingServiceDelegate::removeClient(const QNReportingServerInstance* instance) {
  std::erase_if(clients_, [instance](const auto& client) { return client.get() == instance; });
}

std::shared_ptr<QNReportingSession> QNReportingServiceDelegate::findReportingSessionForID(
    std::int64_t reporterID, std::optional<uid_t> scope) {
  std::shared_ptr<QNReportingSession> found;
  pid_t owner = 0;
  {
    std::lock_guard monitor(lock_);
    if (reporterID == 0 || !reportingEnabled_.load()) return nullptr;
    for (const auto& client : clients_) {
      if (!client->inScope(scope)) continue;
      if (auto session = client->clientReportingSessionMap().Find(reporterID)) {
        found = std::move(session);
        owner = client->processIdentifier();
        break;
      }
    }
  }
  // Logged after leaving the monitor, which is never held while the log's lock is taken.
  if (found) {
    QN_LOG(context_.log(), context_.scope(), LogLevel::kInfo,
           "%s:%d:%s: found reporting session %lli for client %i", reporterID, owner);
  } else {
    QN_LOG(context_.log(), context_.scope(), LogLevel::kError,
           "%s:%d:%s: failed to find reporting session %lli", reporterID);
  }
  return found;
}

// ---------------------------------------------------------------------------------------
// Defaults and driver statistics

void QNReportingServiceDelegate::listenForDefaultsNotification() {
  std::weak_ptr<QNReportingServiceDelegate> weakSelf = shared_from_this();
  // The queue is held while the token is stored, so the handler never sees it unset.
  context_.serverQueue->Suspend();
  int token = 0;
  const std::uint32_t status = context_.platform->notify->Register(
      kQNReportingDefaultsNotification, context_.serverQueue,
      [weakSelf](int delivered) {
        if (auto self = weakSelf.lock()) self->DefaultsChanged(delivered);
      },
      &token);
  if (status == 0) {
    notifyToken_.store(token);
    notifyRegistered_ = true;
  }
  context_.serverQueue->Resume();
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault, "%s:%d:%s: notify setup result %i",
         status);
}

void QNReportingServiceDelegate::DefaultsChanged(int token) {
  if (token != notifyToken_.load()) return;
  QN_LOG(context_.log(), context_.scope(), LogLevel::kDefault,
         "%s:%d:%s: re-reading quenta defaults");
  auto defaults = std::make_shared<const Dictionary>(QNReportingDefaults(*context_.platform));
  defaults_.store(defaults);
  QN_LOG(context_.log(), context_.scope(), LogLevel::kInfo, "%s:%d:%s: defaults %@",
         Value(defaults));
  for (const auto& client : clients_) {
    for (const auto& entry : client->clientReportingSessionMap()) {
      entry.second->updateDefaults(defaults);
    }
  }
  if (const Value* disable = defaults->Find("disable_reporting")) {
    reportingEnabled_.store(!BoolValue(*disable));
  }
}

Dictionary QNReportingServiceDelegate::getSnapShot() { return driverUtility_->getSnapShot(); }

std::optional<Dictionary> QNReportingServiceDelegate::getDriverStatisticsRelativeToSnapShot(
    const Dictionary* snapshot) {
  return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapshot);
}

}  // namespace qn
