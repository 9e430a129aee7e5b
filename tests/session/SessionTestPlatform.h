#pragma once

#include <chrono>
#include <memory>

#include "platform/platform.h"
#include "tests/fakes/FakeDeviceInfo.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/fakes/FakeLivoReporting.h"
#include "tests/fakes/FakeOrientation.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TraceRecorder.h"

namespace qn::testing {

// A Platform made of fakes for the session tests; each test builds its own, so the
// once-computed internal-build flag starts afresh.
struct SessionTestPlatform {
  std::shared_ptr<LogCapture> log = std::make_shared<LogCapture>();
  std::shared_ptr<TraceRecorder> trace = std::make_shared<TraceRecorder>();
  std::shared_ptr<FakeDispatcher> dispatcher = std::make_shared<FakeDispatcher>();
  std::shared_ptr<FakeDeviceInfo> device_info = std::make_shared<FakeDeviceInfo>();
  std::shared_ptr<FakeLivoReporting> livo = std::make_shared<FakeLivoReporting>(dispatcher);
  std::shared_ptr<FakeOrientation> orientation = std::make_shared<FakeOrientation>();
  std::shared_ptr<Platform> platform = Make();

  // Queued work holds its session, and the session holds this platform: run what is left
  // (waits for backends and alarm delays included) so that nothing stays referenced.
  ~SessionTestPlatform() { dispatcher->AdvanceBy(std::chrono::minutes(2)); }

 private:
  std::shared_ptr<Platform> Make() {
    auto p = std::make_shared<Platform>();
    p->log = log;
    p->trace = trace;
    p->dispatcher = dispatcher;
    p->device_info = device_info;
    p->livo_reporting = livo;
    p->orientation = orientation;
    return p;
  }
};

}  // namespace qn::testing
