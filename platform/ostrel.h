#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "common/Value.h"

namespace qn {

// The error an Ostrel operation reports: an integer code.
struct OstrelError {
  std::int64_t code = 0;
};

// An opaque Ostrel subscription handle.
class OstrelSubscription {
 public:
  virtual ~OstrelSubscription() = default;
};

// The I/O statistics library: counters grouped by group and subgroup name. Channel
// descriptions and samples are dictionaries that only the library reads; callers copy and
// store them whole. Safe to call from any thread.
class Ostrel {
 public:
  virtual ~Ostrel() = default;

  // The channels of a group/subgroup (OstrelCopyChannelsInGroup); an absent name matches
  // any. Returns nullopt when there is nothing to describe; on failure sets *error (and
  // may still return channels).
  virtual std::optional<Dictionary> CopyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>& subgroup,
                                                        std::uint64_t options,
                                                        std::optional<OstrelError>* error) = 0;

  // The number of channels in a channel description (OstrelGetChannelCount).
  virtual std::int32_t GetChannelCount(const Dictionary& channels) const = 0;

  // Subscribes to the channels (OstrelCreateSubscription); fills *subscribed_channels
  // with the description of the channels actually subscribed. May return null.
  virtual std::shared_ptr<OstrelSubscription> CreateSubscription(
      const Dictionary& channels, Dictionary* subscribed_channels) = 0;

  // Samples every subscribed channel now (OstrelCreateSamples), or nullopt with *error set.
  virtual std::optional<Dictionary> CreateSamples(const OstrelSubscription* subscription,
                                                  const Dictionary& subscribed_channels,
                                                  std::optional<OstrelError>* error) = 0;

  // Later minus earlier, per channel (OstrelCreateSamplesDelta). `earlier` may be null;
  // then (and when a channel of `later` has no earlier sample) it fails with *error set.
  virtual std::optional<Dictionary> CreateSamplesDelta(const Dictionary* earlier,
                                                       const Dictionary& later,
                                                       std::optional<OstrelError>* error) = 0;

  // Calls `fn` with each channel sample of `samples`, in the library's order, while it
  // returns 0 (OstrelIterate).
  virtual void Iterate(const Dictionary& samples,
                       const std::function<int(const Value& channel_sample)>& fn) const = 0;

  // A channel sample's integer value (OstrelSimpleGetIntegerValue) and its channel's
  // name, when it has one (OstrelChannelGetChannelName).
  virtual std::int64_t SimpleGetIntegerValue(const Value& channel_sample, int options) const = 0;
  virtual std::optional<std::string> ChannelGetChannelName(const Value& channel_sample) const = 0;
};

}  // namespace qn
