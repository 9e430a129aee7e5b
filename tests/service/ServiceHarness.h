#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/Service/QNReportingServerInstance.h"
#include "Statistics/Service/QNReportingServiceDelegate.h"
#include "Statistics/Service/QNReportingSession.h"
#include "tests/fakes/FakeIpc.h"
#include "tests/fakes/FakePlatform.h"

// The harness of the session and service tests: sessions, the service delegate and its
// clients on a platform of fakes. Everything queued runs when the test runs the dispatcher.
namespace qn::testing {

inline std::shared_ptr<const Dictionary> Payload(Dictionary d) {
  return std::make_shared<const Dictionary>(std::move(d));
}

// Records every value a reply callback is called with.
template <typename T>
struct Replies {
  std::shared_ptr<std::vector<T>> values = std::make_shared<std::vector<T>>();
  std::function<void(T)> Callback() const {
    return [v = values](T value) { v->push_back(std::move(value)); };
  }
  std::size_t size() const { return values->size(); }
  bool empty() const { return values->empty(); }
  const T& operator[](std::size_t i) const { return values->at(i); }
  const std::vector<T>& all() const { return *values; }
};
using BoolReplies = Replies<bool>;

// The session tests' fixture: sessions made on a platform of fakes of their own.
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
  void SetInternal(bool internal) {
    t_.device_info->SetAnswer("InternalBuild", internal);
    t_.device_info->SetAnswer("DeviceClassNumber", 1);
  }

  FakePlatform t_;
};

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
  Client Connect(pid_t pid, std::optional<std::string> name = std::nullopt, uid_t uid = 1000) {
    if (name) env.process->SetName(pid, *name);
    auto connection = std::make_shared<FakeIpcConnection>(pid, uid);
    EXPECT_TRUE(listener->Accept(connection));
    Run();
    std::shared_ptr<QNReportingServerInstance> instance;
    for (const auto& client : delegate->clients()) {
      if (client->processIdentifier() == pid) instance = client;
    }
    EXPECT_NE(instance, nullptr) << "client " << pid << " was not listed";
    return Client{connection, instance};
  }

  // Creates `id` for `c` (of `serviceType` when given), and starts it when asked; returns
  // the start reply's record (it is held until the stop).
  BoolReplies Create(const Client& c, std::int64_t id,
                     std::optional<std::uint16_t> serviceType = std::nullopt, bool start = false) {
    BoolReplies r, started;
    c->createReportingSession(id, r.Callback());
    if (serviceType) c->setServiceType(*serviceType, id, r.Callback());
    if (start) c->startReportingSessionForID(id, started.Callback());
    Run();
    return started;
  }
  // Sends `message` from `c` and returns its one reply.
  std::optional<Error> Send(const Client& c, Dictionary message, std::uint32_t category,
                            std::uint16_t type, std::optional<std::vector<std::int64_t>> ids) {
    Replies<std::optional<Error>> r;
    c->sendMessage(Payload(std::move(message)), category, type, std::move(ids), r.Callback());
    Run();
    EXPECT_EQ(r.size(), 1u);
    return r.empty() ? std::nullopt : r[0];
  }

  void Run() { env.dispatcher->RunUntilIdle(); }

  // Posts the defaults notification and runs its handler.
  void PostDefaults() {
    env.notify->Post(kQNReportingDefaultsNotification);
    Run();
  }

  FakePlatform env;
  std::shared_ptr<FakeIpcListener> listener = std::make_shared<FakeIpcListener>();
  std::shared_ptr<QNReportingServiceDelegate> delegate;
};

}  // namespace qn::testing
