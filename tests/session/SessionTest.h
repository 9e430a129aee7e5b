#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <optional>

#include "Statistics/Service/QNReportingSession.h"
#include "tests/fakes/FakePlatform.h"

namespace qn::testing {

inline std::shared_ptr<const Dictionary> Payload(Dictionary d) {
  return std::make_shared<const Dictionary>(std::move(d));
}

// The session tests' fixture: a platform of fakes of its own, and sessions made on it.
class SessionFixture : public ::testing::Test {
 protected:
  // A session of reporter `id` owned by process 1234, of `serviceType` when given.
  std::shared_ptr<QNReportingSession> NewSession(
      std::int64_t id = 42, std::optional<std::uint16_t> serviceType = std::nullopt) {
    auto session = QNReportingSession::initWithID(t_.platform, id, Array{Value(1234)});
    if (serviceType) session->setServiceType(*serviceType);
    return session;
  }
  // A session of reporter 42 whose start sequence has run.
  std::shared_ptr<QNReportingSession> StartedSession(std::uint16_t serviceType = 2) {
    auto session = NewSession(42, serviceType);
    session->start();
    t_.dispatcher->RunUntilIdle();
    return session;
  }
  void SetInternal(bool internal, int deviceClass = 1) {
    t_.device_info->SetAnswer("InternalBuild", internal);
    t_.device_info->SetAnswer("DeviceClassNumber", deviceClass);
  }

  FakePlatform t_;
};

}  // namespace qn::testing
