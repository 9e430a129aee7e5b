#include "Statistics/QNReportingUtility.h"

#include <algorithm>
#include <cctype>
#include <chrono>
#include <utility>

#include "platform/log.h"

namespace qn {

namespace {

const char* CategoryCodeName(std::uint16_t code) {
  switch (code) {
    case 1:
      return "Generic";
    case 2:
      return "Record";
    case 3:
      return "Playback";
    case 4:
      return "PlaybackAndRecord";
    case 5:
      return "Setup";
    case 6:
      return "ClientRequest";
    case 7:
      return "RouteChange";
    case 8:
      return "Error";
    case 9:
      return "Ostreling";
    case 10:
      return "Performance";
    case 11:
      return "Volume";
    default:
      return "Undefined";
  }
}

// The origin is one flag word; combined flags name no origin.
const char* CategoryOriginWord(std::uint16_t origin) {
  switch (origin) {
    case 0x8000:
      return "Toolbox";
    case 0x4000:
      return "Routing";
    case 0x2000:
      return "HAL";
    case 0x1000:
      return "DSP";
    case 0x0800:
      return "Session";
    default:
      return "";
  }
}

// A device answer read as a boolean, as a settings store reads one.
bool AnswerIsTrue(const Value& answer) {
  if (const bool* b = answer.as_bool()) return *b;
  if (answer.is_number()) return answer.as_double().value_or(0) != 0;
  if (const std::string* s = answer.as_string()) {
    std::string lower(*s);
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return lower == "yes" || lower == "true" || lower == "1";
  }
  return false;
}

constexpr const char* kWaitFunction = "QNReportingUtilityWait";

// One bounded wait in progress. Owned by the callback registered on the condition (and so,
// through the condition, by itself) until the wait completes.
struct WaitState {
  std::shared_ptr<Log> logger;
  std::shared_ptr<Dispatcher> dispatcher;
  std::shared_ptr<Condition> condition;
  std::shared_ptr<bool> done;
  std::string waiting_message;
  std::string timeout_message;
  std::shared_ptr<const LogScope> scope;
  Duration timeout;
  std::function<void(bool)> completion;
};

void OnWake(const std::shared_ptr<WaitState>& s, bool timed_out);

// REQUIRES: the condition's lock is held.
void WaitOnePeriod(const std::shared_ptr<WaitState>& s) {
  QN_LOG_AS(kWaitFunction, *s->logger, s->scope.get(), LogLevel::kDefault, "%s:%d:%s: %@",
            s->waiting_message);
  s->condition->WaitUntil(s->dispatcher->Now() + s->timeout,
                          [s](bool timed_out) { OnWake(s, timed_out); });
}

void Finish(const std::shared_ptr<WaitState>& s, bool result) {
  auto completion = std::move(s->completion);
  s->condition->unlock();
  if (completion) completion(result);
}

void OnWake(const std::shared_ptr<WaitState>& s, bool timed_out) {
  s->condition->lock();
  if (timed_out) {
    QN_LOG_AS(kWaitFunction, *s->logger, s->scope.get(), LogLevel::kError, "%s:%d:%s: %@",
              s->timeout_message);
    Finish(s, false);
    return;
  }
  QN_LOG_AS(kWaitFunction, *s->logger, s->scope.get(), LogLevel::kDefault, "%s:%d:%s: continuing");
  if (*s->done) {
    Finish(s, true);
    return;
  }
  WaitOnePeriod(s);
  s->condition->unlock();
}

}  // namespace

std::string QNReportingCategoryName(std::uint32_t category) {
  std::string name;
  const auto origin = static_cast<std::uint16_t>(category >> 16);
  if (origin != 0 && category != 0xFFFFFFFFu) {
    name += CategoryOriginWord(origin);
    name += '_';
  }
  name += CategoryCodeName(static_cast<std::uint16_t>(category & 0xFFFFu));
  return name;
}

std::string QNReportingTypeName(std::uint16_t type) {
  switch (type) {
    case 0:
      return "Generic";
    case 1:
      return "Start";
    case 2:
      return "Stop";
    case 3:
      return "Setup";
    case 4:
      return "Error";
    case 5:
      return "IssueDetector";
    case 0xFFFF:
      return "Unknown";
    default:
      return "Undefined";
  }
}

std::string QNReportingServiceTypeName(std::uint32_t serviceType) {
  static constexpr const char* kNames[] = {"generic",          "vessa",         "telephony",
                                           "haptics",          "alarms",        "standalone",
                                           "soundautoconfig",  "longformaudio", "nonlongformaudio",
                                           "audiodeviceusage", "alerts",        "test",
                                           "apiusage"};
  if (serviceType < std::size(kNames)) return kNames[serviceType];
  if (serviceType == 0xFFFF) return "unknown";
  // Unlisted values are named "telephony", not "unknown": existing consumers rely on it.
  return "telephony";
}

std::string QNReportingHostApplicationName(const Dictionary* userInfo) {
  if (userInfo) {
    if (const Value* name = userInfo->Find("HostApplicationDisplayID")) {
      return name->Description();
    }
  }
  return "Unknown";
}

bool QNReportingIsInternalBuild(const Platform& platform) {
  std::call_once(platform.internal_build_once, [&platform] {
    bool internal = false;
    if (platform.device_info) {
      if (auto answer = platform.device_info->CopyAnswer("InternalBuild")) {
        internal = AnswerIsTrue(*answer);
      }
    }
    platform.internal_build = internal;
  });
  return platform.internal_build;
}

void QNReportingUtilityWait(const Platform& platform, std::shared_ptr<Condition> condition,
                            std::shared_ptr<bool> done, std::string waitingMessage,
                            std::string timeoutMessage, std::shared_ptr<const LogScope> log,
                            double timeout, std::function<void(bool)> completion) {
  auto state = std::make_shared<WaitState>();
  state->logger = platform.log;
  state->dispatcher = platform.dispatcher;
  state->condition = std::move(condition);
  state->done = std::move(done);
  state->waiting_message = std::move(waitingMessage);
  state->timeout_message = std::move(timeoutMessage);
  state->scope = std::move(log);
  state->timeout = std::chrono::duration_cast<Duration>(std::chrono::duration<double>(timeout));
  state->completion = std::move(completion);

  state->condition->lock();
  if (*state->done) {
    Finish(state, true);
    return;
  }
  WaitOnePeriod(state);
  state->condition->unlock();
}

}  // namespace qn
