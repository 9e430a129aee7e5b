#pragma once

#include <cerrno>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "common/Value.h"
#include "platform/ostrel.h"

namespace qn {

// The channel samples of the counter-tree Ostrel: a dictionary per channel,
// {"name": channel name (absent for an unnamed channel), "value": integer}. Every Ostrel
// implementation (the Linux one and the test fake) reads, walks and subtracts them with
// these functions. Thread-safe: they keep no state.

// A sample's integer value ("value", signed or unsigned), or nullopt.
inline std::optional<std::int64_t> OstrelSampleValue(const Value& sample) {
  const Dictionary* d = sample.as_dictionary();
  const Value* value = d ? d->Find("value") : nullptr;
  if (value == nullptr) return std::nullopt;
  if (auto i = value->as_int64()) return i;
  if (auto u = value->as_uint64()) return static_cast<std::int64_t>(*u);
  return std::nullopt;
}

// A sample's channel name, or nullopt when it has none.
inline std::optional<std::string> OstrelSampleName(const Value& sample) {
  const Dictionary* d = sample.as_dictionary();
  const Value* name = d ? d->Find("name") : nullptr;
  if (name == nullptr || name->as_string() == nullptr) return std::nullopt;
  return *name->as_string();
}

// Calls `fn` with each sample in key order while it returns 0 (Ostrel::Iterate).
inline void OstrelIterateSamples(const Dictionary& samples,
                                 const std::function<int(const Value& channel_sample)>& fn) {
  for (const auto& [key, sample] : samples) {
    if (fn(sample) != 0) return;
  }
}

// Later minus earlier per channel of `later` (wrapping on overflow), each entry otherwise
// a copy of the later sample (Ostrel::CreateSamplesDelta). Fails with ENODATA when `earlier`
// is null or lacks a channel of `later`, and with EINVAL when a sample has no integer value;
// *error (when given) is set unless it already holds an error.
inline std::optional<Dictionary> OstrelSamplesDelta(const Dictionary* earlier,
                                                    const Dictionary& later,
                                                    std::optional<OstrelError>* error) {
  auto fail = [&](std::int64_t code) -> std::optional<Dictionary> {
    if (error != nullptr && !*error) *error = OstrelError{code};
    return std::nullopt;
  };
  if (earlier == nullptr) return fail(ENODATA);
  Dictionary delta;
  for (const auto& [key, sample] : later) {
    const std::optional<std::int64_t> now = OstrelSampleValue(sample);
    if (!now) return fail(EINVAL);
    const Value* before = earlier->Find(key);
    if (before == nullptr) return fail(ENODATA);
    const std::optional<std::int64_t> then = OstrelSampleValue(*before);
    if (!then) return fail(EINVAL);
    Dictionary entry = *sample.as_dictionary();
    entry.Set("value", static_cast<std::int64_t>(static_cast<std::uint64_t>(*now) -
                                                 static_cast<std::uint64_t>(*then)));
    delta.Set(key, std::move(entry));
  }
  return delta;
}

}  // namespace qn
