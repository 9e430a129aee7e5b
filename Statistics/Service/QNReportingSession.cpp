#include "Statistics/Service/QNReportingSession.h"

#include <algorithm>
#include <chrono>
#include <random>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Statistics/QNReportingUtility.h"
#include "common/Files.h"
#include "common/Format.h"
#include "common/Json.h"
#include "platform/log.h"

namespace qn {

namespace {

constexpr std::uint64_t kScopeCode = 0x716E7272;  // 'qnrr'
constexpr std::uint32_t kTraceSessionCreated = 0x21042828;
constexpr std::uint32_t kTraceSessionStart = 0x2104282C;
constexpr std::uint32_t kTraceSessionStop = 0x21042830;
constexpr std::uint32_t kTraceSessionDestroyed = 0x21042834;
constexpr std::uint32_t kTraceMessage = 0x21042838;

constexpr const char* kQueueLabel = "com.norvel.quenta.session.livoreporting";
// Summary files are for the daemon's user and the admins in its group, never for others.
constexpr mode_t kSummaryFolderMode = 0750;
constexpr mode_t kSummaryFileMode = 0640;
constexpr const char* kClientName = "com.norvel.quenta";
constexpr std::int64_t kClientType = 19;
constexpr double kClientVersion = 2.0;
constexpr std::int64_t kSingleMessageSessionID = -1;
constexpr const char* kGenericErrorDomain = "com.norvel.quenta.generic";
constexpr const char* kHostApplicationKey = "HostApplicationDisplayID";
constexpr const char* kSummaryEventKey = "QN_Session_Summary_Event";

std::shared_ptr<const LogScope> RegisterSessionScope(Log& log) {
  return log.RegisterScope(true, kScopeCode, "qnrr", "com.norvel.quenta",
                           "reporting_session_verbose", 31);
}

void TracePoint(const Platform& platform, std::uint32_t code) {
  if (platform.trace) platform.trace->TracePoint(code, 0, 0, 0, 0);
}

bool HasBlankInKey(const Dictionary& payload) {
  return std::any_of(payload.begin(), payload.end(), [](const Dictionary::Entry& entry) {
    const std::string* text = entry.first.as_string();
    return text && text->find(' ') != std::string::npos;
  });
}

// `payload` with blanks in string keys replaced by "_": the payload itself when no key has
// one (payloads are immutable, so it is shared rather than copied), else a new dictionary
// in which keys that collapse into one keep the later value. Null gives an empty dictionary.
std::shared_ptr<const Dictionary> ConvertPayload(const std::shared_ptr<const Dictionary>& payload) {
  if (payload && !HasBlankInKey(*payload)) return payload;
  auto converted = std::make_shared<Dictionary>();
  if (!payload) return converted;
  converted->Reserve(payload->size());
  for (const auto& [key, value] : *payload) {
    const std::string* text = key.as_string();
    if (text && text->find(' ') != std::string::npos) {
      std::string replaced = *text;
      std::replace(replaced.begin(), replaced.end(), ' ', '_');
      converted->Set(Value(std::move(replaced)), value);
    } else {
      converted->Set(key, value);
    }
  }
  return converted;
}

// A uniformly distributed whole number in [0, upper_bound) (arc4random_uniform).
std::uint32_t RandomUniform(std::uint32_t upper_bound) {
  if (upper_bound < 2) return 0;
  thread_local std::mt19937 generator{std::random_device{}()};
  return std::uniform_int_distribution<std::uint32_t>(0, upper_bound - 1)(generator);
}

// The host application as one file-name component: a client-chosen name must not lead the
// file out of the diagnostics directory, so "/" (and NUL) become "_".
std::string FileNameComponent(std::string text) {
  for (char& c : text) {
    if (c == '/' || c == '\0') c = '_';
  }
  return text;
}

std::string PrintedOrNull(const std::shared_ptr<const Dictionary>& dictionary) {
  return dictionary ? Value(dictionary).Description() : std::string("(null)");
}

}  // namespace

#define SESSION_LOG(level, format, ...) \
  QN_LOG(*platform_->log, scope_.get(), (level), (format)__VA_OPT__(, ) __VA_ARGS__)

// What start hands to its start sequence.
struct QNReportingSession::StartCapture {
  std::string serviceName;
  std::uint16_t serviceType;
  std::shared_ptr<bool> startFlag;  // shared with the framework's completion handler
};

// ---------------------------------------------------------------------------------------
// Record and lifecycle

std::shared_ptr<QNReportingSession> QNReportingSession::initWithID(
    std::shared_ptr<const Platform> platform, std::int64_t reporterID, Array processIdentifiers) {
  if (!platform || !platform->log || !platform->dispatcher) return nullptr;
  auto scope = RegisterSessionScope(*platform->log);
  auto session = std::make_shared<QNReportingSession>(Token{}, platform, scope, reporterID,
                                                      std::move(processIdentifiers));
  QN_LOG(*platform->log, scope.get(), LogLevel::kInfo,
         "%s:%d:%s: created reporting session for ID: %lli", reporterID);
  TracePoint(*platform, kTraceSessionCreated);
  return session;
}

QNReportingSession::QNReportingSession(Token, std::shared_ptr<const Platform> platform,
                                       std::shared_ptr<const LogScope> scope,
                                       std::int64_t reporterID, Array processIdentifiers)
    : platform_(std::move(platform)),
      heldBytes_(HeldBytes::Charge::Current()),
      scope_(std::move(scope)),
      processIdentifiers_(std::move(processIdentifiers)),
      livoReportingQueue_(
          platform_->dispatcher->CreateSerialQueue(kQueueLabel, QualityOfService::kUtility)),
      reporterID_(reporterID),
      serviceName_(std::make_shared<const std::string>("unknown")),
      userInfo_(std::make_shared<const Dictionary>()),
      aggregatedPayloadData_(std::make_shared<QNReportingPayloadArray>(platform_->counters)),
      nestedAggregatedPayloadData_(std::make_shared<QNReportingPayloadArray>()) {}

QNReportingSession::~QNReportingSession() {
  CountUserInfoBytes(0);
  TracePoint(*platform_, kTraceSessionDestroyed);
  SESSION_LOG(LogLevel::kInfo, "%s:%d:%s: deallocing this session %lli", reporterID());
}

void QNReportingSession::MergeUserInfo(const Dictionary* entries, bool capped) {
  if (!entries) return;
  auto merged = std::make_shared<Dictionary>(*userInfo());
  merged->Merge(*entries);
  const std::size_t bytes = Value(std::shared_ptr<const Dictionary>(merged)).ApproximateBytes();
  Counters& counters = *platform_->counters;
  if (capped && bytes > userInfoBytes_) {
    const std::size_t more = bytes - userInfoBytes_;
    const auto total = static_cast<std::size_t>(
        std::max<std::int64_t>(0, Counters::Get(counters.configurationBytes)));
    const auto ofUid = static_cast<std::size_t>(
        heldBytes_ ? std::max<std::int64_t>(0, heldBytes_->Get(HeldBytes::kConfiguration)) : 0);
    const bool sessionFull = bytes > platform_->max_configuration_bytes;
    const bool uidFull = heldBytes_ && ofUid + more > platform_->max_configuration_bytes_per_uid;
    if (sessionFull || uidFull || total + more > platform_->max_configuration_bytes_total) {
      Counters::Add(counters.configurationCapped);
      if (!std::exchange(configurationCapped_, true)) {
        if (sessionFull) {
          SESSION_LOG(LogLevel::kError,
                      "%s:%d:%s: session %lli would hold more than %zu bytes of configuration, the "
                      "most it keeps; later configurations are acknowledged but not merged",
                      reporterID(), platform_->max_configuration_bytes);
        } else if (uidFull) {
          SESSION_LOG(LogLevel::kError,
                      "%s:%d:%s: the sessions of one user hold %zu bytes of configuration, the "
                      "most they keep; later configurations of session %lli are acknowledged but "
                      "not merged",
                      platform_->max_configuration_bytes_per_uid, reporterID());
        } else {
          SESSION_LOG(LogLevel::kError,
                      "%s:%d:%s: the sessions hold %zu bytes of configuration in all, the most "
                      "they keep; later configurations of session %lli are acknowledged but not "
                      "merged",
                      platform_->max_configuration_bytes_total, reporterID());
        }
      }
      return;
    }
  }
  CountUserInfoBytes(bytes);
  userInfo_.store(std::move(merged));
}

void QNReportingSession::CountUserInfoBytes(std::size_t bytes) {
  const std::int64_t change =
      static_cast<std::int64_t>(bytes) - static_cast<std::int64_t>(userInfoBytes_);
  Counters::Add(platform_->counters->configurationBytes, change);
  if (heldBytes_) heldBytes_->Add(HeldBytes::kConfiguration, change);
  userInfoBytes_ = bytes;
}

void QNReportingSession::setUserInfo(std::shared_ptr<const Dictionary> info) {
  userInfo_.store(info ? std::move(info) : std::make_shared<const Dictionary>());
}

QNReportingSession::TransactionCompleteBlock QNReportingSession::transactionCompleteBlock() const {
  auto block = transactionCompleteBlock_.load();
  return block ? *block : TransactionCompleteBlock();
}

void QNReportingSession::setTransactionCompleteBlock(TransactionCompleteBlock block) {
  transactionCompleteBlock_.store(
      block ? std::make_shared<const TransactionCompleteBlock>(std::move(block)) : nullptr);
}

std::optional<std::string> QNReportingSession::orientationCallbackID() const {
  auto id = orientationCallbackID_.load();
  if (!id) return std::nullopt;
  return *id;
}

std::optional<Date> QNReportingSession::startDate() const {
  auto start = startDate_.load();
  if (!start) return std::nullopt;
  return Date{std::chrono::duration<double>(start->time_since_epoch()).count()};
}

void QNReportingSession::start() {
  SESSION_LOG(LogLevel::kDebug, "%s:%d:%s: starting session owned by %lli", reporterID());
  if (started()) {
    SESSION_LOG(LogLevel::kInfo, "%s:%d:%s: %lli is already started", reporterID());
    return;
  }
  setStarted(true);
  // Whatever was aggregated before (unstarted, or an earlier started period) is dropped.
  aggregatedPayloadData_.store(std::make_shared<QNReportingPayloadArray>(platform_->counters));
  nestedAggregatedPayloadData_.store(std::make_shared<QNReportingPayloadArray>());
  aggregationCapped_.store(false);
  TracePoint(*platform_, kTraceSessionStart);

  if (shouldReportOrientation()) {
    auto callbackID = std::make_shared<const std::string>(
        StringWithFormat("QNReportingService %lli", reporterID()));
    orientationCallbackID_.store(callbackID);
    startDate_.store(std::make_shared<const std::chrono::system_clock::time_point>(
        platform_->dispatcher->WallNow()));
    RegisterOrientationCallbacks(*callbackID);
  }

  StartCapture capture{serviceName(), serviceType(),
                       std::make_shared<bool>(livoReportingSessionStarted())};
  livoReportingQueue_->Async([self = shared_from_this(), capture = std::move(capture)] {
    self->RunStartSequence(capture);
  });
}

// On livoReportingQueue. Holds the queue (suspended, without a thread) until the
// framework has found its backends or the wait has timed out, so that every delivery
// queued after the start runs after it.
void QNReportingSession::RunStartSequence(const StartCapture& capture) {
  if (capture.serviceType == kServiceTypeTest) return;  // test sessions never get one
  const std::shared_ptr<LivoReporting>& livo = platform_->livo_reporting;
  if (!livo) return;

  auto token = livo->NewSecureHierarchyTokenFromParentToken(nullptr);
  livoReportingAgentToken_.store(token);

  Dictionary sessionInfo;
  sessionInfo.Set(kLivoReportingSessionInfoClientType, Value(kClientType));
  sessionInfo.Set(kLivoReportingSessionInfoClientVersion, Value(kClientVersion));
  sessionInfo.Set(kLivoReportingSessionInfoSessionID, Value(reporterID()));
  sessionInfo.Set(kLivoReportingSessionInfoBatchEvent,
                  Value(capture.serviceType != kServiceTypeApiUsage));
  sessionInfo.Set(kLivoReportingSessionInfoHierarchyToken, token ? Value(token->id) : Value());
  sessionInfo.Set(kLivoReportingSessionInfoContainsRealtimeEvents,
                  Value(capture.serviceType == kServiceTypeApiUsage));

  Dictionary userInfoForFramework;
  userInfoForFramework.Set(kLivoReportingUserInfoClientName, Value(kClientName));
  userInfoForFramework.Set(kLivoReportingUserInfoServiceName,
                           Value(capture.serviceName + "_session"));
  // The configuration as it stands now: whatever reached the session before this point.
  auto current = userInfo();
  if (!current->empty()) userInfoForFramework.Merge(*current);

  auto session =
      livo->CreateSession(std::move(sessionInfo), std::move(userInfoForFramework), Array{});
  livoReportingSession_.store(session);

  std::shared_ptr<Condition> condition = platform_->dispatcher->CreateCondition();
  std::shared_ptr<bool> startFlag = capture.startFlag;
  session->StartConfiguration(
      [log = platform_->log, scope = scope_, condition, startFlag](std::optional<Array> backends) {
        if (!backends) {
          QN_LOG(*log, scope.get(), LogLevel::kError,
                 "%s:%d:%s: No backends found, this session won't get sent to the server");
          return;
        }
        QN_LOG(*log, scope.get(), LogLevel::kDefault, "%s:%d:%s: List of backends %@",
               Value(std::move(*backends)));
        std::lock_guard guard(*condition);
        *startFlag = true;
        condition->Signal();
      });

  livoReportingQueue_->Suspend();
  QNReportingUtilityWait(*platform_, condition, startFlag,
                         "waiting for livoreportingd to find backends", "failed to find backend",
                         scope_, kBackendWaitSeconds, [self = shared_from_this()](bool found) {
                           if (!found) {
                             self->livoReportingSession_.store(nullptr);
                             self->livoReportingSessionStarted_.store(false);
                           }
                           self->livoReportingQueue_->Resume();
                         });
}

void QNReportingSession::stop() {
  SESSION_LOG(LogLevel::kDebug, "%s:%d:%s: ending session %lli", reporterID());
  if (shouldReportOrientation()) {
    if (auto callbackID = orientationCallbackID_.load()) {
      if (platform_->orientation) {
        platform_->orientation->UnregisterDeviceOrientation(*callbackID);
        platform_->orientation->UnregisterUIOrientation(*callbackID);
      }
      orientationCallbackID_.store(nullptr);
    }
  }
  if (!started()) return;

  SESSION_LOG(LogLevel::kDebug, "%s:%d:%s: ending session %lli", reporterID());
  TracePoint(*platform_, kTraceSessionStop);

  if (auto summary = createSummaryEventForSession()) {
    SESSION_LOG(LogLevel::kDefault, "%s:%d:%s: sending summary event for reporter %lli",
                reporterID());
    sendMessage(std::move(summary), kSummaryEventCategory, kSummaryEventType, true, nullptr);
  }
  writeSummaryJson();

  livoReportingQueue_->Async([self = shared_from_this()] { self->RunEndSequence(); });

  if (auto aggregated = aggregatedPayloadData()) {
    std::lock_guard guard(aggregated->lock);
    aggregatedPayloadData_.store(nullptr);
  }
  if (auto nested = nestedAggregatedPayloadData()) {
    std::lock_guard guard(nested->lock);
    nestedAggregatedPayloadData_.store(nullptr);
  }
  setStarted(false);
}

// On livoReportingQueue, after every delivery queued before the stop.
void QNReportingSession::RunEndSequence() {
  if (serviceType() == kServiceTypeTest) return;
  auto session = livoReportingSession();
  if (!session) return;
  session->FlushMessages([log = platform_->log, scope = scope_](std::optional<Error> error) {
    if (error) {
      QN_LOG(*log, scope.get(), LogLevel::kError, "%s:%d:%s: flush error %@", error->Description());
    }
  });
  // Dropped without waiting for the flush.
  livoReportingSession_.store(nullptr);
}

// ---------------------------------------------------------------------------------------
// Service types and message identifiers

void QNReportingSession::setServiceType(std::uint16_t serviceType) {
  serviceType_.store(serviceType);
  auto name = std::make_shared<const std::string>(QNReportingServiceTypeName(serviceType));
  serviceName_.store(name);
  SESSION_LOG(LogLevel::kInfo, "%s:%d:%s: setting service type %@", *name);
}

std::string QNReportingSession::messageIdForCategory(std::uint32_t category, std::uint16_t type) {
  // Once per message: plain concatenation ("%@_%@" of the two names, then of the count).
  std::string key = QNReportingCategoryName(category);
  key += '_';
  key += QNReportingTypeName(type);
  std::int64_t count = 1;
  if (const Value* stored = messageTypeCounts_.Find(key); stored && stored->is_number()) {
    count = static_cast<std::int64_t>(stored->as_double().value_or(0)) + 1;
  }
  std::string id = key;
  id += '_';
  id += std::to_string(count);
  messageTypeCounts_.Set(Value(std::move(key)), Value(count));
  return id;
}

// ---------------------------------------------------------------------------------------
// Message delivery

QNReportingSession::AppendResult QNReportingSession::Append(
    const std::shared_ptr<QNReportingPayloadArray>& array, Value item, std::size_t bytes,
    std::size_t cap, std::size_t totalCap) {
  if (!array) return AppendResult::kGone;  // stopped: nothing is aggregated
  std::lock_guard guard(array->lock);
  if (bytes > cap || array->bytes > cap - bytes) return AppendResult::kSessionFull;
  if (array->counted) {
    const auto total = static_cast<std::size_t>(
        std::max<std::int64_t>(0, Counters::Get(array->counted->aggregatedBytes)));
    if (bytes > totalCap || total > totalCap - bytes) return AppendResult::kAllFull;
    Counters::Add(array->counted->aggregatedBytes, static_cast<std::int64_t>(bytes));
  }
  array->items.push_back(std::move(item));
  array->bytes += bytes;
  return AppendResult::kAppended;
}

void QNReportingSession::sendMessage(std::shared_ptr<const Dictionary> payload,
                                     std::uint32_t category, std::uint16_t type, ReplyBlock reply) {
  sendMessage(std::move(payload), category, type, false, std::move(reply));
}

void QNReportingSession::sendMessage(std::shared_ptr<const Dictionary> payload,
                                     std::uint32_t category, std::uint16_t type, bool /*sync*/,
                                     ReplyBlock reply) {
  SESSION_LOG(LogLevel::kDebug, "%s:%d:%s: sending message for session owned by %lli",
              reporterID());
  std::shared_ptr<const Dictionary> converted = ConvertPayload(payload);
  std::string messageID = messageIdForCategory(category, type);

  Counters& counters = *platform_->counters;
  // A stopped session aggregates nothing: its payload's size is not worth measuring.
  const auto array = aggregatedPayloadData();
  AppendResult aggregated = AppendResult::kGone;
  if (array) {
    Value item(converted);
    const std::size_t bytes = item.ApproximateBytes();
    aggregated = Append(array, std::move(item), bytes, platform_->max_aggregated_bytes,
                        platform_->max_aggregated_bytes_total);
  }
  if (aggregated == AppendResult::kAppended) {
    Append(nestedAggregatedPayloadData(), Value(Dictionary{{Value(messageID), Value(converted)}}));
  } else if (aggregated != AppendResult::kGone) {
    Counters::Add(counters.aggregationCapped);
    if (!aggregationCapped_.exchange(true)) {
      if (aggregated == AppendResult::kSessionFull) {
        SESSION_LOG(LogLevel::kError,
                    "%s:%d:%s: session %lli holds %zu bytes of payloads, the most it aggregates; "
                    "later messages are delivered but left out of its summary",
                    reporterID(), platform_->max_aggregated_bytes);
      } else {
        SESSION_LOG(LogLevel::kError,
                    "%s:%d:%s: the sessions hold %zu bytes of payloads in all, the most they "
                    "aggregate; later messages of session %lli are delivered but left out of its "
                    "summary",
                    platform_->max_aggregated_bytes_total, reporterID());
      }
    }
  }
  TracePoint(*platform_, kTraceMessage);

  const bool wasStarted = started();
  Counters::Add(counters.deliveriesQueued, 1);
  // An idle session queue delivers at once on this thread (the delivery only hands the
  // message to the framework), in order, without a hand-off to another thread. The
  // delivery is charged to whoever is charged for the send.
  livoReportingQueue_->AsyncOrRun([self = shared_from_this(), converted,
                                   payload = std::move(payload), category, type, wasStarted,
                                   charged = HeldBytes::Charge::Current()]() mutable {
    const HeldBytes::Charge charge(std::move(charged));
    Counters::Add(self->platform_->counters->deliveriesQueued, -1);
    self->Deliver(std::move(converted), std::move(payload), category, type, wasStarted);
  });
  // The reply never carries a delivery result.
  if (reply) reply(std::nullopt);
}

// On livoReportingQueue.
void QNReportingSession::Deliver(std::shared_ptr<const Dictionary> converted,
                                 std::shared_ptr<const Dictionary> original, std::uint32_t category,
                                 std::uint16_t type, bool wasStarted) {
  if (!wasStarted) {
    SESSION_LOG(LogLevel::kDebug, "%s:%d:%s: session not started, will send as a single message");
    sendSingleMessage(platform_, std::move(converted), category, type, serviceType(), userInfo(),
                      nullptr);
    return;
  }
  if (serviceType() == kServiceTypeTest) {
    SESSION_LOG(LogLevel::kInfo, "%s:%d:%s: transactions aren't allowed on this platform");
    return;
  }
  auto session = livoReportingSession();
  if (!session) {
    Error error{kGenericErrorDomain, -1, "No valid LivoReportingSession"};
    SESSION_LOG(LogLevel::kError, "%s:%d:%s: %@", error.description);
    return;
  }
  // A refused message stays silent: the framework's error is not looked at here.
  std::optional<Error> ignored;
  if (session->SendMessage(static_cast<std::uint16_t>(category & 0xFFFFu), type, Value(converted),
                           &ignored)) {
    SESSION_LOG(LogLevel::kDebug,
                "%s:%d:%s: LivoReportingAgent %@ : message %@ : category %i : type %i", session,
                PrintedOrNull(original), static_cast<int>(category), static_cast<int>(type));
  }
}

void QNReportingSession::sendSingleMessage(const std::shared_ptr<const Platform>& platform,
                                           std::shared_ptr<const Dictionary> payload,
                                           std::uint32_t category, std::uint16_t type,
                                           std::uint16_t serviceType,
                                           std::shared_ptr<const Dictionary> /*userInfo*/,
                                           ReplyBlock reply) {
  if (!platform || !platform->log || !platform->dispatcher) return;
  auto scope = RegisterSessionScope(*platform->log);
  const std::uint32_t delay = serviceType == kServiceTypeAlarms ? RandomUniform(60) : 0;
  QN_LOG(*platform->log, scope.get(), LogLevel::kDebug,
         "%s:%d:%s: sending single message after delta %lli for service %i",
         static_cast<long long>(delay), static_cast<int>(serviceType));

  // A delayed message is counted while it waits, so that the daemon stops reading senders
  // while too many bytes wait (docs/daemon.md, "max-parked-bytes").
  // It counts for its sender's uid too (the account charged now), and its store record is
  // charged to that account when it is sent.
  const std::int64_t parked =
      delay > 0 && payload ? static_cast<std::int64_t>(Value(payload).ApproximateBytes()) : 0;
  std::shared_ptr<HeldBytes> charged = HeldBytes::Charge::Current();
  Counters::Add(platform->counters->parkedBytes, parked);
  if (charged) charged->Add(HeldBytes::kParked, parked);
  platform->dispatcher->AsyncGlobal(
      QualityOfService::kBackground, std::chrono::seconds(delay),
      [platform, scope, payload = std::move(payload), category, type, serviceType, parked,
       charged = std::move(charged), reply = std::move(reply)] {
        Counters::Add(platform->counters->parkedBytes, -parked);
        if (charged) charged->Add(HeldBytes::kParked, -parked);
        const HeldBytes::Charge charge(charged);
        TracePoint(*platform, kTraceMessage);
        QN_LOG(*platform->log, scope.get(), LogLevel::kDebug, "%s:%d:%s: sending single message");
        Dictionary sessionInfo{{kLivoReportingSessionInfoClientType, kClientType},
                               {kLivoReportingSessionInfoClientVersion, kClientVersion},
                               {kLivoReportingSessionInfoSessionID, kSingleMessageSessionID}};
        Dictionary userInfo{
            {kLivoReportingUserInfoClientName, kClientName},
            {kLivoReportingUserInfoServiceName, QNReportingServiceTypeName(serviceType)}};
        std::shared_ptr<const Dictionary> converted = ConvertPayload(payload);
        std::optional<Error> error;
        const bool sent = platform->livo_reporting &&
                          platform->livo_reporting->SendOneMessage(
                              sessionInfo, userInfo, static_cast<std::uint16_t>(category & 0xFFFFu),
                              type, Value(converted), &error);
        if (sent) {
          QN_LOG(*platform->log, scope.get(), LogLevel::kDebug,
                 "%s:%d:%s: message %@ : category %i : type %i", PrintedOrNull(payload),
                 static_cast<int>(category), static_cast<int>(type));
        } else if (error) {
          QN_LOG(*platform->log, scope.get(), LogLevel::kError,
                 "%s:%d:%s: sendOneMessageWithSessionInfo %@", error->Description());
        }
        if (reply) reply(sent ? std::nullopt : error);
      });
}

// ---------------------------------------------------------------------------------------
// Session summary event and summary file

std::shared_ptr<const Dictionary> QNReportingSession::createSummaryEventForSession() const {
  auto aggregated = aggregatedPayloadData();
  if (!aggregated) return nullptr;

  // Key -> the values found under it, in payload order; keys in order of first appearance.
  std::vector<std::pair<Value, std::vector<Value>>> collection;
  std::unordered_map<Value, std::size_t, ValueHash> index;
  collection.push_back({Value(kSummaryEventKey), {Value(serviceType())}});
  index.emplace(Value(kSummaryEventKey), 0);
  {
    std::lock_guard guard(aggregated->lock);
    if (aggregated->items.empty()) return nullptr;
    for (const Value& item : aggregated->items) {
      const Dictionary* payload = item.as_dictionary();
      if (!payload) continue;
      for (const auto& [key, value] : *payload) {
        auto [it, inserted] = index.emplace(key, collection.size());
        if (inserted) collection.push_back({key, {}});
        collection[it->second].second.push_back(value);
      }
    }
  }

  auto summary = std::make_shared<Dictionary>();
  summary->Reserve(collection.size());
  for (const auto& [key, values] : collection) {
    std::string joined;
    for (std::size_t i = 0; i < values.size(); ++i) {
      if (i) joined += ',';
      joined += values[i].Description();
    }
    summary->Set(key, Value(std::move(joined)));
  }
  return summary;
}

void QNReportingSession::writeSummaryJson() {
  if (!QNReportingIsInternalBuild(*platform_)) return;  // customer builds never write one
  auto nested = nestedAggregatedPayloadData();
  if (!nested) return;
  auto info = userInfo();

  // The text is fixed here, under the array's lock; the array keeps the inserted userInfo.
  std::optional<std::string> output;
  std::optional<Error> jsonError;
  {
    std::lock_guard guard(nested->lock);
    if (nested->items.empty()) return;
    nested->items.insert(nested->items.begin(), Value(info));
    std::string text;
    jsonError = ToJson(Value(nested->items), JsonStyle::kPretty, text);
    if (!jsonError) output = std::move(text);
  }
  if (jsonError) {
    SESSION_LOG(LogLevel::kError, "%s:%d:%s: dataWithJSONObject: %@", jsonError->Description());
  }

  const std::string directory = platform_->diagnostic_logs_dir;
  const Value* host = info->Find(kHostApplicationKey);
  const Date now{
      std::chrono::duration<double>(platform_->dispatcher->WallNow().time_since_epoch()).count()};
  const std::string name =
      StringWithFormat("%@-%@-%@-%@.json", FormatLocalTime(now, "yyyyMMdd-HHmmssZ"), "quenta",
                       host ? FileNameComponent(host->Description()) : std::string("unknown"),
                       QNReportingServiceTypeName(serviceType()));

  // The disk work runs on the summary queue when there is one: one writer, in stop order,
  // so a later file of the same name replaces an earlier one. The folders are opened
  // relative to the log folder, so a symbolic link or a folder of another user planted on
  // the way is refused rather than followed.
  Task write = [log = platform_->log, counters = platform_->counters, root = platform_->log_dir,
                maxFiles = platform_->max_summary_files, maxBytes = platform_->max_summary_bytes,
                scope = scope_, directory, name, output = std::move(output)] {
    FileDescriptor folder;
    std::optional<Error> folderError = OpenOwnFolder(root, directory, kSummaryFolderMode, folder);
    if (folderError) {
      QN_LOG(*log, scope.get(), LogLevel::kError,
             "%s:%d:%s: can't create logging directory at %@: %@", directory,
             folderError->Description());
    }
    if (!output) return;  // the serialiser refused: nothing to write
    std::optional<Error> writeError =
        folderError
            ? folderError
            : WriteFileAtomicallyAt(folder.get(), directory, name, *output, kSummaryFileMode);
    if (writeError) {
      QN_LOG(*log, scope.get(), LogLevel::kError, "%s:%d:%s: jsonOutput writeToURL: %@",
             writeError->Description());
      return;
    }
    const RemovedFiles removed = RemoveOldestFiles(folder.get(), ".json", maxFiles, maxBytes, name);
    if (removed.files) {
      Counters::Add(counters->summaryFilesRemoved, removed.files);
      QN_LOG(*log, scope.get(), LogLevel::kDefault,
             "%s:%d:%s: removed the %lu oldest summary files (%llu bytes) to keep at most %lu "
             "files and %llu bytes in %@",
             static_cast<unsigned long>(removed.files),
             static_cast<unsigned long long>(removed.bytes), static_cast<unsigned long>(maxFiles),
             static_cast<unsigned long long>(maxBytes), directory);
    }
  };
  if (platform_->summary_queue) {
    platform_->summary_queue->Async(std::move(write));
  } else {
    write();
  }
}

// ---------------------------------------------------------------------------------------
// Orientation reporting

bool QNReportingSession::shouldReportOrientation() const {
  if (!QNReportingIsInternalBuild(*platform_)) return false;
  const std::uint16_t type = serviceType();
  if (type != 7 && type != 2) return false;
  const std::int32_t deviceClass =
      platform_->device_info ? platform_->device_info->GetSInt32Answer("DeviceClassNumber") : 0;
  return deviceClass != 6;
}

void QNReportingSession::RegisterOrientationCallbacks(const std::string& callbackID) {
  if (!platform_->orientation) return;
  std::weak_ptr<QNReportingSession> weak = weak_from_this();
  platform_->orientation->RegisterDeviceOrientation(callbackID, [weak](std::int32_t orientation) {
    if (auto self = weak.lock()) self->HandleOrientation(true, orientation);
  });
  platform_->orientation->RegisterUIOrientation(callbackID, [weak](std::int32_t orientation) {
    if (auto self = weak.lock()) self->HandleOrientation(false, orientation);
  });
}

// On a thread of the orientation source's choosing.
void QNReportingSession::HandleOrientation(bool device, std::int32_t orientation) {
  const std::string text = platform_->orientation->OrientationToString(orientation);
  // Seconds since start, truncated to whole milliseconds.
  double interval = 0;  // startDate minus now: negative
  if (auto start = startDate_.load()) {
    interval = std::chrono::duration<double>(*start - platform_->dispatcher->WallNow()).count();
  }
  const double seconds = static_cast<double>(static_cast<std::int64_t>(interval * 1000)) / -1000.0;

  if (platform_->log->LogEnabled(scope_.get(), 5)) {
    auto info = userInfo();
    const Value* app = info->Find(kHostApplicationKey);
    const std::string appText = app ? app->Description() : std::string("(null)");
    auto callbackID = orientationCallbackID_.load();
    const std::string idText = callbackID ? *callbackID : std::string("(null)");
    if (device) {
      SESSION_LOG(LogLevel::kDebug,
                  "%s:%d:%s: Orientation handler callback mode=device orientation=\"%@\" "
                  "app=\"%@\", time=%@, id=\"%@\"",
                  text, appText, Value(seconds), idText);
    } else {
      SESSION_LOG(LogLevel::kDebug,
                  "%s:%d:%s: Orientation handler callback mode=ui orientation=\"%@\" "
                  "app=\"%@\", time=%@, id=\"%@\"",
                  text, appText, Value(seconds), idText);
    }
  }

  Dictionary entry;
  if (device) {
    entry.Set(Value("device_orientation"), Value(text));
    entry.Set(Value("device_orientation_time"), Value(seconds));
  } else {
    entry.Set(Value("ui_orientation"), Value(text));
    entry.Set(Value("ui_orientation_time"), Value(seconds));
  }
  Append(aggregatedPayloadData(), Value(std::move(entry)));
}

}  // namespace qn
