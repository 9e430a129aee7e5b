#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/platform.h"
#include "tests/fakes/FakeAnalytics.h"
#include "tests/fakes/FakeDeviceInfo.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeEnerdex.h"
#include "tests/fakes/FakeLivoReporting.h"
#include "tests/fakes/FakeOrientation.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TraceRecorder.h"

namespace qn::testing::service {

// What the test Process throws from Exit, so that a test sees the exit status and the
// test binary goes on.
struct ExitCalled {
  int status;
};

// Process information the test sets; Exit throws ExitCalled.
class TestProcess final : public Process {
 public:
  pid_t Pid() const override { return own_pid; }
  std::string OwnName() const override { return own_name; }
  std::optional<std::string> NameOf(pid_t pid) const override {
    std::lock_guard lock(mu_);
    asked_.push_back(pid);
    auto it = names_.find(pid);
    if (it == names_.end()) return std::nullopt;
    return it->second;
  }
  [[noreturn]] void Exit(int status) override { throw ExitCalled{status}; }

  void SetName(pid_t pid, std::string name) {
    std::lock_guard lock(mu_);
    names_[pid] = std::move(name);
  }
  std::vector<pid_t> Asked() const {
    std::lock_guard lock(mu_);
    return asked_;
  }

  pid_t own_pid = 4242;
  std::string own_name = "qnreportingd";

 private:
  mutable std::mutex mu_;
  std::map<pid_t, std::string> names_;
  mutable std::vector<pid_t> asked_;
};

// Named notifications within the test: Post runs each handler registered for the name on
// its queue, with its token. Registration can be made to fail.
class TestNotify final : public Notify {
 public:
  std::uint32_t Register(const std::string& name, std::shared_ptr<SerialQueue> queue,
                         std::function<void(int)> handler, int* token) override {
    std::lock_guard lock(mu_);
    if (register_status != 0) return register_status;
    const int t = next_token_++;
    registrations_[t] = Registration{name, std::move(queue), std::move(handler)};
    *token = t;
    return 0;
  }
  std::uint32_t Post(const std::string& name) override {
    std::vector<std::pair<int, Registration>> targets;
    {
      std::lock_guard lock(mu_);
      for (auto& [t, r] : registrations_) {
        if (r.name == name) targets.emplace_back(t, r);
      }
    }
    for (auto& [t, r] : targets) {
      r.queue->Async([handler = r.handler, t = t] { handler(t); });
    }
    return 0;
  }
  void Cancel(int token) override {
    std::lock_guard lock(mu_);
    registrations_.erase(token);
  }
  // Runs `name`'s handlers with another token, as a stray delivery would.
  void DeliverWithToken(const std::string& name, int token) {
    std::lock_guard lock(mu_);
    for (auto& [t, r] : registrations_) {
      if (r.name == name) r.queue->Async([handler = r.handler, token] { handler(token); });
    }
  }
  int Registrations() const {
    std::lock_guard lock(mu_);
    return static_cast<int>(registrations_.size());
  }

  std::uint32_t register_status = 0;

 private:
  struct Registration {
    std::string name;
    std::shared_ptr<SerialQueue> queue;
    std::function<void(int)> handler;
  };
  mutable std::mutex mu_;
  std::map<int, Registration> registrations_;
  int next_token_ = 7;
};

// One defaults suite per name, held in memory, read with a settings store's rules.
class TestDefaults final : public Defaults {
 public:
  std::unique_ptr<DefaultsSuite> OpenSuite(const std::string& suite_name) override {
    std::lock_guard lock(mu_);
    opened_.push_back(suite_name);
    return std::make_unique<Suite>(suites_[suite_name]);
  }
  void Write(const std::string& suite, const std::string& key, Value value) {
    std::lock_guard lock(mu_);
    suites_[suite].Set(key, std::move(value));
  }
  void Delete(const std::string& suite, const std::string& key) {
    std::lock_guard lock(mu_);
    suites_[suite].Erase(Value(key));
  }
  std::vector<std::string> Opened() const {
    std::lock_guard lock(mu_);
    return opened_;
  }

 private:
  class Suite final : public DefaultsSuite {
   public:
    explicit Suite(Dictionary values) : values_(std::move(values)) {}
    std::optional<Value> ObjectForKey(const std::string& key) const override {
      const Value* v = values_.Find(key);
      return v ? std::optional<Value>(*v) : std::nullopt;
    }
    std::optional<std::string> StringForKey(const std::string& key) const override {
      const Value* v = values_.Find(key);
      if (!v) return std::nullopt;
      if (const std::string* s = v->as_string()) return *s;
      if (v->is_number()) return v->Description();
      return std::nullopt;
    }
    bool BoolForKey(const std::string& key) const override {
      const Value* v = values_.Find(key);
      if (!v) return false;
      if (const bool* b = v->as_bool()) return *b;
      if (auto d = v->as_double()) return *d != 0;
      if (const std::string* s = v->as_string()) {
        return *s == "YES" || *s == "yes" || *s == "true" || *s == "1";
      }
      return false;
    }

   private:
    Dictionary values_;
  };

  mutable std::mutex mu_;
  std::map<std::string, Dictionary> suites_;
  std::vector<std::string> opened_;
};

// A statistics library with one driver group, "Speaker" (no subgroup), whose channels are
// named counters that the test sets. A sample is {name: value}; a delta subtracts.
class TestOstrel final : public Ostrel {
 public:
  std::optional<Dictionary> CopyChannelsInGroup(const std::optional<std::string>& group,
                                                const std::optional<std::string>& subgroup,
                                                std::uint64_t,
                                                std::optional<OstrelError>*) override {
    std::lock_guard lock(mu_);
    if (!group || *group != "Speaker" || subgroup || counters_.empty()) return std::nullopt;
    Dictionary channels;
    for (auto& [name, value] : counters_) channels.Set(name, true);
    return channels;
  }
  std::int32_t GetChannelCount(const Dictionary& channels) const override {
    return static_cast<std::int32_t>(channels.size());
  }
  std::shared_ptr<OstrelSubscription> CreateSubscription(const Dictionary& channels,
                                                         Dictionary* subscribed) override {
    *subscribed = channels;
    return std::make_shared<OstrelSubscription>();
  }
  std::optional<Dictionary> CreateSamples(const OstrelSubscription*, const Dictionary& subscribed,
                                          std::optional<OstrelError>*) override {
    std::lock_guard lock(mu_);
    Dictionary samples;
    for (const auto& [name, unused] : subscribed) samples.Set(name, counters_[*name.as_string()]);
    return samples;
  }
  std::optional<Dictionary> CreateSamplesDelta(const Dictionary* earlier, const Dictionary& later,
                                               std::optional<OstrelError>* error) override {
    if (!earlier) {
      *error = OstrelError{1};
      return std::nullopt;
    }
    Dictionary delta;
    for (const auto& [name, value] : later) {
      const Value* before = earlier->Find(name);
      delta.Set(name, *value.as_int64() - (before ? *before->as_int64() : 0));
    }
    return delta;
  }
  void Iterate(const Dictionary& samples,
               const std::function<int(const Value&)>& fn) const override {
    for (const auto& [name, value] : samples) {
      if (fn(Value(Dictionary{{"name", name}, {"value", value}})) != 0) return;
    }
  }
  std::int64_t SimpleGetIntegerValue(const Value& sample, int) const override {
    return sample.as_dictionary()->Find("value")->as_int64().value_or(0);
  }
  std::optional<std::string> ChannelGetChannelName(const Value& sample) const override {
    return *sample.as_dictionary()->Find("name")->as_string();
  }

  void SetCounter(const std::string& name, std::int64_t value) {
    std::lock_guard lock(mu_);
    counters_[name] = value;
  }

 private:
  mutable std::mutex mu_;
  std::map<std::string, std::int64_t> counters_;
};

// A Platform of fakes for the service tests. Each test makes its own.
struct ServiceTestPlatform {
  std::shared_ptr<LogCapture> log = std::make_shared<LogCapture>();
  std::shared_ptr<TraceRecorder> trace = std::make_shared<TraceRecorder>();
  std::shared_ptr<FakeDispatcher> dispatcher = std::make_shared<FakeDispatcher>();
  std::shared_ptr<FakeDeviceInfo> device_info = std::make_shared<FakeDeviceInfo>();
  std::shared_ptr<FakeLivoReporting> livo = std::make_shared<FakeLivoReporting>(dispatcher);
  std::shared_ptr<FakeOrientation> orientation = std::make_shared<FakeOrientation>();
  std::shared_ptr<FakeAnalytics> analytics = std::make_shared<FakeAnalytics>();
  std::shared_ptr<FakeEnerdex> enerdex = std::make_shared<FakeEnerdex>();
  std::shared_ptr<TestProcess> process = std::make_shared<TestProcess>();
  std::shared_ptr<TestNotify> notify = std::make_shared<TestNotify>();
  std::shared_ptr<TestDefaults> defaults = std::make_shared<TestDefaults>();
  std::shared_ptr<TestOstrel> ostrel = std::make_shared<TestOstrel>();
  std::shared_ptr<Platform> platform = Make();

 private:
  std::shared_ptr<Platform> Make() {
    auto p = std::make_shared<Platform>();
    p->log = log;
    p->trace = trace;
    p->dispatcher = dispatcher;
    p->device_info = device_info;
    p->livo_reporting = livo;
    p->orientation = orientation;
    p->analytics = analytics;
    p->enerdex = enerdex;
    p->process = process;
    p->notify = notify;
    p->defaults = defaults;
    p->ostrel = ostrel;
    p->diagnostic_logs_dir = "/nonexistent/qn-service-tests";  // internal build is off
    return p;
  }
};

}  // namespace qn::testing::service
