#include "platform/linux/store/repeats.h"

#include <cstring>
#include <functional>
#include <string_view>

namespace qn::store {
namespace {

constexpr std::uint32_t kNone = UINT32_MAX;
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

// The index key of a payload: every entry but the host entry, in order (containers by
// their size only, so that a key costs little however deep a payload is). nullopt for
// payloads that are never linked (a key that is not a string).
std::optional<std::uint64_t> KeyOf(const Dictionary& payload) {
  std::uint64_t key = 0xCBF29CE484222325ull;
  for (const auto& [name, value] : payload) {
    const std::string* text = name.as_string();
    if (!text) return std::nullopt;
    if (*text == kHostKey) continue;
    std::uint64_t entry = std::hash<std::string_view>{}(*text);
    if (const Array* array = value.as_array()) {
      entry ^= array->size() * 0x9E3779B97F4A7C15ull + 1;
    } else if (const Dictionary* dict = value.as_dictionary()) {
      entry ^= dict->size() * 0x9E3779B97F4A7C15ull + 2;
    } else if (const std::string* string = value.as_string()) {
      entry ^= std::hash<std::string_view>{}(*string) * 0x9E3779B97F4A7C15ull;
    } else {
      entry ^= value.Hash() * 0x9E3779B97F4A7C15ull;
    }
    key = (key ^ entry) * 0x100000001B3ull + (key >> 29);
  }
  return key;
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
  if (payload.is_dictionary()) entries_.push_back(Entry{id, payload, std::nullopt});
}

void RecentMessages::Index() {
  for (; indexed_ < entries_.size(); ++indexed_) {
    Entry& entry = entries_[indexed_];
    if (!entry.key && entry.linkable) {
      entry.key = KeyOf(*entry.payload.as_dictionary());
      entry.linkable = entry.key.has_value();
    }
    next_.push_back(kNone);
    if (!entry.linkable) continue;
    auto [head, fresh] = heads_.try_emplace(*entry.key, static_cast<std::uint32_t>(indexed_));
    if (!fresh) {
      next_.back() = head->second;
      head->second = static_cast<std::uint32_t>(indexed_);
    }
  }
}

std::optional<RecentMessages::Repeat> RecentMessages::Find(const Value& event_payload) {
  const Dictionary* event = event_payload.as_dictionary();
  if (!event || entries_.empty()) return std::nullopt;
  const Value* host = event->Find(kHostKey);
  if (!host || !host->is_string() || !PlainHost(*host->as_string())) return std::nullopt;
  const auto key = KeyOf(*event);
  if (!key) return std::nullopt;
  Index();
  const auto head = heads_.find(*key);
  if (head == heads_.end()) return std::nullopt;
  for (std::uint32_t i = head->second; i != kNone; i = next_[i]) {
    if (Repeats(*event, *entries_[i].payload.as_dictionary())) {
      return Repeat{entries_[i].id, *host->as_string()};
    }
  }
  return std::nullopt;
}

void RecentMessages::Committed() {
  entries_.erase(entries_.begin(), entries_.begin() + static_cast<std::ptrdiff_t>(previous_));
  previous_ = entries_.size();
  heads_.clear();
  next_.clear();
  indexed_ = 0;
}

void RecentMessages::RolledBack() {
  entries_.resize(previous_);
  heads_.clear();
  next_.clear();
  indexed_ = 0;
}

}  // namespace qn::store
