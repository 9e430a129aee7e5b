#include "Statistics/QNReportingDriverUtility.h"

#include "platform/log.h"

namespace qn {

namespace {

// An absent name prints as the formatter prints a missing object.
std::string NameOrNull(const std::optional<std::string>& name) {
  return name ? *name : std::string("(null)");
}

}  // namespace

std::shared_ptr<QNReportingDriver> QNReportingDriver::driverWithGroupName(
    std::optional<std::string> groupName, std::optional<std::string> subGroupName) {
  auto driver = std::make_shared<QNReportingDriver>();
  driver->groupName_ = std::move(groupName);
  driver->subGroupName_ = std::move(subGroupName);
  return driver;
}

std::string QNReportingDriver::Description() const {
  return StringWithFormat("%@-%@", NameOrNull(groupName_), NameOrNull(subGroupName_));
}

QNReportingDriverUtility::QNReportingDriverUtility(std::shared_ptr<const Platform> platform)
    : platform_(std::move(platform)) {
  Log& log = *platform_->log;
  scope_ = log.RegisterScope(true, 0x716E7264, "qnrd", "com.norvel.quenta",
                             "reporting_driver_verbose", 31);
  QN_LOG(log, scope_.get(), LogLevel::kInfo, "%s:%d:%s: creating ostreling driver utility");

  const std::vector<std::shared_ptr<QNReportingDriver>> drivers = {
      QNReportingDriver::driverWithGroupName("NorvelKT5MCA", std::nullopt),
      QNReportingDriver::driverWithGroupName("Speaker", std::nullopt),
      QNReportingDriver::driverWithGroupName(std::nullopt, "MCA"),
      QNReportingDriver::driverWithGroupName("Haptics", "Stats"),
  };

  Ostrel& ostrel = *platform_->ostrel;
  for (const auto& driver : drivers) {
    const std::string group = NameOrNull(driver->groupName());
    const std::string subgroup = NameOrNull(driver->subGroupName());
    std::optional<OstrelError> error;
    std::optional<Dictionary> channels =
        ostrel.CopyChannelsInGroup(driver->groupName(), driver->subGroupName(), 0, &error);
    if (error) {
      // Logged, but whatever channels came back with the error are still used.
      QN_LOG(log, scope_.get(), LogLevel::kError,
             "%s:%d:%s: error %li getting channels for driver %@-%@", error->code, group, subgroup);
    }
    if (!channels) continue;

    if (ostrel.GetChannelCount(*channels) < 1) {
      QN_LOG(log, scope_.get(), LogLevel::kInfo,
             "%s:%d:%s: couldn't find any channels for driver group %@-%@", group, subgroup);
    } else {
      auto subscription = std::make_shared<QNReportingIOChannelSubscription>(driver);
      Dictionary subscribed;
      subscription->setSubscription(ostrel.CreateSubscription(*channels, &subscribed));
      subscription->setSubscribedChannels(std::move(subscribed));
      ioChannelSubscriptions_.push_back(std::move(subscription));
    }
    QN_LOG(log, scope_.get(), LogLevel::kDefault, "%s:%d:%s: subscribed to group group %@-%@",
           group, subgroup);
  }
}

Dictionary QNReportingDriverUtility::getSnapShot() const {
  Log& log = *platform_->log;
  Ostrel& ostrel = *platform_->ostrel;
  Dictionary result;
  for (const auto& subscription : ioChannelSubscriptions_) {
    const std::string description = subscription->driver()->Description();
    std::optional<OstrelError> error;
    QN_LOG(log, scope_.get(), LogLevel::kInfo, "%s:%d:%s: sampling driver %@", description);
    std::optional<Dictionary> samples =
        ostrel.CreateSamples(subscription->subscription().get(),
                             subscription->subscribedChannels().value_or(Dictionary{}), &error);
    if (error) {
      QN_LOG(log, scope_.get(), LogLevel::kError, "%s:%d:%s: OstrelCreateSamples error %li",
             error->code);
      continue;
    }
    if (samples) result.Set(description, Value(std::move(*samples)));
  }
  return result;
}

std::optional<Dictionary> QNReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const Dictionary* snapshot) const {
  Log& log = *platform_->log;
  Ostrel& ostrel = *platform_->ostrel;
  Dictionary accumulator;
  for (const auto& subscription : ioChannelSubscriptions_) {
    std::optional<OstrelError> error;
    QN_LOG(log, scope_.get(), LogLevel::kInfo, "%s:%d:%s: getting latest samples");
    std::optional<Dictionary> samples =
        ostrel.CreateSamples(subscription->subscription().get(),
                             subscription->subscribedChannels().value_or(Dictionary{}), &error);
    QN_LOG(log, scope_.get(), LogLevel::kInfo, "%s:%d:%s: done getting latest samples");
    if (error) {
      QN_LOG(log, scope_.get(), LogLevel::kError, "%s:%d:%s: OstrelCreateSamples error %li",
             error->code);
      continue;
    }
    if (!samples) continue;

    std::optional<Dictionary> chosen;
    if (!snapshot) {
      chosen = *samples;  // no snapshot: the absolute counter values
    } else {
      const Value* earlier = snapshot->Find(subscription->driver()->Description());
      const Dictionary* earlier_samples = earlier ? earlier->as_dictionary() : nullptr;
      std::optional<OstrelError> delta_error;
      chosen = ostrel.CreateSamplesDelta(earlier_samples, *samples, &delta_error);
      if (delta_error) {
        // A driver that cannot be differenced is reported by its absolute values rather
        // than dropped.
        QN_LOG(log, scope_.get(), LogLevel::kError, "%s:%d:%s: OstrelCreateSamplesDelta error %li",
               delta_error->code);
        chosen = *samples;
      }
    }
    if (chosen) AddChannels(Value(std::move(*chosen)), *subscription->driver(), accumulator);
  }
  if (accumulator.empty()) return std::nullopt;
  return accumulator;
}

void QNReportingDriverUtility::AddChannels(const Value& samples, const QNReportingDriver& driver,
                                           Dictionary& accumulator) const {
  const Ostrel& ostrel = *platform_->ostrel;
  ostrel.Iterate(*samples.as_dictionary(), [&](const Value& channel) {
    const std::int64_t value = ostrel.SimpleGetIntegerValue(channel, 0);
    if (value < 1) return 0;  // unchanged or gone down: left out
    std::string key;
    if (driver.groupName()) key += *driver.groupName() + "_";
    if (driver.subGroupName()) key += *driver.subGroupName() + "_";
    if (auto name = ostrel.ChannelGetChannelName(channel)) key += *name;
    accumulator.Set(std::move(key), value);  // a key seen before is overwritten
    return 0;
  });
}

}  // namespace qn
