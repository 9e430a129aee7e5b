#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "common/Value.h"

namespace qn::store {

// The message rows of the writer's current and previous transaction, looked up by
// content, so that an analytics event that repeats a message (its payload plus
// "HostApplicationDisplayID") can refer to the message's row instead of copying it. A match
// is exact: the event's JSON text is then the message's with json_set of that one key, byte
// for byte (same keys in the same order, same kinds of values; every key a string; a host
// of plain printable ASCII). Adding a message costs a vector slot; the index is built only
// when an event is looked up. Writer thread only.
class RecentMessages {
 public:
  // What an event refers to: the message row and the host name it adds.
  struct Repeat {
    std::int64_t message = 0;
    std::string host;
  };

  // Remembers message row `id` with `payload` (a dictionary; anything else is ignored).
  void Add(std::int64_t id, const Value& payload);

  // The row of a remembered message that `event_payload` repeats, or nullopt.
  std::optional<Repeat> Find(const Value& event_payload);

  // The transaction committed: its messages become the previous ones, the ones before
  // are forgotten.
  void Committed();
  // The transaction was rolled back: its ids are not rows.
  void RolledBack();

 private:
  struct Entry {
    std::int64_t id;
    Value payload;
    std::optional<std::uint64_t> key;  // computed when first indexed
    bool linkable = true;              // false: a key that is not a string
  };
  void Index();

  std::vector<Entry> entries_;  // the previous transaction's, then this one's
  std::size_t previous_ = 0;    // how many of entries_ are the previous transaction's
  std::size_t indexed_ = 0;     // entries_ in the index
  std::unordered_map<std::uint64_t, std::uint32_t> heads_;  // key -> newest entry
  std::vector<std::uint32_t> next_;                         // entry -> older one, or none
};

}  // namespace qn::store
