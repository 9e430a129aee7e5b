#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "common/Error.h"
#include "common/HeldBytes.h"
#include "common/Value.h"
#include "platform/platform.h"

namespace qn {

// One aggregation array of a session (its payloads, or its message-ID -> payload entries),
// guarded by a lock of its own. Whoever reads, appends to or replaces the array takes the
// lock of the instance it fetched from the session; no other lock is ever taken while it
// is held.
struct QNReportingPayloadArray {
  QNReportingPayloadArray() = default;
  // `counted`: the counters whose aggregatedBytes gauge holds this array's bytes while it
  // lives (null: not counted).
  explicit QNReportingPayloadArray(std::shared_ptr<Counters> counted)
      : counted(std::move(counted)) {}
  ~QNReportingPayloadArray() {
    if (counted) Counters::Add(counted->aggregatedBytes, -static_cast<std::int64_t>(bytes));
  }
  QNReportingPayloadArray(const QNReportingPayloadArray&) = delete;
  QNReportingPayloadArray& operator=(const QNReportingPayloadArray&) = delete;

  mutable std::mutex lock;
  Array items;            // guarded by lock
  std::size_t bytes = 0;  // guarded by lock: the items' approximate size
  const std::shared_ptr<Counters> counted;

  // A copy of the items, taken under the lock.
  Array Snapshot() const {
    std::lock_guard guard(lock);
    return items;
  }
};

namespace session_detail {

// A shared_ptr that is read and replaced indivisibly from any thread.
template <typename T>
class AtomicShared {
 public:
  AtomicShared() = default;
  explicit AtomicShared(std::shared_ptr<T> p) : p_(std::move(p)) {}
  std::shared_ptr<T> load() const { return p_.load(); }
  void store(std::shared_ptr<T> p) { p_.store(std::move(p)); }

 private:
  std::atomic<std::shared_ptr<T>> p_;
};

}  // namespace session_detail

// One client's reporting session, identified by a 64-bit reporter ID. It holds a session of
// the real-time reporting framework (LivoReporting) while started, aggregates what is sent
// through it, and on stop sends a summary event and (on internal builds) writes a summary
// file.
//
// Threads: the operations (configuration, service type, start, stop, send, summary) are
// called by the request handler, one at a time (the server queue). Framework work runs on
// the session's own serial queue, `livoReportingQueue()`, in submission order. Every
// property accessor is safe from any thread. Objects handed out by accessors are
// immutable snapshots, except the aggregation arrays, which are guarded by their own locks.
//
// Lifetime: reference counted; work queued on the session's queue (start and end
// sequences, deliveries) holds the session until it has run. Orientation callbacks hold it
// weakly. Destroying it neither stops it nor unregisters anything: the request handler
// stops sessions before dropping them.
class QNReportingSession : public std::enable_shared_from_this<QNReportingSession> {
 public:
  using ReplyBlock = std::function<void(std::optional<Error>)>;
  using TransactionCompleteBlock = std::function<void(bool)>;

  static constexpr std::uint16_t kServiceTypeNotSet = 0xFFFF;
  static constexpr std::uint16_t kServiceTypeAlarms = 4;
  static constexpr std::uint16_t kServiceTypeTest = 11;
  static constexpr std::uint16_t kServiceTypeApiUsage = 12;
  static constexpr std::uint32_t kSummaryEventCategory = 0xFFFFFFFF;
  static constexpr std::uint16_t kSummaryEventType = 0xFFFF;
  // How long the start waits for the framework to find its backends, per single wait.
  static constexpr double kBackendWaitSeconds = 9.0;

  // Creates a session with service type 65535 ("unknown"), an empty user info, empty
  // counts and aggregation arrays, and its own serial queue
  // ("com.norvel.quenta.session.livoreporting", utility class). Logs the creation and
  // emits its trace point. Returns null when `platform` lacks a log or a dispatcher.
  // `processIdentifiers` is kept, never read. The session's configuration counts in the
  // HeldBytes account charged on the calling thread (its creator's uid), if any.
  static std::shared_ptr<QNReportingSession> initWithID(std::shared_ptr<const Platform> platform,
                                                        std::int64_t reporterID,
                                                        Array processIdentifiers);

  // Logs the release and emits its trace point; nothing else.
  ~QNReportingSession();

  QNReportingSession(const QNReportingSession&) = delete;
  QNReportingSession& operator=(const QNReportingSession&) = delete;

  // Merges every entry of `configuration` into userInfo (later values replace earlier ones
  // under the same key); null changes nothing. Works in any state. userInfo is replaced by
  // a merged copy, so snapshots taken earlier stay as they were. A configuration that would
  // take userInfo past the platform's max_configuration_bytes, the creator's uid's sessions
  // past max_configuration_bytes_per_uid, or all sessions' user info past
  // max_configuration_bytes_total, is not merged (counted; logged once per session).
  // updateDefaults merges the same way, without the caps (the defaults are the daemon's).
  // REQUIRES: on the request handler's thread.
  void setConfiguration(const Dictionary* configuration) { MergeUserInfo(configuration, true); }
  void updateDefaults(const Dictionary* defaults) { MergeUserInfo(defaults, false); }
  void setConfiguration(const std::shared_ptr<const Dictionary>& configuration) {
    setConfiguration(configuration.get());
  }
  void updateDefaults(const std::shared_ptr<const Dictionary>& defaults) {
    updateDefaults(defaults.get());
  }

  // Starts the session: marks it started, replaces both aggregation arrays by empty ones,
  // registers orientation callbacks when shouldReportOrientation(), and queues the start
  // sequence (framework session creation and the wait of up to 9 s per single wait for
  // backends) on livoReportingQueue(). Returns at once; deliveries queued later run after
  // the start sequence has ended. On a started session it only logs "is already started".
  void start();

  // Unregisters orientation callbacks (when registered and still wanted); then, only when
  // started: sends the summary event, writes the summary file, queues the flush and drop of
  // the framework session, sets both aggregation arrays to null and marks the session
  // stopped.
  void stop();

  // Sets serviceType and serviceName (QNReportingServiceTypeName). Any time, any number
  // of times; a framework session already created keeps the name it was created with.
  void setServiceType(std::uint16_t serviceType);

  // Counts a message of this category and type and returns its identifier:
  // "<category name>_<type name>_<count>", the count running per pair for the session's
  // whole life ("Setup_Start_1", "Setup_Start_2", ...).
  // REQUIRES: called only on the request handler's thread (counts are not locked).
  std::string messageIdForCategory(std::uint32_t category, std::uint16_t type);

  // Takes a message: normalises the payload's string keys (blanks -> "_"; null = empty
  // payload), counts it, appends it to the aggregation arrays (when present), and queues its
  // delivery on livoReportingQueue(): through the framework session when the session was
  // started when the message was taken, else as a single message. `reply` (may be empty)
  // is called at once with no error, before delivery; `sync` is accepted and ignored.
  void sendMessage(std::shared_ptr<const Dictionary> payload, std::uint32_t category,
                   std::uint16_t type, ReplyBlock reply);
  void sendMessage(std::shared_ptr<const Dictionary> payload, std::uint32_t category,
                   std::uint16_t type, bool sync, ReplyBlock reply);

  // Sends a standalone message on the platform's global background queue, after a random
  // 0-59 s delay for service type 4 ("alarms"), at once otherwise. `userInfo` is accepted and
  // ignored (the single message's user info is fixed). `reply` (may be empty) gets the
  // framework's error, or none on success, on a background thread. Returns at once.
  // Does nothing without a log and a dispatcher; without a LivoReporting the send fails.
  static void sendSingleMessage(const std::shared_ptr<const Platform>& platform,
                                std::shared_ptr<const Dictionary> payload, std::uint32_t category,
                                std::uint16_t type, std::uint16_t serviceType,
                                std::shared_ptr<const Dictionary> userInfo, ReplyBlock reply);

  // Whether orientation changes are recorded: internal build, service type 2 or 7, and a
  // device class number other than 6.
  bool shouldReportOrientation() const;

  // The summary event of the aggregated payloads: "QN_Session_Summary_Event" -> the
  // service type, then every payload key -> its values' printed forms joined with ",", in
  // payload order. Null when there is nothing aggregated (or the array is gone).
  std::shared_ptr<const Dictionary> createSummaryEventForSession() const;

  // On internal builds, when the nested array holds entries: inserts userInfo at its front
  // and writes it as pretty JSON to
  // "<diagnostic_logs_dir>/<yyyyMMdd-HHmmssZ>-quenta-<host app or unknown>-<service name>.json".
  // A "/" in the host application name becomes "_" so the file stays in the directory.
  // The text and the name are fixed here; the folders (0750, made and opened relative to
  // the log folder, refused when a symbolic link or another user's), the atomic write
  // (0640) and the removal of the oldest files beyond the platform's limits run on the
  // platform's summary queue (in the order sessions stop), or here when the platform has
  // none. Failures are logged, never reported.
  void writeSummaryJson();

  // Properties.
  std::int64_t reporterID() const { return reporterID_.load(); }
  void setReporterID(std::int64_t id) { reporterID_.store(id); }
  std::uint16_t serviceType() const { return serviceType_.load(); }
  std::string serviceName() const { return *serviceName_.load(); }
  const Array& processIdentifiers() const { return processIdentifiers_; }
  bool started() const { return started_.load(); }
  void setStarted(bool started) { started_.store(started); }
  bool livoReportingSessionStarted() const { return livoReportingSessionStarted_.load(); }
  void setLivoReportingSessionStarted(bool v) { livoReportingSessionStarted_.store(v); }
  // Never null.
  std::shared_ptr<const Dictionary> userInfo() const { return userInfo_.load(); }
  void setUserInfo(std::shared_ptr<const Dictionary> info);
  // Null = absent. Set and read by the request handler; the session only holds it.
  std::shared_ptr<const Dictionary> driverSnapShot() const { return driverSnapShot_.load(); }
  void setDriverSnapShot(std::shared_ptr<const Dictionary> s) {
    driverSnapShot_.store(std::move(s));
  }
  // Empty = absent. The deferred start reply; the session only holds it.
  TransactionCompleteBlock transactionCompleteBlock() const;
  void setTransactionCompleteBlock(TransactionCompleteBlock block);
  // Null after stop.
  std::shared_ptr<QNReportingPayloadArray> aggregatedPayloadData() const {
    return aggregatedPayloadData_.load();
  }
  void setAggregatedPayloadData(std::shared_ptr<QNReportingPayloadArray> a) {
    aggregatedPayloadData_.store(std::move(a));
  }
  std::shared_ptr<QNReportingPayloadArray> nestedAggregatedPayloadData() const {
    return nestedAggregatedPayloadData_.load();
  }
  void setNestedAggregatedPayloadData(std::shared_ptr<QNReportingPayloadArray> a) {
    nestedAggregatedPayloadData_.store(std::move(a));
  }
  // "category_type" name -> count. Read and written on the server queue only.
  const Dictionary& messageTypeCounts() const { return messageTypeCounts_; }
  // "QNReportingService <reporterID>" while orientation callbacks are registered.
  std::optional<std::string> orientationCallbackID() const;
  // When the session last started while reporting orientation.
  std::optional<Date> startDate() const;
  // Null before start, after a failed start and after stop.
  std::shared_ptr<LivoReportingSession> livoReportingSession() const {
    return livoReportingSession_.load();
  }
  void setLivoReportingSession(std::shared_ptr<LivoReportingSession> s) {
    livoReportingSession_.store(std::move(s));
  }
  std::shared_ptr<const LivoSecureHierarchyToken> livoReportingAgentToken() const {
    return livoReportingAgentToken_.load();
  }
  const std::shared_ptr<SerialQueue>& livoReportingQueue() const { return livoReportingQueue_; }

 private:
  struct Token {};

 public:
  // Use initWithID.
  QNReportingSession(Token, std::shared_ptr<const Platform> platform,
                     std::shared_ptr<const LogScope> scope, std::int64_t reporterID,
                     Array processIdentifiers);

 private:
  struct StartCapture;
  void RunStartSequence(const StartCapture& capture);
  void RunEndSequence();
  void Deliver(std::shared_ptr<const Dictionary> converted,
               std::shared_ptr<const Dictionary> original, std::uint32_t category,
               std::uint16_t type, bool wasStarted);
  void RegisterOrientationCallbacks(const std::string& callbackID);
  void HandleOrientation(bool device, std::int32_t orientation);
  void MergeUserInfo(const Dictionary* entries, bool capped);
  // Sets userInfoBytes_, counting the change in the counters and the creator's account.
  void CountUserInfoBytes(std::size_t bytes);
  // Appends `item` of `bytes` unless that would take the array past `cap` bytes, or every
  // counted array together past `totalCap`.
  enum class AppendResult { kAppended, kGone, kSessionFull, kAllFull };
  static AppendResult Append(const std::shared_ptr<QNReportingPayloadArray>& array, Value item,
                             std::size_t bytes = 0, std::size_t cap = SIZE_MAX,
                             std::size_t totalCap = SIZE_MAX);

  const std::shared_ptr<const Platform> platform_;
  const std::shared_ptr<HeldBytes> heldBytes_;   // the creator's uid's; may be null
  const std::shared_ptr<const LogScope> scope_;  // "qnrr"; null = the default log
  const Array processIdentifiers_;
  const std::shared_ptr<SerialQueue> livoReportingQueue_;

  std::atomic<std::int64_t> reporterID_;
  std::atomic<std::uint16_t> serviceType_{kServiceTypeNotSet};
  session_detail::AtomicShared<const std::string> serviceName_;
  std::atomic<bool> started_{false};
  std::atomic<bool> livoReportingSessionStarted_{false};
  std::atomic<bool> aggregationCapped_{false};  // the cap was reached since the last start
  bool configurationCapped_ = false;  // request handler only: a configuration was not merged
  std::size_t userInfoBytes_ = 0;     // request handler only: counted in configurationBytes
  session_detail::AtomicShared<const Dictionary> userInfo_;
  session_detail::AtomicShared<const Dictionary> driverSnapShot_;
  session_detail::AtomicShared<const TransactionCompleteBlock> transactionCompleteBlock_;
  session_detail::AtomicShared<QNReportingPayloadArray> aggregatedPayloadData_;
  session_detail::AtomicShared<QNReportingPayloadArray> nestedAggregatedPayloadData_;
  Dictionary messageTypeCounts_;  // server queue only, hence no lock
  session_detail::AtomicShared<const std::string> orientationCallbackID_;
  session_detail::AtomicShared<const std::chrono::system_clock::time_point> startDate_;
  session_detail::AtomicShared<LivoReportingSession> livoReportingSession_;
  session_detail::AtomicShared<const LivoSecureHierarchyToken> livoReportingAgentToken_;
};

}  // namespace qn
