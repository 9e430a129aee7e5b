#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>

namespace qn {

// What the daemon holds for the clients of one uid beyond the IPC layer's own buffers, in
// approximate bytes (Value::ApproximateBytes), by kind. The IPC layer keeps one account per
// uid (IpcConnection::PeerHeldBytes) and stops reading a uid whose messages or parked
// messages pass their limit; the sessions refuse to merge a configuration that would pass
// the uid's. Totals for all uids are kept where the bytes live (the store's backlog, the
// counters' gauges). Relaxed atomics: safe from any thread, never a lock.
class HeldBytes {
 public:
  enum Kind : std::size_t {
    kStore,          // records handed to the store, not yet written
    kParked,         // single messages waiting in delay timers
    kConfiguration,  // the user info of the uid's sessions
    kKindCount,
  };

  void Add(Kind kind, std::int64_t bytes) {
    bytes_[kind].fetch_add(bytes, std::memory_order_relaxed);
  }
  std::int64_t Get(Kind kind) const { return bytes_[kind].load(std::memory_order_relaxed); }

  // Charges the work done on this thread, while it lives, to `account` (may be null:
  // nobody's): the store takes the current account with each record handed over and gives
  // the bytes back once the record is written; a parked single message and the
  // configuration of a session created now count there too; work queued for later carries
  // the charge along. So the service only says whose request it is serving. Nests: the
  // innermost wins.
  class Charge {
   public:
    explicit Charge(std::shared_ptr<HeldBytes> account);
    ~Charge();
    Charge(const Charge&) = delete;
    Charge& operator=(const Charge&) = delete;

    // The account charged on this thread now; null outside any Charge.
    static const std::shared_ptr<HeldBytes>& Current();

   private:
    std::shared_ptr<HeldBytes> previous_;
  };

 private:
  std::array<std::atomic<std::int64_t>, kKindCount> bytes_{};
};

}  // namespace qn
