#pragma once

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/Value.h"
#include "platform/log.h"

namespace qn {

class QNReportingBlockThrottle;

// One pending action of the throttle and the one-shot timer that will run it.
// `block` may be read and replaced from any thread; the timer's fire date likewise (it is
// only a date until the throttle's thread schedules the timer; after that the thread
// re-reads it whenever the timer fires, and the throttle moves the timer when a duplicate
// brings the date forward).
class QNReportingBlockThrottleTimerWrapper {
 public:
  using Block = std::function<void()>;
  using Clock = std::chrono::steady_clock;

  explicit QNReportingBlockThrottleTimerWrapper(Block block, double delaySeconds);

  std::shared_ptr<const Block> block() const { return block_.load(); }
  void setBlock(Block block) { block_.store(std::make_shared<const Block>(std::move(block))); }

  // Moves the fire date to now plus `seconds` (zero or negative: now).
  void sleepFor(double seconds);
  Clock::time_point fireDate() const { return fireDate_.load(); }

 private:
  friend class QNReportingBlockThrottle;

  std::atomic<std::shared_ptr<const Block>> block_;
  std::atomic<Clock::time_point> fireDate_;
  // The waitable timer, made and used only on the throttle's thread once it schedules
  // the wrapper; destroyed before the throttle's event loop.
  std::unique_ptr<asio::steady_timer> timer_;
};

// A debounce of duplicate messages. A sender hands it an action with a message; the action
// runs on the throttle's own thread after the message's throttle time, unless a duplicate
// (a message with the same key, see buildMessageKey) arrives first: then the earlier action
// is dropped, the later one takes its place and the delay starts again. Only the last
// action of a burst runs, once the burst has been quiet for the throttle time.
//
// Threads: addMessageBlock and waitForCompletion may be called from any thread; every
// action runs on the throttle's thread, one at a time. The two collections are guarded by
// one lock each, never held together.
class QNReportingBlockThrottle {
 public:
  using Block = QNReportingBlockThrottleTimerWrapper::Block;

  // Starts the throttle's thread. Lines go to `scope` of `log` (null: the default log).
  QNReportingBlockThrottle(std::shared_ptr<Log> log, std::shared_ptr<const LogScope> scope);
  // Stops the thread (see stop()).
  ~QNReportingBlockThrottle();
  QNReportingBlockThrottle(const QNReportingBlockThrottle&) = delete;
  QNReportingBlockThrottle& operator=(const QNReportingBlockThrottle&) = delete;

  // Runs `block` after the message's throttle time unless a duplicate of the message comes
  // first (which then replaces the block and restarts the delay: the action is due at the
  // duplicate's time plus the duplicate's own throttle time, earlier or later than before). An
  // action that throws still has its entry removed; the exception is logged at error level on the
  // throttle's thread, which goes on.
  void addMessageBlock(Block block, std::int64_t reporterID, const Dictionary& message,
                       std::uint32_t category, std::uint16_t type);

  // Blocks the caller while actions are pending, at most 5 seconds (ten half-second polls).
  // Pending actions are left in place and still run later.
  void waitForCompletion();

  // An orderly stop: the thread ends after its current pass (at most about 0.1 s, or once
  // the running action returns) and is joined. Pending actions are dropped, never run.
  // Idempotent; called by the destructor.
  void stop();

  // The message key: equal for two messages exactly when they are duplicates. Payload keys
  // in code-point order, each followed by its printed value or "^" when the key is skipped
  // (the default skip list, the sender's "_comparison_field_blacklist" array, and Volume /
  // VolumeOperationTime when both are present), then "reporterID", the ID, and the names of
  // the category and type, joined by "|" by position (an empty part keeps its place).
  static std::string buildMessageKey(const Dictionary& message, std::int64_t reporterID,
                                     std::uint32_t category, std::uint16_t type);

  // The message's throttle time in seconds: its "_throttle_seconds" when that is a number
  // whose integer part is at most 4 (read as a single-precision float), else 0.5 (with an
  // info line when the value was there but refused).
  static double determineSleepTime(const Dictionary& message, Log& log,
                                   const LogScope* scope = nullptr);

  // The counts, read without the locks (for logs and tests).
  std::size_t timersInFlightCount() const { return timersInFlightCount_.load(); }
  std::size_t unscheduledTimerKeysCount() const { return unscheduledTimerKeysCount_.load(); }

 private:
  using Wrapper = QNReportingBlockThrottleTimerWrapper;

  // The body of the queue thread: passes until shouldKeepRunning is false.
  void queueThreadBody();
  // Schedules the wrapper's timer on this thread's event loop. Queue thread only.
  void schedule(const std::string& key, const std::shared_ptr<Wrapper>& wrapper);
  // A duplicate moved the date of `key` earlier: moves its scheduled timer there. Queue
  // thread only.
  void rearm(const std::string& key);
  // The timer of `key` fired: run its block unless its date moved, then drop the entry.
  void fire(const std::string& key, const std::shared_ptr<Wrapper>& wrapper);

  std::shared_ptr<Log> log_;
  std::shared_ptr<const LogScope> scope_;
  asio::io_context workingRunLoop_;  // the queue thread's event loop; outlives the timers

  std::atomic<bool> shouldKeepRunning_{true};

  std::mutex timersInFlightLock_;
  std::map<std::string, std::shared_ptr<Wrapper>> timersInFlight_;  // by timersInFlightLock_
  std::atomic<std::size_t> timersInFlightCount_{0};

  std::mutex unscheduledTimerKeysLock_;
  std::vector<std::string> unscheduledTimerKeys_;  // by unscheduledTimerKeysLock_
  std::atomic<std::size_t> unscheduledTimerKeysCount_{0};

  std::thread queueThread_;  // last: started once everything above exists
};

}  // namespace qn
