#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "common/Value.h"
#include "platform/defaults.h"

namespace qn::testing {

// In-memory user-defaults suites. OpenSuite takes a snapshot, as the Linux suites do, and
// reads values the same way (the defaults contract tests run against both). Thread-safe.
class FakeDefaults final : public Defaults {
 public:
  std::unique_ptr<DefaultsSuite> OpenSuite(const std::string& suite_name) override;

  void Set(const std::string& suite, const std::string& key, Value value);
  void Remove(const std::string& suite, const std::string& key);

 private:
  mutable std::mutex mu_;
  std::map<std::string, Dictionary> suites_;
};

}  // namespace qn::testing
