#include "platform/linux/store/repeats.h"

#include <cstring>
#include <functional>
#include <string_view>

namespace qn::store {
namespace {

constexpr std::size_t kRemembered = 8192;
constexpr std::string_view kHostKey = "HostApplicationDisplayID";

bool IsHostKey(const Value& key) {
  const std::string* s = key.as_string();
  return s && *s == kHostKey;
}

// Whether `a` and `b` are written as the same JSON text: the same kinds, dictionaries in
// the same order, doubles to the bit.
bool SameJson(const Value& a, const Value& b) {
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case Value::Kind::kDouble: {
      const double x = *a.as_double();
      const double y = *b.as_double();
      return std::memcmp(&x, &y, sizeof x) == 0;
    }
    case Value::Kind::kArray: {
      const Array& x = *a.as_array();
      const Array& y = *b.as_array();
      if (&x == &y) return true;
      if (x.size() != y.size()) return false;
      for (std::size_t i = 0; i < x.size(); ++i) {
        if (!SameJson(x[i], y[i])) return false;
      }
      return true;
    }
    case Value::Kind::kDictionary: {
      const Dictionary& x = *a.as_dictionary();
      const Dictionary& y = *b.as_dictionary();
      if (&x == &y) return true;
      if (x.size() != y.size()) return false;
      for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
        if (!i->first.is_string() || !SameJson(i->first, j->first) ||
            !SameJson(i->second, j->second)) {
          return false;
        }
      }
      return true;
    }
    default:
      return a == b;
  }
}

// The index key of a payload: its size without the host entry and its first other key.
// nullopt for payloads that are never linked (not a dictionary, a first key that is not a
// string).
std::optional<std::uint64_t> KeyOf(const Dictionary& payload) {
  std::size_t size = payload.size();
  std::string_view first;
  bool have_first = false;
  for (const auto& [key, value] : payload) {
    if (IsHostKey(key)) {
      --size;
      continue;
    }
    if (!have_first) {
      if (!key.is_string()) return std::nullopt;
      first = *key.as_string();
      have_first = true;
    }
  }
  return std::hash<std::string_view>{}(first) ^ (size * 0x9E3779B97F4A7C15ull);
}

// A host name that SQLite's json_set writes as the JSON writer does.
bool PlainHost(const std::string& host) {
  for (unsigned char c : host) {
    if (c < 0x20 || c > 0x7e || c == '"' || c == '\\') return false;
  }
  return true;
}

// Whether `event` is `message` with the host entry set: replaced in place when the message
// has one, else appended.
bool Repeats(const Dictionary& event, const Dictionary& message) {
  const bool has_host = message.Contains(kHostKey);
  if (event.size() != message.size() + (has_host ? 0 : 1)) return false;
  auto e = event.begin();
  for (auto m = message.begin(); m != message.end(); ++m, ++e) {
    if (!m->first.is_string() || !SameJson(m->first, e->first)) return false;
    if (!IsHostKey(m->first) && !SameJson(m->second, e->second)) return false;
  }
  return has_host || IsHostKey(e->first);
}

}  // namespace

void RecentMessages::Add(std::int64_t id, const Value& payload) {
  const Dictionary* dict = payload.as_dictionary();
  if (!dict) return;
  const auto key = KeyOf(*dict);
  if (!key) return;
  if (order_.size() >= kRemembered) {
    index_.erase(order_.front());
    order_.pop_front();
  }
  order_.push_back(index_.emplace(*key, std::pair{id, payload}));
}

std::optional<RecentMessages::Repeat> RecentMessages::Find(const Value& event_payload) const {
  const Dictionary* event = event_payload.as_dictionary();
  if (!event) return std::nullopt;
  const Value* host = event->Find(kHostKey);
  if (!host || !host->is_string() || !PlainHost(*host->as_string())) return std::nullopt;
  const auto key = KeyOf(*event);
  if (!key) return std::nullopt;
  auto [begin, end] = index_.equal_range(*key);
  for (auto it = begin; it != end; ++it) {
    if (Repeats(*event, *it->second.second.as_dictionary())) {
      return Repeat{it->second.first, *host->as_string()};
    }
  }
  return std::nullopt;
}

void RecentMessages::Forget(std::size_t mark) {
  while (order_.size() > mark) {
    index_.erase(order_.back());
    order_.pop_back();
  }
}

}  // namespace qn::store
