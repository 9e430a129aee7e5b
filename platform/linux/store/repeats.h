#pragma once

#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <unordered_map>

#include "common/Value.h"

namespace qn::store {

// The message rows the writer inserted last, looked up by content, so that an analytics
// event that repeats a message (its payload plus "HostApplicationDisplayID") can refer to
// the message's row instead of copying it. A match is exact: the event's JSON text is
// then the message's with json_set of that one key, byte for byte (same keys in the same
// order, same kinds of values; every key a string; a host of plain printable ASCII).
// Writer thread only.
class RecentMessages {
 public:
  // What an event refers to: the message row and the host name it adds.
  struct Repeat {
    std::int64_t message = 0;
    std::string host;
  };

  // Remembers message row `id` with `payload`; forgets the oldest beyond a few thousand.
  void Add(std::int64_t id, const Value& payload);

  // The row of a remembered message that `event_payload` repeats, or nullopt.
  std::optional<Repeat> Find(const Value& event_payload) const;

  // How many rows are remembered; Forget(count) drops those added since it was taken
  // (their transaction was rolled back, so their ids are not rows).
  std::size_t Mark() const { return order_.size(); }
  void Forget(std::size_t mark);

 private:
  using Index = std::unordered_multimap<std::uint64_t, std::pair<std::int64_t, Value>>;
  Index index_;
  std::deque<Index::iterator> order_;  // oldest first
};

}  // namespace qn::store
