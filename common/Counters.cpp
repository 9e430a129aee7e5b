#include "common/Counters.h"

#include <string>

namespace qn {

Dictionary Counters::Snapshot() const {
  Dictionary byOp;
  for (std::uint32_t op = protocol::kFirstOp; op <= protocol::kLastOp; ++op) {
    byOp.Set(protocol::OpName(static_cast<protocol::Op>(op)), Value(Get(requests[op])));
  }
  Dictionary byCode;
  for (std::int64_t code = 1; code <= protocol::kLastConnectionError; ++code) {
    if (const std::uint64_t n = Get(badFrames[code])) byCode.Set(std::to_string(code), Value(n));
  }
  return Dictionary{
      {"requests", Value(std::move(byOp))},
      {"messages", Value(Get(requests[static_cast<std::size_t>(protocol::Op::kSendMessage)]))},
      {"bad_frames", Value(std::move(byCode))},
      {"paused", Value(Dictionary{{"requests", Value(Get(pausedForRequests))},
                                  {"replies", Value(Get(pausedForReplies))},
                                  {"store", Value(Get(pausedForStore))},
                                  {"request_bytes", Value(Get(pausedForBudget[0]))},
                                  {"frame_bytes", Value(Get(pausedForBudget[1]))},
                                  {"reply_bytes", Value(Get(pausedForBudget[2]))},
                                  {"uid_store_bytes", Value(Get(pausedForHeld[0]))},
                                  {"uid_parked_bytes", Value(Get(pausedForHeld[1]))}})},
      {"refused", Value(Dictionary{{"connections", Value(Get(connectionsRefused))},
                                   {"sessions", Value(Get(sessionsRefused))},
                                   {"replies_too_large", Value(Get(repliesTooLarge))},
                                   {"replies_unread", Value(Get(repliesUnread))},
                                   {"partial_frames", Value(Get(partialFrames))}})},
      {"aggregation_capped", Value(Get(aggregationCapped))},
      {"configuration_capped", Value(Get(configurationCapped))},
      {"summary_files_removed", Value(Get(summaryFilesRemoved))},
      {"log_lines_dropped", Value(Get(logLinesDropped))},
      {"connections_open", Value(Get(connectionsOpen))},
      {"sessions_open", Value(Get(sessionsOpen))},
      {"deliveries_queued", Value(Get(deliveriesQueued))},
      {"aggregated_bytes", Value(Get(aggregatedBytes))},
      {"configuration_bytes", Value(Get(configurationBytes))},
      {"parked_bytes", Value(Get(parkedBytes))},
  };
}

}  // namespace qn
