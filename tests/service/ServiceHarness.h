#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Statistics/Service/QNReportingServerInstance.h"
#include "Statistics/Service/QNReportingServiceDelegate.h"
#include "Statistics/Service/QNReportingSession.h"
#include "tests/fakes/FakeIpc.h"
#include "tests/fakes/FakePlatform.h"

namespace qn::testing::service {

// Records every value a reply callback is called with.
template <typename T>
class Replies {
 public:
  std::function<void(T)> Callback() const {
    return [values = values_](T value) { values->push_back(std::move(value)); };
  }
  std::size_t size() const { return values_->size(); }
  bool empty() const { return values_->empty(); }
  const T& operator[](std::size_t i) const { return values_->at(i); }
  const std::vector<T>& all() const { return *values_; }

 private:
  std::shared_ptr<std::vector<T>> values_ = std::make_shared<std::vector<T>>();
};

using BoolReplies = Replies<bool>;
using ErrorReplies = Replies<std::optional<Error>>;

// One connected client: its fake connection and the server instance exported on it.
struct Client {
  std::shared_ptr<FakeIpcConnection> connection;
  std::shared_ptr<QNReportingServerInstance> instance;

  QNReportingServerInstance* operator->() const { return instance.get(); }
  std::shared_ptr<QNReportingSession> Session(std::int64_t id) const {
    return instance->clientReportingSessionMap().Find(id);
  }
};

// The service delegate on fakes, with a fake listener to connect clients through.
// Everything queued runs when the test calls Run().
class ServiceHarness {
 public:
  // `setup` runs before the delegate is made (driver counters, defaults, notify failures).
  explicit ServiceHarness(const std::function<void(FakePlatform&)>& setup = nullptr,
                          QNReportingServiceDelegate::Options options = {}) {
    if (setup) setup(env);
    delegate = QNReportingServiceDelegate::Create(env.platform, options);
    listener->SetDelegate(delegate);
  }

  // Accepts a connection from `pid` (named `name` in the process table, when given) and
  // runs the listing step.
  Client Connect(pid_t pid, std::optional<std::string> name = std::nullopt) {
    if (name) env.process->SetName(pid, *name);
    auto connection = std::make_shared<FakeIpcConnection>(pid);
    EXPECT_TRUE(listener->Accept(connection));
    Run();
    std::shared_ptr<QNReportingServerInstance> instance;
    for (const auto& client : delegate->clients()) {
      if (client->processIdentifier() == pid) instance = client;
    }
    EXPECT_NE(instance, nullptr) << "client " << pid << " was not listed";
    return Client{connection, instance};
  }

  void Run() { env.dispatcher->RunUntilIdle(); }

  // Writes a defaults value and posts the defaults notification (runs it).
  void PostDefaults() {
    env.notify->Post(kQNReportingDefaultsNotification);
    Run();
  }

  FakePlatform env;
  std::shared_ptr<FakeIpcListener> listener = std::make_shared<FakeIpcListener>();
  std::shared_ptr<QNReportingServiceDelegate> delegate;
};

}  // namespace qn::testing::service
