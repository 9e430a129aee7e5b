#pragma once

#include <cerrno>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "platform/ostrel.h"
#include "platform/ostrel_samples.h"

namespace qn::testing {

// In-memory I/O statistics with the Linux library's shapes and error codes: channels keyed
// "group/subgroup/channel", samples {"name", "value"} (no "name" for an unnamed channel),
// ENODATA for a delta without the earlier sample, ENOENT when a subscribed counter was
// removed, EBADF for a null subscription. An absent group or subgroup in a lookup matches
// any; a lookup that matches no pair returns nullopt. Lookups and sampling can be made to
// fail. Thread-safe.
class FakeOstrel final : public Ostrel {
 public:
  std::optional<Dictionary> CopyChannelsInGroup(const std::optional<std::string>& group,
                                                const std::optional<std::string>& subgroup,
                                                std::uint64_t,
                                                std::optional<OstrelError>* error) override {
    std::lock_guard lock(mu_);
    bool found = false;
    Dictionary channels;
    for (const auto& [g, s] : groups_) {
      if ((group && *group != g) || (subgroup && *subgroup != s)) continue;
      found = true;
      for (const auto& [path, c] : counters_) {
        if (c.group != g || c.subgroup != s) continue;
        Dictionary entry{{"group", g}, {"subgroup", s}, {"name", c.channel}};
        if (!c.named) entry.Set("unnamed", true);
        channels.Set(path, std::move(entry));
      }
    }
    if (auto it = lookup_failures_.find({group, subgroup}); it != lookup_failures_.end()) {
      if (error) *error = OstrelError{it->second.first};
      if (!it->second.second) return std::nullopt;
    }
    return found ? std::optional(channels) : std::nullopt;
  }
  std::int32_t GetChannelCount(const Dictionary& channels) const override {
    return static_cast<std::int32_t>(channels.size());
  }
  std::shared_ptr<OstrelSubscription> CreateSubscription(const Dictionary& channels,
                                                         Dictionary* subscribed) override {
    if (subscribed) *subscribed = channels;
    return std::make_shared<OstrelSubscription>();
  }
  std::optional<Dictionary> CreateSamples(const OstrelSubscription* subscription,
                                          const Dictionary& subscribed,
                                          std::optional<OstrelError>* error) override {
    std::lock_guard lock(mu_);
    auto fail = [&](std::int64_t code) {
      if (error) *error = OstrelError{code};
      return std::nullopt;
    };
    if (subscription == nullptr) return fail(EBADF);
    Dictionary samples;
    for (const auto& [key, entry] : subscribed) {
      auto field = [d = entry.as_dictionary()](const char* name) {
        const Value* v = d ? d->Find(name) : nullptr;
        return v && v->as_string() ? *v->as_string() : std::string();
      };
      const std::string g = field("group"), s = field("subgroup");
      if (auto it = sampling_failures_.find({g, s}); it != sampling_failures_.end()) {
        return fail(it->second);
      }
      auto c = counters_.find(g + "/" + s + "/" + field("name"));
      if (c == counters_.end()) return fail(ENOENT);
      Dictionary sample;
      if (c->second.named) sample.Set("name", c->second.channel);
      sample.Set("value", c->second.value);
      samples.Set(key, std::move(sample));
    }
    return samples;
  }
  std::optional<Dictionary> CreateSamplesDelta(const Dictionary* earlier, const Dictionary& later,
                                               std::optional<OstrelError>* error) override {
    return OstrelSamplesDelta(earlier, later, error);
  }
  void Iterate(const Dictionary& samples,
               const std::function<int(const Value&)>& fn) const override {
    OstrelIterateSamples(samples, fn);
  }
  std::int64_t SimpleGetIntegerValue(const Value& sample, int) const override {
    return OstrelSampleValue(sample).value_or(0);
  }
  std::optional<std::string> ChannelGetChannelName(const Value& sample) const override {
    return OstrelSampleName(sample);
  }

  // A group/subgroup pair that lookups find, with or without channels.
  void AddGroup(const std::string& group, const std::string& subgroup) {
    std::lock_guard lock(mu_);
    groups_.insert({group, subgroup});
  }
  // Sets a counter (adding its pair). An unnamed channel's samples have no name.
  void SetCounter(const std::string& group, const std::string& subgroup, const std::string& channel,
                  std::int64_t value, bool named = true) {
    std::lock_guard lock(mu_);
    groups_.insert({group, subgroup});
    counters_[group + "/" + subgroup + "/" + channel] = {group, subgroup, channel, named, value};
  }
  void RemoveCounter(const std::string& group, const std::string& subgroup,
                     const std::string& channel) {
    std::lock_guard lock(mu_);
    counters_.erase(group + "/" + subgroup + "/" + channel);
  }
  // The lookup with exactly these arguments reports `code`, returning the channels anyway
  // when `still_return_channels`.
  void FailLookup(std::optional<std::string> group, std::optional<std::string> subgroup,
                  std::int64_t code, bool still_return_channels = false) {
    std::lock_guard lock(mu_);
    lookup_failures_[{group, subgroup}] = {code, still_return_channels};
  }
  // Sampling a subscription that holds a channel of the pair fails with `code`.
  void FailSamplingOf(const std::string& group, const std::string& subgroup, std::int64_t code) {
    std::lock_guard lock(mu_);
    sampling_failures_[{group, subgroup}] = code;
  }

 private:
  struct Counter {
    std::string group, subgroup, channel;
    bool named = true;
    std::int64_t value = 0;
  };
  using OptionalPair = std::pair<std::optional<std::string>, std::optional<std::string>>;
  mutable std::mutex mu_;
  std::set<std::pair<std::string, std::string>> groups_;
  std::map<std::string, Counter> counters_;  // by "group/subgroup/channel"
  std::map<OptionalPair, std::pair<std::int64_t, bool>> lookup_failures_;
  std::map<std::pair<std::string, std::string>, std::int64_t> sampling_failures_;
};

}  // namespace qn::testing
