#include "tests/fakes/FakeDeviceInfo.h"

namespace qn::testing {

std::optional<Value> FakeDeviceInfo::CopyAnswer(const std::string& question) const {
  std::lock_guard lock(mu_);
  asked_[question]++;
  auto it = answers_.find(question);
  if (it == answers_.end()) return std::nullopt;
  return it->second;
}

std::int32_t FakeDeviceInfo::GetSInt32Answer(const std::string& question) const {
  std::lock_guard lock(mu_);
  asked_[question]++;
  auto it = answers_.find(question);
  if (it == answers_.end()) return 0;
  return static_cast<std::int32_t>(it->second.as_int64().value_or(0));
}

void FakeDeviceInfo::SetAnswer(const std::string& question, Value answer) {
  std::lock_guard lock(mu_);
  answers_[question] = std::move(answer);
}

int FakeDeviceInfo::Asked(const std::string& question) const {
  std::lock_guard lock(mu_);
  auto it = asked_.find(question);
  return it == asked_.end() ? 0 : it->second;
}

}  // namespace qn::testing
