#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

#include "common/Protocol.h"
#include "common/Value.h"

namespace qn {

// The daemon's counters and gauges: what it took in, what it refused, how often flow
// control held a client back, what is open now. Every layer that does the counted thing
// bumps its counter; `qnreport stats` and `systemctl status` show a snapshot. Plain
// relaxed atomics: safe from any thread, never a lock, and a snapshot is not a
// consistent cut across counters (each value is exact on its own).
struct Counters {
  using Counter = std::atomic<std::uint64_t>;
  using Gauge = std::atomic<std::int64_t>;

  // Requests the IPC layer accepted, by operation (index: op number, 1..11).
  std::array<Counter, protocol::kLastOp + 1> requests{};
  // Frames refused as bad input, by connection error code (index: the code).
  std::array<Counter, protocol::kLastConnectionError + 1> badFrames{};

  // Flow control: times a connection stopped being read because it had too many requests
  // in the service, too many reply bytes unwritten, or because the store was behind.
  Counter pausedForRequests{0};
  Counter pausedForReplies{0};
  Counter pausedForStore{0};
  // Times a connection stopped being read because its uid, or all uids, held a byte budget
  // of the IPC layer (index: platform/linux/linux_ipc.h's IpcBudget: request, frame, reply).
  std::array<Counter, 3> pausedForBudget{};
  // Times a connection stopped being read because the service held too many bytes for its
  // uid (index: common/HeldBytes.h's Kind: messages waiting for the store, parked messages).
  std::array<Counter, 2> pausedForHeld{};

  // Limits: what was refused and why.
  Counter connectionsRefused{0};   // over the connection limit
  Counter sessionsRefused{0};      // over the per-client or the total session limit
  Counter aggregationCapped{0};    // payloads delivered but not aggregated (session over its cap)
  Counter repliesTooLarge{0};      // replies that did not fit a frame (connection closed)
  Counter repliesUnread{0};        // connections closed for leaving too many replies unread
  Counter partialFrames{0};        // connections closed for holding a partial frame too long
  Counter configurationCapped{0};  // configurations held but not merged (session over its cap)

  // The oldest summary files removed to keep their folder within its limits.
  Counter summaryFilesRemoved{0};

  // Drops: there should be none but the store's on a full disk.
  Counter logLinesDropped{0};  // the log's stream was full or gone

  // Gauges.
  Gauge connectionsOpen{0};
  Gauge sessionsOpen{0};
  Gauge deliveriesQueued{0};    // messages handed to sessions, not yet handed to the store
  Gauge aggregatedBytes{0};     // payload bytes the sessions hold for their summaries
  Gauge configurationBytes{0};  // configuration bytes the sessions hold
  Gauge parkedBytes{0};         // payload bytes of single messages waiting in delay timers

  // Increments a counter; `n` may be any amount.
  static void Add(Counter& counter, std::uint64_t n = 1) {
    counter.fetch_add(n, std::memory_order_relaxed);
  }
  static void Add(Gauge& gauge, std::int64_t n) { gauge.fetch_add(n, std::memory_order_relaxed); }
  static std::uint64_t Get(const Counter& counter) {
    return counter.load(std::memory_order_relaxed);
  }
  static std::int64_t Get(const Gauge& gauge) { return gauge.load(std::memory_order_relaxed); }

  // A snapshot as a dictionary (the stats file's body, without the store's part): requests
  // by operation name, bad frames by code, and every other counter by name.
  Dictionary Snapshot() const;
};

}  // namespace qn
