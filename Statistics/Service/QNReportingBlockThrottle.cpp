#include "Statistics/Service/QNReportingBlockThrottle.h"

#include <algorithm>
#include <cmath>
#include <exception>
#include <utility>

#include <asio/post.hpp>

#include "Statistics/QNReportingUtility.h"

namespace qn {
namespace {

using namespace std::chrono_literals;

// How long the queue thread sleeps between passes.
constexpr auto kIdleSleep = 100ms;
// waitForCompletion polls every half second, ten times at most.
constexpr auto kCompletionPoll = 500ms;
constexpr unsigned kCompletionPolls = 10;
constexpr unsigned kCompletionWaitSeconds = 5;
constexpr double kDefaultSleepTime = 0.5;
constexpr double kMaxThrottleSeconds = 5.0;

// The payload keys whose values never take part in the comparison, in this order: the
// three time stamps clients add to their messages, then the two control fields.
const std::vector<Value>& DefaultSkipList() {
  static const std::vector<Value> list = {
      Value("systemuptime_sec"), Value("processuptime_ms"), Value("qnreporting_timestamp"),
      Value("_comparison_field_blacklist"), Value("_throttle_seconds")};
  return list;
}

// Now plus `seconds` (a throttle time, below 5; zero or negative: now).
std::chrono::steady_clock::time_point After(double seconds) {
  const auto now = std::chrono::steady_clock::now();
  if (!(seconds > 0)) return now;
  return now + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                   std::chrono::duration<double>(std::min(seconds, kMaxThrottleSeconds)));
}

// A key's text for ordering and for the message key: a string as itself, anything else by
// its printed form.
std::string KeyText(const Value& key) {
  return key.as_string() ? *key.as_string() : key.Description();
}

}  // namespace

#define THROTTLE_LOG(level, format, ...) \
  QN_LOG(*log_, scope_.get(), (level), (format)__VA_OPT__(, ) __VA_ARGS__)

QNReportingBlockThrottleTimerWrapper::QNReportingBlockThrottleTimerWrapper(Block block,
                                                                           double delaySeconds)
    : block_(std::make_shared<const Block>(std::move(block))), fireDate_(After(delaySeconds)) {}

void QNReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  fireDate_.store(After(seconds));
}

QNReportingBlockThrottle::QNReportingBlockThrottle(std::shared_ptr<Log> log,
                                                   std::shared_ptr<const LogScope> scope)
    : log_(std::move(log)), scope_(std::move(scope)) {
  unscheduledTimerKeys_.reserve(6);
  queueThread_ = std::thread([this] { queueThreadBody(); });
}

QNReportingBlockThrottle::~QNReportingBlockThrottle() {
  stop();
  // The timers belong to the event loop, which goes after them.
  timersInFlight_.clear();
}

void QNReportingBlockThrottle::stop() {
  shouldKeepRunning_ = false;
  workingRunLoop_.stop();
  if (queueThread_.joinable() && queueThread_.get_id() != std::this_thread::get_id()) {
    queueThread_.join();
  }
}

void QNReportingBlockThrottle::queueThreadBody() {
  while (shouldKeepRunning_) {
    if (unscheduledTimerKeysCount_.load() > 0) {
      THROTTLE_LOG(LogLevel::kDebug,
                   "%s:%d:%s: calling workingRunLoop run from inside thread block");
      std::vector<std::string> keys;
      {
        std::lock_guard lock(unscheduledTimerKeysLock_);
        keys.swap(unscheduledTimerKeys_);
        unscheduledTimerKeys_.reserve(6);
        unscheduledTimerKeysCount_ = 0;
      }
      // The keys' wrappers are looked up after the key lock is released: the two locks are
      // never held together.
      for (const std::string& key : keys) {
        std::shared_ptr<Wrapper> wrapper;
        {
          std::lock_guard lock(timersInFlightLock_);
          auto found = timersInFlight_.find(key);
          if (found != timersInFlight_.end()) wrapper = found->second;
        }
        if (wrapper) schedule(key, wrapper);
      }
      // Returns when every timer scheduled so far has fired (or on stop). An action's
      // exception ends this run; the loop runs again for the timers that are left.
      workingRunLoop_.restart();
      while (shouldKeepRunning_) {
        try {
          workingRunLoop_.run();
          break;
        } catch (const std::exception& e) {
          THROTTLE_LOG(LogLevel::kError, "%s:%d:%s: throttled action failed: %s", e.what());
        } catch (...) {
          THROTTLE_LOG(LogLevel::kError, "%s:%d:%s: throttled action failed");
        }
      }
    }
    THROTTLE_LOG(LogLevel::kDebug, "%s:%d:%s: sleeping in thread");
    std::this_thread::sleep_for(kIdleSleep);
  }
}

void QNReportingBlockThrottle::schedule(const std::string& key,
                                        const std::shared_ptr<Wrapper>& wrapper) {
  if (!wrapper->timer_) wrapper->timer_ = std::make_unique<asio::steady_timer>(workingRunLoop_);
  // A date that has passed already fires at once.
  wrapper->timer_->expires_at(wrapper->fireDate());
  wrapper->timer_->async_wait([this, key, wrapper](const std::error_code& error) {
    if (!error) fire(key, wrapper);
  });
}

void QNReportingBlockThrottle::rearm(const std::string& key) {
  std::shared_ptr<Wrapper> wrapper;
  {
    std::lock_guard lock(timersInFlightLock_);
    auto found = timersInFlight_.find(key);
    if (found != timersInFlight_.end()) wrapper = found->second;
  }
  // A wrapper not yet scheduled gets its date when it is. A wait that has completed already
  // (nothing to cancel) has its fire queued, which reads the date itself.
  if (!wrapper || !wrapper->timer_ || wrapper->timer_->expiry() <= wrapper->fireDate()) return;
  if (wrapper->timer_->cancel() > 0) schedule(key, wrapper);
}

void QNReportingBlockThrottle::fire(const std::string& key,
                                    const std::shared_ptr<Wrapper>& wrapper) {
  // A duplicate moved the date while the timer waited: wait again, until the new date.
  if (wrapper->fireDate() > std::chrono::steady_clock::now()) {
    schedule(key, wrapper);
    return;
  }
  std::exception_ptr failure;
  try {
    if (auto block = wrapper->block(); block && *block) (*block)();
  } catch (...) {
    failure = std::current_exception();
  }
  // The entry goes after the action: a duplicate that arrived while the action ran moved
  // the date and replaced the block of this very entry, and is lost with it.
  {
    std::lock_guard lock(timersInFlightLock_);
    auto found = timersInFlight_.find(key);
    if (found != timersInFlight_.end()) {
      if (found->second->timer_) found->second->timer_->cancel();
      timersInFlight_.erase(found);
      timersInFlightCount_ = timersInFlight_.size();
    }
  }
  if (failure) std::rethrow_exception(failure);
}

void QNReportingBlockThrottle::addMessageBlock(Block block, std::int64_t reporterID,
                                               const Dictionary& message, std::uint32_t category,
                                               std::uint16_t type) {
  const std::string key = buildMessageKey(message, reporterID, category, type);
  const double delay = determineSleepTime(message, *log_, scope_.get());

  // The duplicate lookup takes the map's lock: a std::map cannot be read while another
  // thread inserts into it. The lock is released before anything else is taken.
  std::shared_ptr<Wrapper> existing;
  {
    std::lock_guard lock(timersInFlightLock_);
    auto found = timersInFlight_.find(key);
    if (found != timersInFlight_.end()) existing = found->second;
  }
  if (existing) {
    THROTTLE_LOG(LogLevel::kDebug, "%s:%d:%s: Dropping duplicate message for %@", key);
    const auto before = existing->fireDate();
    existing->sleepFor(delay);
    existing->setBlock(std::move(block));
    // A later date is met when the timer fires; an earlier one needs the timer moved.
    if (existing->fireDate() < before) asio::post(workingRunLoop_, [this, key] { rearm(key); });
    return;
  }

  auto wrapper = std::make_shared<Wrapper>(std::move(block), delay);
  {
    std::lock_guard lock(timersInFlightLock_);
    timersInFlight_[key] = wrapper;
    timersInFlightCount_ = timersInFlight_.size();
  }
  {
    std::lock_guard lock(unscheduledTimerKeysLock_);
    unscheduledTimerKeys_.push_back(key);
    unscheduledTimerKeysCount_ = unscheduledTimerKeys_.size();
  }
}

void QNReportingBlockThrottle::waitForCompletion() {
  THROTTLE_LOG(LogLevel::kInfo,
               "%s:%d:%s: waitForCompletion. timersInFlight=%u unscheduledTimerKeys=%u",
               timersInFlightCount(), unscheduledTimerKeysCount());
  if (timersInFlightCount() == 0) return;
  THROTTLE_LOG(LogLevel::kDebug,
               "%s:%d:%s: Waiting up to %u seconds for blockThrottle queue to be empty.",
               kCompletionWaitSeconds);
  for (unsigned polls = 0; polls < kCompletionPolls && timersInFlightCount() > 0; ++polls) {
    std::this_thread::sleep_for(kCompletionPoll);
  }
  if (timersInFlightCount() == 0) return;
  THROTTLE_LOG(LogLevel::kDefault,
               "%s:%d:%s: Giving up on waiting for completion after %u seconds. timersInFlight=%u",
               kCompletionWaitSeconds, timersInFlightCount());
}

std::string QNReportingBlockThrottle::buildMessageKey(const Dictionary& message,
                                                      std::int64_t reporterID,
                                                      std::uint32_t category, std::uint16_t type) {
  std::vector<Value> skip = DefaultSkipList();
  if (const Value* blacklist = message.Find("_comparison_field_blacklist")) {
    if (const Array* names = blacklist->as_array()) {
      skip.insert(skip.end(), names->begin(), names->end());
    }
  }
  if (message.Contains("Volume") && message.Contains("VolumeOperationTime")) {
    skip.emplace_back("Volume");
    skip.emplace_back("VolumeOperationTime");
  }

  std::vector<std::pair<std::string, const Dictionary::Entry*>> keys;
  keys.reserve(message.size());
  for (const auto& entry : message) keys.emplace_back(KeyText(entry.first), &entry);
  std::sort(keys.begin(), keys.end(),
            [](const auto& a, const auto& b) { return a.first < b.first; });

  std::vector<std::string> parts;
  parts.reserve(6);
  for (const auto& [text, entry] : keys) {
    parts.push_back(text);
    const bool skipped = std::find(skip.begin(), skip.end(), entry->first) != skip.end();
    parts.push_back(skipped ? "^" : entry->second.Description());
  }
  parts.push_back("reporterID");
  parts.push_back(StringWithFormat("%lld", reporterID));
  parts.push_back(QNReportingCategoryName(category));
  parts.push_back(QNReportingTypeName(type));

  // Joined by position: an empty part (an empty payload key or value) keeps its place.
  std::string key;
  for (std::size_t i = 0; i < parts.size(); ++i) {
    if (i > 0) key += '|';
    key += parts[i];
  }
  return key;
}

double QNReportingBlockThrottle::determineSleepTime(const Dictionary& message, Log& log,
                                                    const LogScope* scope) {
  const Value* time = message.Find("_throttle_seconds");
  if (!time) return kDefaultSleepTime;
  const std::optional<double> seconds = time->is_number() ? time->as_double() : std::nullopt;
  if (!seconds) {
    QN_LOG(log, scope, LogLevel::kInfo,
           "%s:%d:%s: Rejecting non Valbox value of throttle time. {time=%@}", *time);
    return kDefaultSleepTime;
  }
  // The integer part, truncated, at most 4: 4.99 is accepted, 5 is not. (A value too
  // large for a 64-bit integer is too large here as well.)
  if (*seconds < kMaxThrottleSeconds) {
    return static_cast<double>(static_cast<float>(*seconds));
  }
  QN_LOG(log, scope, LogLevel::kInfo, "%s:%d:%s: Rejecting large throttle time. {time=%@, max=%f}",
         *time, kMaxThrottleSeconds);
  return kDefaultSleepTime;
}

}  // namespace qn
