#pragma once

#include <sys/types.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/defaults_suite.h"
#include "platform/orientation_text.h"
#include "platform/platform.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeLivoReporting.h"
#include "tests/fakes/FakeOstrel.h"
#include "tests/fakes/LogCapture.h"

// The small fakes of the platform services, and FakePlatform, which bundles one of each.
// Every fake is thread-safe.
namespace qn::testing {

// A thread-safe list of the events a recording fake has been handed.
template <typename Event>
class EventRecord {
 public:
  std::vector<Event> Events() const {
    std::lock_guard lock(mu_);
    return events_;
  }

 protected:
  void Record(Event event) {
    std::lock_guard lock(mu_);
    events_.push_back(std::move(event));
  }

 private:
  mutable std::mutex mu_;
  std::vector<Event> events_;
};

struct AnalyticsEvent {
  std::string name;
  Value payload;
};

// Records each event as sent; the payload provider runs at once, outside the lock (it may
// send events itself); an empty provider gives a null payload.
class FakeAnalytics final : public Analytics, public EventRecord<AnalyticsEvent> {
 public:
  using Event = AnalyticsEvent;
  void SendEventLazy(const std::string& name, PayloadProvider provider,
                     std::size_t /*held_bytes*/) override {
    Record({name, provider ? provider() : Value()});
  }
  std::vector<Event> EventsNamed(const std::string& name) const {
    auto events = Events();
    std::erase_if(events, [&](const Event& e) { return e.name != name; });
    return events;
  }
};

struct PowerLogEvent {
  std::int32_t subsystem = 0;
  std::string name;
  Value payload, options;
};

// Records every power-log event.
class FakeEnerdex final : public Enerdex, public EventRecord<PowerLogEvent> {
 public:
  using Event = PowerLogEvent;
  void LogRegisteredEvent(std::int32_t subsystem, const std::string& name, Value payload,
                          Value options) override {
    Record({subsystem, name, std::move(payload), std::move(options)});
  }
};

// In-memory suites; OpenSuite takes a snapshot and reads values as the Linux suites do (the
// defaults contract tests run against both).
class FakeDefaults final : public Defaults {
 public:
  std::unique_ptr<DefaultsSuite> OpenSuite(const std::string& name) override {
    std::lock_guard lock(mu_);
    return std::make_unique<SnapshotDefaultsSuite>(suites_[name]);
  }
  void Set(const std::string& suite, const std::string& key, Value value) {
    std::lock_guard lock(mu_);
    suites_[suite].Set(key, std::move(value));
  }
  void Remove(const std::string& suite, const std::string& key) {
    std::lock_guard lock(mu_);
    suites_[suite].Erase(key);
  }

 private:
  std::mutex mu_;
  std::map<std::string, Dictionary> suites_;
};

// Answers the test sets; counts the questions asked by either query.
class FakeDeviceInfo final : public DeviceInfo {
 public:
  std::optional<Value> CopyAnswer(const std::string& question) const override {
    std::lock_guard lock(mu_);
    asked_[question]++;
    auto it = answers_.find(question);
    return it == answers_.end() ? std::nullopt : std::optional<Value>(it->second);
  }
  std::int32_t GetSInt32Answer(const std::string& question) const override {
    auto answer = CopyAnswer(question);
    return answer ? static_cast<std::int32_t>(answer->as_int64().value_or(0)) : 0;
  }
  void SetAnswer(const std::string& question, Value answer) {
    std::lock_guard lock(mu_);
    answers_[question] = std::move(answer);
  }
  int Asked(const std::string& question) const {
    std::lock_guard lock(mu_);
    return asked_[question];
  }

 private:
  mutable std::mutex mu_;
  std::map<std::string, Value> answers_;
  mutable std::map<std::string, int> asked_;
};

// Post queues each live registration of the name on its queue with its token; Cancel stops
// later deliveries, queued ones included. Register returns the status set by
// FailRegistrations (0 by default).
class FakeNotify final : public Notify {
 public:
  std::uint32_t Register(const std::string& name, std::shared_ptr<SerialQueue> queue,
                         std::function<void(int token)> handler, int* token) override {
    std::lock_guard lock(mu_);
    if (fail_status_ != 0) return fail_status_;
    std::shared_ptr<Registration> r(
        new Registration{name, std::move(queue), std::move(handler), next_++});
    registrations_[r->token] = r;
    if (token) *token = r->token;
    return 0;
  }
  std::uint32_t Post(const std::string& name) override {
    std::lock_guard lock(mu_);
    for (const auto& [token, r] : registrations_) {
      if (r->name == name) r->queue->Async([r = r] { r->active ? r->handler(r->token) : void(); });
    }
    return 0;
  }
  void Cancel(int token) override {
    std::lock_guard lock(mu_);
    if (auto it = registrations_.find(token); it != registrations_.end()) {
      it->second->active = false;
      registrations_.erase(it);
    }
  }
  void FailRegistrations(std::uint32_t status) {
    std::lock_guard lock(mu_);
    fail_status_ = status;
  }

 private:
  struct Registration {
    std::string name;
    std::shared_ptr<SerialQueue> queue;
    std::function<void(int)> handler;
    int token;
    std::atomic<bool> active{true};
  };
  std::mutex mu_;
  std::map<int, std::shared_ptr<Registration>> registrations_;
  int next_ = 1;
  std::uint32_t fail_status_ = 0;
};

// Orientation notifications the test fires. Records every (un)registration in order
// ("register device <id>", "unregister ui <id>", ...). Callbacks run on the firing thread
// without the lock held, so one a concurrent Fire picked up may still run after its
// unregistration returns (as with a source that delivers on its own threads).
class FakeOrientation final : public Orientation {
 public:
  void RegisterDeviceOrientation(const std::string& id, Callback cb) override {
    Change("register", "device", id, std::move(cb));
  }
  void RegisterUIOrientation(const std::string& id, Callback cb) override {
    Change("register", "ui", id, std::move(cb));
  }
  void UnregisterDeviceOrientation(const std::string& id) override {
    Change("unregister", "device", id, nullptr);
  }
  void UnregisterUIOrientation(const std::string& id) override {
    Change("unregister", "ui", id, nullptr);
  }
  std::string OrientationToString(std::int32_t orientation) const override {
    return OrientationText(orientation);
  }
  // Calls every registered device (or UI) callback; returns how many.
  int FireDevice(std::int32_t orientation) { return Fire("device", orientation); }
  int FireUI(std::int32_t orientation) { return Fire("ui", orientation); }
  std::vector<std::string> Events() const {
    std::lock_guard lock(mu_);
    return events_;
  }

 private:
  void Change(const char* what, const char* kind, const std::string& id, Callback cb) {
    std::lock_guard lock(mu_);
    events_.push_back(std::string(what) + " " + kind + " " + id);
    cb ? void(callbacks_[kind][id] = std::move(cb)) : void(callbacks_[kind].erase(id));
  }
  int Fire(const std::string& kind, std::int32_t orientation) {
    std::vector<Callback> callbacks;
    {
      std::lock_guard lock(mu_);
      for (const auto& [id, cb] : callbacks_[kind]) callbacks.push_back(cb);
    }
    for (auto& cb : callbacks) cb(orientation);
    return static_cast<int>(callbacks.size());
  }
  mutable std::mutex mu_;
  std::map<std::string, std::map<std::string, Callback>> callbacks_;  // by "device" / "ui"
  std::vector<std::string> events_;
};

// What FakeProcess::Exit throws instead of ending the process; it propagates out of
// FakeDispatcher::RunUntilIdle / AdvanceBy when a task exits.
struct ProcessExited {
  int status;
};

// Process 4242 named "qnreportingd", with a process table the test fills.
class FakeProcess final : public Process {
 public:
  pid_t Pid() const override { return 4242; }
  std::string OwnName() const override { return "qnreportingd"; }
  std::optional<std::string> NameOf(pid_t pid) const override {
    if (pid == Pid()) return OwnName();
    std::lock_guard lock(mu_);
    auto it = names_.find(pid);
    return it == names_.end() ? std::nullopt : std::optional<std::string>(it->second);
  }
  [[noreturn]] void Exit(int status) override { throw ProcessExited{status}; }
  void SetName(pid_t pid, std::string name) {
    std::lock_guard lock(mu_);
    names_[pid] = std::move(name);
  }

 private:
  mutable std::mutex mu_;
  std::map<pid_t, std::string> names_;
};

// Records every trace point's code, and whether all their arguments were zero.
class TraceRecorder final : public Trace {
 public:
  void TracePoint(std::uint32_t code, std::uint64_t a1, std::uint64_t a2, std::uint64_t a3,
                  std::uint64_t a4) override {
    std::lock_guard lock(mu_);
    codes_.push_back(code);
    all_zero_ = all_zero_ && (a1 | a2 | a3 | a4) == 0;
  }
  std::vector<std::uint32_t> Codes() const {
    std::lock_guard lock(mu_);
    return codes_;
  }
  int Count(std::uint32_t code) const {
    auto codes = Codes();
    return static_cast<int>(std::count(codes.begin(), codes.end(), code));
  }
  bool AllArgumentsZero() const {
    std::lock_guard lock(mu_);
    return all_zero_;
  }

 private:
  mutable std::mutex mu_;
  std::vector<std::uint32_t> codes_;
  bool all_zero_ = true;
};

// A Platform made of fakes, each reachable as its fake type. Each test makes its own (the
// once-computed internal-build flag is per Platform). Summary files go nowhere until a test
// points diagnostic_logs_dir at a folder of its own.
struct FakePlatform {
  std::shared_ptr<LogCapture> log = std::make_shared<LogCapture>();
  std::shared_ptr<TraceRecorder> trace = std::make_shared<TraceRecorder>();
  std::shared_ptr<FakeDispatcher> dispatcher = std::make_shared<FakeDispatcher>();
  std::shared_ptr<FakeDeviceInfo> device_info = std::make_shared<FakeDeviceInfo>();
  std::shared_ptr<FakeLivoReporting> livo = std::make_shared<FakeLivoReporting>(dispatcher);
  std::shared_ptr<FakeOrientation> orientation = std::make_shared<FakeOrientation>();
  std::shared_ptr<FakeAnalytics> analytics = std::make_shared<FakeAnalytics>();
  std::shared_ptr<FakeEnerdex> enerdex = std::make_shared<FakeEnerdex>();
  std::shared_ptr<FakeProcess> process = std::make_shared<FakeProcess>();
  std::shared_ptr<FakeNotify> notify = std::make_shared<FakeNotify>();
  std::shared_ptr<FakeDefaults> defaults = std::make_shared<FakeDefaults>();
  std::shared_ptr<FakeOstrel> ostrel = std::make_shared<FakeOstrel>();
  std::shared_ptr<Platform> platform = [this] {
    auto p = std::make_shared<Platform>();
    p->log = log, p->trace = trace, p->dispatcher = dispatcher, p->notify = notify;
    p->defaults = defaults, p->process = process, p->device_info = device_info;
    p->livo_reporting = livo, p->orientation = orientation, p->ostrel = ostrel;
    p->enerdex = enerdex, p->analytics = analytics;
    p->diagnostic_logs_dir = "/nonexistent/qn-tests";
    return p;
  }();

  // Queued work holds its session, and the session holds this platform: run what is left
  // (waits for backends and alarm delays included) so that nothing stays referenced.
  ~FakePlatform() { dispatcher->AdvanceBy(std::chrono::minutes(2)); }
};

}  // namespace qn::testing
