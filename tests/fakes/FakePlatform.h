#pragma once

#include <chrono>
#include <memory>

#include "platform/platform.h"
#include "tests/fakes/FakeAnalytics.h"
#include "tests/fakes/FakeDefaults.h"
#include "tests/fakes/FakeDeviceInfo.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeEnerdex.h"
#include "tests/fakes/FakeLivoReporting.h"
#include "tests/fakes/FakeNotify.h"
#include "tests/fakes/FakeOrientation.h"
#include "tests/fakes/FakeOstrel.h"
#include "tests/fakes/FakeProcess.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TraceRecorder.h"

namespace qn::testing {

// A Platform made of fakes, one per platform service, each reachable as its fake type. Each
// test makes its own (the once-computed internal-build flag is per Platform). Summary files
// go nowhere until a test points diagnostic_logs_dir at a folder of its own.
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
  std::shared_ptr<Platform> platform = Make();

  // Queued work holds its session, and the session holds this platform: run what is left
  // (waits for backends and alarm delays included) so that nothing stays referenced.
  ~FakePlatform() { dispatcher->AdvanceBy(std::chrono::minutes(2)); }

 private:
  std::shared_ptr<Platform> Make() const {
    auto p = std::make_shared<Platform>();
    p->log = log;
    p->trace = trace;
    p->dispatcher = dispatcher;
    p->notify = notify;
    p->defaults = defaults;
    p->process = process;
    p->device_info = device_info;
    p->livo_reporting = livo;
    p->orientation = orientation;
    p->ostrel = ostrel;
    p->enerdex = enerdex;
    p->analytics = analytics;
    p->diagnostic_logs_dir = "/nonexistent/qn-tests";
    return p;
  }
};

}  // namespace qn::testing
