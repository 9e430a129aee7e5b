#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "platform/ostrel.h"

namespace qn::testing {

// In-memory I/O statistics with the Linux library's shapes and error codes: channels keyed
// "group/subgroup/channel" in path order, samples {"name", "value"} (no "name" for an
// unnamed channel), deltas later minus earlier, ENODATA when the earlier sample is absent
// or lacks a channel, ENOENT when a subscribed counter was removed, EBADF for a null
// subscription. An absent group or subgroup in a lookup matches any; a lookup that matches
// no group/subgroup pair returns nullopt. Switches make lookups and sampling fail with a
// given code. Thread-safe.
class FakeOstrel final : public Ostrel {
 public:
  std::optional<Dictionary> CopyChannelsInGroup(const std::optional<std::string>& group,
                                                const std::optional<std::string>& subgroup,
                                                std::uint64_t options,
                                                std::optional<OstrelError>* error) override;
  std::int32_t GetChannelCount(const Dictionary& channels) const override;
  std::shared_ptr<OstrelSubscription> CreateSubscription(const Dictionary& channels,
                                                         Dictionary* subscribed) override;
  std::optional<Dictionary> CreateSamples(const OstrelSubscription* subscription,
                                          const Dictionary& subscribed,
                                          std::optional<OstrelError>* error) override;
  std::optional<Dictionary> CreateSamplesDelta(const Dictionary* earlier, const Dictionary& later,
                                               std::optional<OstrelError>* error) override;
  void Iterate(const Dictionary& samples,
               const std::function<int(const Value& channel_sample)>& fn) const override;
  std::int64_t SimpleGetIntegerValue(const Value& channel_sample, int options) const override;
  std::optional<std::string> ChannelGetChannelName(const Value& channel_sample) const override;

  // A group/subgroup pair that exists (lookups find it), with or without channels.
  void AddGroup(const std::string& group, const std::string& subgroup);
  // Sets a counter (adding its group/subgroup pair). An unnamed channel's samples have no
  // name; `channel` still tells it apart.
  void SetCounter(const std::string& group, const std::string& subgroup, const std::string& channel,
                  std::int64_t value, bool named = true);
  void RemoveCounter(const std::string& group, const std::string& subgroup,
                     const std::string& channel);

  // Makes the lookup with exactly these arguments report `code`, returning the channels
  // anyway when `still_return_channels`, else nullopt.
  void FailLookup(const std::optional<std::string>& group,
                  const std::optional<std::string>& subgroup, std::int64_t code,
                  bool still_return_channels = false);
  // Makes sampling fail with `code` for subscriptions holding a channel of the
  // group/subgroup pair.
  void FailSamplingOf(const std::string& group, const std::string& subgroup, std::int64_t code);

 private:
  struct Counter {
    std::string group;
    std::string subgroup;
    std::string channel;
    bool named = true;
    std::int64_t value = 0;
  };
  using Pair = std::pair<std::string, std::string>;
  using LookupKey = std::pair<std::optional<std::string>, std::optional<std::string>>;

  mutable std::mutex mu_;
  std::set<Pair> groups_;
  std::map<std::string, Counter> counters_;  // by "group/subgroup/channel"
  std::map<LookupKey, std::pair<std::int64_t, bool>> lookup_failures_;
  std::map<Pair, std::int64_t> sampling_failures_of_;
};

}  // namespace qn::testing
