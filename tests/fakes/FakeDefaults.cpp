#include "tests/fakes/FakeDefaults.h"

#include "platform/defaults_suite.h"

namespace qn::testing {

std::unique_ptr<DefaultsSuite> FakeDefaults::OpenSuite(const std::string& suite_name) {
  std::lock_guard lock(mu_);
  auto it = suites_.find(suite_name);
  return std::make_unique<SnapshotDefaultsSuite>(it == suites_.end() ? Dictionary() : it->second);
}

void FakeDefaults::Set(const std::string& suite, const std::string& key, Value value) {
  std::lock_guard lock(mu_);
  suites_[suite].Set(key, std::move(value));
}

void FakeDefaults::Remove(const std::string& suite, const std::string& key) {
  std::lock_guard lock(mu_);
  suites_[suite].Erase(key);
}

}  // namespace qn::testing
