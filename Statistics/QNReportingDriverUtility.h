#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/Value.h"
#include "platform/platform.h"

namespace qn {

// One driver's statistics group: a group name and a subgroup name, either of which may be
// absent ("any" when channels are looked up).
class QNReportingDriver {
 public:
  static std::shared_ptr<QNReportingDriver> driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);

  const std::optional<std::string>& groupName() const { return groupName_; }
  const std::optional<std::string>& subGroupName() const { return subGroupName_; }

  // "<group>-<subgroup>", an absent name printed as "(null)": "Speaker-(null)", "(null)-MCA".
  // Snapshots file a driver's samples under this text.
  std::string Description() const;

 private:
  std::optional<std::string> groupName_;
  std::optional<std::string> subGroupName_;
};

// One driver's live subscription to its channels.
class QNReportingIOChannelSubscription {
 public:
  explicit QNReportingIOChannelSubscription(std::shared_ptr<QNReportingDriver> driver)
      : driver_(std::move(driver)) {}

  const std::shared_ptr<OstrelSubscription>& subscription() const { return subscription_; }
  void setSubscription(std::shared_ptr<OstrelSubscription> s) { subscription_ = std::move(s); }
  const std::optional<Dictionary>& subscribedChannels() const { return subscribedChannels_; }
  void setSubscribedChannels(Dictionary c) { subscribedChannels_ = std::move(c); }
  const std::shared_ptr<QNReportingDriver>& driver() const { return driver_; }

 private:
  std::shared_ptr<OstrelSubscription> subscription_;
  std::optional<Dictionary> subscribedChannels_;
  std::shared_ptr<QNReportingDriver> driver_;
};

// Subscribes once, at construction, to the statistics channels of a fixed table of audio
// drivers, and samples them: a snapshot at session start, the counters that grew at stop.
// The subscription list never changes after construction, so both sampling operations may
// be called from any thread without a lock.
class QNReportingDriverUtility {
 public:
  // Builds the subscriptions for the four drivers of the table (logging what it finds).
  explicit QNReportingDriverUtility(std::shared_ptr<const Platform> platform);

  const std::vector<std::shared_ptr<QNReportingIOChannelSubscription>>& ioChannelSubscriptions()
      const {
    return ioChannelSubscriptions_;
  }

  // Every subscribed driver's current samples, filed under the driver's description.
  // Never absent: empty without subscriptions. A driver whose sampling fails is left out.
  Dictionary getSnapShot() const;

  // The counters that are 1 or more relative to `snapshot` (absolute values when there is
  // no snapshot, or for a driver whose difference cannot be made), flat, keyed
  // "<group>_<subgroup>_<channel>" (absent parts left out). nullopt when nothing is 1 or more.
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(const Dictionary* snapshot) const;

 private:
  void AddChannels(const Value& samples, const QNReportingDriver& driver,
                   Dictionary& accumulator) const;

  std::shared_ptr<const Platform> platform_;
  std::shared_ptr<const LogScope> scope_;  // "qnrd"
  std::vector<std::shared_ptr<QNReportingIOChannelSubscription>> ioChannelSubscriptions_;
};

}  // namespace qn
