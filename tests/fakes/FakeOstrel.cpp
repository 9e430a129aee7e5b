#include "tests/fakes/FakeOstrel.h"

#include <algorithm>
#include <cerrno>
#include <limits>

#include "platform/ostrel_samples.h"

namespace qn::testing {
namespace {

class FakeOstrelSubscription final : public OstrelSubscription {};

std::string PathOf(const std::string& group, const std::string& subgroup,
                   const std::string& channel) {
  return group + "/" + subgroup + "/" + channel;
}

const std::string* StringField(const Value& entry, std::string_view key) {
  const Dictionary* d = entry.as_dictionary();
  if (d == nullptr) return nullptr;
  const Value* v = d->Find(key);
  return v ? v->as_string() : nullptr;
}

}  // namespace

std::optional<Dictionary> FakeOstrel::CopyChannelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup,
    std::uint64_t, std::optional<OstrelError>* error) {
  std::lock_guard lock(mu_);
  bool found = false;
  Dictionary channels;
  for (const auto& [g, s] : groups_) {
    if ((group && *group != g) || (subgroup && *subgroup != s)) continue;
    found = true;
    for (const auto& [path, counter] : counters_) {
      if (counter.group != g || counter.subgroup != s) continue;
      Dictionary entry{{"group", g}, {"subgroup", s}, {"name", counter.channel}};
      if (!counter.named) entry.Set("unnamed", true);
      channels.Set(path, std::move(entry));
    }
  }
  if (auto it = lookup_failures_.find({group, subgroup}); it != lookup_failures_.end()) {
    if (error) *error = OstrelError{it->second.first};
    if (!it->second.second) return std::nullopt;
  }
  if (!found) return std::nullopt;
  return channels;
}

std::int32_t FakeOstrel::GetChannelCount(const Dictionary& channels) const {
  return static_cast<std::int32_t>(
      std::min<std::size_t>(channels.size(), std::numeric_limits<std::int32_t>::max()));
}

std::shared_ptr<OstrelSubscription> FakeOstrel::CreateSubscription(const Dictionary& channels,
                                                                   Dictionary* subscribed) {
  std::lock_guard lock(mu_);
  if (subscribed) *subscribed = channels;
  return std::make_shared<FakeOstrelSubscription>();
}

std::optional<Dictionary> FakeOstrel::CreateSamples(const OstrelSubscription* subscription,
                                                    const Dictionary& subscribed,
                                                    std::optional<OstrelError>* error) {
  std::lock_guard lock(mu_);
  auto fail = [&](std::int64_t code) -> std::optional<Dictionary> {
    if (error) *error = OstrelError{code};
    return std::nullopt;
  };
  if (subscription == nullptr) return fail(EBADF);
  Dictionary samples;
  for (const auto& [key, entry] : subscribed) {
    const std::string* g = StringField(entry, "group");
    const std::string* s = StringField(entry, "subgroup");
    const std::string* c = StringField(entry, "name");
    if (!g || !s || !c) return fail(EINVAL);
    if (auto it = sampling_failures_of_.find({*g, *s}); it != sampling_failures_of_.end()) {
      return fail(it->second);
    }
    auto counter = counters_.find(PathOf(*g, *s, *c));
    if (counter == counters_.end()) return fail(ENOENT);
    Dictionary sample;
    if (counter->second.named) sample.Set("name", counter->second.channel);
    sample.Set("value", counter->second.value);
    samples.Set(key, std::move(sample));
  }
  return samples;
}

std::optional<Dictionary> FakeOstrel::CreateSamplesDelta(const Dictionary* earlier,
                                                         const Dictionary& later,
                                                         std::optional<OstrelError>* error) {
  return OstrelSamplesDelta(earlier, later, error);
}

void FakeOstrel::Iterate(const Dictionary& samples,
                         const std::function<int(const Value& channel_sample)>& fn) const {
  OstrelIterateSamples(samples, fn);
}

std::int64_t FakeOstrel::SimpleGetIntegerValue(const Value& channel_sample, int) const {
  return OstrelSampleValue(channel_sample).value_or(0);
}

std::optional<std::string> FakeOstrel::ChannelGetChannelName(const Value& channel_sample) const {
  return OstrelSampleName(channel_sample);
}

void FakeOstrel::AddGroup(const std::string& group, const std::string& subgroup) {
  std::lock_guard lock(mu_);
  groups_.insert({group, subgroup});
}

void FakeOstrel::SetCounter(const std::string& group, const std::string& subgroup,
                            const std::string& channel, std::int64_t value, bool named) {
  std::lock_guard lock(mu_);
  groups_.insert({group, subgroup});
  counters_[PathOf(group, subgroup, channel)] = Counter{group, subgroup, channel, named, value};
}

void FakeOstrel::RemoveCounter(const std::string& group, const std::string& subgroup,
                               const std::string& channel) {
  std::lock_guard lock(mu_);
  counters_.erase(PathOf(group, subgroup, channel));
}

void FakeOstrel::FailLookup(const std::optional<std::string>& group,
                            const std::optional<std::string>& subgroup, std::int64_t code,
                            bool still_return_channels) {
  std::lock_guard lock(mu_);
  lookup_failures_[{group, subgroup}] = {code, still_return_channels};
}

void FakeOstrel::FailSamplingOf(const std::string& group, const std::string& subgroup,
                                std::int64_t code) {
  std::lock_guard lock(mu_);
  sampling_failures_of_[{group, subgroup}] = code;
}

}  // namespace qn::testing
